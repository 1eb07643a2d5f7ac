"""Clients that quarrel over accounts while the server is slow, refuses, and fails: what they are told is true, and
whatever comes of it, there is one account at most, with all that belongs to it and nothing else.

Requests come in bursts. After each the checks are made when all are answered and no call is with the server; some end
with the agent's sudden death instead. A seed decides what is asked and what the server does, not who comes first:
VELTOID_STRESS_SEED; VELTOID_STRESS_SECONDS says how long it goes on.
"""

from __future__ import annotations

import contextlib
import os
import random
import signal
import threading
import time
import unittest
from collections import Counter

from harness.account_history import DISABLED, WRONG_PASSWORD, History, Request
from harness.world import (ACCOUNT, ADD, CERTIFICATE, CHECK, DATABASE, FORGET, INFO, LIST, OTHER_ACCOUNT,
                           OTHER_PASSWORD, PASSWORD, STATUS, VERIFY, BusError, World, hashed, plain, unwrap_msg,
                           wait_until)

SECONDS = float(os.environ.get("VELTOID_STRESS_SECONDS", "25"))
SEED = int(os.environ.get("VELTOID_STRESS_SEED", "20260117"))
CLIENTS = 8
MOST_REQUESTS = 8  # of a client in a burst
PATIENCE = 120
# The agent's own look at its accounts, which comes ten seconds after its start, belongs to the quarrel as well.
KILLS_BEGIN, KILL_SHARE = 0.6, 0.5

PASSWORDS = {ACCOUNT: PASSWORD, OTHER_ACCOUNT: OTHER_PASSWORD, "kim@example.com": "a third one"}
REFUSALS = {-20101: WRONG_PASSWORD, -20283: WRONG_PASSWORD, -20209: DISABLED}
ADD_OPTIONS = ({}, {}, {"CreateCSRAsynchronously": False}, {"DoNotCheckPassword": True}, {"DoNotCreateCSR": True},
               {"CreateCSRAsynchronously": False, "ForceCertificateCreation": True}, {"certwaitduration": 0.3},
               {"certwaitduration": 1.5, "CreateCSRAsynchronously": False})
COMMANDS = {"add": ADD, "forget": FORGET, "verify": VERIFY, "info": INFO, "list": LIST, "status": STATUS,
            "certificate": CERTIFICATE, "check": CHECK}
OPTIONS = {"add": ADD_OPTIONS, "info": ({}, {"ForceValidation": True}, {"ForceValidationRecordFetch": True}),
           "check": ({}, {"CheckNetwork": True}), "certificate": ({}, {"CertificateDetails": True})}


def some_request(rng: random.Random, weights: list[float], names: list[str]) -> Request:
    kind = rng.choices([*COMMANDS], weights)[0]
    if kind in ("list", "status"):
        return Request(kind)
    name, right = rng.choice(names), rng.random() < 0.7 or kind not in ("add", "verify")
    password = {"hashedpassword": hashed(PASSWORDS[name] if right else "wrong")} if kind in ("add", "verify") else {}
    return Request(kind, name, right, {"VeltoID": name, "options": rng.choice(OPTIONS.get(kind, ({},))), **password})


def some_answer(rng: random.Random, badness: float) -> dict:
    """For the server's next call: always late, sometimes bad."""
    late = {"delay": rng.choice((0.01, 0.05, 0.3)) * rng.random()}
    if rng.random() >= badness:
        return late
    return late | rng.choice([
        *({"method": "authenticate", "fault": {"code": code}} for code in REFUSALS),
        {"fault": {"code": rng.choice([*REFUSALS])}}, {"status": 500}, {"body": "<methodResponse><params>"},
        {"close": rng.choice(("before", "headers", "middle"))}, *([{"delay": 6}] if rng.random() < 0.1 else ())])


def converse(client, requests: list[Request], history: History, troubles: list[str]):
    """One request after the other, until the agent is gone."""
    for one in requests:
        history.requests.append(one)
        one.begin = time.monotonic()
        message = client.request(COMMANDS[one.kind], **one.arguments)
        try:
            message = client.connection.send_and_get_reply(message, timeout=PATIENCE)
            one.reply = plain(("a{sv}", unwrap_msg(message)[0]))
        except BusError:
            return
        except Exception as error:  # a thread's end tells nobody
            return troubles.append(f"{type(error).__name__} {error}: {one}")
        one.end, one.serial = time.monotonic(), message.header.serial


