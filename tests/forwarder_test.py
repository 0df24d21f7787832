#!/usr/bin/env python3
"""The forwarder against collectors that accept, refuse, stall, answer nonsense or break the connection."""
import email.utils
import json
import os
import shutil
import signal
import socket
import sqlite3
import subprocess
import time
import unittest

import harness
from faults.fault_machine import FaultMachine
from forwarder_case import FORWARDER, ForwarderTest, make_spool
from otlp_receiver import Answer, Receiver, make_certificate, number_of, uid_of


class Delivery(ForwarderTest):
    def test_batches_hold_512_records_or_one_mebibyte(self):
        self.add(1100)
        with Receiver() as receiver:
            self.assertEqual(self.run_forwarder(receiver).returncode, 0, self.errors)
        self.assertEqual([len(request.records) for request in receiver.requests], [512, 512, 76])
        self.assert_all_arrived_once(receiver, 1100)
        self.add(5, payload=json.dumps({"Text": "x" * 400_000}))
        self.add(1, payload=json.dumps({"Text": "x" * 2_000_000}))
        with Receiver() as receiver:
            self.assertEqual(self.run_forwarder(receiver).returncode, 0, self.errors)
        self.assertEqual([len(request.records) for request in receiver.requests], [2, 2, 1, 1])

    def test_headers_secrets_and_compression(self):
        self.add(100)
        secrets = os.path.join(self.state, "credentials")
        os.mkdir(secrets)
        with open(os.path.join(secrets, "otlp-headers"), "w") as file:
            file.write("authorization=Bearer%20secret\n")
        with Receiver() as receiver:
            result = self.run_forwarder(None, OTEL_EXPORTER_OTLP_LOGS_ENDPOINT=receiver.url + "/own/path",
                                        OTEL_EXPORTER_OTLP_HEADERS="x-site=north,x-both=a%2Cb",
                                        OTEL_EXPORTER_OTLP_COMPRESSION="gzip", CREDENTIALS_DIRECTORY=secrets)
        self.assertEqual(result.returncode, 0, self.errors)
        request = receiver.requests[0]
        self.assertEqual(request.path, "/own/path")
        self.assertEqual([request.headers[name] for name in ("authorization", "x-site", "x-both")],
                         ["Bearer secret", "north", "a,b"])
        self.assertTrue(request.gzipped)
        self.assertLess(len(request.raw) * 5, len(request.body))
        self.assert_all_arrived_once(receiver, 100)

    def test_nothing_to_deliver_is_no_error(self):
        with Receiver() as receiver:
            self.assertEqual(self.run_forwarder(receiver).returncode, 0)
            os.remove(self.path)
            self.assertEqual(self.run_forwarder(receiver).returncode, 0)
        self.assertEqual(receiver.requests, [])
        self.assertFalse(os.path.exists(self.path), "the forwarder makes no spool")

