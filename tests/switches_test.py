#!/usr/bin/env python3
"""Tasking and deferral: what `tesselctl` switches, what it says of it, and what the service finds."""
import errno
import json
import os
import time

import harness
from faults.fault_machine import FaultMachine
from harness import TASKING, Machine, MachineTest, point, some_points, wait_for

DEEP = "[" * 40 + "]" * 40
ODD = '"x": 1e400, "y": [1, -1e999], "z": %s, "w": 2.50' % DEEP


class Switches(MachineTest):
    def tasking_file(self):
        return os.path.join(self.machine.config, TASKING)

    def content(self):
        with open(self.tasking_file(), encoding="utf-8") as file:
            return file.read()

    def shown(self):
        return json.loads(self.machine.ctl("tasking", "show", "--json").out)

    def test_tasking_is_what_the_service_will_find(self):
        self.machine.write_export([point("event", "com.vantor.A", "x", "One")])
        for argument, rows in (("off", 0), ("on", 6)):
            self.assertEqual(self.machine.ctl("tasking", argument).status, 0)
            self.assertEqual((self.shown()["tasked"], self.shown()["source"]), (argument == "on", "configuration"))
            self.assert_clean(self.machine.run())
            self.assertEqual(len(self.machine.rows()), rows)
        self.assertEqual(os.stat(self.tasking_file()).st_mode & 0o777, 0o644)
        self.assertEqual(os.listdir(self.machine.config), [TASKING])

    def test_it_shows_where_the_answer_comes_from(self):
        for text, tasked, source in (('{"TaskedOn": 1}', True, "configuration"), ('{"TaskedOn": 0.0}', False, "configuration"),
                                     ('{"TaskedOn": "yes"}', False, "unusable"), ("{", False, "unusable"),
                                     ("[]", False, "unusable"), ("{}", False, "unusable")):
            self.machine.task(text)
            self.assertEqual((self.shown()["tasked"], self.shown()["source"]), (tasked, source), text)
        os.unlink(self.tasking_file())
        self.assertEqual((self.shown()["tasked"], self.shown()["source"]), (False, "absent"))
        self.machine.set_internal(True)
        self.assertEqual((self.shown()["tasked"], self.shown()["source"]), (True, "internal_build"))

    def test_a_share_of_the_machines_is_switched_on(self):
        path = os.path.join(self.machine.config, "rollout.json")
        switched = {}
        for machine in range(6):
            self.machine.machine_id = f"{machine + 1:032x}"
            # The cohort is that of the step before.
            steps = (["--share", "0%", "--cohort", "spring"], ["--share", "40%"], ["--share", "100.0%"])
            switched[machine] = [json.loads(self.machine.ctl("tasking", "on", *step, "--json").out) for step in steps]
        answers = [[step["tasked"] for step in steps] for steps in switched.values()]
        self.assertEqual({(first, last) for first, _, last in answers}, {(False, True)})
        self.assertEqual({middle for _, middle, _ in answers}, {False, True}, "some of six machines are in at 40 %")
        for steps in switched.values():
            self.assertTrue(all(step["tasked"] == step["in_share"] and step["cohort"] == "spring" for step in steps), steps)
        self.assertEqual(self.content(), '{"TaskedOn": true}')
        with open(path, encoding="utf-8") as file:
            self.assertEqual((json.load(file), os.stat(path).st_mode & 0o777), ({"share": "100%", "cohort": "spring"}, 0o644))
        self.assertRegex(self.machine.ctl("tasking", "show").out, "100 % of the cohort spring, and this machine is at [0-9.]+ %\n")
        self.assertEqual(json.loads(self.machine.ctl("status", "--json").out)["tasking"]["share"], 100)
        self.machine.task('{"TaskedOn": false}')
        self.assertIn("it does not follow", self.machine.ctl("tasking", "show").out)
        self.machine.ctl("tasking", "off")
        self.assertFalse(os.path.exists(path))
        self.assertNotIn("cohort", self.shown())

    def test_a_share_that_cannot_be_drawn_changes_nothing(self):
        def refused(status, *arguments):
            result = self.machine.ctl("tasking", "on", *arguments)
            self.assertEqual((result.status, os.listdir(self.machine.config)), (status, [TASKING]), arguments)
            self.assertEqual(self.content(), '{"TaskedOn": false}')
            return result.errors
        self.machine.task('{"TaskedOn": false}')
        for arguments in (["--share", "5"], ["--share", "101%"], ["--share", "-1%"], ["--share", "5%", "--cohort", "a b"],
                          ["--cohort", "spring"], ["--share"]):
            self.assertTrue(refused(2, *arguments))
        self.machine.machine_id = ""
        self.assertIn("/etc/machine-id", refused(1, "--share", "100%"))
        self.machine.task("[]")
        self.assertEqual((self.machine.ctl("tasking", "on", "--share", "5%").status, os.listdir(self.machine.config)), (1, [TASKING]))

    def test_other_keys_of_the_configuration_stay(self):
        self.machine.task('{"TaskedOn": false, %s}' % ODD)
        self.assertEqual(self.machine.ctl("tasking", "on").status, 0)
        self.assertEqual(self.content(), '{"TaskedOn": true, %s}' % ODD)

    def test_what_it_cannot_parse_is_not_replaced(self):
        for text in ('{"Other": 1, "TaskedOn": fal', "[]", "x" * (1 << 20) + "x"):
            self.machine.task(text)
            result = self.machine.ctl("tasking", "on")
            self.assertEqual((result.status, self.content()), (1, text), text[:60])
            self.assertRegex(result.errors, f"{self.tasking_file()}: .*stays as it is")
        self.machine.task(" ")
        self.assertEqual((self.machine.ctl("tasking", "on").status, self.content()), (0, '{"TaskedOn": true}\n'))

    def test_deferral_is_switched_once(self):
        for argument, present, changed in (("on", True, True), ("on", True, False), ("off", False, True), ("off", False, False)):
            result = json.loads(self.machine.ctl("defer", argument, "--json").out)
            self.assertEqual((result["defer"], result["changed"]), (present, changed))
            self.assertEqual(os.path.exists(os.path.join(self.machine.state, "defer")), present)


