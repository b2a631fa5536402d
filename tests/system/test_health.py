"""Whether all is well, and the doctor: with things that really are not well."""

import json
import mmap
import os
import shutil
import signal
import sqlite3
import subprocess
import sys
import tempfile
import unittest

sys.path.insert(0, os.path.dirname(__file__))

from cindral_rpc import PATIENCE, PROGRAM, ROOT, RpcError, SocketClient, SystemTest  # noqa: E402


class HealthTest(SystemTest):
    def status(self, *words):
        """What the command answers with --json, and whether it says that all is well."""
        code, out, err = self.run_program("status", "--json", *words)
        answer = json.loads(out)
        problems = len(answer["problems"])
        said = {0: "", 1: "cindral: one thing is not well\n"}.get(problems, f"cindral: {problems} things are not well\n")
        self.assertEqual((code, err.decode().splitlines(True)[-1:]), (min(problems, 1), [said] if said else []))
        return answer

    def problems(self):
        answer = self.status()
        code, out, _ = self.run_program("status")
        self.assertEqual(code, 1 if answer["problems"] else 0)
        for problem in answer["problems"]:
            self.assertTrue(problem["remedy"])
            self.assertIn(f"Not well: {problem['what']}\n  To do: {problem['remedy']}\n", out.decode())
        return [problem["what"] for problem in answer["problems"]]

    def doctor(self):
        code, out, err = self.run_program("doctor", "--json")
        self.assertEqual(code, 0, err.decode() + out.decode())
        return json.loads(out)

    def documents(self):
        """All that a person could notice of their documents."""
        found = {}
        for folder, _, names in os.walk(self.storage):
            for name in ["", *names]:
                path = os.path.join(folder, name)
                status = os.lstat(path)
                contents = b""
                if name:
                    with open(path, "rb") as file:
                        contents = file.read()
                found[path] = (status.st_ino, status.st_mode, status.st_mtime_ns, status.st_ctime_ns, contents)
        return found


