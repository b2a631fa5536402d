"""The document browser's HTTP: what it serves, and what is tried against it."""

import io
import json
import os
import re
import socket
import threading
import time
import unittest
import urllib.parse
import zipfile

from cindral_http import Browser, Events, HttpDaemon, HttpTest, RawConnection, request_bytes
from cindral_rpc import ROOT, PATIENCE, RpcError

# As HttpListener has it.
CONNECTIONS_MAX = 128


class ServingTest(HttpTest):
    def setUp(self):
        super().setUp()
        self.make_file("notes.txt", contents=b"0123456789")
        self.daemon_process = self.serve("--http-upload-max", "1000000")
        self.page = self.browser(self.daemon_process)

    def identifier(self, *names):
        container, item = ROOT, None
        for name in names:
            item = self.page.named(container)[name]
            container = item["identifier"]
        return item["identifier"]

    def test_the_page_is_there_for_everybody(self):
        answer = Browser(self.page.port).get("/")
        self.assertEqual((answer.status, answer.field("content-type")), (200, "text/html; charset=utf-8"))
        self.assertEqual(answer.field("x-content-type-options"), "nosniff")
        self.assertNotIn("unsafe", answer.field("content-security-policy"))
        self.assertIn("script-src 'self'", answer.field("content-security-policy"))

    def test_a_message_is_answered(self):
        self.assertEqual(self.page.rpc("itemForIdentifier", identifier=ROOT)["identifier"], ROOT)

    def test_a_batch_is_answered(self):
        messages = [{"jsonrpc": "2.0", "id": n, "method": "status", "params": {}} for n in range(3)]
        answer = self.page.post("/rpc", json.dumps(messages).encode()).json()
        self.assertEqual(sorted(each["id"] for each in answer), [0, 1, 2])

    def test_notifications_alone_are_answered_with_nothing(self):
        message = {"jsonrpc": "2.0", "method": "status", "params": {}}
        self.assertEqual(self.page.post("/rpc", json.dumps(message).encode()).status, 204)

    def test_several_requests_at_once_are_answered_in_order(self):
        reads = b"".join(request_bytes("GET", path, self.page.read_fields()) for path in ("/session", "/nowhere", "/session"))
        with RawConnection(self.page.port) as connection:
            connection.send(reads)
            self.assertEqual([connection.response().status for _ in range(3)], [200, 404, 200])

    def test_changes_are_signalled_to_the_page_that_monitors(self):
        events = self.events(self.page)
        self.page.rpc("startMonitoring", container=ROOT)
        self.make_file("new.txt")
        self.assertEqual(events.next("signal"), {"container": ROOT})

    def test_a_stream_is_its_own_sessions(self):
        events = self.events(self.page)
        other = self.browser_of_another_link()
        other.connection = events.name
        message = json.dumps({"jsonrpc": "2.0", "id": 1, "method": "status", "params": {}}).encode()
        self.assertEqual(other.post("/rpc", message).status, 409)

    def browser_of_another_link(self):
        other = Browser(self.page.port)
        self.assertEqual(other.trade(self.daemon_process.next_link()).status, 200)
        return other

    def test_another_link_is_printed_when_one_was_used(self):
        self.assertEqual(self.browser_of_another_link().get("/session").status, 200)
        self.assertEqual(self.page.get("/session").status, 200, "the first browser stays")

    # MARK: Documents

    def test_a_document_is_sent(self):
        answer = self.page.file(self.identifier("notes.txt"))
        self.assertEqual((answer.status, answer.body), (200, b"0123456789"))
        self.assertEqual(answer.field("content-type"), "text/plain; charset=utf-8")
        self.assertTrue(answer.field("content-disposition").startswith("inline"))

    def test_ranges_are_sent(self):
        identifier = self.identifier("notes.txt")
        for asked, status, body, said in (
                ("bytes=2-4", 206, b"234", "bytes 2-4/10"), ("bytes=7-", 206, b"789", "bytes 7-9/10"),
                ("bytes=-3", 206, b"789", "bytes 7-9/10"), ("bytes=0-999", 200, b"0123456789", None),
                ("bytes=4-2", 200, b"0123456789", None), ("bytes=-1,2-3", 200, b"0123456789", None),
                ("lines=1-2", 200, b"0123456789", None)):
            with self.subTest(asked):
                answer = self.page.file(identifier, more=[("Range", asked)])
                self.assertEqual((answer.status, answer.body, answer.field("content-range")), (status, body, said))
        for asked in ("bytes=10-", "bytes=-0", "bytes=99-100"):
            with self.subTest(asked):
                self.assertEqual(self.page.file(identifier, more=[("Range", asked)]).status, 416)

    def test_the_head_alone_is_sent(self):
        answer = self.page.get("/file/" + urllib.parse.quote(self.identifier("notes.txt")), method="HEAD")
        self.assertEqual((answer.status, answer.field("content-length"), answer.body), (200, "10", b""))

    def test_a_folder_is_no_document(self):
        os.mkdir(self.path("folder"))
        self.assertEqual(self.page.file(self.identifier("folder")).status, 415)

    def test_nothing_that_waits_is_opened(self):
        os.mkfifo(self.path("pipe"))
        with socket.socket(socket.AF_UNIX) as bound:
            bound.bind(self.path("sock"))
            for name in ("pipe", "sock"):
                with self.subTest(name):
                    self.assertEqual(self.page.file(self.identifier(name)).status, 403)

    # Bytes of another kind are what a browser would make something else of.
    def test_what_a_browser_would_run_is_to_be_saved(self):
        markup = b"<script>alert(1)</script>"
        for name in ("page.html", "page.xhtml", "page.xml", "picture.svg", "page.htm", "script.js", "style.css", "mail.mht"):
            self.make_file(name, contents=markup)
            with self.subTest(name):
                answer = self.page.file(self.identifier(name))
                self.assertTrue(answer.field("content-disposition").startswith("attachment;"))
                self.assertIn(answer.field("content-type"), ("application/octet-stream", "image/svg+xml"))
                self.assert_walled_off(answer)

    def test_what_a_browser_shows_is_walled_off(self):
        markup = b"<script>alert(1)</script>"
        for name in ("readme.md", "notes.txt", "picture.png", "data.json", "noextension"):
            self.make_file(name, contents=markup)
            with self.subTest(name):
                answer = self.page.file(self.identifier(name))
                self.assertNotIn("html", answer.field("content-type"))
                self.assert_walled_off(answer)

    def assert_walled_off(self, answer):
        policy = answer.field("content-security-policy")
        self.assertTrue(policy.startswith("sandbox;"), policy)
        self.assertNotIn("allow-", policy)
        self.assertIn("default-src 'none'", policy)
        self.assertEqual(answer.field("x-content-type-options"), "nosniff")
        self.assertEqual(answer.field("cross-origin-resource-policy"), "same-origin")

    def test_script_in_names_stays_a_name(self):
        name = "\"><script>alert(1)<\\script>\r\nSet-Cookie: a=b;'.txt"
        self.make_file(name, contents=b"x")
        found = self.identifier(name)
        answer = self.page.file(found)
        self.assertEqual(answer.status, 200)
        self.assertIsNone(answer.field("set-cookie"))
        self.assertEqual(answer.field("content-disposition"), "inline; filename*=UTF-8''" + urllib.parse.quote(name, safe=""))

    # MARK: Archives

    def archived(self, *identifiers):
        answer = self.page.archive(*identifiers)
        self.assertEqual((answer.status, answer.field("content-type")), (200, "application/zip"))
        self.assert_walled_off(answer)
        archive = zipfile.ZipFile(io.BytesIO(answer.body))
        self.addCleanup(archive.close)
        self.assertIsNone(archive.testzip())
        return archive

    def test_a_folder_is_an_archive_of_all_that_is_in_it(self):
        self.make_file("Album", "Deep", "leaf ä.txt", contents=b"leaf")
        self.make_file("Album", "picture.png", contents=os.urandom(300_000))
        self.make_file("Album", "run.sh", contents=b"#!/bin/sh\n" * 9999)
        os.chmod(self.path("Album", "run.sh"), 0o755)
        os.utime(self.path("Album", "run.sh"), (1_000_000_000, 1_000_000_000))
        os.mkdir(self.path("Album", "Empty"))
        archive = self.archived(self.identifier("Album"))
        self.assertEqual(sorted(archive.namelist()), ["Album/", "Album/Deep/", "Album/Deep/leaf ä.txt", "Album/Empty/", "Album/picture.png", "Album/run.sh"])
        for name in ("Album/Deep/leaf ä.txt", "Album/picture.png", "Album/run.sh"):
            with open(self.path(name), "rb") as file:
                self.assertEqual(archive.read(name), file.read())
        script = archive.getinfo("Album/run.sh")
        self.assertEqual(script.external_attr >> 16, 0o100755)
        self.assertLess(script.compress_size, script.file_size / 10)
        self.assertEqual(archive.getinfo("Album/picture.png").external_attr >> 16, 0o100644)
        self.assertEqual(script.date_time, time.localtime(1_000_000_000)[:6], "of the zone in which both work")

    def test_several_items_are_one_archive_and_equal_names_stay_apart(self):
        self.make_file("a", "same.txt", contents=b"1")
        self.make_file("b", "same.txt", contents=b"2")
        self.make_file("b", "Same", "x", contents=b"3")
        archive = self.archived(self.identifier("a", "same.txt"), self.identifier("b", "same.txt"), self.identifier("b"))
        self.assertEqual(archive.namelist(), ["same.txt", "same 2.txt", *archive.namelist()[2:]])
        self.assertEqual((archive.read("same.txt"), archive.read("same 2.txt"), archive.read("b/Same/x")), (b"1", b"2", b"3"))

    def test_an_archive_says_what_it_leaves_out(self):
        os.mkdir(self.path("Mixed"))
        os.mkfifo(self.path("Mixed", "pipe"))
        os.symlink("/etc/passwd", self.path("Mixed", "link"))
        os.symlink("/etc", self.path("Mixed", "door"))
        self.make_file("Mixed", "plain.txt", contents=b"x")
        archive = self.archived(self.identifier("Mixed"))
        self.assertEqual(sorted(archive.namelist()), ["Left out.txt", "Mixed/", "Mixed/plain.txt"])
        text = archive.read("Left out.txt").decode()
        for name in ("pipe", "link", "door"):
            self.assertIn(f"Mixed/{name}\n", text)

    def test_names_of_an_archive_lead_nowhere_and_stay_names(self):
        folder = self.path("Names").encode()
        os.mkdir(folder)
        for name in (b"..\\..\\escape.txt", b"bad \xff.txt", b"new\nline", "Größe".encode()):
            with open(os.path.join(folder, name), "wb") as file:
                file.write(name)
        answer = self.page.archive(self.identifier("Names"))
        archive = zipfile.ZipFile(io.BytesIO(answer.body))
        self.addCleanup(archive.close)
        names = sorted(archive.namelist())
        self.assertEqual(names, sorted(["Names/", "Names/..\uff3c..\uff3cescape.txt", b"Names/bad \xff.txt".decode("cp437"), "Names/new\nline", "Names/Größe"]))

    def test_an_archive_that_can_not_be_is_refused(self):
        for message in (b"", b"{}", b"[]", b'{"identifiers":[]}', b'{"identifiers":[1]}', b'{"identifiers":"did=1"}',
                        json.dumps({"identifiers": [ROOT]}).encode()):
            with self.subTest(message):
                self.assertEqual(self.page.post("/archive", message).status, 400)
        self.assertEqual(self.page.archive("did=99999").status, 404)
        self.assertEqual(self.page.post("/archive", b"{}", content_type="text/plain").status, 415)

    def test_an_archive_is_had_once_and_by_who_asked(self):
        message = json.dumps({"identifiers": [self.identifier("notes.txt")]}).encode()
        name = self.page.post("/archive", message).json()["archive"]
        self.assertEqual(self.browser_of_another_link().get("/archive/" + name).status, 404)
        self.assertEqual(self.page.get("/archive/" + name, method="HEAD").status, 204)
        self.assertEqual(self.page.get("/archive/" + name).status, 200)
        self.assertEqual(self.page.get("/archive/" + name).status, 404)
        # Those that nobody fetches are not kept for ever.
        names = [self.page.post("/archive", message).json()["archive"] for _ in range(17)]
        self.assertEqual([self.page.get("/archive/" + each).status for each in (names[0], names[1], names[16])], [404, 200, 200])

    def test_an_archive_that_is_broken_off_has_no_end(self):
        with open(self.path("big.bin"), "wb") as file:
            file.truncate(20_000_000_000)
        message = json.dumps({"identifiers": [self.identifier("big.bin")]}).encode()
        name = self.page.post("/archive", message).json()["archive"]
        with RawConnection(self.page.port) as connection:
            connection.send(request_bytes("GET", "/archive/" + name, self.page.read_fields()))
            self.assertEqual(connection.head()[0], 200)
            self.assertEqual(self.daemon_process.stop(), 0)
            self.assertIsNone(connection.chunks())

    # MARK: Uploads

    def temporary_files(self):
        folder = self.path(".TemporaryLocalFolder")
        return [name for _, folders, files in os.walk(folder) for name in (*folders, *files)]

    def test_a_document_is_received(self):
        answer = self.page.upload(ROOT, "letter.txt", b"dear")
        self.assertEqual(answer.json()["result"]["filename"], "letter.txt")
        with open(self.path("letter.txt"), "rb") as file:
            self.assertEqual(file.read(), b"dear")
        self.assertEqual(os.stat(self.path("letter.txt")).st_mode & 0o777, 0o600)
        self.assertEqual(self.temporary_files(), [])

    def test_a_document_is_received_in_chunks(self):
        head = request_bytes("POST", "/upload?parent=" + ROOT + "&name=a.txt", [*self.page.write_fields(), ("Transfer-Encoding", "chunked")])
        self.assertEqual(self.page.raw(head + b"3\r\nabc\r\n2\r\nde\r\n0\r\n\r\n").status, 200)
        with open(self.path("a.txt"), "rb") as file:
            self.assertEqual(file.read(), b"abcde")

    def test_a_name_that_is_taken_is_said_and_nothing_is_lost(self):
        answer = self.page.upload(ROOT, "notes.txt", b"other").json()["error"]
        self.assertEqual((answer["data"]["domain"], answer["data"]["code"]), ("TesselErrorDomain", -1003))
        self.assertEqual(answer["data"]["item"]["filename"], "notes.txt")
        with open(self.path("notes.txt"), "rb") as file:
            self.assertEqual(file.read(), b"0123456789")
        self.assertEqual(self.temporary_files(), [])

    def test_a_name_is_one_name(self):
        for name in ("../escape", "a/b", "/tmp/x", "..", ".", "", "a\0b", "..\\x/.."):
            with self.subTest(name):
                self.assertIn("error", self.page.upload(ROOT, name, b"x").json())
        self.assertEqual(sorted(os.listdir(self.folder)), ["Documents", "state"])
        self.assertEqual(self.temporary_files(), [])

    def test_an_upload_that_breaks_off_leaves_nothing_behind(self):
        with RawConnection(self.page.port) as connection:
            fields = [*self.page.write_fields(), ("Content-Length", "500000")]
            connection.send(request_bytes("POST", "/upload?parent=" + ROOT + "&name=half.txt", fields, b"x" * 1000))
            connection.end_input()
            self.assertEqual(connection.response().status, 408)
        self.assertEqual(self.temporary_files(), [])
        self.assertFalse(os.path.exists(self.path("half.txt")))

    def test_an_upload_beyond_the_limit_leaves_nothing_behind(self):
        self.assertEqual(self.page.upload(ROOT, "big", b"x" * 1_000_001).status, 413)
        fields = [*self.page.write_fields(), ("Transfer-Encoding", "chunked")]
        head = request_bytes("POST", "/upload?parent=" + ROOT + "&name=big", fields)
        with RawConnection(self.page.port) as connection:
            connection.send(head)
            sender = threading.Thread(target=self.send_endlessly, args=(connection,))
            sender.start()
            self.assertEqual(connection.response().status, 413)
            sender.join()
        self.assertEqual(self.temporary_files(), [])
        self.assertFalse(os.path.exists(self.path("big")))

    @staticmethod
    def send_endlessly(connection):
        try:
            while True:
                connection.socket.sendall(b"10000\r\n" + b"x" * 0x10000 + b"\r\n")
        except OSError:
            pass  # That is what ends it.


