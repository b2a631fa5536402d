"""Edits over JSON-RPC: what is changed, what is answered, and what is never lost."""

import os
import stat
import unittest

from cindral_rpc import ROOT, Client, OutsideTest, RpcError
from installed_apps import Entries

TEMPORARY = "TesselTemporaryLocalFolderItemIdentifier"
UNKNOWN = "fid=18446744073709551615"
TRASH_DATE = "user.com.vemra.trash.time#PS"
PUT_BACK = "user.com.vemra.trash.putback#PS"
TAGS = "user.com.vemra.metadata:_kMDItemUserTags"
RANK = "user.com.vemra.favorite-rank.number#PS"
LAST_USED = "user.com.vemra.lastuseddate#PS"

GENERAL = "KsGeneralErrorDomain"
POSIX = "KsPOSIXErrorDomain"
TESSEL = "TesselErrorDomain"
TS = "TSErrorDomain"
EINVAL, ENAMETOOLONG, ECANCELED = 22, 36, 125


def tree_of(folder):
    """What is below a folder: for each path its kind, mode and contents. The temporary folder's own is left out."""
    tree = {}
    for path, folders, files in os.walk(folder):
        folders[:] = [name for name in folders if name != ".TemporaryLocalFolder"]
        for name in [*folders, *files]:
            entry = os.path.join(path, name)
            status = os.lstat(entry)
            contents = None
            if stat.S_ISREG(status.st_mode):
                with open(entry, "rb") as file:
                    contents = file.read()
            elif stat.S_ISLNK(status.st_mode):
                contents = os.readlink(entry)
            tree[os.path.relpath(entry, folder)] = (status.st_mode, contents)
    return tree


class EditsFixture(OutsideTest):
    def setUp(self):
        super().setUp()
        self.make_folder("Letters")

    def client(self, **popen):
        """One whose first reading is over, so that each test looks at one thing."""
        client = super().client(**popen)
        client.call("currentSyncAnchor", container=ROOT)
        return client

    def make_folder(self, *names):
        os.makedirs(self.path(*names), exist_ok=True)
        return self.path(*names)

    def leftovers(self):
        try:
            return os.listdir(self.path(".TemporaryLocalFolder"))
        except FileNotFoundError:
            return []

    def assert_collision(self, in_the_way, call, *arguments, **params):
        error = self.assert_error(TESSEL, -1003, call, *arguments, **params)
        self.assertEqual(error.data["item"]["identifier"], in_the_way)
        self.assertEqual(error.data["item"]["fileURL"][:8], "file:///")


