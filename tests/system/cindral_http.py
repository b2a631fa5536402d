"""A browser's part of HTTP, byte by byte, so that a test can also send what no browser would."""

import json
import os
import queue
import re
import socket
import subprocess
import threading
import urllib.parse

from cindral_rpc import Daemon, PATIENCE, PROGRAM, RpcError, SystemTest


class Response:
    """An answer as it came. `status` is None where the connection ended without one."""

    def __init__(self, status, fields, body):
        self.status = status
        self.fields = fields
        self.body = body

    def field(self, name):
        values = [value for each, value in self.fields if each == name.lower()]
        return values[0] if len(values) == 1 else None

    def json(self):
        return json.loads(self.body)


class RawConnection:
    """One connection, on which anything can be sent."""

    def __init__(self, port):
        self.socket = socket.create_connection(("127.0.0.1", port), timeout=PATIENCE)
        self.file = self.socket.makefile("rb")

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.close()

    def close(self):
        self.file.close()
        self.socket.close()

    def send(self, data):
        try:
            self.socket.sendall(data)
        except (BrokenPipeError, ConnectionResetError):
            pass  # What was answered before can still be read.

    def end_input(self):
        self.socket.shutdown(socket.SHUT_WR)

    def head(self):
        """Status and fields of the next answer."""
        try:
            line = self.file.readline()
        except ConnectionResetError:
            line = b""
        if not line:
            return None, []
        status = int(line.split()[1])
        fields = []
        while (line := self.file.readline().rstrip(b"\r\n")):
            name, _, value = line.decode("latin-1").partition(":")
            fields.append((name.lower(), value.strip()))
        return status, fields

    def response(self, has_body=True):
        status, fields = self.head()
        lengths = [int(value) for name, value in fields if name == "content-length"]
        if ("transfer-encoding", "chunked") in fields:
            return Response(status, fields, self.chunks())
        body = self.file.read(lengths[0]) if lengths and has_body else b""
        return Response(status, fields, body)

    def chunks(self):
        """A body in chunks; None where it ends before its end."""
        body = b""
        while (line := self.file.readline()):
            length = int(line, 16)
            chunk = self.file.read(length + 2)
            if len(chunk) < length + 2:
                return None
            if length == 0:
                return body
            body += chunk[:-2]
        return None

    def is_closed(self):
        """Waits for the other end to go."""
        try:
            return self.file.read() == b""
        except ConnectionResetError:
            return True


def request_bytes(method, target, fields, body=b""):
    """`fields` is a list of pairs, sent as they are."""
    lines = [f"{method} {target} HTTP/1.1".encode("latin-1")]
    lines += [f"{name}: {value}".encode("latin-1") for name, value in fields]
    return b"\r\n".join(lines) + b"\r\n\r\n" + body


class Events:
    """The stream of events of one page."""

    def __init__(self, browser, fields=None):
        self.raw = RawConnection(browser.port)
        self.raw.send(request_bytes("GET", "/events", fields or browser.read_fields()))
        self.status, self.fields = self.raw.head()
        self._messages = queue.Queue()
        self.name = None
        if self.status == 200:
            self._thread = threading.Thread(target=self._read)
            self._thread.start()
            self.name = self._messages.get(timeout=PATIENCE)

    def _read(self):
        try:
            for line in self.raw.file:
                if line.startswith(b"data: "):
                    self._messages.put(json.loads(line[6:]))
        except (OSError, ValueError):
            pass  # Closed.
        self._messages.put(None)

    def next(self, method=None):
        """The next notification, of the method where one is named; None at the end."""
        while (message := self._messages.get(timeout=PATIENCE)) is not None:
            if method is None or message["method"] == method:
                return message["params"]
        return None

    def close(self):
        try:
            self.raw.socket.shutdown(socket.SHUT_RDWR)
        except OSError:
            pass  # It is gone already.
        if self.status == 200:
            self._thread.join()
        self.raw.close()


