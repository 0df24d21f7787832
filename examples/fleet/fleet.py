#!/usr/bin/env python3
"""A fleet of simulated machines and one store, and the questions that an analyst asks of it.

    fleet.py PROGRAMS [--machines N]      as root; `run` beside it finds the programs and calls this

Each machine runs the real service and the real forwarder on two days. Services and forwarders are killed on the way,
and the store goes away for a while. Then each query of queries/ is asked, and each answer is held against the sum of
the machines' spools.
"""
import argparse
import collections
import concurrent.futures
import datetime
import glob
import math
import os
import shutil
import signal
import sys
import tempfile
import threading
import time

from machine import Machine
from store import Store, unpack

HERE = os.path.dirname(os.path.abspath(__file__))
OBJECT = "com.vantor.performance.tessel"
COUNTS = OBJECT + "_counts"
HEALTH = "tessel.health"
OPEN = "ts__com.vantor.Calendar__View__Open"
DAYS_AGO = (2, 0)  # the first day is so long ago that a machine without a second one is silent
AT_ONCE = 16  # machines that work at the same time; most of a run is waiting
SILENT = 29  # every so many machines, one has no second day


def query(store, name, table="events"):
    with open(os.path.join(HERE, "queries", name + ".sql"), encoding="utf-8") as file:
        return store.query(file.read().replace("FROM events ", f"FROM {table} "))


class Outage:
    """Kills the store while the machines deliver, and starts it again some seconds later."""

    def __init__(self, store):
        self.store, self.over, self.count = store, threading.Event(), 0
        self.thread = threading.Thread(target=self.work, daemon=True)
        self.thread.start()

    def work(self):
        while not self.over.wait(2):
            self.store.kill()
            self.count += 1
            self.over.wait(4)
            self.store.start()
            if self.count == 3:
                return

    def end(self):
        self.over.set()
        self.thread.join()


def a_day(machines, store, days_ago):
    """Every machine reports and delivers; the store goes away three times meanwhile."""
    outage = Outage(store)

    def work(machine):
        chance = machine.chance
        machine.report(days_ago, kill=chance.random() < 0.2)
        machine.deliver(store.insert_url(), days_ago, kills=chance.choice([0, 0, 1, 3]))

    with concurrent.futures.ThreadPoolExecutor(AT_ONCE) as pool:
        for done in [pool.submit(work, machine) for machine in machines]:
            done.result()
    outage.end()
    return outage.count


def timestamp_of(microseconds):
    return f"{datetime.datetime.fromtimestamp(microseconds // 10**6, datetime.timezone.utc):%Y-%m-%dT%H:%M:%S}.{microseconds % 10**6:06}Z"


class Books:
    """What the machines' spools say the answers must be."""

    def __init__(self, machines):
        self.rows = {machine.number: machine.rows() for machine in machines}
        self.versions = {machine.number: machine.version for machine in machines}

    def named(self, name):
        return [(number, payload) for number, rows in self.rows.items() for _, _, event, payload in rows if event == name]

    def contents(self):
        """Time and name of each row, by machine."""
        return {number: sorted((timestamp_of(time), name) for _, time, name, _ in rows) for number, rows in self.rows.items()}

    def reach(self):
        found = collections.defaultdict(list)
        for number, payload in self.named(OBJECT):
            found[payload["Subsystem"], payload["Category"], payload["Name"]].append(number)
        return sorted([*key, str(len(set(numbers))), str(len(numbers))] for key, numbers in found.items())

    def durations(self):
        found = collections.defaultdict(list)
        for number, payload in self.named(OPEN):
            if payload["DurationInSeconds"] > 0:
                found[self.versions[number]].append(payload["DurationInSeconds"])
        return [[version, len(each), *(sorted(each)[int(level * len(each))] for level in (0.5, 0.95))]
                for version, each in sorted(found.items())]

    def held_back(self):
        found = collections.defaultdict(list)
        for number, payload in self.named(COUNTS):
            if payload["Classification"] == "StringWhitelistFiltered":
                found[payload["Subsystem"], payload["Category"]].append((payload["Count"], number))
        sums = [[-sum(count for count, _ in each), *pair, len({number for _, number in each})] for pair, each in found.items()]
        return [[subsystem, category, str(-count), str(machines)] for count, subsystem, category, machines in sorted(sums)[:3]]

    def dropped(self):
        found = collections.Counter()
        for _, payload in self.named(COUNTS):
            if payload["Classification"].endswith("Filtered"):
                found[payload["Classification"]] += payload["Count"]
        last = {number: payload for number, payload in self.named(HEALTH)}
        for what, key in (("refused", "RowsRefused"), ("set aside", "RowsSetAside"), ("expired", "RowsExpired"),
                          ("rejected", "RowsRejected")):
            found["rows " + what] = sum(payload[key] for payload in last.values())
        return sorted([what, str(count)] for what, count in found.items())


class Checks:
    def __init__(self):
        self.failed = 0

    def check(self, what, told, expected, same=lambda told, expected: told == expected):
        good = same(told, expected)
        self.failed += not good
        print(f"{'ok  ' if good else 'FAIL'} {what}", flush=True)
        if not good:
            print(f"     the store says {str(told)[:500]}\n     the spools say  {str(expected)[:500]}")


def same_durations(told, expected):
    return len(told) == len(expected) and all(
        row[0] == right[0] and int(row[1]) == right[1] and
        all(math.isclose(float(one), other, rel_tol=1e-9) for one, other in zip(row[2:], right[2:]))
        for row, right in zip(told, expected))


