"""What JSON-RPC clients are told of folders and items."""

import base64
import datetime
import errno
import json
import os
import shutil
import socket
import subprocess
import unittest
import urllib.parse

from cindral_rpc import PROGRAM, ROOT, WORKING_SET, Client, SystemTest, base64_text

PROVIDER = "CindralProvider.LocalTesselKitError"
TESSEL = "TesselErrorDomain"
POSIX = "KsPOSIXErrorDomain"
NOBODY = 65534


def date_text(nanoseconds):
    """A time stamp as the interface writes dates."""
    seconds, fraction = divmod(nanoseconds, 10**9)
    text = datetime.datetime.fromtimestamp(seconds, datetime.timezone.utc).strftime("%Y-%m-%dT%H:%M:%S")
    return text + (f".{fraction:09}".rstrip("0") if fraction else "") + "Z"


def path_of(item):
    return urllib.parse.unquote_to_bytes(item["fileURL"][len("file://"):])


class PagesTest(SystemTest):
    def test_a_thousand_entries_are_what_the_folder_holds(self):
        self.make_files("many", 1000)
        client = self.client()
        pages = client.pages(client.identifier(self.path("many")))
        names = [item["filename"] for page in pages for item in page]
        self.assertEqual(sorted(names), sorted(os.listdir(self.path("many"))))
        self.assertEqual(len(set(names)), 1000)
        self.assertTrue(all(len(page) <= 200 for page in pages))

    def test_a_full_page_is_followed_by_an_empty_one(self):
        self.make_files("full", 200)
        client = self.client()
        self.assertEqual([len(page) for page in client.pages(client.identifier(self.path("full")))], [200, 0])

    def test_one_entry_less_than_a_page_is_all_of_it(self):
        self.make_files("less", 199)
        client = self.client()
        self.assertEqual([len(page) for page in client.pages(client.identifier(self.path("less")))], [199])

    def test_one_entry_more_is_on_the_next_page(self):
        self.make_files("more", 201)
        client = self.client()
        self.assertEqual([len(page) for page in client.pages(client.identifier(self.path("more")))], [200, 1])

    def test_both_orders_list_everything(self):
        self.make_files("many", 450)
        client = self.client()
        identifier = client.identifier(self.path("many"))
        names = sorted(os.listdir(self.path("many")))
        for order in ("name", "date"):
            self.assertEqual(sorted(item["filename"] for item in client.items(identifier, sort=order)), names)

    def test_an_empty_folder_is_one_empty_page(self):
        os.mkdir(self.path("empty"))
        client = self.client()
        self.assertEqual(client.pages(client.identifier(self.path("empty"))), [[]])

    def test_the_trash_is_not_listed(self):
        self.make_file(".Trash", "old.txt")
        self.make_file("sub", ".Trash", "old.txt")
        self.make_file("sub", "kept.txt")
        client = self.client()
        self.assertEqual(set(client.named()), {"sub"})
        self.assertEqual(set(client.named(client.identifier(self.path("sub")))), {"kept.txt"})

    def test_the_trash_counts_for_its_page(self):
        self.make_files("sub", 199)
        os.mkdir(self.path("sub", ".Trash"))
        client = self.client()
        pages = client.pages(client.identifier(self.path("sub")))
        self.assertEqual([len(page) for page in pages], [199, 0])

    def test_the_working_set_holds_the_documents(self):
        self.make_file("report.txt")
        client = self.client()
        self.assertIn("report.txt", [item["filename"] for item in client.items(WORKING_SET)])

    def test_a_page_of_a_folder_that_was_renamed_goes_on(self):
        self.make_files("before", 300)
        client = self.client()
        identifier = client.identifier(self.path("before"))
        first = client.call("enumerateItems", container=identifier)
        os.rename(self.path("before"), self.path("after"))
        try:
            second = client.call("enumerateItems", container=identifier, page=first["nextPage"])
            names = [item["filename"] for item in first["items"] + second["items"]]
        except Exception as refused:  # pylint: disable=broad-except
            # A renamed folder may expire the page; then the listing begins again, under the same identifier.
            self.assertEqual(getattr(refused, "domain_code", None), -1002, refused)
            names = [item["filename"] for item in client.items(identifier)]
        self.assertEqual(sorted(names), sorted(os.listdir(self.path("after"))))

    def test_what_is_base64_of_anything_else_has_expired(self):
        client = self.client()
        for data in (b"", b"x", b"bplist00", bytes(1000), os.urandom(64)):
            self.assert_error(TESSEL, -1002, client.call, "enumerateItems", container=ROOT, page=base64_text(data))

    def test_a_page_that_was_changed_anywhere_is_a_page_or_has_expired(self):
        self.make_files("many", 300)
        client = self.client()
        identifier = client.identifier(self.path("many"))
        page = base64.b64decode(client.call("enumerateItems", container=identifier)["nextPage"])
        for index in range(len(page)):
            changed = bytearray(page)
            changed[index] ^= 0x41
            answer = client.answer(client.send("enumerateItems", container=identifier, page=base64_text(changed)))
            if "error" in answer:
                self.assertEqual(answer["error"]["data"]["code"], -1002, answer)
            else:
                self.assertLessEqual(len(answer["result"]["items"]), 200)

    def test_what_is_not_base64_is_refused(self):
        client = self.client()
        for page in ("!", "abc", "YQ", "YQ=", "Y Q==", "YR==", "_-==", 7, None, ["YQ=="]):
            self.assert_refused(-32602, client.call, "enumerateItems", container=ROOT, page=page)


