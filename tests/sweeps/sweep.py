"""Disturbs upgrades of the example appliance, once a case, and says what they do not survive."""

import argparse
import ctypes
import multiprocessing
import resource
import subprocess
import sys
import time
from collections import Counter

import fault
import kill
import power
from appliance import Appliance, Wrong

SWEEPS = {"kill": kill.Sweep, "fault": fault.Sweep, "power": power.Sweep}
CLONE_NEWNS = 0x20000
ENOUGH = 50  # failed cases


def arguments():
    parser = argparse.ArgumentParser(prog="scripts/sweep", description=__doc__)
    parser.add_argument("kind", choices=SWEEPS)
    parser.add_argument("--wal", action="store_true", help="the database is in WAL mode")
    parser.add_argument(
        "--every",
        metavar="N",
        type=int,
        default=1,
        help="only each N-th case, but all of the capability files",
    )
    parser.add_argument("--from", dest="first", metavar="N", type=int, default=1)
    parser.add_argument("case", nargs="?", help="only this case, as a failed one is printed")
    return parser.parse_args()


def private_var():
    """Gives a worker process a /var of its own."""
    if ctypes.CDLL(None, use_errno=True).unshare(CLONE_NEWNS) != 0:
        raise OSError(ctypes.get_errno(), "unshare")
    subprocess.run(["mount", "-t", "tmpfs", "tmpfs", "/var"], check=True)


def in_parallel(function, cases):
    """Yields the results of function, in the order of the cases, from a process for each core."""
    with multiprocessing.Pool(initializer=private_var) as pool:
        yield from pool.imap(function, cases)


def check(case):
    """Runs in a worker, which has the sweep from its parent."""
    sweep.appliance.notes.clear()
    try:
        sweep.check(case)
        return None, sweep.appliance.notes
    except Wrong as wrong:
        return str(wrong), sweep.appliance.notes


def chosen(cases, args):
    if args.case:
        return [args.case]
    return [
        case
        for number, (case, in_full) in enumerate(cases, 1)
        if number >= args.first and (in_full or number % args.every == 0)
    ]


def show_progress(done, total, start):
    if sys.stderr.isatty():
        left = (time.monotonic() - start) / done * (total - done) / 60
        text = f"{done} of {total} cases, {left:.1f} minutes left"
        print(f"\r{text}\x1b[K", end="" if done < total else "\n", file=sys.stderr, flush=True)


def main():
    global sweep
    args = arguments()
    resource.setrlimit(resource.RLIMIT_CORE, (0, 0))
    appliance = Appliance(args.wal, in_parallel)
    sweep = SWEEPS[args.kind](appliance)
    cases = chosen(sweep.cases(), args)
    options = " --wal" if args.wal else ""
    done = failed = 0
    notes = Counter()
    start = time.monotonic()
    results = zip(cases, in_parallel(check, cases))
    for done, (case, (wrong, noted)) in enumerate(results, 1):
        notes.update(noted)
        if wrong:
            failed += 1
            print(f"scripts/sweep {args.kind}{options} '{case}': {wrong}", flush=True)
        show_progress(done, len(cases), start)
        if failed == ENOUGH:
            break
    for note, count in sorted(notes.items()):
        print(f"{count} times: {note}")
    print(f"{args.kind}{options}: {done} cases, {failed} failed")
    return 0 if done == len(cases) > 0 and not failed else 1


if __name__ == "__main__":
    sys.exit(main())