class Browser:
    """One browser that knows the service's address, and its session once the link was traded."""

    def __init__(self, port):
        self.port = port
        self.host = f"127.0.0.1:{port}"
        self.origin = f"http://{self.host}"
        self.cookie = None
        self.token = None
        self.connection = None

    def read_fields(self):
        fields = [("Host", self.host), ("Sec-Fetch-Site", "same-origin")]
        if self.cookie:
            fields.append(("Cookie", self.cookie))
        return fields

    def write_fields(self):
        fields = self.read_fields() + [("Origin", self.origin)]
        if self.token:
            fields.append(("X-Cindral-Token", self.token))
        if self.connection:
            fields.append(("X-Cindral-Connection", self.connection))
        return fields

    def raw(self, data, has_body=True):
        with RawConnection(self.port) as connection:
            connection.send(data)
            return connection.response(has_body)

    def get(self, target, fields=None, method="GET"):
        return self.raw(request_bytes(method, target, self.read_fields() if fields is None else fields), method != "HEAD")

    def post(self, target, body=b"", fields=None, more=(), content_type="application/json"):
        given = self.write_fields() if fields is None else list(fields)
        given += [("Content-Type", content_type), ("Content-Length", str(len(body))), *more]
        return self.raw(request_bytes("POST", target, given, body))

    def trade(self, link):
        answer = self.post("/session", link.encode(), content_type="text/plain")
        if answer.status == 200:
            self.cookie = answer.field("set-cookie").split(";")[0]
            self.token = answer.json()["token"]
        return answer

    def rpc(self, method, **params):
        message = json.dumps({"jsonrpc": "2.0", "id": 1, "method": method, "params": params}).encode()
        answer = self.post("/rpc", message)
        if answer.status != 200:
            raise AssertionError(f"{answer.status}: {answer.body!r}")
        answer = answer.json()
        if "error" in answer:
            raise RpcError(answer["error"])
        return answer["result"]

    def items(self, container):
        items = []
        params = {"container": container}
        while True:
            page = self.rpc("enumerateItems", **params)
            items += page["items"]
            if page["nextPage"] is None:
                return items
            params = {"container": container, "page": page["nextPage"]}

    def named(self, container):
        return {item["filename"]: item for item in self.items(container)}

    def file(self, identifier, query="", more=()):
        return self.get("/file/" + urllib.parse.quote(identifier, safe="") + query, self.read_fields() + list(more))

    def archive(self, *identifiers):
        """What is to be saved of the items: the answer with the archive, or the one that refuses it."""
        asked = self.post("/archive", json.dumps({"identifiers": identifiers}).encode())
        return asked if asked.status != 200 else self.get("/archive/" + asked.json()["archive"])

    def upload(self, parent, name, body=b""):
        target = "/upload?" + urllib.parse.urlencode({"parent": parent, "name": name}, quote_via=urllib.parse.quote)
        return self.post(target, body, content_type="application/octet-stream")


class HttpDaemon(Daemon):
    """A daemon that lets browsers in."""

    def __init__(self, words, environment, **popen):
        read, write = os.pipe()
        try:
            super().__init__(["--http", *words], environment, stdout=write, **popen)
        finally:
            os.close(write)
        self._output = os.fdopen(read)
        self.printed = self._output.readline()
        found = re.search(r"http://127\.0\.0\.1:(\d+)/#([0-9a-f]{64})", self.printed)
        self.port = int(found.group(1)) if found else None
        self.link = found.group(2) if found else None


    def next_link(self):
        """The secret of the link that is printed next."""
        return re.search(r"#([0-9a-f]{64})", self._output.readline()).group(1)

    def status(self):
        status = super().status()
        self._output.close()
        return status


class HttpTest(SystemTest):
    """A daemon and a browser that it has let in."""

    def serve(self, *words):
        daemon = HttpDaemon([*self.options(), *words], self.environment)
        self.addCleanup(daemon.__exit__)
        self.assertTrue(daemon.is_serving, daemon.error_text())
        return daemon

    def browser(self, daemon):
        browser = Browser(daemon.port)
        self.assertEqual(browser.trade(daemon.link).status, 200)
        return browser

    def events(self, browser):
        events = Events(browser)
        self.addCleanup(events.close)
        browser.connection = events.name
        return events
