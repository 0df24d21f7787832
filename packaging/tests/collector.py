#!/usr/bin/env python3
"""collector.py FILE: takes OTLP/HTTP logs on port 4318; a line in FILE for each request says how many
records it held."""
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


http.server.HTTPServer(("127.0.0.1", 4318), Collector).serve_forever()