class Quarrel:
    """The world, and what is known of it from one burst to the next."""

    def __init__(self, world: World, rng: random.Random):
        self.world, self.rng, self.server = world, rng, world.server
        self.history = History([*PASSWORDS])
        self.seen: Counter = Counter()

    def burst(self, killing: int | None) -> list[str]:
        rng, troubles = self.rng, []
        weights = [rng.choice((0.2, 1, 4)) * (3 if kind == "add" else 1) for kind in COMMANDS]
        names = rng.sample([*PASSWORDS], rng.randint(1, 3))
        badness = rng.choice((0, 0, 0.1, 0.4))
        self.server.command("POST", "/next", [some_answer(rng, badness) for _ in range(300)])
        self.server.settings(issuance=rng.choice(("at-once", "at-once", "token", "token-refuse", "refuse", "never")),
                             pendingPolls=rng.randrange(2), dsSessionValidityDuration=rng.choice((0, 300)))
        with contextlib.ExitStack() as stack:
            threads = []
            for _ in range(CLIENTS):
                requests = [some_request(rng, weights, names) for _ in range(rng.randint(1, MOST_REQUESTS))]
                client = stack.enter_context(self.world.client(starts_agent=False))
                threads.append(threading.Thread(target=converse, args=(client, requests, self.history, troubles)))
            if killing:
                threads.append(threading.Timer(rng.random(), self.world.agent.send_signal, [killing]))
            for thread in threads:
                thread.start()
            for thread in threads:
                thread.join()
        more, stored = self.after_death(killing) if killing else self.at_quiet()
        self.seen.update(f"{one.kind} {'refused' if one.failed() else 'succeeded' if one.reply else 'lost'}"
                         for one in self.history.requests)
        if troubles or more:
            return [*troubles, *more, f"the history:\n{self.history}"]
        self.history = History([*PASSWORDS], *stored)
        return []

    def calm_down(self):
        self.server.clear_next()
        wait_until(lambda: all(call["answered"] for call in self.server.received()), 30, "a call is not answered")
        for call in self.server.received():
            fault = ((call["injection"] or {}).get("fault") or {}).get("code")
            if fault in REFUSALS:
                self.note_refusal(call, fault)
        self.server.clear_received()

    def note_refusal(self, call: dict, fault: int):
        """Of another password it says nothing, unless the account as a whole is disabled. Only a sign-in has a name."""
        signing_in = call["method"] == "authenticate"
        for name in [call["parameters"]["veltoConnect"]] if signing_in else PASSWORDS:
            if not signing_in or fault == -20209 or call["parameters"]["pwdHash"] == hashed(PASSWORDS[name]):
                self.history.refusals[name].add(REFUSALS[fault])

    def look(self, client) -> Request:
        """A list with nothing beside it."""
        look = Request("list", begin=time.monotonic())
        look.reply, look.end = client.call(LIST, PATIENCE), time.monotonic()
        self.history.requests.append(look)
        return look

    def at_quiet(self) -> tuple[list[str], list[Request]]:
        """What is wrong, and the adds that stand for what is stored."""
        self.calm_down()
        with self.world.client(starts_agent=False) as client:
            look = self.look(client)
            troubles = self.history.troubles()
            if client.call(STATUS)["status"]["pid"] != self.world.agent.pid:
                troubles.append("it is another agent")
            # The agent's own check may be at work.
            with contextlib.suppress(AssertionError):
                wait_until(lambda: not self.disorder(client), 2, "")
            troubles += self.disorder(client)
            names = look.reply["result"]
            stored = {name: self.history.is_password_stored(name, look) for name in names}
            records = client.call(DATABASE)["result"]["Accounts"]
            troubles += [f"{name} has lost its password" for name in names
                         if stored[name] and "HashedPasswordRef" not in records[name]]
        return troubles, [Request("add", name, stored[name], end=0, serial=-1, reply={"success": True})
                          for name in names]

    def disorder(self, client) -> list[str]:
        contents = client.call(DATABASE)["result"]
        accounts, entries = contents["Accounts"], contents["AuthCertificates"]
        strangers = entries.keys() - {record.get("encDsId") for record in accounts.values()}
        return [f"{what}: {which}" for what, which in (
            ("more than one account", [*accounts] if len(accounts) > 1 else []),
            ("certificates without account", strangers), ("loose ends", self.world.loose_ends(contents))) if which]

    def after_death(self, how: int) -> tuple[list[str], list[Request]]:
        """The same. What was answered before still holds, and a clean-up takes what was left behind."""
        status = self.world.agent.wait()
        troubles = [] if status == (-how if how == signal.SIGKILL else 0) else [f"the agent ended with {status}"]
        self.calm_down()
        self.world.start_agent()
        with self.world.client(starts_agent=False) as client:
            self.look(client)
            troubles += self.history.troubles()
            if not client.add(DoNotCheckPassword=True)["success"]:
                troubles.append("nothing can be added after a restart")
            troubles += self.disorder(client) if len(client.call(LIST)["result"]) != 1 else []
            client.call(FORGET, VeltoID=ACCOUNT)
            troubles += [f"left behind: {item}" for item in self.world.keychain_items()] + self.disorder(client)
        return troubles, []


class Stress(unittest.TestCase):
    def test_answers_are_true_and_nothing_is_lost_or_left_behind(self):
        print(f"VELTOID_STRESS_SEED={SEED}", flush=True)
        rng = random.Random(SEED)
        bursts = deaths = 0
        begin = time.monotonic()
        with World() as world:
            world.server.accounts(*({"name": name, "password": password} for name, password in PASSWORDS.items()))
            world.start_agent()
            quarrel = Quarrel(world, rng)
            while (passed := time.monotonic() - begin) < SECONDS:
                killing = rng.choice((signal.SIGKILL, signal.SIGTERM)) if rng.random() < KILL_SHARE else None
                killing = killing if passed > SECONDS * KILLS_BEGIN else None
                troubles = quarrel.burst(killing)
                bursts, deaths = bursts + 1, deaths + bool(killing)
                if troubles:
                    self.fail("\n".join([f"in burst {bursts} of seed {SEED}:", *troubles]))
            self.assertEqual(world.stop_agent(), 0)
        print(f"{bursts} bursts, {deaths} deaths, {dict(quarrel.seen)}")
        self.assertGreater(quarrel.seen["add succeeded"], bursts, "hardly anything was added")


if __name__ == "__main__":
    unittest.main()
