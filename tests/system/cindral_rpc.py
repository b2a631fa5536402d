"""Drives the program from outside: folders of its own, a JSON-RPC client, and what a test can say about both."""

import base64
import collections
import itertools
import json
import os
import queue
import shutil
import signal
import socket
import stat
import subprocess
import tempfile
import threading
import unittest

PROGRAM = os.environ.get("CINDRAL_PROGRAM", "")
ROOT = "TesselRootContainerItemIdentifier"
WORKING_SET = "TesselWorkingSetContainerItemIdentifier"

# A test that waits this long has failed; nothing is measured by it.
PATIENCE = 120


class RpcError(Exception):
    """An error that a request was answered with."""

    def __init__(self, error):
        super().__init__(json.dumps(error))
        self.code = error["code"]
        self.data = error.get("data", {})
        self.domain = self.data.get("domain")
        self.domain_code = self.data.get("code")


class Connection:
    """One client's way to a host: what it sends, and what comes back."""

    def __init__(self):
        self._ids = itertools.count(1)
        self._answers = queue.Queue()
        self._early = {}
        self._notifications = collections.deque()

    def __enter__(self):
        return self

    def _read_answers(self, lines):
        try:
            for line in lines:
                self._answers.put(line)
        except OSError:
            pass  # The other end is gone.
        self._answers.put(None)

    def send(self, method, **params):
        """Sends a request and answers its id."""
        request_id = next(self._ids)
        request = {"jsonrpc": "2.0", "id": request_id, "method": method, "params": params}
        self.send_bytes(json.dumps(request).encode() + b"\n")
        return request_id

    def next_message(self):
        """The next line as it comes; None at the end of the output."""
        line = self._answers.get(timeout=PATIENCE)
        return None if line is None else json.loads(line)

    def answer(self, request_id):
        """The answer to one request, whatever comes before it."""
        while request_id not in self._early:
            message = self.next_message()
            if message is None:
                raise AssertionError(self.why_it_ended())
            self._keep(message)
        return self._early.pop(request_id)

    def _keep(self, message):
        if "id" in message:
            self._early[message["id"]] = message
        else:
            self._notifications.append(message)

    def next_notification(self, method):
        """Parameters of the next one of the method, which is waited for; others are dropped."""
        while True:
            while self._notifications:
                message = self._notifications.popleft()
                if message["method"] == method:
                    return message["params"]
            message = self.next_message()
            if message is None:
                raise AssertionError(self.why_it_ended())
            self._keep(message)

    def call(self, method, **params):
        answer = self.answer(self.send(method, **params))
        if "error" in answer:
            raise RpcError(answer["error"])
        return answer["result"]

    def pages(self, container, **first):
        """The items of each page."""
        pages = []
        params = {"container": container, **first}
        while True:
            page = self.call("enumerateItems", **params)
            pages.append(page["items"])
            if page["nextPage"] is None:
                return pages
            params = {"container": container, "page": page["nextPage"]}

    def items(self, container, **first):
        return [item for page in self.pages(container, **first) for item in page]

    def named(self, container=ROOT):
        """The items of a container by name."""
        return {item["filename"]: item for item in self.items(container)}

    def identifier(self, path):
        return self.call("identifierForItemAtURL", path=path)["identifier"]