class Trouble(ForwarderTest):
    def check_retried(self, first, least_wait, **more):
        """The collector answers `first`, then accepts: the forwarder must send the same record again after a pause."""
        self.add(3)
        with Receiver(lambda request, number: first() if number == 0 else Answer()) as receiver:
            self.assertEqual(self.run_forwarder(receiver, **more).returncode, 0, self.errors)
        self.assertEqual(len(receiver.requests), 2)
        self.assertEqual(receiver.requests[0].body, receiver.requests[1].body)
        self.assertGreater(receiver.requests[1].arrived - receiver.requests[0].arrived, least_wait)
        self.assertEqual(self.waiting(), 0)
        self.assertEqual(self.counters()["retries"], 1)
        self.assertEqual(self.counters()["delivered"], 3)

    def test_the_wait_that_the_collector_asks_for(self):
        self.check_retried(lambda: Answer(429, headers={"Retry-After": "2"}), 1.9)
        self.setUp()
        # The date has whole seconds, so it may be up to one second less than three away.
        date = email.utils.formatdate(time.time() + 3, usegmt=True)
        self.check_retried(lambda: Answer(429, headers={"Retry-After": date}), 1.9)

    def test_a_connection_that_breaks_in_the_middle(self):
        self.check_retried(lambda: Answer(200, kind="cut"), 0.4)

    def test_a_collector_that_is_too_slow(self):
        self.check_retried(lambda: Answer(200, delay=3), 0.9, OTEL_EXPORTER_OTLP_TIMEOUT="500")

    def test_only_an_answer_of_the_protocol_is_a_success(self):
        self.add(3)
        for answer in (Answer(200, b"x" * 30_000_000), Answer(202, b"<html>"), Answer(200, b'{"error":"sign in"}'),
                       Answer(200, b"{}", headers={"Content-Type": "Text/HTML; charset=utf-8"}), Answer(200, b"{}", kind="head")):
            with Receiver(lambda request, number: answer if number == 0 else Answer(403)) as receiver:
                self.assertEqual(self.run_forwarder(receiver).returncode, 69, self.errors)
            self.assertEqual(self.waiting(), 3)
        for answer in (Answer(201, b""), Answer(200, b'{"partialSuccess":{}}')):
            self.add(3)
            with Receiver(lambda request, number: answer) as receiver:
                self.assertEqual(self.run_forwarder(receiver).returncode, 0, self.errors)
            self.assertEqual(len(receiver.requests), 1)
            self.assertEqual(self.waiting(), 0)

    def test_a_partial_success_is_never_sent_again(self):
        self.add(5)
        body = b'{"partialSuccess":{"rejectedLogRecords":"2","errorMessage":"too old\\n"}}'
        with Receiver(lambda request, number: Answer(200, body)) as receiver:
            self.assertEqual(self.run_forwarder(receiver).returncode, 0)
        self.assertEqual(len(receiver.requests), 1)
        self.assertEqual(self.counters()["rejected"], 2)
        self.assertEqual(self.errors, "statora_forwarder: error: The collector rejected 2 records: too old\n")
        self.assert_all_arrived_once(receiver, 5)

    def test_a_spool_that_cannot_be_written(self):
        self.add(1)
        with Receiver() as receiver:
            self.run_forwarder(receiver)  # makes the forwarder's tables, so its next write is the proof
        self.add(5)
        with Receiver() as receiver:
            full = self.run_forwarder(receiver, **FaultMachine.faults(CALL="pwrite64", PATH="-wal", AT=1, ERRNO=28))
            self.assertEqual((full.returncode, receiver.requests), (66, []), "nothing leaves that cannot be acknowledged")
        other = sqlite3.connect(self.path, isolation_level=None, check_same_thread=False)
        self.addCleanup(other.close)
        body = b'{"partialSuccess":{"rejectedLogRecords":"18446744073709551615","errorMessage":"too old"}}'

        def lock(*_):
            other.execute("BEGIN IMMEDIATE")
            return Answer(200, body)

        with Receiver(lock) as receiver:
            process = subprocess.Popen([FORWARDER, "--once"], env=self.environment(receiver), stderr=subprocess.PIPE, text=True)
            self.assertIn("rejected 5 records", process.stderr.readline())
            self.assertIn("The spool cannot be used: database is locked", process.stderr.readline())
            other.execute("COMMIT")
            process.communicate(timeout=60)
            self.assertEqual((process.returncode, len(receiver.requests)), (0, 1), "what was taken is not sent again")
        self.assertEqual((self.counters()["delivered"], self.counters()["rejected"], self.waiting()), (6, 5, 0))

    def test_a_newer_spool_is_used_if_it_says_so(self):
        self.add(1)
        self.query("PRAGMA user_version=2")
        with Receiver() as receiver:
            for oldest, status in ((None, 66), ("2", 66), ("1", 0)):
                if oldest:
                    self.query(f"INSERT OR REPLACE INTO meta VALUES('compatible_from', '{oldest}')")
                self.assertEqual(self.run_forwarder(receiver).returncode, status, self.errors)
                self.assertEqual("made by another version (schema 2)" in self.errors, status == 66, self.errors)
        self.assert_all_arrived_once(receiver, 1)

    def test_a_bad_record_is_set_aside_with_the_answer(self):
        self.add(1000)

        def refuse(request, _):
            bad = any(number_of(record) == 344 for record in request.records)
            return Answer(400, b"attribute Name is bad") if bad else Answer()

        with Receiver(refuse) as receiver:
            self.assertEqual(self.run_forwarder(receiver).returncode, 0, self.errors)
        numbers = [number_of(record) for record in receiver.accepted_records()]
        self.assertEqual(numbers, [number for number in range(1000) if number != 344])
        self.assertLess(len(receiver.requests), 25)
        self.assertEqual(self.query("SELECT id, payload, status, words FROM forwarder_set_aside"),
                         [(345, '{"Name":"Open","Number1Value":344}', 400, "400: attribute Name is bad")])
        self.assertEqual(self.counters()["set_aside"], 1)
        with Receiver() as receiver:
            self.run_forwarder(None, "--requeue")
            self.assertEqual(self.run_forwarder(receiver).returncode, 0, self.errors)
        self.assertEqual([number_of(record) for record in receiver.accepted_records()], [344])
        self.assertEqual(self.query("SELECT count(*) FROM forwarder_set_aside"), [(0,)])

    def test_a_row_that_is_no_event_holds_up_no_other(self):
        self.add(1)
        for payload in ("", "[1]", '{"a":{"b":1}}', '{"a":'):
            self.add(1, payload=payload)
        self.add(1)
        with Receiver() as receiver:
            self.assertEqual(self.run_forwarder(receiver).returncode, 0, self.errors)
        self.assertEqual(len(receiver.accepted_uids()), 2)
        self.assertEqual(self.query("SELECT id FROM forwarder_set_aside ORDER BY id"), [(2,), (3,), (4,), (5,)])

    def test_a_refused_sender_sets_nothing_aside(self):
        self.add(600)
        with Receiver() as elsewhere:
            for answer in (Answer(401), Answer(404), Answer(307, headers={"Location": elsewhere.url + "/v1/logs"})):
                with Receiver(lambda request, number: answer) as receiver:
                    self.assertEqual(self.run_forwarder(receiver).returncode, 69)
                self.assertEqual(len(receiver.requests), 1)
                self.assertIn(str(answer.status), self.errors)
            self.assertEqual(elsewhere.requests, [], "redirects are not followed")
        self.assertEqual(self.waiting(), 600)

    def test_certificates_are_verified(self):
        self.add(3)
        right = make_certificate(self.state, "right")
        wrong = make_certificate(self.state, "wrong")
        with Receiver(certificate=right[0], key=right[1]) as receiver:
            process = subprocess.Popen([FORWARDER], env=self.environment(receiver, OTEL_EXPORTER_OTLP_CERTIFICATE=wrong[0]),
                                       stderr=subprocess.PIPE, text=True)
            self.assertIn("certificate", process.stderr.readline())
            process.terminate()
            process.communicate(timeout=60)
            self.assertEqual(receiver.requests, [])
            self.assertEqual(self.waiting(), 3)
            result = self.run_forwarder(receiver, OTEL_EXPORTER_OTLP_CERTIFICATE=right[0])
            self.assertEqual(result.returncode, 0, self.errors)
        self.assert_all_arrived_once(receiver, 3)


