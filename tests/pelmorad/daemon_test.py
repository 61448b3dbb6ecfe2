"""pelmorad run as a user would: every endpoint over curl and Python, /metrics through
promtool, graceful stop during a slow request, log reopen on SIGHUP, and the command
line's errors.

usage: daemon_test.py PELMORAD_BINARY
"""

import gzip
import json
import os
import signal
import subprocess
import sys
import threading
import time
import unittest
import xml.etree.ElementTree as ET

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from daemon import Daemon, wait_until  # noqa: E402

BINARY = None


def run(args, timeout=20):
    return subprocess.run([BINARY] + args, capture_output=True, text=True, timeout=timeout)


class EndpointTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.d = Daemon(BINARY)

    @classmethod
    def tearDownClass(cls):
        try:
            assert cls.d.stop() == 0
        finally:
            cls.d.close()

    def test_page_and_its_files_are_served_with_their_types(self):
        for path, kind, needle in (("/", "text/html", b"<title>pelmorad"),
                                   ("/index.html", "text/html", b"/app.js"),
                                   ("/style.css", "text/css", b"@media"),
                                   ("/app.js", "javascript", b"/api/status")):
            status, headers, body = self.d.get(path)
            self.assertEqual(status, 200, path)
            self.assertIn(kind, headers["Content-Type"], path)
            self.assertIn(needle, body, path)

    def test_status_reports_process_pool_threads_counters_and_log(self):
        status, headers, body = self.d.get("/api/status")
        self.assertEqual(status, 200)
        self.assertIn("application/json", headers["Content-Type"])
        self.assertEqual(headers["Cache-Control"], "no-store")
        s = json.loads(body)
        self.assertEqual(s["name"], "pelmorad")
        self.assertEqual(s["version"], run(["--version"]).stdout.split()[1])
        self.assertEqual(s["state"], "running")
        self.assertEqual(s["pid"], self.d.proc.pid)
        self.assertEqual(s["url"], self.d.url)
        self.assertEqual(s["stateDir"], self.d.state)
        self.assertGreater(s["connections"], 0)
        self.assertGreaterEqual(s["uptimeSeconds"], 0)
        self.assertLessEqual(s["pool"]["minThreads"], s["pool"]["maxThreads"])
        self.assertEqual(s["pool"]["maxThreads"], 64)  # from the compiled-in defaults
        # The request being answered is on its thread's board.
        states = [t for thread in s["threads"] for t in thread["states"]]
        self.assertIn("serving /api/status", states)
        names = {c["name"]: c for c in s["counters"]}
        self.assertGreaterEqual(names["/Pelmorad/Endpoint='status'/Requests"]["value"], 1)
        self.assertEqual(names["/Pelmorad/UptimeSeconds"]["type"], "gauge")
        self.assertTrue(s["log"])
        self.assertLessEqual(len(s["log"]), 40)
        everything = json.loads(self.d.get("/api/log?lines=10000")[2])
        self.assertTrue(any("Serving " + self.d.url in line for line in everything), everything)

    def test_counters_filter_by_expression_and_refuse_a_broken_one(self):
        self.d.get("/healthz")
        status, _, body = self.d.get("/api/counters?match=endpoint='HEALTHZ'")
        self.assertEqual(status, 200)
        counters = json.loads(body)
        self.assertEqual([c["name"] for c in counters], ["/Pelmorad/Endpoint='healthz'/Requests"])
        self.assertGreaterEqual(counters[0]["value"], 1)
        # The refusal quotes the pattern, quote and backslash escaped.
        status, _, body = self.d.get("/api/counters?match=%22(%5C")
        self.assertEqual(status, 400)
        self.assertIn('"(\\', json.loads(body)["error"])

    def test_log_tail_gives_the_newest_lines_in_order(self):
        status, _, body = self.d.get("/api/log?lines=3")
        self.assertEqual(status, 200)
        lines = json.loads(body)
        self.assertEqual(len(lines), 3)
        status, _, body = self.d.get("/api/log?lines=1000")
        everything = json.loads(body)
        self.assertGreater(len(everything), 3)
        # The short tail is where the long one ends (a line or two may have come since).
        start = everything.index(lines[0])
        self.assertEqual(everything[start:start + 3], lines)

    def test_threads_health_and_unknown_paths(self):
        status, _, body = self.d.get("/api/threads")
        self.assertEqual(status, 200)
        t = json.loads(body)
        self.assertIn("minThreads", t["pool"])
        self.assertTrue(any("serving /api/threads" in s for th in t["threads"] for s in th["states"]))
        status, _, body = self.d.get("/healthz")
        self.assertEqual((status, body), (200, b"ok\n"))
        status, _, _ = self.d.get("/no/such/page")
        self.assertEqual(status, 404)

    def test_every_endpoint_answers_curl(self):
        for path in ("/", "/style.css", "/app.js", "/api/status", "/api/counters", "/api/log",
                     "/api/threads", "/metrics", "/healthz", "/api/sleep?ms=1"):
            r = subprocess.run(["curl", "-sS", "-f", "-o", "/dev/null", "-w", "%{http_code}",
                                self.d.url.rstrip("/") + path],
                               capture_output=True, text=True, timeout=20)
            self.assertEqual((r.returncode, r.stdout), (0, "200"), path + " " + r.stderr)

    def test_metrics_pass_promtool_and_carry_labels(self):
        status, headers, body = self.d.get("/metrics")
        self.assertEqual(status, 200)
        self.assertIn("text/plain; version=0.0.4", headers["Content-Type"])
        r = subprocess.run(["/usr/bin/promtool", "check", "metrics"], input=body,
                           capture_output=True, timeout=30)
        # promtool exits 1 for a text it cannot parse and 3 for naming advice only (the
        # counter names are the library's, camel case and without "_total").
        self.assertIn(r.returncode, (0, 3), r.stderr)
        self.assertNotIn(b"error", r.stderr)
        for line in r.stderr.decode().splitlines():
            self.assertRegex(line, r"should have \"_total\" suffix|should be written in 'snake_case'")
        text = body.decode()
        self.assertIn('Pelmorad_Requests{Endpoint="metrics"}', text)
        self.assertIn("# TYPE Pelmorad_UptimeSeconds gauge", text)


