"""The daemon, killed at any moment while clients edit: no edit is lost, the store opens, and every old anchor converges.

Each client works in folders of its own. Every document holds a number and is to be whole; a client knows of each whether it
must be there, may be there (its import or deletion was under way), or is gone. After each kill a new daemon is started; views
of the root, the working set and all directories catch up from their old anchors, one of them only at the very end, and are
held against fresh listings.

    CINDRAL_PROGRAM=build/dev/src/host/cindral python3 -B tests/property/daemon_kills.py --kills 200
"""

import argparse
import collections
import os
import random
import shutil
import sys
import tempfile
import threading

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), os.pardir, "system"))

from cindral_rpc import ROOT, WORKING_SET, Daemon, RpcError, SocketClient  # noqa: E402
from container_view import ALL_DIRECTORIES, ContainerView, is_expired, listed  # noqa: E402

CONTAINERS = [ROOT, WORKING_SET, ALL_DIRECTORIES]
LINES = 500
DOCUMENTS = 60
# What edits are told that want what another one of the same client took.
EXPECTED = {("TesselErrorDomain", -1003), ("TesselErrorDomain", -1001), ("CindralProvider.LocalTesselKitError", 0)}


class ConnectionLost(Exception):
    pass


class Editor:
    """One client: what it does, and which documents there must be because it was told that it is done."""

    def __init__(self, folder, storage, number, seed):
        self.random = random.Random(seed)
        self.outside = os.path.join(folder, f"outside {number}")
        self.folders = [os.path.join(storage, f"client {number}"), os.path.join(storage, f"client {number}", "below")]
        for path in (self.outside, *self.folders):
            os.mkdir(path)
        self.first = self.last = number * 1_000_000
        self.must = set()
        self.may = set()
        self.acknowledged = collections.Counter()
        self.failure = None

    def call(self, client, method, **params):
        try:
            sent = client.send(method, **params)
            answer = client.answer(sent)
        except (AssertionError, OSError) as lost:
            raise ConnectionLost from lost
        if "error" not in answer:
            self.acknowledged[method] += 1
            return answer["result"]
        error = RpcError(answer["error"])
        if (error.domain, error.domain_code) not in EXPECTED:
            raise error
        return None

    def run(self, client, did_acknowledge, did_end):
        """Edits until the daemon is gone."""
        try:
            while True:
                self.edit(client)
                did_acknowledge()
        except ConnectionLost:
            pass
        except BaseException as failure:
            self.failure = failure
            raise
        finally:
            did_end()

    def edit(self, client):
        # About so many documents at any time, however long it goes on.
        deletions = 2 if len(self.must) < DOCUMENTS else 6
        edits = [self.import_document, self.delete, self.rename, self.move, self.make_folder]
        self.random.choices(edits, [5, deletions, 4, 4, 1])[0](client)

    def documents(self):
        return [os.path.join(folder, name) for folder in self.folders for name in os.listdir(folder)
                if os.path.isfile(os.path.join(folder, name))]

    def identifier(self, client, path):
        found = self.call(client, "identifierForItemAtURL", path=path)
        return found and found["identifier"]

    def import_document(self, client):
        self.last += 1
        source = os.path.join(self.outside, f"{self.last}.txt")
        with open(source, "w", encoding="ascii") as file:
            file.write(f"{self.last}\n" * LINES)
        parent = self.identifier(client, self.random.choice(self.folders))
        self.may.add(self.last)
        if self.call(client, "importDocument", path=source, parent=parent):
            self.must.add(self.last)
        self.may.discard(self.last)

    def chosen(self, client):
        documents = self.documents()
        path = self.random.choice(documents) if documents else None
        return path, path and self.identifier(client, path)

    def delete(self, client):
        path, identifier = self.chosen(client)
        if identifier is None:
            return
        number = number_in(path)
        self.must.discard(number)
        self.may.add(number)
        if self.call(client, "deleteItem", identifier=identifier) is None:
            self.must.add(number)
        self.may.discard(number)

    def rename(self, client):
        _, identifier = self.chosen(client)
        if identifier:
            self.call(client, "renameItem", identifier=identifier, name=f"{self.random.randrange(40)}.txt")

    def move(self, client):
        _, identifier = self.chosen(client)
        parent = self.identifier(client, self.random.choice(self.folders))
        if identifier and parent:
            self.call(client, "reparentItem", identifier=identifier, parent=parent)

    def make_folder(self, client):
        parent = self.identifier(client, self.folders[0])
        self.call(client, "createDirectory", name=f"folder {self.random.randrange(5)}", parent=parent)

    def check(self):
        """What is there after a kill is known from now on."""
        found = collections.Counter(number_in(path) for folder in self.folders for path in files_in(folder))
        twice = [number for number, count in found.items() if count > 1]
        missing = self.must - found.keys()
        back = found.keys() - self.must - self.may
        if twice or missing or back:
            raise AssertionError(f"twice: {twice}, missing: {missing}, back again: {back}")
        self.must |= self.may & found.keys()
        self.may.clear()


