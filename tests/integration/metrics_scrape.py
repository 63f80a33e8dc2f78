#!/usr/bin/python3
"""mxreportingd's metrics file as Prometheus sees it: well formed (and clean to
promtool, where installed), read by Debian's node exporter running as a user of its
own (where installed), fresh, and gone once the daemon stops cleanly."""

import os
import re
import shutil
import signal
import socket
import subprocess
import sys
import time
import urllib.request

from harness import Checks, Daemon, wait_for

DAEMON = sys.argv[1]
METRICS = "var/lib/harmonia/metrics/mxreportingd.prom"


def parse_prometheus(text):
    """Series to value; raises on any line that is not a comment or a sample."""
    sample = re.compile(r'^([a-zA-Z_:][a-zA-Z0-9_:]*(\{[a-zA-Z_][a-zA-Z0-9_]*="(?:[^"\\\n]|\\.)*"'
                        r'(,[a-zA-Z_][a-zA-Z0-9_]*="(?:[^"\\\n]|\\.)*")*\})?) (\S+)$')
    series = {}
    for line in text.splitlines():
        if line.startswith("# HELP ") or line.startswith("# TYPE "):
            continue
        match = sample.match(line)
        assert match, f"not Prometheus text: {line!r}"
        series[match.group(1)] = float(match.group(4))
    return series


def free_port():
    with socket.socket() as probe:
        probe.bind(("127.0.0.1", 0))
        return probe.getsockname()[1]


def node_exporter(directory):
    """Debian's node exporter reading `directory`, as nobody when we may switch; its
    scrape function, or None when it is not installed."""
    binary = shutil.which("prometheus-node-exporter")
    if not binary:
        return None, None
    port = free_port()
    command = [binary, f"--web.listen-address=127.0.0.1:{port}", "--collector.disable-defaults",
               "--collector.textfile", f"--collector.textfile.directory={directory}"]
    if os.geteuid() == 0:
        command = ["setpriv", "--reuid=nobody", "--regid=nogroup", "--clear-groups", *command]
    process = subprocess.Popen(command, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)

    def scrape():
        try:
            with urllib.request.urlopen(f"http://127.0.0.1:{port}/metrics", timeout=5) as response:
                return response.read().decode()
        except OSError:
            return ""
    return process, scrape


def main():
    daemon = Daemon(DAEMON)
    # The node exporter's user passes through the private root as it would /var/lib.
    os.chmod(daemon.root, 0o755)
    checks = Checks()
    check = checks.check
    exporter, scrape = None, None
    try:
        client = daemon.connect()
        client.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"a": 1}, 1, 0, None)
        path = daemon.path(METRICS)
        series = lambda: parse_prometheus(open(path).read()) if os.path.exists(path) else {}
        check("the file counts the report", wait_for(lambda: series().get("mxreportingd_reports_received_total") == 1))
        written = series().get("mxreportingd_last_update_timestamp_seconds", 0)
        check("and says when it was written", abs(written - time.time()) < 30, written)
        check("rewritten every few seconds",
              wait_for(lambda: series().get("mxreportingd_last_update_timestamp_seconds", 0) > written))

        if shutil.which("promtool"):
            linted = subprocess.run(["promtool", "check", "metrics"], stdin=open(path), capture_output=True, text=True)
            check("promtool finds nothing to say", linted.returncode == 0 and not linted.stdout.strip(),
                  linted.stdout + linted.stderr)
        exporter, scrape = node_exporter(os.path.dirname(path))
        if scrape:
            check("the node exporter, as its own user, reads the file",
                  wait_for(lambda: "mxreportingd_reports_received_total 1" in scrape()), scrape()[-2000:])
            check("without a scrape error", "node_textfile_scrape_error 0" in scrape())

        daemon.process.send_signal(signal.SIGTERM)
        checks.equal("a clean stop", daemon.process.wait(timeout=60), 0)
        check("removes the file", not os.path.exists(path))
        if scrape:
            check("and the node exporter stops showing the daemon's series",
                  wait_for(lambda: "mxreportingd_" not in scrape() and "node_textfile_scrape_error 0" in scrape()))
    finally:
        if exporter:
            exporter.kill()
            exporter.wait()
        daemon.close(checks.failed)
    return checks.summary()


if __name__ == "__main__":
    sys.exit(main())
