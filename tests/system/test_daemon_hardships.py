"""The daemon among hostile clients and on disks that are full or read-only."""

import errno
import json
import os
import shutil
import socket
import stat
import subprocess
import threading
import unittest

from cindral_rpc import PATIENCE, PROGRAM, ROOT, WORKING_SET, Daemon, RpcError, SocketClient, SystemTest

NOBODY = 65534


def request(number, method, **params):
    return json.dumps({"jsonrpc": "2.0", "id": number, "method": method, "params": params}).encode() + b"\n"


def peak_memory(process):
    """Bytes that the process had in memory at most."""
    with open(f"/proc/{process.pid}/status", encoding="ascii") as status:
        return next(int(line.split()[1]) * 1024 for line in status if line.startswith("VmHWM"))


class HostileClientsTest(SystemTest):
    def setUp(self):
        super().setUp()
        self.make_files("many", 300)
        self.served = self.daemon()
        self.bystander = self.connect()
        self.many = self.bystander.identifier(self.path("many"))

    def tearDown(self):
        # Whatever the others did: nobody else noticed.
        self.assertEqual(len(self.bystander.items(self.many)), 300)
        self.assertEqual(self.served.stop(), 0)
        super().tearDown()

    def resources(self):
        """How many threads and descriptors the daemon has."""
        folder = f"/proc/{self.served.process.pid}"
        return len(os.listdir(f"{folder}/task")), len(os.listdir(f"{folder}/fd"))

    def test_lines_that_are_no_requests_are_answered_and_harm_nobody(self):
        client = self.connect()
        lines = [b"\xff\xfe\xfd", b"\0" * 1000, b"{", b"}", b'{"jsonrpc":"2.0"', b"[" * 100_000, b'{"a":' * 100_000, b"1e999", b"[]", b"[1,2,3]",
                 b'"\xed\xa0\x80"', b'{"jsonrpc":"2.0","id":{},"method":"status"}', b'{"jsonrpc":"2.0","id":1e400,"method":"status"}', b"null",
                 b'{"jsonrpc":"1.0","id":5,"method":"status"}', b'{"jsonrpc":"2.0","id":5,"method":7}', b"\xef\xbb\xbf{}", b"GET / HTTP/1.1"]
        for line in lines:
            client.send_bytes(line + b"\n")
            answer = client.next_message()
            for one in answer if isinstance(answer, list) else [answer]:
                self.assertIn(one["error"]["code"], (-32700, -32600), line)
        self.assertEqual(len(client.items(self.many)), 300)

    def test_a_line_of_a_gigabyte_costs_no_memory(self):
        client = self.connect()
        before = peak_memory(self.served.process)
        piece = b"x" * (1 << 20)
        for _ in range(1 << 10):
            client.send_bytes(piece)
        client.send_bytes(b"\n" + request("after", "currentSyncAnchor", container=ROOT))
        self.assertEqual(client.next_message()["error"]["code"], -32600)
        self.assertEqual(client.next_message()["id"], "after")
        self.assertLess(peak_memory(self.served.process) - before, 100 << 20)

    def test_who_asks_much_and_reads_nothing_is_dropped_alone(self):
        before = peak_memory(self.served.process)
        stuck = self.connect(reads=False)
        with self.assertRaises(OSError) as raised:
            for number in range(100_000):
                stuck.send_bytes(request(number, "enumerateItems", container=self.many))
                if number % 1000 == 0:
                    self.assertEqual(len(self.bystander.items(self.many)), 300)
        self.assertIn(raised.exception.errno, (errno.EPIPE, errno.ECONNRESET))
        self.assertTrue(self.served.waits_for("a client that does not read is dropped"))
        # Of nine gigabytes that it has asked for; a sanitizer's share included.
        self.assertLess(peak_memory(self.served.process) - before, 600 << 20)

    def test_who_reads_slowly_gets_everything(self):
        slow = self.connect(reads=False)
        count = 600
        sending = threading.Thread(target=lambda: [
            slow.send_bytes(request(number, "enumerateItems", container=self.many)) for number in range(count)])
        sending.start()
        # More than the daemon would ever keep.
        slow.socket.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, 4096)
        with slow.socket.makefile("rb", buffering=4096) as lines:
            self.assertEqual({json.loads(lines.readline())["id"] for _ in range(count)}, set(range(count)))
        sending.join()

    def test_clients_may_go_at_any_moment(self):
        script = (request(1, "startMonitoring", container=ROOT) + request(2, "enumerateItems", container=self.many) +
                  request(3, "setTags", identifier=self.many, tags=["red"]) + b"[" + request(4, "status").strip() + b"]\n")
        with SocketClient(os.path.join(self.state, "socket")) as first:
            first.call("search", text="nothing")
        threads, descriptors = self.resources()
        for length in range(len(script) + 1):
            client = SocketClient(os.path.join(self.state, "socket"), reads=False)
            client.socket.sendall(script[:length])
            # With and without the end of the input first; unread answers make it a reset.
            if length % 2:
                client.end_input()
            client.close()
        # Of each nothing stays; the pool's threads come and go, and so do some folders and the index's files.
        while self.resources()[1] > descriptors + 16 or self.resources()[0] > threads + 64:
            self.assertEqual(len(self.bystander.items(self.many)), 300)

    def test_many_clients_at_once(self):
        clients = [self.connect() for _ in range(100)]
        for client in clients:
            client.call("startMonitoring", container=self.many)
        asked = [(client, client.send("enumerateItems", container=self.many)) for client in clients for _ in range(3)]
        for client, number in asked:
            self.assertEqual(len(client.answer(number)["result"]["items"]), 200)
        self.make_file("many", "new.txt")
        for client in clients:
            self.assertEqual(client.next_notification("signal"), {"container": self.many})
        os.unlink(self.path("many", "new.txt"))

    def test_where_descriptors_run_out_those_that_there_are_go_on(self):
        other = os.path.join(self.folder, "other")
        served = self.daemon(state=other, launcher=["sh", "-c", 'ulimit -n 64 && exec "$@"', "sh"])

        def asked(client):
            """Whether it is served: one that is turned away is not answered."""
            try:
                client.send("status")
                return client.next_message() is not None
            except OSError:
                return False
        clients = [self.connect(state=other)]
        while asked(clients[-1]):
            self.assertLess(len(clients), 64)
            clients.append(self.connect(state=other))
        self.assertGreater(len(clients), 10)
        self.assertTrue(all(asked(client) for client in clients[:-1]))
        for client in clients[-5:]:
            client.close()
        # As soon as the daemon has noticed.
        while not asked(self.connect(state=other)):
            self.assertTrue(asked(clients[0]))
        self.assertEqual(served.stop(), 0)

    def test_nobody_else_is_let_in(self):
        path = os.path.join(self.state, "socket")
        self.assertEqual(stat.S_IMODE(os.stat(path).st_mode), 0o600)
        self.assertEqual(stat.S_IMODE(os.stat(self.state).st_mode), 0o700)
        if os.geteuid() != 0:
            return  # The modes keep others out; only a privileged tester can be somebody else all the same.
        for place, mode in ((self.folder, 0o755), (self.state, 0o755), (path, 0o666)):
            os.chmod(place, mode)
        # Sends nothing: it may be sent away before.
        ask = ("import socket, sys; s = socket.socket(socket.AF_UNIX); s.connect(sys.argv[1]); "
               "sys.stdout.write(s.makefile().read())")
        said = subprocess.run(
            ["setpriv", f"--reuid={NOBODY}", f"--regid={NOBODY}", "--clear-groups", "/usr/bin/python3", "-c", ask, path],
            stdout=subprocess.PIPE, timeout=PATIENCE, check=False).stdout
        answer = json.loads(said)
        self.assertEqual(answer["error"]["message"], "This daemon serves nobody but the person who started it")
        self.assertEqual(said.count(b"\n"), 1, "and nothing else")
        # A command says so as well.
        program = os.path.join(self.folder, "cindral")
        shutil.copy2(PROGRAM, program)
        done = subprocess.run(["setpriv", f"--reuid={NOBODY}", f"--regid={NOBODY}", "--clear-groups", program, "ls", *self.options()],
                              env=self.environment, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=PATIENCE, check=False)
        self.assertEqual((done.returncode, done.stdout.decode(), done.stderr.decode()),
                         (1, "", f"cindral: the daemon of the state folder {self.state}: process {self.served.process.pid} is another user's\n"))


