"""The agent's life on demand under a real systemd: started by messages and its timer, gone when idle, nothing lost."""

from __future__ import annotations

import contextlib
import os
import random
import sys
import time
import unittest

from harness.systemd_world import UserSession, run_inside
from harness.world import (ACCOUNT, PASSWORD_SERVICE, PING, SERVICE, SET_VALUE, SET_VALUE_QUIETLY, STATUS, TERMINATE,
                           TIMER, UNIT, BusError, NameOwner, busctl_send)
from shutdown_test import Writer

MICROSECONDS = 1_000_000


class ComingAndGoing(unittest.TestCase):
    def test_a_message_to_either_name_starts_it_and_idleness_ends_it(self):
        session = self.enterContext(UserSession(HARBWELL_IDLE_EXIT="1"))
        for service in (SERVICE, PASSWORD_SERVICE):
            with self.subTest(service):
                self.assertEqual(session.unit_property("ActiveState"), "inactive")
                self.assertEqual(busctl_send(session.address, service=service, command=PING), {"success": True})
                session.wait_for_state("active")
                session.wait_for_state("inactive")
                self.assertEqual(session.unit_property("Result", interface="Service"), "success")
                self.assertEqual(session.unit_property("ExecMainStatus", interface="Service"), 0)
        self.assertEqual(session.unit_property("ActiveState", TIMER), "active", "nothing brings it back")

    def test_an_unreadable_idle_time_is_the_default(self):
        session = self.enterContext(UserSession(HARBWELL_IDLE_EXIT="soon"))
        with session.client() as client:
            client.call(SET_VALUE, domain="MetaInfo", key="k", value=1)
        log = (session.folder / "log" / "agent.log").read_text(errors="replace")
        self.assertIn("HARBWELL_IDLE_EXIT is not a number of seconds; using 30.", log)


class BroughtBack(unittest.TestCase):
    def test_the_timer_starts_it_when_its_time_has_come(self):
        session = self.enterContext(UserSession(HARBWELL_IDLE_EXIT="0"))
        with session.client() as client:
            client.add(DoNotCheckPassword=True)
        # As a date, as a date that is almost too near for one, and as a delay.
        for seconds in (8, 5.5, 1.9):
            with self.subTest(seconds), NameOwner(session.address) as owner, session.client() as client:
                date = time.time() + seconds
                for key, value in (("Dirty", ("g", "")), ("EarliestAllowedConnectionDate", ("(d)", (date,)))):
                    reply = client.call(SET_VALUE_QUIETLY, domain="Accounts", item=ACCOUNT, key=key, value=value,
                                        options={"Dirty": False})
                    self.assertTrue(reply["success"])
                self.assertRaises(BusError, client.call, TERMINATE)
                owner.wait(False)
                owner.wait(True)
                started = session.unit_property("InactiveExitTimestamp") / MICROSECONDS
                self.assertGreater(started, date - 1)
                self.assertLess(started, date + 2)


    def test_a_first_look_at_the_accounts_is_taken_however_soon_it_leaves(self):
        session = self.enterContext(UserSession(HARBWELL_IDLE_EXIT="1"))
        with NameOwner(session.address) as owner, session.client() as client:
            client.add(DoNotCheckPassword=True)
            account = {}
            while "LastAttempt" not in account:
                owner.wait(False)
                account = client.call(STATUS)["status"]["AccountStatuses"][ACCOUNT]
                self.assertLess(owner.owners_gone, 5)
            self.assertEqual((account["LastAttempt"], account["LastAttemptOutcome"]), ("sign-in", "failed"))


class NothingIsLost(unittest.TestCase):
    def test_stop_and_restart_in_the_middle_of_requests(self):
        session = self.enterContext(UserSession(HARBWELL_IDLE_EXIT="0"))
        with NameOwner(session.address) as owner, Writer(session.client()) as writer:
            owner.wait(True)
            for method in ("StopUnit", "RestartUnit") * 5:
                session.call(method, "ss", (UNIT, "replace"))
                owner.wait(False)
                owner.wait(True)
                writer.wait_for(10)
        with session.client() as client:
            self.assertEqual(writer.lost(client), {})

    def test_a_thousand_messages_across_twenty_idle_exits(self):
        session = self.enterContext(UserSession(HARBWELL_IDLE_EXIT="0.2"))
        rng = random.Random(20260211)
        answered = 0
        with session.client() as client, NameOwner(session.address) as owner:
            while owner.owners_gone < 20 or answered < 1000:
                for _ in range(50):
                    # A ping is answered on the bus thread, a status on the client's queue.
                    self.assertTrue(client.call(rng.choice((PING, STATUS)))["success"])
                    answered += 1
                owner.wait(True)
                if rng.random() < 0.5:
                    owner.wait(False)  # the names are free, the process is not yet gone
                else:
                    with contextlib.suppress(TimeoutError):  # about when it decides to leave
                        owner.wait(False, timeout=rng.uniform(0.195, 0.205))


if __name__ == "__main__":
    if "VELTOID_INSIDE" in os.environ:
        unittest.main()
    sys.exit(run_inside([sys.executable, "-B", os.path.abspath(__file__), *sys.argv[1:]]))
