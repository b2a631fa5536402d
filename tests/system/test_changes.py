"""Clients that follow containers: what they are told is what changed, whoever changed it."""

import base64
import ctypes
import mmap
import os
import plistlib
import random
import shutil
import signal
import tempfile
import unittest

from cindral_rpc import ROOT, WORKING_SET, Client, RpcError, SystemTest, base64_text
from container_view import ALL_DIRECTORIES, ContainerView, listed
from recorders import may_use_fanotify

TESSEL = "TesselErrorDomain"
NOBODY = 65534
LIBC = ctypes.CDLL(None, use_errno=True)


def exchange(one, other):
    """Both names, at once."""
    here, both = -100, 2
    if LIBC.renameat2(here, one, here, other, both) != 0:
        raise OSError(ctypes.get_errno(), "renameat2")


class ChangesTest(SystemTest):
    """A host with one recorder, and views that must stay what a fresh listing is."""

    recorder = "inotify"

    def setUp(self):
        super().setUp()
        self.host = None

    def options(self, storage=None, state=None):
        return [*super().options(storage, state), "--no-flatpak", "--recorder", self.recorder]

    def start(self, **popen):
        self.host = Client(self.options(), self.environment, **popen)
        self.addCleanup(self._end, self.host)
        return self.host

    @staticmethod
    def _end(host):
        if host.process.poll() is None:
            host.kill()

    def call(self, method, **params):
        return self.host.call(method, **params)

    def restart(self, kill=False, meanwhile=None):
        if kill:
            self.host.kill()
        else:
            self.assertEqual(self.host.finish(), 0, self.host.error_text())
        if meanwhile is not None:
            meanwhile()
        self.start()

    def view(self, container):
        # The views outlive the host's process: they ask whichever is there.
        return ContainerView(self, container)

    def views(self, *containers):
        return [self.view(container) for container in containers]

    def identifier(self, *names):
        return self.host.identifier(self.path(*names))

    def changes(self, view):
        """What a view is told, after which it must be what the container lists."""
        changes = view.catch_up()
        fresh, _ = listed(self, view.container)
        self.assertEqual(view.differences(fresh), [])
        return changes

    def assert_changes(self, view, updated=(), deleted=()):
        changes = self.changes(view)
        self.assertEqual(sorted(set(changes.updated_identifiers)), sorted(set(updated)))
        self.assertEqual(sorted(set(changes.deleted)), sorted(set(deleted)))

    def write(self, *names, contents=b"changed"):
        with open(self.path(*names), "wb") as file:
            file.write(contents)


