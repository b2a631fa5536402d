"""Questions across folders: what is found, in which order, and that it is always what is there."""

import json
import os
import subprocess
import sys
import threading
import unittest

sys.path.insert(0, os.path.dirname(__file__))

from cindral_rpc import ROOT, Client, RpcError, SystemTest, WORKING_SET  # noqa: E402


def names(items):
    return [item["filename"] for item in items]


class SearchTest(SystemTest):
    def found(self, client, method="search", **params):
        """The items of all pages."""
        items = []
        page = {}
        while True:
            answer = client.call(method, **params, **page)
            items += answer["items"]
            if answer["nextPage"] is None:
                return items
            page = {"page": answer["nextPage"]}

    def at(self, seconds, *name, contents=b""):
        path = self.make_file(*name, contents=contents)
        os.utime(path, (seconds, seconds))
        return path

    def test_finds_names_by_beginning_word_and_part_newest_first(self):
        for seconds, name in ((10, "Report"), (20, "reports.txt"), (5, "the report"), (90, "xreport"), (30, "réport")):
            self.at(seconds, "sub", name)
        client = self.client()
        self.assertEqual(names(self.found(client, text="REPORT")), ["réport", "reports.txt", "Report", "the report", "xreport"])
        self.assertEqual(names(self.found(client, text="REPORT", limit=1)), ["réport", "reports.txt", "Report", "the report", "xreport"])
        self.assertEqual(self.found(client, text="nothing"), [])
        self.assertEqual(self.found(client, text=""), [])
        self.assertEqual(self.found(client, text="a\0b"), [])

    def test_items_are_what_the_provider_says_of_them(self):
        self.make_file("folder", "report.txt", contents=b"12345")
        os.mkdir(self.path("report folder"))
        client = self.client()
        os.rename(self.path("folder"), self.path("moved"))
        items = self.found(client, text="report")
        self.assertEqual(len(items), 2)
        for item in items:
            self.assertEqual(item, client.call("itemForIdentifier", identifier=item["identifier"]))
        self.assertIn("/moved/report.txt", "".join(item["fileURL"] for item in items))

    def test_reads_its_own_writes(self):
        client = self.client()
        for number in range(40):
            path = self.make_file(f"write{number}.txt")
            self.assertEqual(names(self.found(client, text=f"write{number}.")), [f"write{number}.txt"])
            os.rename(path, self.path(f"renamed{number}"))
            self.assertEqual(self.found(client, text=f"write{number}."), [])
            self.assertEqual(names(self.found(client, text=f"renamed{number}")), [f"renamed{number}"])
            os.unlink(self.path(f"renamed{number}"))
            self.assertEqual(self.found(client, text=f"renamed{number}"), [])

    def test_recents_tags_favorites_and_trash(self):
        for seconds, name in ((10, "old"), (30, "new"), (20, "middle")):
            self.at(seconds, name)
        os.mkdir(self.path("folder"))
        self.make_file("folder", "inside")
        os.utime(self.path("folder", "inside"), (1, 1))
        client = self.client()
        self.assertEqual(names(self.found(client, "recents")), ["new", "middle", "old", "inside"])
        old, new = client.identifier(self.path("old")), client.identifier(self.path("new"))
        client.call("setLastUsedDate", identifier=old, date="2030-01-01T00:00:00Z")
        self.assertEqual(names(self.found(client, "recents", limit=1)), ["old", "new", "middle", "inside"])

        self.assertEqual(client.call("tags"), {"tags": []})
        client.call("setTags", identifier=old, tags=["red", "10"])
        client.call("setTags", identifier=new, tags=["red", "9"])
        self.assertEqual(names(self.found(client, "taggedItems", tag="red")), ["old", "new"])
        self.assertEqual(client.call("tags")["tags"],
                         [{"tag": "9", "count": 1}, {"tag": "10", "count": 1}, {"tag": "red", "count": 2}])

        client.call("setFavoriteRank", identifier=old, rank=2)
        client.call("setFavoriteRank", identifier=new, rank=1)
        self.assertEqual(names(self.found(client, "favorites")), ["new", "old"])

        client.call("trashItem", identifier=old)
        client.call("trashItem", identifier=client.identifier(self.path("folder")))
        self.assertEqual(sorted(names(self.found(client, "trashedItems"))), ["folder", "old"])
        self.assertEqual(names(self.found(client, "favorites")), ["new"])
        self.assertEqual(names(self.found(client, "recents")), ["new", "middle"])
        self.assertEqual(self.found(client, text="inside"), [], "it is in the trash with its folder")

    def test_sorts_a_folder(self):
        for size, name in ((3, "file10"), (1, "File9"), (2, "über"), (5, "zoo")):
            self.at(size, name, contents=b"x" * size)
        os.mkdir(self.path("Folder"))
        client = self.client()

        def view(**params):
            answer = client.call("sortedItems", container=ROOT, **params)
            self.assertEqual(answer["total"], 5)
            return names(answer["items"])

        self.assertEqual(view(), ["File9", "file10", "Folder", "über", "zoo"])
        self.assertEqual(view(descending=True), ["zoo", "über", "Folder", "file10", "File9"])
        self.assertEqual(view(sort="size", offset=1), ["File9", "über", "file10", "zoo"])
        self.assertEqual(view(sort="date", limit=2), ["File9", "über"])
        self.assertEqual(view(sort="kind")[0], "Folder")
        self.assertEqual(view(offset=5), [])
        self.assert_error("TesselErrorDomain", -1001, client.call, "sortedItems", container="fid=1")
        self.assert_refused(-32602, client.call, "sortedItems", container=ROOT, sort="color")
        self.assert_refused(-32602, client.call, "sortedItems", container=ROOT, descending=1)
        self.assert_refused(-32602, client.call, "sortedItems", container=ROOT, offset=-1)

    def test_pages_of_others_have_expired(self):
        for number in range(3):
            self.make_file(f"file{number}")
        client = self.client()
        page = client.call("search", text="file", limit=1)["nextPage"]
        self.assertEqual(len(client.call("search", text="file", limit=5, page=page)["items"]), 2)
        self.assert_error("TesselErrorDomain", -1002, client.call, "search", text="fil", page=page)
        self.assert_error("TesselErrorDomain", -1002, client.call, "recents", page=page)
        self.assert_error("TesselErrorDomain", -1002, client.call, "search", text="file", page="AAAA")
        self.assert_refused(-32602, client.call, "search", text="file", page="?")
        self.assert_refused(-32602, client.call, "search", text="file", limit=0)
        self.assert_refused(-32602, client.call, "search")

    def test_tells_when_a_watched_answer_changes(self):
        client = self.client()
        watch = client.call("watchQuery", query="search", text="wanted")["watch"]
        other = client.call("watchQuery", query="taggedItems", tag="never")["watch"]
        self.assertNotEqual(watch, other)
        self.make_file("unwanted but wanted")
        self.assertEqual(client.next_notification("queryChanged"), {"watch": watch})
        self.assertEqual(client.call("unwatchQuery", watch=watch), {})
        self.assert_refused(-32602, client.call, "unwatchQuery", watch=watch)
        self.assert_refused(-32602, client.call, "watchQuery", query="everything")
        folder = client.call("watchQuery", query="sortedItems", container=ROOT)["watch"]
        self.make_file("wanted too")
        self.assertEqual(client.next_notification("queryChanged"), {"watch": folder})

    def assert_index_is_whole(self, client):
        """What is listed as the working set is what can be found."""
        listed = {item["identifier"] for item in client.items(WORKING_SET) if not item["isTrashed"]}
        trashed = {item["identifier"] for item in client.items(WORKING_SET) if item["isTrashed"]}
        everything = set()
        for letter in "efo":
            everything |= {item["identifier"] for item in self.found(client, text=letter, limit=1000)}
        self.assertEqual(everything, listed)
        self.assertLessEqual({item["identifier"] for item in self.found(client, "trashedItems")}, trashed)

    def test_goes_on_after_a_restart_and_a_kill(self):
        for number in range(300):
            self.make_file(f"folder{number % 7}", f"file{number}")
        client = self.client()
        client.call("search", text="file")
        client.kill()
        os.rename(self.path("folder1"), self.path("folder2", "folder1"))
        self.make_file("folder2", "folder1", "file-new")
        client = self.client()
        self.assert_index_is_whole(client)
        self.assertNotIn("gathering the search index", client.error_text())
        client.finish()
        os.unlink(os.path.join(self.state, "search-index"))
        with open(os.path.join(self.state, "search-index"), "wb") as file:
            file.write(b"no database" * 1000)
        client = self.client()
        self.assert_index_is_whole(client)

    def test_survives_being_killed_while_it_gathers(self):
        for number in range(2000):
            self.make_file(f"folder{number % 40}", f"file{number}")
        for _ in range(6):
            client = self.client()
            client.send("search", text="file")
            client.send("status")
            client.next_message()
            client.kill()
        self.assert_index_is_whole(self.client())

    def test_gathers_anew_when_the_store_is_lost(self):
        for number in range(300):
            self.make_file("folder", f"file{number}")
        client = self.client()
        client.call("search", text="file")
        client.finish()
        for name in os.listdir(os.path.join(self.state, "store")):
            os.unlink(os.path.join(self.state, "store", name))
        self.make_file("folder", "file-new")
        os.unlink(self.path("folder", "file7"))
        self.assert_index_is_whole(self.client())

    def test_gets_to_the_end_while_files_are_deleted(self):
        # In one flat folder, where every deletion moves all the entries behind it.
        folder = self.make_files("folder", 6000)
        kept = {f"{number:05}.txt" for number in range(0, 6000, 3)}
        doomed = sorted(set(os.listdir(folder)) - kept)
        client = self.client()
        client.call("currentSyncAnchor", container=WORKING_SET)
        over = threading.Event()

        def delete():
            for name in doomed:
                if over.is_set():
                    return
                os.unlink(os.path.join(folder, name))

        deleting = threading.Thread(target=delete)
        deleting.start()
        self.addCleanup(deleting.join)
        self.addCleanup(over.set)
        found = set(names(self.found(client, text=".txt", limit=1000)))
        self.assertLessEqual(kept, found)
        over.set()
        deleting.join()
        self.assertEqual(set(names(self.found(client, text=".txt", limit=1000))), set(os.listdir(folder)))

    def test_names_of_any_bytes(self):
        for name in (b"bytes\xff\xfe", b"a\nb", "中文名字".encode(), b"\"quoted\" AND", b"per%cent_"):
            self.make_file(name)
        client = self.client()
        for text in ("bytes\ufffd", "A\nB", "文名", "字", "\"QUOTED\"", "%", "t_"):
            self.assertEqual(len(self.found(client, text=text)), 1, text)

    def test_the_temporary_folder_is_in_no_answer(self):
        """What an import puts together there least of all, also while it is at it."""
        source = os.path.join(self.folder, "source")
        os.makedirs(os.path.join(source, "report below"))
        for number in range(300):
            with open(os.path.join(source, "report below", f"report {number}"), "wb"):
                pass
        self.make_file(".TemporaryLocalFolder", "somebody's", "report.txt")
        os.mkdir(self.path("sub"))
        client = self.client()
        self.assertEqual(self.found(client, text="report"), [])
        self.assertEqual(self.found(client, text="temporary"), [])
        self.assertEqual(self.found(client, "recents"), [])
        self.assertEqual(names(client.call("sortedItems", container=ROOT)["items"]), ["sub"])
        imported = client.send("importDocument", path=source, parent=client.identifier(self.path("sub")))
        while imported not in client._early:
            for item in self.found(client, text="report"):
                self.assertNotIn(".TemporaryLocalFolder", item["fileURL"])
            client.call("status")
        self.assertIn("result", client.answer(imported))
        self.assertEqual(len(self.found(client, text="report")), 301)
        self.assertEqual(client.call("sortedItems", container=ROOT)["total"], 1)
        hidden = client.call("itemForIdentifier", identifier="TesselTemporaryLocalFolderItemIdentifier")["identifier"]
        self.assertEqual(client.call("sortedItems", container=hidden)["total"], 0)


