"""The agent's life on a plain message bus: started on demand, there as long as nothing ends it, and no message is lost."""

from __future__ import annotations

import os
import pathlib
import signal
import sys
import threading
import unittest
from concurrent.futures import ThreadPoolExecutor

sys.path.insert(0, str(pathlib.Path(__file__).resolve().parent / "harness"))
from world import (ACCOUNT, ADD, DATABASE, PASSWORD, SET_VALUE, STATUS, TERMINATE, BusError, NameOwner,  # noqa: E402
                   World, hashed)


class Writer:
    """A client that stores one value after the other, and what the agent has answered. Writes until it is left."""

    def __init__(self, client, name: str = "key"):
        self.client = client
        self.name = name
        self.answered: dict[str, int] = {}
        self.count = 0
        self.changed = threading.Condition()
        self.stopping = False
        self.failure: Exception | None = None
        self.thread = threading.Thread(target=self.run)

    def write(self):
        key, value = f"{self.name}{self.count % 50}", self.count
        if not self.client.call(SET_VALUE, domain="MetaInfo", key=key, value=value)["success"]:
            raise AssertionError(f"{key} was not stored")
        with self.changed:
            self.answered[key] = value
            self.count += 1
            self.changed.notify_all()

    def run(self):
        try:
            while not self.stopping:
                self.write()
        except Exception as failure:  # pylint: disable=broad-except
            with self.changed:
                self.failure = failure
                self.changed.notify_all()

    def wait_for(self, more: int):
        """Blocks until so many more are answered."""
        with self.changed:
            target = self.count + more
            if not self.changed.wait_for(lambda: self.failure or self.count >= target, timeout=60):
                raise AssertionError("no answer")
            if self.failure:
                raise self.failure

    def lost(self, client) -> dict:
        """What was answered and is not stored."""
        stored = client.call(DATABASE)["result"]["MetaInfo"]
        return {key: value for key, value in self.answered.items() if stored.get(key) != value}

    def __enter__(self):
        self.thread.start()
        return self

    def __exit__(self, *_):
        self.stopping = True
        self.thread.join()
        self.client.close()
        if self.failure:
            raise self.failure


class PlainBus(unittest.TestCase):
    def test_it_stays_when_nobody_could_bring_it_back(self):
        # A child of some unit inherits what tells units apart.
        inherited = {"INVOCATION_ID": "0" * 32, "NOTIFY_SOCKET": "/nowhere"}
        for environment in ({}, inherited):
            environment["HARBWELL_IDLE_EXIT"] = "0.05"
            with self.subTest(environment), World(server=False, environment=environment) as world, \
                    NameOwner(world.bus.address) as owner:
                first = world.agent_pid()
                owner.wait(True)
                with self.assertRaises(TimeoutError):
                    owner.wait(False, timeout=1)
                self.assertEqual(world.agent_pid(), first)

    def test_ends_in_the_middle_of_requests_lose_none(self):
        with World(server=False) as world, NameOwner(world.bus.address) as owner:
            with Writer(world.client(), "one") as one, Writer(world.client(), "other") as other:
                for _ in range(10):
                    for end in self.end_by_signal, self.end_by_command, self.end_by_option:
                        one.wait_for(10)
                        other.wait_for(10)
                        owner.wait(True)
                        end(world)
                        owner.wait(False)
            self.assertGreaterEqual(owner.owners_gone, 30)
            with world.client() as client:
                self.assertEqual((one.lost(client), other.lost(client)), ({}, {}))

    @staticmethod
    def end_by_signal(world):
        os.kill(world.agent_pid(), signal.SIGTERM)

    def end_by_command(self, world):
        with world.client() as client, self.assertRaises(BusError):
            client.call(TERMINATE)

    @staticmethod
    def end_by_option(world):
        with world.client() as client:
            client.call(STATUS, options={"VeltoIDAuthenticationStatusTerminateServer": True})

    def test_a_request_without_end_does_not_keep_a_terminated_agent(self):
        with World() as world, world.client() as client, ThreadPoolExecutor() as pool:
            agent = world.start_agent()
            self.assertTrue(client.call(SET_VALUE, domain="MetaInfo", key="k", value=1)["success"])
            world.server.settings(issuance="never")
            adding = pool.submit(client.call, ADD, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD), timeout=90,
                                 options={"certwaitduration": 60})
            self.assertTrue(world.server.wait("getMyInfo"))
            agent.send_signal(signal.SIGTERM)
            self.assertEqual(agent.wait(timeout=45), 0)
            self.assertRaises(BusError, adding.result)
            with world.client() as other:
                database = other.call(DATABASE)["result"]
            self.assertEqual((database["MetaInfo"]["k"], [*database["Accounts"]]), (1, [ACCOUNT]))

    def test_the_next_agent_waits_for_what_the_one_before_still_stores(self):
        with World() as world, NameOwner(world.bus.address) as owner, world.client() as client, \
                ThreadPoolExecutor() as pool:
            world.server.next("authenticate", delay=1)
            adding = pool.submit(client.call, ADD, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))
            self.assertTrue(world.server.wait("authenticate"))
            owner.wait(True)
            with world.client() as other:
                os.kill(world.agent_pid(), signal.SIGTERM)
                owner.wait(False)
                self.assertTrue(other.call(SET_VALUE, domain="MetaInfo", key="k", value=1)["success"])
                self.assertTrue(adding.result(timeout=30)["success"])
                database = other.call(DATABASE)["result"]
            self.assertEqual(database["Accounts"][ACCOUNT]["FirstName"], "Jane")
            self.assertEqual(database["MetaInfo"]["k"], 1)


if __name__ == "__main__":
    unittest.main()
