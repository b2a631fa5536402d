#!/usr/bin/env python3
"""Changes beside what the kernel and a file watcher of the distribution (watchman, where it is installed) charge.

usage: changes_bench.py [--files N...] [--bin FOLDER] [--folder DIR] [--recorder inotify|fanotify]...

Everything that is compared is measured in turns in one run. Needs the release build: build/release.
"""

import argparse
import json
import os
import shutil
import socket
import statistics
import subprocess
import sys
import tarfile
import tempfile
import time

WORKING_SET = "TesselWorkingSetContainerItemIdentifier"


class Host:
    """`cindral rpc` as a client sees it."""

    def __init__(self, program, storage, state, recorder):
        begin = time.perf_counter()
        self.process = subprocess.Popen(
            [program, "rpc", "--storage", storage, "--state", state, "--no-flatpak", "--recorder", recorder],
            stdin=subprocess.PIPE, stdout=subprocess.PIPE, stderr=subprocess.DEVNULL)
        self.number = 0
        self.signals = []
        self.call("status")
        self.start_time = time.perf_counter() - begin

    def read(self):
        line = self.process.stdout.readline()
        if not line:
            raise RuntimeError("the host has ended")
        return json.loads(line)

    def call(self, method, **params):
        self.number += 1
        request = {"jsonrpc": "2.0", "id": self.number, "method": method, "params": params}
        self.process.stdin.write(json.dumps(request).encode() + b"\n")
        self.process.stdin.flush()
        while True:
            message = self.read()
            if message.get("id") == self.number:
                if "error" in message:
                    raise RuntimeError(message["error"])
                return message["result"]
            self.signals.append(message)

    def anchor(self):
        return self.call("currentSyncAnchor", container=WORKING_SET)["anchor"]

    def changes(self, anchor):
        updated = deleted = 0
        while True:
            result = self.call("enumerateChanges", container=WORKING_SET, anchor=anchor)
            updated += len(result["updated"])
            deleted += len(result["deleted"])
            anchor = result["anchor"]
            if not result["moreComing"]:
                return anchor, updated, deleted

    def list_all(self):
        page, count = None, 0
        while True:
            params = {"container": WORKING_SET}
            if page:
                params["page"] = page
            result = self.call("enumerateItems", **params)
            count += len(result["items"])
            page = result["nextPage"]
            if not page:
                return count

    def anonymous_memory(self):
        with open(f"/proc/{self.process.pid}/status", encoding="ascii") as status:
            for line in status:
                if line.startswith("RssAnon:"):
                    return int(line.split()[1]) * 1024
        return 0

    def close(self):
        self.process.stdin.close()
        self.process.wait()


class Peer:
    """The distribution's file watcher, over its socket."""

    def __init__(self, storage):
        name = json.loads(subprocess.run(["watchman", "get-sockname"], check=True, capture_output=True).stdout)
        self.socket = socket.socket(socket.AF_UNIX)
        self.socket.connect(name["sockname"])
        self.file = self.socket.makefile("rwb")
        self.storage = storage
        begin = time.perf_counter()
        self.call(["watch", storage])
        self.clock = self.call(["clock", storage, {"sync_timeout": 600_000}])["clock"]
        self.start_time = time.perf_counter() - begin

    def call(self, request):
        self.file.write(json.dumps(request).encode() + b"\n")
        self.file.flush()
        while True:
            message = json.loads(self.file.readline())
            if "error" in message:
                raise RuntimeError(message["error"])
            if "log" not in message:
                return message

    def changes(self, clock):
        fields = ["name", "exists", "size", "mtime_ns", "ctime_ns", "ino", "mode", "type"]
        result = self.call(["query", self.storage, {"since": clock, "fields": fields, "sync_timeout": 600_000}])
        return result["clock"], len(result["files"])

    def close(self):
        self.call(["watch-del", self.storage])
        self.socket.close()