class PowerCut(ForwarderTest):
    def test_no_id_is_sent_before_the_disk_has_its_row(self):
        durable, cut = os.path.join(self.state, "durable"), os.path.join(self.state, "cut")
        for folder in (durable, cut):
            os.mkdir(folder)
        shutil.copy(self.path, cut)
        survived = []

        def look(request, _):
            """What the spool would hold if the power failed now."""
            for name in os.listdir(durable):
                shutil.copy(os.path.join(durable, name), cut)
            with sqlite3.connect(os.path.join(cut, "statora.db")) as database:
                survived.append(database.execute("SELECT max(id), (SELECT seq FROM sqlite_sequence) FROM events")
                                .fetchone())
            return Answer()

        writer = sqlite3.connect(self.path, isolation_level=None)
        self.addCleanup(writer.close)  # open to the end: a writer that closes would move the log into the file
        writer.execute("PRAGMA synchronous=OFF")
        for _ in range(3):
            writer.execute("INSERT INTO events(time, name, payload) VALUES(1, 'a', '{}')")
        with Receiver(look) as receiver:
            self.run_forwarder(receiver, **FaultMachine.faults(DURABLE=durable))
        self.assertEqual(survived, [(3, 3)], self.errors)
        writer.execute("INSERT INTO events(time, name, payload) VALUES(1, 'a', '{}')")
        with Receiver() as receiver:
            result = self.run_forwarder(receiver, **FaultMachine.faults(CALL="fdatasync", PATH="-wal", AT=1, ERRNO=5))
        self.assertEqual((result.returncode, receiver.requests), (66, []))
        self.assertIn("the write-ahead log cannot be flushed: Input/output error", self.errors)


class Process(ForwarderTest):
    def test_senseless_settings_are_one_line_and_status_78(self):
        result = self.run_forwarder("http://127.0.0.1:9", TESSEL_FORWARD_RATE="-1")
        self.assertEqual(result.returncode, 78)
        self.assertEqual(len(result.stderr.splitlines()), 1)
        self.assertIn("TESSEL_FORWARD_RATE", result.stderr)

    def test_it_notifies_the_manager_and_ends_when_asked(self):
        self.add(3)
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as manager, Receiver() as receiver:
            manager.bind(os.path.join(self.state, "notify"))
            manager.settimeout(60)
            process = subprocess.Popen([FORWARDER],
                                       env=self.environment(receiver, NOTIFY_SOCKET=os.path.join(self.state, "notify")))
            told = ""
            while "STATUS=Delivered what there was" not in told:
                told += manager.recv(4096).decode() + "\n"
            self.assertIn("READY=1", told)
            self.assertIn("STATUS=Delivered 3, waiting 0, set aside 0", told)
            self.add(2)  # later events are found on their own
            while len(receiver.accepted_uids()) < 5:
                told += manager.recv(4096).decode()
            process.send_signal(signal.SIGTERM)
            self.assertEqual(process.wait(60), 0)
        self.assertRegex(told, r"STATUS=Waiting for its turn in the fleet, until \d\d:\d\d:\d\d\n")
        self.assertEqual(self.waiting(), 0)

    def test_a_spool_that_was_replaced_is_noticed(self):
        self.add(1)
        with Receiver() as receiver:
            process = subprocess.Popen([FORWARDER], env=self.environment(receiver))
            harness.wait_for(lambda: len(receiver.requests) == 1 and not self.waiting())
            for suffix in ("-wal", "", "-shm"):
                if os.path.exists(self.path + suffix):
                    os.rename(self.path + suffix, self.path + ".damaged-x" + suffix)
            make_spool(self.state)
            self.add(2)
            harness.wait_for(lambda: len(receiver.requests) == 2 and not self.waiting())
            process.terminate()
            self.assertEqual(process.wait(60), 0)


if __name__ == "__main__":
    unittest.main()
