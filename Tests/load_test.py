"""Sixty-four clients at once: every request is answered once and in its order, by an agent that stays the same, does
not grow, and leaves nothing behind.

All but two mix commands, first calmly, then in a rush: one more floods the agent with pings, another waits for a
certificate that never comes. VELTOID_LOAD_SECONDS sets how long the rush lasts. How long pings take is printed, never
judged; `ping_times` measures it for the benchmarks.
"""

from __future__ import annotations

import concurrent.futures
import contextlib
import multiprocessing
import os
import pathlib
import signal
import statistics
import time
import unittest
from collections import Counter
from dataclasses import dataclass

from harness.load_clients import (PASSWORDS, WAITING_ACCOUNT, Conversation, Findings, Timetable, flood, is_success, mix,
                                  sleep_until, success_with, wait_for_certificate)
from harness.world import ACCOUNT, ADD, DATABASE, FORGET, LIST, PASSWORD, PING, World, hashed

SECONDS = float(os.environ.get("VELTOID_LOAD_SECONDS", "8"))
CALM_SHARE = 0.5  # of that, before
TIME_TO_CONNECT, TIME_TO_SETTLE = 2, 1

CLIENTS = 64
QUARRELLERS, QUARRELS = 16, 40

# Sanitized agents get through fewer requests, and ThreadSanitizer keeps several times of what a request takes.
SANITIZED = os.environ.get("VELTOID_SANITIZER", "")
MOST_GROWTH = 256 << 20 if "thread" in SANITIZED else 64 << 20
# A sanitizer keeps what was freed for a while, but not so much that it looks like growth.
SANITIZER = {"ASAN_OPTIONS": os.environ.get("ASAN_OPTIONS", "") + ":quarantine_size_mb=16"}

NEVER_SUCCEED = {"unknown", "set nothing", "verify wrong", "linked identity", "flood"}


@dataclass
class Load:
    """All clients' findings, and the agent's memory before and after the rush, in bytes."""
    findings: list[Findings]
    memory: tuple[int, int]

    def slowest_pings(self) -> tuple[float, float]:
        """The 99th percentile in microseconds, calm and in the rush."""
        return tuple(statistics.quantiles((ping for one in self.findings for ping in one.pings[phase]), n=100)[98]
                     for phase in ("calm", "rush"))

    def total(self, what: str) -> Counter:
        return sum((getattr(one, what) for one in self.findings), Counter())


def put_under_load(world: World, agent: int, seconds: float) -> Load:
    world.server.accounts(*({"name": name, "password": password} for name, password in PASSWORDS.items()),
                          {"name": WAITING_ACCOUNT, "password": PASSWORD})
    begin = time.monotonic() + TIME_TO_CONNECT
    calm = begin + TIME_TO_SETTLE
    rush = calm + seconds * CALM_SHARE
    timetable = Timetable(begin, calm, rush, rush + seconds)
    address = world.address
    with concurrent.futures.ProcessPoolExecutor(CLIENTS, multiprocessing.get_context("fork")) as pool:
        clients = [pool.submit(mix, number, address, agent, timetable) for number in range(CLIENTS - 2)]
        clients += [pool.submit(client, address, timetable) for client in (wait_for_certificate, flood)]
        sleep_until(rush)
        world.server.settings(issuance="never")
        before = resident(agent)
        findings = [client.result() for client in clients]
    return Load(findings, (before, resident(agent)))


def resident(process: int) -> int:
    lines = pathlib.Path(f"/proc/{process}/status").read_text().splitlines()
    return next(int(line.split()[1]) << 10 for line in lines if line.startswith("VmRSS:"))


def ping_times(seconds: float) -> tuple[float, float]:
    """Microseconds within which 99 of 100 pings of the mixing clients were answered, calm and in the rush."""
    with World() as world:
        return put_under_load(world, world.start_agent().pid, seconds).slowest_pings()