class NamesTest(SystemTest):
    NAMES = [b"new\nline", b"tab\t", b"\xff\xfe", b"a\xe2\x82z", b"quote\"back\\slash", b"100%", b" leading", b"trailing ", b"did=1",
             b"#tag", b"-rf", b"\x1b[31mred", "Ünï".encode(), "e\u0301".encode(), b"x" * 255, b"a:b?c*d"]

    def test_every_name_is_listed_and_found_again(self):
        for name in self.NAMES:
            self.make_file(b"odd", name)
        client = self.client()
        items = client.items(client.identifier(self.path("odd")))
        folder = os.fsencode(self.path("odd"))
        self.assertEqual(sorted(path_of(item) for item in items), sorted(os.path.join(folder, name) for name in self.NAMES))
        for item in items:
            name = os.path.basename(path_of(item))
            self.assertEqual(item["filename"], name.decode("utf-8", "replace"))
            self.assertEqual(client.call("identifierForItemAtURL", url=item["fileURL"])["identifier"], item["identifier"])
            self.assertEqual(client.call("URLForItem", identifier=item["identifier"])["url"], item["fileURL"])

    def test_a_path_longer_than_the_systems_limit_is_listed(self):
        # Made piece by piece: no call takes the whole path.
        folder = os.open(self.storage, os.O_RDONLY | os.O_DIRECTORY)
        depth = 30
        for _ in range(depth):
            os.mkdir("n" * 200, dir_fd=folder)
            below = os.open("n" * 200, os.O_RDONLY | os.O_DIRECTORY, dir_fd=folder)
            os.close(folder)
            folder = below
        os.close(folder)
        client = self.client()
        container, listed = ROOT, 0
        while True:
            items = client.items(container)
            if not items:
                break
            listed += 1
            container = items[0]["identifier"]
            if "error" in client.answer(client.send("enumerateItems", container=container)):
                break  # Listed, and not resolvable: its path is longer than an identifier's may be.
        self.assertGreaterEqual(listed, 4)
        self.assertEqual(client.call("status")["storage"], self.storage)


