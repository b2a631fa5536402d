"""Applications whose documents are published: they come and go while clients look on."""

import base64
import datetime
import errno
import json
import os
import plistlib
import random
import re
import shutil
import struct
import subprocess
import time
import unittest
import zlib

from cindral_rpc import PATIENCE, ROOT, WORKING_SET, Client, RpcError, SystemTest
from container_view import ALL_DIRECTORIES, ContainerView, is_expired, listed
from installed_apps import DOCUMENT_BROWSER, Entries, FlatpakTree, key_file, replace_file

NOBODY = 65534
PARAMETER = ("TSErrorDomain", 1)


class AppsTest(SystemTest):
    """A host with sources of applications of its own, and views that must stay what a fresh listing is."""

    def setUp(self):
        super().setUp()
        self.environment["CINDRAL_LOG"] = "debug"
        self.entries = Entries(os.path.join(self.folder, "entries"))
        self.user = FlatpakTree(self.environment["FLATPAK_USER_DIR"])
        self.system = FlatpakTree(self.environment["FLATPAK_SYSTEM_DIR"])
        self.host = None

    def options(self, storage=None, state=None):
        return [*super().options(storage, state), "--apps", self.entries.folder]

    def start(self, **popen):
        self.host = Client(self.options(), self.environment, **popen)
        self.addCleanup(self._end, self.host)
        self.call("startMonitoring", container=ROOT)
        self.call("startMonitoring", container=WORKING_SET)

    @staticmethod
    def _end(host):
        if host.process.poll() is None:
            host.kill()

    def finish(self):
        self.assertEqual(self.host.finish(), 0, self.host.error_text())

    def restart(self, meanwhile=None):
        self.finish()
        if meanwhile is not None:
            meanwhile()
        self.start()

    def call(self, method, **params):
        return self.host.call(method, **params)

    # Applications.

    def container(self, identifier):
        """Where a Flatpak application keeps its data; entries are given the like."""
        return os.path.join(self.folder, ".var", "app", identifier)

    def documents(self, identifier, *names):
        return os.path.join(self.container(identifier), "Documents", *names)

    def make_documents(self, identifier):
        os.makedirs(self.documents(identifier), exist_ok=True)

    def put(self, identifier, *names, contents=b""):
        path = self.documents(identifier, *names)
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "wb") as file:
            file.write(contents)
        return path

    def install(self, identifier, **entry):
        self.make_documents(identifier)
        self.entries.install(identifier, self.container(identifier), **entry)

    # What clients see.

    def views(self, *containers):
        return [ContainerView(self, container) for container in containers]

    @staticmethod
    def libraries(view):
        return sorted(identifier for identifier in view.items if identifier.startswith("#"))

    def catch_up(self, view):
        """Until the view is what a fresh listing is. Between the two, applications may have come or gone: then that is told."""
        while True:
            view.catch_up()
            fresh, _ = listed(self, view.container)
            differences = view.differences(fresh)
            if not differences:
                return
            self.assertTrue(view.catch_up().log, "\n".join(differences))

    def wait_for_libraries(self, view, *identifiers):
        """Applies changes until the view has exactly those app libraries; between two looks, waits for a signal."""
        expected = sorted("#" + identifier for identifier in identifiers)
        while True:
            self.catch_up(view)
            if self.libraries(view) == expected:
                return
            self.host.next_notification("signal")

    def lines(self, level, text):
        return [line for line in self.host.error_text().splitlines() if re.search(rf" {level} (\[\w+\] )?{text}", line)]

    def assert_said(self, level, text):
        self.host.wait_for_error(lambda line: re.search(rf" {level} (\[\w+\] )?{text}", line))


