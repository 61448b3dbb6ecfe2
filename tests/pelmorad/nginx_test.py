"""Two pelmorad daemons behind an nginx of the test's own, configured as
docs/deployment.md says: one session cookie always reaches one daemon, and a daemon
stopped with SIGTERM hands new sessions to the other without a failed request.

usage: nginx_test.py PELMORAD_BINARY [NGINX_BINARY]
Exit status 77 (skipped) when nginx is missing or may not run here.
"""

import os
import shutil
import signal
import socket
import subprocess
import sys
import tempfile
import threading
import time
import urllib.request

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from daemon import Daemon, TEST_CONFIG, wait_until  # noqa: E402

import requests  # noqa: E402
import zeep  # noqa: E402

SKIP = 77
COOKIE = "norvex_soap_session"

# The upstream and location of packaging/nginx-pelmorad.conf, on the test's ports.
NGINX_CONF = """
{user}
worker_processes 1;
events {{ worker_connections 512; }}
http {{
    access_log {dir}/access.log;
    client_body_temp_path {dir}/body;
    proxy_temp_path {dir}/proxy;
    fastcgi_temp_path {dir}/fastcgi;
    uwsgi_temp_path {dir}/uwsgi;
    scgi_temp_path {dir}/scgi;

    upstream pelmorad {{
        hash $cookie_norvex_soap_session consistent;
        server {a} max_fails=1 fail_timeout=5s;
        server {b} max_fails=1 fail_timeout=5s;
        keepalive 16;
    }}
    server {{
        listen 127.0.0.1:{port};
        location / {{
            proxy_pass http://pelmorad;
            proxy_http_version 1.1;
            proxy_set_header Connection "";
            proxy_set_header Host $http_host;
            proxy_set_header X-Forwarded-For $proxy_add_x_forwarded_for;
            proxy_next_upstream error timeout http_502 http_503 non_idempotent;
            proxy_connect_timeout 2s;
            proxy_read_timeout 20s;
        }}
    }}
}}
"""


def skip(reason):
    print("SKIP: " + reason)
    sys.exit(SKIP)


def free_port():
    with socket.socket() as s:
        s.bind(("127.0.0.1", 0))
        return s.getsockname()[1]


class Nginx:
    def __init__(self, binary, upstreams):
        self.dir = tempfile.mkdtemp(prefix="pelmorad-nginx-")
        self.port = free_port()
        user = "user root;" if os.geteuid() == 0 else ""
        conf = os.path.join(self.dir, "nginx.conf")
        with open(conf, "w") as f:
            f.write(NGINX_CONF.format(user=user, dir=self.dir, a=upstreams[0], b=upstreams[1], port=self.port))
        self.error_log = os.path.join(self.dir, "error.log")
        globals_ = "daemon off; pid %s/nginx.pid; error_log %s;" % (self.dir, self.error_log)
        self.proc = subprocess.Popen([binary, "-p", self.dir, "-c", conf, "-g", globals_],
                                     stdout=subprocess.DEVNULL, stderr=subprocess.PIPE)
        self.url = "http://127.0.0.1:%d/" % self.port
        if not wait_until(self._answers, timeout=10) or self.proc.poll() is not None:
            err = self.proc.stderr.read().decode(errors="replace") if self.proc.poll() is not None else ""
            log = open(self.error_log, errors="replace").read() if os.path.exists(self.error_log) else ""
            self.close()
            text = (err + log).strip()
            if "Permission denied" in text or "Operation not permitted" in text:
                skip("nginx cannot run here: " + text.splitlines()[-1])
            raise AssertionError("nginx did not start: " + text)

    def _answers(self):
        if self.proc.poll() is not None:
            return True
        try:
            socket.create_connection(("127.0.0.1", self.port), timeout=1).close()
            return True
        except OSError:
            return False

    def close(self):
        if self.proc.poll() is None:
            self.proc.send_signal(signal.SIGQUIT)
            try:
                self.proc.wait(timeout=10)
            except subprocess.TimeoutExpired:
                self.proc.kill()
                self.proc.wait()
        shutil.rmtree(self.dir, ignore_errors=True)


class Caller:
    """One management client through nginx, with its own cookie jar."""

    def __init__(self, wsdl_url):
        self.session = requests.Session()
        transport = zeep.transports.Transport(session=self.session, timeout=10, operation_timeout=10)
        self.service = zeep.Client(wsdl_url, transport=transport).service

    def cookie(self):
        return self.session.cookies.get(COOKIE)

    def instance(self):
        """(cookie sent, instance id that answered)."""
        sent = self.cookie()
        return sent, self.service.GetStatus().instanceId


def instance_of(daemon):
    transport = zeep.transports.Transport(timeout=10)
    return zeep.Client(daemon.url + "soap?wsdl", transport=transport).service.GetStatus().instanceId