class KindsTest(SystemTest):
    def make_odd_objects(self):
        os.mkdir(self.path("odd"))
        os.mkfifo(self.path("odd", "fifo"))
        # A socket's path is short: bound in the folder itself.
        with socket.socket(socket.AF_UNIX) as bound:
            folder = os.open(self.path("odd"), os.O_RDONLY | os.O_DIRECTORY)
            bound.bind(f"/proc/self/fd/{folder}/socket")
            os.close(folder)
        os.symlink("nowhere", self.path("odd", "dangling"))
        os.symlink("loop2", self.path("odd", "loop1"))
        os.symlink("loop1", self.path("odd", "loop2"))
        os.symlink("..", self.path("odd", "up"))
        os.symlink("/etc/passwd", self.path("odd", "outside"))
        os.symlink("x" * 4000, self.path("odd", "long"))

    def test_odd_objects_are_listed_and_not_touched(self):
        self.make_odd_objects()
        client = self.client()
        items = client.named(client.identifier(self.path("odd")))
        self.assertEqual(set(items), {"fifo", "socket", "dangling", "loop1", "loop2", "up", "outside", "long"})
        for name, item in items.items():
            self.assertEqual(item["identifier"], f"fid={os.lstat(self.path('odd', name)).st_ino}")
            self.assertEqual(item["fileURL"], "file://" + self.path("odd", name))
            self.assertNotIn("childItemCount", item)

    def test_a_link_to_a_folder_is_no_folder(self):
        self.make_odd_objects()
        client = self.client()
        link = client.named(client.identifier(self.path("odd")))["up"]
        answer = client.answer(client.send("enumerateItems", container=link["identifier"]))
        self.assertEqual(answer.get("error", {}).get("code"), -32000, answer)

    def test_documents_and_folders_are_named_by_their_numbers(self):
        self.make_file("sub", "report.txt")
        client = self.client()
        folder = client.named()["sub"]
        self.assertEqual(folder["identifier"], f"fid={os.stat(self.path('sub')).st_ino}")
        self.assertEqual(folder["parentIdentifier"], ROOT)
        self.assertEqual(folder["fileID"], os.stat(self.path("sub")).st_ino)
        self.assertNotIn("docID", folder)
        document = client.named(folder["identifier"])["report.txt"]
        self.assertEqual(document["identifier"], f"did={document['docID']}")
        self.assertEqual(document["parentIdentifier"], folder["identifier"])
        self.assertEqual(document["fileID"], os.stat(self.path("sub", "report.txt")).st_ino)

    def test_packages_are_documents(self):
        self.make_file("report.folio", "index.xml", contents=b"x" * 1234)
        client = self.client()
        package = client.named()["report.folio"]
        self.assertTrue(package["identifier"].startswith("did="))
        self.assertEqual(package["typeIdentifier"], "com.vemra.folio.document")
        self.assertEqual(package["documentSize"], 1234)

    def test_items_say_what_the_file_system_says(self):
        self.make_file("sub", "one.txt", contents=b"12345")
        for name in ("two", "three"):
            self.make_file("sub", name)
        os.utime(self.path("sub", "one.txt"), ns=(10**18, 1_234_567_890_123_456_789))
        client = self.client()
        folder = client.named()["sub"]
        self.assertEqual(folder["childItemCount"], 3)
        self.assertEqual(folder["typeIdentifier"], "inode/directory")
        self.assertNotIn("documentSize", folder)
        item = client.named(folder["identifier"])["one.txt"]
        self.assertEqual(item["documentSize"], 5)
        self.assertEqual(item["typeIdentifier"], "text/plain")
        self.assertEqual(item["contentModificationDate"], date_text(1_234_567_890_123_456_789))
        self.assertEqual(item["capabilities"], 63)
        self.assertIs(item["isTrashed"], False)
        self.assertIs(item["isUbiquitous"], False)
        base64.b64decode(item["versionIdentifier"], validate=True)

    def test_listing_changes_no_time_stamp(self):
        self.make_file("sub", "one.txt", contents=b"12345")
        os.symlink("one.txt", self.path("sub", "link"))
        paths = [self.storage, self.path("sub"), self.path("sub", "one.txt"), self.path("sub", "link")]
        for path in paths:
            os.utime(path, ns=(10**18, 10**18), follow_symlinks=False)

        def stamps():
            return [(s.st_atime_ns, s.st_mtime_ns, s.st_ctime_ns) for s in (os.lstat(path) for path in paths)]

        before = stamps()
        client = self.client()
        client.items(client.named()["sub"]["identifier"])
        client.items(WORKING_SET)
        self.assertEqual(client.finish(), 0)
        self.assertEqual(stamps(), before)


class RestartTest(SystemTest):
    def test_a_page_of_an_earlier_process_has_expired(self):
        self.make_files(self.path(), 400)
        client = self.client()
        first = client.call("enumerateItems", container=ROOT)
        self.assertEqual(client.finish(), 0)
        for item in first["items"][:50]:
            os.unlink(self.path(item["filename"]))
        client = self.client()
        self.assertNotEqual(client.call("enumerateItems", container=ROOT)["nextPage"], first["nextPage"])
        self.assert_error("TesselErrorDomain", -1002, client.call, "enumerateItems", container=ROOT, page=first["nextPage"])
        self.assertEqual(len(client.items(ROOT)), 350)

    def test_other_listings_between_two_pages_do_no_harm(self):
        for number in range(250):
            os.mkdir(self.path("folder%d" % number))
            for inner in range(3):
                self.make_file("folder%d/%d" % (number, inner))
        client = self.client()
        first = client.call("enumerateItems", container=ROOT)
        for item in first["items"]:
            self.assertEqual(len(client.items(item["identifier"])), 3)
        second = client.call("enumerateItems", container=ROOT, page=first["nextPage"])
        self.assertEqual(len(second["items"]), 50)


