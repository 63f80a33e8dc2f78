#!/usr/bin/python3
"""An independent client of mxreportingd: drives every operation over the socket
with python3-msgpack and checks the replies the protocol promises. Written from
the wire protocol alone, so it catches what a shared client library would hide."""

import datetime
import os
import shutil
import socket
import subprocess
import sys
import tempfile
import time

import msgpack

DAEMON = sys.argv[1]
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


checks = {"passed": 0, "failed": 0}


def check(name, actual, expected):
    if actual == expected:
        checks["passed"] += 1
    else:
        checks["failed"] += 1
        print(f"FAILED {name}: got {actual!r}, expected {expected!r}")


def main():
    root = tempfile.mkdtemp(prefix="mxreporting-python-")
    env = dict(os.environ, MXREPORTING_ROOT=root)
    env.pop("JOURNAL_STREAM", None)
    log = open(os.path.join(root, "daemon.log"), "w")
    daemon = subprocess.Popen([DAEMON], env=env, stderr=log, stdout=log)
    path = os.path.join(root, "run/harmonia/reporting.sock")
    try:
        deadline = time.time() + BOUND
        while True:
            try:
                a = Client(path)
                break
            except OSError:
                if time.time() > deadline:
                    raise
                time.sleep(0.01)
        b = Client(path)

        check("create", a.call("createReportingSession:reply:", 5), True)
        check("create zero", a.call("createReportingSession:reply:", 0), True)
        check("set service type", a.call("setServiceType:reportingSession:reply:", 12, 5), True)
        check("set configuration", a.call("setConfiguration:forReporterID:reply:", {"HostApplicationDisplayID": "py"}, 5), True)
        check("service type across clients", b.call("getServiceNameForReporterID:reply:", 5), 12)
        check("service type unknown", b.call("getServiceNameForReporterID:reply:", 99), 65535)

        zero = a.send("getServiceNameForReporterID:reply:", 0)
        check("service type of reporter 0", a.reply(zero), (None, 65535))
        check("valid", a.call("reporterID:valid:", 5), {"reporterID": 5, "serviceType": 12})
        check("valid unknown", a.call("reporterID:valid:", 6), {"reporterID": 0, "serviceType": 65535})
        check("all reporters", sorted(b.call("getAllReporters:")), [0, 5])

        held = b.send("startReportingSessionForID:reply:", 5)
        stamp = datetime.datetime(2026, 11, 16, 4, 41, 21, tzinfo=datetime.timezone.utc)
        check("send to list", a.call("sendMessage:withCategory:andType:forReportingIDs:reply:",
                                     {"when": stamp, "raw": b"\x01\x02", "nested": {"a b": [1, 2.5]}}, 0x08000003, 1, [5]), None)
        check("send to empty list", a.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"x": 1}, 3, 1, []), None)
        check("send to every started session", a.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"x": 1}, 3, 1, None), None)
        check("stop of another client's session", b.call("stopReportingSessionForID:reply:", 5), True)
        check("stop", a.call("stopReportingSessionForID:reply:", 5), True)
        check("held start reply after stop", b.reply(held), (None, True))
        check("no second reply to reporter 0", zero in a.early, False)
        check("destroy", a.call("destroyReportingSession:reply:", 5), True)
        check("destroyed", a.call("reporterID:valid:", 5), {"reporterID": 0, "serviceType": 65535})

        error, _ = a.reply(a.send("startReportingSessionForID:reply:"))
        check("wrong argument count", error["code"], 2)
        error, _ = a.reply(a.send("frobnicate:"))
        check("unknown method", error["code"], 1)

        os.makedirs(os.path.join(root, "var/lib/harmonia/preferences"), exist_ok=True)
        with open(os.path.join(root, "var/lib/harmonia/preferences/com.kestrel.harmonia.json"), "w") as prefs:
            prefs.write('{"disable_reporting": true}')
        daemon.send_signal(1)  # SIGHUP posts the preferences notification
        refusal = {"domain": "com.kestrel.audio.reporting", "code": 1}
        deadline = time.time() + BOUND
        while a.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {}, 1, 0, None) != refusal:
            if time.time() > deadline:
                break
            time.sleep(0.01)
        check("refused while reporting is off", a.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {}, 1, 0, None), refusal)

        a.send("killService:")
        check("kill service exit status", daemon.wait(timeout=BOUND), 2)
    finally:
        if daemon.poll() is None:
            daemon.kill()
            daemon.wait()
        log.close()
        if checks["failed"]:
            print(open(os.path.join(root, "daemon.log")).read()[-4000:])
        shutil.rmtree(root, ignore_errors=True)
    print(f"{checks['passed']} passed, {checks['failed']} failed")
    return 1 if checks["failed"] else 0


if __name__ == "__main__":
    sys.exit(main())
