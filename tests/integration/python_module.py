"""The Python module mxreporting against the real daemon: sessions as context
managers, names for service types, categories and types, refusals while reporting is
off, a daemon that cannot be reached, and what reaches the stores.

    python_module.py MXREPORTINGD MXREPORT [MODULE_DIRECTORY]"""

import os
import sqlite3
import subprocess
import sys

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

        try:
            mxreporting.Client(daemon.path("run/harmonia/nobody.sock"))
            checks.check("nobody there", False)
        except mxreporting.NotConnected as error:
            checks.check("nobody there", "nobody.sock" in str(error), str(error))
    finally:
        daemon.close(checks.failed > 0)
    return checks.summary()


if __name__ == "__main__":
    sys.exit(main())