class SameAnswersTest(SystemTest):
    def test_a_listing_and_a_lookup_say_the_same(self):
        self.make_file("picture", contents=b"\x89PNG\r\n\x1a\n" + bytes(100))
        self.make_file("script", contents=b"#!/bin/sh\necho\n")
        self.make_file("text", contents=b"hello\n")
        self.make_file("empty")
        self.make_file("report.folio/index", contents=b"x")
        self.make_file("folder/a.txt", contents=b"x")
        os.symlink("text", self.path("link"))
        client = self.client()
        items = client.items(ROOT)
        self.assertEqual({item["filename"]: item["typeIdentifier"] for item in items}["picture"], "image/png")
        self.assertEqual(len(items), 7)
        for item in items:
            self.assertEqual(client.call("itemForIdentifier", identifier=item["identifier"]), item)

    def test_a_file_with_several_names_is_one_item(self):
        self.make_file("a", contents=b"x")
        os.mkdir(self.path("folder"))
        os.link(self.path("a"), self.path("b"))
        os.link(self.path("a"), self.path("folder/c"))
        client = self.client()
        for _ in range(2):
            listed = client.items(WORKING_SET)
            identifiers = [item["identifier"] for item in listed]
            self.assertEqual(len(listed), 2, listed)
            self.assertEqual(len(set(identifiers)), 2)
        name = next(item["fileURL"] for item in listed if item["identifier"].startswith("did="))
        os.unlink(urllib.parse.unquote(name.removeprefix("file://")))
        left = client.items(WORKING_SET)
        self.assertEqual([item["identifier"] for item in left if item["identifier"].startswith("did=")],
                         [identifier for identifier in identifiers if identifier.startswith("did=")])

    def test_a_path_of_many_components_costs_little(self):
        client = self.client()
        self.assertIsNone(client.call("identifierForItemAtURL", path="/a" * 3_000_000)["identifier"])
        with open("/proc/%d/status" % client.process.pid, encoding="ascii") as status:
            peak = next(int(line.split()[1]) for line in status if line.startswith("VmHWM:"))
        self.assertLess(peak, 200 * 1024, "kB")


class MountsTest(SystemTest):
    """The system's folder of devices: it holds mounts of other file systems, and devices that must not be touched."""

    def test_what_is_mounted_below_is_left_out_and_told(self):
        names = set(os.listdir("/dev"))
        device = os.lstat("/dev").st_dev
        mounted = {name for name in names if os.lstat("/dev/" + name).st_dev != device}
        self.assertTrue(mounted, "a Linux system mounts something below /dev")
        client = self.client(storage="/dev")
        listed = client.named()
        self.assertEqual(set(listed), names - mounted)
        self.assertEqual(listed["null"]["typeIdentifier"], "inode/chardevice")
        self.assertTrue(listed["null"]["identifier"].startswith("fid="))
        for name in mounted:
            self.assertIsNone(client.call("identifierForItemAtURL", path="/dev/" + name)["identifier"], name)
        left_out = {entry["url"] for entry in client.call("status")["coverage"] if entry["how"] == "left out"}
        self.assertEqual(left_out, {"file:///dev/" + name for name in mounted})
        self.assertEqual(client.finish(), 0)
        self.assertEqual(client.error_text().count("leaving out"), len(mounted))


