"""The one property: a client that applies the changes since its anchor has the view that a fresh listing gives.

Random operations are made on a storage, behind the host's back, while the host runs, is stopped, killed or suspended.
After each round of them, clients of some folders, the root, the working set and all directories catch up, each from its
own anchor, and are held against a fresh listing; and a file that is still there must be the document that it was.

    CINDRAL_PROGRAM=build/dev/src/host/cindral python3 -B tests/property/convergence.py --ops 1000000 --recorder inotify

The seed is printed; the same seed makes the same operations.
"""

import argparse
import collections
import contextlib
import errno
import os
import random
import shlex
import shutil
import signal
import sys
import tempfile
import time
import urllib.parse

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), os.pardir, "system"))

import cindral_rpc  # noqa: E402
from cindral_rpc import ROOT, WORKING_SET, Client, RpcError  # noqa: E402
from comparing_host import ComparingHost, WalkedListing  # noqa: E402
from container_view import ALL_DIRECTORIES, ContainerView, is_expired, listed  # noqa: E402
from tree_operations import Operations, Tree  # noqa: E402

# What a client is told of a folder that is gone, and of a number that is a file's now.
NO_FOLDER = (("TesselErrorDomain", -1001), ("KsPOSIXErrorDomain", errno.ENOTDIR))


class Difference(Exception):
    """The property does not hold: lines that tell how."""


class RealHost:
    """The program, as a process that is started and ended in several ways."""

    can_end = True

    def __init__(self, storage, state, environment, options):
        self.arguments = ["--storage", storage, "--state", state, "--no-flatpak", *options]
        self.environment = environment
        self.errors = collections.Counter()
        self.client = None
        self.start()

    def start(self):
        self.client = Client(self.arguments, self.environment)

    def call(self, method, **params):
        return self.client.call(method, **params)

    def identifier(self, path):
        url = "file://" + urllib.parse.quote(path)
        return self.call("identifierForItemAtURL", url=url)["identifier"]

    def stop(self):
        client, self.client = self.client, None
        status = client.finish()
        self._count_errors(client)
        if status != 0:
            raise Difference(f"the host ended with {status}: {client.error_text()}")

    def kill(self):
        client, self.client = self.client, None
        client.kill()
        self._count_errors(client)

    def kill_at_work(self, container, anchor):
        """While it answers."""
        self.client.send("enumerateChanges", container=container, anchor=anchor)
        self.kill()

    def suspend(self):
        os.kill(self.client.process.pid, signal.SIGSTOP)

    def resume(self):
        os.kill(self.client.process.pid, signal.SIGCONT)

    def _count_errors(self, client):
        self.errors.update(line.split(" ", 2)[-1].strip()[:60] for line in client.error_text().splitlines() if " error " in line)

    def close(self):
        if self.client is not None:
            self.kill()


class ModelHost:
    """One that needs no process: see comparing_host.py."""

    can_end = False

    def __init__(self, storage, loses_every):
        self.host = ComparingHost(WalkedListing(storage), loses_every)
        self.errors = collections.Counter()

    def call(self, method, **params):
        return self.host.call(method, **params)

    def identifier(self, path):
        return f"fid={os.lstat(path).st_ino}"

    def close(self):
        pass


class FolderClient:
    """A client of one folder, for as long as it is there under its identifier."""

    def __init__(self, host, tree, node):
        self.tree = tree
        self.node = node
        self.view = ContainerView(host, host.identifier(tree.path(node)))

    def still_is(self, host):
        return self.node.place is not None and host.identifier(self.tree.path(self.node)) == self.view.container


