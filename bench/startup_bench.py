#!/usr/bin/env python3
"""The start of a command, to the first byte that it prints: by a daemon and alone, beside `ls` and `true` of the system.

usage: startup_bench.py [--rounds N] [--entries N] [--bin FOLDER]

Everything that is compared is measured in turns in one run. Needs the release build: build/release.
"""

import argparse
import os
import statistics
import subprocess
import tempfile
import time


def to_first_byte(words, environment):
    """Milliseconds from before the process is made until its first byte (or its end, where it prints nothing)."""
    ours, its = os.pipe()
    begin = time.perf_counter()
    process = os.posix_spawnp(words[0], words, environment, file_actions=[
        (os.POSIX_SPAWN_DUP2, its, 1), (os.POSIX_SPAWN_CLOSE, its), (os.POSIX_SPAWN_CLOSE, ours)])
    os.close(its)
    os.read(ours, 1)
    elapsed = (time.perf_counter() - begin) * 1000
    while os.read(ours, 65536):
        pass
    os.close(ours)
    _, status = os.waitpid(process, 0)
    if status != 0:
        raise RuntimeError(f"{words} ended with {status}")
    return elapsed


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("--rounds", type=int, default=200)
    parser.add_argument("--entries", type=int, default=100)
    parser.add_argument("--bin", default=os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "build", "release", "src", "host"))
    arguments = parser.parse_args()
    program = os.path.join(arguments.bin, "cindral")
    with tempfile.TemporaryDirectory(prefix="cindral-bench-") as folder:
        storage = os.path.join(folder, "Documents")
        os.mkdir(storage)
        for number in range(arguments.entries):
            with open(os.path.join(storage, f"{number}.txt"), "wb"):
                pass
        environment = {**os.environ, "HOME": folder}
        options = ["--storage", storage, "--state", os.path.join(folder, "state"), "--no-flatpak"]
        alone = ["--storage", storage, "--state", os.path.join(folder, "alone"), "--no-flatpak"]
        daemon = subprocess.Popen([program, "serve", *options], env=environment, stderr=subprocess.PIPE)
        while b" serving " not in daemon.stderr.readline():
            pass
        compared = {
            "true": ["true"],
            "ls -l": ["ls", "-l", storage],
            "cindral --version": [program, "--version"],
            "cindral ls, by the daemon": [program, "ls", *options],
            "cindral ls, alone": [program, "ls", *alone],
        }
        taken = {name: [] for name in compared}
        for _ in range(arguments.rounds + 5):
            for name, words in compared.items():
                taken[name].append(to_first_byte(words, environment))
        daemon.terminate()
        daemon.wait()
    print("| to the first byte | median, ms | 95 of 100, ms | times `ls -l` |\n|---|---|---|---|")
    beside = statistics.median(taken["ls -l"][5:])
    for name, times in taken.items():
        times = sorted(times[5:])
        median = statistics.median(times)
        print(f"| `{name}` | {median:.2f} | {times[len(times) * 95 // 100]:.2f} | {median / beside:.1f} |")


if __name__ == "__main__":
    main()
