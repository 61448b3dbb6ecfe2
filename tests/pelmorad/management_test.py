"""pelmorad's SOAP management API driven by zeep through the WSDL the daemon serves:
every operation, faults for bad arguments, configuration written back to the file, and
the session cookie.

usage: management_test.py PELMORAD_BINARY
"""

import http.client
import os
import shutil
import sys
import unittest
import urllib.parse
import xml.etree.ElementTree as ET

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from daemon import Daemon  # noqa: E402

# Missing zeep must fail the test, not skip it.
import requests  # noqa: E402
import zeep  # noqa: E402
import zeep.exceptions  # noqa: E402

BINARY = None
# Markup, an entity, quotes and text beyond ASCII, as callers send them.
AWKWARD = 'a <b>&amp; "q" \'s\' ]]> – grüße 日本 🚀'
SESSION_COOKIE = "norvex_soap_session"


class CookieLog:
    """A requests session that records every Set-Cookie of the session cookie."""

    def __init__(self):
        self.session = requests.Session()
        self.set_cookies = []
        self.session.hooks["response"].append(self._record)

    def _record(self, response, *args, **kwargs):
        header = response.headers.get("Set-Cookie", "")
        if SESSION_COOKIE in header:
            self.set_cookies.append(header)


def make_client(daemon, cookies=None):
    cookies = cookies or CookieLog()
    transport = zeep.transports.Transport(session=cookies.session, timeout=10, operation_timeout=10)
    return zeep.Client(daemon.url + "soap?wsdl", transport=transport), cookies


def read_bytes(path):
    with open(path, "rb") as f:
        return f.read()


def raw_get(daemon, path, host):
    parts = urllib.parse.urlsplit(daemon.url)
    conn = http.client.HTTPConnection(parts.hostname, parts.port, timeout=10)
    try:
        conn.putrequest("GET", path, skip_host=True)
        conn.putheader("Host", host)
        conn.endheaders()
        r = conn.getresponse()
        return r.status, r.read().decode()
    finally:
        conn.close()


