#!/usr/bin/env python3
"""What the forwarder sends, held against the official schema as npm ships it compiled.

Needs npm and node, and a registry that can be reached; where one is missing the test says so and is
skipped. The package is kept beside the build, so that it is fetched once.
"""
import os
import shutil
import subprocess
import sys
import unittest

import harness
from forwarder_test import ForwarderTest

PACKAGE = "@opentelemetry/otlp-transformer@0.208.0"
MODULES = os.path.join(harness.BIN, "..", "otlp-schema")

# Bodies come one a line. Each must come back from its binary form as it was sent; what the schema
# does not know, or knows of another kind, does not.
CHECK = r"""
const assert = require("assert");
const root = require("@opentelemetry/otlp-transformer/build/src/generated/root");
const Request = root.opentelemetry.proto.collector.logs.v1.ExportLogsServiceRequest;
let records = 0;
for (const line of require("fs").readFileSync(0, "utf8").split("\n").filter(Boolean)) {
  const sent = JSON.parse(line);
  const message = Request.fromObject(sent);
  assert.strictEqual(Request.verify(message), null);
  const back = Request.toObject(Request.decode(Request.encode(message).finish()), {longs: String});
  assert.deepStrictEqual(back, sent);
  records += sent.resourceLogs[0].scopeLogs[0].logRecords.length;
}
console.log(records);
"""


def install():
    """None, or why the schema is not to be had."""
    if not (shutil.which("npm") and shutil.which("node")):
        return "npm and node are needed"
    if not os.path.isdir(os.path.join(MODULES, "node_modules", "@opentelemetry", "otlp-transformer")):
        os.makedirs(MODULES, exist_ok=True)
        command = ["npm", "install", "--prefix", MODULES, "--ignore-scripts", "--no-audit", "--no-fund", "--silent", PACKAGE]
        try:
            result = subprocess.run(command, capture_output=True, text=True, timeout=120, check=False)
        except subprocess.TimeoutExpired:
            return "the npm registry does not answer"
        if result.returncode != 0:
            return "npm cannot install the schema: " + result.stderr.strip()[:200]
    return None


class Schema(ForwarderTest):
    def check(self, bodies):
        return subprocess.run(["node", "-e", CHECK], input=bodies, capture_output=True, text=True, timeout=120,
                              cwd=MODULES, check=False)

    def test_every_body_comes_back_as_it_was_sent(self):
        self.add(600)
        self.add(payload='{"Text":"a\\"\\u0001ü\U0001f600","Yes":true,"No":false,"Least":-9223372036854775808,'
                         '"Most":9223372036854775807,"Above":18446744073709551615,"Single":0.1,"Small":5e-324,'
                         '"Large":1.7976931348623157e+308,"DurationInSeconds":0,"Nothing":null,"":""}')
        self.add(payload="{}", name="")
        bodies = self.run_forwarder(None, "--dry-run", TESSEL_FORWARD_INSTANCE_ID="1").stdout
        result = self.check(bodies)
        self.assertEqual(result.returncode, 0, result.stderr[-2000:])
        self.assertEqual(result.stdout.strip(), "602")

    def test_the_check_would_notice(self):
        self.add(payload='{"Number":1}')
        body = self.run_forwarder(None, "--dry-run").stdout
        for right, wrong in (('"eventName"', '"event_name_"'), ('"intValue":"1"', '"integerValue":"1"'),
                             ('"timeUnixNano"', '"time"')):
            self.assertIn(right, body)
            self.assertNotEqual(self.check(body.replace(right, wrong)).returncode, 0, wrong)


if __name__ == "__main__":
    reason = install()
    if reason:
        print("skipped:", reason)
        sys.exit(harness.SKIPPED)
    unittest.main()
