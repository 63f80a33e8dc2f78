#!/usr/bin/python3
"""An independent client of mxreportingd: drives every operation over the socket
with python3-msgpack and checks the replies the protocol promises. Written from
the wire protocol alone, so it catches what a shared client library would hide."""

import datetime
import re
import sys

from harness import BOUND, Checks, Daemon, wait_for

DAEMON = sys.argv[1]


def main():
    daemon = Daemon(DAEMON)
    checks = Checks()
    check = checks.equal
    try:
        a = daemon.connect()
        b = daemon.connect()

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
        bad_arguments = [("createReportingSession:reply:", ["5"]), ("createReportingSession:reply:", [2**64 - 1]),
                         ("setServiceType:reportingSession:reply:", [65536, 1]),
                         ("setConfiguration:forReporterID:reply:", [[], 1]),
                         ("sendMessage:withCategory:andType:forReportingIDs:reply:", [{}, -1, 0, None]),
                         ("sendMessage:withCategory:andType:forReportingIDs:reply:", [{}, 1, 0, 5])]
        for method, params in bad_arguments:
            error, result = a.reply(a.send(method, *params))
            check(f"refused arguments {params!r}", (error or {}).get("code"), 2)

        status = b.call("status")
        check("status counts", (status["sessions_started"], status["reports_received"]), (1, 3))
        check("status clients", sorted(client["sessions"] for client in status["clients"]), [0, 1])
        check("status stores", sorted(status["stores"]), ["joule", "tally", "uplink"])
        check("status store counters", sorted(status["stores"]["tally"]),
              ["bytes", "failures", "pending_rows_in_memory", "queue_depth", "rows_written"])
        error, _ = a.reply(a.send("status", 1))
        check("status takes no arguments", error["code"], 2)

        daemon.write("var/lib/harmonia/preferences/com.kestrel.harmonia.json", '{"disable_reporting": true}')
        daemon.process.send_signal(1)  # SIGHUP posts the preferences notification
        refusal = {"domain": "com.kestrel.audio.reporting", "code": 1}
        send_anything = lambda: a.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {}, 1, 0, None)
        checks.check("refused while reporting is off", wait_for(lambda: send_anything() == refusal))

        line = re.compile(r"^\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{3}[+-]\d\d:\d\d (DEBUG|INFO|NOTICE|ERROR) \S+:\d+:\S+: ")
        unstamped = [text for text in daemon.log().splitlines() if not line.match(text)]
        check("every log line leads with its time and level", unstamped, [])

        a.send("killService:")
        check("kill service exit status", daemon.process.wait(timeout=BOUND), 2)
    finally:
        daemon.close(checks.failed)
    return checks.summary()


if __name__ == "__main__":
    sys.exit(main())