class EntriesTest(AppsTest):
    def test_an_application_appears_and_goes(self):
        self.make_file("own.txt")
        self.start()
        views = self.views(ROOT, WORKING_SET, ALL_DIRECTORIES)
        self.put("org.a", "letter.txt", contents=b"12345")
        self.put("org.a", "folder", "deep.txt")
        self.put("org.a", ".Trash", "gone.txt")
        self.put("org.a", "Inbox", "incoming.txt")
        self.install("org.a", name="Writer")
        for view in views:
            self.wait_for_libraries(view, "org.a")
        root, everything, directories = views
        library = root.items["#org.a"]
        self.assertEqual((library["filename"], library["parentIdentifier"], library["isAppLibrary"]), ("Writer", ROOT, True))
        # The folders of trash and inbox don't count.
        self.assertEqual((library["childItemCount"], library["bundleIdentifier"]), (2, "org.a"))
        self.assertEqual(library["capabilities"], 3)
        self.assertEqual(library["fileURL"], "file://" + self.documents("org.a"))
        names = {item["filename"]: item["parentIdentifier"] for item in everything.items.values()}
        self.assertEqual(names.keys(), {"own.txt", "Writer", "letter.txt", "folder", "deep.txt", "gone.txt", "incoming.txt"})
        self.assertEqual((names["letter.txt"], names["own.txt"]), ("#org.a", ROOT))
        self.assertEqual({item["filename"] for item in directories.items.values()}, {"Writer", "folder"})
        self.assertIn("letter.txt", self.host.named("#org.a"))

        # From now on as any other folder.
        self.put("org.a", "new.txt")
        self.catch_up(everything)
        self.assertIn("new.txt", {item["filename"] for item in everything.items.values()})

        self.entries.uninstall("org.a")
        for view in views:
            self.wait_for_libraries(view)
        self.assertEqual({item["filename"] for item in everything.items.values()}, {"own.txt"})
        self.assertTrue(os.path.exists(self.documents("org.a", "letter.txt")))

    def test_what_is_there_at_the_start_is_listed_at_once(self):
        self.put("org.a", "letter.txt")
        self.install("org.a")
        self.start()
        self.assertIn("The org.a", self.host.named())
        self.assertEqual(self.call("status")["roots"], ["file://" + self.documents("org.a"), "file://" + self.storage])

    def test_lookups_of_libraries(self):
        self.install("org.a")
        self.start()
        library = self.call("itemForIdentifier", identifier="#org.a")
        self.assertTrue(library["isAppLibrary"])
        self.assertEqual(self.call("defaultContainer", bundleIdentifier="org.a"), library)
        for path in (self.container("org.a") + "/Documents", self.container("org.a") + "/Documents/"):
            self.assertEqual(self.host.identifier(path), "#org.a")
        self.assertEqual(self.call("URLForItem", identifier="#org.a")["url"], "file://" + self.documents("org.a"))
        other = self.path("sub", "Documents")
        os.makedirs(other)
        self.assertTrue(self.host.identifier(other).startswith("fid="))
        for identifier in ("#", "#org.unknown"):
            self.assert_error("CindralProvider.LocalTesselKitError", 0, self.call, "itemForIdentifier", identifier=identifier)
        for unknown in ("", "org.unknown", "#org.a"):
            error = self.assert_error(*PARAMETER, self.call, "defaultContainer", bundleIdentifier=unknown)
            self.assertEqual(error.data["value"], unknown)
        self.assert_refused(-32602, self.call, "defaultContainer")

    def test_only_applications_that_ask_for_it_are_published(self):
        both = {"X-Cindral-SupportsOpenInPlace": "true", "X-Cindral-FileSharingEnabled": "true"}
        self.install("org.both", keys=both)
        self.install("org.one", keys={"X-Cindral-SupportsOpenInPlace": "true"})
        self.install("org.neither", keys={})
        self.install("org.off", keys={"X-Cindral-SupportsDocumentBrowser": "false"})
        self.entries.install("org.homeless", self.container("org.homeless"))
        self.start()
        self.assertEqual([item["identifier"] for item in self.host.items(ROOT)], ["#org.both"])

    def test_a_library_appears_when_its_documents_folder_does(self):
        self.entries.install("org.a", self.container("org.a"))
        self.start()
        [root] = self.views(ROOT)
        self.assertEqual(self.libraries(root), [])
        self.put("org.a", "letter.txt")
        self.wait_for_libraries(root, "org.a")
        shutil.rmtree(self.container("org.a"))
        self.wait_for_libraries(root)

    def test_a_half_written_entry_is_ignored_until_it_is_whole(self):
        self.make_documents("org.a")
        self.start()
        [root] = self.views(ROOT)
        text = key_file(Desktop_Entry={"Type": "Application", "Name": "Whole", "X-Cindral-DataContainer": self.container("org.a"),
                                       **DOCUMENT_BROWSER})
        with open(self.entries.path("org.a"), "w", encoding="utf-8") as file:
            for at in range(0, len(text), 10):
                file.write(text[at:at + 10])
                file.flush()
                self.catch_up(root)
                self.assertIn(self.libraries(root), ([], ["#org.a"]))
        self.wait_for_libraries(root, "org.a")
        self.assertEqual(root.items["#org.a"]["filename"], "Whole")

    def test_names_are_localised(self):
        self.install("org.a", name="Writer", **{"Name[de]": "Schreiber"})
        for variable, expected in (("de_AT.UTF-8", "Schreiber"), ("fr_FR.UTF-8", "Writer"), ("C", "Writer")):
            self.environment["LC_ALL"] = variable
            self.start()
            self.assertEqual(self.call("itemForIdentifier", identifier="#org.a")["filename"], expected)
            self.finish()

    def test_a_documents_folder_that_is_a_link_is_not_published(self):
        os.makedirs(self.container("org.a"))
        os.symlink("/etc", self.documents("org.a"))
        self.entries.install("org.a", self.container("org.a"))
        self.start()
        self.assertEqual(self.host.items(ROOT), [])

    def test_works_without_privilege(self):
        self.install("org.a")
        self.put("org.a", "letter.txt")
        how = {}
        if os.geteuid() == 0:
            for folder, folders, files in os.walk(self.folder):
                os.chown(folder, NOBODY, NOBODY)
                for name in folders + files:
                    os.lchown(os.path.join(folder, name), NOBODY, NOBODY)
            how = {"user": NOBODY, "group": NOBODY, "extra_groups": []}
        self.start(**how)
        [everything] = self.views(WORKING_SET)
        self.wait_for_libraries(everything, "org.a")
        self.assertIn("letter.txt", {item["filename"] for item in everything.items.values()})
        self.put("org.a", "new.txt")
        self.put("org.b", "other.txt")
        self.entries.install("org.b", self.container("org.b"))
        self.wait_for_libraries(everything, "org.a", "org.b")
        self.assertLessEqual({"new.txt", "other.txt"}, {item["filename"] for item in everything.items.values()})


