"""Measures the agent against references in the same run and prints one table: what, ours, reference, ratio, limit.

    bench.py [--quick] [--build DIRECTORY]        (scripts/bench builds first)

Every number is a median; agent and reference are measured in turn, so that what else the machine does hits both. Exit
status 0 unless something could not be run: a result over its limit is for the reader to judge.
"""

from __future__ import annotations

import argparse
import datetime
import functools
import json
import os
import pathlib
import plistlib
import random
import shutil
import statistics
import subprocess
import sys
import tempfile
import threading
import time
from collections import defaultdict
from collections.abc import Iterator
from dataclasses import dataclass

ROOT = pathlib.Path(__file__).resolve().parent.parent
sys.path.insert(0, str(ROOT / "Tests"))
from harness.world import (ACCOUNT, ADD, INFO, LIST, PASSWORD, PING, SERVICE, STATUS, Client,  # noqa: E402
                           IdentityServer, World, hashed)
from load_test import CLIENTS as LOAD_CLIENTS, ping_times  # noqa: E402
from jeepney import message_bus  # noqa: E402
from jeepney.io.blocking import Proxy  # noqa: E402

MINIMAL = "com.velto.harbwell.veltoid.minimal"
CERTIFICATES = pathlib.Path("/etc/ssl/certs")
CLIENTS = 8

# Ways to get a mount namespace of one's own, the first that is permitted.
NAMESPACES = (("unshare", "--user", "--map-root-user", "--mount"), ("unshare", "--mount"))

RECORDS = 4500  # of the property list: about 4 MB in the XML form
READINGS = 3  # of each list, each time that the program is started
MANY_PEOPLE, FEW_PEOPLE = 100_000, 10

# The agent first looks at its accounts 10 s after its start, and ends threads that had nothing to do for 10 s.
SETTLING_SECONDS = 25


@dataclass(frozen=True)
class Effort:
    """How much is measured. The medians that count are over at least 20 runs."""
    cold_starts: int = 60
    runs: int = 20
    pings: int = 500
    parallel_milliseconds: int = 400
    calls: int = 15
    idle_seconds: int = 30
    rush_seconds: int = 60


QUICK = Effort(cold_starts=10, runs=5, pings=200, parallel_milliseconds=200, calls=5, idle_seconds=10, rush_seconds=10)


@dataclass(frozen=True)
class Row:
    """One line of the table. A limit is "at most" for a ratio of times, "at least" for one of throughputs."""
    what: str
    ours: str
    reference: str
    ratio: float | None = None
    limit: float | None = None
    at_least: bool = False
    verdict: str | None = None

    def cells(self) -> list[str]:
        sign = ">=" if self.at_least else "<="
        return [self.what, self.ours, self.reference, "" if self.ratio is None else f"{self.ratio:.2f}",
                "" if self.limit is None else f"{sign} {self.limit:g}", self.judged()]

    def judged(self) -> str:
        if self.verdict is not None:
            return self.verdict
        if self.ratio is None or self.limit is None:
            return "-"
        held = self.ratio >= self.limit if self.at_least else self.ratio <= self.limit
        return "ok" if held else "OVER"


def timing(what: str, ours: float, reference: float, limit: float, against: str = "") -> Row:
    """A row from two times in microseconds."""
    return Row(what, duration(ours), duration(reference) + against, ours / reference, limit)


def duration(microseconds: float) -> str:
    return f"{microseconds:.1f} us" if microseconds < 1000 else f"{microseconds / 1000:.2f} ms"


def medians(output: str) -> dict[str, float]:
    """Of lines "NAME NUMBER", by name."""
    numbers = defaultdict(list)
    for line in output.splitlines():
        name, number = line.split()
        numbers[name].append(float(number))
    return {name: statistics.median(values) for name, values in numbers.items()}