class WhatChangesMean:
    """Each rule once, whatever the recorder."""

    def test_nothing_is_told_of_a_tree_that_nobody_changed(self):
        self.make_file("folder", "file.txt")
        self.start()
        views = self.views(ROOT, WORKING_SET, ALL_DIRECTORIES, self.identifier("folder"))
        for view in views:
            self.assertEqual(self.changes(view).log, [])
        self.restart()
        for view in views:
            self.assertEqual(self.changes(view).log, [])

    def test_a_new_file_is_told_where_it_is_listed(self):
        os.mkdir(self.path("folder"))
        self.start()
        folder = self.identifier("folder")
        root, inside, everything, directories = self.views(ROOT, folder, WORKING_SET, ALL_DIRECTORIES)
        self.make_file("folder", "file.txt")
        file = self.identifier("folder", "file.txt")
        # A folder whose entries changed is itself changed.
        self.assert_changes(root, updated=[folder])
        self.assert_changes(inside, updated=[file])
        self.assert_changes(everything, updated=[folder, file])
        self.assert_changes(directories, updated=[folder])

    def test_a_new_folder_is_told_with_what_is_in_it(self):
        self.start()
        root, everything, directories = self.views(ROOT, WORKING_SET, ALL_DIRECTORIES)
        self.make_file("new", "deeper", "file.txt")
        new, deeper = self.identifier("new"), self.identifier("new", "deeper")
        file = self.identifier("new", "deeper", "file.txt")
        self.assert_changes(root, updated=[new])
        self.assert_changes(everything, updated=[new, deeper, file])
        self.assert_changes(directories, updated=[new, deeper])

    def test_an_edit_is_one_update(self):
        self.make_file("file.txt")
        self.make_file("other.txt")
        self.start()
        root, everything = self.views(ROOT, WORKING_SET)
        self.write("file.txt", contents=b"twelve bytes")
        for view in (root, everything):
            changes = self.changes(view)
            self.assertEqual([(item["filename"], item["documentSize"]) for item in changes.updated], [("file.txt", 12)])
            self.assertEqual(changes.deleted, [])

    def test_a_rename_keeps_the_identifier(self):
        self.make_file("before.txt")
        self.start()
        file = self.identifier("before.txt")
        root, everything = self.views(ROOT, WORKING_SET)
        os.rename(self.path("before.txt"), self.path("after.txt"))
        for view in (root, everything):
            changes = self.changes(view)
            self.assertEqual(changes.deleted, [])
            self.assertEqual({(item["identifier"], item["filename"]) for item in changes.updated}, {(file, "after.txt")})

    def test_a_document_moved_out_of_a_folder_is_deleted_there_and_updated_elsewhere(self):
        self.make_file("from", "file.txt")
        os.mkdir(self.path("to"))
        self.start()
        source, target, file = self.identifier("from"), self.identifier("to"), self.identifier("from", "file.txt")
        of_source, of_target, everything = self.views(source, target, WORKING_SET)
        os.rename(self.path("from", "file.txt"), self.path("to", "file.txt"))
        self.assert_changes(of_source, deleted=[file])
        self.assert_changes(of_target, updated=[file])
        self.assert_changes(everything, updated=[source, target, file])
        self.assertEqual(everything.items[file]["parentIdentifier"], target)

    def test_a_renamed_folder_keeps_what_is_below(self):
        self.make_file("before", "deeper", "file.txt")
        self.start()
        folder = self.identifier("before")
        root, inside, everything, directories = self.views(ROOT, folder, WORKING_SET, ALL_DIRECTORIES)
        os.rename(self.path("before"), self.path("after"))
        for view in (root, everything, directories):
            self.assert_changes(view, updated=[folder])
        self.assert_changes(inside)
        self.make_file("after", "new.txt")
        self.assert_changes(inside, updated=[self.identifier("after", "new.txt")])

    def test_a_removed_file_is_deleted(self):
        self.make_file("file.txt")
        self.start()
        file = self.identifier("file.txt")
        root, everything = self.views(ROOT, WORKING_SET)
        os.unlink(self.path("file.txt"))
        self.assert_changes(root, deleted=[file])
        self.assert_changes(everything, deleted=[file])

    def test_what_leaves_the_storage_is_deleted_and_what_enters_is_told_with_all_below(self):
        self.make_files("folder", 20)
        self.start()
        folder = self.identifier("folder")
        root, everything = self.views(ROOT, WORKING_SET)
        os.rename(self.path("folder"), os.path.join(self.folder, "outside"))
        self.assert_changes(root, deleted=[folder])
        self.assertIn(folder, self.changes(everything).deleted)
        self.assertEqual(everything.items, {})
        os.rename(os.path.join(self.folder, "outside"), self.path("again"))
        self.assert_changes(root, updated=[folder])
        self.changes(everything)
        self.assertEqual(len(everything.items), 21)

    def test_a_folder_that_becomes_a_package_changes_its_identifier(self):
        self.make_file("folder", "deeper", "file.txt", contents=b"12345")
        self.start()
        folder = self.identifier("folder")
        root, everything, directories = self.views(ROOT, WORKING_SET, ALL_DIRECTORIES)
        os.rename(self.path("folder"), self.path("folder.folio"))
        package = self.identifier("folder.folio")
        self.assertTrue(package.startswith("did="))
        self.assert_changes(root, updated=[package], deleted=[folder])
        self.changes(everything)
        self.assertEqual(list(everything.items), [package])
        self.changes(directories)
        self.assertEqual(directories.items, {})
        os.rename(self.path("folder.folio"), self.path("folder"))
        self.assert_changes(root, updated=[folder], deleted=[package])
        self.changes(everything)
        self.assertEqual(len(everything.items), 3)

    def test_a_change_inside_a_package_is_one_of_the_package(self):
        self.make_file("book.folio", "chapters", "one.txt", contents=b"12345")
        self.start()
        package = self.identifier("book.folio")
        everything = self.view(WORKING_SET)
        self.write("book.folio", "chapters", "one.txt", contents=b"1234567")
        self.assert_changes(everything, updated=[package])
        self.assertEqual(everything.items[package]["documentSize"], 7)

    def test_a_trashed_folder_is_trashed_with_all_below(self):
        self.make_file("folder", "deeper", "file.txt")
        os.mkdir(self.path(".Trash"))
        self.start()
        folder = self.identifier("folder")
        root, everything, directories = self.views(ROOT, WORKING_SET, ALL_DIRECTORIES)
        os.rename(self.path("folder"), self.path(".Trash", "folder"))
        self.assert_changes(root, deleted=[folder])
        self.changes(everything)
        self.assertEqual({item["isTrashed"] for item in everything.items.values()}, {True})
        self.changes(directories)
        os.rename(self.path(".Trash", "folder"), self.path("folder"))
        self.assert_changes(root, updated=[folder])
        self.changes(everything)
        self.assertEqual({item["isTrashed"] for item in everything.items.values()}, {False})

    def test_what_moved_out_of_a_folder_that_moved_and_went_stays(self):
        """Told in one go: the folder's own way must not take along what left it on the way."""
        for end in (shutil.rmtree, lambda folder: os.rename(folder, folder + ".folio"),
                    lambda folder: os.rename(folder, self.path(".Trash"))):
            self.make_file("a", "b", "c", "d", "kept.txt")
            self.start()
            views = self.views(WORKING_SET, ALL_DIRECTORIES)
            settle = self.view(ROOT)
            os.rename(self.path("a", "b"), self.path("a", "moved"))
            self.changes(settle)
            os.rename(self.path("a", "moved", "c"), self.path("c"))
            self.changes(settle)
            end(self.path("a", "moved"))
            for view in views:
                self.changes(view)
            self.assertIn("kept.txt", {item["filename"] for item in views[0].items.values()})
            self._end(self.host)
            for entry in os.scandir(self.storage):
                shutil.rmtree(entry)

    def test_what_left_a_folder_by_way_of_another_that_went_stays(self):
        """The folder in between is told of no more, so clients still have all of it in the first one when that goes."""
        self.make_file("first", "carrier", "a", "kept.txt")
        self.start()
        views = self.views(WORKING_SET, ALL_DIRECTORIES)
        self.make_file("first", "carrier", "a", "below", "new.txt")
        for view in views:
            self.changes(view)
        settle = self.view(ROOT)
        os.rename(self.path("first", "carrier"), self.path("carrier"))
        self.changes(settle)
        shutil.rmtree(self.path("first"))
        self.changes(settle)
        os.rename(self.path("carrier", "a"), self.path("a"))
        self.changes(settle)
        shutil.rmtree(self.path("carrier"))
        for view in views:
            self.changes(view)
        self.assertEqual(len(views[0].items), 4)

    def test_what_is_in_a_trash_stays_whatever_happens_to_the_trash(self):
        """A folder that was listed becomes one that is not, while what is in it still is."""
        self.make_file("folder", "below", "file.txt")
        os.mkdir(self.path("other"))
        self.start()
        views = self.views(WORKING_SET, ALL_DIRECTORIES)
        trash, other_trash = self.path(".Trash"), self.path("other", ".Trash")

        def both():
            for view in views:
                self.changes(view)
            self.assertIn("below", {item["filename"] for item in views[0].items.values()})

        os.rename(self.path("folder"), trash)
        both()
        self.make_file(".Trash", "new.txt")
        both()
        os.rename(trash, other_trash)
        both()
        os.mkdir(trash)
        both()
        os.rename(other_trash, os.path.join(trash, ".Trash"))
        both()
        # Within a trash, which is no reason to tell of what is in it.
        os.rename(os.path.join(trash, ".Trash"), os.path.join(trash, "folder"))
        both()
        os.rename(os.path.join(trash, "folder"), os.path.join(trash, ".Trash"))
        both()
        self.restart()
        os.rename(os.path.join(trash, ".Trash"), os.path.join(self.path("other"), ".Trash"))
        both()

    def test_both_sides_of_an_exchange_are_told(self):
        self.make_file("a", "file.txt")
        self.make_file("b")
        self.start()
        root, everything = self.views(ROOT, WORKING_SET)
        exchange(os.fsencode(self.path("a")), os.fsencode(self.path("b")))
        self.changes(root)
        self.changes(everything)
        kinds = {item["filename"]: item["identifier"][:4] for item in root.items.values()}
        self.assertEqual(kinds, {"a": "did=", "b": "fid="})

    def test_a_folder_that_is_made_again_is_another(self):
        self.make_file("folder", "old.txt")
        self.start()
        root, everything = self.views(ROOT, WORKING_SET)
        os.unlink(self.path("folder", "old.txt"))
        os.rmdir(self.path("folder"))
        self.make_file("folder", "new.txt")
        self.changes(root)
        self.changes(everything)
        self.assertEqual(sorted(item["filename"] for item in everything.items.values()), ["folder", "new.txt"])

    def test_what_came_and_went_is_not_told(self):
        self.start()
        views = self.views(ROOT, WORKING_SET)
        for number in range(50):
            self.make_file(f"temporary {number}")
            os.unlink(self.path(f"temporary {number}"))
        for view in views:
            self.assertEqual(self.changes(view).log, [])

    def test_mode_and_attributes_are_told(self):
        self.make_file("file.txt")
        self.start()
        file = self.identifier("file.txt")
        everything = self.view(WORKING_SET)
        os.chmod(self.path("file.txt"), 0o600)
        self.assert_changes(everything, updated=[file])
        os.setxattr(self.path("file.txt"), "user.colour", b"red")
        self.assert_changes(everything, updated=[file])

    def test_a_file_changed_under_a_name_outside_is_told(self):
        self.make_file("file.txt")
        self.start()
        everything = self.view(WORKING_SET)
        outside = os.path.join(self.folder, "outside.txt")
        os.link(self.path("file.txt"), outside)
        # inotify says nothing of a name in a folder that isn't watched; it does from the next look at the file on.
        os.chmod(self.path("file.txt"), 0o600)
        self.changes(everything)
        with open(outside, "wb") as written:
            written.write(b"from outside")
        self.changes(everything)
        self.assertEqual([item["documentSize"] for item in everything.items.values()], [12])

    def test_a_mapped_file_is_told_when_it_is_closed(self):
        self.make_file("file.txt", contents=b"x" * 4096)
        self.start()
        file = self.identifier("file.txt")
        everything = self.view(WORKING_SET)
        with open(self.path("file.txt"), "r+b") as opened, mmap.mmap(opened.fileno(), 4096) as memory:
            memory[0:4] = b"true"
        self.assert_changes(everything, updated=[file])

    def test_odd_names_are_told(self):
        self.start()
        everything = self.view(WORKING_SET)
        for name in (b"\xff\xfe", b"new\nline", b"#12", b"%41", b"x" * 255):
            self.make_file(b"odd", name)
        self.changes(everything)
        self.assertEqual(len(everything.items), 6)

    def test_many_changes_come_in_several_answers(self):
        self.start()
        everything = self.view(WORKING_SET)
        self.make_files("many", 1000)
        changes = self.changes(everything)
        self.assertGreater(changes.calls, 5)
        self.assertEqual(len(everything.items), 1001)
        # In between, more is changed; what was told is not lost, what comes is told.
        for number in range(1000):
            os.rename(self.path("many", f"{number:05}.txt"), self.path("many", f"{number:05}.md"))
        self.assertEqual(everything.catch_up(calls_max=1).calls, 1)
        for number in range(0, 1000, 2):
            os.unlink(self.path("many", f"{number:05}.md"))
        self.changes(everything)
        self.assertEqual(len(everything.items), 501)

    def test_each_answer_is_of_the_time_it_is_asked_for(self):
        self.start()
        everything = self.view(WORKING_SET)
        for attempt in range(5):
            folder = f"many{attempt}"
            self.make_files(folder, 350)
            first = self.call("enumerateChanges", container=WORKING_SET, anchor=everything.anchor)
            self.assertTrue(first["moreComing"])
            told = {item["filename"] for item in first["updated"]}
            removed = [name for name in os.listdir(self.path(folder)) if name not in told]
            for name in removed:
                os.unlink(self.path(folder, name))
            second = self.call("enumerateChanges", container=WORKING_SET, anchor=first["anchor"])
            self.assertEqual({item["filename"] for item in second["updated"]} & set(removed), set())
            self.changes(everything)

    def test_a_client_that_asks_again_from_the_same_anchor_is_told_the_same(self):
        self.start()
        everything = self.view(WORKING_SET)
        self.make_files("many", 150)
        first = self.call("enumerateChanges", container=WORKING_SET, anchor=everything.anchor)
        second = self.call("enumerateChanges", container=WORKING_SET, anchor=everything.anchor)
        self.assertEqual(first["log"], second["log"])

    # Anchors.

    def test_an_anchor_of_anything_else_has_expired(self):
        self.make_file("file.txt")
        self.start()
        for data in (b"", b"x", b"bplist00", bytes(1000), os.urandom(64)):
            self.assert_error(TESSEL, -1002, self.call, "enumerateChanges", container=ROOT, anchor=base64_text(data))
        for anchor in ("!", "abc", 7, None):
            self.assert_refused(-32602, self.call, "enumerateChanges", container=ROOT, anchor=anchor)

    def test_an_anchor_of_another_store_has_expired(self):
        self.make_file("file.txt")
        self.start()
        anchors = {container: self.call("currentSyncAnchor", container=container)["anchor"]
                   for container in (ROOT, WORKING_SET, ALL_DIRECTORIES)}
        self.state = os.path.join(self.folder, "another state")
        self.restart()
        for container, anchor in anchors.items():
            self.assert_error(TESSEL, -1002, self.call, "enumerateChanges", container=container, anchor=anchor)

    def test_an_anchor_ahead_of_the_store_has_expired(self):
        """As when the state was put back from a copy."""
        self.make_file("file.txt")
        self.start()
        before = base64.b64decode(self.call("currentSyncAnchor", container=WORKING_SET)["anchor"])
        view = self.view(WORKING_SET)
        self.make_files("many", 3)
        self.changes(view)
        now = base64.b64decode(view.anchor)
        changed = [at for at, (a, b) in enumerate(zip(before, now)) if a != b]
        self.assertTrue(changed, "the event ID is where the two differ")
        ahead = bytearray(now)
        ahead[changed[0]] = 0x7F
        self.assert_error(TESSEL, -1002, self.call, "enumerateChanges", container=WORKING_SET, anchor=base64_text(bytes(ahead)))

    def test_a_container_that_is_not_there_has_no_changes(self):
        self.start()
        anchor = self.call("currentSyncAnchor", container=ROOT)["anchor"]
        for container in ("fid=999999999", "did=999999", "nonsense"):
            with self.assertRaises(RpcError) as raised:
                self.call("enumerateChanges", container=container, anchor=anchor)
            self.assertNotEqual(raised.exception.domain_code, -1002)

    def test_a_change_by_a_name_that_left_the_storage_with_its_folder_is_told_where_the_other_name_is(self):
        with tempfile.TemporaryDirectory(dir=os.path.dirname(self.storage)) as outside:
            self.make_file("stays", "one name.txt")
            os.mkdir(self.path("leaves"))
            self.start()
            everything = self.view(WORKING_SET)
            for number in range(3):
                os.link(self.path("stays", "one name.txt"), self.path("leaves", "another.txt"))
                self.changes(everything)
                os.kill(self.host.process.pid, signal.SIGSTOP)
                self.write("leaves", "another.txt", contents=b"x" * (number + 1))
                os.rename(self.path("leaves"), os.path.join(outside, str(number)))
                os.mkdir(self.path("leaves"))
                os.kill(self.host.process.pid, signal.SIGCONT)
                self.changes(everything)

    # Packages whose contents others follow.

    def _package(self, name, *files):
        for file in files:
            self.make_file(name, file)
        return self.path(name)

    def test_what_is_in_a_package_is_followed_when_another_takes_its_place(self):
        old, new = self._package("a.folio", "gone.txt", "both.txt"), self._package("b.folio", "both.txt", "new.txt")
        self.start()
        followed = self.view(self.identifier("a.folio"))
        other = self.identifier("b.folio")
        names = lambda: sorted(item["filename"] for item in followed.items.values())  # noqa: E731
        self.assertEqual(names(), ["both.txt", "gone.txt"])
        shutil.rmtree(old)
        os.rename(new, old)
        self.changes(followed)
        self.assertEqual(names(), ["both.txt", "new.txt"])
        self.assertEqual(self.identifier("a.folio"), followed.container)
        # Of the two identifiers that it had, one is no more: for nothing at all.
        self.assert_error("CindralProvider.LocalTesselKitError", 0, self.call, "itemForIdentifier", identifier=other)
        self.assert_error(TESSEL, -1001, self.call, "currentSyncAnchor", container=other)

    def test_what_is_in_a_package_is_followed_when_it_is_saved_with_a_backup(self):
        package = self._package("a.folio", "gone.txt", "both.txt")
        self.start()
        followed = self.view(self.identifier("a.folio"))
        everything = self.view(WORKING_SET)
        for number in range(3):
            saved = self._package("a.folio.tmp", "both.txt", f"{number}.txt")
            os.rename(package, package + "~")
            os.rename(saved, package)
            self.changes(followed)
            self.assertEqual(sorted(item["filename"] for item in followed.items.values()), [f"{number}.txt", "both.txt"])
            self.assertEqual(self.identifier("a.folio"), followed.container)
            shutil.rmtree(package + "~")
            self.changes(followed)
            self.changes(everything)

    # Ends and beginnings.

    def _change_a_little(self):
        self.write("folder", "changed.txt")
        os.rename(self.path("folder", "renamed.txt"), self.path("new name.txt"))
        os.unlink(self.path("folder", "removed.txt"))
        self.make_file("folder", "new.txt")
        self.make_file("new folder", "file.txt")

    def _make_what_changes(self):
        for name in ("changed.txt", "renamed.txt", "removed.txt", "same.txt"):
            self.make_file("folder", name)

    def _assert_told_a_little(self, root, everything, same):
        self.changes(root)
        changes = self.changes(everything)
        self.assertNotIn(same, changes.updated_identifiers)
        names = {item["filename"] for item in everything.items.values()}
        self.assertEqual(names, {"folder", "changed.txt", "new name.txt", "new.txt", "same.txt", "new folder", "file.txt"})

    def test_changes_made_while_the_host_is_down_are_told(self):
        self._make_what_changes()
        self.start()
        same = self.identifier("folder", "same.txt")
        renamed = self.identifier("folder", "renamed.txt")
        root, everything = self.views(ROOT, WORKING_SET)
        self.restart(meanwhile=self._change_a_little)
        self._assert_told_a_little(root, everything, same)
        self.assertIn(renamed, everything.items)

    def test_changes_around_a_kill_are_told(self):
        self._make_what_changes()
        self.start()
        same = self.identifier("folder", "same.txt")
        root, everything = self.views(ROOT, WORKING_SET)
        self.make_file("before the kill.txt")
        self.changes(everything)
        os.unlink(self.path("before the kill.txt"))
        self.restart(kill=True, meanwhile=self._change_a_little)
        self._assert_told_a_little(root, everything, same)

    def test_changes_made_while_the_host_is_suspended_are_told(self):
        self._make_what_changes()
        self.start()
        same = self.identifier("folder", "same.txt")
        root, everything = self.views(ROOT, WORKING_SET)
        os.kill(self.host.process.pid, signal.SIGSTOP)
        self._change_a_little()
        os.kill(self.host.process.pid, signal.SIGCONT)
        self._assert_told_a_little(root, everything, same)

    def test_nothing_is_lost_when_the_queue_of_the_kernel_overflows(self):
        self._make_what_changes()
        for name in ("one", "two"):
            self.make_file(name)
        self.start()
        same = self.identifier("folder", "same.txt")
        root, everything = self.views(ROOT, WORKING_SET)
        with open("/proc/sys/fs/inotify/max_queued_events", encoding="ascii") as file:
            events = int(file.read()) + 100
        os.kill(self.host.process.pid, signal.SIGSTOP)
        for number in range(events):
            os.chmod(self.path(("one", "two")[number % 2]), 0o600)
        self._change_a_little()
        os.unlink(self.path("one"))
        os.unlink(self.path("two"))
        os.kill(self.host.process.pid, signal.SIGCONT)
        self._assert_told_a_little(root, everything, same)

    def test_edits_made_while_the_host_is_down_are_told_and_nothing_else(self):
        """So many files as CINDRAL_RESTART_FILES says."""
        files = int(os.environ.get("CINDRAL_RESTART_FILES", "2000"))
        edits = files // 100
        for number in range(files):
            self.make_file(f"folder {number % (files // 100)}", f"{number}.txt", contents=b"same size")
        self.start()
        everything = self.view(WORKING_SET)
        chosen = random.Random(1).sample(range(files), edits)

        def edit():
            for number in chosen:
                with open(self.path(f"folder {number % (files // 100)}", f"{number}.txt"), "r+b") as file:
                    file.write(b"SAME SIZE")

        self.restart(meanwhile=edit)
        changes = self.changes(everything)
        self.assertEqual(changes.deleted, [])
        self.assertEqual(sorted(item["filename"] for item in changes.updated), sorted(f"{number}.txt" for number in chosen))

    def test_reads_what_was_written_before_every_time(self):
        """So often as CINDRAL_READS says."""
        reads = int(os.environ.get("CINDRAL_READS", "10000"))
        for number in range(20):
            self.make_file(f"{number}.txt")
        self.start()
        identifiers = [self.identifier(f"{number}.txt") for number in range(20)]
        view = self.view(ROOT)
        chosen = random.Random(2)
        sizes = [0] * 20
        for _ in range(reads):
            number = chosen.randrange(20)
            sizes[number] += 1
            with open(self.path(f"{number}.txt"), "ab") as file:
                file.write(b"x")
            view.catch_up()
            self.assertEqual(view.items[identifiers[number]]["documentSize"], sizes[number])
        self.assertEqual(view.differences(listed(self, ROOT)[0]), [])

    def test_reads_names_that_were_made_and_removed_before_every_time(self):
        self.start()
        view = self.view(ROOT)
        chosen = random.Random(3)
        names = set()
        for number in range(1000):
            if names and chosen.random() < 0.5:
                name = chosen.choice(sorted(names))
                names.remove(name)
                os.unlink(self.path(name))
            else:
                name = f"{number}.txt"
                names.add(name)
                self.make_file(name)
            view.catch_up()
            self.assertEqual({item["filename"] for item in view.items.values()}, names)

    # Signals.

    def test_a_monitored_container_is_signalled(self):
        os.mkdir(self.path("folder"))
        self.start()
        for container in (ROOT, WORKING_SET, self.identifier("folder")):
            view = self.view(container)
            self.call("startMonitoring", container=container)
            self.call("startMonitoring", container=container)
            self.make_file("folder", f"{container}.txt")
            while self.host.next_notification("signal")["container"] != container:
                pass
            self.assertTrue(self.changes(view).log)
            self.call("stopMonitoring", container=container)

    def test_who_lists_anew_is_signalled_again(self):
        os.mkdir(self.path("folder"))
        self.start()
        folder = self.identifier("folder")
        for container in (ROOT, folder):
            self.call("startMonitoring", container=container)
            for i in range(3):
                self.make_file("folder" if container == folder else ".", f"{i}.txt")
                while self.host.next_notification("signal")["container"] != container:
                    pass
                self.assertIn(f"{i}.txt", {item["filename"] for item in self.host.items(container)})
            self.call("stopMonitoring", container=container)

    # Documents through saving.

    def _saved(self, save):
        """The same document before and after, with its metadata."""
        self.make_file("report.txt", contents=b"first")
        self.start()
        before = self.identifier("report.txt")
        root, everything = self.views(ROOT, WORKING_SET)
        os.setxattr(self.path("report.txt"), "user.com.vemra.favorite-rank.number#PS", self._rank_of_three())
        self.changes(everything)
        self.assertEqual(everything.items[before]["favoriteRank"], 3)
        save(self.path("report.txt"))
        for view in (root, everything):
            self.changes(view)
            document = view.items[before]
            self.assertEqual((document["filename"], document["documentSize"], document.get("favoriteRank")), ("report.txt", 7, 3))
        self.assertEqual(self.identifier("report.txt"), before)

    @staticmethod
    def _rank_of_three():
        archive = {"archiver": "KsKeyedArchiver", "version": 1, "root": 3}
        return plistlib.dumps(archive, fmt=plistlib.FMT_BINARY)

    @staticmethod
    def _write_new(path):
        with open(path, "xb") as file:
            file.write(b"changed")

    def test_a_document_that_is_written_in_place_stays_itself(self):
        def save(path):
            with open(path, "wb") as file:
                file.write(b"changed")
        self._saved(save)

    def test_a_document_that_a_temporary_file_is_renamed_over_stays_itself(self):
        def save(path):
            self._write_new(path + ".tmp")
            os.rename(path + ".tmp", path)
        self._saved(save)

    def test_a_document_that_is_renamed_to_a_backup_stays_itself(self):
        def save(path):
            os.rename(path, path + "~")
            self._write_new(path)
            os.unlink(path + "~")
        self._saved(save)

    def test_a_document_whose_backup_is_kept_stays_itself(self):
        def save(path):
            os.rename(path, path + "~")
            self._write_new(path)
        self._saved(save)

    def test_a_document_that_is_removed_and_written_anew_stays_itself(self):
        def save(path):
            os.unlink(path)
            self._write_new(path)
        self._saved(save)

    def test_a_document_that_is_saved_while_its_client_looks_on_stays_itself(self):
        def save(path):
            os.rename(path, path + "~")
            self.view(ROOT).catch_up()
            self._write_new(path)
            self.view(ROOT).catch_up()
            os.unlink(path + "~")
        self._saved(save)

    def test_a_document_moved_over_another_leaves_one_of_them(self):
        """Both are young: whether this was a save or a move can't be told."""
        self.make_file("one.txt")
        self.make_file("two.txt")
        self.start()
        one, two = self.identifier("one.txt"), self.identifier("two.txt")
        root = self.view(ROOT)
        os.rename(self.path("one.txt"), self.path("two.txt"))
        self.changes(root)
        self.assertEqual(len(root.items), 1)
        self.assertIn(next(iter(root.items)), (one, two))

    # What can't be watched.

    def test_a_folder_that_cannot_be_read_hides_nothing_else(self):
        self.make_file("closed", "secret.txt")
        self.make_file("open", "file.txt")
        os.chmod(self.path("closed"), 0)
        self._start_as_an_ordinary_user()
        everything = self.view(WORKING_SET)
        self.write("open", "file.txt")
        self.make_file("open", "new.txt")
        self.changes(everything)
        self.assertEqual({item["filename"] for item in everything.items.values()}, {"closed", "open", "file.txt", "new.txt"})
        self.assertNotEqual(self.call("status")["coverage"], "full")

    def _start_as_an_ordinary_user(self):
        if os.geteuid() == 0:
            self._give_away()
            self.start(user=NOBODY, group=NOBODY, extra_groups=[])
        else:
            self.start()

    def _give_away(self):
        """To a user without privilege, with all that is in it."""
        os.chown(self.folder, NOBODY, NOBODY)
        for folder, folders, files in os.walk(self.folder):
            for name in folders + files:
                os.lchown(os.path.join(folder, name), NOBODY, NOBODY)


