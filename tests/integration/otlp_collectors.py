#!/usr/bin/python3
"""mxreportingd reaching collectors the way production ones are reached: over HTTPS
with a CA of their own and a client certificate, with a token in a header, without
compression. A collector whose CA is not trusted gets nothing, what it did not get
stays in the spool and reaches it once uplink.json trusts its CA; the token never
reaches the log or the status view."""

import json
import os
import ssl
import subprocess
import sys
import tempfile

from collector import Receiver
from harness import Checks, Daemon, wait_for

DAEMON = sys.argv[1]
TOKEN = "Bearer s3cret-collector-token"


def openssl(*arguments):
    subprocess.run(["openssl", *arguments], check=True, capture_output=True)


def make_ca(directory, name):
    """A CA and a certificate it signed for 127.0.0.1: the paths of the CA, the
    certificate and its key."""
    ca, ca_key = f"{directory}/{name}-ca.pem", f"{directory}/{name}-ca.key"
    key, request, certificate = (f"{directory}/{name}.{suffix}" for suffix in ("key", "csr", "pem"))
    curve = ["-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:prime256v1", "-nodes"]
    openssl("req", "-x509", *curve, "-keyout", ca_key, "-out", ca, "-days", "2", "-subj", f"/CN={name} CA")
    openssl("req", *curve, "-keyout", key, "-out", request, "-subj", "/CN=127.0.0.1")
    extensions = f"{directory}/{name}.ext"
    with open(extensions, "w") as file:
        file.write("subjectAltName=IP:127.0.0.1\n")
    openssl("x509", "-req", "-in", request, "-CA", ca, "-CAkey", ca_key, "-CAcreateserial", "-out", certificate,
            "-days", "2", "-extfile", extensions)
    return ca, certificate, key


def tls_server(certificate, key, client_ca=None):
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
    context.load_cert_chain(certificate, key)
    if client_ca:
        context.verify_mode = ssl.CERT_REQUIRED
        context.load_verify_locations(client_ca)
    return context


def main():
    directory = tempfile.mkdtemp(prefix="mxreporting-tls-")
    trusted_ca, trusted_cert, trusted_key = make_ca(directory, "trusted")
    other_ca, other_cert, other_key = make_ca(directory, "other")
    # The daemon's client certificate, from the trusted CA.
    _, client_cert, client_key = make_ca(directory, "client")
    secure = Receiver(tls=tls_server(trusted_cert, trusted_key, client_ca=f"{directory}/client-ca.pem"))
    untrusted = Receiver(tls=tls_server(other_cert, other_key))
    secure_url = f"https://127.0.0.1:{secure.port}/v1/logs"
    untrusted_url = f"https://127.0.0.1:{untrusted.port}/v1/logs"

    def uplink(untrusted_ca):
        return json.dumps({"backends": [
            {"type": "otlp-http", "url": secure_url, "headers": {"Authorization": TOKEN},
             "tls": {"ca_file": trusted_ca, "cert_file": client_cert, "key_file": client_key},
             "timeout_seconds": 5, "compression": "none"},
            {"type": "otlp-http", "url": untrusted_url, "tls": {"ca_file": untrusted_ca}}]})

    daemon = Daemon(DAEMON, {"etc/harmonia/uplink.json": uplink(trusted_ca)})
    checks = Checks()
    check = checks.check
    try:
        client = daemon.connect()
        client.call("sendMessage:withCategory:andType:forReportingIDs:reply:", {"first": True}, 1, 0, None)
        check("the collector behind TLS gets the message",
              wait_for(lambda: any("first" in json.dumps(b) for b in secure.bodies())), secure.bodies())
        headers = secure.headers[0]
        check("with the configured header", headers.get("Authorization") == TOKEN, headers)
        check("uncompressed", "Content-Encoding" not in headers and secure.gzipped == 0, headers)

        check("the untrusted collector's failure is logged, naming what to set",
              wait_for(lambda: "tls.ca_file" in daemon.log()), daemon.log()[-2000:])
        exporters = lambda: client.call("status")["exporters"]
        check("what it did not get waits in the spool",
              wait_for(lambda: exporters()[untrusted_url]["unacknowledged"] >= 1), exporters())
        check("and it got nothing", untrusted.records == [] and untrusted.headers == [])

        daemon.write("etc/harmonia/uplink.json", uplink(other_ca))
        daemon.process.send_signal(1)  # SIGHUP
        check("once its CA is trusted, the spool reaches it",
              wait_for(lambda: any("first" in json.dumps(b) for b in untrusted.bodies()), 60), untrusted.bodies())
        check("the token is in no log line", TOKEN not in daemon.log() and "s3cret" not in daemon.log())
        check("nor in the status view", "s3cret" not in json.dumps(client.call("status"), default=str))
    finally:
        daemon.close(checks.failed)
        secure.stop()
        untrusted.stop()
    return checks.summary()


if __name__ == "__main__":
    sys.exit(main())