class Programs:
    def __init__(self, build: pathlib.Path):
        self.agent = build / "VeltoIDAuthentication" / "VeltoIDAuthd" / "veltoidauthd"
        self.folder = build / "Benchmarks"

    def run(self, name: str, *arguments, prefix: tuple[str, ...] = (),
            environment: dict[str, str] | None = None) -> str:
        command = [*prefix, str(self.folder / name), *map(str, arguments)]
        return subprocess.run(command, stdout=subprocess.PIPE, text=True, check=True,
                              env={**os.environ, **(environment or {})}).stdout

    def world(self, server: bool) -> World:
        """A bus that can start the agent and the minimal service."""
        world = World(server=server)
        file = world.folder / "services" / f"{MINIMAL}.service"
        file.write_text(f"[D-BUS Service]\nName={MINIMAL}\nExec={self.folder / 'minimal_service'} {MINIMAL}\n")
        return world


# --- On the bus

def bus_rows(programs: Programs, effort: Effort) -> Iterator[Row]:
    with programs.world(server=False) as world:
        def load(*arguments) -> tuple[float, float]:
            output = programs.run("bus_load", *arguments, SERVICE, MINIMAL,
                                  environment={"DBUS_SESSION_BUS_ADDRESS": world.address})
            result = medians(output)
            return result[SERVICE], result[MINIMAL]

        yield timing("cold start to first reply", *load("cold", effort.cold_starts), 1.3, " minimal service")
        yield timing("ping, one client", *load("ping", effort.runs, effort.pings), 1.3, " minimal service")
        ours, reference = load("parallel", effort.runs, CLIENTS, effort.parallel_milliseconds)
        yield Row(f"ping, {CLIENTS} clients", f"{ours:,.0f}/s", f"{reference:,.0f}/s minimal service",
                  ours / reference, 0.8, at_least=True)


def load_rows(effort: Effort) -> Iterator[Row]:
    calm, rush = ping_times(effort.rush_seconds)
    yield timing(f"ping, 99 of 100, {LOAD_CLIENTS} clients, with flood and wait", rush, calm, 5, " without")


# --- Texts

def benchmark_medians(programs: Programs, name: str, effort: Effort) -> dict[str, float]:
    """Microseconds by the name of the function."""
    report = json.loads(programs.run(
        name, f"--benchmark_repetitions={effort.runs}", "--benchmark_min_time=0.05",
        "--benchmark_enable_random_interleaving=true", "--benchmark_report_aggregates_only=true",
        "--benchmark_format=json"))
    per_unit = {"ns": 1e-3, "us": 1.0, "ms": 1e3}
    failed = [run["error_message"] for run in report["benchmarks"] if run.get("error_occurred")]
    if failed:
        raise RuntimeError(f"{name}: {failed[0]}")
    return {run["run_name"]: run["real_time"] * per_unit[run["time_unit"]]
            for run in report["benchmarks"] if run["aggregate_name"] == "median"}


def text_rows(programs: Programs, effort: Effort) -> Iterator[Row]:
    xmlrpc = benchmark_medians(programs, "XMLRPC_bench", effort)
    yield timing("parse a 4 MB response", xmlrpc["parseOurs"], xmlrpc["parseBareExpat"], 2, " bare expat")
    yield timing("parse a 4 MB response", xmlrpc["parseOurs"], xmlrpc["parseOtherLibrary"], 1, " libxmlrpc")
    yield timing("encode a 4 MB call", xmlrpc["encodeOurs"], xmlrpc["encodeOtherLibrary"], 1, " libxmlrpc")
    base64 = benchmark_medians(programs, "Base64_bench", effort)
    for what, function, reference in (("encode", "encodeAgents", "encodeOpenSSL"),
                                      ("encode for XML-RPC", "encodeXMLRPC", "encodeOpenSSL"),
                                      ("decode", "decodeAgents", "decodeOpenSSL"),
                                      ("decode for XML-RPC", "decodeXMLRPC", "decodeOpenSSL")):
        yield timing(f"base64 {what}, 1 MB", base64[function], base64[reference], 1, " OpenSSL")


