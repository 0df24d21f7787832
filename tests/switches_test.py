#!/usr/bin/env python3
"""`tesselctl tasking` and `tesselctl defer`: what they switch, and what they say of it."""
import json
import os

import harness
from harness import TASKING, MachineTest, point


class Switches(MachineTest):
    def tasking_file(self):
        return os.path.join(self.machine.config, TASKING)

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

    def test_other_keys_of_the_configuration_stay(self):
        self.machine.task('{"Other": [1, 2.50], "TaskedOn": false}')
        self.assertEqual(self.machine.ctl("tasking", "on").status, 0)
        with open(self.tasking_file(), encoding="utf-8") as file:
            self.assertEqual(json.load(file), {"Other": [1, 2.5], "TaskedOn": True})

    def test_deferral_is_switched_once(self):
        for argument, present, changed in (("on", True, True), ("on", True, False), ("off", False, True), ("off", False, False)):
            result = json.loads(self.machine.ctl("defer", argument, "--json").out)
            self.assertEqual((result["defer"], result["changed"]), (present, changed))
            self.assertEqual(os.path.exists(os.path.join(self.machine.state, "defer")), present)


if __name__ == "__main__":
    harness.main()
