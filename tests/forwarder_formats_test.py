#!/usr/bin/env python3
"""What leaves in each format: the fields of a record, its identifier, the resource, and what --dry-run shows."""
import json
import os
import shutil
import socket
import subprocess
import tempfile
import unittest

import otlp_protobuf
from forwarder_case import FORWARDER, ForwarderTest
from otlp_receiver import Receiver, uid_of

JSON = {"OTEL_EXPORTER_OTLP_PROTOCOL": "http/json"}
NDJSON = {"TESSEL_FORWARD_FORMAT": "ndjson"}
NAME = "ts__com.vantor.Calendar__View__Open"
AT = 1_795_000_000_000_000
FACTS = {"service.name": "tessel_reporter", "os.type": "linux"}


class FormatsTest(ForwarderTest):
    def send(self, **more):
        """The requests of one delivery."""
        with Receiver() as receiver:
            self.assertEqual(self.run_forwarder(receiver, **more).returncode, 0, self.errors)
        return receiver.requests

    def dry_run(self, how="--dry-run=raw", namespace=(), **more):
        result = subprocess.run([*namespace, FORWARDER, how], env=self.environment(None, **more), capture_output=True,
                                timeout=120, check=True)
        return result.stdout

    def records(self, **more):
        """The records that a delivery would send now."""
        message = otlp_protobuf.read(self.dry_run(**more))
        return [record for one in message["resourceLogs"] for scope in one["scopeLogs"] for record in scope["logRecords"]]

    def resource(self, **more):
        message = otlp_protobuf.read(self.dry_run(**more))
        return {one["key"]: one["value"]["stringValue"] for one in message["resourceLogs"][0]["resource"]["attributes"]}