class ShutdownTest(unittest.TestCase):
    def test_sigterm_lets_a_slow_request_finish_and_healthz_turns_503(self):
        d = Daemon(BINARY, drain_ms=400, deadline_ms=5000)
        try:
            result = {}

            def slow():
                result["answer"] = d.get("/api/sleep?ms=1200", timeout=15)

            client = threading.Thread(target=slow)
            client.start()
            self.assertTrue(wait_until(lambda: "serving /api/sleep" in d.get("/api/threads")[2].decode()))
            started = time.monotonic()
            d.signal(signal.SIGTERM)
            # While draining, new requests are still answered, the health check with 503.
            self.assertTrue(wait_until(lambda: d.get("/healthz")[0] == 503, timeout=5))
            status, _, body = d.get("/api/status")
            self.assertEqual(json.loads(body)["state"], "stopping")
            client.join(15)
            self.assertEqual(result["answer"][0], 200)
            self.assertEqual(json.loads(result["answer"][2]), {"sleptMs": 1200})
            self.assertEqual(d.wait(timeout=15), 0)
            self.assertLess(time.monotonic() - started, 10)
            log = d.log()
            self.assertIn("Received signal 15, stopping", log)
            self.assertIn("HTTP service stopped", log)
            self.assertLess(log.index("HTTP service stopped"), log.index("Application exiting"))
        finally:
            d.close()

    def test_a_request_past_the_deadline_is_cut_and_the_stop_stays_bounded(self):
        d = Daemon(BINARY, deadline_ms=200)
        try:
            result = {}

            def slow():
                try:
                    result["answer"] = d.get("/api/sleep?ms=3000", timeout=15)
                except Exception as e:  # the connection is closed under it
                    result["error"] = e

            client = threading.Thread(target=slow)
            client.start()
            self.assertTrue(wait_until(lambda: "serving /api/sleep" in d.get("/api/threads")[2].decode()))
            started = time.monotonic()
            d.signal(signal.SIGTERM)
            # The sleeping handler keeps its thread; the service stops after 200 ms and the
            # pool wait is what bounds the rest.
            self.assertEqual(d.wait(timeout=25), 0)
            client.join(15)
            self.assertNotIn("answer", result)
            self.assertLess(time.monotonic() - started, 20)
        finally:
            d.close()


class ReloadTest(unittest.TestCase):
    def test_sighup_reopens_a_renamed_log_and_applies_a_changed_level(self):
        d = Daemon(BINARY)
        try:
            self.assertTrue(wait_until(lambda: "Serving http://" in d.log()))
            rotated = d.log_path + ".1"
            os.rename(d.log_path, rotated)
            d.signal(signal.SIGHUP)
            self.assertTrue(wait_until(lambda: "Reopened log files" in d.log()), d.log())
            with open(rotated) as f:
                old = f.read()
            self.assertIn("Serving http://", old)
            self.assertNotIn("Reopened log files", old)
            # A changed file is read again: the unknown level is complained about.
            with open(d.config) as f:
                text = f.read()
            with open(d.config, "w") as f:
                f.write(text.replace("<level>info</level>",
                                     "<level>info</level><memoryLevel>bogus</memoryLevel>"))
            d.signal(signal.SIGHUP)
            self.assertTrue(wait_until(lambda: "Unrecognized log/memoryLevel 'bogus'" in d.log()), d.log())
            self.assertIn("Configuration refreshed", d.log())
            self.assertEqual(d.get("/healthz")[0], 200)
            self.assertEqual(d.stop(), 0)
        finally:
            d.close()


