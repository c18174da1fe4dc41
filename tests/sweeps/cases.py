"""Runs the cases of a sweep."""

import sqlite3
import sys
import time
from subprocess import TimeoutExpired


def run(sweep, cases, check):
    """Checks all cases, which begin with their names. Returns the status.

    Prints the command that repeats a failed one.
    """
    cases = list(cases)
    failed = 0
    start = time.monotonic()
    for done, (name, *case) in enumerate(cases, 1):
        try:
            check(*case)
        except (AssertionError, sqlite3.Error, TimeoutExpired) as reason:
            failed += 1
            print(f"scripts/sweep {sweep} '{name}': {reason}", flush=True)
        if sys.stderr.isatty():
            left = (time.monotonic() - start) / done * (len(cases) - done) / 60
            text = f"{sweep}: {done} of {len(cases)}, {left:.1f} minutes left"
            print(text, end="\x1b[K\r", file=sys.stderr, flush=True)
    print(f"{sweep}: {len(cases)} cases, {failed} failed")
    return 0 if cases and not failed else 1
