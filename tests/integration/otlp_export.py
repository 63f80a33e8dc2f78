#!/usr/bin/python3
"""mxreportingd exporting to an OpenTelemetry collector: an OTLP/JSON receiver on
loopback gets valid log batches for a flushed batch session and a standalone
message; with the receiver down a flush reports the error, the daemon goes on, and
what it could not send reaches the receiver once it is back."""

import json
import os
import sys
import time

from collector import Receiver
from harness import Checks, Daemon, wait_for

DAEMON = sys.argv[1]


def attributes(record):
    return {a["key"]: a["value"] for a in record["attributes"]}


def session(client, reporter, reports):
    client.call("createReportingSession:reply:", reporter)
    client.call("setServiceType:reportingSession:reply:", 7, reporter)
    client.send("startReportingSessionForID:reply:", reporter)
    for index in range(reports):
        client.call("sendMessage:withCategory:andType:forReportingIDs:reply:",
                    {"reporter": reporter, "index": index, "peak level": -3.5}, 0x08000003, 1, [reporter])
    client.call("stopReportingSessionForID:reply:", reporter)


def main():
    receiver = Receiver()
    backends = {"backends": [{"type": "spool"},
                             {"type": "otlp-http", "url": f"http://127.0.0.1:{receiver.port}/v1/logs"}]}
    daemon = Daemon(DAEMON, {"etc/harmonia/uplink.json": json.dumps(backends)})
    checks = Checks()
    check = checks.check
    try:
        client = daemon.connect()

        session(client, 1, 3)
        check("batch session exported after its flush",
              wait_for(lambda: sum(1 for b in receiver.bodies() if "kvlistValue" in b) >= 4), receiver.bodies())
        records = list(receiver.records)
        first = records[0]
        values = {v["key"]: v["value"] for v in first["body"]["kvlistValue"]["values"]}
        check("body holds the cleaned payload", values.get("peak_level") == {"doubleValue": -3.5}, values)
        check("time in nanoseconds", first["timeUnixNano"].isdigit() and len(first["timeUnixNano"]) >= 19)
        attrs = attributes(first)
        check("category cut to 16 bits", attrs["harmonia.category"] == {"intValue": "3"}, attrs)
        check("session information travels", attrs["harmonia.session.SessionID"] == {"intValue": "1"}, attrs)
        check("service name travels", attrs["harmonia.user.ServiceName"] == {"stringValue": "longformaudio_session"})
        check("summary event last", attributes(records[3])["harmonia.type"] == {"intValue": "65535"})
        check("bodies are gzipped", receiver.gzipped > 0)

        client.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"alone": True}, 1, 0, None)
        check("standalone message exported at once",
              wait_for(lambda: any("alone" in json.dumps(b) for b in receiver.bodies())))

        # A realtime session's message reaches the collector at once: well within 300 ms
        # of its reply, long before the spool's own window would commit it.
        client.call("createReportingSession:reply:", 5)
        client.call("setServiceType:reportingSession:reply:", 12, 5)
        client.send("startReportingSessionForID:reply:", 5)
        latencies = []
        for index in range(5):
            client.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"live": index}, 3, 1, [5])
            answered = time.monotonic()
            wait_for(lambda: any(f'"live", "value": {{"intValue": "{index}"}}' in json.dumps(b)
                                 for b in receiver.bodies()), 5)
            latencies.append(time.monotonic() - answered)
        check("realtime messages reach the collector within 300 ms of their replies", max(latencies) < 0.3, latencies)
        client.call("destroyReportingSession:reply:", 5)

        receiver.stop()
        session(client, 2, 2)
        check("flush reports the error",
              wait_for(lambda: "flush error" in daemon.log()))
        check("daemon goes on", client.call("reporterID:valid:", 2) == {"reporterID": 2, "serviceType": 7})

        receiver = Receiver(receiver.port)
        check("spooled messages reach the collector once it is back",
              wait_for(lambda: sum(1 for b in receiver.bodies() if "reporter" in json.dumps(b)) >= 2, 90))

        with receiver.lock:
            receiver.refusals = 1
        client.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"patient": True}, 1, 0, None)
        check("a busy collector's Retry-After is honoured",
              wait_for(lambda: "(retry after 1 s)" in daemon.log()))
        check("and the message arrives after it",
              wait_for(lambda: any("patient" in json.dumps(b) for b in receiver.bodies()), 30))

        for suffix in ["", "-wal", "-shm"]:
            os.remove(daemon.path("var/lib/harmonia/uplink.db" + suffix))
        client.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"after": True}, 1, 0, None)
        check("a spool made anew is exported from",
              wait_for(lambda: any("after" in json.dumps(b) for b in receiver.bodies()), 30))
    finally:
        daemon.close(checks.failed)
    return checks.summary()


if __name__ == "__main__":
    sys.exit(main())