class StatusTest(HealthTest):
    def test_all_is_well_with_and_without_a_daemon(self):
        self.make_file("a.txt")
        self.run_program("find", "a.txt")
        alone = self.status("--recorder", "inotify")
        self.assertEqual(alone["problems"], [])
        code, out, err = self.run_program("status")
        self.assertEqual((code, err), (0, b""))
        self.assertTrue(out.startswith(b"All is well.\n"), out)
        for word in (b"storage", b"recorder", b"following", b"watch", b"coverage", b"history", b"1 item", b"not behind", b"libraries",
                     b"none within the last hour"):
            self.assertIn(word, out)
        self.daemon("--recorder", "inotify")
        self.run_program("find", "a.txt")
        served = self.status()
        self.assertEqual(self.run_program("status")[1].splitlines()[0], b"All is well.")
        for search in (alone["search"], served["search"]):
            search.pop("bytes")
        self.assertEqual(served, alone)

    def test_there_is_no_index_before_a_question(self):
        self.make_file("a.txt")
        self.assertFalse(self.status()["search"]["exists"])
        self.assertIn(b"none yet", self.run_program("status")[1])
        self.assertFalse(os.path.exists(os.path.join(self.state, "search-index")))

    def test_it_tells_how_far_the_index_is_behind(self):
        self.make_file("a.txt")
        self.run_program("find", "a")
        self.assertEqual(self.status()["search"]["eventsBehind"], 0)
        for number in range(3):
            self.make_file(f"new{number}")
        behind = self.status()["search"]["eventsBehind"]
        self.assertGreaterEqual(behind, 3)
        self.assertIn(f"behind by {behind} events", self.run_program("status")[1].decode())
        self.run_program("find", "a")
        self.assertEqual(self.status()["search"]["eventsBehind"], 0)
        # Of another history nothing can be said but that all is to be looked at.
        shutil.rmtree(os.path.join(self.state, "store"))
        self.assertNotIn("eventsBehind", self.status()["search"])
        self.assertIn(b"gathered anew", self.run_program("status")[1])

    def test_it_tells_since_when_events_are_kept(self):
        self.run_program("status")
        self.assertNotIn("oldestEventDate", self.status())
        self.make_file("a.txt")
        self.run_program("find", "a")
        status = self.status()
        self.assertGreaterEqual(status["events"], 1)
        self.assertRegex(status["oldestEventDate"], r"^20\d\d-\d\d-\d\dT")
        self.assertRegex(self.run_program("status")[1].decode(), r"history   \d+ events? kept, since 20\d\d-\d\d-\d\d \d\d:\d\d\n")

    @unittest.skipIf(os.geteuid() == 0 and not shutil.which("setpriv"), "needs an ordinary person")
    def test_a_folder_that_cannot_be_read(self):
        self.make_file("locked", "a.txt")
        os.chmod(self.path("locked"), 0)
        code, out, err = self.run_as_ordinary_person("status")
        self.assertEqual((code, err), (1, b"cindral: one thing is not well\n"))
        self.assertIn(f"Not well: {self.path('locked')} can't be read\n  To do: give yourself the right to read it", out.decode())
        os.chmod(self.path("locked"), 0o755)
        self.assertEqual(self.run_as_ordinary_person("status")[0], 0)

    def run_as_ordinary_person(self, *words):
        if os.geteuid() != 0:
            return self.run_program(*words)
        for path, folders, _ in os.walk(self.folder):
            for each in [path, *(os.path.join(path, folder) for folder in folders)]:
                os.chown(each, 65534, 65534)
        done = subprocess.run(["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", PROGRAM, *words, *self.options()],
                              env=self.environment, stdin=subprocess.DEVNULL, capture_output=True, timeout=PATIENCE, check=False)
        return done.returncode, done.stdout, done.stderr

    def test_a_storage_that_goes_and_another_in_its_place(self):
        self.make_file("a.txt")
        self.daemon()
        self.assertEqual(self.problems(), [])
        away = os.path.join(self.folder, "away")
        os.rename(self.storage, away)
        self.assertEqual(self.problems(), [f"the storage {self.storage} is not there"])
        os.mkdir(self.storage)
        self.assertEqual(self.problems(), [f"the storage {self.storage} is another folder than the one that is shown"])
        os.rmdir(self.storage)
        os.rename(away, self.storage)
        self.assertEqual(self.problems(), [])

    def test_the_limit_of_watches(self):
        """In a user namespace, whose limit is its own."""
        for number in range(30):
            os.mkdir(self.path(f"folder{number}"))
        command = 'echo 20 > /proc/sys/user/max_inotify_watches && exec "$@"'
        done = subprocess.run(
            ["unshare", "--user", "--map-root-user", "sh", "-c", command, "sh", PROGRAM, "status", "--recorder", "inotify", *self.options()],
            env=self.environment, stdin=subprocess.DEVNULL, capture_output=True, timeout=PATIENCE, check=False)
        self.assertEqual((done.returncode, done.stderr.decode().splitlines()[-1]), (1, "cindral: one thing is not well"))
        self.assertRegex(done.stdout.decode(), r"Not well: the limit of 20 watches is reached: \d+ more folders are compared")
        self.assertRegex(done.stdout.decode(), r"To do: raise it: sudo sysctl \S*max_\S*watches=\d+")

    def test_no_room_for_the_state(self):
        os.mkdir(self.state, 0o700)
        done = subprocess.run(
            ["unshare", "--user", "--map-root-user", "--mount", "sh", "-c", 'mount -t tmpfs -o size=8m,mode=700 none "$0" && exec "$@"',
             self.state, PROGRAM, "status", *self.options()],
            env=self.environment, stdin=subprocess.DEVNULL, capture_output=True, timeout=PATIENCE, check=False)
        self.assertEqual(done.returncode, 1)
        self.assertRegex(done.stdout.decode(), r"Not well: \d.* free where the state is kept, in .*/state\n  To do: make room")

    def test_errors_that_were_logged(self):
        self.make_file("a.txt")
        self.run_program("find", "a")
        with open(os.path.join(self.state, "search-index"), "r+b") as file:
            file.write(b"x" * 5000)
        self.daemon()
        self.run_program("find", "a")
        [problem] = self.problems()
        self.assertTrue(problem.startswith("an error was logged within the last hour: making the search index anew"), problem)
        self.assertEqual(self.status()["errors"]["lastHour"], 1)
        # Who has had everything looked at knows of it.
        self.assertTrue(self.doctor()["search"]["wasDamaged"])
        self.assertEqual(self.problems(), [])
        self.assertFalse(self.doctor()["search"]["wasDamaged"])

    def test_to_ask_for_what_is_not_there_is_no_error_of_the_system(self):
        self.make_file("a.txt")
        client = self.client()
        for method, params in (("itemForIdentifier", {"identifier": "did=99"}), ("URLForItem", {"identifier": "fid=99"}),
                               ("deleteItem", {"identifier": "did=99"}), ("setTags", {"identifier": "did=99", "tags": []}),
                               ("identifierForItemAtURL", {"path": self.path("none")}), ("enumerateItems", {"container": "fid=99"}),
                               ("defaultContainer", {"bundleIdentifier": "none"}), ("itemForIdentifier", {"identifier": "%&/"}),
                               ("enumerateChanges", {"container": ROOT, "anchor": "AAAA"}),
                               ("fetchThumbnails", {"identifiers": ["did=99"], "size": 64})):
            try:
                client.call(method, **params)
            except RpcError:
                pass
        status = client.call("status")
        self.assertEqual((status["errors"], status["problems"]), ({"lastHour": 0, "last": ""}, []))