class Fields(FormatsTest):
    def setUp(self):
        super().setUp()
        self.add(payload='{"Name":"a\\"ü","Z":true,"A":-9223372036854775808,"B":18446744073709551615,"F":0.1,"G":5.0,'
                         '"DurationInSeconds":2,"N":null,"":""}', name=NAME, at=AT)

    def test_otlp_keeps_kinds_and_order_in_both_encodings(self):
        [record] = self.records()
        self.assertEqual(record, {
            "timeUnixNano": str(AT * 1000), "observedTimeUnixNano": str(AT * 1000), "eventName": NAME,
            "attributes": [{"key": "log.record.uid", "value": {"stringValue": uid_of(record)}},
                           {"key": "event.name", "value": {"stringValue": NAME}},
                           {"key": "Name", "value": {"stringValue": 'a"ü'}},
                           {"key": "Z", "value": {"boolValue": True}},
                           {"key": "A", "value": {"intValue": "-9223372036854775808"}},
                           {"key": "B", "value": {"stringValue": "18446744073709551615"}},
                           {"key": "F", "value": {"doubleValue": 0.1}},
                           {"key": "G", "value": {"doubleValue": 5.0}},
                           {"key": "DurationInSeconds", "value": {"doubleValue": 2.0}},
                           {"key": "N", "value": {}},
                           {"key": "", "value": {"stringValue": ""}}]})
        self.add(600)
        as_json = [json.loads(line) for line in self.dry_run(**JSON).splitlines()]
        binary = self.dry_run()
        self.assertEqual(otlp_protobuf.read(binary)["resourceLogs"], [one["resourceLogs"][0] for one in as_json])
        self.assertIn(b'"value":{"doubleValue":0.1}},{"key":"G","value":{"doubleValue":5.0}}', self.dry_run(**JSON))
        self.assertNotIn(socket.gethostname().encode(), binary)
        sent = self.send(OTEL_EXPORTER_OTLP_COMPRESSION="none")
        self.assertEqual(b"".join(request.body for request in sent), binary, "--dry-run=raw shows the very bytes")
        self.assertEqual([(request.path, request.headers["Content-Type"]) for request in sent],
                         [("/v1/logs", "application/x-protobuf")] * 2)

    def test_ndjson_is_one_flat_object_a_line(self):
        self.add(2, at=AT)
        lines = self.dry_run(**NDJSON).decode().splitlines()
        first = json.loads(lines[0])
        self.assertEqual(list(first)[:5], ["timestamp", "log.record.uid", "event.name", "service.name", "service.version"])
        self.assertEqual((first["timestamp"], first["event.name"]), ("2026-11-18T11:06:40.000000Z", NAME))
        self.assertTrue(lines[0].endswith('"Name":"a\\"ü","Z":true,"A":-9223372036854775808,"B":18446744073709551615,'
                                          '"F":0.1,"G":5.0,"DurationInSeconds":2.0,"":""}'), lines[0])
        # No line has a key twice, whatever the operator calls an attribute of the resource.
        odd = {"OTEL_RESOURCE_ATTRIBUTES": "Name=x,timestamp=y,team=z"}
        pairs = json.loads(self.dry_run(**NDJSON, **odd).splitlines()[0], object_pairs_hook=list)
        self.assertEqual(len(dict(pairs)), len(pairs), pairs)
        self.assertEqual([dict(pairs)[key] for key in ("Name", "payload.Name", "team")], ["x", 'a"ü', "z"])
        with Receiver() as receiver:
            result = self.run_forwarder(receiver.url + "/?query=INSERT%20INTO%20t%20FORMAT%20JSONEachRow", **NDJSON)
            self.assertEqual(result.returncode, 0, self.errors)
        [request] = receiver.requests
        self.assertEqual((request.path, request.headers["Content-Type"], request.body.decode().splitlines()),
                         ("/?query=INSERT%20INTO%20t%20FORMAT%20JSONEachRow", "application/x-ndjson", lines))

    def test_the_text_for_people_is_fit_for_a_terminal(self):
        self.add(payload='{"Title":"\\u001b]0;x\\u0007","a b":1}', name="bad\x1b[2J")
        shown = self.dry_run("--dry-run").decode()
        self.assertEqual(shown, self.dry_run("--dry-run=text", **JSON).decode())
        self.assertNotIn("\x1b", shown)
        [uid, _] = [uid_of(record) for record in self.records()]
        self.assertIn(f'  record 2026-11-18T11:06:40.000000Z\n    log.record.uid: "{uid}"\n    event.name: "{NAME}"\n'
                      '    Name: "a\\"ü"\n    Z: true\n', shown)
        self.assertIn('    Title: "\\u001b]0;x\\u0007"\n    "a b": 1\n', shown)
        self.assertIn('  resource\n    service.name: "tessel_reporter"\n', shown)
        self.assertEqual(self.waiting(), 2)

    def test_times_and_texts_that_no_receiver_takes(self):
        self.query("DELETE FROM events")
        for at in (-5, 0, 9_223_372_036_854_775_807):
            self.add(at=at, name=b"caf\xe9".decode("latin-1"))
        self.query("UPDATE events SET name = CAST(x'636166e9' AS TEXT)")
        records = self.records()
        self.assertEqual([int(record["timeUnixNano"]) for record in records], [0, 0, 9_223_372_036_854_775_000])
        self.assertEqual({record["eventName"] for record in records}, {"caf\ufffd"})
        stamps = [json.loads(line)["timestamp"] for line in self.dry_run(**NDJSON).splitlines()]
        self.assertEqual(stamps, ["1970-01-01T00:00:00.000000Z"] * 2 + ["9999-12-31T23:59:59.000000Z"])