def make_tree(folder, files):
    per_folder = 100 if files <= 100_000 else 1000
    for i in range(0, files, per_folder):
        sub = f"{folder}/{i // per_folder:06}"
        os.makedirs(sub)
        for j in range(i, min(files, i + per_folder)):
            with open(f"{sub}/document-{j:08}.txt", "wb") as out:
                out.write(b"x")
    os.sync()


def touch(folder, files, count):
    per_folder = 100 if files <= 100_000 else 1000
    for i in range(count):
        j = i * (files // count)
        with open(f"{folder}/{j // per_folder:06}/document-{j:08}.txt", "ab") as out:
            out.write(b"y")


def median_time(action, rounds):
    times = []
    for _ in range(rounds):
        begin = time.perf_counter()
        action()
        times.append(time.perf_counter() - begin)
    return statistics.median(times)


def disk_bytes(folder):
    return sum(os.stat(os.path.join(folder, name)).st_blocks * 512 for name in os.listdir(folder))


def row(what, ours, other, other_name, aim):
    ratio = ours / other if other else float("nan")
    print(f"| {what} | {ours * 1e3:.2f} ms | {other * 1e3:.2f} ms ({other_name}) | {ratio:.2f} | {aim} |", flush=True)


def measure(options, files, recorder):
    print(f"\n### {files:,} files, {recorder}\n\n| what | ours | beside | ratio | aim |\n|---|---|---|---|---|", flush=True)
    top = tempfile.mkdtemp(dir=options.folder)
    storage, state = f"{top}/Documents", f"{top}/state"
    os.makedirs(storage)
    host = peer = None
    try:
        make_tree(storage, files)
        walk = lambda: float(subprocess.run([f"{options.bin}/bench/walk_floor", storage], check=True,
                                            capture_output=True).stdout.split()[1])
        walk()
        floor = statistics.median(walk() for _ in range(3))

        def start():
            nonlocal host
            begin = time.perf_counter()
            host = Host(f"{options.bin}/src/host/cindral", storage, state, recorder)
            anchor = host.anchor()
            return time.perf_counter() - begin, anchor

        crawls = []
        for _ in range(3):
            shutil.rmtree(state, ignore_errors=True)
            took, _ = start()
            crawls.append(took)
            # What was read is written to the tables behind the answer.
            time.sleep(3)
            memory = host.anonymous_memory()
            host.close()
        row("first reading", statistics.median(crawls), floor, "bare walk", "1.5")
        index = disk_bytes(f"{state}/store")
        starts = []
        for _ in range(3):
            took, anchor = start()
            starts.append(took)
            host.close()
        row("comparison at the start, nothing changed", statistics.median(starts), floor, "bare walk", "1.2")
        print(f"\nIndex {index / files:.0f} bytes a file on disk (aim 200), anonymous memory {memory / files:.1f} bytes a "
              f"file after the first reading ({memory / 1e6:.1f} MB)\n", flush=True)

        took, anchor = start()
        host.list_all()
        anchor = host.anchor()
        if shutil.which("watchman"):
            peer = Peer(storage)
            row("the peer's own first reading", peer.start_time, floor, "bare walk", "-")
        print("| what | ours | beside | ratio | aim |\n|---|---|---|---|---|")
        clock = peer.clock if peer else None
        ours = median_time(lambda: host.changes(anchor), 500)
        theirs = median_time(lambda: peer.changes(clock), 500) if peer else 0.0
        row("0 changes", ours, theirs, "peer", "1")
        for count, rounds in ((1_000, 9), (100_000, 3)):
            if count > files:
                continue
            ours, theirs = [], []
            for _ in range(rounds):
                touch(storage, files, count)
                # Both have taken note of the files before they are asked: what is measured is the answer.
                host.call("enumerateChanges", container="TesselRootContainerItemIdentifier",
                          anchor=host.call("currentSyncAnchor", container="TesselRootContainerItemIdentifier")["anchor"])
                if peer:
                    peer.call(["clock", storage, {"sync_timeout": 600_000}])
                begin = time.perf_counter()
                anchor, updated, _ = host.changes(anchor)
                ours.append(time.perf_counter() - begin)
                if updated < count:
                    raise RuntimeError(f"{updated} of {count} changes were told")
                if peer:
                    begin = time.perf_counter()
                    clock, _ = peer.changes(clock)
                    theirs.append(time.perf_counter() - begin)
            row(f"{count:,} changes", statistics.median(ours), statistics.median(theirs) if peer else 0.0, "peer", "2")
        latencies = []
        host.call("startMonitoring", container=WORKING_SET)
        for i in range(5):
            # Who was signalled is not signalled again before it has asked; and one write may be worth two signals.
            while True:
                host.signals.clear()
                anchor, _, _ = host.changes(anchor)
                time.sleep(1)
                host.call("status")
                if not host.signals:
                    break
            begin = time.perf_counter()
            touch(storage, files, 1)
            while not any(message.get("params", {}).get("container") == WORKING_SET for message in host.signals):
                host.signals.append(host.read())
            latencies.append(time.perf_counter() - begin)
        print(f"\nWrite to signal: {statistics.median(latencies) * 1e3:.0f} ms (aim 520)")
        host.close()
        host = None
    finally:
        if host:
            host.process.kill()
        if peer:
            peer.close()
        shutil.rmtree(top, ignore_errors=True)


def storm(options):
    """100,000 files unpacked from an archive, with nobody watching and with each recorder."""
    top = tempfile.mkdtemp(dir=options.folder)
    try:
        source = f"{top}/source"
        os.makedirs(source)
        make_tree(source, 100_000)
        with tarfile.open(f"{top}/archive.tar", "w") as archive:
            archive.add(source, arcname="unpacked")
        shutil.rmtree(source)

        def unpack(to):
            begin = time.perf_counter()
            subprocess.run(["tar", "xf", f"{top}/archive.tar", "-C", to], check=True)
            return time.perf_counter() - begin

        alone, watched, reported = [], {}, {}
        for round_number in range(3):
            target = f"{top}/alone{round_number}"
            os.makedirs(target)
            alone.append(unpack(target))
            shutil.rmtree(target)
            for recorder in ("inotify", "fanotify"):
                storage, state = f"{top}/{recorder}{round_number}/Documents", f"{top}/{recorder}{round_number}.state"
                os.makedirs(storage)
                host = Host(f"{options.bin}/src/host/cindral", storage, state, recorder)
                anchor = host.anchor()
                watched.setdefault(recorder, []).append(unpack(storage))
                _, updated, _ = host.changes(anchor)
                reported.setdefault(recorder, []).append(updated)
                host.close()
                shutil.rmtree(f"{top}/{recorder}{round_number}")
                shutil.rmtree(state)
        print("\n### A storm: 100,000 files in 1,000 folders unpacked\n")
        print("| recorder | unpacking | alone | ratio | aim | reported |\n|---|---|---|---|---|---|")
        for recorder, times in watched.items():
            base, took = statistics.median(alone), statistics.median(times)
            print(f"| {recorder} | {took:.2f} s | {base:.2f} s | {took / base:.2f} | 1.5 | "
                  f"{min(reported[recorder]):,} of 101,001 |", flush=True)
    finally:
        shutil.rmtree(top, ignore_errors=True)


def main():
    here = os.path.dirname(os.path.abspath(__file__))
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--files", type=int, nargs="*", default=[1_000, 100_000, 1_000_000])
    parser.add_argument("--bin", default=os.path.join(here, "..", "build", "release"))
    parser.add_argument("--folder", default=os.environ.get("TMPDIR", "/tmp"))
    parser.add_argument("--recorder", nargs="*", default=["inotify", "fanotify"])
    parser.add_argument("--no-storm", action="store_true")
    options = parser.parse_args()
    for recorder in options.recorder:
        for files in options.files:
            measure(options, files, recorder)
    if not options.no_storm:
        storm(options)


if __name__ == "__main__":
    sys.exit(main())
