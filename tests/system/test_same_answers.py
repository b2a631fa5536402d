"""What a command says and does is the same by a daemon and alone."""

import json
import os
import re
import shutil
import struct
import zlib

from cindral_rpc import OutsideTest

# What can't be the same twice, whoever answers: what a moment, a process or an object's own number says.
CHANGING = [
    (rb'"(creationDate|contentModificationDate|lastUsedDate)":"[^"]*"', rb'"\1":"DATE"'),
    (rb"^(creationDate|contentModificationDate|lastUsedDate) .*$", rb"\1 DATE"),
    (rb'"versionIdentifier":"[^"]*"', rb'"versionIdentifier":"VERSION"'),
    (rb"^versionIdentifier .*$", rb"versionIdentifier VERSION"),
    (rb'"(fileID|docID)":\d+', rb'"\1":NUMBER'),
    (rb"^(fileID|docID) .*$", rb"\1 NUMBER"),
    (rb"(did|fid)=\d+", rb"\1=NUMBER"),
    (rb"\d{4}-\d\d-\d\d \d\d:\d\d", rb"MINUTE"),
]


def picture():
    def chunk(kind, data):
        return struct.pack(">I", len(data)) + kind + data + struct.pack(">I", zlib.crc32(kind + data))
    return (b"\x89PNG\r\n\x1a\n" + chunk(b"IHDR", struct.pack(">IIBBBBB", 1, 1, 8, 0, 0, 0, 0)) +
            chunk(b"IDAT", zlib.compress(b"\0\0")) + chunk(b"IEND", b""))


# What the provider logs is said where the provider is.
LOG_LINE = re.compile(rb"^\d{4}-\d\d-\d\dT[\d:.]+Z \w+ .*\n", re.MULTILINE)