class Client(Connection):
    """One process that speaks JSON-RPC on its standard input and output."""

    def __init__(self, arguments, environment, launcher=(), **popen):
        super().__init__()
        self.process = subprocess.Popen(
            [*launcher, PROGRAM, "rpc", *arguments], stdin=subprocess.PIPE, stdout=subprocess.PIPE, stderr=subprocess.PIPE,
            env=environment, **popen)
        self._errors = []
        self._said = threading.Condition()
        self._readers = [threading.Thread(target=self._read_answers, args=(self.process.stdout,)),
                         threading.Thread(target=self._read_errors)]
        for reader in self._readers:
            reader.start()

    def __exit__(self, *_):
        if self.process.poll() is None:
            self.finish()

    def _read_errors(self):
        for line in self.process.stderr:
            with self._said:
                self._errors.append(line.decode("utf-8", "backslashreplace"))
                self._said.notify_all()

    def wait_for_error(self, is_meant):
        """Returns once there is such a line; what is said before an answer is not read before it."""
        with self._said:
            if not self._said.wait_for(lambda: any(is_meant(line) for line in self._errors), timeout=PATIENCE):
                raise AssertionError("not said: " + "".join(self._errors))

    def send_bytes(self, data):
        self.process.stdin.write(data)
        self.process.stdin.flush()

    def why_it_ended(self):
        return "the process ended; it said: " + "".join(self._errors)

    def finish(self):
        """Ends the input, and answers the exit status."""
        try:
            self.process.stdin.close()
        except BrokenPipeError:
            pass
        status = self.process.wait(timeout=PATIENCE)
        for reader in self._readers:
            reader.join()
        self.process.stdout.close()
        self.process.stderr.close()
        return status

    def kill(self):
        self.process.kill()
        return self.finish()

    def error_text(self):
        return "".join(self._errors)


class SocketClient(Connection):
    """One connection to a daemon's socket. It reads all the time; `reads=False` makes it one that never does."""

    def __init__(self, path, reads=True):
        super().__init__()
        self.socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.socket.settimeout(PATIENCE)
        self.socket.connect(path)
        self._reader = None
        if reads:
            self._file = self.socket.makefile("rb")
            self._reader = threading.Thread(target=self._read_answers, args=(self._file,))
            self._reader.start()

    def __exit__(self, *_):
        self.close()

    def send_bytes(self, data):
        self.socket.sendall(data)

    def why_it_ended(self):
        return "the connection ended"

    def end_input(self):
        self.socket.shutdown(socket.SHUT_WR)

    def close(self):
        try:
            self.socket.shutdown(socket.SHUT_RDWR)
        except OSError:
            pass  # It is gone already.
        if self._reader is not None:
            self._reader.join()
            self._file.close()
        self.socket.close()


class Daemon:
    """A daemon of a state folder. Made, it serves; where it ends instead, `is_serving` is false."""

    def __init__(self, words, environment, launcher=(), stdout=subprocess.DEVNULL, **popen):
        self.process = subprocess.Popen(
            [*launcher, PROGRAM, "serve", *words], env=environment, stdin=subprocess.DEVNULL, stdout=stdout,
            stderr=subprocess.PIPE, **popen)
        self.said = queue.Queue()
        self._errors = []
        self._reader = threading.Thread(target=self._read_errors)
        self._reader.start()
        self.is_serving = self.waits_for(" serving ")

    def __exit__(self, *_):
        if self.process.poll() is None:
            self.process.kill()
        self.status()

    def _read_errors(self):
        for line in self.process.stderr:
            self._errors.append(line.decode("utf-8", "backslashreplace"))
            self.said.put(self._errors[-1])
        self.said.put(None)

    def waits_for(self, text):
        """Whether a line with the text comes, from what was not looked at before, ere the daemon ends."""
        while (line := self.said.get(timeout=PATIENCE)) is not None:
            if text in line:
                return True
        self.said.put(None)
        return False

    def error_text(self):
        return "".join(self._errors)

    def status(self):
        """The exit status, which is waited for."""
        status = self.process.wait(timeout=PATIENCE)
        self._reader.join()
        self.process.stderr.close()
        return status

    def stop(self, number=signal.SIGTERM):
        self.process.send_signal(number)
        return self.status()