class InotifyChangesTest(WhatChangesMean, ChangesTest):
    recorder = "inotify"

    def test_a_folder_that_is_opened_and_moved_at_once_is_read(self):
        self.make_file("closed", "secret.txt")
        os.chmod(self.path("closed"), 0)
        self._start_as_an_ordinary_user()
        everything = self.view(WORKING_SET)
        self.host.process.send_signal(signal.SIGSTOP)
        os.rename(self.path("closed"), self.path("moved"))
        os.chmod(self.path("moved"), 0o755)
        self.host.process.send_signal(signal.SIGCONT)
        self.changes(everything)
        self.assertEqual({item["filename"] for item in everything.items.values()}, {"moved", "secret.txt"})

    def test_the_status_names_the_recorder(self):
        self.start()
        self.view(WORKING_SET)
        status = self.call("status")
        self.assertEqual((status["recorder"], status["coverage"]), ("inotify", "full"))

    def test_beyond_the_watch_limit_changes_are_found_all_the_same(self):
        for number in range(30):
            self.make_file(f"folder {number}", "file.txt")
        limited = ["unshare", "--user", "--map-root-user", "sh", "-c",
                   'echo 10 > /proc/sys/user/max_inotify_watches && exec "$@"', "sh"]
        self.start(launcher=limited)
        everything = self.view(WORKING_SET)
        self.assertNotEqual(self.call("status")["coverage"], "full")
        for number in range(30):
            self.write(f"folder {number}", "file.txt", contents=b"x" * number)
            self.changes(everything)
            os.rename(self.path(f"folder {number}"), self.path(f"renamed {number}"))
            self.make_file(f"renamed {number}", "deeper", "new.txt")
            self.changes(everything)
        self.assertEqual(len(everything.items), 30 * 4)


