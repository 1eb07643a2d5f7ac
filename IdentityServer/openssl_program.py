"""The openssl program as the judge of what tests get; stands alone, like `control_client.py`."""

from __future__ import annotations

import subprocess
from os import PathLike

TIMEOUT = 60


def openssl(*arguments: str | PathLike, stdin: bytes | str = b"") -> bytes | str:
    """What the program prints, as text if it is given a text; AssertionError with its complaint when it fails."""
    is_text = isinstance(stdin, str)
    done = subprocess.run(["openssl", *arguments], input=stdin.encode() if is_text else stdin, capture_output=True,
                          timeout=TIMEOUT, check=False)
    if done.returncode != 0:
        raise AssertionError(f"openssl {arguments[0]}: {done.stderr.decode()}")
    return done.stdout.decode() if is_text else done.stdout