class ServiceManagerTest(unittest.TestCase):
    def test_ready_once_serving_watchdog_fed_and_stopping_told(self):
        import socket
        import tempfile
        sock_dir = tempfile.mkdtemp(prefix="pelmorad-notify-")
        path = os.path.join(sock_dir, "notify")
        listener = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        listener.bind(path)
        listener.settimeout(10)
        env = dict(os.environ, NOTIFY_SOCKET=path, WATCHDOG_USEC="100000")
        d = None
        try:
            d = Daemon(BINARY, env=env)
            messages = []

            def receive_until(word):
                while not any(word in m for m in messages):
                    messages.append(listener.recv(4096).decode())

            receive_until("READY=1")
            # Ready means serving.
            self.assertEqual(d.get("/healthz")[0], 200)
            ready = next(m for m in messages if "READY=1" in m)
            self.assertIn("MAINPID=%d" % d.proc.pid, ready)
            receive_until("WATCHDOG=1")
            d.signal(signal.SIGTERM)
            receive_until("STOPPING=1")
            self.assertEqual(d.wait(timeout=15), 0)
        finally:
            listener.close()
            if d:
                d.close()
            subprocess.run(["rm", "-rf", sock_dir])


class CommandLineTest(unittest.TestCase):
    def assertOneLineError(self, args, *needles):
        r = run(args)
        self.assertEqual(r.returncode, 2, (args, r.stdout, r.stderr))
        self.assertEqual(r.stdout, "")
        lines = r.stderr.splitlines()
        self.assertEqual(len(lines), 1, r.stderr)
        self.assertTrue(lines[0].startswith("pelmorad: "), lines[0])
        for needle in needles:
            self.assertIn(needle, lines[0])

    def test_bad_flags_exit_2_with_one_line(self):
        self.assertOneLineError(["--bogus"], "--bogus")
        self.assertOneLineError(["--port", "http"], "--port", "http")
        self.assertOneLineError(["--port", "70000"], "70000")
        self.assertOneLineError(["--port"], "--port needs a value")
        self.assertOneLineError(["--help=yes"], "--help")
        self.assertOneLineError(["stray"], "stray")
        self.assertOneLineError(["--version", "--help"], "cannot be combined")

    def test_unreadable_configurations_exit_2_naming_the_file(self):
        tmp = subprocess.run(["mktemp", "-d"], capture_output=True, text=True).stdout.strip()
        try:
            missing = os.path.join(tmp, "missing.xml")
            self.assertOneLineError(["--config", missing], missing, "no such file")
            broken = os.path.join(tmp, "broken.xml")
            with open(broken, "w") as f:
                f.write("<config><log>\n")
            self.assertOneLineError(["--config", broken], broken)
            self.assertOneLineError(["--config", tmp], tmp, "not a regular file")
            flat = os.path.join(tmp, "broken.conf")
            with open(flat, "w") as f:
                f.write("this is not a setting\n")
            self.assertOneLineError(["--config", flat], flat)
            # A value of the wrong kind is found once the daemon reads it; the key is named.
            port = os.path.join(tmp, "port.conf")
            with open(port, "w") as f:
                f.write('pelmorad/http/port = "eighty"\nlog/outputToConsole = "false"\n')
            r = run(["--config", port, "--state-dir", os.path.join(tmp, "state")])
            self.assertEqual(r.returncode, 2, r.stderr)
            self.assertEqual(r.stderr.splitlines(), [r.stderr.strip()])
            self.assertRegex(r.stderr, r"^pelmorad: bad value for pelmorad/http/port in the configuration: ")
        finally:
            subprocess.run(["rm", "-rf", tmp])

    def test_help_version_and_the_default_configuration(self):
        r = run(["--help"])
        self.assertEqual(r.returncode, 0)
        for flag in ("--config", "--port", "--listen", "--state-dir", "--print-default-config"):
            self.assertIn(flag, r.stdout)
        r = run(["--version"])
        self.assertRegex(r.stdout, r"^pelmorad \d+\.\d+\.\d+\n$")
        r = run(["--print-default-config"])
        self.assertEqual(r.returncode, 0)
        root = ET.fromstring(r.stdout)
        self.assertEqual(root.findtext("pelmorad/http/address"), "127.0.0.1")
        self.assertEqual(root.findtext("pelmorad/http/port"), "8080")
        self.assertEqual(root.findtext("pelmorad/debug/sleepEndpoint"), "false")
        self.assertEqual(root.findtext("pelmora/daemon/handleSignals"), "false")

    def test_a_taken_port_is_one_line_and_status_1(self):
        d = Daemon(BINARY)
        try:
            port = d.url.rstrip("/").rsplit(":", 1)[1]
            r = run(["--port", port, "--state-dir", d.dir + "/second"])
            self.assertEqual(r.returncode, 1, r.stderr)
            # Start-up lines on the console come first; the failure is one line of its own.
            self.assertIn("pelmorad: cannot serve: Cannot listen on 127.0.0.1:%s: Address already in use"
                          % port, r.stderr.splitlines())
        finally:
            d.stop()
            d.close()


