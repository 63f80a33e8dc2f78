"""The Python module mxreporting against the real daemon: sessions as context
managers, names for service types, categories and types, refusals while reporting is
off, a daemon that cannot be reached, a restart the client carries on across, and
what reaches the stores; and against peers that answer garbage or never the question.

    python_module.py MXREPORTINGD MXREPORT [MODULE_DIRECTORY]"""

import os
import socket
import sqlite3
import subprocess
import sys
import threading
import time

sys.path.insert(0, sys.argv[3] if len(sys.argv) > 3 else os.path.join(os.path.dirname(__file__), "../../python"))
import mxreporting  # noqa: E402  (the module under test, from where the test says)
from harness import Checks, Daemon, wait_for  # noqa: E402


def tally(daemon, where):
    with sqlite3.connect(daemon.path("var/lib/harmonia/tally.db")) as store:
        return [row[0] for row in store.execute("SELECT payload FROM events WHERE " + where + " ORDER BY id")]


def main():
    binary, mxreport = sys.argv[1], sys.argv[2]
    checks = Checks()
    daemon = Daemon(binary)
    try:
        daemon.connect().sock.close()  # up
        os.environ["MXREPORTING_ROOT"] = daemon.root
        with mxreporting.Client() as client:
            with client.session(42, service_type="longformaudio",
                                configuration={"HostApplicationDisplayID": "py"}) as session:
                session.send({"sample rate": 48000, "levels": [1, 2.5], "when": None},
                             category="Session_Playback", type="Start")
                checks.equal("typed by name", client.service_type(42), 7)
                checks.check("valid", client.is_valid(42))
                checks.equal("own reporters", client.reporters(), [42])
                checks.equal("started", client.status()["sessions_started"], 1)
            checks.check("destroyed on exit", not client.is_valid(42))
            client.send({"alone": True}, category=3, type=2)
            try:
                client.send({"a": 1}, category="No_Such", type=1)
                checks.check("unknown category refused", False)
            except ValueError:
                checks.check("unknown category refused", True)

            daemon.write("var/lib/harmonia/preferences/com.kestrel.harmonia.json", '{"disable_reporting": true}')
            subprocess.run([mxreport, "notify"], check=True, capture_output=True)

            def refused():
                try:
                    client.send({"a": 1}, category=3, type=1)
                    return False
                except mxreporting.ReportingDisabled:
                    return True
            checks.check("refused while reporting is off", wait_for(refused))
            checks.check("a refusal is an Error", issubclass(mxreporting.ReportingDisabled, mxreporting.Error))
            client.create_session(9)  # sessions are still made

        checks.check("stored with the host", wait_for(lambda: tally(
            daemon, "name = 'com.kestrel.harmonia.Session_Playback.Start'") ==
            ['{"sample rate":48000,"levels":[1,2.5],"when":null,"HostApplicationDisplayID":"py"}']))

        with mxreporting.Client() as client:
            try:
                with client.session(43, service_type="no such type"):
                    pass
            except ValueError:
                pass
            checks.check("a session that cannot be set up is not left behind", not client.is_valid(43))

            with client.session(44, service_type=7, configuration={"HostApplicationDisplayID": "again"}) as session:
                daemon.restart()
                daemon.connect().sock.close()
                session.send({"after": 1}, category=3, type=1)  # reconnects and restores first
                checks.equal("restored as it was", client.service_type(44), 7)
                checks.equal("restored started", client.status()["sessions_started"], 1)
            checks.check("the restored session's configuration applies", wait_for(lambda: tally(
                daemon, "payload LIKE '%\"after\"%'") == ['{"after":1,"HostApplicationDisplayID":"again"}']))

            try:
                with client.session(45):
                    daemon.process.kill()
                    daemon.process.wait()
                    raise KeyError("the body's own")
            except KeyError:
                checks.check("the body's exception is the one raised", True)
            except mxreporting.Error as error:
                checks.check("the body's exception is the one raised", False, repr(error))

        peers(daemon, checks)

        try:
            mxreporting.Client(daemon.path("run/harmonia/nobody.sock"))
            checks.check("nobody there", False)
        except mxreporting.NotConnected as error:
            checks.check("nobody there", "nobody.sock" in str(error), str(error))
    finally:
        daemon.close(checks.failed > 0)
    return checks.summary()


def peers(daemon, checks):
    """Peers that are not the daemon: one answers garbage, one answers every question
    but the one asked, and one sends more than any reply could be."""
    def serve(path, answer):
        listener = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        listener.bind(path)
        listener.listen()

        def run():
            connection, _ = listener.accept()
            connection.recv(65536)
            try:
                answer(connection)
            except OSError:
                pass
            connection.close()
            listener.close()
        threading.Thread(target=run, daemon=True).start()

    def unrelated(connection):
        for msgid in range(100000, 100400):
            connection.sendall(bytes([0x94, 0x01, 0xce]) + msgid.to_bytes(4, "big") + bytes([0xc0, 0xc0]))
            time.sleep(0.01)

    def huge(connection):
        connection.sendall(bytes([0x94, 0x01, 0x01, 0xc0, 0xdb]) + (100 << 20).to_bytes(4, "big"))
        for _ in range(200):
            connection.sendall(b"x" * (1 << 20))

    for name, answer, expected in [("garbage", lambda c: c.sendall(b"\xc1\xc1"), "malformed"),
                                   ("unrelated", unrelated, "in time"),
                                   ("huge", huge, "malformed")]:
        path = daemon.path(f"run/{name}.sock")
        serve(path, answer)
        began = time.monotonic()
        try:
            mxreporting.Client(path, timeout=1).status()
            checks.check(f"{name}: refused", False)
        except mxreporting.Error as error:
            checks.check(f"{name}: an mxreporting.Error", expected in str(error), str(error))
        except Exception as error:  # noqa: BLE001  (any other kind is the failure)
            checks.check(f"{name}: an mxreporting.Error", False, repr(error))
        checks.check(f"{name}: within the call's timeout", time.monotonic() - began < 2.5)


if __name__ == "__main__":
    sys.exit(main())
