"""Random values through the agent's XML-RPC code and Python's: what one writes, the other must read as the same value.

usage: xmlrpc_property_test.py PEER
"""

from __future__ import annotations

import base64
import datetime
import random
import re
import subprocess
import sys
import xmlrpc.client

SEED = 20_260_117
DOCUMENTS = 1500
DEEPEST = 5
LONGEST_REPORT = 2000
EPOCH = datetime.datetime(1970, 1, 1)

# What the agent's parser takes off both ends of a text.
WHITE_SPACE = ("\t\n\v\f\r \x85\xa0\u1680\u2000\u2001\u2002\u2003\u2004\u2005\u2006\u2007\u2008\u2009\u200a"
               "\u2028\u2029\u202f\u205f\u3000")
# Everything that has a meaning in XML, white space of all kinds, and characters of one to four bytes.
CHARACTERS = "ab01<>&\"';#x]\\ \t\n\r\x7f\x85\xa0\u2003\u3000\xe9\u20ac\u200b\ufeff\U0001f600"


class Generator:
    def __init__(self, seed: int, for_parser: bool):
        self.random = random.Random(seed)
        # The parser keeps 32 bits of an integer; Python's writer has no form for None.
        self.bits = 31 if for_parser else 63
        self.leaves = [self.integer, self.double, self.text, self.date, self.data,
                       lambda: self.random.random() < 0.5]
        if not for_parser:
            self.leaves.append(lambda: None)

    def integer(self) -> int:
        bits = self.random.randint(0, self.bits)
        return self.random.choice([self.random.randint(-(1 << bits), (1 << bits) - 1), -(1 << self.bits)])

    def double(self) -> float:
        choices = [self.random.uniform(-10, 10), self.random.gauss(0, 1) * 10.0 ** self.random.randint(-300, 300),
                   0.1 * self.random.randint(0, 9), -0.0, 5e-324, sys.float_info.max, float(1 << 53)]
        return self.random.choice(choices)

    def text(self) -> str:
        return "".join(self.random.choices(CHARACTERS, k=self.random.choice([0, 1, 2, 5, 40, 400])))

    def date(self) -> datetime.datetime:
        # Python's writer pads no year of less than four digits.
        first, last = datetime.datetime(1000, 1, 1), datetime.datetime(9999, 12, 31, 23, 59, 59)
        return first + datetime.timedelta(seconds=self.random.randint(0, int((last - first).total_seconds())))

    def data(self) -> bytes:
        return self.random.randbytes(self.random.choice([0, 1, 2, 3, 47, 48, 49, 57, 96, 1000]))

    def value(self, depth: int = 0):
        kind = self.random.random()
        if depth == DEEPEST or kind < 0.4:
            return self.random.choice(self.leaves)()
        if kind < 0.7:
            return [self.value(depth + 1) for _ in range(self.random.randint(0, 6))]
        members = {}
        for _ in range(self.random.choice([0, 1, 3, 12])):
            name = self.text()
            # Names that differ in their outer white space only are one name to the parser.
            if trimmed(name) not in {trimmed(each) for each in members}:
                members[name] = self.value(depth + 1)
        return members


def line_ends_read(text: str) -> str:
    """What every XML reader makes of line ends."""
    return text.replace("\r\n", "\n").replace("\r", "\n")


def trimmed(text: str) -> str:
    return line_ends_read(text).strip(WHITE_SPACE)


def coded(kind: str, content: bytes) -> str:
    return kind + base64.b64encode(content).decode()


def words(value, text=lambda each: each) -> str:
    """The value in the peer's words, every text put through a function first."""
    match value:
        case None: return "n"
        case bool(): return f"b{int(value)}"
        case int(): return f"i{value}"
        case float(): return f"d{value!r}"
        case str(): return coded("s", text(value).encode())
        case bytes(): return coded("x", value)
        case datetime.datetime(): return f"t{int((value - EPOCH).total_seconds())}"
        case list(): return " ".join([f"a{len(value)}", *(words(each, text) for each in value)])
        case dict():
            pairs = (f"{words(name, text)} {words(each, text)}" for name, each in value.items())
            return " ".join([f"m{len(value)}", *pairs])
    raise TypeError(value)


def in_our_notation(answer: str) -> str:
    """Both sides write the shortest form of a double, but not in the same notation."""
    return re.sub(r"(?<!\S)d(\S+)", lambda double: f"d{float(double[1])!r}", answer)


def as_read_by_python(value):
    """What Python's reader makes of a value that the agent's encoder wrote."""
    match value:
        case str(): return line_ends_read(value)
        case datetime.datetime(): return xmlrpc.client.DateTime(value.strftime("%Y%m%dT%H:%M:%SZ"))
        case bytes(): return xmlrpc.client.Binary(value)
        case list(): return [as_read_by_python(each) for each in value]
        case dict(): return {line_ends_read(name): as_read_by_python(each) for name, each in value.items()}
    return value


def answers(peer: str, tasks: list[str]) -> list[str]:
    """What the peer says to each task."""
    run = subprocess.run([peer], input="".join(f"{task}\n" for task in tasks), stdout=subprocess.PIPE, text=True)
    lines = run.stdout.splitlines()
    if len(lines) < len(tasks):
        sys.exit(f"the peer ended at: {tasks[len(lines)][:LONGEST_REPORT]}")
    return lines


def check_parser(peer: str) -> None:
    generator = Generator(SEED, for_parser=True)
    written, expected = [], []
    for number in range(DOCUMENTS):
        value, kind = generator.value(), "value"
        document = xmlrpc.client.dumps((value,), methodresponse=True)
        if number % 10 == 0:
            fault = xmlrpc.client.Fault(generator.integer(), generator.text())
            document, kind = xmlrpc.client.dumps(fault), "fault"
            value = {"faultCode": fault.faultCode, "faultString": fault.faultString}
        written.append(document)
        expected.append(f"{kind} {words(value, trimmed)}")
    read = answers(peer, [coded("parse ", document.encode()) for document in written])
    for number, (document, ours, theirs) in enumerate(zip(written, read, expected)):
        if in_our_notation(ours) != theirs:
            sys.exit(f"document {number}:\n{document}\nread as:\n{ours}\ninstead of:\n{theirs}")


def check_encoder(peer: str) -> None:
    generator = Generator(SEED + 1, for_parser=False)
    values = [generator.value() for _ in range(DOCUMENTS)]
    written = answers(peer, [f"encode {words(value)}" for value in values])
    for number, (value, line) in enumerate(zip(values, written)):
        document = base64.b64decode(line).decode()
        parameters, method = xmlrpc.client.loads(document)
        if method != "test" or parameters != (as_read_by_python(value),):
            sys.exit(f"value {number}:\n{value!r}\nwritten as:\n{document}\nread as:\n{parameters!r}")


if __name__ == "__main__":
    check_parser(sys.argv[1])
    check_encoder(sys.argv[1])
    print(f"{DOCUMENTS} responses parsed and {DOCUMENTS} requests encoded alike")