class ConfigurationTest(unittest.TestCase):
    """--config in each syntax, plain and compressed, overrides the defaults key by key."""

    def check_log_lines(self, text, name, expected):
        d = Daemon(BINARY, config_text=text, config_name=name)
        try:
            s = json.loads(d.get("/api/status")[2])
            self.assertEqual(len(s["log"]), expected, name)
            # Keys the file leaves out keep their defaults.
            self.assertEqual(s["pool"]["maxThreads"], 64, name)
            self.assertEqual(d.get("/api/sleep?ms=1")[0], 404, name)
            self.assertEqual(d.stop(), 0)
        finally:
            d.close()

    def test_each_syntax_plain_and_gzip(self):
        xml = "<config><pelmorad><status><logLines>2</logLines></status></pelmorad></config>\n"
        flat = 'pelmorad/status/logLines = "3"\n'
        properties = "pelmorad.status.logLines = 4\n"
        self.check_log_lines(xml, "a.xml", 2)
        self.check_log_lines(gzip.compress(xml.encode()), "a.xml.gz", 2)
        self.check_log_lines(flat, "a.conf", 3)
        self.check_log_lines(gzip.compress(flat.encode()), "a.conf.gz", 3)
        self.check_log_lines(properties, "a.properties", 4)
        self.check_log_lines(gzip.compress(properties.encode()), "a.properties.gz", 4)

    def test_printed_defaults_run_as_a_configuration(self):
        text = run(["--print-default-config"]).stdout
        d = Daemon(BINARY, config_text=text)
        try:
            self.assertEqual(d.get("/healthz")[0], 200)
            self.assertEqual(d.stop(), 0)
            # Its empty log directory means the default one, not the working directory.
            self.assertIn("Serving " + d.url, d.log())
        finally:
            d.close()

    def test_flags_win_over_the_file(self):
        text = ("<config><pelmorad><http><address>127.0.0.3</address><port>1</port></http>"
                "<stateDir>/nonexistent/elsewhere</stateDir></pelmorad></config>\n")
        d = Daemon(BINARY, config_text=text, extra_args=["--listen=127.0.0.2"])
        try:
            self.assertTrue(d.url.startswith("http://127.0.0.2:"), d.url)
            self.assertNotEqual(d.url, "http://127.0.0.2:1/")
            self.assertEqual(json.loads(d.get("/api/status")[2])["stateDir"], d.state)
            self.assertTrue(os.path.exists(d.log_path))
            self.assertEqual(d.stop(), 0)
        finally:
            d.close()

    def test_documents_come_from_a_configured_root_without_escaping_it(self):
        import tempfile
        root = tempfile.mkdtemp(prefix="pelmorad-docroot-")
        with open(os.path.join(root, "hello.txt"), "w") as f:
            f.write("hello from the root\n")
        text = ("<config><pelmorad><docroot>%s</docroot></pelmorad></config>\n" % root)
        d = Daemon(BINARY, config_text=text)
        try:
            status, headers, body = d.get("/hello.txt")
            self.assertEqual((status, body), (200, b"hello from the root\n"))
            self.assertIn("text/plain", headers["Content-Type"])
            # The daemon's own paths win over files of the same name.
            self.assertEqual(d.get("/healthz")[2], b"ok\n")
            r = subprocess.run(["curl", "-s", "--path-as-is", "-o", "/dev/null", "-w", "%{http_code}",
                                d.url + "../" + os.path.basename(root) + "/hello.txt"],
                               capture_output=True, text=True, timeout=20)
            self.assertEqual(r.stdout, "404")
            d.stop()
        finally:
            d.close()
            subprocess.run(["rm", "-rf", root])


if __name__ == "__main__":
    if len(sys.argv) < 2:
        sys.exit(__doc__)
    BINARY = os.path.abspath(sys.argv.pop(1))
    unittest.main(verbosity=2)
