"""The agent is killed at random moments of busy traffic: whatever it had answered is still there afterwards, whole.

A fixed seed decides what is sent and when the kill comes; VELTOID_CRASH_ROUNDS sets how many kills there are.
"""

from __future__ import annotations

import os
import random
import signal
import threading
import unittest

from harness.world import ADD, DATABASE, FORGET, LIST, SET_VALUE, STATUS, BusError, World, hashed

ROUNDS = int(os.environ.get("VELTOID_CRASH_ROUNDS", "200"))
LONGEST_TRAFFIC = 0.25


class Traffic:
    """One client's adds, sets and forgets, and what the agent has answered so far."""

    def __init__(self, client, rng: random.Random, model: dict):
        self.client, self.rng, self.model = client, rng, model
        # What the request under way may or may not have changed when the agent dies.
        self.uncertain: dict[str, set] = {}

    def run(self):
        """Goes on until the bus says that the agent is gone; returns how many requests were answered."""
        answered = 0
        try:
            while True:
                self.step()
                answered += 1
        except BusError:
            return answered

    def step(self):
        kind = self.rng.choices(("add", "set", "forget"), (3, 6, 1))[0]
        if kind == "add":
            account = f"user{self.rng.randrange(3)}@example.com"
            self.request("account", account, ADD, VeltoID=account, hashedpassword=hashed(str(self.rng.random())),
                         options={"DoNotCheckPassword": True})
        elif kind == "forget" and self.model.get("account"):
            self.request("account", None, FORGET, VeltoID=self.model["account"])
        else:
            key, value = f"key{self.rng.randrange(5)}", self.rng.randrange(10**9)
            self.request(key, value, SET_VALUE, domain="MetaInfo", key=key, value=value)

    def request(self, name, outcome, command, **arguments):
        self.uncertain = {name: {self.model.get(name), outcome}}
        # An add stores the new account before it forgets the old one: in between there are both.
        if self.client.call(command, **arguments)["success"]:
            self.model[name] = outcome
        self.uncertain = {}


class KilledAgent(unittest.TestCase):
    def test_nothing_that_was_answered_is_lost(self):
        rng = random.Random(20260117)
        model: dict = {}
        answered = 0
        with World(server=False) as world:
            for round_number in range(ROUNDS):
                agent = world.start_agent()
                with world.client(starts_agent=False) as client:
                    traffic = Traffic(client, rng, model)
                    killer = threading.Timer(rng.random() * LONGEST_TRAFFIC, agent.send_signal, [signal.SIGKILL])
                    killer.start()
                    answered += traffic.run()
                killer.join()
                with self.subTest(round=round_number):
                    self.assertEqual(agent.wait(), -signal.SIGKILL)
                    self.check(world, model, traffic.uncertain)
            log = world.log_text()
        self.assertGreater(answered, ROUNDS, "hardly anything was under way when the agent was killed")
        for trouble in ("corrupt", "damaged", "moved aside", "Failed to get password"):
            self.assertNotIn(trouble, log)

    def check(self, world, model, uncertain):
        """Starts the agent again and compares what it has with what it answered."""
        with world.running_agent() as client:
            accounts = client.call(LIST)["result"]
            stored = {**client.call(DATABASE)["result"]["MetaInfo"], "account": accounts[-1] if accounts else None}
            known = uncertain.get("account", {model.get("account")})
            self.assertLessEqual(set(accounts), known, "an account came back, or is a stranger")
            for name in {*model, *uncertain}:
                self.assertIn(stored.get(name), uncertain.get(name, {model.get(name)}), name)
                model[name] = stored.get(name)
            for account in accounts:
                # The state says whether the keychain still gives the password out.
                status = client.call(STATUS)["status"]["AccountStatuses"][account]
                self.assertEqual(status["AccountState"], "NoEncodedDSID", account)
            # A kill between the two steps of an add leaves the old account beside the new one, until the next add.
            for account in accounts[:-1]:
                self.assertTrue(client.call(FORGET, VeltoID=account)["success"])


if __name__ == "__main__":
    unittest.main()