class Identifiers(FormatsTest):
    def uids(self, **more):
        return [uid_of(record) for record in self.records(**more)]

    def test_an_identifier_stands_for_one_content(self):
        self.add(501, at=AT)
        self.query("PRAGMA wal_checkpoint(TRUNCATE)")
        backup = os.path.join(self.state, "backup")
        shutil.copy(self.path, backup)
        first = self.uids()
        self.assertEqual(first, self.uids(), "the same on each repeat")
        self.assertEqual(first, [uid_of(record) for request in self.send(**JSON) for record in request.records])
        self.assertEqual(len(set(first)), 501)
        self.assertTrue(all(len(uid) == 32 and set(uid) <= set("0123456789abcdef") for uid in first))
        # No place of the identifier has the same digit in all records.
        self.assertTrue(all(len(set(digits)) > 8 for digits in zip(*first)))
        # The spool comes back from a backup and gets other rows under the numbers of the old ones.
        for name in ("", "-wal", "-shm"):
            if os.path.exists(self.path + name):
                os.remove(self.path + name)
        shutil.copy(backup, self.path)
        self.assertEqual(self.uids(), first, "the rows of the backup are the rows that were sent")
        self.query("DELETE FROM events")
        self.query("UPDATE sqlite_sequence SET seq = 0")
        self.add(501, payload='{"Name":"Close","Number1Value":%d}', at=AT)
        self.assertEqual(len(set(first) | set(self.uids())), 1002)
        # Each of row, time and name counts, and the spool as well.
        for change in ("UPDATE events SET id = id + 1000", "UPDATE events SET time = time + 1",
                       "UPDATE events SET name = name || 'x'", "UPDATE meta SET value = 'other' WHERE key = 'spool_id'"):
            before = set(self.uids())
            self.query(change)
            self.assertEqual(len(before | set(self.uids())), 1002, change)

    def test_cloned_machines_have_ids_of_their_own(self):
        self.add(5)
        told = {}
        for machine in ("0" * 31 + "1", "0" * 31 + "2", ""):
            with tempfile.NamedTemporaryFile("w", dir=self.state) as file:
                file.write(machine + "\n")
                file.flush()
                bind = f'mount -n --bind {file.name} /etc/machine-id && exec "$@"'
                unshare = ["unshare", "--mount"] if os.geteuid() == 0 else ["unshare", "--user", "--map-root-user", "--mount"]
                told[machine] = self.uids(namespace=[*unshare, "--", "sh", "-c", bind, "sh"])
        self.assertEqual(len({uid for uids in told.values() for uid in uids}), 15)


class Resource(FormatsTest):
    def test_added_attributes_leave_the_host_unnamed(self):
        self.add()
        given = {"OTEL_RESOURCE_ATTRIBUTES": "deployment.environment=a%2Cb, Host.Name=web17,host.arch=mips,host.type=x1,"
                                             "service.instance.id=i-1,k8s.pod.uid=p,os.name=,service.name=site"}
        plain, named = self.resource(**given), self.resource(**given, TESSEL_FORWARD_INSTANCE_ID="1")
        self.assertEqual(plain.items() & FACTS.items(), {("os.type", "linux")})
        self.assertEqual([plain.get(key) for key in ("deployment.environment", "host.arch", "host.type", "os.name", "service.name")],
                         ["a,b", "mips", "x1", None, "site"])
        self.assertEqual({key: named[key] for key in named.keys() - plain.keys()},
                         {"Host.Name": "web17", "service.instance.id": "i-1", "k8s.pod.uid": "p"})
        own = self.resource(TESSEL_FORWARD_INSTANCE_ID="1")["service.instance.id"]
        self.assertRegex(own, "^[0-9a-f]{8}(-[0-9a-f]{4}){3}-[0-9a-f]{12}$")
        with open("/etc/machine-id", encoding="ascii") as file:
            self.assertNotIn(file.read().strip(), own.replace("-", ""))

    def test_only_a_health_record_names_the_machine(self):
        self.add(2)
        self.add(name="tessel.health")
        given = {"OTEL_RESOURCE_ATTRIBUTES": "host.name=web17,site=north"}
        for protocol, read in (("http/protobuf", otlp_protobuf.read), ("http/json", json.loads)):
            rows, health = read(self.dry_run(OTEL_EXPORTER_OTLP_PROTOCOL=protocol, **given))["resourceLogs"]
            told = [{one["key"] for one in part["resource"]["attributes"]} for part in (rows, health)]
            self.assertEqual(told[1] - told[0], {"host.name", "service.instance.id"})
            self.assertEqual([len(part["scopeLogs"][0]["logRecords"]) for part in (rows, health)], [2, 1])
        lines = [json.loads(line) for line in self.dry_run(**NDJSON, **given).splitlines()]
        self.assertEqual([line.get("host.name") for line in lines], [None, None, "web17"])
        self.assertEqual(self.dry_run("--dry-run", **given).decode().count("web17"), 1)

    def test_a_list_that_cannot_be_read_is_refused(self):
        for text in ("team", "team=%zz", "team=%ff", "=x"):
            result = self.run_forwarder("http://127.0.0.1:9", "--once", OTEL_RESOURCE_ATTRIBUTES=text)
            self.assertEqual(result.returncode, 78, text)
            self.assertIn("OTEL_RESOURCE_ATTRIBUTES", result.stderr)


if __name__ == "__main__":
    unittest.main()