class DesktopTagsTest(SystemTest):
    def desktop_tags(self, path):
        try:
            return os.getxattr(path, "user.xdg.tags").decode()
        except OSError:
            return None

    def sharing_client(self):
        client = Client([*self.options(), "--desktop-tags"], self.environment)
        self.addCleanup(client.__exit__)
        return client

    def test_are_left_alone_unless_asked_for(self):
        path = self.make_file("a.txt")
        os.setxattr(path, "user.xdg.tags", b"desktop")
        client = self.client()
        identifier = client.identifier(path)
        self.assertNotIn("tags", client.call("itemForIdentifier", identifier=identifier))
        client.call("setTags", identifier=identifier, tags=["own"])
        self.assertEqual(self.desktop_tags(path), "desktop")

    def test_are_read_and_written_with_ours(self):
        path = self.make_file("a.txt")
        os.setxattr(path, "user.xdg.tags", "work, zu Hause".encode())
        client = self.sharing_client()
        self.assertTrue(client.call("status")["desktopTags"])
        identifier = client.identifier(path)
        self.assertEqual(client.call("itemForIdentifier", identifier=identifier)["tags"], ["work", "zu Hause"])
        self.assertEqual(names(client.call("taggedItems", tag="work")["items"]), ["a.txt"])

        item = client.call("setTags", identifier=identifier, tags=["own", "with, comma"])
        self.assertEqual(item["tags"], ["own", "with, comma"])
        self.assertEqual(self.desktop_tags(path), "own")
        os.setxattr(path, "user.xdg.tags", b"later")
        self.assertEqual(client.call("itemForIdentifier", identifier=identifier)["tags"], ["own", "with, comma"])

        self.assertNotIn("tags", client.call("setTags", identifier=identifier, tags=[]))
        self.assertIsNone(self.desktop_tags(path))
        os.setxattr(path, "user.xdg.tags", b"again")
        self.assertEqual(names(client.call("taggedItems", tag="again")["items"]), ["a.txt"])

    def test_are_both_as_they_were_where_one_cannot_be_written(self):
        path = self.make_file("a.txt")
        os.setxattr(path, "user.xdg.tags", b"before")
        client = self.sharing_client()
        identifier = client.identifier(path)
        # The second is written, or taken away, when the first has been.
        for label in ("x" * 70000, "x," * 35000):
            error = self.assert_fails(client, "setTags", identifier=identifier, tags=[label])
            self.assertEqual(error.domain, "KsPOSIXErrorDomain")
            self.assertEqual(self.desktop_tags(path), "before")
        self.assertEqual(client.call("itemForIdentifier", identifier=identifier)["tags"], ["before"])

    def assert_fails(self, client, method, **params):
        with self.assertRaises(RpcError) as raised:
            client.call(method, **params)
        return raised.exception