class LookupsTest(SystemTest):
    def test_every_item_is_found_by_identifier_url_and_path(self):
        for names in (("a.txt",), ("sub", "b.txt"), ("sub", "deeper", "c d.txt")):
            self.make_file(*names)
        client = self.client()
        waiting, seen = [ROOT], 0
        while waiting:
            for item in client.items(waiting.pop()):
                seen += 1
                self.assertEqual(client.call("itemForIdentifier", identifier=item["identifier"]), item)
                self.assertEqual(client.call("URLForItem", identifier=item["identifier"])["url"], item["fileURL"])
                self.assertEqual(client.call("identifierForItemAtURL", url=item["fileURL"])["identifier"], item["identifier"])
                self.assertEqual(client.identifier(os.fsdecode(path_of(item))), item["identifier"])
                if item["typeIdentifier"] == "inode/directory":
                    waiting.append(item["identifier"])
        self.assertEqual(seen, 5)

    def test_the_storage_is_the_root(self):
        client = self.client()
        root = client.call("itemForIdentifier", identifier=ROOT)
        self.assertEqual(root["identifier"], ROOT)
        self.assertEqual(root["capabilities"], 1)
        self.assertEqual(client.identifier(self.storage), ROOT)
        self.assertEqual(client.call("URLForItem", identifier=ROOT)["url"], "file://" + self.storage)

    UNKNOWN = ["fid=999999999999", "did=4294967295", "did=0", "did=-1", "did=", "fid=x", "did=1=2", "=", "", "nonsense", "#", "#com.example.none",
               "did=99999999999999999999999", "fid=18446744073709551616", "fid=0", "DID=1", "\u0000", "\u00e4"]

    def test_unknown_identifiers_are_refused(self):
        client = self.client()
        for identifier in [*self.UNKNOWN, WORKING_SET]:
            self.assert_error(PROVIDER, 0, client.call, "itemForIdentifier", identifier=identifier)
            self.assertIsNone(client.call("URLForItem", identifier=identifier)["url"])
        for identifier in self.UNKNOWN:
            error = self.assert_error(TESSEL, -1001, client.call, "enumerateItems", container=identifier)
            self.assertEqual(error.data["identifier"], identifier)
            self.assert_error(TESSEL, -1001, client.call, "currentSyncAnchor", container=identifier)

    def test_identifiers_of_any_length_are_refused_alike(self):
        client = self.client()
        for identifier in ("x" * 100_000, "did=" + "9" * 100_000, "fid=" + "0" * 100_000, "=" * 100_000, "#" * 100_000):
            self.assert_error(PROVIDER, 0, client.call, "itemForIdentifier", identifier=identifier)
            self.assert_error(TESSEL, -1001, client.call, "enumerateItems", container=identifier)
            self.assertIsNone(client.call("URLForItem", identifier=identifier)["url"])

    def test_what_is_not_there_has_no_identifier(self):
        client = self.client()
        self.assertIsNone(client.identifier(self.path("none")))
        self.assertIsNone(client.identifier(self.path("none", "below")))
        self.assertIsNone(client.call("identifierForItemAtURL", url="https://example.com/x")["identifier"])
        for params in ({"path": "relative"}, {"path": ""}, {"path": "/a\0b"}, {"path": 1}, {}, {"url": "file:///a%00"}, {"url": "file://x", "path": "/x"}):
            self.assert_refused(-32602, client.call, "identifierForItemAtURL", **params)

    def test_an_unknown_application_has_no_container(self):
        client = self.client()
        error = self.assert_error("TSErrorDomain", 1, client.call, "defaultContainer", bundleIdentifier="com.example.none")
        self.assertIn("parameter", error.data)
        self.assertIn("com.example.none", error.data["value"])

    def test_containers_have_anchors(self):
        os.mkdir(self.path("sub"))
        client = self.client()
        for container in (ROOT, WORKING_SET, client.identifier(self.path("sub"))):
            self.assertTrue(base64.b64decode(client.call("currentSyncAnchor", container=container)["anchor"], validate=True))

    def test_status_says_where_and_what(self):
        self.make_file("report.txt")
        client = self.client()
        client.items(ROOT)
        client.call("currentSyncAnchor", container=ROOT)  # Waits until the roots have been read.
        status = client.call("status")
        self.assertEqual(status["storage"], self.storage)
        self.assertEqual(status["state"], self.state)
        self.assertEqual(status["roots"], ["file://" + self.storage])
        self.assertEqual(status["documents"], 1)
        self.assertIn(status["recorder"], ("inotify", "fanotify"))
        self.assertEqual(status["coverage"], "full")
        for key in ("version", "objects", "events", "oldestEventID", "currentEventID", "volumeUUID"):
            self.assertIn(key, status)


class IdentityTest(SystemTest):
    def test_identifiers_survive_rename_move_and_restart(self):
        self.make_file("report.txt", contents=b"x")
        self.make_file("sub", "other.txt")
        with self.client() as client:
            document = client.identifier(self.path("report.txt"))
            folder = client.identifier(self.path("sub"))
            os.rename(self.path("report.txt"), self.path("sub", "renamed.txt"))
            self.assertEqual(client.call("URLForItem", identifier=document)["url"], "file://" + self.path("sub", "renamed.txt"))
            self.assertEqual(client.finish(), 0)
        os.rename(self.path("sub"), self.path("moved"))
        client = self.client()
        self.assertEqual(client.identifier(self.path("moved", "renamed.txt")), document)
        self.assertEqual(client.call("itemForIdentifier", identifier=document)["filename"], "renamed.txt")
        self.assertEqual(client.call("itemForIdentifier", identifier=folder)["filename"], "moved")

    def test_identifiers_survive_the_death_of_the_process(self):
        self.make_files("many", 250)
        client = self.client()
        before = {item["filename"]: item["identifier"] for item in client.items(client.identifier(self.path("many")))}
        client.kill()
        client = self.client()
        after = {item["filename"]: item["identifier"] for item in client.items(client.identifier(self.path("many")))}
        self.assertEqual(after, before)

    def test_a_copy_is_another_document(self):
        self.make_file("report.txt", contents=b"x")
        client = self.client()
        original = client.identifier(self.path("report.txt"))
        shutil.copy2(self.path("report.txt"), self.path("copy.txt"))
        self.assertNotEqual(client.identifier(self.path("copy.txt")), original)

    def test_a_deleted_documents_identifier_is_never_given_again(self):
        client = self.client()
        given = set()
        for i in range(50):
            # Each under its own name: made again under the same one, it would be the same document, saved.
            name = f"report{i}.txt"
            self.make_file(name)
            identifier = client.identifier(self.path(name))
            self.assertNotIn(identifier, given)
            given.add(identifier)
            os.unlink(self.path(name))
            self.assert_error(PROVIDER, 0, client.call, "itemForIdentifier", identifier=identifier)