def generated_list() -> dict:
    """Records of the kind that the agent keeps."""
    rng = random.Random(7)

    def text(length: int) -> str:
        return "".join(rng.choices("abcdefghijklmnopqrstuvwxyz0123456789 ", k=length))

    def record() -> dict:
        return {"VeltoID": f"{text(9)}@example.com", "FirstName": text(7), "LastName": "Zo\xeb " + text(6),
                "encDsId": str(rng.randrange(10**9)), "AllEmails": [f"{text(12)}@example.com" for _ in range(3)],
                "Count": rng.randrange(10**6), "Interval": rng.uniform(0, 1e6), "Valid": True, "Dirty": False,
                "CreationDate": datetime.datetime(2014, 3, 5) + datetime.timedelta(seconds=rng.randrange(10**8)),
                "Reference": rng.randbytes(20),
                "Certificate": {"CertStatus": "CERT_ISSUED", "SerialNumber": rng.randrange(2**60)}}

    return {f"account-{number}": record() for number in range(RECORDS)}


def property_list_rows(programs: Programs, effort: Effort) -> Iterator[Row]:
    """Python's reader builds a value, so both are compared with it: the reading alone, which the limit is for, and with
    the building of a value of ours."""
    forms = {"XML": plistlib.FMT_XML, "binary": plistlib.FMT_BINARY}
    contents = generated_list()
    lists = {form: plistlib.dumps(contents, fmt=fmt, sort_keys=False) for form, fmt in forms.items()}
    references = defaultdict(list)
    output = ""
    with tempfile.TemporaryDirectory() as name:
        paths = {form: pathlib.Path(name) / form for form in forms}
        for form, path in paths.items():
            path.write_bytes(lists[form])
        for _ in range(effort.runs):
            for form, data in lists.items():
                start = time.perf_counter()
                plistlib.loads(data)
                references[form].append((time.perf_counter() - start) * 1e6)
            output += programs.run("PropertyList_bench", READINGS, *paths.values())
    result = medians(output)
    for form, path in paths.items():
        size, reference = len(lists[form]), statistics.median(references[form])
        for what, kind, limit in (("read", "events", 5), ("read and build", "values", None)):
            ours = result[f"{path}:{kind}"]
            yield Row(f"{what} a property list, {form}, {size / 1e6:.1f} MB", f"{size / ours:.0f} MB/s",
                      f"{size / reference:.1f} MB/s plistlib", reference / ours, limit, at_least=True)


def find_person_rows(programs: Programs, effort: Effort) -> Iterator[Row]:
    # Few and many in turn; a process has one cache.
    output = "".join(programs.run("FindPersonCache_bench", 1, entries)
                     for _ in range(effort.runs) for entries in (FEW_PEOPLE, MANY_PEOPLE))
    result = medians(output)
    many, few = result[str(MANY_PEOPLE)], result[str(FEW_PEOPLE)]
    yield Row(f"find a person among {MANY_PEOPLE:,}", f"{many * 1000:.0f} ns",
              f"{few * 1000:.0f} ns among {FEW_PEOPLE}", many / few, 2)


# --- Certificates

def signed_record(folder: pathlib.Path) -> pathlib.Path:
    """A validation record of about 2 KB, signed as the identity server signs."""
    statement = {"VeltoID": ACCOUNT, "encDsId": "000123-08-4f1c2a9e5b7d", "SuggestValidDuration": 2592000,
                 "ValidAsOf": datetime.datetime(2026, 1, 2, 3, 4, 5),
                 "ValidatedEmail": [f"jane.roe{number}@example.com" for number in range(12)],
                 "ValidatedPhones": [f"+1555555012{number}" for number in range(6)]}
    key, certificate, payload, record = (folder / name for name in ("key", "certificate", "payload", "record"))
    payload.write_bytes(plistlib.dumps(statement))
    for command in (("req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes", "-subj",
                     "/CN=Signer", "-keyout", key, "-out", certificate),
                    ("cms", "-sign", "-binary", "-nodetach", "-outform", "DER", "-signer", certificate, "-inkey", key,
                     "-in", payload, "-out", record)):
        subprocess.run(["openssl", *map(str, command)], check=True, stderr=subprocess.DEVNULL)
    return record