class AttackTest(HttpTest):
    @classmethod
    def setUpClass(cls):
        super().setUpClass()
        # One service for all: what is tried must leave it as it was.
        cls.holder = HttpTest()
        cls.holder.setUp()
        cls.addClassCleanup(cls.holder.doCleanups)
        cls.holder.make_file("secret.txt", contents=b"the secret")
        cls.daemon_process = cls.holder.serve()
        cls.page = cls.holder.browser(cls.daemon_process)
        cls.message = json.dumps({"jsonrpc": "2.0", "id": 1, "method": "status", "params": {}}).encode()

    def tearDown(self):
        self.assertEqual(self.page.get("/session").status, 200, "the service works on")

    def storage_path(self, *names):
        return self.holder.path(*names)

    def replaced(self, fields, name, value):
        return [(each, value if each == name else old) for each, old in fields]

    # MARK: Host

    def test_a_host_that_is_not_ours_is_refused(self):
        port = self.page.port
        for host in (f"evil.example:{port}", f"127.0.0.1.evil.example:{port}", f"127.0.0.1.:{port}", f"localhost.:{port}",
                     "127.0.0.1", "localhost", f"127.0.0.1:{port}:80", f"127.0.0.1:{port + 1}", f"[::1]:{port}",
                     f"127.1:{port}", f"0.0.0.0:{port}", f"2130706433:{port}", f"127.0.0.1:{port}, evil.example",
                     f"evil.example@127.0.0.1:{port}", f"127.0.0.1:0{port}", ""):
            for target in ("/", "/session", "/events", "/file/did=1"):
                with self.subTest(host=host, target=target):
                    fields = self.replaced(self.page.read_fields(), "Host", host)
                    self.assertEqual(self.page.get(target, fields).status, 421)

    def test_a_host_that_is_missing_or_doubled_is_refused(self):
        fields = self.page.read_fields()
        self.assertEqual(self.page.get("/session", fields[1:]).status, 421)
        self.assertEqual(self.page.get("/session", [fields[0], *fields]).status, 421)
        self.assertEqual(self.page.get("/session", [("Host", "evil.example"), *fields]).status, 421)

    def test_a_target_that_names_a_host_is_refused(self):
        for target in ("http://evil.example/session", f"http://127.0.0.1:{self.page.port}/session", "evil.example:80", "*"):
            with self.subTest(target):
                self.assertEqual(self.page.get(target).status, 400)

    # MARK: Other sites

    def test_a_form_of_another_site_is_refused(self):
        for origin in ("http://evil.example", "null", f"http://127.0.0.1:{self.page.port + 1}", f"https://{self.page.host}",
                       f"http://localhost:{self.page.port}", f"http://{self.page.host}.evil.example", ""):
            with self.subTest(origin):
                fields = self.replaced(self.page.write_fields(), "Origin", origin)
                self.assertEqual(self.page.post("/rpc", self.message, fields).status, 403)
                self.assertEqual(self.page.post("/logout", b"", fields).status, 403)
                self.assertEqual(self.page.post("/upload?parent=" + ROOT + "&name=x", b"", fields).status, 403)
                self.assertEqual(self.page.post("/archive", self.message, fields).status, 403)

    def test_a_write_without_an_origin_is_refused(self):
        fields = [field for field in self.page.write_fields() if field[0] != "Origin"]
        self.assertEqual(self.page.post("/rpc", self.message, fields).status, 403)
        doubled = [*self.page.write_fields(), ("Origin", self.page.origin)]
        self.assertEqual(self.page.post("/rpc", self.message, doubled).status, 403)

    def test_a_write_without_the_token_is_refused(self):
        fields = [field for field in self.page.write_fields() if field[0] != "X-Cindral-Token"]
        for more in ([], [("X-Cindral-Token", "")], [("X-Cindral-Token", "0" * 64)], [("X-Cindral-Token", self.page.token)] * 2):
            with self.subTest(more):
                self.assertEqual(self.page.post("/rpc", self.message, [*fields, *more]).status, 403)

    def test_a_message_of_a_form_is_refused(self):
        for content_type in ("text/plain", "application/x-www-form-urlencoded", "multipart/form-data; boundary=x"):
            with self.subTest(content_type):
                self.assertEqual(self.page.post("/rpc", self.message, content_type=content_type).status, 415)

    def test_what_another_site_fetches_is_refused(self):
        for site in ("cross-site", "same-site", "unknown"):
            fields = self.replaced(self.page.read_fields(), "Sec-Fetch-Site", site)
            for target in ("/session", "/events", "/file/did=1", "/thumbnail/did=1", "/archive/x"):
                with self.subTest(site=site, target=target):
                    self.assertEqual(self.page.get(target, fields).status, 403)

    def test_a_stream_of_another_origin_is_refused(self):
        events = Events(self.page, [*self.page.read_fields(), ("Origin", "http://evil.example")])
        self.addCleanup(events.close)
        self.assertEqual(events.status, 403)

    def test_no_answer_is_for_another_origin(self):
        for fields in (self.page.read_fields(), [*self.page.read_fields(), ("Origin", "http://evil.example")]):
            for target in ("/", "/session", "/nowhere"):
                answer = self.page.get(target, fields)
                self.assertEqual([name for name, _ in answer.fields if name.startswith("access-control-")], [])
        asked = [*self.page.read_fields(), ("Origin", "http://evil.example"), ("Access-Control-Request-Method", "POST")]
        answer = self.page.get("/rpc", asked, method="OPTIONS")
        self.assertEqual((answer.status, answer.field("access-control-allow-origin")), (405, None))

    def test_nobody_may_frame_the_page(self):
        self.assertIn("frame-ancestors 'none'", self.page.get("/").field("content-security-policy"))

    # MARK: Sessions

    def test_a_link_is_good_once(self):
        self.assertEqual(Browser(self.page.port).trade(self.daemon_process.link).status, 401)

    def test_a_link_is_not_guessed(self):
        for link in ("", "0" * 64, self.daemon_process.link[:-1], self.daemon_process.link + "0", "x" * 1000):
            with self.subTest(link[:70]):
                self.assertEqual(Browser(self.page.port).trade(link).status, 401)
        self.assertEqual(Browser(self.page.port).trade("x" * 5000).status, 413)

    def test_nothing_is_to_be_had_without_a_session(self):
        stranger = Browser(self.page.port)
        for cookie in (None, "", f"cindral-{self.page.port}=", f"cindral-{self.page.port}=" + "0" * 64, "cindral=1"):
            stranger.cookie = cookie
            for target in ("/session", "/events", "/file/did=1", "/thumbnail/did=1", "/archive/x"):
                with self.subTest(cookie=cookie, target=target):
                    self.assertEqual(stranger.get(target).status, 401)
            for target in ("/rpc", "/logout", "/archive", "/upload?parent=" + ROOT + "&name=x"):
                with self.subTest(cookie=cookie, target=target):
                    self.assertEqual(stranger.post(target, self.message).status, 401)

    def test_the_cookie_is_for_the_browser_alone(self):
        daemon = HttpDaemon(self.options(), self.environment)
        self.addCleanup(daemon.__exit__)
        answer = Browser(daemon.port).trade(daemon.link)
        attributes = [part.strip() for part in answer.field("set-cookie").split(";")[1:]]
        self.assertEqual(sorted(attributes), ["HttpOnly", "Path=/", "SameSite=Strict"])
        self.assertEqual(answer.field("cache-control"), "no-store")

    def test_a_session_ends_with_logging_out_and_with_the_process(self):
        daemon = HttpDaemon(self.options(), self.environment)
        self.addCleanup(daemon.__exit__)
        page = self.browser(daemon)
        events = self.events(page)
        self.assertEqual(page.post("/logout").status, 204)
        self.assertIsNone(events.next(), "the stream ends too")
        self.assertEqual(page.get("/session").status, 401)
        self.assertEqual(page.post("/rpc", self.message).status, 401)

        self.assertEqual(daemon.stop(), 0)
        again = HttpDaemon([*self.options(), "--http-port", str(daemon.port)], self.environment)
        self.addCleanup(again.__exit__)
        self.assertEqual(again.port, daemon.port)
        self.assertEqual(page.get("/session").status, 401)
        self.assertEqual(page.trade(daemon.link).status, 401, "nor is an old link good")
        self.assertEqual(self.browser(again).get("/session").status, 200)

    def test_secrets_are_never_logged(self):
        self.environment["CINDRAL_LOG"] = "debug"
        daemon = HttpDaemon(self.options(), self.environment)
        self.addCleanup(daemon.__exit__)
        page = self.browser(daemon)
        page.rpc("status")
        page.raw(b"GARBAGE " + page.token.encode() + b"\r\n\r\n")
        page.raw(request_bytes("GET", "/?" + page.token, []))
        page.trade(daemon.link)
        self.assertEqual(daemon.stop(), 0)
        for secret in (daemon.link, page.token, page.cookie.split("=")[1]):
            self.assertNotIn(secret, daemon.error_text())

    # MARK: Paths

    def test_no_way_of_writing_a_path_leads_anywhere(self):
        for path in ("../secret", "..%2fsecret", "%2e%2e/%2e%2e/etc/passwd", "%252e%252e%252fetc%252fpasswd", "..%5c..%5cetc",
                     "/etc/passwd", "//etc/passwd", "%2fetc%2fpasswd", "secret.txt", "./secret.txt", "did=1/../secret.txt",
                     "did=1%2f..%2fsecret.txt", "..%c0%afetc", "%c0%ae%c0%ae/etc", "did=1%00", "%00", "did=1%0d%0aSet-Cookie:%20a",
                     "did=99999", "fid=0", "did=-1", "did=18446744073709551616", "did=", "", "#nobody", "%23..%2f..",
                     "file:%2f%2f%2fetc%2fpasswd", "..;/..;/etc/passwd", "TesselTemporaryLocalFolderItemIdentifier%2f..",
                     self.storage_path("secret.txt"), urllib.parse.quote(self.storage_path("secret.txt"), safe="")):
            self.assertIn(self.page.archive(urllib.parse.unquote(path, errors="replace")).status, (400, 404))
            for route in ("/file/", "/thumbnail/", "/archive/"):
                if route == "/thumbnail/" and path.startswith("#"):
                    continue
                with self.subTest(route=route, path=path):
                    answer = self.page.get(route + path)
                    self.assertIn(answer.status, (400, 404, 415))
                    self.assertNotIn(b"secret\n", answer.body)
                    self.assertIsNone(answer.field("set-cookie"))
        for path in ("%zz", "%2", "%"):
            self.assertEqual(self.page.get("/file/" + path).status, 400)
        for path in ("/../secret.txt", "/assets/../../secret.txt", "/%2e%2e/secret.txt", "//", "/index.html/..", "/file", "/file/../session"):
            with self.subTest(path):
                self.assertIn(self.page.get(path).status, (404,))

    def test_methods_that_take_paths_are_not_to_be_had(self):
        with self.assertRaises(RpcError) as raised:
            self.page.rpc("importDocument", path="/etc/passwd", parent=ROOT)
        self.assertEqual(raised.exception.code, -32601)
        with self.assertRaises(RpcError) as raised:
            self.page.rpc("identifierForItemAtURL", path="/etc/passwd")
        self.assertEqual(raised.exception.code, -32601)

    def test_no_browser_lets_another_one_in(self):
        with self.assertRaises(RpcError) as raised:
            self.page.rpc("makeLink")
        self.assertEqual(raised.exception.code, -32601)

    def test_identifiers_of_what_is_not_published_are_nobodys(self):
        beside = self.holder.storage + "-of-others"
        os.mkdir(beside)
        with open(os.path.join(beside, "secret"), "w", encoding="utf-8") as file:
            file.write("secret\n")
        for path in (beside, os.path.join(beside, "secret"), "/etc/passwd", self.holder.state):
            number = os.stat(path).st_ino
            with self.subTest(path):
                self.assertIn(self.page.file(f"fid={number}").status, (404, 403))
                self.assertIn(self.page.archive(f"fid={number}").status, (404, 403))
                with self.assertRaises(RpcError):
                    self.page.rpc("copyItem", identifier=f"fid={number}", parent=ROOT)
                self.assertIn("error", self.page.upload(f"fid={number}", "x", b"x").json())
        self.assertEqual(os.listdir(beside), ["secret"])

    def test_links_out_of_the_tree_lead_nowhere(self):
        outside = os.path.join(self.holder.folder, "outside")
        os.makedirs(outside, exist_ok=True)
        with open(os.path.join(outside, "secret"), "w", encoding="utf-8") as file:
            file.write("secret\n")
        os.symlink(os.path.join(outside, "secret"), self.storage_path("leaf"))
        os.symlink(outside, self.storage_path("door"))
        os.symlink(os.path.join(outside, "not-yet"), self.storage_path("dangling"))
        self.addCleanup(lambda: [os.unlink(self.storage_path(name)) for name in ("leaf", "door", "dangling")])
        for name in ("leaf", "door", "dangling"):
            item = self.page.named(ROOT)[name]["identifier"]
            with self.subTest(name):
                self.assertIn(self.page.file(item).status, (403, 404, 415))
                self.assertNotIn(b"secret\n", self.page.archive(item).body)
                self.assertIn("error", self.page.upload(item, "x", b"x").json())
                with self.assertRaises(RpcError):
                    self.page.rpc("createDirectory", name="x", parent=item)
                self.assertEqual(self.page.get("/thumbnail/" + urllib.parse.quote(item)).status, 404)
        # A copy of a link is a link.
        copied = self.page.rpc("copyItem", identifier=self.page.named(ROOT)["leaf"]["identifier"], parent=ROOT, name="copied")
        self.addCleanup(os.unlink, self.storage_path("copied"))
        self.assertTrue(os.path.islink(self.storage_path("copied")), copied)
        # A name that is taken by a link is taken.
        self.assertIn("error", self.page.upload(ROOT, "dangling", b"x").json())
        self.assertEqual(os.listdir(outside), ["secret"])

    def test_a_folder_swapped_for_a_link_leads_nowhere(self):
        os.mkdir(self.storage_path("swapped"))
        outside = os.path.join(self.holder.folder, "swap-target")
        os.makedirs(outside, exist_ok=True)
        with open(os.path.join(outside, "secret.txt"), "w", encoding="utf-8") as file:
            file.write("another secret\n")
        with open(self.storage_path("swapped", "secret.txt"), "w", encoding="utf-8") as file:
            file.write("inside\n")
        folder = self.page.named(ROOT)["swapped"]["identifier"]
        document = self.page.named(folder)["secret.txt"]["identifier"]
        os.rename(self.storage_path("swapped"), self.storage_path("aside"))
        os.symlink(outside, self.storage_path("swapped"))
        self.addCleanup(os.unlink, self.storage_path("swapped"))
        answer = self.page.file(document)
        self.assertEqual((answer.status, answer.body), (200, b"inside\n"), "it is followed to where it went")
        archive = zipfile.ZipFile(io.BytesIO(self.page.archive(folder).body))
        self.addCleanup(archive.close)
        self.assertEqual([archive.read(name) for name in archive.namelist() if name.endswith("secret.txt")], [b"inside\n"])
        self.page.upload(folder, "put.txt", b"x")
        self.assertEqual(os.listdir(outside), ["secret.txt"])

    # MARK: Bytes

    def test_lengths_that_are_none_are_refused(self):
        for length in ("-1", "abc", "1e3", "0x10", "+5", "18446744073709551616", "5, 5", "5 5", "99999999999999999999999"):
            with self.subTest(length):
                fields = [*self.page.write_fields(), ("Content-Type", "application/json"), ("Content-Length", length)]
                self.assertEqual(self.page.raw(request_bytes("POST", "/rpc", fields, self.message)).status, 400)

    def test_two_lengths_or_a_length_and_chunks_are_refused(self):
        fields = [*self.page.write_fields(), ("Content-Type", "application/json")]
        for more in ([("Content-Length", "5"), ("Content-Length", "6")], [("Content-Length", "5"), ("Transfer-Encoding", "chunked")],
                     [("Transfer-Encoding", "chunked"), ("Content-Length", "5")], [("Transfer-Encoding", "gzip")],
                     [("Transfer-Encoding", "chunked"), ("Transfer-Encoding", "identity")]):
            with self.subTest(more):
                self.assertEqual(self.page.raw(request_bytes("POST", "/rpc", [*fields, *more], b"0\r\n\r\n")).status, 400)

    def test_a_length_that_promises_more_than_comes_is_refused(self):
        fields = [*self.page.write_fields(), ("Content-Type", "application/json"), ("Content-Length", "1000")]
        with RawConnection(self.page.port) as connection:
            connection.send(request_bytes("POST", "/rpc", fields, self.message))
            connection.end_input()
            self.assertEqual(connection.response().status, 408)

    def test_a_length_that_promises_less_than_comes_ends_there(self):
        fields = [*self.page.write_fields(), ("Content-Type", "application/json"), ("Content-Length", str(len(self.message)))]
        with RawConnection(self.page.port) as connection:
            connection.send(request_bytes("POST", "/rpc", fields, self.message + b"smuggled / HTTP/9\r\n\r\n"))
            self.assertEqual(connection.response().status, 200)
            self.assertEqual(connection.response().status, 400, "the rest is the next request, and none")
            self.assertTrue(connection.is_closed())

    def test_chunks_that_are_none_are_refused(self):
        fields = [*self.page.write_fields(), ("Content-Type", "application/json"), ("Transfer-Encoding", "chunked")]
        for body in (b"-2\r\nab\r\n0\r\n\r\n", b"zz\r\n", b"ffffffffffffffffff\r\nab", b"2\r\nabc\r\n0\r\n\r\n", b"\r\n\r\n"):
            with self.subTest(body):
                self.assertEqual(self.page.raw(request_bytes("POST", "/rpc", fields, body)).status, 400)

    def test_chunks_without_end_are_refused(self):
        fields = [*self.page.write_fields(), ("Content-Type", "application/json"), ("Transfer-Encoding", "chunked")]
        with RawConnection(self.page.port) as connection:
            connection.send(request_bytes("POST", "/rpc", fields))
            sender = threading.Thread(target=ServingTest.send_endlessly, args=(connection,))
            sender.start()
            self.assertEqual(connection.response().status, 413)
            sender.join()

    def test_a_message_that_is_too_long_is_refused(self):
        self.assertEqual(self.page.post("/rpc", b"[" + b" " * (4 << 20) + b"]").status, 413)

    def test_floods_of_fields_are_refused(self):
        many = [*self.page.read_fields(), *((f"X-{number}", "x") for number in range(5000))]
        self.assertEqual(self.page.get("/session", many).status, 431)
        self.assertEqual(self.page.get("/session", [*self.page.read_fields(), ("X-Long", "x" * 100_000)]).status, 431)
        self.assertEqual(self.page.get("/" + "x" * 100_000).status, 431)
        with RawConnection(self.page.port) as connection:
            connection.send(b"GET / HTTP/1.1\r\n" + b"X: y\r\n" * 100_000)
            self.assertEqual(connection.response().status, 431)

    def test_what_is_no_http_is_refused(self):
        for data in (b"\x16\x03\x01\x02\x00\x01\x00\x01\xfc\x03\x03" + bytes(50), b"\r\n\r\n\r\nGARBAGE\r\n\r\n", b"GET / HTTP/0.9\r\n\r\n",
                     b"GET / HTTP/1.0\r\nHost: " + self.page.host.encode() + b"\r\n\r\n", b"GET / HTTP/2.0\r\n\r\n",
                     b"PRI * HTTP/2.0\r\n\r\nSM\r\n\r\n", b"GET  / HTTP/1.1\r\n\r\n", b"GET / HTTP/1.1\r\nHost : x\r\n\r\n",
                     b"GET / HTTP/1.1\r\n: x\r\n\r\n", b"GET /\0 HTTP/1.1\r\n\r\n", b"G\xc3T / HTTP/1.1\r\n\r\n"):
            with self.subTest(data[:40]):
                self.assertEqual(self.page.raw(data).status, 400)

    def test_unknown_methods_do_nothing(self):
        for method in ("PUT", "DELETE", "PATCH", "TRACE", "CONNECT", "PROPFIND", "get"):
            with self.subTest(method):
                self.assertIn(self.page.get("/session", method=method).status, (400, 405))

    def test_slow_clients_keep_nobody_out(self):
        slow = []
        self.addCleanup(lambda: [each.close() for each in slow])
        for number in range(CONNECTIONS_MAX + 20):
            connection = RawConnection(self.page.port)
            slow.append(connection)
            if number % 2:
                connection.send(b"GET / HTTP/1.1\r\nX-Slow: ")
        self.assertEqual(self.page.get("/session").status, 200)
        for connection in slow[:20]:
            self.assertTrue(connection.is_closed(), "who came first goes first")

    def test_a_client_that_reads_nothing_keeps_nobody_waiting(self):
        with open(self.storage_path("big"), "wb") as file:
            file.truncate(1 << 28)
        identifier = urllib.parse.quote(self.page.named(ROOT)["big"]["identifier"])
        with RawConnection(self.page.port) as connection:
            connection.send(request_bytes("GET", "/file/" + identifier, self.page.read_fields()))
            self.assertEqual(self.page.get("/session").status, 200)

    def test_the_service_is_on_this_machine_alone(self):
        with socket.socket() as other:
            other.bind(("0.0.0.0", 0))
        with open("/proc/net/tcp", encoding="ascii") as table:
            listening = [line.split()[1] for line in table if line.split()[3] == "0A"]
        self.assertIn(f"0100007F:{self.page.port:04X}", listening)
        self.assertNotIn(f"00000000:{self.page.port:04X}", listening)