class Convergence:
    """Rounds of operations, each followed by a comparison."""

    def __init__(self, options, folder):
        self.options = options
        self.random = random.Random(options.seed)
        self.storage = os.path.join(folder, "Documents")
        beside = os.path.join(folder, "beside")
        os.mkdir(self.storage)
        os.mkdir(beside)
        self.tree = Tree(self.storage, beside, random.Random(options.seed + 1))
        self.operations = Operations(self.tree, options.size)
        self.told = []
        self.count = collections.Counter()
        for _ in range(options.size):
            self.operations.run()
        self.host = self._host(folder)
        self.operations.names_outside_are_told = self.options.model or self.host.call("status")["recorder"] == "fanotify"
        self.whole = [ContainerView(self.host, container) for container in (ROOT, WORKING_SET, ALL_DIRECTORIES)]
        self.folders = []
        self.documents = {}  # Of each file that was listed: its names, and its identifier.
        self.newest_document = 0

    def _host(self, folder):
        if self.options.model:
            return ModelHost(self.storage, self.options.loses_every)
        environment = {name: value for name, value in os.environ.items() if not name.startswith("XDG_")}
        environment["HOME"] = folder
        environment.setdefault("CINDRAL_LOG", "error")
        return RealHost(self.storage, os.path.join(folder, "state"), environment, ["--recorder", self.options.recorder])

    # A round.

    def run(self):
        while self.count["operations"] < self.options.ops:
            self.count["rounds"] += 1
            self.told = []
            way = self._way()
            self.told.append(f"-- {way.__name__[1:].replace('_', ' ')}")
            way()
            self.tree.verify()
            self._compare(is_last=self.count["operations"] >= self.options.ops)

    def _way(self):
        if not self.host.can_end:
            return self._while_running
        ways = [(self._while_running, 10), (self._while_stopped, 3), (self._over_a_kill, 3), (self._while_suspended, 3),
                (self._while_suspended_with_a_full_queue, 1 if self.options.overflows else 0)]
        return self.random.choices(*zip(*ways))[0]

    def _operate(self, count):
        for _ in range(count):
            self.told.append(self.operations.run())
            self.count["operations"] += 1

    def _while_running(self):
        """Clients ask in between."""
        left = self.options.round_size
        while left > 0:
            some = min(left, self.random.randrange(1, self.options.round_size + 1))
            self._operate(some)
            left -= some
            if self.random.random() < 0.5:
                view = self.random.choice(self.whole)
                self.told.append(f"-- {view.container} asks once")
                self._count_changes(view.catch_up(calls_max=1))

    def _while_stopped(self):
        self.host.stop()
        self._operate(self.options.round_size)
        self.host.start()

    def _over_a_kill(self):
        before = self.random.randrange(self.options.round_size)
        self._operate(before)
        if self.random.random() < 0.5:
            view = self.random.choice(self.whole)
            self.told.append(f"-- killed while {view.container} asks")
            self.host.kill_at_work(view.container, view.anchor)
        else:
            self.told.append("-- killed")
            self.host.kill()
        self._operate(self.options.round_size - before)
        self.host.start()

    def _while_suspended(self):
        self.host.suspend()
        self._operate(self.options.round_size)
        self.host.resume()

    def _while_suspended_with_a_full_queue(self):
        self.host.suspend()
        before = self.random.randrange(self.options.round_size)
        self._operate(before)
        self._fill_the_queue()
        self._operate(self.options.round_size - before)
        self.host.resume()

    def _fill_the_queue(self):
        """Events in turn of two files are not folded by inotify."""
        with open("/proc/sys/fs/inotify/max_queued_events", encoding="ascii") as file:
            events = int(file.read()) + 100
        files = [self.tree.path(node) for node in self.tree.lists["file"][:2]]
        if len(files) == 2:
            self.told.append(f"-- {events} times chmod {files}")
            for number in range(events):
                os.chmod(files[number % 2], 0o644)

    # The comparison.

    def _compare(self, is_last):
        # Up to now: until the recorder has been here, a document may still have the identifier that it had by itself.
        self.host.call("currentSyncAnchor", container=ROOT)
        self._keep_folder_clients()
        clients = self.whole + [client.view for client in self.folders]
        self.random.shuffle(clients)
        several = self.tree.files_with_several_names() if self.options.several_names == "any" else set()
        for view in clients:
            if not is_last and self.random.random() < 0.3:
                continue  # Its anchor grows old.
            self._compare_one(view, several)
        if self.random.random() < 0.05:
            at = self.random.randrange(len(self.whole))
            self.whole[at] = ContainerView(self.host, self.whole[at].container)

    def _compare_one(self, view, several):
        try:
            self._count_changes(view.catch_up())
        except RpcError as error:
            if not is_expired(error):
                raise
            self.count["expired"] += 1
            raise Difference(f"the anchor of {view.container} has expired") from error
        fresh, restarts = listed(self.host, view.container)
        self.count["listings that began again"] += restarts
        self.count["comparisons"] += 1
        lines = view.differences(fresh, lambda item: item.get("fileID") in several, self._had_several_names)
        if lines:
            raise Difference("\n".join([f"the view of {view.container} is not what it lists:", *lines, self._second_look(view, several)]))
        if view.container == WORKING_SET and self.host.can_end:
            self._compare_documents(fresh)

    def _compare_documents(self, fresh):
        """A file that is still there is still the same document, unless another file is that one since."""
        identifiers = {item["fileID"]: item["identifier"] for item in fresh.values() if item["identifier"].startswith("did=")}
        left_out = {id(names) for names in self.operations.may_be_another_document}
        self.operations.may_be_another_document.clear()
        vacated = set(self.tree.vacated)
        self.tree.vacated.clear()
        documents = {}
        for node in self.tree.lists["file"]:
            identifier = identifiers.get(os.lstat(self.tree.path(node)).st_ino)
            # One that has a name outside may have been there with all of them for a while.
            if identifier is None or any(name.place is None for name in node.names):
                continue
            documents[id(node.names)] = node.names, identifier
            _, before = self.documents.get(id(node.names), (None, identifier))
            is_new = int(identifier[4:]) > self.newest_document
            may_differ = id(node.names) in left_out or (node.parent, node.name) in vacated
            if before != identifier and is_new and before not in fresh and not may_differ:
                raise Difference(f"{self.tree.path(node)} was {before} and is {identifier}")
        self.documents = documents
        self.newest_document = max((int(identifier[4:]) for identifier in identifiers.values()), default=0)
        self.count["documents compared"] += len(documents)

    def _had_several_names(self, item):
        return not self.operations.names_outside_are_told and item.get("fileID") in self.operations.had_several_names

    def _second_look(self, view, several):
        """For whoever looks for the reason: whether it is late, or lost."""
        if not self.host.can_end:
            return ""
        time.sleep(3)
        view.catch_up()
        lines = view.differences(listed(self.host, view.container)[0], lambda item: item.get("fileID") in several,
                                 self._had_several_names)
        return "(three seconds later it still is not)" if lines else "(three seconds later it is)"

    def _count_changes(self, changes):
        self.count["requests for changes"] += changes.calls
        self.count["updates"] += len(changes.updated)
        self.count["deletions"] += len(changes.deleted)

    def _keep_folder_clients(self):
        stay = []
        for client in self.folders:
            if client.still_is(self.host):
                stay.append(client)
            else:
                self._leave(client)
        self.folders = stay
        while len(self.folders) < self.options.folders and len(self.tree.lists["folder"]) > 1:
            node = self.random.choice(self.tree.lists["folder"][1:])
            # The folder ".Trash" itself is listed nowhere.
            if node.name == b".Trash":
                break
            self.folders.append(FolderClient(self.host, self.tree, node))

    def _leave(self, client):
        """It is gone, or another thing: its client is told so, unless something new has its number."""
        self.count["folders that went"] += 1
        try:
            client.view.catch_up()
        except RpcError as error:
            if (error.domain, error.domain_code) not in NO_FOLDER:
                raise

    def close(self):
        self.host.close()