class DisksTest(SystemTest):
    """With folders on small disks of their own, in a place that only the program sees: no privilege is needed."""

    def setUp(self):
        super().setUp()
        self.make_files("many", 300)
        self.make_file("notes.txt", contents=b"notes")
        os.mkdir(self.state, 0o700)

    def launcher(self, script, *arguments):
        return ["unshare", "--user", "--map-root-user", "--mount", "sh", "-c", script + ' && exec "$@"', *arguments]

    def fill(self, path):
        with self.assertRaises(OSError) as raised, open(path, "ab", buffering=0) as file:
            while True:
                file.write(b"x" * 4096)
        self.assertEqual(raised.exception.errno, errno.ENOSPC)

    def contents(self):
        """Every document and what is in it."""
        found = {}
        for folder, _, names in os.walk(self.storage):
            for name in names:
                with open(os.path.join(folder, name), "rb") as file:
                    found[os.path.join(folder, name)] = file.read()
        return found

    def test_on_a_full_disk_nothing_is_lost_and_nothing_kept_secret(self):
        served = self.daemon(launcher=self.launcher('mount -t tmpfs -o size=16m,mode=700 none "$0"', self.state))
        inside = f"/proc/{served.process.pid}/root{self.state}"
        client = SocketClient(os.path.join(inside, "socket"))
        self.addCleanup(client.close)
        # The known ones are told all the same, those that would need a new number are not.
        view = {item["identifier"] for item in client.items(WORKING_SET)}
        many = client.identifier(self.path("many"))
        self.assertEqual(len(client.items(many)), 300)
        anchor = client.call("currentSyncAnchor", container=WORKING_SET)["anchor"]
        filler = os.path.join(inside, "filler")
        self.fill(filler)
        before = self.contents()
        self.assertEqual({item["identifier"] for item in client.items(WORKING_SET)}, view)
        os.rename(self.path("notes.txt"), self.path("moved.txt"))
        made = client.call("createDirectory", name="made", parent=many)
        self.assertTrue(os.path.isdir(self.path("many", "made")))
        # What can't be recorded can't be told: never a silent miss. There may be room for some of it yet.
        with self.assertRaises(RpcError) as raised:
            while True:
                client.call("enumerateChanges", container=WORKING_SET, anchor=anchor)
                self.fill(filler)
                os.utime(self.path("moved.txt"))
        self.assertEqual((raised.exception.domain, raised.exception.domain_code), ("TesselErrorDomain", -1002))
        self.assertTrue(served.waits_for("No space left on device"))
        self.assertEqual(client.call("status")["storage"], self.storage)
        before[self.path("moved.txt")] = before.pop(self.path("notes.txt"))
        self.assertEqual(self.contents(), before)

        # With space again, without help, and from the old anchor on.
        os.unlink(filler)
        changes = client.call("enumerateChanges", container=WORKING_SET, anchor=anchor)
        self.assertFalse(changes["moreComing"])
        told = {item["identifier"]: item["filename"] for item in changes["updated"]}
        self.assertEqual(told[made["identifier"]], "made")
        self.assertIn("moved.txt", told.values())
        fresh = {item["identifier"]: item["filename"] for item in client.items(WORKING_SET)}
        self.assertEqual({**{identifier: fresh[identifier] for identifier in view}, **told}, fresh)
        self.assertEqual(served.stop(), 0)

    def test_on_a_full_disk_search_says_so_and_goes_on_when_there_is_room(self):
        served = self.daemon(launcher=self.launcher('mount -t tmpfs -o size=24m,mode=700 none "$0"', self.state))
        inside = f"/proc/{served.process.pid}/root{self.state}"
        client = SocketClient(os.path.join(inside, "socket"))
        self.addCleanup(client.close)
        self.assertEqual([item["filename"] for item in client.call("search", text="notes")["items"]], ["notes.txt"])
        self.assertEqual(client.call("status")["problems"], [])
        filler = os.path.join(inside, "filler")
        self.fill(filler)
        before = self.contents()

        # There may be room for some of it yet.
        def search_until_full():
            for number in range(10_000):
                os.rename(self.path("many", "00000.txt"), self.path("many", f"renamed {number}"))
                try:
                    found = client.call("search", text=f"renamed {number}")["items"]
                    self.assertEqual([item["filename"] for item in found], [f"renamed {number}"], "never a wrong answer")
                except RpcError as refused:
                    return refused
                finally:
                    os.rename(self.path("many", f"renamed {number}"), self.path("many", "00000.txt"))
                self.fill(filler)
            self.fail("the disk is never full")

        refused = search_until_full()
        self.assertEqual((refused.domain, refused.domain_code), ("KsPOSIXErrorDomain", errno.ENOSPC), refused)
        # Again, and by another question; and what is wrong can be read.
        for method, params in (("search", {"text": "notes"}), ("recents", {}), ("sortedItems", {"container": "TesselRootContainerItemIdentifier"})):
            with self.assertRaises(RpcError) as raised:
                client.call(method, **params)
            self.assertEqual(raised.exception.domain_code, errno.ENOSPC, raised.exception)
        problems = {problem["what"]: problem["remedy"] for problem in client.call("status")["problems"]}
        self.assertIn("the search index can't follow: No space left on device", problems)
        self.assertIn("make room on the disk", problems["the search index can't follow: No space left on device"])
        self.assertEqual(self.contents(), before)

        os.unlink(filler)
        os.rename(self.path("many", "00000.txt"), self.path("many", "found again"))
        self.assertEqual([item["filename"] for item in client.call("search", text="found again")["items"]], ["found again"])
        self.assertEqual([item["filename"] for item in client.call("search", text="notes")["items"]], ["notes.txt"])
        self.assertEqual(client.call("search", text="renamed")["items"], [])
        # Nothing is wrong any more but what was logged of it, until somebody has looked after that.
        for problem in client.call("status")["problems"]:
            self.assertIn("logged within the last hour", problem["what"])
        self.assertEqual(client.call("doctor")["problems"], [])
        self.assertEqual(client.call("status")["problems"], [])
        self.assertEqual(served.stop(), 0)

    def test_on_a_full_disk_commands_say_so(self):
        """Nobody can begin there; who begins once there is space does."""
        script = 'mount -t tmpfs -o size=64k,mode=700 none "$0" && { cat /dev/zero > "$0/filler" 2>/dev/null; true; }'
        before = self.contents()
        for words in (["serve"], ["ls"], ["rpc"], ["find", "notes"], ["status"], ["doctor"]):
            done = subprocess.run([*self.launcher(script, self.state), PROGRAM, *words, *self.options()], env=self.environment,
                                  stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=PATIENCE, check=False)
            self.assertEqual((done.returncode, done.stdout), (1, b""), words)
            self.assertEqual(done.stderr.decode().splitlines()[-1],
                             f"cindral: can't open the state folder {self.state}: No space left on device")
        self.assertEqual(self.contents(), before)

    def test_on_a_read_only_disk_the_daemon_does_not_begin(self):
        self.run_program("ls")
        before = self.contents()
        script = 'mount --bind "$0" "$0" && mount -o remount,bind,ro "$0"'
        for words in (["serve"], ["ls"], ["mkdir", self.path("many", "made")], ["find", "notes"], ["recents"], ["status"]):
            done = subprocess.run([*self.launcher(script, self.state), PROGRAM, *words, *self.options()], env=self.environment,
                                  stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=PATIENCE, check=False)
            self.assertEqual((done.returncode, done.stdout), (1, b""), words)
            self.assertEqual(done.stderr.decode().splitlines()[-1],
                             f"cindral: can't open the state folder {self.state}: Read-only file system")
        self.assertEqual(self.contents(), before)
        self.daemon()

    def test_documents_on_a_read_only_disk_are_shown_and_not_changed(self):
        before = self.contents()
        served = self.daemon(launcher=self.launcher('mount --bind "$0" "$0" && mount -o remount,bind,ro "$0"', self.storage))
        with self.connect() as client:
            many = client.identifier(self.path("many"))
            self.assertEqual(len(client.items(many)), 300)
            notes = client.identifier(self.path("notes.txt"))
            for method, params in (("deleteItem", {"identifier": notes}), ("renameItem", {"identifier": notes, "name": "other"}),
                                   ("createDirectory", {"name": "new", "parent": many}), ("setTags", {"identifier": notes, "tags": ["red"]}),
                                   ("trashItem", {"identifier": notes})):
                with self.subTest(method=method), self.assertRaises(RpcError) as raised:
                    client.call(method, **params)
                self.assertEqual((raised.exception.domain, raised.exception.domain_code), ("KsPOSIXErrorDomain", errno.EROFS), method)
        status, _, error = self.run_program("rm", "--yes", self.path("notes.txt"))
        self.assertEqual((status, error.decode()), (1, f"cindral: {self.path('notes.txt')}: Read-only file system\n"))
        self.assertEqual(self.contents(), before)
        self.assertEqual(served.stop(), 0)


if __name__ == "__main__":
    unittest.main()
