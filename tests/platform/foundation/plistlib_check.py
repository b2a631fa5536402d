"""Compares our binary property lists with those of Python's plistlib, in both directions.

Usage: plistlib_check.py TOOL. plistlib writes a value, TOOL says what it reads and how it writes that, and plistlib reads
it again: both must be the value that was written.
"""

import datetime
import plistlib
import random
import string
import struct
import subprocess
import sys

EPOCH = datetime.datetime(1970, 1, 1)
TEXTS = string.ascii_letters + "\0\n äß€Ω漢\u07ff\u0800\ud7ff\ue000\uffff\U00010000\U0001f600\U0010ffff"


def describe(value):
    """What the tool prints for the value."""
    if isinstance(value, bool):
        return "true" if value else "false"
    if isinstance(value, int):
        return f"i{value}"
    if isinstance(value, float):
        return "r" + struct.pack(">d", value).hex()
    if isinstance(value, datetime.datetime):
        microseconds = (value - EPOCH) // datetime.timedelta(microseconds=1)
        return f"d{microseconds // 1000000}.{microseconds % 1000000 * 1000:09}"
    if isinstance(value, bytes):
        return "x" + value.hex()
    if isinstance(value, str):
        return "s" + value.encode().hex()
    if isinstance(value, list):
        return "[" + "".join(describe(element) + "," for element in value) + "]"
    entries = sorted(value.items(), key=lambda entry: entry[0].encode())
    return "{" + "".join(f"{describe(key)}:{describe(element)}," for key, element in entries) + "}"


def random_date():
    # A moment that doubles hold exactly, because plistlib and we round others to different units.
    quarters = random.randrange(-4 * 10**10, 4 * 10**10)
    return datetime.datetime(2001, 1, 1) + datetime.timedelta(seconds=quarters / 4)


def random_text():
    return "".join(random.choices(TEXTS, k=random.choice([0, 1, 5, 14, 15, 16, 300])))


def random_value(depth):
    scalars = [
        lambda: random.random() < 0.5,
        lambda: random.randrange(2 ** random.choice([8, 16, 32, 63, 64])),
        lambda: -random.randrange(1, 2 ** random.choice([8, 16, 32, 63])),
        lambda: random.choice([0.0, -1.5, 1e300, 5e-324, float("inf"), random.random()]),
        random_date,
        lambda: random.randbytes(random.choice([0, 1, 14, 15, 255, 256, 300])),
        random_text,
    ]
    if depth == 0 or random.random() < 0.3:
        return random.choice(scalars)()
    count = random.choice([0, 1, 3, 14, 15, 20])
    if random.random() < 0.5:
        return [random_value(depth - 1) for _ in range(count)]
    return {random_text(): random_value(depth - 1) for _ in range(count)}


def edges():
    yield from [True, False, 0, -1, 2**63 - 1, -(2**63), 2**64 - 1, 0.0, "", b"", [], {}]
    for bits in [8, 16, 32, 63]:
        yield from [2**bits - 1, 2**bits, -(2**bits)]
    yield datetime.datetime(2001, 1, 1)
    yield datetime.datetime(1, 1, 1)
    yield datetime.datetime(9999, 12, 31, 23, 59, 59)
    yield "a" * 70000
    yield list(range(300))
    yield [str(i) for i in range(70000)]
    yield {f"key {i}": "shared" for i in range(1000)}


def check(tool):
    random.seed(2001)
    values = list(edges()) + [random_value(3) for _ in range(500)]
    refused = [{"uid": plistlib.UID(1)}, plistlib.UID(70000)]
    lists = [plistlib.dumps(value, fmt=plistlib.FMT_BINARY) for value in values + refused]
    lists.append(plistlib.dumps("text", fmt=plistlib.FMT_XML))
    output = subprocess.run([tool], input="".join(data.hex() + "\n" for data in lists), capture_output=True, text=True, check=True)
    lines = output.stdout.splitlines()
    assert len(lines) == len(lists), f"{len(lines)} answers to {len(lists)} lists"
    for value, line in zip(values, lines):
        assert line != "refused", f"refused: {value!r:.200}"
        description, data = line.split(" ")
        assert description == describe(value), f"read as {description:.200}: {value!r:.200}"
        again = plistlib.loads(bytes.fromhex(data), fmt=plistlib.FMT_BINARY)
        assert describe(again) == describe(value), f"written as {again!r:.200}: {value!r:.200}"
    for line in lines[len(values):]:
        assert line == "refused", f"not refused: {line:.200}"
    print(f"{len(values)} values")


check(sys.argv[1])