class SignalsTest(AppsTest):
    def test_root_and_working_set_are_signalled_when_the_list_changes(self):
        self.start()
        self.install("org.a")
        told = set()
        while told != {ROOT, WORKING_SET}:
            told.add(self.host.next_notification("signal")["container"])

    def test_a_look_that_finds_the_same_signals_nothing(self):
        self.install("org.a")
        self.start()
        [root] = self.views(ROOT)
        # Another entry that is not published, then one that is: whatever the first was signalled as, it came before.
        self.install("org.hidden", keys={})
        self.install("org.b")
        self.wait_for_libraries(root, "org.a", "org.b")
        self.finish()
        notified = self.lines("info", f"notify changes on {ROOT}")
        versions = self.lines("debug", "main cache version token is now")
        self.assertEqual(len(notified), len(versions))

    def test_a_burst_of_installs_and_removals_ends_at_the_last_state(self):
        begin = time.monotonic()
        self.start()
        root, everything = self.views(ROOT, WORKING_SET)
        chosen = random.Random(4)
        installed = set()
        for number in range(200):
            identifier = f"org.burst{number % 40}"
            if identifier in installed and chosen.random() < 0.7:
                self.entries.uninstall(identifier)
                installed.remove(identifier)
            else:
                self.install(identifier, name=f"{identifier} {number}")
                installed.add(identifier)
        for identifier in sorted(installed)[::2]:
            self.entries.uninstall(identifier)
            installed.remove(identifier)
        self.install("org.last")
        self.wait_for_libraries(root, "org.last", *installed)
        self.wait_for_libraries(everything, "org.last", *installed)
        self.finish()
        events = self.pacer_events()
        self.assertGreaterEqual(len(events), 2)
        # The first comes at once, each further one half a second later at the earliest.
        self.assertLessEqual((len(events) - 1) * 0.5, time.monotonic() - begin)
        # An event begins after the one before it has ended, and half a second before the next: so between that end and the line of the
        # next there is as much, however late a line is written. (Stamps are of a clock that may be set: by less than that, one hopes.)
        for (_, ended), _, (opened, _) in zip(events, events[1:], events[2:]):
            self.assertGreaterEqual(opened - ended, 0.5 - 0.05)

    def pacer_events(self):
        """When the section of each event was opened and closed, in seconds."""
        opened, events = {}, []
        for line in self.host.error_text().splitlines():
            mark = re.search(r"^(\S+)Z debug \[DEBUG\] (┏|┗)(\d+)( pacer event)?$", line)
            if not mark:
                continue
            stamp = datetime.datetime.fromisoformat(mark[1]).timestamp()
            if mark[4]:
                opened[mark[3]] = stamp
            elif mark[2] == "┗" and mark[3] in opened:
                events.append((opened.pop(mark[3]), stamp))
        return events


class FlatpakTreeTest(AppsTest):
    def test_applications_of_both_installations_are_published(self):
        for identifier in ("org.user", "org.system"):
            self.put(identifier, f"of {identifier}.txt")
        self.user.deploy("org.user", name="For me")
        self.system.deploy("org.system", name="For all")
        self.start()
        [root] = self.views(ROOT)
        self.assertEqual({root.items[i]["filename"] for i in self.libraries(root)}, {"For me", "For all"})
        self.assertEqual(set(self.host.named("#org.user")), {"of org.user.txt"})

    def test_an_update_swaps_what_is_active(self):
        self.make_documents("org.a")
        self.start()
        [root] = self.views(ROOT)
        self.user.deploy("org.a", name="First")
        self.wait_for_libraries(root, "org.a")
        self.user.deploy("org.a", name="Second", keys={})
        self.wait_for_libraries(root)
        self.user.deploy("org.a", name="Third", keys={}, metadata_keys=DOCUMENT_BROWSER)
        self.wait_for_libraries(root, "org.a")
        self.assertEqual(self.call("itemForIdentifier", identifier="#org.a")["filename"], "Third")
        self.user.remove("org.a")
        self.wait_for_libraries(root)

    def test_an_installation_that_is_configured_is_read(self):
        extra = FlatpakTree(os.path.join(self.folder, "extra"))
        replace_file(os.path.join(self.environment["FLATPAK_CONFIG_DIR"], "installations.d", "extra.conf"),
                     f'[Installation "extra"]\nPath={extra.folder}\n')
        self.make_documents("org.extra")
        extra.deploy("org.extra")
        self.start()
        [root] = self.views(ROOT)
        self.assertEqual(self.libraries(root), ["#org.extra"])

    def test_no_flatpak_leaves_them_out(self):
        self.make_documents("org.a")
        self.user.deploy("org.a")
        host = Client([*self.options(), "--no-flatpak"], self.environment)
        self.addCleanup(self._end, host)
        self.assertEqual(host.items(ROOT), [])

    def test_one_that_is_half_installed_is_ignored_until_it_is_whole(self):
        self.make_documents("org.a")
        os.makedirs(os.path.join(self.user.folder, "app", "org.a", "x86_64"))
        self.start()
        [root] = self.views(ROOT)
        self.assertEqual(self.libraries(root), [])
        self.user.deploy("org.a")
        self.wait_for_libraries(root, "org.a")