class Gate(MachineTest):
    """What the service's gate makes of a configuration within its five seconds."""

    def test_an_odd_neighbour_is_no_answer(self):
        self.machine.write_export(some_points(1))
        for text in ('{"TaskedOn": true, %s}', '{%s, "TaskedOn": true}'):
            self.machine.task(text % ODD)
            before = len(self.machine.rows())
            self.run_clean()
            self.assertGreater(len(self.machine.rows()), before, text)
        self.machine.task('{"TaskedOn": 1e400}')
        self.assertIn("Not reporting since not tasked-on by Statora (Wrong value class for class for TaskedOn)",
                      self.run_clean().log)

    def test_what_comes_at_the_last_moment_counts(self):
        machines = {"in place": self.machine, "in a new directory": Machine(), "no JSON": Machine()}
        runs = {}
        for how, machine in machines.items():
            self.addCleanup(machine.close)
            machine.write_export(some_points(1))
            for name in os.listdir(machine.config):
                os.unlink(os.path.join(machine.config, name))
            if how == "in a new directory":
                os.rmdir(machine.config)
            runs[how] = machine.start()
        for process in runs.values():
            wait_for(lambda: os.fstat(process.tessel_errors.fileno()).st_size > 0)  # pylint: disable=cell-var-from-loop
        time.sleep(4.77)  # a look at the file every quarter of a second would now come too late
        for machine in machines.values():
            os.makedirs(machine.config, exist_ok=True)
        files = {how: open(os.path.join(machine.config, TASKING), "w", encoding="utf-8")
                 for how, machine in machines.items()}
        time.sleep(0.03)
        for how, file in files.items():
            file.write("no JSON" if how == "no JSON" else '{"TaskedOn": true}')
            file.close()
        for how, process in runs.items():
            log = self.assert_clean(machines[how].result(process)).log
            self.assertIn("Not reporting based on not being tasked-on by Statora (nil configuration object)"
                          if how == "no JSON" else "Reporting based on being tasked-on by Statora", log, how)

    def test_a_lack_of_its_own_is_not_an_absence(self):
        self.machine.write_export(some_points(1))
        faults = {"CALL": "open_existing", "PATH": TASKING, "AT": 1, "ERRNO": errno.EMFILE}
        warning = "The configuration cannot be looked at: " + os.path.join(self.machine.config, TASKING)
        result = self.run_clean(**FaultMachine.faults(**faults))
        self.assertEqual(sum(line.startswith(warning) for line in result.warnings), 1, result.errors)
        with open(os.path.join(self.machine.state, "last_run.json"), encoding="utf-8") as file:
            record = json.load(file)
        self.assertEqual((record["outcome"], record["failure"]),
                         ("failed", "the tasking configuration could not be looked at"))
        shown = self.machine.ctl("tasking", "show", "--json", **FaultMachine.faults(**faults))
        self.assertEqual(json.loads(shown.out)["source"], "unknown")
        self.assertEqual(len(self.machine.rows()), 0)
        self.run_clean(**FaultMachine.faults(TIMES=3, **faults))
        self.assertGreater(len(self.machine.rows()), 0, "it looks again")


if __name__ == "__main__":
    harness.main()