def certificate_rows(programs: Programs, effort: Effort) -> Iterator[Row]:
    sides = ("ours", "bare")

    def paired(what: str, pairs: list[dict[str, float]], limit: float) -> Row:
        ours, reference = (statistics.median(pair[side] for pair in pairs) for side in sides)
        ratio = statistics.median(pair["ours"] / pair["bare"] for pair in pairs)
        return Row(what, duration(ours), f"{duration(reference)} bare OpenSSL", ratio, limit)

    def measured(kind: str, *arguments) -> dict[str, float]:
        return {side: next(iter(medians(programs.run("Certificates_bench", kind, side, *arguments)).values()))
                for side in sides}

    # The same key for both sides each time: what they differ in is a fraction of what keys differ in.
    yield paired("certification request with a new key", [measured("request", seed) for seed in range(effort.runs)],
                 1.05)
    with tempfile.TemporaryDirectory() as name:
        record = signed_record(pathlib.Path(name))
        yield paired(f"verify and read a record, {record.stat().st_size / 1000:.1f} KB",
                     [measured("verify", 1, record) for _ in range(effort.runs)], 1.3)


# --- Over TLS

def store_with(authority: str, folder: pathlib.Path) -> pathlib.Path:
    """A copy of the system's certificate directory that knows this authority as well."""
    store = folder / "certs"
    shutil.copytree(CERTIFICATES, store, symlinks=True)
    name = subprocess.run(["openssl", "x509", "-hash", "-noout", "-in", authority], stdout=subprocess.PIPE, text=True,
                          check=True).stdout.strip()
    number = next(number for number in range(100) if not os.path.lexists(store / f"{name}.{number}"))
    shutil.copy(authority, store / f"{name}.{number}")
    return store


def permitted_namespace() -> tuple[str, ...] | None:
    trial = ("mount", "--bind", str(CERTIFICATES), str(CERTIFICATES))
    return next((namespace for namespace in NAMESPACES
                 if subprocess.run([*namespace, *trial], stderr=subprocess.DEVNULL, check=False).returncode == 0), None)


def tls_rows(programs: Programs, effort: Effort) -> Iterator[Row]:
    what = "call over new TLS, system store"
    # The machine's own store stays as it is: the copy lies over it in a mount namespace that only tls_call is in.
    namespace = permitted_namespace()
    if namespace is None:
        yield Row(what, "", "", verdict="skipped: mount namespaces are not permitted here")
        return
    with tempfile.TemporaryDirectory() as name:
        folder = pathlib.Path(name)
        with IdentityServer(folder / "server") as server:
            store = store_with(server.authority, folder)
            cover = ("sh", "-c", f'mount --bind "$0" {CERTIFICATES} && exec "$@"', str(store))
            result = medians(programs.run("tls_call", server.url, server.authority, effort.runs, effort.calls,
                                          prefix=namespace + cover))
    yield timing(what, result["system"], result["file"], 1.2, " file of one authority")


# --- At rest

def resident(pid: int) -> str:
    lines = pathlib.Path(f"/proc/{pid}/status").read_text().splitlines()
    kilobytes = next(int(line.split()[1]) for line in lines if line.startswith("VmRSS:"))
    return f"{kilobytes / 1024:.1f} MB"


def switches(pid: int) -> dict[str, int]:
    """How often each thread has been given the processor."""
    counts = {}
    for task in pathlib.Path(f"/proc/{pid}/task").iterdir():
        lines = (task / "status").read_text().splitlines()
        counts[task.name] = sum(int(line.split()[1]) for line in lines if "ctxt_switches" in line)
    return counts


def wake_ups(before: dict[str, int], after: dict[str, int]) -> int:
    # A thread that has come or gone counts as one more.
    return sum(max(1, abs(after.get(thread, 0) - before.get(thread, 0)))
               for thread in before.keys() | after.keys() if before.get(thread) != after.get(thread))