if shutil.which("flatpak"):
    class FlatpakToolTest(AppsTest):
        """The tool itself, offline, in folders of the test's own."""

        IDENTIFIER = "org.example.Hello"

        def setUp(self):
            super().setUp()
            # So that nothing of this machine is asked, and no program is run for what is exported.
            for variable, name in (("XDG_DATA_HOME", "data"), ("XDG_RUNTIME_DIR", "run"), ("FLATPAK_TRIGGERSDIR", "triggers")):
                self.environment[variable] = os.path.join(self.folder, name)
                os.makedirs(self.environment[variable], mode=0o700)
            self.repository = os.path.join(self.folder, "repository")
            architecture = self.flatpak("--default-arch").strip()
            self.platform = f"org.example.Platform/{architecture}/master"
            platform = self._build("platform", key_file(Runtime={"name": "org.example.Platform"}))
            os.mkdir(os.path.join(platform, "usr"))
            self.flatpak("build-export", "--disable-sandbox", "--runtime", self.repository, platform)

        def flatpak(self, *words):
            done = subprocess.run(["flatpak", *words], env=self.environment, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE,
                                  stderr=subprocess.STDOUT, timeout=PATIENCE, check=False)
            self.assertEqual(done.returncode, 0, done.stdout.decode())
            return done.stdout.decode()

        def _build(self, name, metadata):
            build = os.path.join(self.folder, "builds", name)
            os.makedirs(os.path.join(build, "files"))
            replace_file(os.path.join(build, "metadata"), metadata)
            return build

        def publish(self, version, keys):
            metadata = key_file(Application={"name": self.IDENTIFIER, "runtime": self.platform, "sdk": self.platform})
            build = self._build(version, metadata)
            entry = {"Type": "Application", "Name": f"Hello {version}", "Exec": "hello", **keys}
            replace_file(os.path.join(build, "export", "share", "applications", self.IDENTIFIER + ".desktop"),
                         key_file(Desktop_Entry=entry))
            self.flatpak("build-export", "--disable-sandbox", self.repository, build)

        def test_what_it_installs_updates_and_removes_comes_changes_and_goes(self):
            self.publish("1", keys=DOCUMENT_BROWSER)
            self.flatpak("remote-add", "--user", "--no-gpg-verify", "test", self.repository)
            self.put(self.IDENTIFIER, "letter.txt")
            self.start()
            [root] = self.views(ROOT)
            self.assertEqual(self.libraries(root), [])
            self.flatpak("install", "--user", "-y", "--noninteractive", "test", self.IDENTIFIER)
            self.wait_for_libraries(root, self.IDENTIFIER)
            self.assertEqual(root.items["#" + self.IDENTIFIER]["filename"], "Hello 1")
            self.publish("2", keys={})
            self.flatpak("update", "--user", "-y", "--noninteractive")
            self.wait_for_libraries(root)
            self.publish("3", keys=DOCUMENT_BROWSER)
            self.flatpak("update", "--user", "-y", "--noninteractive")
            self.wait_for_libraries(root, self.IDENTIFIER)
            self.assertEqual(root.items["#" + self.IDENTIFIER]["filename"], "Hello 3")
            self.flatpak("uninstall", "--user", "-y", "--noninteractive", self.IDENTIFIER)
            self.wait_for_libraries(root)


def png(width, height, colour):
    """A picture of one colour."""
    def chunk(kind, data):
        return struct.pack(">I", len(data)) + kind + data + struct.pack(">I", zlib.crc32(kind + data))
    rows = b"".join(b"\0" + bytes(colour) * width for _ in range(height))
    head = struct.pack(">IIBBBBB", width, height, 8, 6, 0, 0, 0)
    return b"\x89PNG\r\n\x1a\n" + chunk(b"IHDR", head) + chunk(b"IDAT", zlib.compress(rows)) + chunk(b"IEND", b"")


def side_of(data):
    """Of the longer side."""
    return max(struct.unpack(">II", data[16:24]))


RED_SVG = b'<svg xmlns="http://www.w3.org/2000/svg" width="8" height="8"><rect width="8" height="8" fill="red"/></svg>'


