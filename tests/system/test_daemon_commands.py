"""Commands and the daemon: how they find it, agree with it, wait for it and interrupt it."""

import fcntl
import os
import pty
import shutil
import signal
import subprocess
import threading
import unittest

from cindral_rpc import PATIENCE, PROGRAM, ROOT, Daemon, SystemTest, all_of_terminal


class DaemonCommandsTest(SystemTest):
    def setUp(self):
        super().setUp()
        self.make_file("notes.txt", contents=b"notes")

    def start_program(self, *words, **popen):
        process = subprocess.Popen([PROGRAM, *words, *self.options()], env=self.environment, stdin=subprocess.DEVNULL,
                                   stdout=subprocess.PIPE, stderr=subprocess.PIPE, **popen)
        self.addCleanup(process.communicate)
        self.addCleanup(process.kill)
        return process

    def run_words(self, *words):
        """A command's answer with exactly these words."""
        done = subprocess.run([PROGRAM, *words], env=self.environment, timeout=PATIENCE, stdin=subprocess.DEVNULL,
                              stdout=subprocess.PIPE, stderr=subprocess.PIPE, check=False)
        return done.returncode, done.stdout, done.stderr

    # Agreement.

    def test_what_the_call_does_not_say_is_as_the_daemon_has_it(self):
        self.daemon("--no-flatpak")
        expected = self.run_program("ls")
        self.assertEqual(expected[0], 0)
        self.assertEqual(self.run_words("ls", "--state", self.state), expected)
        self.assertEqual(self.run_words("id", self.storage, "--state", self.state)[1], ROOT.encode() + b"\n")

    def test_words_that_contradict_the_daemon_are_told(self):
        entries, others = (os.path.join(self.folder, name) for name in ("entries", "others"))
        for folder in (entries, others):
            os.mkdir(folder)
        daemon = self.daemon("--apps", entries, "--recorder", "inotify")
        who = f"cindral: the daemon that runs (process {daemon.process.pid}) "
        for words, what in [
                (["--storage", entries], f"has the storage {self.storage}, not {entries}"),
                (["--storage", "/nowhere"], f"has the storage {self.storage}, not /nowhere"),
                (["--apps", others], f"has the application folders {entries}, not {others}"),
                (["--apps", entries, "--apps", others], f"has the application folders {entries}, not {entries}, {others}"),
                (["--no-flatpak"], "reads Flatpak's applications"),
                (["--recorder", "fanotify"], "has the recorder inotify, not fanotify")]:
            for command in (["ls"], ["apps"], ["rpc"], ["mkdir", "new"]):
                with self.subTest(words=words, command=command):
                    self.assertEqual(self.run_words(*command, "--state", self.state, *words), (1, b"", f"{who}{what}\n".encode()))
        same = ["--storage", os.path.join(self.storage, "."), "--apps", entries + "/", "--recorder", "inotify"]
        self.assertEqual(self.run_words("ls", "--state", self.state, *same)[0], 0)

    def test_the_storage_may_be_named_by_a_link(self):
        link = os.path.join(self.folder, "link")
        os.symlink(self.storage, link)
        self.daemon(storage=link)
        for words in (["--storage", link], []):
            self.assertEqual(self.run_words("id", link, "--state", self.state, *words)[:2], (0, ROOT.encode() + b"\n"))
            status, output, _ = self.run_words("url", os.path.join(link, "notes.txt"), "--state", self.state, *words)
            self.assertEqual((status, output), (0, f"file://{self.path('notes.txt')}\n".encode()))

    # Beginning and end.

    def test_a_command_waits_for_a_daemon_that_begins_or_ends(self):
        self.run_program("ls")
        folder = os.open(self.state, os.O_RDONLY)
        self.addCleanup(os.close, folder)
        # As a daemon does before it has the store's lock, and after it has stopped listening.
        fcntl.flock(folder, fcntl.LOCK_EX)
        process = self.start_program("ls")
        # Asleep in the kernel, and nowhere else than on the lock.
        while f"flock {process.pid}".encode() not in self.waiting_locks():
            self.assertIsNone(process.poll())
        daemon = self.daemon_that_waits()
        fcntl.flock(folder, fcntl.LOCK_UN)
        self.assertTrue(process.communicate(timeout=PATIENCE)[0])
        self.assertEqual(process.returncode, 0)
        daemon.__exit__()

    def waiting_locks(self):
        """Who waits for a flock, as "flock PID", a line each."""
        with open("/proc/locks", "rb") as locks:
            fields = [line.split() for line in locks]
        return b"\n".join(b"flock " + line[5] for line in fields if line[1] == b"->" and line[2] == b"FLOCK")

    def daemon_that_waits(self):
        """A daemon that has begun; whether it comes to serve is its own affair."""
        words = [PROGRAM, "serve", *self.options()]
        process = subprocess.Popen(words, env=self.environment, stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)

        class Ending:
            @staticmethod
            def __exit__():
                process.kill()
                process.wait()
        self.addCleanup(Ending.__exit__)
        while f"flock {process.pid}".encode() not in self.waiting_locks():
            self.assertIsNone(process.poll())
        return Ending

    def test_commands_go_on_while_daemons_come_and_go(self):
        stop = threading.Event()
        failures = []

        def commands():
            while not stop.is_set():
                status, output, error = self.run_program("ls")
                if (status, error) != (0, b"") or b"notes.txt" not in output:
                    failures.append((status, output, error))
        thread = threading.Thread(target=commands)
        thread.start()
        for number in range(8):
            # A command that is alone holds the store for its moment: then the daemon is refused.
            daemon = Daemon(self.options(), self.environment)
            if daemon.is_serving:
                self.assertEqual(daemon.stop(signal.SIGTERM if number % 2 else signal.SIGINT), 0)
            else:
                self.assertEqual(daemon.status(), 1)
        stop.set()
        thread.join()
        self.assertEqual(failures, [])

    def test_a_state_folder_in_use_by_a_command_is_told(self):
        alone = self.client()
        alone.call("status")
        self.assertEqual(self.run_program("ls"),
                         (1, b"", f"cindral: the state folder {self.state} is in use by process {alone.process.pid}\n".encode()))

    # Following and interrupting.

    def keep_changing(self, heard):
        """What a watch is told of once it has begun, whenever that is."""
        while not heard.is_set():
            os.utime(self.path("notes.txt"))

    def test_watch_follows_by_the_daemon(self):
        daemon = self.daemon()
        watching = self.start_program("watch")
        # Whether it has begun can be told by what it says.
        lines = iter(watching.stdout.readline, b"")
        heard = threading.Event()
        thread = threading.Thread(target=self.keep_changing, args=(heard,))
        thread.start()
        self.assertEqual(next(lines), b"updated  notes.txt\n")
        heard.set()
        thread.join()
        self.make_file("last.txt")
        while next(lines) != b"updated  last.txt\n":
            pass
        other = self.start_program("watch", "--json")
        watching.send_signal(signal.SIGINT)
        self.assertEqual(watching.wait(timeout=PATIENCE), 0)
        other.send_signal(signal.SIGKILL)
        self.assertEqual(daemon.stop(), 0)

    def test_a_watch_ends_with_its_daemon(self):
        daemon = self.daemon()
        watching = self.start_program("watch")
        heard = threading.Event()
        thread = threading.Thread(target=self.keep_changing, args=(heard,))
        thread.start()
        self.assertTrue(watching.stdout.readline())
        heard.set()
        thread.join()
        daemon.process.kill()
        daemon.status()
        _, error = watching.communicate(timeout=PATIENCE)
        self.assertEqual(watching.returncode, 1)
        self.assertEqual(error.decode(), f"cindral: {self.storage}: the connection to the daemon was lost\n")

    def interrupted(self, number, *words):
        """What is shown by a command that gets the signal when it first says how far it is, and dies of it."""
        ours, terminal = pty.openpty()
        process = subprocess.Popen([PROGRAM, *words, *self.options()], env=self.environment, stdin=terminal, stdout=terminal,
                                   stderr=terminal, start_new_session=True)
        os.close(terminal)
        shown = b""
        while b"%" not in shown and (data := os.read(ours, 4096)):
            shown += data
        process.send_signal(number)
        shown += all_of_terminal(ours)
        self.assertEqual(process.wait(timeout=PATIENCE), -number)
        return shown

    def test_an_interrupted_import_leaves_nothing_behind(self):
        big = os.path.join(self.folder, "big")
        os.mkdir(big)
        first = os.path.join(big, "0")
        with open(first, "wb") as file:
            file.write(b"x" * 1000)
        for number in range(1, 20_000):
            os.link(first, os.path.join(big, str(number)))
        os.mkdir(self.path("sub"))
        self.daemon()
        for number in (signal.SIGINT, signal.SIGTERM):
            # Whether it is over before the signal comes is not to be said: then one more is tried.
            while True:
                shown = self.interrupted(number, "import", big, "--to", self.path("sub"))
                self.assertNotIn(b"cindral:", shown, "it ends as it would without a daemon")
                if not os.listdir(self.path("sub")):
                    break
                shutil.rmtree(self.path("sub", "big"))
        # The daemon is as before.
        self.assertEqual(self.run_program("mkdir", self.path("sub", "made")), (0, b"", b""))

    def test_what_is_shown_of_the_way_comes_from_the_daemon(self):
        self.make_files("many", 3000)
        self.daemon()
        ours, terminal = pty.openpty()
        removing = subprocess.Popen([PROGRAM, "rm", "--yes", self.path("many"), *self.options()], env=self.environment,
                                    stdin=terminal, stdout=terminal, stderr=terminal, start_new_session=True)
        os.close(terminal)
        self.assertIn(b"items  ", all_of_terminal(ours))
        self.assertEqual(removing.wait(timeout=PATIENCE), 0)


if __name__ == "__main__":
    unittest.main()
