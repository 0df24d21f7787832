"""A collector on the loopback address: gives the answers of a script and keeps the requests."""
import gzip
import json
import socket
import ssl
import subprocess
import threading
import time
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer

import otlp_protobuf


class Answer:
    """The answer to one request. `kind` is whole, says where the connection breaks (cut in the body, or in the head), or is
    drip: a byte now and then, without an end."""

    def __init__(self, status=200, body=b"{}", headers=(), kind="whole", delay=0.0):
        self.status, self.body, self.headers, self.kind, self.delay = status, body, dict(headers), kind, delay


class Request:
    def __init__(self, path, headers, raw, arrived):
        self.path, self.headers, self.raw, self.arrived = path, headers, raw, arrived
        self.gzipped = headers.get("Content-Encoding") == "gzip"

    @property
    def body(self):
        return gzip.decompress(self.raw) if self.gzipped else self.raw

    @property
    def message(self):
        """The body as OTLP's JSON says it, in whichever encoding it came."""
        return (otlp_protobuf.read if self.headers["Content-Type"] == "application/x-protobuf" else json.loads)(self.body)

    @property
    def records(self):
        return [record for resource in self.message["resourceLogs"] for scope in resource["scopeLogs"]
                for record in scope["logRecords"]]


def attribute_of(record, name):
    [value] = [attribute["value"] for attribute in record["attributes"] if attribute["key"] == name]
    return next(iter(value.values()))


def uid_of(record):
    return attribute_of(record, "log.record.uid")


def number_of(record):
    """The number that ForwarderTest.add() gave the row, from 0."""
    return int(attribute_of(record, "Number1Value"))


class Receiver:
    """`script(request, number)` gives the Answer to each request; number counts from 0. Who connects must show the
    certificate `client`, if there is one."""

    def __init__(self, script=lambda request, number: Answer(), certificate=None, key=None, client=None):
        self.script, self.requests, self.accepted = script, [], []
        self._lock = threading.Lock()
        receiver = self

        class Handler(BaseHTTPRequestHandler):
            protocol_version = "HTTP/1.1"
            disable_nagle_algorithm = True

            def do_POST(self):
                length = int(self.headers["Content-Length"])
                raw = self.rfile.read(length)
                if len(raw) < length:
                    return  # the sender is gone
                receiver._answer(self, Request(self.path, self.headers, raw, time.monotonic()))

            def log_message(self, *_):
                pass

        class Server(ThreadingHTTPServer):
            daemon_threads = True

            def handle_error(self, *_):
                pass  # a peer that was killed

        self._server = Server(("127.0.0.1", 0), Handler)
        if certificate:
            context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
            context.load_cert_chain(certificate, key)
            if client:
                context.verify_mode = ssl.CERT_REQUIRED
                context.load_verify_locations(client)
            self._server.socket = context.wrap_socket(self._server.socket, server_side=True)
        self.port = self._server.server_address[1]
        self.url = f"{'https' if certificate else 'http'}://127.0.0.1:{self.port}"
        threading.Thread(target=self._server.serve_forever, kwargs={"poll_interval": 0.05}, daemon=True).start()

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self._server.shutdown()
        self._server.server_close()

    def _answer(self, handler, request):
        with self._lock:
            number = len(self.requests)
            self.requests.append(request)
        answer = self.script(request, number)
        if answer.delay:
            time.sleep(answer.delay)
        if answer.status // 100 == 2 and answer.kind == "whole":
            with self._lock:
                self.accepted.append(request)
        handler.send_response(answer.status)
        for name, value in answer.headers.items():
            handler.send_header(name, value)
        handler.send_header("Content-Length", str(len(answer.body) + {"cut": 100, "drip": 2**20}.get(answer.kind, 0)))
        if answer.kind == "head":
            handler.flush_headers()
        else:
            handler.end_headers()
            handler.wfile.write(answer.body)
        while answer.kind == "drip":  # until the sender has gone
            handler.wfile.write(b" ")
            time.sleep(0.02)
        if answer.kind != "whole":
            handler.wfile.flush()
            handler.connection.shutdown(socket.SHUT_RDWR)
            handler.close_connection = True

    def accepted_records(self):
        return [record for request in list(self.accepted) for record in request.records]

    def accepted_uids(self):
        return [uid_of(record) for record in self.accepted_records()]


def make_certificate(directory, name):
    """A self-signed certificate for 127.0.0.1; answers the paths of certificate and key."""
    certificate, key = f"{directory}/{name}.crt", f"{directory}/{name}.key"
    subprocess.run(["openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes",
                    "-days", "2", "-subj", f"/CN={name}", "-addext", "subjectAltName=IP:127.0.0.1",
                    "-keyout", key, "-out", certificate], check=True, capture_output=True)
    return certificate, key