class ManyClients(unittest.TestCase):
    def test_every_request_has_its_reply_and_nothing_is_left_behind(self):
        with World(environment=SANITIZER) as world:
            agent = world.start_agent()
            load = put_under_load(world, agent.pid, SECONDS)
            troubles = [trouble for one in load.findings for trouble in one.troubles]
            self.assertEqual(troubles, [], "\n".join(troubles))
            self.report(load)
            self.assertIsNone(agent.poll())
            self.assertLess(load.memory[1] - load.memory[0], MOST_GROWTH)
            succeeded = load.total("succeeded")
            # There may have been no moment with an account that had a certificate, and who waits for one is replaced.
            failed = {name for name in load.total("answered") if not succeeded[name]} - {"certificate", "waiting add"}
            self.assertGreaterEqual(failed, NEVER_SUCCEED)
            if not SANITIZED:
                self.assertEqual(failed, NEVER_SUCCEED)
            self.assertEqual(world.stop_agent(), 0)
            self.check_what_is_stored(world, load)

    def check_what_is_stored(self, world: World, load: Load):
        # By a fresh agent, which leaves its accounts alone for its first ten seconds.
        with world.running_agent() as client:
            contents = client.call(DATABASE)["result"]
            accounts, entries = contents["Accounts"], contents["AuthCertificates"]
            self.assertEqual(client.call(LIST).get("result", []), list(accounts))
            self.assertLessEqual(len(accounts), 1)
            self.assertLessEqual(set(entries), {record.get("encDsId") for record in accounts.values()})
            self.assertEqual(world.loose_ends(contents), set())
            for one in load.findings:
                self.assertLessEqual(one.stored.items(), contents["MetaInfo"].items())
            for name in accounts:
                self.assertTrue(client.call(FORGET, VeltoID=name)["success"])
            self.assertEqual(world.loose_ends(client.call(DATABASE)["result"]), set())

    @staticmethod
    def report(load: Load):
        calm, rush = load.slowest_pings()
        print(f"answered: {dict(load.total('answered'))}\nsucceeded: {dict(load.total('succeeded'))}\n"
              f"resident: {load.memory[0] >> 20} MB before the rush, {load.memory[1] >> 20} MB after it\n"
              f"99 of 100 pings: {calm / 1000:.1f} ms calm, {rush / 1000:.1f} ms in the rush, ratio {rush / calm:.2f}")


class Turns(unittest.TestCase):
    AHEAD = 100

    def test_who_asks_once_does_not_wait_for_who_asks_ahead(self):
        with World(server=False) as world, contextlib.ExitStack() as stack:
            agent = world.start_agent()
            ahead, other = (stack.enter_context(Conversation(world.address)) for _ in range(2))
            for client in (ahead, other):
                client.time_ping()
            agent.send_signal(signal.SIGSTOP)
            for client, requests in ((ahead, self.AHEAD), (other, 1)):
                for _ in range(requests):
                    client.ask("ping", is_success, PING)
                # Its reply tells that the bus has passed the requests on.
                client.connection.bus_proxy.GetId()
            agent.send_signal(signal.SIGCONT)
            # The agent numbers its replies.
            sent = {client: [client.take() for _ in range(len(client.awaited))] for client in (other, ahead)}
            overtaken = sum(serial > sent[other][0] for serial in sent[ahead])
            self.assertGreater(overtaken, self.AHEAD / 4)


class OneAccount(unittest.TestCase):
    def test_adding_and_forgetting_at_the_same_time_leaves_no_loose_ends(self):
        with World(server=False) as world, contextlib.ExitStack() as stack:
            world.start_agent()
            clients = [stack.enter_context(Conversation(world.address)) for _ in range(QUARRELLERS)]
            for _ in range(QUARRELS):
                for number, client in enumerate(clients):
                    for command in (ADD, FORGET, ADD) if number % 2 else (FORGET, ADD, FORGET):
                        client.ask("quarrel", success_with(lambda _: True), command, VeltoID=ACCOUNT,
                                   hashedpassword=hashed(PASSWORD), options={"DoNotCheckPassword": True})
                for client in clients:
                    client.take_all()
                self.assertEqual(world.loose_ends(clients[0].call(DATABASE)["result"]), set())


if __name__ == "__main__":
    unittest.main()