def numbers_of_machines(store, books):
    """Whose rows the store holds under which identifier. The rows tell: no two machines sent the same at the same times."""
    held = collections.defaultdict(list)
    for machine, timestamp, name in store.query("SELECT `service.instance.id`, timestamp, `event.name` FROM events FINAL"):
        held[machine].append((timestamp, name))
    found = {}
    for number, contents in books.contents().items():
        found.update((machine, number) for machine, rows in held.items() if sorted(rows) == contents)
    return found


def check_answers(checks, store, books, silent):
    total = sum(len(rows) for rows in books.rows.values())
    numbers = numbers_of_machines(store, books)
    checks.check(f"every row is there once: {total:,} rows of {len(books.rows)} machines", sorted(numbers.values()), sorted(books.rows))
    checks.check("the sums of each machine", sorted((numbers.get(machine), *sums) for machine, *sums in query(store, "machines")),
                 [(number, *[str(len(rows))] * 2) for number, rows in sorted(books.rows.items())])
    checks.check("the reach of each trace point", sorted(query(store, "reach")), books.reach())
    checks.check("durations by version of the system", sorted(query(store, "durations")), books.durations(), same_durations)
    checks.check("pairs with most values held back", query(store, "held_back"), books.held_back())
    checks.check("what was dropped, and why", sorted(query(store, "dropped")), books.dropped())
    checks.check(f"machines silent since yesterday: {len(silent)}",
                 sorted(numbers.get(machine) for [machine] in query(store, "silent")), silent)
    checks.check("the health records and the store agree", query(store, "reconcile"), [])


def check_that_a_loss_is_named(checks, store):
    """Takes two rows away, stores one under a second identifier, and asks the reconciling query again."""
    names = "`log.record.uid`, `event.name`, `service.instance.id`, timestamp, Runs, RowsStored, RowsSetAside, RowsExpired, RowsWithdrawn"
    store.query("CREATE TABLE bent AS events")
    of_objects = f"FROM events FINAL WHERE `event.name` = '{OBJECT}'"
    lost = store.query(f"SELECT `service.instance.id`, `log.record.uid` {of_objects} ORDER BY `log.record.uid` LIMIT 2")
    [[twice, uid]] = store.query(f"SELECT `service.instance.id`, `log.record.uid` {of_objects} ORDER BY `log.record.uid` DESC LIMIT 1")
    gone = ", ".join(f"'{one[1]}'" for one in lost)
    store.query(f"INSERT INTO bent ({names}) SELECT {names} FROM events FINAL WHERE `log.record.uid` NOT IN ({gone})")
    store.query(f"INSERT INTO bent ({names}) SELECT concat(`log.record.uid`, 'x'), {names.split(', ', 1)[1]} FROM events FINAL "
                f"WHERE `log.record.uid` = '{uid}'")
    expected = collections.Counter(machine for machine, _ in lost)
    expected[twice] -= 1
    found = {machine: int(missing) - int(double) for machine, day, _, _, missing, double in query(store, "reconcile", "bent") if day == "all"}
    checks.check("two lost rows and a double one are named with their machines", found,
                 {machine: count for machine, count in expected.items() if count})


def simulate(directory, arguments):
    print("Unpacking the store", flush=True)
    unpacked = unpack(directory)
    store = Store(directory, unpacked)
    store.start()
    try:
        with open(os.path.join(HERE, "schema.sql"), encoding="utf-8") as file:
            store.query(file.read())
        programs = os.path.join(directory, "programs")
        os.mkdir(programs)
        for name in ("tessel_reporter", "statora_forwarder"):
            shutil.copy(os.path.join(arguments.programs, name), programs)
        [faketime] = glob.glob(os.path.join(unpacked, "usr/lib/*/faketime/libfaketimeMT.so.1"))
        machines = [Machine(directory, number, programs, faketime) for number in range(arguments.machines)]
        began, outages = time.monotonic(), 0
        for days_ago in DAYS_AGO:
            print(f"A day of {len(machines)} machines", flush=True)
            outages += a_day([machine for machine in machines if days_ago or machine.number % SILENT], store, days_ago)
        services, forwarders = (sum(getattr(machine, "killed_" + kind) for machine in machines) for kind in ("services", "forwarders"))
        print(f"Two days took {time.monotonic() - began:.0f} s; {services} services, {forwarders} forwarders and the store, "
              f"{outages} times, were killed", flush=True)
        checks = Checks()
        check_answers(checks, store, Books(machines), list(range(0, arguments.machines, SILENT)))
        check_that_a_loss_is_named(checks, store)
        return 1 if checks.failed else 0
    finally:
        store.kill()


def main():
    parser = argparse.ArgumentParser(description=__doc__.split("\n", maxsplit=1)[0])
    parser.add_argument("programs", help="the directory of tessel_reporter and statora_forwarder")
    parser.add_argument("--machines", type=int, default=200)
    arguments = parser.parse_args()
    # The directory is removed on Ctrl-C and SIGTERM, too.
    signal.signal(signal.SIGTERM, lambda *_: sys.exit(143))
    # In $TMPDIR, which `run` sets. It is not below /var/tmp: each machine has a directory of its own in its place.
    directory = tempfile.mkdtemp(prefix="tessel-fleet-")
    try:
        return simulate(directory, arguments)
    except RuntimeError as error:
        print(error, file=sys.stderr)
        return 1
    finally:
        shutil.rmtree(directory, ignore_errors=True)


if __name__ == "__main__":
    sys.dont_write_bytecode = True
    sys.exit(main())
