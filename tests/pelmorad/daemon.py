"""Starts pelmorad as a child on a free port with a scratch state directory."""

import os
import select
import shutil
import signal
import subprocess
import tempfile
import time
import urllib.error
import urllib.request

# Settings every test daemon gets: the slow debug endpoint, a short drain and deadline.
TEST_CONFIG = """<?xml version="1.0"?>
<config>
  <pelmorad>
    <debug><sleepEndpoint>true</sleepEndpoint><maxSleepMs>5000</maxSleepMs></debug>
    <shutdown><drainDelayMs>{drain}</drainDelayMs></shutdown>
  </pelmorad>
  <log><consoleLevel>warning</consoleLevel><level>info</level></log>
  <pelmora><http><shutdownDeadlineMs>{deadline}</shutdownDeadlineMs></http></pelmora>
</config>
"""


class Daemon:
    def __init__(self, binary, extra_args=(), config_text=None, config_name="test.xml",
                 drain_ms=0, deadline_ms=5000, env=None, use_config=True):
        self.dir = tempfile.mkdtemp(prefix="pelmorad-test-")
        self.state = os.path.join(self.dir, "state")
        self.config = os.path.join(self.dir, config_name)
        if config_text is None:
            config_text = TEST_CONFIG.format(drain=drain_ms, deadline=deadline_ms)
        mode = "wb" if isinstance(config_text, bytes) else "w"
        with open(self.config, mode) as f:
            f.write(config_text)
        args = [binary, "--port", "0", "--state-dir", self.state]
        if use_config:
            args += ["--config", self.config]
        # Standard error goes to a file: a pipe nobody reads would stall a chatty daemon.
        self.stderr_path = os.path.join(self.dir, "stderr.txt")
        with open(self.stderr_path, "wb") as err:
            self.proc = subprocess.Popen(args + list(extra_args), stdout=subprocess.PIPE,
                                         stderr=err, env=env)
        self.url = self._read_url(timeout=20)

    def _read_url(self, timeout):
        deadline = time.monotonic() + timeout
        line = b""
        while time.monotonic() < deadline:
            ready, _, _ = select.select([self.proc.stdout], [], [], 0.1)
            if ready:
                chunk = os.read(self.proc.stdout.fileno(), 1)
                if not chunk:
                    break
                line += chunk
                if chunk == b"\n":
                    text = line.decode()
                    if "serving http://" in text:
                        return text.split("serving ", 1)[1].split()[0]
                    line = b""
        err = self.stderr()
        self.close()
        raise AssertionError("pelmorad did not print its URL: %r %r" % (line, err))

    @property
    def log_path(self):
        return os.path.join(self.state, "log", "pelmorad.log")

    def log(self):
        try:
            with open(self.log_path, errors="replace") as f:
                return f.read()
        except FileNotFoundError:
            return ""

    def stderr(self):
        with open(self.stderr_path, errors="replace") as f:
            return f.read()

    def get(self, path, timeout=10):
        """(status, headers, body bytes) of GET path."""
        try:
            with urllib.request.urlopen(self.url.rstrip("/") + path, timeout=timeout) as r:
                return r.status, r.headers, r.read()
        except urllib.error.HTTPError as e:
            return e.code, e.headers, e.read()

    def signal(self, number):
        self.proc.send_signal(number)

    def stop(self, timeout=20):
        """SIGTERM, then the exit status; killed when it does not end in time."""
        if self.proc.poll() is None:
            self.proc.send_signal(signal.SIGTERM)
        try:
            status = self.proc.wait(timeout=timeout)
        except subprocess.TimeoutExpired:
            self.proc.kill()
            self.proc.wait()
            raise
        self.check_sanitizers()
        return status

    def wait(self, timeout):
        status = self.proc.wait(timeout=timeout)
        self.check_sanitizers()
        return status

    def check_sanitizers(self):
        """A sanitizer build reports through standard error and may still exit 0."""
        text = self.stderr()
        for marker in ("ERROR: AddressSanitizer", "WARNING: ThreadSanitizer",
                       "runtime error:", "ERROR: LeakSanitizer"):
            if marker in text:
                raise AssertionError("sanitizer report from pelmorad:\n" + text[-6000:])

    def close(self):
        if self.proc.poll() is None:
            self.proc.kill()
            self.proc.wait()
        if self.proc.stdout:
            self.proc.stdout.close()
        shutil.rmtree(self.dir, ignore_errors=True)


def wait_until(predicate, timeout=10, step=0.02):
    deadline = time.monotonic() + timeout
    while time.monotonic() < deadline:
        if predicate():
            return True
        time.sleep(step)
    return predicate()
