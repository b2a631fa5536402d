"""Eight clients that hammer one daemon with edits, listings, changes and searches, for so long or so often.

Meant for builds with a sanitizer, whose reports are looked for in what the daemon says:

    CINDRAL_PROGRAM=build/tsan/src/host/cindral python3 -B tests/property/daemon_hammer.py --seconds 60
    CINDRAL_PROGRAM=build/asan/src/host/cindral python3 -B tests/property/daemon_hammer.py --seconds 60
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

from cindral_rpc import ROOT, WORKING_SET, Daemon, SocketClient  # noqa: E402
from container_view import ALL_DIRECTORIES  # noqa: E402

CONTAINERS = [ROOT, WORKING_SET, ALL_DIRECTORIES]
AT_ONCE = 16
REPORTS = ("Sanitizer", "runtime error:")


class Hammer:
    """One client, that knows a few identifiers and doesn't care who else does."""

    def __init__(self, state, storage, outside, seed):
        self.random = random.Random(seed)
        self.client = SocketClient(os.path.join(state, "socket"))
        self.storage, self.outside = storage, outside
        self.identifiers = collections.deque([ROOT], maxlen=200)
        self.anchors = {}
        self.count = collections.Counter()
        self.failure = None

    def request(self):
        choose = self.random.choice
        item, parent, name = choose(self.identifiers), choose(self.identifiers), f"{self.random.randrange(50)}.txt"
        container = choose([*CONTAINERS, parent])
        requests = [
            ("enumerateItems", {"container": container, "sort": choose(["name", "date"])}), ("itemForIdentifier", {"identifier": item}),
            ("URLForItem", {"identifier": item}), ("identifierForItemAtURL", {"path": os.path.join(self.storage, name)}),
            ("currentSyncAnchor", {"container": container}), ("startMonitoring", {"container": container}),
            ("stopMonitoring", {"container": container}), ("status", {}), ("hello", {}), ("search", {"text": name[:2]}),
            ("importDocument", {"path": self.outside, "parent": parent}), ("createDirectory", {"name": name, "parent": parent}),
            ("renameItem", {"identifier": item, "name": name}), ("reparentItem", {"identifier": item, "parent": parent, "name": name}),
            ("trashItem", {"identifier": item}), ("untrashItem", {"identifier": item}), ("deleteItem", {"identifier": item}),
            ("setTags", {"identifier": item, "tags": [name]}), ("setFavoriteRank", {"identifier": item, "rank": 1}),
            ("fetchThumbnails", {"identifiers": [item], "size": 64}), ("cancel", {"request": self.random.randrange(1, 10_000)}),
        ]
        if container in self.anchors:
            requests.append(("enumerateChanges", {"container": container, "anchor": self.anchors[container]}))
        return choose(requests)

    def learn(self, method, params, result):
        """From what is answered come the identifiers and anchors of what is asked next."""
        for item in [*result.get("items", [])[:20], *([result] if "identifier" in result else [])]:
            if item["identifier"]:
                self.identifiers.append(item["identifier"])
        if method in ("currentSyncAnchor", "enumerateChanges") and result["anchor"]:
            self.anchors[params["container"]] = result["anchor"]

    def run(self, goes_on):
        try:
            while goes_on():
                asked = [(method, params, self.client.send(method, **params)) for method, params in (self.request() for _ in range(AT_ONCE))]
                for method, params, sent in asked:
                    answer = self.client.answer(sent)
                    self.count[method if "result" in answer else f"{method} refused"] += 1
                    if "result" in answer:
                        self.learn(method, params, answer["result"])
                    elif answer["error"]["code"] not in (-32000, -32601):
                        raise AssertionError(f"{method} {params}: {answer}")
        except BaseException as failure:
            self.failure = failure
            raise
        finally:
            self.client.close()


def arguments(words=None):
    parser = argparse.ArgumentParser()
    parser.add_argument("--seconds", type=float)
    parser.add_argument("--rounds", type=int, default=20, help="of 16 requests each, where no time is given")
    parser.add_argument("--clients", type=int, default=8)
    parser.add_argument("--recorder", default="auto")
    parser.add_argument("--seed", type=int, default=random.randrange(1 << 32))
    return parser.parse_args(words)


def run(options):
    folder = os.path.realpath(tempfile.mkdtemp(prefix="cindral-hammer-"))
    print(f"seed {options.seed}", flush=True)
    try:
        storage, state, outside = (os.path.join(folder, name) for name in ("Documents", "state", "outside.txt"))
        os.mkdir(storage)
        for number in range(300):
            path = os.path.join(storage, f"folder {number % 7}")
            os.makedirs(path, exist_ok=True)
            with open(os.path.join(path, f"{number}.txt"), "wb"):
                pass
        with open(outside, "wb") as file:
            file.write(b"x" * 10_000)
        daemon = Daemon(["--storage", storage, "--state", state, "--no-flatpak", "--recorder", options.recorder], {**os.environ, "HOME": folder})
        try:
            count = hammer(options, storage, state, outside, daemon)
        finally:
            daemon.__exit__()
        if any(report in daemon.error_text() for report in REPORTS):
            raise AssertionError(daemon.error_text())
    finally:
        shutil.rmtree(folder)
    print(f"{sum(count.values())} requests: {dict(sorted(count.items()))}", flush=True)
    return count


def hammer(options, storage, state, outside, daemon):
    seeds = random.Random(options.seed)
    hammers = [Hammer(state, storage, outside, seeds.randrange(1 << 32)) for _ in range(options.clients)]
    end = time.monotonic() + options.seconds if options.seconds else None

    def goes_on_for(one):
        if end is not None:
            return lambda: time.monotonic() < end
        return lambda: sum(one.count.values()) < options.rounds * AT_ONCE
    threads = [threading.Thread(target=one.run, args=(goes_on_for(one),)) for one in hammers]
    for thread in threads:
        thread.start()
    for thread in threads:
        thread.join()
    status = daemon.stop()
    failures = [one.failure for one in hammers if one.failure]
    if failures or status != 0:
        raise AssertionError(f"status {status}: {failures}\n{daemon.error_text()}")
    return sum((one.count for one in hammers), collections.Counter())


if __name__ == "__main__":
    run(arguments())
