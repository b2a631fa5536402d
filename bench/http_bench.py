#!/usr/bin/env python3
"""A browser's waits: the first page of a big folder over HTTP, and a change on the disk until the page's stream tells of it.

usage: http_bench.py [--files N] [--rounds N] [--bin FOLDER] [--folder DIR] [--page]

With --page also until the row is in the page itself, in Chromium (tests/browser/run fetches what that takes). Needs the
release build: build/release.
"""

import argparse
import http.client
import json
import os
import queue
import re
import shutil
import statistics
import subprocess
import sys
import tempfile
import threading
import time

ROOT = "TesselRootContainerItemIdentifier"
HERE = os.path.dirname(os.path.realpath(__file__))
# How long a change waits to be told together with others.
LATENCY = 0.5
# Items that the page asks for at a time (web/sources.js).
PAGE = 100


def percentile(values, share):
    return sorted(values)[min(len(values) - 1, int(len(values) * share))]


class Page:
    """A page that was let in, with its stream of events."""

    def __init__(self, port, secret):
        self.host = f"127.0.0.1:{port}"
        self.connection = http.client.HTTPConnection(self.host)
        self.fields = {"Host": self.host, "Origin": f"http://{self.host}", "Content-Type": "application/json"}
        answer, body = self.post("/session", secret.encode())
        self.fields["Cookie"] = answer.getheader("Set-Cookie").split(";")[0]
        self.fields["X-Cindral-Token"] = json.loads(body)["token"]
        self.events = queue.Queue()
        threading.Thread(target=self.read_events, daemon=True).start()
        self.fields["X-Cindral-Connection"] = self.events.get()

    def read_events(self):
        stream = http.client.HTTPConnection(self.host)
        stream.request("GET", "/events", headers=self.fields)
        for line in stream.getresponse():
            if line.startswith(b"data: "):
                self.events.put(json.loads(line[6:]))

    def post(self, target, body):
        self.connection.request("POST", target, body, self.fields)
        answer = self.connection.getresponse()
        return answer, answer.read()

    def call(self, method, **params):
        _, body = self.post("/rpc", json.dumps({"jsonrpc": "2.0", "id": 1, "method": method, "params": params}).encode())
        answer = json.loads(body)
        if "error" in answer:
            raise RuntimeError(answer["error"])
        return answer["result"]


def time_pages(page, folder, files, rounds):
    for sort in ("name", "date", "size", "kind"):
        for offset in (0, files // 2, files - PAGE):
            times = []
            for _ in range(rounds):
                begin = time.perf_counter()
                answer = page.call("sortedItems", container=folder, sort=sort, offset=offset, limit=PAGE)
                times.append((time.perf_counter() - begin) * 1e3)
                assert answer["total"] == files and len(answer["items"]) == PAGE
            print(f"{PAGE} items by {sort} from {offset}: median {statistics.median(times):.1f} ms, 95th percentile {percentile(times, 0.95):.1f} ms")


def time_changes(page, folder, path, rounds):
    watch = page.call("watchQuery", query="sortedItems", container=folder)["watch"]
    times = []
    for number in range(rounds):
        time.sleep(LATENCY)  # What came before has been told.
        while not page.events.empty():
            page.events.get()
        begin = time.perf_counter()
        with open(os.path.join(path, f"new {number}.txt"), "w", encoding="ascii"):
            pass
        while page.events.get() != {"jsonrpc": "2.0", "method": "queryChanged", "params": {"watch": watch}}:
            pass
        page.call("sortedItems", container=folder, sort="name", offset=0, limit=PAGE)
        times.append((time.perf_counter() - begin) * 1e3)
    print(f"a change until its page is there again: median {statistics.median(times):.0f} ms, 95th percentile {percentile(times, 0.95):.0f} ms")


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("--files", type=int, default=100_000)
    parser.add_argument("--rounds", type=int, default=200)
    parser.add_argument("--changes", type=int, default=20)
    parser.add_argument("--bin", default=os.path.join(HERE, "../build/release"))
    parser.add_argument("--folder", default=tempfile.gettempdir())
    parser.add_argument("--page", action="store_true")
    words = parser.parse_args()

    program = os.path.join(os.path.realpath(words.bin), "src/host/cindral")
    folder = tempfile.mkdtemp(prefix="cindral-http-", dir=words.folder)
    storage = os.path.join(folder, "Documents")
    path = os.path.join(storage, "Big")
    os.makedirs(path)
    for number in range(words.files):
        with open(os.path.join(path, f"Document {number}.txt"), "w", encoding="ascii"):
            pass
    try:
        with subprocess.Popen([program, "serve", "--http", "--storage", storage, "--state", os.path.join(folder, "state"), "--no-flatpak"],
                              stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True) as daemon:
            link = daemon.stdout.readline()
            port, secret = re.search(r":(\d+)/#([0-9a-f]+)", link).groups()
            page = Page(port, secret)
            begin = time.perf_counter()
            big = page.call("sortedItems", container=ROOT, limit=1)["items"][0]["identifier"]
            page.call("sortedItems", container=big, limit=PAGE)
            print(f"{words.files:,} files; the very first page, with the first look at all of them: {time.perf_counter() - begin:.1f} s")
            time_pages(page, big, words.files, words.rounds)
            time_changes(page, big, path, words.changes)
            daemon.terminate()
        if words.page:
            npm = os.path.join(HERE, "../build/npm")
            subprocess.run([os.path.join(HERE, "../tests/browser/run"), npm, program, "--test-name-pattern=^$"], check=False, stdout=subprocess.DEVNULL)
            subprocess.run(["node", os.path.join(HERE, "page_bench.mjs"), storage, os.path.join(folder, "state")], check=True,
                           env={**os.environ, "CINDRAL_PROGRAM": program, "CINDRAL_NODE_MODULES": os.path.join(npm, "node_modules")})
    finally:
        shutil.rmtree(folder)
    return 0


if __name__ == "__main__":
    sys.exit(main())