class DoctorTest(HealthTest):
    def setUp(self):
        super().setUp()
        for number in range(20):
            self.make_file(f"file{number}", contents=b"contents")
        self.before = self.documents()
        self.addCleanup(self.check_documents)

    def check_documents(self):
        if self.before is not None:
            self.assertEqual(self.documents(), self.before)

    def index_path(self):
        return os.path.join(self.state, "search-index")

    def test_it_finds_nothing_where_nothing_is_wrong(self):
        code, out, err = self.run_program("doctor")
        self.assertEqual((code, err), (0, b""))
        self.assertEqual(out.decode(), "Compared what is known of 21 objects with the files: it is the same.\n"
                                       "Compared the search index of 20 items with the files: it is whole.\n")
        self.assertEqual(self.doctor(), {
            "objects": 21, "differences": 0, "search": {"items": 20, "wasDamaged": False, "missing": 0, "outdated": 0, "superfluous": 0},
            "repairs": [], "problems": [], "setAside": []})
        self.daemon()
        self.assertEqual(self.run_program("doctor"), (0, out, b""))

    def test_it_puts_the_index_right(self):
        self.run_program("find", "file")
        # Somebody's tool writes into it.
        database = sqlite3.connect(self.index_path())
        database.create_function("name_key", 1, lambda name: name, deterministic=True)
        with database:
            database.execute("UPDATE items SET identifier = 'did=4000' WHERE identifier = 'did=7'")
            database.execute("UPDATE items SET used = 99 WHERE identifier = 'did=8'")
        database.close()
        self.assertEqual(self.doctor()["search"], {"items": 20, "wasDamaged": False, "missing": 1, "outdated": 1, "superfluous": 1})
        self.assertEqual(self.doctor()["search"], {"items": 20, "wasDamaged": False, "missing": 0, "outdated": 0, "superfluous": 0})
        self.assertEqual(len(self.run_program("find", "file")[1].splitlines()), 20)

    def test_it_makes_a_damaged_index_anew(self):
        for offset in (0, 8192, 20480):
            with self.subTest(offset=offset):
                self.run_program("find", "file")
                with open(self.index_path(), "r+b") as file:
                    file.seek(offset)
                    file.write(b"x" * 20000)
                self.assertTrue(self.doctor()["search"]["wasDamaged"])
                self.assertIn(b"it is whole", self.run_program("doctor")[1])
                self.assertEqual(len(self.run_program("find", "file")[1].splitlines()), 20)

    def test_it_finds_what_no_event_told(self):
        """A write through a memory map tells nobody."""
        self.before = None
        path = self.make_file("mapped", contents=b"x" * 4096)
        with open(path, "r+b") as file:
            mapped = mmap.mmap(file.fileno(), 4096)
        with mapped:
            self.daemon()
            os.utime(path, (1000, 1000))
            self.run_program("status")
            mapped[0] = 0x79
            mapped.flush()
            found = self.doctor()
            self.assertEqual((found["differences"], self.doctor()["differences"]), (1, 0))

    def test_a_damaged_store_begins_anew_and_is_kept(self):
        self.run_program("ls")
        path = os.path.join(self.state, "store", "volume")
        with open(path, "r+b") as file:
            file.write(b"x" * 8192)
        with open(path, "rb") as file:
            damaged = file.read()
        [repair] = self.doctor()["repairs"]
        self.assertIn("is damaged", repair)
        [aside] = [name for name in os.listdir(os.path.dirname(path)) if name.startswith("volume.damaged-")]
        with open(os.path.join(os.path.dirname(path), aside), "rb") as file:
            self.assertEqual(file.read(), damaged)
        self.assertIn(aside, repair)
        self.assertEqual(self.doctor()["repairs"], [])

    def test_what_is_no_file_is_set_aside(self):
        """Whatever stands where a part of the state is to be: the doctor makes it start again, and keeps it."""
        self.run_program("find", "file")
        pristine = os.path.join(self.folder, "pristine")
        shutil.copytree(self.state, pristine)
        outside = tempfile.mkdtemp(prefix="cindral-outside-")
        self.addCleanup(shutil.rmtree, outside)
        os.makedirs(os.path.join(pristine, "Application Support", "Cindral Storage"), exist_ok=True)
        parts = [os.path.join(at, name)[len(pristine) + 1:] for at, _, names in os.walk(pristine) for name in names]
        self.assertGreater(len(parts), 4)
        for part in [*parts, "store", "Application Support", "Application Support/Cindral Storage"]:
            for kind in ("folder", "link", "pipe"):
                with self.subTest(part=part, kind=kind):
                    shutil.rmtree(self.state)
                    shutil.copytree(pristine, self.state)
                    path = os.path.join(self.state, part)
                    isFolder = os.path.isdir(path)
                    if isFolder:
                        shutil.rmtree(path)
                    elif os.path.lexists(path):
                        os.unlink(path)
                    os.makedirs(os.path.dirname(path), exist_ok=True)
                    if kind == "folder" and not isFolder:
                        os.mkdir(path)
                        with open(os.path.join(path, "kept"), "wb"):
                            pass
                    elif kind == "link":
                        os.symlink(os.path.join(outside, "none"), path)
                    elif kind == "pipe":
                        os.mkfifo(path)
                    else:
                        with open(path, "wb"):
                            pass
                    self.doctor()
                    aside = [name for name in os.listdir(os.path.dirname(path)) if name.startswith(os.path.basename(path) + ".set-aside-")]
                    self.assertEqual(len(aside), 1)
                    found = self.doctor()
                    self.assertEqual((found["setAside"], found["repairs"]), ([], []))
                    self.assertEqual(len(self.run_program("find", "file")[1].splitlines()), 20)
                    self.assertEqual(os.listdir(outside), [])

    def test_where_it_cannot_help_it_says_so(self):
        with open(self.state, "wb"):
            pass
        code, out, err = self.run_program("doctor")
        self.assertEqual((code, out), (1, b""))
        self.assertTrue(err.startswith(b"cindral: "), err)
        with open(self.state, "rb") as file:
            self.assertEqual(file.read(), b"", "what may be a document is left alone")

    def test_a_state_folder_in_use_is_left_alone(self):
        with self.client() as client:
            client.call("status")
            code, out, err = self.run_program("doctor")
            self.assertEqual((code, out), (1, b""))
            self.assertIn(f"is in use by process {client.process.pid}", err.decode())

    def test_a_daemon_goes_on_while_it_looks(self):
        served = self.daemon()
        client = self.connect()
        asked = [client.send("doctor"), *(client.send("search", text="file") for _ in range(20)), client.send("doctor")]
        for request in asked:
            self.assertIn("result", client.answer(request))
        self.assertEqual(served.stop(signal.SIGTERM), 0)


if __name__ == "__main__":
    unittest.main()