class SameAnswersTest(OutsideTest):
    def setUp(self):
        super().setUp()
        self.environment["TZ"] = "UTC"
        self.make_tree(self.storage)

    def make_tree(self, storage):
        self.storage = storage
        self.make_file("notes.txt", contents=b"x" * 1_234_567)
        self.make_file("sub", "one.txt", contents=b"1")
        self.make_file("sub", "deep", "last.txt")
        self.make_file("sub", "not utf-8 \udcff\udcfe", contents=b"?")
        self.make_file("sub", "line\nbreak \x1b[31m \u202e")
        self.make_file("sub", "real replacement \ufffd")
        self.make_file("sub", b"\xff".decode("utf-8", "surrogateescape"), "below")
        self.make_file("sub", "report.folio", "contents")
        self.make_file("did=1")
        self.make_files("many", 450)
        os.symlink("sub", self.path("link"))
        os.mkfifo(self.path("fifo"))
        self.make_file(".Trash", "gone.txt")
        os.utime(self.path("notes.txt"), ns=(0, 1_795_168_320 * 10**9 + 123_456_789))

    def answer_to(self, *words, **run):
        """A command's exit status, standard output, and error line."""
        status, output, error = self.run_program(*words, **run)
        return status, output, LOG_LINE.sub(b"", error)

    def both(self, *words, **run):
        """The answers alone and by the daemon: exit status, standard output, and the error line."""
        answers = []
        for daemon in (False, True):
            served = self.daemon() if daemon else None
            answers.append(self.answer_to(*words, **run))
            if served is not None:
                self.assertEqual(served.stop(), 0)
        return answers

    def assert_same(self, *words, **run):
        alone, served = self.both(*words, **run)
        self.assertEqual(alone, served, words)
        return alone

    def lookups(self):
        notes = self.path("notes.txt")
        return [
            ["ls"], ["ls", self.path("sub")], ["ls", self.path("many")], ["ls", notes], ["ls", "TesselWorkingSetContainerItemIdentifier"],
            ["tree"], ["tree", "--packages"], ["tree", self.path("sub")], ["tree", notes],
            ["info"], ["info", notes], ["info", self.path("sub")], ["info", self.path("sub", "not utf-8 \udcff\udcfe")],
            ["info", self.path("sub", "real replacement \ufffd")], ["info", self.path("fifo")], ["info", self.path("link")],
            ["url", notes], ["url", self.path("sub", b"\xff".decode("utf-8", "surrogateescape"), "below")],
            ["id", notes], ["id", self.storage], ["id", "did=1"], ["id", "sub/../notes.txt"], ["url", "./did=1"],
            ["anchor"], ["anchor", self.path("sub")],
            ["tags", notes], ["apps"],
            ["find", "notes"], ["find", "o"], ["find", "nothing of the kind"], ["find", "line", "--limit", "3"], ["recents"], ["favorites"],
            ["tags"], ["tagged", "no such tag"], ["trash"],
            # And what fails.
            ["ls", "nothing"], ["ls", "nothing/\udcff"], ["info", "did=4294967295"], ["info", "did=\udcff"], ["url", "fid=1"],
            ["id", ""], ["id", "/etc"], ["anchor", "fid=1"], ["anchor", notes], ["changes", "--since", "!"], ["changes", "--since", "AAAA"],
            ["changes", notes, "--since", "AAAA"], ["thumbnail", notes, "-o", "-"], ["thumbnail", "nothing", "-o", "-"],
            ["apps", "enable", "org.example.Nothing"], ["watch", notes], ["watch", "nothing"],
        ]

    def test_lookups_answer_the_same_byte_for_byte(self):
        # The first look gives the numbers that all others see.
        self.run_program("tree")
        wanted = [[*words, *form] for words in self.lookups() for form in ([], ["--json"])]
        alone = [self.answer_to(*words, cwd=self.storage) for words in wanted]
        served = self.daemon()
        for words, expected in zip(wanted, alone):
            with self.subTest(words=words):
                self.assertEqual(self.answer_to(*words, cwd=self.storage), expected)
        self.assertEqual(served.stop(), 0)
        statuses = {status for status, _, _ in alone}
        self.assertEqual(statuses, {0, 1, 2}, "there is one of each")

    def test_status_says_the_same(self):
        # A search looks at everything, and a daemon gets ready for one by itself.
        self.assertEqual(self.run_program("find", "one")[0], 0)
        self.run_program("anchor")
        for form in ([], ["--json"]):
            self.assert_same("status", *form)

    def test_changes_since_an_anchor_are_the_same(self):
        _, anchor, _ = self.run_program("anchor")
        self.make_file("new.txt")
        os.rename(self.path("notes.txt"), self.path("sub", "moved.txt"))
        shutil.rmtree(self.path("many"))
        for form in ([], ["--json"]):
            # How far it came is told last; what takes its time, as the end of a document's number does, makes the second come further.
            answers = [(status, re.sub(rb"[A-Za-z0-9+/=]{100,}", b"ANCHOR", output), error)
                       for status, output, error in self.both("changes", "--since", anchor.decode().strip(), *form)]
            self.assertEqual(*answers)
            status, output, _ = answers[0]
            self.assertEqual(status, 0)
            self.assertEqual(output.count(b"ANCHOR"), 1)
            self.assertGreater(len(output.splitlines()), 2)

    def edits(self):
        return [
            ["mkdir", self.path("sub", "made")], ["mkdir", self.path("sub", "made")], ["mkdir", self.path("top")],
            ["mkdir", self.path("sub", "bytes \udcff")], ["mkdir", self.path("sub", "bytes \udcff")], ["mkdir", self.path("sub", "n" * 300)],
            ["mkdir", self.path("nowhere", "made")], ["mkdir", "--keep-both", self.path("sub", "made")],
            ["import", os.path.join(self.outside, "in.txt")], ["import", os.path.join(self.outside, "in.txt")],
            ["import", os.path.join(self.outside, "in.txt"), "--to", self.path("sub")],
            ["import", os.path.join(self.outside, "bytes \udcff"), "--to", self.path("sub")],
            ["import", os.path.join(self.outside, "in.txt"), "--to", self.path("sub"), "--keep-both"],
            ["import", os.path.join(self.outside, "tree")], ["import", os.path.join(self.outside, "nothing"), self.path("fifo")],
            ["rename", self.path("sub", "one.txt"), "two.txt"], ["rename", self.path("sub", "two.txt"), "a/b"],
            ["rename", self.path("sub", "two.txt"), "bytes \udcfe"], ["rename", self.path("sub", "bytes \udcfe"), ""],
            ["mv", self.path("sub", "bytes \udcfe"), self.path("sub", "deep")], ["mv", self.path("notes.txt"), "nowhere"],
            ["mv", self.path("sub"), self.path("sub", "deep")],
            ["tag", "red", self.path("notes.txt")], ["tag", "blue \u00e9", self.path("notes.txt")], ["tags", self.path("notes.txt")],
            ["tag", "bytes \udcff", self.path("notes.txt")], ["tags", self.path("notes.txt")],
            ["untag", "red", self.path("notes.txt"), self.path("sub")], ["favorite", self.path("notes.txt"), "--rank", "7"],
            ["favorite", self.path("sub", "deep", "last.txt")], ["unfavorite", self.path("notes.txt"), "nothing"],
            ["touch-used", self.path("notes.txt"), "--date", "2026-01-02T03:04:05.678Z"], ["info", self.path("notes.txt")],
            ["trash", self.path("notes.txt"), self.path("sub", "deep"), "nothing"], ["trash", self.path(".Trash", "gone.txt")],
            ["restore", self.path(".Trash", "notes.txt")], ["restore", self.path(".Trash", "gone.txt"), "--to", self.path("sub")],
            ["restore", self.path("many")],
            ["rm", "--yes", self.path("many", "00001.txt"), "nothing", self.path("link")], ["rm", "--yes", self.path("many")],
            ["empty-trash", "--yes", "--older-than", "1h"], ["empty-trash", "--yes"], ["tree"],
        ]

    def run_edits(self, folder):
        """What each edit says, and the tree that they leave, on a storage of their own; what is its own is left out."""
        os.mkdir(os.path.join(self.folder, folder))
        self.state = os.path.join(self.folder, folder, "state")
        os.mkdir(os.path.join(self.folder, folder, "Documents"))
        self.make_tree(os.path.join(self.folder, folder, "Documents"))
        served = self.daemon() if folder == "served" else None
        said = []
        for words in self.edits():
            for form in ([], ["--json"]):
                # Twice is mostly another error: that the name is taken, that it is gone.
                said.append((words, self.answer_to(*words, *form)))
        if served is not None:
            self.assertEqual(served.stop(), 0)
        return said

    def neutral(self, text, folder):
        text = text.replace(os.fsencode(os.path.join(self.folder, folder)), b"FOLDER")
        for pattern, replacement in CHANGING:
            text = re.sub(pattern, replacement, text, flags=re.MULTILINE)
        return text

    def test_edits_do_and_say_the_same(self):
        self.outside_file("in.txt")
        self.outside_file("bytes \udcff")
        self.outside_file("tree/below/file")
        answers = {folder: self.run_edits(folder) for folder in ("itself", "served")}
        for (words, alone), (_, served) in zip(answers["itself"], answers["served"]):
            with self.subTest(words=words):
                self.assertEqual([self.neutral(text, "served") for text in served[1:]], [self.neutral(text, "itself") for text in alone[1:]])
                self.assertEqual(served[0], alone[0])
        self.assertEqual({status for _, (status, _, _) in answers["served"]}, {0, 1})

    def test_thumbnails_are_the_same(self):
        icons = os.path.join(self.folder, "container", "Documents")
        os.makedirs(icons)
        entries = os.path.join(self.folder, "entries")
        os.mkdir(entries)
        with open(os.path.join(self.folder, "icon.png"), "wb") as file:
            file.write(picture())
        with open(os.path.join(entries, "org.example.Pictures.desktop"), "w", encoding="utf-8") as file:
            file.write("[Desktop Entry]\nType=Application\nName=Pictures\nExec=true\nX-Cindral-SupportsDocumentBrowser=true\n"
                       f"Icon={self.folder}/icon.png\nX-Cindral-DataContainer={self.folder}/container\n")
        words = ["--apps", entries]
        alone = [self.run_program(*command, *words) for command in
                 (["ls"], ["thumbnail", "#org.example.Pictures", "-o", "-"], ["apps"], ["info", "#org.example.Pictures", "--json"])]
        served = self.daemon(*words)
        by_daemon = [self.run_program(*command) for command in
                     (["ls"], ["thumbnail", "#org.example.Pictures", "-o", "-"], ["apps"], ["info", "#org.example.Pictures", "--json"])]
        self.assertEqual(by_daemon, alone)
        self.assertEqual([status for status, _, _ in alone], [0] * 4)
        self.assertTrue(alone[1][1].startswith(b"\x89PNG"))
        self.assertEqual(served.stop(), 0)

    def test_a_client_on_standard_input_is_served_by_the_daemon(self):
        with self.client() as alone:
            expected = sorted(alone.named().items())
        served = self.daemon()
        clients = [self.client() for _ in range(3)]
        for client in clients:
            self.assertEqual(sorted(client.named().items()), expected)
        request = clients[0].send("enumerateItems", container=clients[0].identifier(self.path("many")))
        self.assertEqual(clients[0].finish(), 0)
        self.assertEqual(len(clients[0].answer(request)["result"]["items"]), 200)
        self.assertEqual(served.stop(), 0)
        # Everything was answered; that the daemon has gone is the news.
        for client in clients[1:]:
            self.assertEqual(client.finish(), 1)
            self.assertEqual(client.error_text(), "cindral: the connection to the daemon was lost\n")


