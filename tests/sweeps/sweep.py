"""Disturbs upgrades of the example appliance, once a case."""

import argparse
import ctypes
import multiprocessing
import re
import signal
import sqlite3
import subprocess
import sys
import time
from itertools import islice, pairwise
from pathlib import Path

from appliance import DATABASE, TOOL, TRACE, Appliance
from appliance import capability_files, disturbed, record, rows
from disk import CAPS, LOG, TARGET, File, cut_disks

CHANGES = r"p?write|ftruncate|f?(data)?sync|f?ch(own|mod)|rename|unlink|open\w*\(.*O_CREAT"
# The first that matches. SQLite and the tool tell apart at most "again", "locked", "full" and
# others. What lasts in reality has a plus: each later call of the name fails too.
ERRORS = {
    r"open": "EIO EINTR EMFILE+",
    r"p?write": "EIO EINTR ENOSPC+",
    r"p?read(64)?\(|fsync|ftruncate": "EIO EINTR",
    r"rename|unlink": "EIO ENOSPC+",
    r"flock": "EIO EINTR EAGAIN",
    r"fcntl.*(RD|WR)LCK": "EIO EAGAIN",
    r"mmap|fdatasync|fchown|fchmod|[a-z]*stat|getdents": "EIO",
}
JOURNAL = DATABASE + "-journal"
PRELOADED = "build/release/normal.so"
SETTINGS = CAPS + "/settings"
OLD = b"".join(b'key%d="value"\n' % number for number in range(100))
MOST = 1000  # more disks than an upgrade that syncs can leave at one moment
CLONE_NEWNS = 0x20000


def kills():
    """At each system call that can change something, and at some others."""
    for number, call in enumerate(appliance.calls, 1):
        if number % 25 == 0 or re.match(CHANGES, call.line):
            yield call.name, CAPS in call.line


def check_kill(case):
    status, left = disturbed(appliance.start, case, "signal=KILL")
    assert status == -signal.SIGKILL, f"not killed, but ended with {status}"
    appliance.check(left)


def faults():
    """Each error that a call can have, after the loader's calls."""
    started = False
    for call in appliance.calls:
        started = started or "camveld.log" in call.line
        errors = next((ERRORS[what] for what in ERRORS if re.match(what, call.line)), "")
        for error in errors.split() if started else ():
            yield f"{call.name} {error}", CAPS in call.line
        if re.match(rf'openat.*/{DATABASE}", O_RDWR', call.line):
            appliance.failures.add(rows(disturbed(appliance.start, call.name, "error=EIO")[1]))


def check_fault(case):
    call, error = case.rsplit(" ", 1)
    lasts = "+" if "+" in error else ""
    status, left = disturbed(appliance.start, call + lasts, f"error={error.rstrip('+')}")
    assert "INJECTED" in TRACE.read_text(), "the call did not come"
    line = appliance.lines[call]
    log = LOG.read_text() if LOG.exists() else ""
    whole = appliance.check(left) == appliance.steps[-1]
    files, end = capability_files(left), capability_files(appliance.end)
    assert files.keys() == end.keys(), "leaves a temporary file"
    if status == 0:
        assert whole, "ended with 0 and other rows"
        assert files == end or lasts or CAPS in line, "a file is not upgraded"
        assert "version: 0\n" in log or "camveld.log" in line, "a log line is missing"
        return
    assert status == 255, f"ended with {status}"
    said = whole or lasts or re.search(r"error\.$", log, re.M)
    assert said, "actions are missing, and the log does not say so"
    locks = re.match("flock|.*WRLCK", line)
    assert not locks or error != "EAGAIN", "does not wait for a lock"


def recordings():
    """The calls of runs with synchronous = FULL, SQLite's default, and NORMAL."""
    source = "tests/sweeps/normal.cpp"
    subprocess.run(["c++", "-shared", "-fPIC", source, "-o", PRELOADED], check=True)
    normal = f"-ELD_PRELOAD={PRELOADED}"
    yield "FULL", appliance.calls
    yield "NORMAL", record(appliance.start, normal, TOOL, "0")[0]
    if appliance.wal:
        yield "FULL-recorder", record(appliance.start, TOOL, "0", recorder=True)[0]
        yield "NORMAL-recorder", record(appliance.start, normal, TOOL, "0", recorder=True)[0]
    client = next(Path("build/release/tests").rglob("client"))
    old = {SETTINGS: File(OLD, 0o640)}
    yield "settings", record(old, client, "set", TARGET / SETTINGS, "key7", "new")[0]