class SystemTest(unittest.TestCase):
    """A storage "Documents" and a state folder of its own, and no trace of the account that runs the test."""

    def setUp(self):
        self.assertTrue(PROGRAM, "CINDRAL_PROGRAM names the program")
        self.folder = os.path.realpath(tempfile.mkdtemp(prefix="cindral-"))
        self.addCleanup(self._remove_folder)
        self.storage = os.path.join(self.folder, "Documents")
        self.state = os.path.join(self.folder, "state")
        os.mkdir(self.storage)
        self.environment = {
            name: value for name, value in os.environ.items() if not name.startswith("XDG_") and name != "CINDRAL_LOG"}
        self.environment["HOME"] = self.folder
        for variable, name in (("FLATPAK_USER_DIR", "user"), ("FLATPAK_SYSTEM_DIR", "system"), ("FLATPAK_CONFIG_DIR", "etc")):
            self.environment[variable] = os.path.join(self.folder, "flatpak", name)

    def _remove_folder(self):
        # What a test locked is opened again, so that also a person without privilege is rid of it.
        # By name in an open folder: some paths are longer than a call takes.
        for _, names, _, folder in os.fwalk(os.fsencode(self.folder)):
            for name in names:
                if stat.S_ISDIR(os.stat(name, dir_fd=folder, follow_symlinks=False).st_mode):
                    os.chmod(name, 0o700, dir_fd=folder)
        shutil.rmtree(os.fsencode(self.folder))

    def options(self, storage=None, state=None):
        return ["--storage", storage or self.storage, "--state", state or self.state]

    def client(self, storage=None, state=None, **popen):
        client = Client(self.options(storage, state), self.environment, **popen)
        self.addCleanup(client.__exit__)
        return client

    def daemon(self, *words, storage=None, state=None, environment=None, **popen):
        """A daemon that serves."""
        daemon = Daemon([*self.options(storage, state), *words], environment or self.environment, **popen)
        self.addCleanup(daemon.__exit__)
        self.assertTrue(daemon.is_serving, daemon.error_text())
        return daemon

    def connect(self, state=None, **how):
        """A client of the daemon's."""
        client = SocketClient(os.path.join(state or self.state, "socket"), **how)
        self.addCleanup(client.close)
        return client

    def run_program(self, *words, storage=None, state=None, **run):
        """A command's exit status, standard output and standard error, as bytes."""
        done = subprocess.run([PROGRAM, *words, *self.options(storage, state)], env=self.environment, timeout=PATIENCE,
                              stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, stderr=subprocess.PIPE, check=False, **run)
        return done.returncode, done.stdout, done.stderr

    def path(self, *names):
        return os.path.join(self.storage, *names)

    def make_file(self, *names, contents=b""):
        path = os.path.join(os.fsencode(self.storage), *(os.fsencode(name) for name in names))
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "wb") as file:
            file.write(contents)
        return os.fsdecode(path)

    def make_files(self, folder, count):
        path = self.path(folder)
        os.makedirs(path, exist_ok=True)
        for number in range(count):
            with open(os.path.join(path, f"{number:05}.txt"), "wb"):
                pass
        return path

    def assert_error(self, domain, code, call, *arguments, **params):
        """The call is refused with that error, which is answered for further looks."""
        with self.assertRaises(RpcError) as raised:
            call(*arguments, **params)
        self.assertEqual((raised.exception.code, raised.exception.domain, raised.exception.domain_code), (-32000, domain, code))
        return raised.exception

    def assert_refused(self, code, call, *arguments, **params):
        """The request itself is refused with one of JSON-RPC's own codes."""
        with self.assertRaises(RpcError) as raised:
            call(*arguments, **params)
        self.assertEqual(raised.exception.code, code)


def base64_text(data):
    return base64.b64encode(data).decode()


class OutsideTest(SystemTest):
    """With a folder `outside` of everything that is published."""

    def setUp(self):
        super().setUp()
        self.outside = tempfile.mkdtemp(prefix="cindral-outside-")
        self.addCleanup(shutil.rmtree, self.outside)

    def outside_file(self, name, contents=b"contents"):
        path = os.path.join(self.outside, name)
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "wb") as file:
            file.write(contents)
        return path

    def read(self, *names):
        with open(self.path(*names), "rb") as file:
            return file.read()


def all_of_terminal(controller):
    """What is written to a terminal until its other end is closed; closes this one."""
    text = b""
    try:
        while data := os.read(controller, 65536):
            text += data
    except OSError:
        pass  # The other end is closed.
    os.close(controller)
    return text
