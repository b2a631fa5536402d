"""Random edits through the host itself, many at a time: views converge, and no document is ever lost.

Every document holds a number of its own, so that one that was overwritten would be missed. After each round, views of the
root, the working set and all directories catch up, each from its own anchor, and are held against a fresh listing.

    CINDRAL_PROGRAM=build/dev/src/host/cindral python3 -B tests/property/edits_converge.py --ops 100000
"""

import argparse
import collections
import os
import random
import shutil
import sys
import tempfile

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), os.pardir, "system"))

from cindral_rpc import ROOT, WORKING_SET, Client, RpcError  # noqa: E402
from container_view import ALL_DIRECTORIES, ContainerView, is_expired, listed  # noqa: E402

TEMPORARY = "TesselTemporaryLocalFolderItemIdentifier"
# What edits that want the same things are told: taken, gone, into itself, the root.
EXPECTED = {("TesselErrorDomain", -1003), ("TesselErrorDomain", -1001), ("TSErrorDomain", 1), ("TSErrorDomain", 2), ("KsGeneralErrorDomain", 260),
            ("KsGeneralErrorDomain", 513), ("KsPOSIXErrorDomain", 22), ("CindralProvider.LocalTesselKitError", 0)}
NAMES = ["a", "b", "c.txt", "d.tonemill", "\u00e9", "e\n", ".hidden"]


class Edits:
    """Makes edits, and knows which documents there are to be."""

    def __init__(self, seed, folder):
        self.random = random.Random(seed)
        self.storage = os.path.join(folder, "Documents")
        self.outside = os.path.join(folder, "outside")
        os.mkdir(self.storage)
        os.mkdir(self.outside)
        os.mkdir(os.path.join(self.storage, "first"))
        self.documents = 0
        self.removed = set()
        self.count = collections.Counter()
        self.told = []

    def folders(self):
        found = []
        for path, names, _ in os.walk(self.storage):
            names[:] = [name for name in names if name != ".TemporaryLocalFolder"]
            found.extend(os.path.join(path, name) for name in names)
        return found

    def entries(self, folder=None):
        return [os.path.join(path, name) for path, names, files in os.walk(folder or self.storage) for name in [*names, *files]
                if ".TemporaryLocalFolder" not in path and name != ".TemporaryLocalFolder"]

    def identifier(self, client, path):
        return client.call("identifierForItemAtURL", path=path)["identifier"]

    def numbers(self, folder=None):
        """The documents below a folder, or the one document, by the numbers that they hold."""
        found = collections.Counter()
        if folder and os.path.isfile(folder):
            with open(folder, encoding="ascii") as file:
                found[int(file.read())] += 1
            return found
        for path, _, files in os.walk(folder or self.storage):
            for name in files:
                with open(os.path.join(path, name), encoding="ascii") as file:
                    found[int(file.read())] += 1
        return found

    def make_document(self):
        path = os.path.join(self.outside, self.random.choice(NAMES))
        self.documents += 1
        with open(path, "w", encoding="ascii") as file:
            file.write(str(self.documents))
        return path

    def request(self, client):
        """A request that is to be sent: its method and parameters; none where there is nothing to do it with."""
        folders, entries = self.folders(), self.entries()
        if not folders:
            return "createDirectory", {"name": "first", "parent": TEMPORARY}
        folder = self.random.choice([*folders, *folders, self.storage])
        item = self.random.choice(entries)
        item_identifier, folder_identifier = self.identifier(client, item), self.identifier(client, folder)
        if item_identifier is None or folder_identifier is None:
            return None
        name = self.random.choice(NAMES)
        edits = [
            (4, "createDirectory", {"name": name, "parent": folder_identifier}),
            (6, "renameItem", {"identifier": item_identifier, "name": name}),
            (10, "reparentItem", {"identifier": item_identifier, "parent": folder_identifier}),
            (6, "reparentItem", {"identifier": item_identifier, "parent": folder_identifier, "name": name}),
            (3, "trashItem", {"identifier": item_identifier}),
            (4, "untrashItem", {"identifier": item_identifier}),
            (2, "setTags", {"identifier": item_identifier, "tags": [name]}),
            (1, "setFavoriteRank", {"identifier": item_identifier, "rank": 1}),
        ]
        chosen = self.random.choices(edits, [edit[0] for edit in edits])[0]
        return chosen[1], chosen[2]

    def run(self, client, count, at_once):
        """So many edits, several of them under way at the same time."""
        under_way = []
        for _ in range(count):
            request = self.request(client)
            if request is None:
                continue
            self.told.append(f"{request[0]} {request[1]}")
            under_way.append((request, client.send(request[0], **request[1])))
            if len(under_way) >= self.random.randrange(1, at_once + 1):
                self.finish(client, under_way)
        self.finish(client, under_way)
        self.add_and_remove(client)

    def finish(self, client, under_way):
        for request, sent in under_way:
            answer = client.answer(sent)
            error = RpcError(answer["error"]) if "error" in answer else None
            self.count[request[0] + (" refused" if error else "")] += 1
            if error and (error.domain, error.domain_code) not in EXPECTED:
                raise AssertionError(f"{request}: {error}")
        under_way.clear()

    def add_and_remove(self, client):
        """One at a time, so that it is known which documents are to be there."""
        source = self.make_document()
        try:
            folders = self.folders()
            parent = self.identifier(client, self.random.choice(folders)) if folders else TEMPORARY
            client.call("importDocument", path=source, parent=parent)
            self.count["importDocument"] += 1
        except RpcError:
            self.removed.add(self.documents)
        entries = self.entries()
        if len(entries) < 40:
            return
        item = self.random.choice(entries)
        gone = self.numbers(item)
        client.call("deleteItem", identifier=self.identifier(client, item))
        self.removed.update(gone)
        self.count["deleteItem"] += 1

    def check(self):
        expected = collections.Counter(number for number in range(1, self.documents + 1) if number not in self.removed)
        if self.numbers() != expected:
            raise AssertionError(f"missing: {expected - self.numbers()}, too many: {self.numbers() - expected}")


