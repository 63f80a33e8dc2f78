"""An OpenTelemetry collector's logs endpoint on loopback, over HTTP or HTTPS, that
keeps every record and every request's headers."""

import gzip
import http.server
import json
import threading


class Receiver:
    """A collector's logs endpoint that keeps every record it is sent; over HTTPS when
    given an ssl.SSLContext."""

    def __init__(self, port=0, tls=None):
        self.records = []
        self.headers = []  # each request's, as a dict
        self.gzipped = 0
        self.refusals = 0  # answer this many requests with 503 and Retry-After: 1
        self.lock = threading.Lock()
        receiver = self

        class Handler(http.server.BaseHTTPRequestHandler):
            def do_POST(self):
                body = self.rfile.read(int(self.headers["Content-Length"]))
                with receiver.lock:
                    receiver.headers.append(dict(self.headers))
                if self.headers.get("Content-Encoding") == "gzip":
                    body = gzip.decompress(body)
                    with receiver.lock:
                        receiver.gzipped += 1
                request = json.loads(body)
                with receiver.lock:
                    if receiver.refusals > 0:
                        receiver.refusals -= 1
                        self.send_response(503)
                        self.send_header("Retry-After", "1")
                        self.send_header("Content-Length", "0")
                        self.end_headers()
                        return
                    for resource in request["resourceLogs"]:
                        for scope in resource["scopeLogs"]:
                            receiver.records.extend(scope["logRecords"])
                self.send_response(200)
                self.send_header("Content-Type", "application/json")
                self.end_headers()
                self.wfile.write(b"{}")

            def log_message(self, *args):
                pass

        class Server(http.server.ThreadingHTTPServer):
            def handle_error(self, request, address):
                pass  # a client that fails the TLS handshake is what some tests want

        self.server = Server(("127.0.0.1", port), Handler)
        if tls:
            self.server.socket = tls.wrap_socket(self.server.socket, server_side=True)
        self.port = self.server.server_address[1]
        threading.Thread(target=self.server.serve_forever, daemon=True).start()

    def stop(self):
        self.server.shutdown()
        self.server.server_close()

    def bodies(self):
        with self.lock:
            return [record["body"] for record in self.records]