class SearchCommandsTest(SystemTest):
    def lines(self, *words):
        status, out, err = self.run_program(*words)
        self.assertEqual((status, err), (0, b""))
        return out.decode().splitlines()

    def test_find(self):
        self.make_file("sub", "Report.txt")
        self.assertTrue(self.lines("find", "rép")[0].endswith(self.path("sub", "Report.txt")))
        self.assertEqual(self.lines("find", "nothing"), [])
        self.assertEqual([json.loads(line)["filename"] for line in self.lines("find", "REPORT", "--json")], ["Report.txt"])
        self.assertEqual(self.run_program("find")[0], 2)
        self.assertEqual(self.run_program("find", "x", "--limit", "0")[0], 2)

    def test_lists_more_than_a_page(self):
        self.make_files("folder", 450)
        self.assertEqual(len(self.lines("find", ".txt")), 450)
        self.assertEqual(len(self.lines("find", ".txt", "--limit", "201")), 201)

    def test_tags_favorites_recents_and_trash(self):
        path = self.make_file("a.txt")
        self.make_file("b.txt")
        self.lines("tag", "work", path)
        self.assertEqual([line.split() for line in self.lines("tags")], [["1", "work"]])
        self.assertEqual(self.lines("tags", path), ["work"])
        self.assertEqual(json.loads(self.lines("tags", "--json")[0]), {"tag": "work", "count": 1})
        self.assertTrue(self.lines("tagged", "work")[0].endswith("a.txt"))
        self.lines("favorite", path)
        self.assertTrue(self.lines("favorites")[0].endswith("a.txt"))
        self.assertEqual(len(self.lines("recents")), 2)
        self.assertEqual(self.lines("trash"), [])
        self.lines("trash", path)
        self.assertTrue(self.lines("trash")[0].endswith("a.txt"))
        self.assertEqual(len(self.lines("recents")), 1)


if __name__ == "__main__":
    unittest.main()