def check_sessions_stay_put(wsdl_url, instances):
    """Every call carrying one cookie is answered by one daemon; a client's cookie
    settles once it names a session of the daemon it hashes to."""
    for _ in range(6):
        caller = Caller(wsdl_url)
        seen = {}
        for _ in range(24):
            sent, answered = caller.instance()
            assert answered in instances, answered
            if sent is not None:
                assert seen.setdefault(sent, answered) == answered, (sent, seen[sent], answered)
        settled = caller.cookie()
        last = {caller.instance() for _ in range(4)}
        assert len(last) == 1 and next(iter(last))[0] == settled, last
        assert caller.cookie() == settled, "the cookie still changes after 24 calls"


def check_graceful_stop(wsdl_url, nginx_url, daemons, instances):
    # A settled session's daemon takes the in-flight request (sent with that session's
    # cookie, so that nginx sends it there) and goes.
    probe = Caller(wsdl_url)
    for _ in range(24):
        probe.instance()
    victim_cookie, victim_id = probe.instance()
    victim = daemons[instances.index(victim_id)]
    survivor_id = instances[1 - instances.index(victim_id)]

    stop = threading.Event()
    failures, answers = [], []
    lock = threading.Lock()

    def call_repeatedly():
        caller = Caller(wsdl_url)
        while not stop.is_set():
            try:
                text = caller.service.Echo("ping ü <&>")
                assert text == "ping ü <&>", text
                answered = caller.service.GetStatus().instanceId
                with lock:
                    answers.append((time.monotonic(), answered))
            except Exception as e:  # every failure counts, whatever its kind
                with lock:
                    failures.append(repr(e))

    def slow_request(result):
        try:
            request = urllib.request.Request(nginx_url + "api/sleep?ms=1500",
                                             headers={"Cookie": COOKIE + "=" + victim_cookie})
            with urllib.request.urlopen(request, timeout=20) as r:
                result.append((r.status, r.read()))
        except Exception as e:
            result.append(repr(e))

    workers = [threading.Thread(target=call_repeatedly) for _ in range(4)]
    for w in workers:
        w.start()
    victim_api = zeep.Client(victim.url + "soap?wsdl").service

    def sleeping():
        return any(s.startswith("serving /api/sleep") for t in victim_api.GetThreadStates() for s in t.state)

    assert wait_until(lambda: len(answers) >= 8, timeout=10)
    slow = []
    slow_thread = threading.Thread(target=slow_request, args=(slow,))
    slow_thread.start()
    assert wait_until(sleeping, timeout=10)
    victim.signal(signal.SIGTERM)
    assert victim.wait(timeout=20) == 0
    exited = time.monotonic()
    with lock:
        before = len(answers)
    assert wait_until(lambda: len(answers) >= before + 12, timeout=10)
    stop.set()
    for w in workers:
        w.join(timeout=20)
    slow_thread.join(timeout=20)

    assert not failures, failures[:5]
    assert slow == [(200, b'{"sleptMs":1500}')], slow
    after = [who for when, who in answers if when > exited]
    assert after and set(after) == {survivor_id}, set(after)
    # Sessions opened now all land on the survivor.
    for _ in range(3):
        caller = Caller(wsdl_url)
        assert {caller.instance()[1] for _ in range(3)} == {survivor_id}


def main():
    if len(sys.argv) < 2:
        sys.exit(__doc__)
    binary = os.path.abspath(sys.argv[1])
    nginx_binary = sys.argv[2] if len(sys.argv) > 2 else "/usr/sbin/nginx"
    if not os.access(nginx_binary, os.X_OK):
        skip("no nginx at " + nginx_binary + " (Debian package nginx)")
    started = time.monotonic()
    config = TEST_CONFIG.format(drain=500, deadline=5000)
    daemons = [Daemon(binary, config_text=config) for _ in range(2)]
    nginx = None
    try:
        upstreams = [d.url[len("http://"):].rstrip("/") for d in daemons]
        instances = [instance_of(d) for d in daemons]
        assert instances[0] != instances[1]
        nginx = Nginx(nginx_binary, upstreams)
        wsdl_url = nginx.url + "soap?wsdl"
        check_sessions_stay_put(wsdl_url, instances)
        print("sessions stay with one daemon: ok")
        check_graceful_stop(wsdl_url, nginx.url, daemons, instances)
        print("a stopped daemon hands over without a failed request: ok")
    finally:
        if nginx:
            nginx.close()
        for d in daemons:
            try:
                if d.proc.poll() is None:
                    d.stop()
            finally:
                d.close()
    print("passed in %.1f s" % (time.monotonic() - started))


if __name__ == "__main__":
    main()
