"""What people see on the command line."""

import json
import os
import pty
import subprocess
import unittest

from cindral_rpc import PROGRAM, ROOT, SystemTest, all_of_terminal


class CommandsTest(SystemTest):
    def setUp(self):
        super().setUp()
        self.make_file("notes.txt", contents=b"x" * 1_234_567)
        self.make_file("sub", "deep", "last.txt")
        self.make_file("sub", "one.txt")
        os.symlink("sub", self.path("link"))
        os.utime(self.path("notes.txt"), ns=(0, 1_795_168_320 * 10**9))
        self.environment["TZ"] = "UTC"

    def output(self, *words, **run):
        """What a command that works prints; it says nothing else."""
        status, output, error = self.run_program(*words, **run)
        self.assertEqual((status, error), (0, b""))
        return output.decode()

    def failure(self, *words, **run):
        """What a command that fails says."""
        status, output, error = self.run_program(*words, **run)
        self.assertEqual((status, output), (1, b""))
        return error.decode().splitlines()[-1]

    def values(self, *words):
        return [json.loads(line) for line in self.output(*words, "--json").splitlines()]

    def test_ls_lists_with_columns(self):
        lines = self.output("ls").splitlines()
        self.assertEqual(sorted(line.split()[-1] for line in lines), ["link", "notes.txt", "sub"])
        self.assertIn("-rwmntd       1.2 MB  2026-11-20 09:52  notes.txt", lines)
        self.assertEqual({line.split()[-1]: line[0] for line in lines}, {"link": "l", "notes.txt": "-", "sub": "d"})

    def test_ls_lists_folders_of_any_size(self):
        self.make_files("many", 1000)
        self.assertEqual(len(self.output("ls", self.path("many")).splitlines()), 1000)
        self.assertEqual(len(self.values("ls", self.path("many"))), 1000)

    def test_items_are_named_by_identifier_or_path(self):
        identifier = self.output("id", "sub", cwd=self.storage).strip()
        self.assertEqual(identifier, f"fid={os.stat(self.path('sub')).st_ino}")
        expected = self.output("ls", identifier)
        for item in ("sub", "./sub", self.path("sub"), self.path("sub", "deep", "..")):
            self.assertEqual(self.output("ls", item, cwd=self.storage), expected)
        self.assertEqual(self.run_program("id", self.storage)[:2], (0, ROOT.encode() + b"\n"))

    def test_a_file_may_be_called_like_an_identifier(self):
        self.make_file("did=1")
        identifier = self.output("id", "did=1", cwd=self.storage).strip()
        self.assertEqual(self.output("url", "./did=1", cwd=self.storage), f"file://{self.path('did%3D1')}\n")
        self.assertEqual(self.values("info", identifier)[0]["filename"], "did=1")

    def test_tree_draws_what_is_below(self):
        lines = self.output("tree").splitlines()
        self.assertEqual(lines[0], self.storage)
        self.assertEqual(lines[-1], "2 folders, 3 documents, 1 other item")
        drawn = "\n".join(lines)
        for part in ("── sub\n", "── deep\n", "── last.txt\n", "── link\n"):
            self.assertIn(part, drawn)
        self.assertEqual({value["filename"] for value in self.values("tree")}, {"notes.txt", "sub", "deep", "last.txt", "one.txt", "link"})

    def test_tree_draws_folders_of_any_size(self):
        self.make_files("many", 1000)
        self.assertEqual(self.output("tree").splitlines()[-1], "3 folders, 1003 documents, 1 other item")

    def test_info_shows_every_field(self):
        value = self.values("info", self.path("notes.txt"))[0]
        text = self.output("info", self.path("notes.txt"))
        self.assertEqual({line.split()[0] for line in text.splitlines()}, set(value))
        self.assertEqual(value["documentSize"], 1_234_567)

    def test_url_id_anchor_and_status_as_json(self):
        identifier = self.values("id", self.path("sub"))[0]["identifier"]
        self.assertEqual(self.values("url", identifier), [{"url": "file://" + self.path("sub")}])
        self.assertEqual(list(self.values("anchor", identifier)[0]), ["anchor"])
        self.assertEqual(self.values("status")[0]["storage"], self.storage)
        self.assertIn(self.storage, self.output("status"))

    def test_what_is_not_there_is_said_in_one_line(self):
        for command in ("ls", "tree", "info", "url", "anchor"):
            self.assertEqual(self.failure(command, "fid=999999999999"), "cindral: no such item: fid=999999999999")
            self.assertEqual(self.failure(command, "none", cwd=self.storage), "cindral: no such item: none")
        self.assertEqual(self.failure("id", "no\nne", cwd=self.storage), "cindral: no such item: no\\x0Ane")

    def test_wrong_words_are_said_in_one_line(self):
        for words in (["frobnicate"], ["ls", "--frobnicate"], ["info"], ["--recorder", "magic", "ls"], ["ls", "a", "b"]):
            status, output, error = self.run_program(*words)
            self.assertEqual((status, output, error.count(b"\n")), (2, b"", 1), words)
            self.assertTrue(error.startswith(b"cindral: "), error)

    def test_version_and_help(self):
        for words in (["--version"], ["--help"], ["ls", "--help"], ["tree", "--help"], ["rpc", "--help"]):
            done = subprocess.run([PROGRAM, *words], env=self.environment, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=120, check=True)
            self.assertTrue(done.stdout)
            self.assertEqual(done.stderr, b"")

    def test_names_cannot_write_to_the_screen(self):
        self.make_file(b"odd", b"\x1b[2Jboo\n\xff")
        for command in ("ls", "tree"):
            self.assertIn("\\x1B[2Jboo\\x0A\\xFF\n", self.output(command, self.path("odd")))

    def on_terminal(self, *words, **environment):
        """What a command prints where standard output is a terminal."""
        controller, terminal = pty.openpty()
        process = subprocess.Popen([PROGRAM, *words, *self.options()], env={**self.environment, "TERM": "xterm", **environment}, stdout=terminal,
                                   stdin=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        os.close(terminal)
        text = all_of_terminal(controller)
        self.assertEqual(process.wait(timeout=120), 0)
        return text

    def test_color_is_for_terminals(self):
        self.assertIn(b"\x1b[", self.on_terminal("ls"))
        self.assertNotIn(b"\x1b[", self.on_terminal("ls", NO_COLOR="1"))
        self.assertNotIn(b"\x1b[", self.on_terminal("ls", TERM="dumb"))
        self.assertNotIn("\x1b[", self.output("ls"))

    def test_a_reader_that_leaves_is_no_failure(self):
        self.make_files("many", 5000)
        process = subprocess.Popen([PROGRAM, "ls", self.path("many"), "--json", *self.options()], env=self.environment, stdout=subprocess.PIPE,
                                   stderr=subprocess.PIPE)
        process.stdout.readline()
        process.stdout.close()
        self.assertEqual((process.wait(timeout=120), process.stderr.read()), (0, b""))
        process.stderr.close()

    def test_output_that_cannot_be_written_is_a_failure(self):
        with open("/dev/full", "wb") as full:
            done = subprocess.run([PROGRAM, "ls", *self.options()], env=self.environment, stdout=full, stderr=subprocess.PIPE, timeout=120, check=False)
        self.assertEqual((done.returncode, done.stderr), (1, b"cindral: can't write to standard output: No space left on device\n"))


if __name__ == "__main__":
    unittest.main()
