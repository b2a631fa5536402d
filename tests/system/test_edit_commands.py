"""Edits on the command line: what people type, what is done, and what they are told."""

import json
import os
import pty
import subprocess
import unittest

from cindral_rpc import PATIENCE, PROGRAM, OutsideTest, all_of_terminal


class EditCommandsTest(OutsideTest):
    def setUp(self):
        super().setUp()
        os.mkdir(self.path("Letters"))

    def names(self, *folder):
        return sorted(name for name in os.listdir(self.path(*folder)) if not name.startswith("."))

    def do(self, *words, **run):
        """A command that works, in the storage; it says nothing unless asked to."""
        status, output, error = self.run_program(*words, cwd=self.storage, **run)
        self.assertEqual((status, error), (0, b""), words)
        return output.decode()

    def failure(self, *words, **run):
        """The lines of a command that fails."""
        status, output, error = self.run_program(*words, cwd=self.storage, **run)
        self.assertEqual((status, output), (1, b""), words)
        return error.decode().splitlines()

    def items(self, *words):
        return [json.loads(line) for line in self.do(*words, "--json").splitlines()]

    def assert_no_leftovers(self):
        self.assertEqual(os.listdir(self.path(".TemporaryLocalFolder")), [])

    def test_import_fills_an_empty_storage(self):
        file, folder = self.outside_file("a.txt", b"A"), os.path.dirname(self.outside_file("tree/b", b"B"))
        self.assertEqual(self.do("import", file, folder), "")
        self.assertEqual(self.names(), ["Letters", "a.txt", "tree"])
        self.assertEqual((self.read("a.txt"), self.read("tree", "b")), (b"A", b"B"))
        item = self.items("import", file, "--to", "Letters")[0]
        self.assertEqual((item["filename"], item["documentSize"]), ("a.txt", 1))
        self.assertEqual(self.failure("import", file), [f"cindral: {file}: {self.path('a.txt')} is in the way"])
        self.do("import", file, folder, "--keep-both")
        self.do("import", file, "--keep-both", "--to", "Letters")
        self.assertEqual(self.names(), ["Letters", "a 2.txt", "a.txt", "tree", "tree 2"])
        self.assertEqual(self.names("Letters"), ["a 2.txt", "a.txt"])
        self.assert_no_leftovers()

    def test_of_several_items_those_that_can_be_are_done(self):
        files = [self.outside_file(name) for name in ("a", "b", "c")]
        self.make_file("b", contents=b"in the way")
        lines = self.failure("import", files[0], "/nowhere/at all", files[1], files[2])
        self.assertEqual(lines, ["cindral: no such item: /nowhere/at all", f"cindral: {files[1]}: {self.path('b')} is in the way"])
        self.assertEqual(self.names(), ["Letters", "a", "b", "c"])
        self.assertEqual(self.read("b"), b"in the way")
        self.assertEqual(len(self.failure("rm", "a", "none", "b", "nothing")), 2)
        self.assertEqual(self.names(), ["Letters", "c"])

    def test_mkdir(self):
        self.do("mkdir", "New", "New/Inner", self.path("Letters", "Old"))
        self.do("mkdir", "a", "b", "--in", "Letters")
        self.assertEqual(self.names(), ["Letters", "New"])
        self.assertEqual(self.names("Letters"), ["Old", "a", "b"])
        self.assertEqual(self.failure("mkdir", "New"), [f"cindral: New: {self.path('New')} is in the way"])
        self.do("mkdir", "New", "Letters/a", "--keep-both")
        self.assertEqual(self.names(), ["Letters", "New", "New 2"])
        self.assertEqual(self.names("Letters"), ["Old", "a", "a 2", "b"])
        self.assertEqual(self.failure("mkdir", "none/new"), ["cindral: no such item: none/"])
        self.assertEqual(self.failure("mkdir", "..", "--in", "Letters"), ["cindral: ..: Invalid argument"])
        self.assert_no_leftovers()

    def test_rename_and_mv(self):
        for name in ("a.txt", "b.txt"):
            self.make_file(name, contents=name.encode())
        self.do("rename", "a.txt", "c.txt")
        self.assertEqual(self.failure("rename", "b.txt", "c.txt"), [f"cindral: b.txt: {self.path('c.txt')} is in the way"])
        self.do("rename", "b.txt", "c.txt", "--keep-both")
        self.assertEqual((self.read("c.txt"), self.read("c 2.txt")), (b"a.txt", b"b.txt"))
        self.do("mv", "c.txt", "c 2.txt", "Letters")
        self.assertEqual(self.names(), ["Letters"])
        self.make_file("c.txt", contents=b"new")
        self.assertEqual(self.failure("mv", "c.txt", "Letters"), [f"cindral: c.txt: {self.path('Letters', 'c.txt')} is in the way"])
        self.do("mv", "c.txt", "Letters", "--keep-both")
        self.assertEqual(self.names("Letters"), ["c 2.txt", "c 3.txt", "c.txt"])
        # To the storage itself, and by identifier.
        identifier = self.do("id", "Letters/c 3.txt").strip()
        self.do("mv", identifier, self.storage)
        self.assertEqual(self.read("c 3.txt"), b"new")
        self.assertEqual(self.failure("mv", "Letters", "Letters"), ["cindral: Letters: Invalid argument"])
        self.assertEqual(self.failure("mv", "c 3.txt", "none"), ["cindral: no such item: none"])

    def test_trash_restore_and_empty(self):
        self.make_file("Letters", "a.txt", contents=b"first")
        self.do("trash", "Letters/a.txt")
        # Each name is in the trash once: what comes later is given another.
        for contents in (b"second", b"third"):
            self.make_file("Letters", "a.txt", contents=contents)
            self.do("trash", "Letters/a.txt")
        self.assertEqual(sorted(os.listdir(self.path(".Trash"))), ["a 2.txt", "a 3.txt", "a.txt"])
        self.do("restore", ".Trash/a 2.txt")
        self.do("restore", ".Trash/a.txt", "--to", self.storage)
        self.assertEqual((self.read("Letters", "a 2.txt"), self.read("a.txt")), (b"second", b"first"))
        self.assertEqual(self.failure("restore", "a.txt"), ["cindral: a.txt: A parameter is not valid"])
        self.do("empty-trash", "--older-than", "1h")
        self.assertEqual(os.listdir(self.path(".Trash")), ["a 3.txt"])
        self.do("empty-trash")
        self.assertEqual(os.listdir(self.path(".Trash")), [])

    def test_metadata(self):
        self.make_file("a")
        self.make_file("b")
        self.do("tag", "green", "a", "b")
        self.do("tag", "to do", "a")
        self.do("tag", "green", "a")
        self.assertEqual(self.do("tags", "a"), "green\nto do\n")
        self.assertEqual(self.do("tags", "a", "b"), "a  green\na  to do\nb  green\n")
        self.do("untag", "green", "a", "b")
        self.assertEqual(self.do("tags", "a", "b"), "a  to do\n")
        self.assertEqual([item["favoriteRank"] for item in self.items("favorite", "a", "b", "--rank", "7")], [7, 7])
        self.assertNotIn("favoriteRank", self.items("unfavorite", "a")[0])
        self.assertIn("lastUsedDate", self.items("touch-used", "a")[0])
        self.assertEqual(self.items("touch-used", "a", "--date", "2026-11-20")[0]["lastUsedDate"], "2026-11-20T00:00:00Z")
        self.assertNotIn("lastUsedDate", self.items("touch-used", "a", "--clear")[0])

    def test_names_cannot_write_to_the_screen(self):
        self.make_file(b"\x1b[2J\n")
        self.make_file("Letters", b"\x1b[2J\n".decode())
        lines = self.failure("mv", "\x1b[2J\n", "Letters")
        self.assertEqual(lines, [f"cindral: \\x1B[2J\\x0A: {self.path('Letters')}/\\x1B[2J\\x0A is in the way"])

    def on_terminal(self, *words, typed=b""):
        """Exit status and what a command says where a person sits at it."""
        controller, terminal = pty.openpty()
        process = subprocess.Popen([PROGRAM, *words, *self.options()], env=self.environment, cwd=self.storage, stdin=terminal, stdout=terminal,
                                   stderr=terminal)
        os.close(terminal)
        os.write(controller, typed)
        text = all_of_terminal(controller)
        return process.wait(timeout=PATIENCE), text.decode()

    def test_rm_asks_a_person(self):
        for name in ("a", "b"):
            self.make_file(name)
        status, said = self.on_terminal("rm", "a", typed=b"n\n")
        self.assertEqual(status, 0)
        self.assertIn("Delete a for good? [y/N] ", said)
        self.assertEqual(self.names(), ["Letters", "a", "b"])
        self.on_terminal("rm", "a", "b", typed=b"\n")
        self.assertEqual(self.names(), ["Letters", "a", "b"])
        self.assertIn("Delete 2 items for good? [y/N] ", self.on_terminal("rm", "a", "b", typed=b"y\n")[1])
        self.assertEqual(self.names(), ["Letters"])
        self.make_file("a")
        self.assertNotIn("good", self.on_terminal("rm", "a", "--yes")[1])
        self.make_file("a")
        # Where nobody can be asked, nobody is.
        self.do("rm", "a")
        self.assertEqual(self.names(), ["Letters"])

    def test_a_person_sees_how_far_it_is(self):
        file = os.path.join(self.outside, "big")
        with open(file, "wb") as big:
            big.write(os.urandom(2 << 20))
        status, said = self.on_terminal("import", file)
        self.assertEqual(status, 0)
        self.assertIn("%  ", said)
        self.assertTrue(said.endswith("\r\x1b[K"), said)

    def test_an_empty_trash_asks_too(self):
        self.make_file("a")
        self.do("trash", "a")
        self.on_terminal("empty-trash", typed=b"n\n")
        self.assertEqual(os.listdir(self.path(".Trash")), ["a"])
        self.on_terminal("empty-trash", typed=b"y\n")
        self.assertEqual(os.listdir(self.path(".Trash")), [])


if __name__ == "__main__":
    unittest.main()
