"""The status page in headless Chromium through Selenium: it renders without JavaScript
errors, the counters table fills in, and screenshots at desktop and phone width are
written to OUTPUT_DIR. Exits 77 (skipped) when no browser can be started.
$PELMORAD_CHROMIUM and $PELMORAD_CHROMEDRIVER name other binaries.

usage: browser_test.py PELMORAD_BINARY OUTPUT_DIR
"""

import os
import sys

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from daemon import Daemon  # noqa: E402

SKIP = 77


def skip(reason):
    print("SKIP: " + reason)
    sys.exit(SKIP)


def start_browser():
    try:
        from selenium import webdriver
        from selenium.webdriver.chrome.service import Service
    except ImportError as e:
        skip("selenium is not installed (python3-selenium): %s" % e)
    chromium = os.environ.get("PELMORAD_CHROMIUM", "/usr/bin/chromium")
    driver = os.environ.get("PELMORAD_CHROMEDRIVER", "/usr/bin/chromedriver")
    for path in (chromium, driver):
        if not os.path.exists(path):
            skip("%s is missing (chromium, chromium-driver)" % path)
    options = webdriver.ChromeOptions()
    options.binary_location = chromium
    for arg in ("--headless=new", "--no-sandbox", "--disable-gpu", "--disable-dev-shm-usage",
                "--window-size=1280,1000"):
        options.add_argument(arg)
    options.set_capability("goog:loggingPrefs", {"browser": "ALL"})
    try:
        return webdriver.Chrome(service=Service(driver), options=options)
    except Exception as e:  # no display libraries, a driver of another version ...
        skip("the browser did not start: %s" % str(e).splitlines()[0])


def main():
    if len(sys.argv) != 3:
        sys.exit(__doc__)
    binary, out_dir = os.path.abspath(sys.argv[1]), os.path.abspath(sys.argv[2])
    os.makedirs(out_dir, exist_ok=True)
    from selenium.webdriver.common.by import By
    from selenium.webdriver.support.ui import WebDriverWait

    browser = start_browser()
    daemon = Daemon(binary)
    failures = []
    try:
        browser.get(daemon.url)
        wait = WebDriverWait(browser, 15)
        wait.until(lambda b: len(b.find_elements(By.CSS_SELECTOR, "#counters tbody tr")) > 0)
        wait.until(lambda b: b.find_element(By.ID, "state").text == "running")
        rows = browser.find_elements(By.CSS_SELECTOR, "#counters tbody tr")
        names = [r.find_elements(By.TAG_NAME, "td")[0].text for r in rows]
        if "/Pelmorad/Endpoint='status'/Requests" not in names:
            failures.append("the counters table lacks the daemon's own counters: %r" % names[:10])
        if not browser.find_element(By.ID, "version").text.strip("–"):
            failures.append("the version is not shown")
        if not browser.find_elements(By.CSS_SELECTOR, "#threads tbody tr"):
            failures.append("the thread-state table is empty")
        if not browser.find_element(By.ID, "log").text:
            failures.append("the log tail is empty")
        # The filter narrows the table on the page itself.
        browser.find_element(By.ID, "filter").send_keys("UptimeSeconds")
        shown = browser.find_elements(By.CSS_SELECTOR, "#counters tbody tr")
        if len(shown) != 1:
            failures.append("filtering for UptimeSeconds left %d rows" % len(shown))
        browser.find_element(By.ID, "filter").clear()
        browser.execute_script("document.getElementById('filter').dispatchEvent(new Event('input'))")

        if not browser.find_elements(By.CSS_SELECTOR, "#queues tbody tr"):
            failures.append("the work-queue table is empty")
        browser.set_window_size(1280, 1400)
        browser.execute_script("window.scrollTo(0, 0)")
        desktop = os.path.join(out_dir, "pelmorad-status.png")
        browser.save_screenshot(desktop)
        print("screenshot: " + desktop)
        # A phone: the page must fit 390 px without sideways scrolling.
        browser.set_window_size(390, 844)
        browser.refresh()
        wait.until(lambda b: len(b.find_elements(By.CSS_SELECTOR, "#counters tbody tr")) > 0)
        overflow = browser.execute_script(
            "return document.documentElement.scrollWidth - window.innerWidth")
        if overflow > 0:
            failures.append("at 390 px the page is %d px too wide" % overflow)
        browser.execute_script("window.scrollTo(0, 0)")
        phone = os.path.join(out_dir, "pelmorad-status-phone.png")
        browser.save_screenshot(phone)
        print("screenshot: " + phone)

        severe = [e for e in browser.get_log("browser") if e.get("level") == "SEVERE"]
        for entry in severe:
            failures.append("browser console: " + entry.get("message", ""))
    finally:
        browser.quit()
        daemon.stop()
        daemon.close()
    for failure in failures:
        print("FAIL: " + failure)
    print("%d passed, %d failed" % (0 if failures else 1, 1 if failures else 0))
    sys.exit(1 if failures else 0)


if __name__ == "__main__":
    main()
