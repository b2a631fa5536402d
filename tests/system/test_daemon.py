"""The daemon: its socket, its clients, its beginning and its end."""

import errno
import json
import os
import signal
import socket
import stat
import subprocess
import unittest

from cindral_rpc import PATIENCE, PROGRAM, ROOT, Daemon, SocketClient, SystemTest


def status_request(number):
    return json.dumps({"jsonrpc": "2.0", "id": number, "method": "status", "params": {}}).encode() + b"\n"


class DaemonTest(SystemTest):
    def setUp(self):
        super().setUp()
        self.make_file("notes.txt", contents=b"notes")
        self.runtime = os.path.join(self.folder, "run")
        os.mkdir(self.runtime, 0o700)

    @property
    def with_runtime(self):
        return {**self.environment, "XDG_RUNTIME_DIR": self.runtime}

    def sockets(self):
        folder = os.path.join(self.runtime, "cindral")
        return [os.path.join(folder, name) for name in os.listdir(folder)]

    # Where it is.

    def test_serves_on_a_socket_in_the_runtime_folder(self):
        daemon = self.daemon(environment=self.with_runtime)
        (path,) = self.sockets()
        self.assertTrue(stat.S_ISSOCK(os.stat(path).st_mode))
        self.assertEqual(stat.S_IMODE(os.stat(path).st_mode), 0o600)
        self.assertEqual(stat.S_IMODE(os.stat(os.path.dirname(path)).st_mode), 0o700)
        self.assertEqual(os.readlink(os.path.join(self.state, "socket")), path)
        self.assertEqual(set(self.connect().named()), {"notes.txt"})
        self.assertEqual(daemon.stop(), 0)
        self.assertEqual(self.sockets(), [])
        self.assertFalse(os.path.lexists(os.path.join(self.state, "socket")))

    def test_every_state_folder_has_a_socket_of_its_own(self):
        other = os.path.join(self.folder, "other")
        for state in (self.state, other):
            self.daemon(state=state, environment=self.with_runtime)
        self.assertEqual(len(self.sockets()), 2)
        for state in (self.state, other):
            self.assertEqual(self.connect(state=state).call("status")["state"], state)

    def test_the_socket_is_in_the_state_folder_where_no_runtime_folder_is_ones_own(self):
        os.mkdir(os.path.join(self.runtime, "cindral"), 0o755)
        for environment in (self.environment, self.with_runtime):
            daemon = self.daemon(environment=environment)
            self.assertTrue(stat.S_ISSOCK(os.lstat(os.path.join(self.state, "socket")).st_mode))
            self.assertEqual(set(self.connect().named()), {"notes.txt"})
            self.assertEqual(daemon.stop(), 0)

    def test_the_path_of_the_state_folder_may_be_longer_than_an_address(self):
        self.state = os.path.join(self.folder, "state" * 30, "state" * 30)
        daemon = self.daemon()
        folder = os.open(self.state, os.O_PATH)
        self.addCleanup(os.close, folder)
        with SocketClient(f"/proc/self/fd/{folder}/socket") as client:
            self.assertEqual(set(client.named()), {"notes.txt"})
        self.assertEqual(daemon.stop(), 0)

    def test_replaces_the_socket_of_a_daemon_that_died(self):
        for environment in (self.environment, self.with_runtime):
            daemon = self.daemon(environment=environment)
            daemon.process.kill()
            daemon.status()
            self.assertTrue(os.path.lexists(os.path.join(self.state, "socket")))
            daemon = self.daemon(environment=environment)
            self.assertEqual(set(self.connect().named()), {"notes.txt"})
            self.assertEqual(daemon.stop(), 0)

    def test_a_second_daemon_says_who_is_there(self):
        daemon = self.daemon()
        second = Daemon(self.options(), self.environment)
        self.assertFalse(second.is_serving)
        self.assertEqual(second.status(), 1)
        self.assertEqual(second.error_text().splitlines()[-1],
                         f"cindral: the state folder {self.state} is in use by process {daemon.process.pid}")
        self.assertEqual(set(self.connect().named()), {"notes.txt"}, "the first one goes on")

    # Its end.

    def test_stops_on_either_signal_with_everything_answered(self):
        self.make_files("many", 500)
        for number in (signal.SIGTERM, signal.SIGINT):
            daemon = self.daemon()
            clients = [self.connect() for _ in range(3)]
            folder = clients[0].identifier(self.path("many"))
            asked = [(client, [client.send("enumerateItems", container=folder) for _ in range(50)]) for client in clients]
            self.assertEqual(daemon.stop(number), 0)
            for client, requests in asked:
                for request in requests:
                    self.assertTrue(client.answer(request)["result"]["items"])
                self.assertIsNone(client.next_message(), "the end")

    def test_an_edit_under_way_is_finished_at_the_end(self):
        big = os.path.join(self.folder, "big")
        with open(big, "wb") as file:
            file.write(b"x" * 30_000_000)
        os.mkdir(self.path("sub"))
        daemon = self.daemon()
        client = self.connect()
        request = client.send("importDocument", path=big, parent=client.identifier(self.path("sub")))
        self.assertEqual(daemon.stop(), 0)
        self.assertEqual(client.answer(request)["result"]["documentSize"], 30_000_000)
        self.assertEqual(os.stat(self.path("sub", "big")).st_size, 30_000_000)

    def test_a_client_that_does_not_read_does_not_keep_it_from_stopping(self):
        self.make_files("many", 1000)
        daemon = self.daemon()
        client = self.connect(reads=False)
        folder = self.connect().identifier(self.path("many"))
        for number in range(40):
            client.send("enumerateItems", container=folder)
        self.assertEqual(daemon.stop(), 0)

    def test_the_end_of_a_clients_input_is_the_end_of_its_connection(self):
        self.daemon()
        client = self.connect()
        requests = [client.send("enumerateItems", container=ROOT) for _ in range(100)]
        client.end_input()
        for request in requests:
            self.assertTrue(client.answer(request)["result"]["items"])
        self.assertIsNone(client.next_message())


if __name__ == "__main__":
    unittest.main()