def files_in(folder):
    return [os.path.join(folder, name) for name in os.listdir(folder) if os.path.isfile(os.path.join(folder, name))]


def number_in(path):
    """The number that a document holds; it must be whole."""
    with open(path, encoding="ascii") as file:
        lines = file.read().splitlines()
    if len(lines) != LINES or len(set(lines)) != 1:
        raise AssertionError(f"half a document: {path}")
    return int(lines[0])


class Run:
    def __init__(self, options, folder):
        self.options = options
        self.random = random.Random(options.seed)
        self.storage, self.state = os.path.join(folder, "Documents"), os.path.join(folder, "state")
        os.mkdir(self.storage)
        self.environment = {**{name: value for name, value in os.environ.items() if not name.startswith("XDG_")}, "HOME": folder}
        self.editors = [Editor(folder, self.storage, number, self.random.randrange(1 << 32)) for number in range(1, options.clients + 1)]
        self.views = []
        self.oldest = None
        self.uuid = None
        self.expired = 0

    def start(self):
        words = ["--storage", self.storage, "--state", self.state, "--no-flatpak", "--recorder", self.options.recorder]
        daemon = Daemon(words, self.environment)
        if not daemon.is_serving:
            daemon.status()
            raise AssertionError(f"the daemon does not start: {daemon.error_text()}")
        return daemon

    def connect(self):
        return SocketClient(os.path.join(self.state, "socket"))

    def kill_under_load(self):
        """One daemon's life: what was looks right, clients edit, and it is killed after some of their edits."""
        daemon = self.start()
        try:
            with self.connect() as client:
                self.check(client)
            answered = threading.Semaphore(0)
            edits = self.random.randrange(1, self.options.edits)
            clients = [self.connect() for _ in self.editors]
            threads = [threading.Thread(target=editor.run, args=(client, answered.release, lambda: answered.release(edits)))
                       for editor, client in zip(self.editors, clients)]
            for thread in threads:
                thread.start()
            for _ in range(edits):
                answered.acquire()
            daemon.process.kill()
            for thread in threads:
                thread.join()
            for client in clients:
                client.close()
            for editor in self.editors:
                if editor.failure:
                    raise editor.failure
        finally:
            daemon.__exit__()

    def check(self, client):
        status = client.call("status")
        if self.uuid is None:
            self.uuid = status["volumeUUID"]
            self.views = [ContainerView(client, container) for container in CONTAINERS]
            self.oldest = ContainerView(client, WORKING_SET)
        if status["volumeUUID"] != self.uuid:
            raise AssertionError("the store was begun anew")
        for editor in self.editors:
            editor.check()
        for view in self.views:
            self.converge(view, client)

    def converge(self, view, client):
        view.host = client
        try:
            view.catch_up()
        except RpcError as error:
            if not is_expired(error):
                raise
            self.expired += 1
            view.__init__(client, view.container)
        differences = view.differences(listed(client, view.container)[0])
        if differences:
            raise AssertionError("\n".join([f"{view.container} does not converge:", *differences]))

    def finish(self):
        daemon = self.start()
        with self.connect() as client:
            self.check(client)
            self.converge(self.oldest, client)
        if daemon.stop() != 0:
            raise AssertionError(daemon.error_text())


def arguments(words=None):
    parser = argparse.ArgumentParser()
    parser.add_argument("--kills", type=int, default=200)
    parser.add_argument("--clients", type=int, default=3)
    parser.add_argument("--edits", type=int, default=120, help="at most so many between two kills")
    parser.add_argument("--recorder", default="auto")
    parser.add_argument("--seed", type=int, default=random.randrange(1 << 32))
    return parser.parse_args(words)


def run(options):
    folder = os.path.realpath(tempfile.mkdtemp(prefix="cindral-kills-"))
    print(f"seed {options.seed}", flush=True)
    try:
        told = Run(options, folder)
        for _ in range(options.kills):
            told.kill_under_load()
        told.finish()
    finally:
        shutil.rmtree(folder)
    edits = sum((editor.acknowledged for editor in told.editors), collections.Counter())
    print(f"{options.kills} kills, {sum(edits.values())} requests answered ({dict(edits)}), "
          f"{sum(len(editor.must) for editor in told.editors)} documents, {told.expired} anchors expired", flush=True)
    return told


if __name__ == "__main__":
    run(arguments())
