"""Two clients of one host create, rename and move onto the same names, without waiting for each other.

No edit overwrites anything, each is answered once, and a view of the working set that catches up afterwards is what is there.

    CINDRAL_PROGRAM=build/dev/src/host/cindral python3 -B tests/property/edits_race.py --ops 100000
"""

import argparse
import collections
import os
import random
import shutil
import sys
import tempfile
import threading
import time

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), os.pardir, "system"))

from cindral_rpc import WORKING_SET, Daemon, SocketClient  # noqa: E402
from container_view import ContainerView, listed  # noqa: E402

NAMES = [f"n{number}" for number in range(48)]
FOLDERS_MAX = 20
# What edits that want the same things are told: taken; gone since it was looked for; what was in the way has gone meanwhile.
EXPECTED = {("TesselErrorDomain", -1003), ("TesselErrorDomain", -1001), ("TSErrorDomain", 2), ("CindralProvider.LocalTesselKitError", 0)}


class Racer(threading.Thread):
    """One client, with a number of requests under way."""

    def __init__(self, path, seed, count, at_once, documents, parents):
        super().__init__()
        self.client = SocketClient(path)
        self.random = random.Random(seed)
        self.left, self.at_once = count, at_once
        self.items, self.parents = list(documents), parents
        self.told = collections.Counter()
        self.made = self.unsure = 0
        self.failure = None

    def request(self):
        name, parent = self.random.choice(NAMES), self.random.choice(self.parents)
        kind = self.random.random()
        if kind < 0.1 and self.made + self.unsure < FOLDERS_MAX:
            return "createDirectory", {"name": name, "parent": parent}
        item = self.random.choice(self.items)
        if kind < 0.4:
            return "renameItem", {"identifier": item, "name": name}
        return "reparentItem", {"identifier": item, "parent": parent, **({"name": name} if kind < 0.8 else {})}

    def take(self, method, answer):
        error = answer.get("error", {}).get("data")
        self.told[(method, "done" if error is None else f"{error['domain']} {error['code']}")] += 1
        if error is None:
            if method == "createDirectory":
                self.made += 1
                self.items.append(answer["result"]["identifier"])
        elif (error["domain"], error["code"]) not in EXPECTED:
            raise AssertionError(f"{method}: {error}")
        elif method == "createDirectory" and error["code"] == 0:
            self.unsure += 1  # Made, and moved on by the other before it could be told of; or what was in the way was.

    def run(self):
        try:
            under_way = collections.deque()
            while self.left or under_way:
                while self.left and len(under_way) < self.at_once:
                    method, params = self.request()
                    under_way.append((method, self.client.send(method, **params)))
                    self.left -= 1
                method, sent = under_way.popleft()
                self.take(method, self.client.answer(sent))
            # All that is still to come is the end: no second answer.
            self.client.end_input()
            while (message := self.client.next_message()) is not None:
                if "id" in message:
                    raise AssertionError(f"answered twice: {message}")
        except BaseException as failure:  # pylint: disable=broad-except
            self.failure = failure
        finally:
            self.client.close()


def contents_of(storage):
    """The numbers that documents hold, and how many folders there are besides the two."""
    numbers, folders = collections.Counter(), -2
    for path, names, files in os.walk(storage):
        names[:] = [name for name in names if not name.startswith(".")]
        folders += len(names)
        for name in files:
            with open(os.path.join(path, name), encoding="ascii") as file:
                numbers[int(file.read())] += 1
    return numbers, folders


def race(options, folder):
    seed = random.randrange(1 << 32) if options.seed is None else options.seed
    print(f"seed {seed}", flush=True)
    storage, state = os.path.join(folder, "Documents"), os.path.join(folder, "state")
    for name in ("here", "there"):
        os.makedirs(os.path.join(storage, name))
    for number in range(40):
        with open(os.path.join(storage, ("here", "there")[number % 2], NAMES[number]), "w", encoding="ascii") as file:
            file.write(str(number))
    environment = {name: value for name, value in os.environ.items() if not name.startswith("XDG_")}
    environment.update(HOME=folder, CINDRAL_LOG="info")
    daemon = Daemon(["--storage", storage, "--state", state, "--no-flatpak"], environment)
    assert daemon.is_serving, daemon.error_text()
    path = os.path.join(state, "socket")
    try:
        with SocketClient(path) as watcher:
            view = ContainerView(watcher, WORKING_SET)
            parents = [watcher.identifier(os.path.join(storage, name)) for name in ("here", "there")]
            documents = [item["identifier"] for parent in parents for item in watcher.items(parent)]
            began = time.monotonic()
            racers = [Racer(path, seed + who, options.ops // 2, options.at_once, documents, parents) for who in range(2)]
            for racer in racers:
                racer.start()
            for racer in racers:
                racer.join()
            seconds = time.monotonic() - began
            for racer in racers:
                if racer.failure:
                    raise racer.failure
            numbers, folders = contents_of(storage)
            if numbers != collections.Counter(range(40)):
                raise AssertionError(f"documents were lost or doubled: {sorted(numbers.items())}")
            made, unsure = sum(racer.made for racer in racers), sum(racer.unsure for racer in racers)
            if not made <= folders <= made + unsure:
                raise AssertionError(f"{folders} folders, of {made} that were made and {unsure} that may have been")
            view.catch_up()
            lines = view.differences(listed(watcher, WORKING_SET)[0])
            if lines:
                raise AssertionError("\n".join(["the view of the working set is not what it lists:", *lines]))
            told = sum((racer.told for racer in racers), collections.Counter())
            print(f"{sum(told.values())} edits in {seconds:.1f} s:", ", ".join(f"{method} {how}: {number}" for (method, how), number in sorted(told.items())))
    finally:
        daemon.stop()


def run(options):
    folder = os.path.realpath(tempfile.mkdtemp(prefix="cindral-race-"))
    try:
        race(options, folder)
    finally:
        shutil.rmtree(folder)
    return True


def arguments(words):
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--seed", type=int, default=None, help="what each client asks for (default: a new one)")
    parser.add_argument("--ops", type=int, default=10_000, help="edits of both together (default: %(default)s)")
    parser.add_argument("--at-once", type=int, default=8, help="requests that each client has under way (default: %(default)s)")
    return parser.parse_args(words)


if __name__ == "__main__":
    sys.exit(0 if run(arguments(sys.argv[1:])) else 1)