class OperationsTest(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.d = Daemon(BINARY)
        cls.client, cls.cookies = make_client(cls.d)
        cls.service = cls.client.service

    @classmethod
    def tearDownClass(cls):
        try:
            assert cls.d.stop() == 0
        finally:
            cls.d.close()

    def assertClientFault(self, call, *args, contains):
        with self.assertRaises(zeep.exceptions.Fault) as caught:
            call(*args)
        self.assertIn("Client", caught.exception.code)
        self.assertIn(contains, caught.exception.message)

    def test_wsdl_address_is_the_one_the_client_used(self):
        status, text = raw_get(self.d, "/soap?wsdl", "manager.example.org:8443")
        self.assertEqual(status, 200)
        self.assertIn('location="http://manager.example.org:8443/soap"', text)
        ET.fromstring(text.encode())
        # A Host that is no host name falls back to the daemon's own address.
        status, text = raw_get(self.d, "/soap?wsdl", 'x"/><evil')
        self.assertEqual(status, 200)
        self.assertIn('location="%ssoap"' % self.d.url, text)
        self.assertNotIn("evil", text)

    def test_status_names_this_process(self):
        status = self.service.GetStatus()
        self.assertEqual(status.name, "pelmorad")
        self.assertEqual(status.pid, self.d.proc.pid)
        self.assertEqual(status.url, self.d.url)
        self.assertEqual(status.state, "running")
        self.assertEqual(status.configFile, self.d.config)
        self.assertRegex(status.instanceId, r"^[0-9a-f]{8}-[0-9a-f]{4}-[0-9a-f]{4}-[0-9a-f]{4}-[0-9a-f]{12}$")
        self.assertGreaterEqual(status.connections, 1)

    def test_echo_returns_awkward_text_unchanged(self):
        self.assertEqual(self.service.Echo(AWKWARD), AWKWARD)
        self.assertEqual(self.service.Echo(""), None)  # zeep reads an empty element as nothing

    def test_counters_are_selected_by_regular_expression(self):
        for _ in range(3):
            self.assertEqual(self.d.get("/healthz")[0], 200)
        counters = self.service.QueryCounters(r"Endpoint='health.*'/Requests$")
        self.assertEqual([c.name for c in counters], ["/Pelmorad/Endpoint='healthz'/Requests"])
        self.assertGreaterEqual(counters[0].value, 3)
        self.assertEqual(counters[0].type, "counter")
        everything = self.service.QueryCounters("")
        names = [c.name for c in everything]
        self.assertIn("/Pelmorad/UptimeSeconds", names)
        self.assertGreater(len(names), len(counters))
        self.assertEqual(self.service.QueryCounters("^no such counter$"), [])
        self.assertClientFault(self.service.QueryCounters, "([unclosed", contains="Invalid regular expression")

    def test_log_tail_and_thread_states(self):
        lines = self.service.GetLogTail(3)
        self.assertTrue(1 <= len(lines) <= 3, lines)
        self.assertTrue(any("Serving http://" in line for line in self.service.GetLogTail(10000)))
        self.assertEqual(self.service.GetLogTail(0), [])
        self.assertClientFault(self.service.GetLogTail, -1, contains="lines")
        threads = self.service.GetThreadStates()
        states = [s for t in threads for s in t.state]
        self.assertTrue(any(s.startswith("main: running") for s in states), states)
        self.assertTrue(all(t.id > 0 for t in threads))

    def test_config_is_read_back_and_missing_paths_are_client_faults(self):
        self.assertEqual(self.service.GetConfig("pelmorad/debug/maxSleepMs"), "5000")  # from the file
        self.assertEqual(self.service.GetConfig("pelmorad/status/logLines"), "40")  # compiled in
        self.assertClientFault(self.service.GetConfig, "pelmorad/no/such/key", contains="pelmorad/no/such/key")

    def test_set_config_rewrites_the_file(self):
        self.service.SetConfig("pelmorad/note", AWKWARD)
        self.service.SetConfig("pelmorad/status/logLines", "25")
        root = ET.parse(self.d.config).getroot()
        self.assertEqual(root.findtext("pelmorad/note"), AWKWARD)
        self.assertEqual(root.findtext("pelmorad/status/logLines"), "25")
        # What was in the file stays.
        self.assertEqual(root.findtext("pelmorad/debug/maxSleepMs"), "5000")
        self.assertEqual(self.service.GetConfig("pelmorad/note"), AWKWARD)
        self.assertEqual(self.service.GetConfig("pelmorad/status/logLines"), "25")
        # A value cannot go below a node that holds one; neither file nor memory change.
        before = read_bytes(self.d.config)
        self.assertClientFault(self.service.SetConfig, "pelmorad/note/below", "x", contains="pelmorad/note/below")
        self.assertEqual(read_bytes(self.d.config), before)
        self.assertEqual(self.service.GetConfig("pelmorad/note"), AWKWARD)

    def test_session_cookie_is_set_once_and_reused(self):
        client, cookies = make_client(self.d)
        for text in ("one", "two", "three"):
            self.assertEqual(client.service.Echo(text), text)
        client.service.GetStatus()
        self.assertEqual(len(cookies.set_cookies), 1, cookies.set_cookies)
        self.assertIn(SESSION_COOKIE, cookies.session.cookies.get_dict())
        cookies.session.close()


class ConfigFileTest(unittest.TestCase):
    def test_set_config_without_a_file_is_refused(self):
        d = Daemon(BINARY, use_config=False)
        try:
            client, _ = make_client(d)
            with self.assertRaises(zeep.exceptions.Fault) as caught:
                client.service.SetConfig("pelmorad/note", "x")
            self.assertIn("Client", caught.exception.code)
            self.assertIn("--config", caught.exception.message)
            with self.assertRaises(zeep.exceptions.Fault):
                client.service.GetConfig("pelmorad/note")
            self.assertEqual(d.stop(), 0)
        finally:
            d.close()

    def test_a_failed_write_leaves_the_running_configuration_alone(self):
        d = Daemon(BINARY)
        try:
            client, _ = make_client(d)
            client.service.SetConfig("pelmorad/note", "first")
            # The file's name now holds a directory: the rename over it fails.
            saved = d.config + ".saved"
            os.rename(d.config, saved)
            os.mkdir(d.config)
            with self.assertRaises(zeep.exceptions.Fault) as caught:
                client.service.SetConfig("pelmorad/note", "second")
            self.assertIn("Server", caught.exception.code)
            self.assertEqual(client.service.GetConfig("pelmorad/note"), "first")
            with self.assertRaises(zeep.exceptions.Fault):
                client.service.SetConfig("pelmorad/other", "x")
            with self.assertRaises(zeep.exceptions.Fault):
                client.service.GetConfig("pelmorad/other")
            shutil.rmtree(d.config)
            os.rename(saved, d.config)
            client.service.SetConfig("pelmorad/note", "third")
            self.assertEqual(ET.parse(d.config).getroot().findtext("pelmorad/note"), "third")
            self.assertEqual(d.stop(), 0)
        finally:
            d.close()

    def test_compressed_flat_files_are_not_written_back(self):
        import gzip
        text = gzip.compress(b'pelmorad/debug/sleepEndpoint = "true"\n')
        d = Daemon(BINARY, config_text=text, config_name="test.conf.gz")
        try:
            client, _ = make_client(d)
            with self.assertRaises(zeep.exceptions.Fault) as caught:
                client.service.SetConfig("pelmorad/note", "x")
            self.assertIn("compressed", caught.exception.message)
            self.assertEqual(client.service.GetConfig("pelmorad/debug/sleepEndpoint"), "true")
            self.assertEqual(d.stop(), 0)
        finally:
            d.close()


if __name__ == "__main__":
    if len(sys.argv) < 2:
        sys.exit(__doc__)
    BINARY = os.path.abspath(sys.argv.pop(1))
    unittest.main(verbosity=2)