if may_use_fanotify():
    class FanotifyChangesTest(WhatChangesMean, ChangesTest):
        recorder = "fanotify"

        def test_the_status_names_the_recorder(self):
            self.start()
            self.view(WORKING_SET)
            status = self.call("status")
            self.assertEqual((status["recorder"], status["coverage"]), ("fanotify", "full"))

        def test_a_folder_that_cannot_be_read_hides_nothing_else(self):
            """Whoever may use it may read everything."""
            self.make_file("closed", "secret.txt")
            os.chmod(self.path("closed"), 0)
            self.start()
            everything = self.view(WORKING_SET)
            self.write("closed", "secret.txt")
            self.changes(everything)
            self.assertEqual(self.call("status")["coverage"], "full")
else:
    class FanotifyRefusedTest(ChangesTest):
        recorder = "fanotify"

        def test_it_is_refused_with_a_reason(self):
            status, _, errors = self.run_program("status")
            self.assertNotEqual(status, 0)
            self.assertIn(b"fanotify", errors)


class AutomaticRecorderTest(ChangesTest):
    recorder = "auto"

    def test_takes_what_this_user_may_have(self):
        self.start()
        self.view(WORKING_SET)  # Waits until the roots have been read: before that nobody records.
        self.assertEqual(self.call("status")["recorder"], "fanotify" if may_use_fanotify(self.storage) else "inotify")


if __name__ == "__main__":
    unittest.main()