class OptionsTest(HttpTest):
    def test_nobody_is_served_unasked(self):
        daemon = self.daemon()
        inodes = set()
        for number in os.listdir(f"/proc/{daemon.process.pid}/fd"):
            target = os.readlink(f"/proc/{daemon.process.pid}/fd/{number}")
            if target.startswith("socket:["):
                inodes.add(target[8:-1])
        for table in ("/proc/net/tcp", "/proc/net/tcp6"):
            if os.path.exists(table):
                with open(table, encoding="ascii") as lines:
                    self.assertEqual([line for line in lines if line.split()[9] in inodes], [])

    def test_a_port_that_is_taken_is_said(self):
        with socket.socket() as taken:
            taken.bind(("127.0.0.1", 0))
            taken.listen()
            port = taken.getsockname()[1]
            status, output, errors = self.run_program("serve", "--http-port", str(port))
        self.assertEqual((status, output), (1, b""))
        self.assertIn(f"can't listen at port {port}: Address already in use", errors.decode())

    def test_the_link_is_json_where_that_is_asked_for(self):
        daemon = self.serve("--json")
        self.assertEqual(json.loads(daemon.printed), {"url": f"http://127.0.0.1:{daemon.port}/#{daemon.link}"})

    def link_beside(self, *words):
        status, output, errors = self.run_program("link", *words)
        self.assertEqual((status, errors), (0, b""))
        found = re.fullmatch(r"Your documents, for one browser: http://127\.0\.0\.1:(\d+)/#([0-9a-f]{64})\n", output.decode())
        self.assertIsNotNone(found, output)
        return int(found.group(1)), found.group(2)

    def test_a_daemon_that_runs_lets_a_browser_in_when_asked(self):
        daemon = self.serve()
        port, link = self.link_beside()
        self.assertEqual(port, daemon.port)
        self.assertNotEqual(link, daemon.link)
        for each in (link, daemon.link):
            self.assertEqual(Browser(port).trade(each).status, 200, "both are good")
            self.assertEqual(Browser(port).trade(each).status, 401, "once")

    def test_a_daemon_that_lets_nobody_in_does_when_asked(self):
        daemon = self.daemon()
        port, link = self.link_beside()
        page = Browser(port)
        self.assertEqual(page.trade(link).status, 200)
        self.assertEqual(page.rpc("itemForIdentifier", identifier=ROOT)["identifier"], ROOT)
        self.assertEqual(self.link_beside()[0], port, "it stays where it is")
        status, output, _ = self.run_program("link", "--json")
        self.assertEqual((status, json.loads(output)["url"].split("#")[0]), (0, f"http://127.0.0.1:{port}/"))
        self.assertEqual(daemon.stop(), 0)
        with self.assertRaises(ConnectionRefusedError):
            page.get("/session")

    def test_without_a_daemon_nobody_is_let_in(self):
        status, output, errors = self.run_program("link")
        self.assertEqual((status, output), (1, b""))
        self.assertIn("no daemon runs", errors.decode())
        with self.client() as alone, self.assertRaises(RpcError) as raised:
            alone.call("makeLink")
        self.assertEqual(raised.exception.data["domain"], "KsPOSIXErrorDomain")

    def test_an_upload_and_a_stream_end_with_the_daemon(self):
        daemon = self.serve()
        page = self.browser(daemon)
        events = self.events(page)
        with RawConnection(page.port) as connection:
            fields = [*page.write_fields(), ("Content-Length", "500000")]
            connection.send(request_bytes("POST", "/upload?parent=" + ROOT + "&name=half", fields, b"x" * 1000))
            self.assertEqual(daemon.stop(), 0)
        self.assertIsNone(events.next())
        self.assertEqual([name for name in os.listdir(self.storage) if not name.startswith(".")], [])


if __name__ == "__main__":
    unittest.main()