def become(user, folder):
    os.chown(folder, user, user)
    os.setgroups([])
    os.setgid(user)
    os.setuid(user)


def arguments(words):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--seed", type=int, default=None, help="repeat what this seed made (default: a new one)")
    parser.add_argument("--ops", type=int, default=2000, help="operations (default: %(default)s)")
    parser.add_argument("--round-size", type=int, default=40, help="operations between two comparisons (default: %(default)s)")
    parser.add_argument("--size", type=int, default=300, help="files and folders that the tree has, about (default: %(default)s)")
    parser.add_argument("--folders", type=int, default=4, help="clients of folders (default: %(default)s)")
    parser.add_argument("--recorder", default="auto", help="as the program's option (default: %(default)s)")
    parser.add_argument("--storage", default=None, help="folder to make the tree in (default: one for temporary files)")
    parser.add_argument("--user", type=int, default=None, help="number of a user to be, with the host (default: who runs this)")
    parser.add_argument("--no-overflows", dest="overflows", action="store_false", help="never overflow the kernel's queue")
    parser.add_argument("--several-names", choices=["any", "exact"], default="any",
                        help="whether a file with several names may be listed under any of them (default: %(default)s)")
    parser.add_argument("--model", action="store_true", help="against a host that compares listings, to try this program itself")
    parser.add_argument("--loses-every", type=int, default=0, help="with --model: lose one of so many changes")
    options = parser.parse_args(words)
    if options.seed is None:
        options.seed = random.SystemRandom().randrange(10**9)
    return options


def report(options, run, failure):
    print(f"FAILED in round {run.count['rounds']}, after {run.count['operations']} operations; seed {options.seed}")
    print("operations of the round:")
    for line in run.told:
        print("  " + line)
    print(failure)
    words = [*sys.argv] if "--seed" in sys.argv else [*sys.argv, "--seed", str(options.seed)]
    print("again:", shlex.join(words))


@contextlib.contextmanager
def temporary_folder(place):
    folder = os.path.realpath(tempfile.mkdtemp(prefix="cindral-convergence-", dir=place))
    try:
        yield folder
    finally:
        shutil.rmtree(os.fsencode(folder), ignore_errors=True)


def check(options):
    """Whether the property held."""
    print(f"seed {options.seed}", flush=True)
    began = time.monotonic()
    with temporary_folder(options.storage) as folder:
        if options.user is not None:
            become(options.user, folder)
        run = Convergence(options, folder)
        try:
            run.run()
        except Exception as failure:  # Whatever it is, the operations before it are what is looked for.
            report(options, run, failure)
            if not isinstance(failure, Difference):
                raise
            return False
        finally:
            run.close()
        counts = ", ".join(f"{count} {what}" for what, count in sorted(run.count.items()))
        print(f"held: {counts}, in {time.monotonic() - began:.1f} s")
        for line, count in run.host.errors.most_common(10):
            print(f"the host said {count} times: {line}")
        return True


def main():
    options = arguments(sys.argv[1:])
    if not options.model and not cindral_rpc.PROGRAM:
        sys.exit("CINDRAL_PROGRAM names the program")
    sys.exit(0 if check(options) else 1)


if __name__ == "__main__":
    main()