def run(options):
    seed = random.randrange(1 << 32) if options.seed is None else options.seed
    print(f"seed {seed}", flush=True)
    folder = os.path.realpath(tempfile.mkdtemp(prefix="cindral-edits-"))
    edits = Edits(seed, folder)
    environment = {name: value for name, value in os.environ.items() if not name.startswith("XDG_")}
    environment.update(HOME=folder, CINDRAL_LOG=os.environ.get("CINDRAL_LOG", "error"))
    arguments = ["--storage", edits.storage, "--state", os.path.join(folder, "state"), "--no-flatpak", "--recorder", options.recorder]
    client = Client(arguments, environment)
    try:
        views = [ContainerView(client, container) for container in (ROOT, WORKING_SET, ALL_DIRECTORIES)]
        made = 0
        while made < options.ops:
            edits.told = []
            edits.run(client, options.round_size, options.at_once)
            made += options.round_size
            edits.check()
            for view in views:
                try:
                    view.catch_up()
                except RpcError as error:
                    if is_expired(error):
                        raise AssertionError(f"the anchor of {view.container} has expired") from error
                    raise
                lines = view.differences(listed(client, view.container)[0])
                if lines:
                    raise AssertionError("\n".join([f"the view of {view.container} is not what it lists:", *lines]))
    except BaseException:
        print(f"seed {seed}; the last edits:", *edits.told, sep="\n")
        client.kill()
        raise
    client.finish()
    print(", ".join(f"{what}: {number}" for what, number in sorted(edits.count.items())))
    shutil.rmtree(folder)
    return True


def arguments(words):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--seed", type=int, default=None, help="repeat what this seed made (default: a new one)")
    parser.add_argument("--ops", type=int, default=2000, help="edits (default: %(default)s)")
    parser.add_argument("--round-size", type=int, default=40, help="edits between two comparisons (default: %(default)s)")
    parser.add_argument("--at-once", type=int, default=8, help="edits under way at most; with one, a seed repeats all (default: %(default)s)")
    parser.add_argument("--recorder", default="auto", help="as the program's option (default: %(default)s)")
    return parser.parse_args(words)


if __name__ == "__main__":
    sys.exit(0 if run(arguments(sys.argv[1:])) else 1)