class PresentationTest(SystemTest):
    """A storage that is not called "Documents" is presented through a link; clients never see it."""

    def setUp(self):
        super().setUp()
        self.real = os.path.join(self.folder, "My Files")
        os.makedirs(os.path.join(self.real, "sub"))
        with open(os.path.join(self.real, "sub", "a b.txt"), "wb"):
            pass
        self.url = "file://" + urllib.parse.quote(self.real)

    def test_clients_see_the_real_place(self):
        client = self.client(storage=self.real)
        self.assertEqual(client.named()["sub"]["fileURL"], self.url + "/sub")
        self.assertEqual(os.readlink(os.path.join(self.state, "Documents")), self.real)
        self.assertEqual(client.call("status")["storage"], self.real)
        self.assertEqual(client.call("status")["roots"], [self.url])
        identifier = client.identifier(os.path.join(self.real, "sub", "a b.txt"))
        self.assertEqual(client.call("URLForItem", identifier=identifier)["url"], self.url + "/sub/a%20b.txt")
        self.assertEqual(client.call("itemForIdentifier", identifier=identifier)["parentIdentifier"], client.named()["sub"]["identifier"])

    def test_every_way_to_a_file_names_it(self):
        os.symlink(self.real, os.path.join(self.folder, "way"))
        os.symlink(self.folder, os.path.join(self.folder, "self"))
        client = self.client(storage=os.path.join(self.folder, "way"))
        expected = client.identifier(os.path.join(self.real, "sub", "a b.txt"))
        self.assertIsNotNone(expected)
        for way in ("way", "self/way", "self/My Files", "state/Documents"):
            self.assertEqual(client.identifier(os.path.join(self.folder, way, "sub", "a b.txt")), expected, way)
        for way in ("way", "My Files", "state/Documents", "self/My Files"):
            self.assertEqual(client.identifier(os.path.join(self.folder, way)), ROOT, way)

    def test_the_link_follows_the_storage(self):
        self.assertEqual(self.client(storage=self.real).finish(), 0)
        other = os.path.join(self.folder, "Other")
        os.mkdir(other)
        self.assertEqual(self.client(storage=other).call("status")["storage"], other)
        self.assertEqual(os.readlink(os.path.join(self.state, "Documents")), other)

    def test_an_outer_folder_of_the_name_does_not_matter(self):
        inner = self.path("Work")
        os.mkdir(inner)
        with open(os.path.join(inner, "x.txt"), "wb"):
            pass
        client = self.client(storage=inner)
        self.assertEqual(client.named()["x.txt"]["fileURL"], "file://" + inner + "/x.txt")

    def test_the_link_is_said_once(self):
        client = self.client(storage=self.real)
        client.items(ROOT)
        self.assertEqual(client.finish(), 0)
        lines = [line for line in client.error_text().splitlines() if os.path.join(self.state, "Documents") in line]
        self.assertEqual(len(lines), 1, client.error_text())
        self.assertIn("INFO", lines[0].upper())