def cuts():
    """The run, the last call before the cut, and the disk that is left."""
    appliance.runs = dict(recordings())
    seen = set()
    for run, calls in appliance.runs.items():
        for before, call in pairwise(calls):
            disks = cut_disks(*call.state) if call.state != before.state else ()
            for number, left in enumerate(islice(disks, MOST)):
                # A disk that an early cut may leave can be too old for a later one.
                key = hash((call.step, call.state == calls[-1].state, frozenset(left.items())))
                if key not in seen:
                    seen.add(key)
                    in_full = CAPS in call.line and run in ("FULL", "settings")
                    yield f"{run} {call.name} {number}", in_full


def check_cut(case):
    run, *name, number = case.split()
    calls = appliance.runs[run]
    call = next(call for call in calls if call.name.split() == name)
    left = next(islice(cut_disks(*call.state), int(number), None))
    if run == "settings":
        content = left[SETTINGS].content
        new = next(cut_disks(*calls[-1].state))[SETTINGS].content
        assert content == OLD or new.startswith(content), "neither old nor new settings"
        return
    # With NORMAL only checksums tell a torn journal, and they are of each 200th byte.
    journal = next(cut_disks(*call.state)).get(JOURNAL)
    if run == "NORMAL" and left.get(JOURNAL) not in (None, journal):
        return
    back = call.step - appliance.steps.index(appliance.check(left))
    # The removal of a rollback journal is not synced, nor is the log with NORMAL.
    may = len(appliance.steps) if run == "NORMAL-recorder" else not appliance.wal
    assert back <= may, f"takes back {back} transactions"
    kept = capability_files(left) == capability_files(appliance.end)
    assert kept or call.state != calls[-1].state, "takes back a finished file"


KINDS = {"kill": (kills, check_kill), "fault": (faults, check_fault), "power": (cuts, check_cut)}


def private_var():
    """Gives a worker process a /var of its own."""
    if ctypes.CDLL(None, use_errno=True).unshare(CLONE_NEWNS) != 0:
        raise OSError(ctypes.get_errno(), "unshare")
    subprocess.run(["mount", "-t", "tmpfs", "tmpfs", "/var"], check=True)


def wrong(case):
    """Runs in a worker, a fork of this process. Returns what is wrong."""
    try:
        KINDS[args.kind][1](case)
    except (AssertionError, sqlite3.Error, subprocess.TimeoutExpired) as reason:
        return str(reason)


parser = argparse.ArgumentParser("scripts/sweep")
parser.add_argument("kind", choices=KINDS)
parser.add_argument("--wal", action="store_true")
parser.add_argument("--every", type=int, default=1)
parser.add_argument("--from", dest="first", type=int, default=1)
parser.add_argument("case", nargs="?")
args = parser.parse_intermixed_args()

appliance = Appliance(args.wal)
cases = [
    case
    for number, (case, in_full) in enumerate(KINDS[args.kind][0](), 1)
    if number >= args.first and (in_full or number % args.every == 0)
]
cases = [args.case] if args.case else cases
sweep = args.kind + " --wal" * args.wal
failed = 0
start = time.monotonic()
with multiprocessing.Pool(initializer=private_var) as pool:
    for done, reason in enumerate(pool.imap(wrong, cases, chunksize=4), 1):
        if reason:
            failed += 1
            print(f"scripts/sweep {sweep} '{cases[done - 1]}': {reason}", flush=True)
        if sys.stderr.isatty():
            left = (time.monotonic() - start) / done * (len(cases) - done) / 60
            text = f"{done} of {len(cases)} cases, {left:.1f} minutes left\x1b[K\r"
            print(text, end="", file=sys.stderr, flush=True)
print(f"{sweep}: {len(cases)} cases, {failed} failed")
sys.exit(0 if cases and not failed else 1)
