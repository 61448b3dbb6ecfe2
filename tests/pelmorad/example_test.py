"""The README's embedding example serves its page and /metrics, and SIGTERM ends it with
status 0.

usage: example_test.py EMBEDDED_DAEMON_BINARY
"""

import signal
import socket
import subprocess
import sys
import time
import urllib.request


def free_port():
    with socket.socket() as s:
        s.bind(("127.0.0.1", 0))
        return s.getsockname()[1]


def get(url):
    with urllib.request.urlopen(url, timeout=10) as r:
        return r.status, r.read()


def main():
    if len(sys.argv) != 2:
        sys.exit(__doc__)
    port = free_port()
    proc = subprocess.Popen([sys.argv[1], str(port)], stdout=subprocess.DEVNULL,
                            stderr=subprocess.DEVNULL)
    failures = []
    try:
        deadline = time.monotonic() + 20
        while True:
            try:
                status, body = get("http://127.0.0.1:%d/" % port)
                break
            except OSError:
                if time.monotonic() > deadline or proc.poll() is not None:
                    raise
                time.sleep(0.05)
        if (status, body) != (200, b"hello\n"):
            failures.append("/ answered %r %r" % (status, body))
        status, body = get("http://127.0.0.1:%d/metrics" % port)
        if status != 200 or b"# TYPE " not in body:
            failures.append("/metrics answered %r %r" % (status, body[:200]))
        proc.send_signal(signal.SIGTERM)
        code = proc.wait(timeout=30)
        if code != 0:
            failures.append("exit status %d after SIGTERM" % code)
    finally:
        if proc.poll() is None:
            proc.kill()
            proc.wait()
    for failure in failures:
        print("FAIL: " + failure)
    print("%d passed, %d failed" % (0 if failures else 1, 1 if failures else 0))
    sys.exit(1 if failures else 0)


if __name__ == "__main__":
    main()