class ProtocolTest(SystemTest):
    STATUS = b'{"jsonrpc":"2.0","id":"after","method":"status"}\n'

    def answers(self, data):
        """Everything that is answered to these bytes and the end of input, and the exit status."""
        done = subprocess.run([PROGRAM, "rpc", *self.options()], env=self.environment, input=data, stdout=subprocess.PIPE, stderr=subprocess.PIPE,
                              timeout=120, check=False)
        return [json.loads(line) for line in done.stdout.splitlines()], done.returncode

    def assert_lives_on_after(self, data, code):
        answers, status = self.answers(data + b"\n" + self.STATUS)
        self.assertEqual(status, 0)
        by_id = {answer["id"]: answer for answer in answers}
        self.assertEqual(set(by_id), {None, "after"})
        self.assertEqual(by_id[None]["error"]["code"], code)
        self.assertIn("result", by_id["after"])

    def test_a_line_beyond_the_limit_is_skipped(self):
        self.assert_lives_on_after(b'{"jsonrpc":"2.0","id":1,"method":"status","params":{"x":"' + b"x" * (16 << 20) + b'"}}', -32600)

    def test_deep_nesting_is_refused(self):
        self.assert_lives_on_after(b"[" * 10_000 + b"]" * 10_000, -32600)
        self.assert_lives_on_after(b'{"a":' * 10_000 + b"1" + b"}" * 10_000, -32600)
        self.assert_lives_on_after(b"[" * 10_000_000, -32600)

    def test_what_is_not_json_is_refused(self):
        for data in (b"{", b"hello", b'{"id":\xff}', b'"\xff"', b'"\\ud800"', b"\x00"):
            self.assert_lives_on_after(data, -32700)

    def test_what_is_no_request_is_refused(self):
        for data in (b"1", b"[]", b"{}", b'{"jsonrpc":"1.0","method":"status"}', b'{"jsonrpc":"2.0","method":1}'):
            self.assert_lives_on_after(data, -32600)

    def test_params_by_position_and_unknown_methods_are_refused(self):
        answers, _ = self.answers(b'{"jsonrpc":"2.0","id":1,"method":"itemForIdentifier","params":["x"]}\n{"jsonrpc":"2.0","id":2,"method":"no"}\n')
        self.assertEqual({answer["id"]: answer["error"]["code"] for answer in answers}, {1: -32602, 2: -32601})

    def test_ids_come_back_as_they_were(self):
        ids = [0, -1, 18446744073709551615, -9223372036854775808, "", "a\"b\n\u00e4", None, 1.5]
        lines = b"".join(json.dumps({"jsonrpc": "2.0", "id": each, "method": "status"}).encode() + b"\n" for each in ids)
        answers, _ = self.answers(lines)
        self.assertCountEqual([answer["id"] for answer in answers], ids)

    def test_batches_are_answered_in_one_line(self):
        batch = [{"jsonrpc": "2.0", "id": n, "method": "enumerateItems", "params": {"container": ROOT}} for n in range(100)]
        batch += [7, {"jsonrpc": "2.0", "method": "status"}, {"jsonrpc": "2.0", "id": "no", "method": "no"}]
        answers, status = self.answers(json.dumps(batch).encode() + b"\n")
        self.assertEqual((len(answers), status), (1, 0))
        self.assertCountEqual([answer["id"] for answer in answers[0]], [*range(100), None, "no"])

    def test_notifications_are_not_answered(self):
        answers, status = self.answers(b'{"jsonrpc":"2.0","method":"status"}\n[{"jsonrpc":"2.0","method":"no"}]\n')
        self.assertEqual((answers, status), ([], 0))

    def test_what_is_under_way_at_the_end_of_input_is_answered(self):
        self.make_files("many", 1000)
        request = b'{"jsonrpc":"2.0","id":%d,"method":"enumerateItems","params":{"container":"TesselWorkingSetContainerItemIdentifier"}}'
        answers, status = self.answers(b"\n".join(request % n for n in range(500)))
        self.assertEqual(status, 0)
        self.assertCountEqual([answer["id"] for answer in answers], range(500))
        self.assertTrue(all("result" in answer for answer in answers))

    def test_a_client_that_stops_reading_ends_the_process(self):
        client = subprocess.Popen([PROGRAM, "rpc", *self.options()], env=self.environment, stdin=subprocess.PIPE, stdout=subprocess.PIPE,
                                  stderr=subprocess.PIPE)
        client.stdin.write(self.STATUS)
        client.stdin.flush()
        client.stdout.readline()
        client.stdout.close()
        # The input stays open.
        self.assertEqual(client.wait(timeout=120), 0)
        client.stdin.close()
        client.stderr.close()

    def test_requests_are_answered_beside_each_other(self):
        self.make_files("many", 1000)
        client = self.client()
        container = client.identifier(self.path("many"))
        ids = [client.send("enumerateItems", container=container) for _ in range(200)]
        ids += [client.send("itemForIdentifier", identifier=ROOT) for _ in range(200)]
        for identifier in reversed(ids):
            self.assertIn("result", client.answer(identifier))


