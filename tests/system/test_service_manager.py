"""What the daemon says to a service manager, what it takes from one, and what it costs while nothing happens."""

import configparser
import os
import platform
import shutil
import socket
import subprocess
import unittest

from cindral_rpc import PATIENCE, ROOT, SocketClient, SystemTest

UNITS = os.environ.get("CINDRAL_UNITS", "")
FOREVER = {0xFFFFFFFF, 0xFFFFFFFFFFFFFFFF}
# Numbers of the calls in which a thread may sleep: read, poll, futex, ppoll.
CALLS = {"x86_64": (0, 7, 202, 271), "aarch64": (63, None, 98, 73)}[platform.machine()]
# As long as the recorder rests between two looks at what no event tells of.
AUDIT_PAUSE_MIN = 30_000


class ServiceManagerTest(SystemTest):
    def setUp(self):
        super().setUp()
        self.make_file("notes.txt")
        self.notices = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.addCleanup(self.notices.close)
        self.notices.settimeout(PATIENCE)
        self.notices.bind(os.path.join(self.folder, "notices"))
        self.managed = {**self.environment, "NOTIFY_SOCKET": os.path.join(self.folder, "notices")}

    def notice(self):
        return self.notices.recv(4096).decode().splitlines()

    def test_says_when_it_is_ready_and_when_it_stops(self):
        daemon = self.daemon(environment=self.managed)
        self.assertEqual(self.notice(), ["READY=1"])
        self.assertEqual(set(self.connect().named()), {"notes.txt"})
        self.assertEqual(daemon.stop(), 0)
        self.assertEqual(self.notice(), ["STOPPING=1"])

    def test_says_that_all_is_well_as_often_as_it_is_asked(self):
        daemon = self.daemon(environment={**self.managed, "WATCHDOG_USEC": "20000"})
        self.assertEqual(self.notice(), ["READY=1"])
        for _ in range(5):
            self.assertEqual(self.notice(), ["WATCHDOG=1"])
        self.assertEqual(daemon.stop(), 0)
        said = [self.notice()]
        while said[-1] != ["STOPPING=1"]:
            said.append(self.notice())

    def test_what_is_meant_for_another_process_is_left_alone(self):
        daemon = self.daemon(environment={**self.managed, "WATCHDOG_USEC": "1", "WATCHDOG_PID": "1", "LISTEN_FDS": "1", "LISTEN_PID": "1"})
        self.assertEqual(self.notice(), ["READY=1"])
        self.assertEqual(daemon.stop(), 0)
        self.assertEqual(self.notice(), ["STOPPING=1"])

    def test_serves_on_a_socket_that_it_is_given(self):
        path = os.path.join(self.folder, "given.sock")
        with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as listening:
            listening.bind(path)
            listening.listen(16)
            # As the service manager would: as the third descriptor of the very process.
            script = f'export LISTEN_PID=$$; exec "$@" 3<&{listening.fileno()}'
            how = {"launcher": ["sh", "-c", script, "sh"], "environment": {**self.managed, "LISTEN_FDS": "1"}, "pass_fds": [listening.fileno()]}
            for _ in range(2):
                # Who comes before the daemon waits for it.
                early = SocketClient(path)
                self.addCleanup(early.close)
                number = early.send("status")
                daemon = self.daemon(**how)
                self.assertEqual(early.answer(number)["result"]["state"], self.state)
                self.assertEqual(os.readlink(os.path.join(self.state, "socket")), path)
                self.assertEqual(self.run_program("id", self.path("notes.txt"))[0], 0)
                self.assertEqual(daemon.stop(), 0)
                self.assertTrue(os.path.exists(path), "it is not the daemon's to take away")

    def test_sleeps_while_nothing_happens(self):
        daemon = self.daemon()
        clients = [self.connect() for _ in range(3)]
        for client in clients:
            client.call("startMonitoring", container=ROOT)
        awake = None
        # What was begun comes to its end first.
        while awake != []:
            awake = [state for state in self.threads(daemon.process.pid) if state is not None]
        # As long as it sleeps so, no thread is ever run: a tick would be a moment that it waits for.
        self.assertEqual(awake, [])
        self.assertEqual(daemon.stop(), 0)

    @staticmethod
    def threads(process):
        """For each thread: None where it sleeps until somebody else does something, else what it does."""
        states = []
        with open(f"/proc/{process}/maps", encoding="utf-8") as maps:
            has_ticking_sanitizer = "libtsan" in maps.read()
        for thread in os.listdir(f"/proc/{process}/task"):
            folder = f"/proc/{process}/task/{thread}"
            try:
                with open(f"{folder}/comm", encoding="ascii") as file:
                    name = file.read().strip()
                with open(f"{folder}/syscall", encoding="ascii") as file:
                    call = file.read().split()
            except (FileNotFoundError, ProcessLookupError):
                continue  # It has ended.
            if call[0] == "running":
                states.append(f"{name} runs")
                continue
            number, arguments = int(call[0]), [int(text, 16) for text in call[1:7]]
            read, poll, futex, ppoll = CALLS
            timeouts = {read: 0, poll: arguments[2] not in FOREVER and arguments[2], futex: arguments[3], ppoll: arguments[2]}
            timeout = timeouts.get(number, f"system call {number}")
            audits = name == "recorder" and number in (poll, ppoll) and arguments[2] >= AUDIT_PAUSE_MIN
            # The thread sanitizer's own thread ticks.
            is_sanitizers = has_ticking_sanitizer and number not in timeouts
            states.append(None if not timeout or audits or is_sanitizers else f"{name} waits: {call}")
        return states


class UnitsTest(unittest.TestCase):
    """The files that `cmake --install` puts where the service manager looks."""

    def unit(self, name):
        parser = configparser.ConfigParser(interpolation=None, strict=False)
        parser.optionxform = str
        with open(os.path.join(UNITS, name), encoding="utf-8") as file:
            parser.read_file(file)
        return parser

    def test_the_service_runs_the_installed_program(self):
        service = self.unit("cindral.service")
        program, command = service["Service"]["ExecStart"].split()
        self.assertTrue(program.startswith("/") and program.endswith("/bin/cindral"), program)
        self.assertEqual(command, "serve")
        self.assertEqual(service["Service"]["Type"], "notify")

    def test_the_socket_is_its_owners_alone(self):
        unit = self.unit("cindral.socket")["Socket"]
        self.assertEqual((unit["SocketMode"], unit["DirectoryMode"]), ("0600", "0700"))
        self.assertEqual(unit["ListenStream"], "%t/cindral/cindral.sock")
        self.assertTrue(unit["Symlinks"].endswith("/cindral/socket"))

    def test_the_service_manager_understands_them(self):
        verify = shutil.which("systemd-analyze")
        if verify is None:
            # Without a service manager there is nobody to misunderstand them.
            self.assertFalse(os.path.exists("/run/systemd/system"))
            return
        done = subprocess.run([verify, "--user", "verify", os.path.join(UNITS, "cindral.socket")], stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                              env={**os.environ, "XDG_RUNTIME_DIR": os.environ.get("XDG_RUNTIME_DIR", "/tmp")}, timeout=PATIENCE, check=False)
        # That the program is not installed is no fault of the files.
        complaints = [line for line in done.stdout.decode().splitlines() if "is not executable" not in line and "cindral" in line and "man " not in line]
        self.assertEqual(complaints, [])


if __name__ == "__main__":
    unittest.main()