class Rest(threading.Thread):
    """An agent that has done its first work and is then left alone, while other things are measured: it sleeps, so it
    is in nobody's way, and a counter of its switches does not mind a busy machine."""

    def __init__(self, programs: Programs, effort: Effort):
        super().__init__()
        self.programs = programs
        self.seconds = effort.idle_seconds
        self.rows: list[Row] = []
        self.error: Exception | None = None

    def run(self):
        try:
            with self.programs.world(server=True) as world:
                self.measure(world)
        except Exception as error:  # for the main thread to see
            self.error = error

    def measure(self, world: World):
        with world.client() as client, world.client(MINIMAL) as other:
            for one in (client, other):
                one.call(PING)
            pid, reference = self.process(client, SERVICE), self.process(other, MINIMAL)
            self.rows.append(Row("resident after a ping", resident(pid), f"{resident(reference)} minimal service"))
            if not client.call(ADD, VeltoID=ACCOUNT, hashedpassword=hashed(PASSWORD))["success"]:
                raise RuntimeError("the account could not be added")
            client.call(INFO, VeltoID=ACCOUNT)
            client.call(LIST)
            client.call(STATUS)
        time.sleep(SETTLING_SECONDS)
        before = switches(pid), switches(reference)
        time.sleep(self.seconds)
        ours, theirs = wake_ups(before[0], switches(pid)), wake_ups(before[1], switches(reference))
        self.rows.append(Row("resident with an account", resident(pid), f"{resident(reference)} minimal service"))
        self.rows.append(Row(f"wake-ups in {self.seconds} s at rest", str(ours), f"{theirs} minimal service",
                             verdict="ok" if ours == 0 else "OVER", limit=0))

    @staticmethod
    def process(client: Client, service: str) -> int:
        return Proxy(message_bus, client.connection).GetConnectionUnixProcessID(service)[0]


# --- The table

def print_table(rows: list[Row]):
    table = [["what", "ours", "reference", "ratio", "limit", ""], *(row.cells() for row in rows)]
    widths = [max(len(line[column]) for line in table) for column in range(len(table[0]))]
    for line in table:
        print("  ".join(cell.ljust(width) for cell, width in zip(line, widths)).rstrip())


def main() -> int:
    parser = argparse.ArgumentParser(description="Measures the agent against references in the same run.")
    parser.add_argument("--quick", action="store_true", help="fewer and shorter runs: a first impression")
    parser.add_argument("--build", type=pathlib.Path, default=ROOT / "build" / "release", metavar="DIRECTORY")
    options = parser.parse_args()
    effort = QUICK if options.quick else Effort()
    programs = Programs(options.build.resolve())
    os.environ["VELTOID_AGENT"] = str(programs.agent)
    os.environ["HARBWELL_IDLE_EXIT"] = "0"  # the agent at rest is there to be looked at

    rows = []
    failures = []

    def add(what: str, measure):
        print(f"bench: {what}", flush=True)
        try:
            rows.extend(measure())
        except Exception as error:  # the rest is still worth having
            failures.append(f"{what}: {error}")

    # All processors are needed for this one.
    add("many clients", lambda: load_rows(effort))
    rest = Rest(programs, effort)
    rest.start()
    for what, measure in (("the bus", bus_rows), ("texts", text_rows),
                          ("property lists", property_list_rows), ("the find-person cache", find_person_rows),
                          ("certificates", certificate_rows), ("TLS", tls_rows)):
        add(what, functools.partial(measure, programs, effort))
    print("bench: waiting for the agent at rest", flush=True)
    rest.join()
    rows += rest.rows
    if rest.error:
        failures.append(f"the agent at rest: {rest.error}")

    print(f"\nMedians over {effort.runs} runs ({effort.cold_starts} cold starts); {os.cpu_count()} processors\n")
    print_table(rows)
    for failure in failures:
        print(f"bench: failed: {failure}", file=sys.stderr)
    return 1 if failures else 0


if __name__ == "__main__":
    sys.exit(main())
