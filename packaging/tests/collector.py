#!/usr/bin/env python3
"""collector.py FILE: takes OTLP/HTTP logs on a free port, which FILE.port names; a line in FILE for each request
says how many records it held.

The container has the network of the machine, so another collector may have the usual port."""
import gzip
import http.server
import sys

import otlp_protobuf


class Collector(http.server.BaseHTTPRequestHandler):
    def do_POST(self):
        body = self.rfile.read(int(self.headers["Content-Length"]))
        if self.headers.get("Content-Encoding") == "gzip":
            body = gzip.decompress(body)
        count = sum(len(scope["logRecords"]) for resource in otlp_protobuf.read(body)["resourceLogs"]
                    for scope in resource["scopeLogs"])
        with open(sys.argv[1], "a", encoding="utf-8") as file:
            print(count, file=file)
        self.send_response(200)
        self.send_header("Content-Length", "0")
        self.end_headers()


server = http.server.HTTPServer(("127.0.0.1", 0), Collector)
with open(sys.argv[1] + ".port", "w", encoding="utf-8") as port:
    print(server.server_port, file=port)
server.serve_forever()