class ThumbnailsTest(AppsTest):
    def thumbnails(self, *identifiers, size=96):
        answer = self.call("fetchThumbnails", identifiers=list(identifiers), size=size)["thumbnails"]
        self.assertEqual([each["identifier"] for each in answer], list(identifiers))
        return [each["png"] and base64.b64decode(each["png"]) for each in answer]

    def deploy(self, identifier, **icons):
        """Icons by their folder in the theme: s48 for 48x48, scalable."""
        self.make_documents(identifier)
        files = {}
        for folder, data in icons.items():
            size = folder if folder == "scalable" else f"{folder[1:]}x{folder[1:]}"
            files[f"{size}/apps/{identifier}.{'svg' if size == 'scalable' else 'png'}"] = data
        self.user.deploy(identifier, icons=files)

    def test_libraries_have_their_applications_icon(self):
        icons = {f"s{side}": png(side, side, (side - 1, 0, 0, 255)) for side in (48, 64, 128, 256)}
        self.deploy("org.png", **icons)
        self.deploy("org.svg", scalable=RED_SVG)
        self.deploy("org.none")
        document = self.make_file("document.txt")
        for scale, device, side in (("1", "1", 48), ("1", "3", 48), ("2", "1", 96), ("2", "3", 96), ("3", "1", 192)):
            self.environment.update(CINDRAL_SCREEN_SCALE=scale, CINDRAL_DEVICE_CLASS=device)
            self.start()
            of_png, of_svg, of_none, of_document, of_unknown = self.thumbnails(
                "#org.png", "#org.svg", "#org.none", self.host.identifier(document), "#org.unknown")
            self.assertTrue(of_png and of_svg, self.host.error_text())
            self.assertEqual((side_of(of_png), side_of(of_svg)), (side, side))
            self.assertEqual((of_none, of_document, of_unknown), (None, None, None))
            self.finish()
            self.assert_said("debug", "#org.unknown: can't get app proxy for org.unknown")
            self.assert_said("debug", "#org.none: can't get primary icon data; ")

    def test_a_coarser_icon_does_where_there_is_no_finer(self):
        self.deploy("org.a", s96=png(96, 96, (9, 9, 9, 255)))
        self.environment["CINDRAL_SCREEN_SCALE"] = "3"
        self.start()
        self.assertEqual(side_of(self.thumbnails("#org.a")[0]), 96)

    def test_hostile_images_give_none_and_a_line(self):
        huge = bytearray(png(1, 1, (0, 0, 0, 255)))
        huge[16:24] = struct.pack(">II", 60_000, 60_000)
        huge[29:33] = struct.pack(">I", zlib.crc32(bytes(huge[12:29])))
        hostile = {"org.huge": {"s96": bytes(huge)}, "org.broken": {"s96": png(96, 96, (1, 2, 3, 4))[:60]},
                   "org.text": {"s96": b"no picture"}, "org.svg": {"scalable": b"<svg"}, "org.empty": {"s96": b""}}
        for identifier, icons in hostile.items():
            self.deploy(identifier, **icons)
        self.start()
        self.assertEqual(self.thumbnails(*(f"#{identifier}" for identifier in hostile)), [None] * len(hostile))
        self.deploy("org.good", scalable=RED_SVG)
        [root] = self.views(ROOT)
        self.wait_for_libraries(root, "org.good", *hostile)
        self.assertIsNotNone(self.thumbnails("#org.good")[0])
        self.finish()
        for identifier in hostile:
            self.assertTrue(self.lines("debug", f"#{identifier}: can't"), identifier)

    def test_the_command_writes_a_file(self):
        self.deploy("org.a", scalable=RED_SVG)
        out = os.path.join(self.folder, "icon.png")
        del self.environment["CINDRAL_LOG"]
        self.assertEqual(self.run_program("thumbnail", "#org.a", "-o", out), (0, b"", b""))
        with open(out, "rb") as file:
            data = file.read()
        self.assertEqual(side_of(data), 96)
        self.assertEqual(self.run_program("thumbnail", "#org.a", "-o", "-"), (0, data, b""))
        self.assertEqual(self.run_program("thumbnail", self.documents("org.a"), "-o", "-")[1], data)
        document = self.make_file("document.txt")
        status, output, error = self.run_program("thumbnail", document, "-o", out + "2")
        self.assertEqual((status, output), (1, b""))
        self.assertIn(b"there is no thumbnail of", error)
        self.assertFalse(os.path.exists(out + "2"))
        status, _, error = self.run_program("thumbnail", "#org.a", "-o", os.path.join(self.folder, "missing", "x"))
        self.assertEqual(status, 1)
        self.assertIn(b"can't write", error)
        self.assertEqual(self.run_program("thumbnail", "#org.a")[0], 2)
        self.assertEqual(self.run_program("thumbnail", "-o", out)[0], 2)


class AppsCommandsTest(AppsTest):
    def setUp(self):
        super().setUp()
        del self.environment["CINDRAL_LOG"]

    def listed_apps(self):
        status, output, error = self.run_program("apps", "--json")
        self.assertEqual((status, error), (0, b""))
        return {app["bundleIdentifier"]: app for app in map(json.loads, output.splitlines())}

    def test_what_is_installed_is_shown_and_why_it_is_not_published(self):
        self.user.deploy("org.mine", name="Mine")
        self.make_documents("org.mine")
        self.system.deploy("org.all", keys={})
        self.make_documents("org.all")
        self.entries.install("org.homeless", self.container("org.homeless"))
        self.entries.install("org.nowhere", "")
        apps = self.listed_apps()
        self.assertEqual({identifier: app["published"] for identifier, app in apps.items()},
                         {"org.mine": True, "org.all": False, "org.homeless": False, "org.nowhere": False})
        self.assertEqual((apps["org.mine"]["name"], apps["org.mine"]["type"], apps["org.all"]["type"]), ("Mine", 0, 2))
        self.assertEqual(apps["org.mine"]["dataContainer"], "file://" + self.container("org.mine"))
        self.assertIn("don't ask for it", apps["org.all"]["why"])
        self.assertIn("Documents folder is missing", apps["org.homeless"]["why"])
        self.assertIn("names no data container", apps["org.nowhere"]["why"])
        self.assertNotIn("why", apps["org.mine"])
        bare = self.run_program("apps", "-0")[1]
        self.assertTrue(bare.endswith(b"\0"))
        self.assertEqual(bare.decode().split("\0")[:-1], list(apps))
        lines = self.run_program("apps")[1].decode().splitlines()
        self.assertEqual(len(lines), 4)
        self.assertRegex(lines[0], r"^org\.mine +published +Mine$")

    def test_a_person_enables_and_disables_while_the_host_runs(self):
        self.user.deploy("org.a", keys={})
        self.start()
        [root] = self.views(ROOT)
        self.assertEqual(self.libraries(root), [])
        self.assertEqual(self.run_program("apps", "enable", "org.a"), (0, b"", b""))
        self.assertTrue(os.path.isdir(self.documents("org.a")))
        self.wait_for_libraries(root, "org.a")
        self.assertEqual(self.listed_apps()["org.a"]["choice"], "enabled")
        self.put("org.a", "letter.txt")
        self.assertEqual(self.run_program("apps", "disable", "org.a"), (0, b"", b""))
        self.wait_for_libraries(root)
        app = self.listed_apps()["org.a"]
        self.assertEqual((app["choice"], app["published"]), ("disabled", False))
        self.assertIn("disabled with apps disable", app["why"])
        self.assertTrue(os.path.exists(self.documents("org.a", "letter.txt")))
        choices = os.path.join(self.folder, ".config", "cindral", "applications.conf")
        self.assertEqual(os.stat(choices).st_mode & 0o777, 0o600)

    def test_choices_count_before_the_applications_keys(self):
        self.install("org.a")
        self.assertEqual(self.run_program("apps", "disable", "org.a")[0], 0)
        self.assertEqual(self.run_program("ls")[1], b"")
        self.assertEqual(self.run_program("apps", "enable", "org.a")[0], 0)
        self.assertIn(b"The org.a", self.run_program("ls")[1])

    def test_what_cannot_be_done_is_refused(self):
        self.entries.install("org.nowhere", "")
        for words, message in ((("enable", "org.unknown"), b"no such application: org.unknown"),
                               (("disable", "org.unknown"), b"no such application: org.unknown"),
                               (("enable", ""), b"no such application"),
                               (("enable", "org.nowhere"), b"not published: it names no data container")):
            status, output, error = self.run_program("apps", *words)
            self.assertEqual((status, output), (1, b""), words)
            self.assertIn(message, error)
        for words in (("enable",), ("frobnicate", "x"), ("enable", "a", "b")):
            self.assertEqual(self.run_program("apps", *words)[0], 2, words)