class FoldersTest(SystemTest):
    def test_a_second_process_on_the_state_is_told_who_has_it(self):
        client = self.client()
        client.call("status")
        status, output, error = self.run_program("ls")
        self.assertEqual((status, output), (1, b""))
        self.assertEqual(error.decode().splitlines()[-1], f"cindral: the state folder {self.state} is in use by process {client.process.pid}")
        # The first one is none the worse for it.
        self.assertEqual(client.call("status")["state"], self.state)

    def test_a_state_in_the_storage_is_a_wrong_word(self):
        for state in (self.storage, self.path("state"), self.path("a", "b")):
            status, output, error = self.run_program("ls", state=state)
            self.assertEqual((status, output), (2, b""))
            self.assertTrue(error.startswith(b"cindral: "), error)
        self.assertEqual(os.listdir(self.storage), [])

    def test_missing_folders_are_made(self):
        storage = os.path.join(self.folder, "a", "b", "Documents")
        state = os.path.join(self.folder, "c", "d")
        self.assertEqual(self.run_program("ls", storage=storage, state=state), (0, b"", b""))
        self.assertTrue(os.path.isdir(storage))
        self.assertEqual(os.stat(state).st_mode & 0o7777, 0o700)

    def test_the_documents_folder_is_the_storage_where_nothing_is_said(self):
        os.makedirs(os.path.join(self.folder, ".config"))
        with open(os.path.join(self.folder, ".config", "user-dirs.dirs"), "w", encoding="utf-8") as file:
            file.write('XDG_DOCUMENTS_DIR="$HOME/Papers"\n')
        done = subprocess.run([PROGRAM, "status", "--json"], env=self.environment, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=120, check=True)
        status = json.loads(done.stdout)
        self.assertEqual(status["storage"], os.path.join(self.folder, "Papers"))
        self.assertEqual(status["state"], os.path.join(self.folder, ".local", "state", "cindral"))

    def test_nothing_the_host_keeps_is_open_to_others(self):
        self.make_file("report.txt")
        client = self.client()
        client.items(ROOT)
        for folder, folders, files in os.walk(self.state):
            for name in folders + files:
                path = os.path.join(folder, name)
                if not os.path.islink(path):
                    self.assertEqual(os.stat(path).st_mode & 0o077, 0, path)


class UnprivilegedTest(SystemTest):
    """As somebody who may not read everything. A privileged tester gives its folders, and a copy of the program, away first."""

    def unprivileged_client(self):
        if os.geteuid() != 0:
            return self.client()
        program = os.path.join(self.folder, "cindral")
        shutil.copy2(PROGRAM, program)
        for folder, folders, files in os.walk(self.folder):
            for name in [".", *folders, *files]:
                os.chown(os.path.join(folder, name), NOBODY, NOBODY, follow_symlinks=False)
        client = Client(self.options(), self.environment, executable=program, user=NOBODY, group=NOBODY, extra_groups=[], cwd=self.folder)
        self.addCleanup(client.__exit__)
        return client

    def test_a_folder_that_may_not_be_read_says_so(self):
        self.make_file("closed", "x.txt")
        self.make_file("open", "y.txt")
        os.chmod(self.path("closed"), 0)
        client = self.unprivileged_client()
        items = client.named()
        self.assertEqual(set(items), {"closed", "open"})
        self.assert_error(POSIX, errno.EACCES, client.call, "enumerateItems", container=items["closed"]["identifier"])
        self.assertEqual(set(client.named(items["open"]["identifier"])), {"y.txt"})

    def test_one_folder_that_may_not_be_searched_hides_no_other(self):
        os.mkdir(self.path("locked"))
        for number in range(450):
            self.make_file("locked/%d" % number)
        for number in range(300):
            self.make_file("open/%d" % number)
        os.chmod(self.path("locked"), 0o444)
        try:
            names = [item["filename"] for item in self.unprivileged_client().items(WORKING_SET)]
        finally:
            os.chmod(self.path("locked"), 0o755)
        self.assertEqual(len(names), 302)

    def test_a_file_that_may_not_be_read_is_listed(self):
        self.make_file("secret.txt", contents=b"123")
        os.chmod(self.path("secret.txt"), 0)
        item = self.unprivileged_client().named()["secret.txt"]
        self.assertEqual(item["documentSize"], 3)
        self.assertEqual(item["capabilities"], 1)

    def test_what_may_not_be_written_may_not_be_changed(self):
        self.make_file("fixed.txt")
        self.make_file("free.txt")
        os.chmod(self.path("fixed.txt"), 0o444)
        items = self.unprivileged_client().named()
        self.assertEqual((items["fixed.txt"]["capabilities"], items["free.txt"]["capabilities"]), (1, 63))


if __name__ == "__main__":
    unittest.main()
