"""What the Python clients of mxreportingd share: a msgpack-rpc client written from
the wire protocol alone, the daemon in a private root, and bounded checks."""

import os
import shutil
import socket
import subprocess
import tempfile
import time

import msgpack

BOUND = 20.0


class Client:
    def __init__(self, path):
        self.sock = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.sock.connect(path)
        self.sock.settimeout(BOUND)
        self.unpacker = msgpack.Unpacker(raw=False, timestamp=3)
        self.msgid = 0
        self.early = {}

    def send(self, method, *params):
        self.msgid += 1
        self.sock.sendall(msgpack.packb([0, self.msgid, method, list(params)], datetime=True))
        return self.msgid

    def reply(self, msgid):
        """The (error, result) of a request; replies to others are kept for later."""
        while msgid not in self.early:
            data = self.sock.recv(65536)
            if not data:
                raise ConnectionError("daemon closed the connection")
            self.unpacker.feed(data)
            for message in self.unpacker:
                assert message[0] == 1, message
                self.early[message[1]] = (message[2], message[3])
        return self.early.pop(msgid)

    def call(self, method, *params):
        error, result = self.reply(self.send(method, *params))
        assert error is None, (method, error)
        return result


class Checks:
    def __init__(self):
        self.passed = 0
        self.failed = 0

    def check(self, name, condition, detail=""):
        if condition:
            self.passed += 1
        else:
            self.failed += 1
            print(f"FAILED {name} {detail}")

    def equal(self, name, actual, expected):
        self.check(name, actual == expected, f"got {actual!r}, expected {expected!r}")

    def summary(self):
        print(f"{self.passed} passed, {self.failed} failed")
        return 1 if self.failed else 0


def wait_for(condition, bound=BOUND):
    deadline = time.time() + bound
    while time.time() < deadline:
        if condition():
            return True
        time.sleep(0.02)
    return False


class Daemon:
    """mxreportingd in a private root, its log in the root; `files` are written first."""

    def __init__(self, binary, files=None, env=None):
        self.root = tempfile.mkdtemp(prefix="mxreporting-python-")
        for relative, text in (files or {}).items():
            self.write(relative, text)
        # No system bus but the one a test brings.
        env = dict(os.environ, MXREPORTING_ROOT=self.root,
                   DBUS_SYSTEM_BUS_ADDRESS="unix:path=" + self.path("run/no-system-bus")) | (env or {})
        env.pop("JOURNAL_STREAM", None)
        self.log_file = open(self.path("daemon.log"), "w")
        self.command = ([binary], env)
        self.process = subprocess.Popen([binary], env=env, stderr=self.log_file, stdout=self.log_file)

    def restart(self):
        """Killed, and started anew on the same root."""
        self.process.kill()
        self.process.wait()
        arguments, env = self.command
        self.process = subprocess.Popen(arguments, env=env, stderr=self.log_file, stdout=self.log_file)

    def path(self, relative):
        return os.path.join(self.root, relative)

    def write(self, relative, text):
        os.makedirs(os.path.dirname(self.path(relative)), exist_ok=True)
        with open(self.path(relative), "w") as file:
            file.write(text)

    def log(self):
        with open(self.path("daemon.log")) as log:
            return log.read()

    def connect(self):
        socket_path = self.path("run/harmonia/reporting.sock")
        deadline = time.time() + BOUND
        while True:
            try:
                return Client(socket_path)
            except OSError:
                if time.time() > deadline:
                    raise
                time.sleep(0.01)

    def close(self, failed):
        if self.process.poll() is None:
            self.process.kill()
            self.process.wait()
        self.log_file.close()
        if failed:
            print(self.log()[-4000:])
        shutil.rmtree(self.root, ignore_errors=True)