class CachesTest(AppsTest):
    def setUp(self):
        super().setUp()
        self.support = os.path.join(self.state, "Application Support")
        self.main = os.path.join(self.support, "Cindral Storage", "app-libraries.plist")
        self.working_set = os.path.join(self.support, "Cindral Storage", "searchable-app-libraries.plist")
        self.install("org.a")
        self.put("org.a", "letter.txt")

    @staticmethod
    def root_of(path):
        with open(path, "rb") as file:
            return plistlib.load(file)["root"]

    @staticmethod
    def write(path, data):
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "wb") as file:
            file.write(data)

    def archive(self, root):
        return plistlib.dumps({"archiver": "KsKeyedArchiver", "version": 1, "root": root}, fmt=plistlib.FMT_BINARY)

    def test_a_first_start_writes_the_main_cache(self):
        self.start()
        self.assertEqual(self.root_of(self.main)["versionToken"], 1)
        self.assertFalse(os.path.exists(self.working_set))
        [everything] = self.views(WORKING_SET)
        self.wait_for_libraries(everything, "org.a")
        root = self.root_of(self.working_set)
        self.assertEqual((root["versionToken"], len(root["bundleProxy"])), (1, 1))
        self.restart()
        self.assertEqual(self.root_of(self.main)["versionToken"], 1)
        for path in (self.main, self.working_set):
            self.assertEqual(os.stat(path).st_mode & 0o777, 0o600)
        self.catch_up(everything)

    def test_a_damaged_cache_is_begun_anew(self):
        self.start()
        self.finish()
        with open(self.main, "rb") as file:
            whole = file.read()
        damaged = [b"", b"x", whole[:-1], whole[: len(whole) // 2], bytes(len(whole)), b"bplist00" + bytes(100),
                   self.archive({"versionToken": "7", "bundleProxy": []}), self.archive({"bundleProxy": []}),
                   self.archive({"versionToken": 7}), self.archive({"versionToken": 7, "bundleProxy": "x"}),
                   self.archive({"versionToken": 7, "bundleProxy": [7]})]
        for data in damaged:
            self.write(self.main, data)
            self.write(self.working_set, data)
            self.start()
            [root, everything] = self.views(ROOT, WORKING_SET)
            self.wait_for_libraries(root, "org.a")
            self.wait_for_libraries(everything, "org.a")
            self.assertEqual(self.root_of(self.main)["versionToken"], 1)
            self.finish()

    def test_a_cache_whose_root_is_no_dictionary_stops_the_process(self):
        for path in (self.main, self.working_set):
            for root in ([], "text", 7):
                self.write(path, self.archive(root))
                status, _, error = self.run_program("ls")
                self.assertNotIn(status, (0, 1, 2))
                self.assertIn(os.fsencode(path), error)
                self.assertRegex(error.decode(), r"(?i)remove|delete|move")
            os.unlink(path)
        self.assertEqual(self.run_program("ls")[0], 0)

    def test_the_doctor_sets_aside_a_cache_that_stops_the_process(self):
        for path in (self.main, self.working_set):
            self.write(path, self.archive("text"))
        status, output, _ = self.run_program("doctor")
        self.assertEqual(status, 0)
        self.assertEqual(output.count(b"Set aside"), 2)
        for path in (self.main, self.working_set):
            [aside] = [name for name in os.listdir(os.path.dirname(path)) if name.startswith(os.path.basename(path) + ".")]
            with open(os.path.join(os.path.dirname(path), aside), "rb") as file:
                self.assertEqual(file.read(), self.archive("text"))
        self.assertEqual(self.run_program("ls")[0], 0)
        self.assertNotIn(b"Set aside", self.run_program("doctor")[1])

    def test_an_older_token_of_the_main_cache_is_another_list(self):
        """As when the file was put back from a copy."""
        self.start()
        views = self.views(ROOT, WORKING_SET)
        self.install("org.b")
        for view in views:
            self.wait_for_libraries(view, "org.a", "org.b")
        self.finish()
        root = self.root_of(self.main)
        self.write(self.main, self.archive({**root, "versionToken": 1}))
        self.start()
        with self.assertRaises(RpcError) as raised:
            views[0].catch_up()
        self.assertTrue(is_expired(raised.exception))
        self.assert_said("info", "app-library version is greater than local version")
        [again] = self.views(ROOT)
        self.wait_for_libraries(again, "org.a", "org.b")
        # The working set's list is newer than the main one's, which wins.
        self.wait_for_libraries(views[1], "org.a", "org.b")
        self.assert_said("error", "version token shouldn't be greater than the main's cache version")

    def unprivileged(self):
        if os.geteuid() != 0:
            return {}
        for folder, folders, files in os.walk(self.folder):
            os.chown(folder, NOBODY, NOBODY)
            for name in folders + files:
                os.lchown(os.path.join(folder, name), NOBODY, NOBODY)
        return {"user": NOBODY, "group": NOBODY, "extra_groups": []}

    def test_caches_that_cannot_be_written_keep_the_old_list(self):
        how = self.unprivileged()
        self.start(**how)
        self.finish()
        self.install("org.b")
        os.chmod(os.path.dirname(self.main), 0o500)
        how = self.unprivileged()
        self.start(**how)
        root, everything = self.views(ROOT, WORKING_SET)
        self.assertEqual(self.libraries(root), ["#org.a"])
        # It is told all the same; only the next process won't know.
        self.wait_for_libraries(everything, "org.a")
        self.assert_said("error", "can't refresh app libraries; .*Permission denied")
        self.assert_said("error", "can't save working-set cache to disk; .*Permission denied")
        os.chmod(os.path.dirname(self.main), 0o700)
        self.install("org.c")
        self.wait_for_libraries(root, "org.a", "org.b", "org.c")
        self.wait_for_libraries(everything, "org.a", "org.b", "org.c")

    def test_a_full_disk_keeps_the_old_list(self):
        self.start()
        self.finish()
        self.install("org.b")
        # The two files stand on a disk of their own that is full; what was there is in it.
        script = ('mount -t tmpfs -o size=64k none "$0" && cp -a "$1"/. "$0" && '
                  '{ cat /dev/zero > "$0/filler" 2>/dev/null; shift; exec "$@"; }')
        folder = os.path.dirname(self.main)
        copy = os.path.join(self.folder, "copy")
        shutil.copytree(folder, copy)
        self.start(launcher=["unshare", "--user", "--map-root-user", "--mount", "sh", "-c", script, folder, copy])
        root, everything = self.views(ROOT, WORKING_SET)
        self.assertEqual(self.libraries(root), ["#org.a"])
        self.wait_for_libraries(everything, "org.a")
        self.assert_said("error", "can't refresh app libraries; .*No space left on device")
        self.assert_said("error", "can't save working-set cache to disk; .*No space left on device")
        self.finish()
        self.start()
        self.wait_for_libraries(self.views(ROOT)[0], "org.a", "org.b")


class OtherMountTest(AppsTest):
    """An application's documents may be mounted where they are: the kernel moves nothing from one mount to another, so it's copied."""

    def setUp(self):
        super().setUp()
        self.install("org.a")
        self.start(launcher=["unshare", "--user", "--map-root-user", "--mount", "sh", "-c", 'mount --bind "$0" "$0" && exec "$@"',
                             self.documents("org.a")])
        self.library, = self.views(ROOT)
        self.wait_for_libraries(self.library, "org.a")
        self.target = self.host.identifier(self.make_folder("target"))

    def make_folder(self, name):
        path = os.path.join(self.storage, name)
        os.makedirs(path)
        return path

    def trashed(self, mebibytes):
        """A document of the application's, in its trash."""
        source = os.path.join(self.folder, "big")
        with open(source, "wb") as file:
            for _ in range(mebibytes):
                file.write(bytes(range(1, 129)) * 8192)
        item = self.call("importDocument", path=source, parent="#org.a")
        return self.call("trashItem", identifier=item["identifier"])["identifier"]

    def test_a_put_back_that_copies_is_followed_and_cancelled(self):
        # Whether it is over before its cancellation comes is not to be said: then one of more is tried.
        for mebibytes in (32, 128, 512, 2048):
            item = self.trashed(mebibytes)
            request = self.host.send("untrashItem", identifier=item, parent=self.target)
            while (told := self.host.next_notification("progress"))["request"] != request:
                pass  # The import told of itself, too.
            self.assertEqual((told["totalBytes"], told["totalItems"]), (mebibytes << 20, 1))
            self.assertEqual(self.call("cancel", request=request), {})
            answer = self.host.answer(request)
            if "error" in answer:
                break
            self.call("deleteItem", identifier=answer["result"]["identifier"])
        self.assertEqual((answer["error"]["data"]["domain"], answer["error"]["data"]["code"]), ("KsPOSIXErrorDomain", errno.ECANCELED))
        self.assertEqual(os.listdir(os.path.join(self.storage, "target")), [])
        self.assertTrue(self.call("itemForIdentifier", identifier=item)["isTrashed"])

        # It is as it was, and the next attempt gets to its end.
        restored = self.call("untrashItem", identifier=item, parent=self.target)
        self.assertEqual((restored["parentIdentifier"], restored["isTrashed"]), (self.target, False))
        with open(os.path.join(self.storage, "target", "big"), "rb") as file, open(os.path.join(self.folder, "big"), "rb") as source:
            self.assertTrue(file.read() == source.read())
        self.assertEqual(os.listdir(self.documents("org.a", ".Trash")), [])

    def test_every_edit_works_there(self):
        folder = self.call("createDirectory", name="folder", parent="#org.a")["identifier"]
        source = os.path.join(self.folder, "tree")
        os.makedirs(os.path.join(source, "below"))
        with open(os.path.join(source, "below", "file"), "w", encoding="ascii") as file:
            file.write("contents")
        tree = self.call("importDocument", path=source, parent=folder)["identifier"]
        self.assertEqual(os.listdir(self.documents("org.a", "folder", "tree")), ["below"])
        # There and back.
        for parent, path in ((self.target, os.path.join(self.storage, "target")), (folder, self.documents("org.a", "folder"))):
            tree = self.call("reparentItem", identifier=tree, parent=parent)["identifier"]
            with open(os.path.join(path, "tree", "below", "file"), encoding="ascii") as file:
                self.assertEqual(file.read(), "contents")
        self.assertEqual(os.listdir(os.path.join(self.storage, "target")), [])
        self.call("deleteItem", identifier=tree)
        self.assertEqual(os.listdir(self.documents("org.a", "folder")), [])
        # Nothing is left behind where things are built.
        for root in (self.storage, self.documents("org.a")):
            temporary = os.path.join(root, ".TemporaryLocalFolder")
            self.assertEqual(os.listdir(temporary) if os.path.exists(temporary) else [], [])


class ConvergenceTest(AppsTest):
    """Whatever happens to applications and their documents, views end where a fresh listing does."""

    APPLICATIONS = [f"org.app{number}" for number in range(4)]

    def setUp(self):
        super().setUp()
        self.random = random.Random(int(os.environ.get("CINDRAL_SEED", "5")))
        self.installed = set()
        self.count = 0

    def _new_name(self, suffix=".txt"):
        self.count += 1
        return f"{self.count}{suffix}"

    def _folders(self):
        """Folders of the storage and of all applications, also of those that are not installed."""
        roots = [self.storage] + [self.documents(identifier) for identifier in self.APPLICATIONS]
        return [folder for root in roots for folder, _, _ in os.walk(root)]

    def _entries(self):
        roots = {self.storage, *(self.documents(identifier) for identifier in self.APPLICATIONS)}
        return [os.path.join(folder, name) for root in sorted(roots) for folder, folders, files in os.walk(root)
                for name in sorted(folders + files)]

    def _toggle(self):
        identifier = self.random.choice(self.APPLICATIONS)
        if identifier in self.installed:
            self.entries.uninstall(identifier)
            self.installed.remove(identifier)
        else:
            self.install(identifier)
            self.installed.add(identifier)

    def _make(self):
        folder = self.random.choice(self._folders())
        if self.random.random() < 0.4:
            name = self.random.choice([".Trash", "Inbox", self._new_name(""), self._new_name(".folio")])
            os.makedirs(os.path.join(folder, name), exist_ok=True)
        else:
            with open(os.path.join(folder, self._new_name()), "wb") as file:
                file.write(b"x" * self.random.randrange(100))

    def _move(self):
        entries = self._entries()
        if not entries:
            return
        source = self.random.choice(entries)
        target = self.random.choice([f for f in self._folders() if not (f + "/").startswith(source + "/")])
        os.rename(source, os.path.join(target, self._new_name(os.path.splitext(source)[1])))

    def _remove(self):
        entries = self._entries()
        if not entries:
            return
        path = self.random.choice(entries)
        if os.path.isdir(path):
            shutil.rmtree(path)
        else:
            os.unlink(path)

    def _replace_documents(self):
        identifier = self.random.choice(self.APPLICATIONS)
        other = self.container(identifier) + "/" + self._new_name("")
        os.rename(self.documents(identifier), other)
        os.mkdir(self.documents(identifier))
        with open(self.documents(identifier, self._new_name()), "wb"):
            pass

    def test_views_converge_while_applications_come_and_go(self):
        for identifier in self.APPLICATIONS:
            self.make_documents(identifier)
        self.start()
        views = self.views(ROOT, WORKING_SET, ALL_DIRECTORIES)
        steps = [self._toggle] * 2 + [self._make] * 6 + [self._move] * 4 + [self._remove] * 2 + [self._replace_documents]
        for round_number in range(int(os.environ.get("CINDRAL_ROUNDS", "25"))):
            for _ in range(self.random.randrange(1, 12)):
                self.random.choice(steps)()
                if self.random.random() < 0.2:
                    self.catch_up(self.random.choice(views))
            with self.subTest(round=round_number):
                for view in views:
                    self.wait_for_libraries(view, *self.installed)
                    self._assert_holds_what_is_there(view)

    def _assert_holds_what_is_there(self, view):
        """The documents of installed applications, and no others."""
        mine = {item["bundleIdentifier"] for item in view.items.values() if item["identifier"].startswith("#")}
        self.assertEqual(mine, self.installed)
        if view.container != WORKING_SET:
            return
        roots = [self.storage, *(self.documents(identifier) for identifier in self.installed)]
        self.assertTrue(all(any(item["fileURL"].startswith(f"file://{root}") for root in roots) for item in view.items.values()
                            if "fileURL" in item and item["parentIdentifier"] in (ROOT, *self.libraries(view))))

    def test_views_outlive_the_host(self):
        for identifier in self.APPLICATIONS:
            self.make_documents(identifier)
            self.put(identifier, ".Trash", "trashed.txt")
        self.start()
        views = self.views(ROOT, WORKING_SET, ALL_DIRECTORIES)
        for _ in range(5):
            self.restart(meanwhile=self._toggle)
            for at, view in enumerate(views):
                try:
                    self.wait_for_libraries(view, *self.installed)
                except RpcError as error:
                    # The list of the root and of all directories is the newest: a client of an older one begins again.
                    self.assertTrue(is_expired(error) and view.container != WORKING_SET, f"{view.container}: {error}")
                    views[at] = ContainerView(self, view.container)
                    self.wait_for_libraries(views[at], *self.installed)


if __name__ == "__main__":
    unittest.main()