class EditsTest(EditsFixture):
    # --- What each method does --------------------------------------------------------------------------------------------

    def test_import_copies_a_document_and_answers_its_item(self):
        source = self.outside_file("ada.txt", b"Dear Ada")
        os.utime(source, ns=(1, 1_000_000_000_000_000_002))
        client = self.client()
        parent = client.identifier(self.path("Letters"))
        item = client.call("importDocument", path=source, parent=parent)
        self.assertEqual((item["filename"], item["parentIdentifier"], item["documentSize"]), ("ada.txt", parent, 8))
        self.assertEqual(self.read("Letters", "ada.txt"), b"Dear Ada")
        self.assertEqual(os.stat(self.path("Letters", "ada.txt")).st_mtime_ns, 1_000_000_000_000_000_002)
        self.assertEqual(client.call("itemForIdentifier", identifier=item["identifier"]), item)
        # By URL, and from within the storage: a copy of its own.
        url = item["fileURL"]
        copy = client.call("importDocument", url=url, parent=TEMPORARY)
        self.assertNotEqual(copy["identifier"], item["identifier"])

    def test_import_copies_folders_whole(self):
        for name in ("tree/a", "tree/sub/b", "tree/sub/deeper/c"):
            self.outside_file(name, name.encode())
        os.symlink("nowhere", os.path.join(self.outside, "tree", "link"))
        os.mkfifo(os.path.join(self.outside, "tree", "fifo"))
        client = self.client()
        item = client.call("importDocument", path=os.path.join(self.outside, "tree"), parent=client.identifier(self.path("Letters")))
        self.assertEqual(item["typeIdentifier"], "inode/directory")
        self.assertEqual(tree_of(self.path("Letters", "tree")), tree_of(os.path.join(self.outside, "tree")))
        self.assertEqual(self.leftovers(), [])

    def test_the_root_takes_no_new_files_but_what_is_moved_there(self):
        source = self.outside_file("a", b"A")
        client = self.client()
        for call in (("importDocument", {"path": source}), ("createDirectory", {"name": "new"})):
            error = self.assert_error(GENERAL, 513, client.call, call[0], parent=ROOT, **call[1])
            self.assertEqual(set(error.data), {"domain", "code"})
        self.assertEqual(set(os.listdir(self.storage)), {"Letters"})
        built = client.call("importDocument", path=source, parent=TEMPORARY)
        moved = client.call("reparentItem", identifier=built["identifier"], parent=ROOT)
        self.assertEqual((moved["identifier"], moved["parentIdentifier"]), (built["identifier"], ROOT))
        self.assertEqual(self.read("a"), b"A")
        folder = client.call("createDirectory", name="new", parent=TEMPORARY)
        client.call("reparentItem", identifier=folder["identifier"], parent=ROOT, name="newer")
        self.assertTrue(os.path.isdir(self.path("newer")))
        self.assertEqual(self.leftovers(), [])

    def test_folders_are_created_renamed_moved_and_deleted(self):
        self.make_file("Letters", "old", "a")
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        made = client.call("createDirectory", name="new", parent=letters)
        self.assertEqual(made["identifier"], f"fid={os.stat(self.path('Letters', 'new')).st_ino}")
        renamed = client.call("renameItem", identifier=made["identifier"], name="newer")
        self.assertEqual((renamed["identifier"], renamed["filename"]), (made["identifier"], "newer"))
        old = client.identifier(self.path("Letters", "old"))
        moved = client.call("reparentItem", identifier=old, parent=made["identifier"], name="inner")
        self.assertEqual((moved["identifier"], moved["filename"], moved["parentIdentifier"]), (old, "inner", made["identifier"]))
        self.assertEqual(client.call("deleteItem", identifier=made["identifier"]), {})
        self.assertEqual(os.listdir(self.path("Letters")), [])
        self.assert_error("CindralProvider.LocalTesselKitError", 0, client.call, "itemForIdentifier", identifier=old)

    def test_documents_and_packages_keep_their_identifier(self):
        self.make_file("a.txt")
        self.make_file("Song.tonemill", "data")
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        for name in ("a.txt", "Song.tonemill"):
            identifier = client.identifier(self.path(name))
            self.assertTrue(identifier.startswith("did="))
            self.assertEqual(client.call("reparentItem", identifier=identifier, parent=letters)["identifier"], identifier)
            self.assertEqual(client.call("renameItem", identifier=identifier, name="b-" + name)["identifier"], identifier)
            self.assertEqual(client.call("trashItem", identifier=identifier)["identifier"], identifier)
            self.assertEqual(client.call("untrashItem", identifier=identifier)["identifier"], identifier)
            self.assertTrue(os.path.exists(self.path("Letters", "b-" + name)))

    def test_a_name_that_is_taken_is_answered_with_the_item_in_the_way(self):
        self.make_file("Letters", "taken", contents=b"old")
        self.make_file("a", contents=b"A")
        source = self.outside_file("taken")
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        in_the_way = client.identifier(self.path("Letters", "taken"))
        document = client.identifier(self.path("a"))
        before = tree_of(self.storage)
        self.assert_collision(in_the_way, client.call, "importDocument", path=source, parent=letters)
        self.assert_collision(in_the_way, client.call, "createDirectory", name="taken", parent=letters)
        self.assert_collision(in_the_way, client.call, "reparentItem", identifier=document, parent=letters, name="taken")
        self.assert_collision(letters, client.call, "renameItem", identifier=document, name="Letters")
        self.make_file(".Trash", "a")
        self.assert_collision(client.identifier(self.path(".Trash", "a")), client.call, "trashItem", identifier=document)
        os.remove(self.path(".Trash", "a"))
        os.rmdir(self.path(".Trash"))
        self.assertEqual(tree_of(self.storage), before)

    def test_names_are_checked(self):
        self.make_file("a")
        client = self.client()
        document, letters = client.identifier(self.path("a")), client.identifier(self.path("Letters"))
        for name in ("", ".", "..", "a/b", "/", "a\0b"):
            self.assert_error(POSIX, EINVAL, client.call, "createDirectory", name=name, parent=letters)
            self.assert_error(POSIX, EINVAL, client.call, "renameItem", identifier=document, name=name)
            self.assert_error(POSIX, EINVAL, client.call, "reparentItem", identifier=document, parent=letters, name=name)
        for name in ("x" * 256, "\u00fc" * 128):
            self.assert_error(POSIX, ENAMETOOLONG, client.call, "renameItem", identifier=document, name=name)
        self.assertEqual(client.call("renameItem", identifier=document, name="\u00fc" * 127)["filename"], "\u00fc" * 127)

    def test_names_of_any_bytes_are_moved_trashed_and_restored(self):
        names = [b"\xff\xfe", b"line\nbreak", b"-rf", b"\x1b[2J", "\u202etxt.exe".encode(), b"a%20b", b"did=1", b"*"]
        for name in names:
            self.make_file(b"odd", name, contents=name)
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        items = client.items(client.identifier(self.path("odd")))
        self.assertEqual(len(items), len(names))
        for item in items:
            client.call("reparentItem", identifier=item["identifier"], parent=letters)
            client.call("trashItem", identifier=item["identifier"])
            client.call("untrashItem", identifier=item["identifier"])
            client.call("setTags", identifier=item["identifier"], tags=["seen"])
        self.assertEqual(sorted(os.listdir(os.fsencode(self.path("Letters")))), sorted(names))
        for item in items:
            client.call("deleteItem", identifier=item["identifier"])
        self.assertEqual(os.listdir(self.path("Letters")), [])

    def test_unknown_items_and_parents(self):
        self.make_file("a")
        source = self.outside_file("b")
        client = self.client()
        document, letters = client.identifier(self.path("a")), client.identifier(self.path("Letters"))
        refused = [
            (TESSEL, -1001, "importDocument", {"path": source, "parent": UNKNOWN}),
            (TESSEL, -1001, "createDirectory", {"name": "new", "parent": UNKNOWN}),
            (TESSEL, -1001, "renameItem", {"identifier": UNKNOWN, "name": "new"}),
            (TS, 2, "reparentItem", {"identifier": UNKNOWN, "parent": letters}),
            (TS, 2, "reparentItem", {"identifier": document, "parent": UNKNOWN}),
            (TS, 2, "deleteItem", {"identifier": UNKNOWN}),
            (TS, 2, "trashItem", {"identifier": UNKNOWN}),
            (TS, 2, "untrashItem", {"identifier": UNKNOWN}),
            (TESSEL, -1001, "setLastUsedDate", {"identifier": UNKNOWN, "date": None}),
            (TS, 2, "setTags", {"identifier": UNKNOWN, "tags": []}),
            (TESSEL, -1001, "setFavoriteRank", {"identifier": UNKNOWN, "rank": 1}),
        ]
        for domain, code, method, params in refused:
            with self.subTest(method=method):
                error = self.assert_error(domain, code, client.call, method, **params)
                self.assertEqual(error.data["identifier"], UNKNOWN)
        error = self.assert_error(GENERAL, 260, client.call, "importDocument", path="/nowhere/at all", parent=letters)
        self.assertEqual(error.data["path"], "/nowhere/at all")

    def test_the_root_is_never_moved_away(self):
        self.make_file("a")
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        before = tree_of(self.storage)
        self.assert_error(GENERAL, 513, client.call, "reparentItem", identifier=ROOT, parent=letters)
        self.assert_error(GENERAL, 513, client.call, "renameItem", identifier=ROOT, name="new")
        self.assert_error(GENERAL, 513, client.call, "deleteItem", identifier=ROOT)
        self.assert_error(GENERAL, 513, client.call, "trashItem", identifier=ROOT)
        self.assert_error(POSIX, EINVAL, client.call, "reparentItem", identifier=letters, parent=letters)
        os.rmdir(self.path(".Trash"))
        self.assertEqual(tree_of(self.storage), before)

    def test_parameters_are_checked(self):
        client = self.client()
        for method, params in [
                ("importDocument", {"parent": ROOT}), ("importDocument", {"path": "relative", "parent": ROOT}),
                ("importDocument", {"path": "/a", "url": "file:///a", "parent": ROOT}), ("importDocument", {"path": "/a"}),
                ("createDirectory", {"name": 1, "parent": ROOT}), ("createDirectory", {"name": "a"}), ("renameItem", {"name": "a"}),
                ("reparentItem", {"identifier": "did=1"}), ("reparentItem", {"identifier": "did=1", "parent": ROOT, "name": 1}),
                ("deleteItem", {}), ("trashItem", {}), ("untrashItem", {"identifier": "did=1", "parent": []}),
                ("removeTrashedItemsOlderThan", {}), ("removeTrashedItemsOlderThan", {"date": "yesterday"}),
                ("setLastUsedDate", {"identifier": "did=1"}), ("setLastUsedDate", {"identifier": "did=1", "date": "2026"}),
                ("setTags", {"identifier": "did=1"}), ("setTags", {"identifier": "did=1", "tags": "a"}), ("setTags", {"identifier": "did=1", "tags": [1]}),
                ("setFavoriteRank", {"identifier": "did=1"}), ("setFavoriteRank", {"identifier": "did=1", "rank": 1.5}),
                ("setFavoriteRank", {"identifier": "did=1", "rank": 2**63}), ("cancel", {}), ("cancel", {"request": []})]:
            with self.subTest(method=method, params=params):
                self.assert_refused(-32602, client.call, method, **params)

    # --- The trash ----------------------------------------------------------------------------------------------------------

    def test_trash_and_put_back(self):
        self.make_file("Letters", "2026", "ada.txt", contents=b"Dear Ada")
        client = self.client()
        identifier = client.identifier(self.path("Letters", "2026", "ada.txt"))
        trashed = client.call("trashItem", identifier=identifier)
        self.assertTrue(trashed["isTrashed"])
        self.assertEqual(trashed["identifier"], identifier)
        self.assertEqual(os.listdir(self.path(".Trash")), ["ada.txt"])
        self.assertLessEqual({TRASH_DATE, PUT_BACK}, set(os.listxattr(self.path(".Trash", "ada.txt"))))
        self.assertIn(b"Letters/2026/ada.txt", os.getxattr(self.path(".Trash", "ada.txt"), PUT_BACK))
        restored = client.call("untrashItem", identifier=identifier)
        self.assertFalse(restored["isTrashed"])
        self.assertEqual(self.read("Letters", "2026", "ada.txt"), b"Dear Ada")
        attributes = os.listxattr(self.path("Letters", "2026", "ada.txt"))
        self.assertNotIn(TRASH_DATE, attributes)
        self.assertIn(PUT_BACK, attributes)
        self.assert_error(TS, 1, client.call, "untrashItem", identifier=identifier)

    def test_put_back_chooses_the_first_place_that_will_do(self):
        self.make_file("Letters", "a")
        self.make_folder("Other")
        self.make_folder("Gone")
        client = self.client()
        identifier = client.identifier(self.path("Letters", "a"))
        gone = client.identifier(self.path("Gone"))
        client.call("trashItem", identifier=gone)
        client.call("trashItem", identifier=identifier)
        client.call("untrashItem", identifier=identifier, parent=client.identifier(self.path("Other")))
        self.assertTrue(os.path.exists(self.path("Other", "a")))
        client.call("trashItem", identifier=identifier)
        client.call("untrashItem", identifier=identifier, parent=gone)
        self.assertTrue(os.path.exists(self.path("Other", "a")))
        client.call("trashItem", identifier=identifier)
        os.rmdir(self.path("Other"))
        self.make_file("a", contents=b"in the way")
        restored = client.call("untrashItem", identifier=identifier, parent=gone)
        self.assertEqual((restored["filename"], restored["parentIdentifier"]), ("a 2", ROOT))
        self.assertEqual(self.read("a"), b"in the way")

    def test_the_sweep_takes_what_is_older(self):
        for name in ("old", "older"):
            self.make_file("Letters", name)
        self.make_file("Letters", "folder", "inside")
        client = self.client()
        for name in ("old", "older", "folder"):
            client.call("trashItem", identifier=client.identifier(self.path("Letters", name)))
        self.assertEqual(client.call("removeTrashedItemsOlderThan", date="2001-01-01T00:00:00Z"), {})
        self.assertEqual(len(os.listdir(self.path(".Trash"))), 3)
        self.make_file(".Trash", "undated")
        self.assertEqual(client.call("removeTrashedItemsOlderThan", date="2999-01-01T00:00:00Z"), {})
        self.assertEqual(os.listdir(self.path(".Trash")), ["undated"])
        self.assertEqual(client.call("removeTrashedItemsOlderThan", date="2999-01-01T00:00:00Z"), {})
        self.assertEqual(os.listdir(self.path(".Trash")), [])

    # --- Metadata -----------------------------------------------------------------------------------------------------------

    def test_metadata_lasts_and_is_taken_away(self):
        path = self.make_file("a")
        client = self.client()
        identifier = client.identifier(path)
        client.call("setTags", identifier=identifier, tags=["green", "\U0001f332"])
        client.call("setFavoriteRank", identifier=identifier, rank=-5)
        item = client.call("setLastUsedDate", identifier=identifier, date="2026-11-20T09:52:00.5Z")
        self.assertEqual((item["tags"], item["favoriteRank"], item["lastUsedDate"]), (["green", "\U0001f332"], -5, "2026-11-20T09:52:00.5Z"))
        self.assertEqual({TAGS, RANK, LAST_USED}, set(os.listxattr(path)))
        client.finish()
        client = self.client()
        self.assertEqual(client.call("itemForIdentifier", identifier=identifier), item)
        client.call("setTags", identifier=identifier, tags=[])
        client.call("setFavoriteRank", identifier=identifier, rank=None)
        item = client.call("setLastUsedDate", identifier=identifier, date=None)
        self.assertFalse({"tags", "favoriteRank", "lastUsedDate"} & set(item))
        self.assertEqual(os.listxattr(path), [])

    def test_a_full_attribute_space_changes_nothing(self):
        path = self.make_file("a")
        client = self.client()
        identifier = client.identifier(path)
        before = client.call("setTags", identifier=identifier, tags=["green"])
        with self.assertRaises(RpcError) as raised:
            client.call("setTags", identifier=identifier, tags=["x" * 1000] * 100)
        self.assertEqual(raised.exception.domain, POSIX)
        self.assertIn(raised.exception.domain_code, (7, 28))  # E2BIG, ENOSPC
        self.assertEqual(raised.exception.data["path"], path)
        self.assertEqual(client.call("itemForIdentifier", identifier=identifier)["tags"], before["tags"])

    # --- Progress and cancel ----------------------------------------------------------------------------------------------------

    def test_long_work_tells_how_far_it_is(self):
        source = self.outside_file("big", b"x" * (64 << 20))
        client = self.client()
        request = client.send("importDocument", path=source, parent=client.identifier(self.path("Letters")))
        told = client.next_notification("progress")
        self.assertEqual(set(told), {"request", "completedBytes", "totalBytes", "completedItems", "totalItems"})
        self.assertEqual((told["request"], told["totalBytes"], told["totalItems"]), (request, 64 << 20, 1))
        self.assertLessEqual(told["completedBytes"], told["totalBytes"])
        self.assertEqual(client.answer(request)["result"]["documentSize"], 64 << 20)

    def test_deletions_tell_how_far_they_are(self):
        self.make_files("many", 500)
        client = self.client()
        request = client.send("deleteItem", identifier=client.identifier(self.path("many")))
        told = client.next_notification("progress")
        self.assertEqual((told["request"], told["totalItems"]), (request, 501))
        self.assertEqual(client.answer(request)["result"], {})

    def test_work_of_one_step_is_quiet(self):
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        for number in range(20):
            client.call("createDirectory", name=str(number), parent=letters)
            client.call("renameItem", identifier=client.identifier(self.path("Letters", str(number))), name=f"new {number}")
        self.assertEqual(client.finish(), 0)
        self.assertIsNone(client.next_message())

    def test_what_is_cancelled_is_undone(self):
        source = os.path.join(self.outside, "big")
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        before = tree_of(self.storage)
        # Whether an import is over before its cancellation comes is not to be said: then one of more is tried.
        for mebibytes in (64, 256, 1024, 4096):
            with open(source, "ab") as file:
                while file.tell() < mebibytes << 20:
                    file.write(bytes(range(1, 129)) * 8192)
            request = client.send("importDocument", path=source, parent=letters)
            client.next_notification("progress")
            self.assertEqual(client.call("cancel", request=request), {})
            answer = client.answer(request)
            if "error" in answer:
                break
            client.call("deleteItem", identifier=answer["result"]["identifier"])
        error = answer["error"]
        self.assertEqual((error["data"]["domain"], error["data"]["code"]), (POSIX, ECANCELED))
        self.assertEqual(tree_of(self.storage), before)
        self.assertEqual(self.leftovers(), [])

    def test_requests_are_cancelled_as_soon_as_they_are_sent(self):
        source = self.outside_file("big", b"x" * (8 << 20))
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        lines, requests = [], []
        for number in range(20):
            lines.append(f'{{"jsonrpc":"2.0","id":"i{number}","method":"importDocument","params":{{"path":"{source}","parent":"{letters}"}}}}')
            lines.append(f'{{"jsonrpc":"2.0","id":"c{number}","method":"cancel","params":{{"request":"i{number}"}}}}')
            requests.append(f"i{number}")
        client.send_bytes(("\n".join(lines) + "\n").encode())
        answers = [client.answer(request) for request in requests]
        for number in range(20):
            self.assertEqual(client.answer(f"c{number}")["result"], {})
        # Whether one of them was quicker than its cancellation is not to be said; nothing but that is left to chance.
        done = [answer for answer in answers if "result" in answer]
        self.assertTrue(all("result" in answer or answer["error"]["data"]["code"] in (ECANCELED, -1003) for answer in answers))
        self.assertEqual(os.listdir(self.path("Letters")), ["big"] * len(done))

    def test_cancelling_what_is_not_under_way_is_nothing(self):
        client = self.client()
        self.assertEqual(client.call("cancel", request=12345), {})
        self.assertEqual(client.call("cancel", request="none"), {})
        self.assertEqual(client.call("cancel", request=None), {})

    # --- Whatever happens ---------------------------------------------------------------------------------------------------------

    def test_a_killed_import_leaves_nothing_after_the_next_start(self):
        for number in range(300):
            self.outside_file(f"tree/{number % 10}/{number}", os.urandom(20_000))
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        before = tree_of(self.storage)
        client.send("importDocument", path=os.path.join(self.outside, "tree"), parent=letters)
        client.next_notification("progress")
        client.kill()
        after = tree_of(self.storage)
        if "Letters/tree" in after:  # It was quicker: then it is all there.
            self.assertEqual(tree_of(self.path("Letters", "tree")), tree_of(os.path.join(self.outside, "tree")))
        else:
            self.assertEqual(after, before)
        with self.client() as client:
            client.call("status")
        self.assertEqual(self.leftovers(), [])

    def test_a_killed_deletion_is_wholly_done_or_not_at_all(self):
        for number in range(1000):
            self.make_file("tree", str(number % 10), str(number))
        before = tree_of(self.path("tree"))
        client = self.client()
        client.send("deleteItem", identifier=client.identifier(self.path("tree")))
        client.next_notification("progress")
        client.kill()
        if os.path.exists(self.path("tree")):
            self.assertEqual(tree_of(self.path("tree")), before)
        with self.client() as client:
            client.call("status")
        self.assertEqual(self.leftovers(), [])

    def test_two_requests_for_one_name_overwrite_nothing(self):
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        rounds, senders = 100, 8
        for number in range(senders):
            for turn in range(rounds):
                self.outside_file(f"{number}/{turn}", f"{number} {turn}".encode())
        requests = [client.send("importDocument", path=os.path.join(self.outside, str(number), str(turn)), parent=letters)
                    for turn in range(rounds) for number in range(senders)]
        answers = [client.answer(request) for request in requests]
        self.assertEqual(sum("result" in answer for answer in answers), rounds)
        self.assertTrue(all("result" in answer or answer["error"]["data"]["code"] == -1003 for answer in answers))
        winners = {answer["result"]["filename"]: index % senders for index, answer in enumerate(answers) if "result" in answer}
        for name, number in winners.items():
            self.assertEqual(self.read("Letters", name), f"{number} {name}".encode())

    def test_moves_onto_the_same_names_lose_nothing(self):
        folders = [self.make_folder("Letters"), self.make_folder("Other")]
        for number in range(20):
            self.make_file("Letters", f"n{number % 4}-{number}", contents=str(number).encode())
        client = self.client()
        parents = [client.identifier(folder) for folder in folders]
        documents = [item["identifier"] for item in client.items(parents[0])]
        requests = []
        for turn in range(200):
            identifier = documents[turn % len(documents)]
            requests.append(client.send("reparentItem", identifier=identifier, parent=parents[turn % 2], name=f"n{turn % 7}"))
            requests.append(client.send("renameItem", identifier=identifier, name=f"n{turn % 5}"))
        for request in requests:
            client.answer(request)
        contents = []
        for folder in folders:
            for name in os.listdir(folder):
                with open(os.path.join(folder, name), "rb") as file:
                    contents.append(int(file.read()))
        self.assertEqual(sorted(contents), list(range(20)))

    def test_requests_that_do_not_wait_for_each_other_are_of_the_items_that_they_name(self):
        """A document is renamed, something moved to where it was, and the document deleted, trashed, renamed once more or tagged."""
        rounds = 300
        for turn in range(rounds):
            self.make_file("Letters", f"a{turn}", contents=b"named %d" % turn)
            # A folder: a file would be taken for the document's new version where it is deleted first.
            self.make_file("Other", f"x{turn}", "inside", contents=b"bystander %d" % turn)
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        named, bystanders = client.named(letters), client.named(client.identifier(self.path("Other")))
        last = [("deleteItem", {}), ("trashItem", {}), ("renameItem", {"name": None}), ("setTags", {"tags": ["named"]})]
        requests = []
        for turn in range(rounds):
            document, bystander = named[f"a{turn}"]["identifier"], bystanders[f"x{turn}"]["identifier"]
            method, params = last[turn % len(last)]
            if "name" in params:
                params = {"name": f"c{turn}"}
            requests.append((client.send("renameItem", identifier=document, name=f"b{turn}"),
                             client.send("reparentItem", identifier=bystander, parent=letters, name=f"a{turn}"),
                             client.send(method, identifier=document, **params)))
        for turn, (_, _, request) in enumerate(requests):
            # It moves once while it is looked for: that is no reason not to find it.
            self.assertIn("result", client.answer(request), turn)
        client.finish()
        found = {}
        for path, _, files in os.walk(self.storage):
            for name in files:
                place = os.path.join(path, name)
                with open(place, "rb") as file:
                    found[file.read()] = place
        for turn in range(rounds):
            bystander = os.path.dirname(found[b"bystander %d" % turn])
            self.assertNotIn("Trash", bystander)
            self.assertIn(os.path.basename(bystander), (f"a{turn}", f"x{turn}"))
            self.assertNotIn(TAGS, os.listxattr(bystander))
            method, _ = last[turn % len(last)]
            document = found.get(b"named %d" % turn)
            self.assertEqual(document is None, method == "deleteItem", turn)
            if method == "trashItem":
                self.assertIn("Trash", document)
            elif method == "setTags":
                self.assertIn(TAGS, os.listxattr(document))

    def test_no_link_leads_an_edit_outside(self):
        victim = self.outside_file("victim/a", b"untouched")
        os.symlink(os.path.dirname(victim), self.path("way"))
        self.make_file("b")
        client = self.client()
        way = client.identifier(self.path("way"))
        before = tree_of(self.outside)
        for method, params in [("createDirectory", {"name": "new", "parent": way}), ("importDocument", {"path": victim, "parent": way}),
                               ("reparentItem", {"identifier": client.identifier(self.path("b")), "parent": way})]:
            with self.assertRaises(RpcError):
                client.call(method, **params)
        # The link itself is an item like any other.
        client.call("renameItem", identifier=way, name="other")
        client.call("trashItem", identifier=way)
        client.call("deleteItem", identifier=way)
        self.assertEqual(tree_of(self.outside), before)

    def test_edits_of_an_ordinary_person(self):
        """What the mode forbids is refused, whatever else of it is allowed."""
        self.make_file("locked", "a")
        self.make_file("Letters", "b", contents=b"B")
        launcher = []
        if os.geteuid() == 0:
            for path, folders, files in os.walk(self.folder):
                for name in ["", *folders, *files]:
                    os.chown(os.path.join(path, name), 65533, 65533)
            launcher = ["setpriv", "--reuid=65533", "--regid=65533", "--clear-groups", "--"]
        os.chmod(self.path("locked"), 0o555)
        with Client(self.options(), self.environment, launcher=launcher) as client:
            inside = client.identifier(self.path("locked", "a"))
            document = client.identifier(self.path("Letters", "b"))
            locked = client.identifier(self.path("locked"))
            before = tree_of(self.storage)
            for method, params in [("renameItem", {"identifier": inside, "name": "c"}), ("deleteItem", {"identifier": inside}),
                                   ("deleteItem", {"identifier": locked}), ("createDirectory", {"name": "new", "parent": locked}),
                                   ("importDocument", {"path": self.path("Letters", "b"), "parent": locked}),
                                   ("reparentItem", {"identifier": document, "parent": locked})]:
                with self.subTest(method=method):
                    self.assert_error(POSIX, 13, client.call, method, **params)
            self.assertEqual(tree_of(self.storage), before)
            client.call("trashItem", identifier=document)
            client.call("untrashItem", identifier=document)
            client.call("setTags", identifier=document, tags=["green"])
            self.assertEqual(self.read("Letters", "b"), b"B")

    def test_many_edits_at_once_are_each_answered_once(self):
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        requests = [client.send("createDirectory", name=f"{number % 50}", parent=letters) for number in range(500)]
        made = sum("result" in client.answer(request) for request in requests)
        self.assertEqual(made, 50)
        self.assertEqual(client.finish(), 0)
        self.assertIsNone(client.next_message())


