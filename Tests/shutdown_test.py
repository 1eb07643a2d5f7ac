"""The agent's life on a plain message bus: started on demand, there until something ends it, and no message is lost."""

from __future__ import annotations

import os
import signal
import subprocess
import unittest
from concurrent.futures import ThreadPoolExecutor

from harness.world import (ACCOUNT, DATABASE, SET_VALUE, STATUS, TERMINATE, BusError, Client, NameOwner, World,
                           wait_until)


class Writer:
    """A client that stores one value after the other until it is left, and what the agent has answered."""

    def __init__(self, client: Client, name: str = "key"):
        self.client, self.name = client, name
        self.answered: dict[str, int] = {}
        self.count = 0
        self.stopping = False
        self.pool = ThreadPoolExecutor(1)

    def run(self):
        while not self.stopping:
            key, value = f"{self.name}{self.count % 50}", self.count
            reply = self.client.call(SET_VALUE, domain="MetaInfo", key=key, value=value)
            assert reply["success"], f"{key} was not stored"
            self.answered[key] = value
            self.count += 1

    def wait_for(self, more: int):
        """Blocks until so many more are answered."""
        target = self.count + more
        wait_until(lambda: self.count >= target or self.running.done(), 60, "no answer")
        if self.running.done():
            self.running.result()

    def lost(self, client: Client) -> dict:
        """What was answered and is not stored."""
        stored = client.call(DATABASE)["result"]["MetaInfo"]
        return {key: value for key, value in self.answered.items() if stored.get(key) != value}

    def __enter__(self):
        self.running = self.pool.submit(self.run)
        return self

    def __exit__(self, *_):
        self.stopping = True
        self.pool.shutdown()
        self.client.connection.close()
        self.running.result()


class PlainBus(unittest.TestCase):
    def test_it_stays_when_nobody_could_bring_it_back(self):
        # A child of some unit inherits what tells units apart.
        inherited = {"INVOCATION_ID": "0" * 32, "NOTIFY_SOCKET": "/nowhere"}
        for environment in ({}, inherited):
            environment["HARBWELL_IDLE_EXIT"] = "0.05"
            with self.subTest(environment), World(server=False, environment=environment) as world, \
                    NameOwner(world.address) as owner:
                first = world.agent_pid()
                owner.wait(True)
                with self.assertRaises(TimeoutError):
                    owner.wait(False, timeout=1)
                self.assertEqual(world.agent_pid(), first)

    def test_a_second_agent_ends_says_who_is_there_and_writes_nothing(self):
        def second(*arguments, **environment):
            return subprocess.Popen([*world.command, *arguments, "k=v"], env={**world.environment, **environment},
                                    stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)

        with World(server=False) as world, world.running_agent() as client:
            other_names = "--authServiceName", "com.example.other"
            elsewhere = world.folder / "elsewhere"
            same_store, impatient = [second(), second(*other_names)], second()
            same_name = [second("--noprefsfile"), second(XDG_STATE_HOME=str(elsewhere))]
            for agents, why in [(same_name, "cannot be had on this bus"),
                                (same_store, "works on this user's accounts")]:
                for agent in agents:
                    said = agent.communicate(timeout=60)[1].splitlines()
                    self.assertEqual(agent.returncode, 1, said)
                    reasons = [line for line in said if why in line]
                    self.assertEqual(len(reasons), 1, said)
                    self.assertIn(f"process {world.agent.pid}", reasons[0])
                if agents is same_name:
                    impatient.terminate()
                    impatient.communicate(timeout=60)
                    self.assertEqual(impatient.returncode, -signal.SIGTERM, "it waited without being deaf")
            self.assertNotIn("k", client.call(DATABASE)["result"].get("MetaInfo", {}))
            self.assertEqual([file.name for file in elsewhere.rglob("*") if file.is_file()], ["agent.lock"])

    def test_ends_in_the_middle_of_requests_lose_none(self):
        ends = [lambda client: os.kill(client.call(STATUS)["status"]["pid"], signal.SIGTERM),
                lambda client: self.assertRaises(BusError, client.call, TERMINATE),
                lambda client: client.call(STATUS, options={"VeltoIDAuthenticationStatusTerminateServer": True})]
        with World(server=False) as world, NameOwner(world.address) as owner:
            with Writer(world.client(), "one") as one, Writer(world.client(), "other") as other:
                for end in ends * 10:
                    one.wait_for(10)
                    other.wait_for(10)
                    owner.wait(True)
                    with world.client() as client:
                        end(client)
                    owner.wait(False)
            self.assertGreaterEqual(owner.owners_gone, 30)
            with world.client() as client:
                self.assertEqual((one.lost(client), other.lost(client)), ({}, {}))

    def test_a_request_that_waits_is_answered_with_what_is_known_when_the_agent_is_terminated(self):
        with World() as world, world.client() as client, ThreadPoolExecutor() as pool:
            agent = world.start_agent()
            self.assertTrue(client.call(SET_VALUE, domain="MetaInfo", key="k", value=1)["success"])
            world.server.settings(issuance="never")
            adding = pool.submit(client.add, timeout=90, certwaitduration=60)
            self.assertTrue(world.server.wait("getMyInfo"))
            agent.send_signal(signal.SIGTERM)
            self.assertEqual(agent.wait(timeout=10), 0)
            self.assertTrue(adding.result()["success"])
            with world.client() as other:
                database = other.call(DATABASE)["result"]
            self.assertEqual((database["MetaInfo"]["k"], [*database["Accounts"]]), (1, [ACCOUNT]))

    def test_the_next_agent_waits_for_what_the_one_before_still_stores(self):
        with World() as world, NameOwner(world.address) as owner, world.client() as client, \
                ThreadPoolExecutor() as pool:
            world.server.next("authenticate", delay=1)
            adding = pool.submit(client.add)
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
