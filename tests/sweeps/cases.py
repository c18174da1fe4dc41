"""Runs the cases of a sweep."""

import sys
import time

MOST_FAILURES = 20  # one fault makes many cases fail


def run(sweep, cases, case, check):
    """Checks the cases, which begin with their names. Returns the status.

    Case is the name that was asked for, if any. Prints the command that
    repeats a failed case.
    """
    cases = list(cases)
    if not cases:
        reason = f"no case '{case}'" if case else "no case is due"
        print(f"scripts/sweep {sweep}: {reason}", file=sys.stderr)
        return 2
    failed = done = 0
    start = time.monotonic()
    for done, (name, *details) in enumerate(cases, 1):
        try:
            check(*details)
        except Exception as reason:
            failed += 1
            known = isinstance(reason, AssertionError)
            text = reason if known else repr(reason)
            print(f"scripts/sweep {sweep} '{name}': {text}", flush=True)
        if failed == MOST_FAILURES:
            print(f"{sweep}: stops after {failed} failures")
            break
        if sys.stderr.isatty():
            left = (time.monotonic() - start) / done * (len(cases) - done) / 60
            text = f"{sweep}: {done} of {len(cases)}, {left:.1f} minutes left"
            print(text, end="\x1b[K\r", file=sys.stderr, flush=True)
    print(f"{sweep}: {done} cases, {failed} failed")
    return 1 if failed else 0
