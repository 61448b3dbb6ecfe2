#!/usr/bin/python3
"""Drives the SOAP example with a real SOAP client (zeep) over HTTP.

usage: zeepInterop.py SOAP_ECHO_PROGRAM

Starts the program on a free port, loads its WSDL over HTTP, calls both operations with
XML-special and non-ASCII text, expects a fault as zeep.exceptions.Fault, and checks that
the session cookie is set once and sent back on later calls. Exits non-zero on any failure,
including a missing zeep: the test must not pass by skipping.
"""
import socket
import subprocess
import sys
import time
import urllib.request

import requests
import zeep
import zeep.exceptions
import zeep.transports

COOKIE = "norvex_soap_session"


def free_port():
    with socket.socket() as s:
        s.bind(("127.0.0.1", 0))
        return s.getsockname()[1]


def wait_until_serving(base, server, deadline=20.0):
    end = time.monotonic() + deadline
    while time.monotonic() < end:
        if server.poll() is not None:
            raise RuntimeError("the server exited with %d" % server.returncode)
        try:
            urllib.request.urlopen(base + "/serviceState", timeout=1).read()
            return
        except OSError:
            time.sleep(0.05)
    raise RuntimeError("the server did not answer within %.0f s" % deadline)


class CookieWatch(requests.Session):
    """Records the Set-Cookie and Cookie headers of every exchange."""

    def __init__(self):
        super().__init__()
        self.set_cookies = []
        self.sent_cookies = []

    def send(self, request, **kwargs):
        self.sent_cookies.append(request.headers.get("Cookie", ""))
        response = super().send(request, **kwargs)
        self.set_cookies.append(response.headers.get("Set-Cookie", ""))
        return response


def check(condition, what):
    if not condition:
        raise AssertionError(what)


def main(argv):
    program = argv[1]
    port = free_port()
    base = "http://127.0.0.1:%d" % port
    server = subprocess.Popen([program, "--port", str(port)], stdout=subprocess.DEVNULL)
    try:
        wait_until_serving(base, server)
        session = CookieWatch()
        client = zeep.Client(base + "/soap/echo.wsdl?wsdl",
                             transport=zeep.transports.Transport(session=session))
        service = client.create_service("{urn:anchor:echo}echo", base + "/soap")

        text = 'Fünf <tags> & "quotes" \'apos\' ✓ 日本 ]]> \u00e9'
        check(service.echoString(text) == text, "echoString did not echo the text")
        described = service.describePerson({"name": "Zoë <admin> & co", "age": 41,
                                            "languages": ["français", "日本語"]})
        check(described == "Zoë <admin> & co (41) speaks français, 日本語",
              "describePerson answered %r" % described)
        try:
            service.describePerson({"name": "x", "age": -1, "languages": []})
            raise AssertionError("a negative age did not fault")
        except zeep.exceptions.Fault as fault:
            check(fault.message == "age must not be negative", "fault message %r" % fault.message)
            check(fault.code == "ClientFaultCode", "fault code %r" % fault.code)
        check(service.echoString("again") == "again", "the call after the fault failed")

        # The WSDL GET has no session; the first SOAP call gets the cookie, later calls send it.
        soap_set = [c for c in session.set_cookies if COOKIE in c]
        check(len(soap_set) == 1, "session cookie set %d times: %r" % (len(soap_set), session.set_cookies))
        value = soap_set[0].split(";")[0]
        later = session.sent_cookies[-3:]
        check(all(value in sent for sent in later), "cookie not sent back: %r / %r" % (value, later))
        print("zeep interoperability OK")
        return 0
    finally:
        server.terminate()
        try:
            server.wait(timeout=10)
        except subprocess.TimeoutExpired:
            server.kill()
            raise AssertionError("the server did not stop on SIGTERM")
        check(server.returncode == 0, "the server exited with %s on SIGTERM" % server.returncode)


if __name__ == "__main__":
    sys.exit(main(sys.argv))