class LibraryEditsTest(EditsFixture):
    """Edits in the documents of an application."""

    APPLICATION = "org.example.Writer"
    LIBRARY = "#" + APPLICATION

    def setUp(self):
        super().setUp()
        self.container = os.path.join(self.folder, "containers", self.APPLICATION)
        self.library = os.path.join(self.container, "Documents")
        os.makedirs(os.path.join(self.library, "Drafts"))
        with open(self.document("Drafts", "novel"), "w", encoding="ascii") as file:
            file.write("It was")
        self.entries = Entries(os.path.join(self.folder, "entries"))
        self.entries.install(self.APPLICATION, self.container)

    def options(self, storage=None, state=None):
        return [*super().options(storage, state), "--apps", self.entries.folder]

    def client(self, **popen):
        client = super().client(**popen)
        self.assertIn(self.LIBRARY, [item["identifier"] for item in client.items(ROOT)])
        return client

    def document(self, *names):
        return os.path.join(self.library, *names)

    def test_a_library_takes_new_files_like_any_folder(self):
        self.make_file("Letters", "a", contents=b"A")
        client = self.client()
        imported = client.call("importDocument", path=self.outside_file("b", b"B"), parent=self.LIBRARY)
        made = client.call("createDirectory", name="new", parent=self.LIBRARY)
        moved = client.call("reparentItem", identifier=client.identifier(self.path("Letters", "a")), parent=self.LIBRARY, name="c")
        for item in (imported, made, moved):
            self.assertEqual(item["parentIdentifier"], self.LIBRARY)
        self.assertEqual(sorted(os.listdir(self.library)), ["Drafts", "b", "c", "new"])
        self.assert_collision(made["identifier"], client.call, "createDirectory", name="new", parent=self.LIBRARY)
        # Whole folders too, and back into the storage.
        for name in ("tree/a", "tree/sub/b"):
            self.outside_file(name, name.encode())
        tree = client.call("importDocument", path=os.path.join(self.outside, "tree"), parent=self.LIBRARY)
        self.assertEqual(tree_of(self.document("tree")), tree_of(os.path.join(self.outside, "tree")))
        client.call("deleteItem", identifier=tree["identifier"])
        back = client.call("reparentItem", identifier=moved["identifier"], parent=ROOT)
        self.assertEqual((back["identifier"], back["parentIdentifier"]), (moved["identifier"], ROOT))
        self.assertEqual(self.read("c"), b"A")
        self.assertEqual(sorted(os.listdir(self.library)), ["Drafts", "b", "new"])

    def test_a_library_stays_where_it_is(self):
        client = self.client()
        letters = client.identifier(self.path("Letters"))
        before = tree_of(self.container)
        for method, params in [("reparentItem", {"parent": letters}), ("renameItem", {"name": "new"}), ("trashItem", {}), ("deleteItem", {})]:
            with self.subTest(method=method):
                self.assert_error(GENERAL, 513, client.call, method, identifier=self.LIBRARY, **params)
        # The trash was made for what then could not be put there.
        if os.path.isdir(self.document(".Trash")):
            os.rmdir(self.document(".Trash"))
        self.assertEqual(tree_of(self.container), before)

    def test_the_date_of_a_library_is_not_kept(self):
        client = self.client()
        before = os.listxattr(self.library)
        for date in ("2026-11-20T09:52:00Z", None):
            item = client.call("setLastUsedDate", identifier=self.LIBRARY, date=date)
            self.assertEqual(item["identifier"], self.LIBRARY)
            self.assertNotIn("lastUsedDate", item)
        self.assertEqual(os.listxattr(self.library), before)

    def test_a_library_has_a_trash_of_its_own(self):
        client = self.client()
        novel = client.identifier(self.document("Drafts", "novel"))
        trashed = client.call("trashItem", identifier=novel)
        self.assertTrue(trashed["isTrashed"])
        self.assertIn(b"Drafts/novel", os.getxattr(self.document(".Trash", "novel"), PUT_BACK))
        self.assertFalse(os.path.exists(self.path(".Trash")))
        client.call("untrashItem", identifier=novel)
        self.assertTrue(os.path.exists(self.document("Drafts", "novel")))
        # Without the folder that it was in, it goes to the library, not to the storage.
        client.call("trashItem", identifier=novel)
        os.rmdir(self.document("Drafts"))
        self.assertEqual(client.call("untrashItem", identifier=novel)["parentIdentifier"], self.LIBRARY)
        client.call("trashItem", identifier=novel)
        self.assertEqual(client.call("removeTrashedItemsOlderThan", date="2999-01-01T00:00:00Z"), {})
        self.assertEqual(os.listdir(self.document(".Trash")), [])

    def test_an_application_leads_no_edit_outside(self):
        victim = os.path.dirname(self.outside_file("victim/a", b"untouched"))
        os.symlink(victim, self.document("way"))
        os.symlink(victim, self.document(".Trash"))
        os.symlink(victim, self.document(".TemporaryLocalFolder"))
        self.make_file("b")
        client = self.client()
        way, novel = client.identifier(self.document("way")), client.identifier(self.document("Drafts", "novel"))
        document = client.identifier(self.path("b"))
        before = tree_of(self.outside)
        for method, params in [("createDirectory", {"name": "new", "parent": way}), ("importDocument", {"path": self.path("b"), "parent": way}),
                               ("reparentItem", {"identifier": document, "parent": way}), ("trashItem", {"identifier": novel}),
                               ("removeTrashedItemsOlderThan", {"date": "2999-01-01T00:00:00Z"})]:
            with self.subTest(method=method), self.assertRaises(RpcError):
                client.call(method, **params)
        client.call("deleteItem", identifier=client.identifier(self.document("Drafts")))
        client.call("deleteItem", identifier=way)
        self.assertEqual(tree_of(self.outside), before)


if __name__ == "__main__":
    unittest.main()
