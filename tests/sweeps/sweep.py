"""Disturbs upgrades of the example appliance, once a case."""

import argparse
import re
import sys
from functools import partial
from itertools import dropwhile, islice, pairwise

from appliance import CAPS, DATABASE, LOG, TARGET, TOOL, Appliance
from appliance import capabilities, different, disturb, record, rows
import cases

CHANGES = "p?write|ftruncate|f(data)?sync|fch|rename|unlink|open.*O_CREAT"
# The first that matches. SQLite and the tool tell apart at most "again",
# "locked", "full" and others. After a plus, the later calls fail too.
ERRORS = {
    r"open": "EIO EINTR EMFILE+",
    r"p?write": "EIO EINTR ENOSPC+",
    r"p?read(64)?\(|fsync|ftruncate": "EIO EINTR",
    r"rename|unlink": "EIO ENOSPC+",
    r"flock": "EIO EINTR EAGAIN",
    r"fcntl.*(RD|WR)LCK": "EIO EAGAIN",
    r"mmap|fdatasync|fchown|fchmod|[a-z]*stat|getdents": "EIO",
}
SETTINGS = f"{CAPS}/settings"
OLD = b"".join(b'key%d="value"\n' % number for number in range(100, 200))
NEW = OLD.replace(b'107="value"', b'107="new"')
MOST = 1000  # more disks than a cut can leave if the tool syncs


def kills(appliance):
    """The calls that can change something."""
    calls = appliance.calls
    return [(call,) for call in calls if re.match(CHANGES, call.line)]


def check_kill(appliance, call):
    appliance.check(disturb(appliance.start, call.name, "signal=KILL")[1])


def faults(appliance):
    """Each error that a call can have, after the loader's calls."""
    calls = dropwhile(lambda call: LOG.name not in call.line, appliance.calls)
    for call in calls:
        found = (ERRORS[kind] for kind in ERRORS if re.match(kind, call.line))
        for error in next(found, "").split():
            yield call, error
        if re.match(f'openat.*/{DATABASE}", O_RDWR', call.line):
            left = disturb(appliance.start, call.name, "error=EIO")[1]
            appliance.failures.append(rows(left))


def check_fault(appliance, call, error):
    status, left = disturb(appliance.start, call.name, f"error={error}")
    log = LOG.read_text() if LOG.exists() else ""
    lasts = "+" in error
    complete = appliance.check(left) == appliance.steps[-1]
    if status == 0:
        assert complete, "ended with 0 and other rows"
        stay = different(capabilities(left), capabilities(appliance.end))
        # A call on a file costs that file, one on the directory all files.
        directory = re.search(f'{CAPS}[>"]', call.line)
        one = len(stay) == 1 and CAPS in call.line
        may_stay = not stay or one or directory or lasts
        assert may_stay, f"these files are not upgraded: {stay}"
        assert "version: 0\n" in log or LOG.name in call.line, "no log line"
    else:
        assert status == 255, f"ended with {status}"
        said = complete or lasts or re.search(r"error\.$", log, re.M)
        assert said, "does not log that an action failed"


def recordings(appliance):
    """Calls with this SQLite, and with one whose connections sync less."""
    yield "default", appliance.calls
    normal = ["-ELD_PRELOAD=build/release/tests/libnormal.so", *TOOL]
    yield "NORMAL", record(appliance.start, *normal)[0]
    client = "build/release/tests/unit/client"
    change = [client, "set", f"{TARGET}/{SETTINGS}", "key107", "new"]
    yield "settings", record({SETTINGS: OLD}, *change)[0]


def cuts(appliance):
    """The disks that a power cut can leave after each change."""
    seen = set()
    for run, calls in recordings(appliance):
        for before, call in pairwise(calls):
            ended = "exit_group" in call.line
            changed = ended or call.disk != before.disk
            disks = call.disk.cuts() if changed else ()
            for number, left in enumerate(islice(disks, MOST)):
                # What an early cut may leave can be too old for a later one.
                key = hash((call.step, ended, frozenset(left.items())))
                if key not in seen:
                    seen.add(key)
                    yield call, run, str(number)


def check_cut(appliance, call, run, number):
    left = next(islice(call.disk.cuts(), int(number), None))
    live = call.disk.live()
    if run == "settings":
        whole = left[SETTINGS] == OLD or NEW.startswith(left[SETTINGS])
        assert whole, "neither old nor new settings"
        return
    back = call.step - appliance.steps.index(appliance.check(left))
    assert back <= 0, f"takes back {back} transactions"
    kept = capabilities(left) == capabilities(live)
    assert kept or "exit_group" not in call.line, "takes back a finished file"


KINDS = {"kill": kills, "fault": faults, "power": cuts}
CHECKS = {"kill": check_kill, "fault": check_fault, "power": check_cut}


def chosen(cases, args):
    """The case that is named, or those that are due, with their names."""
    numbered = islice(enumerate(cases, 1), args.first - 1, None)
    for number, (call, *details) in numbered:
        name = " ".join([call.name, *details])
        always = re.search(f"{CAPS}|exit_group", call.line)
        due = always or number % args.every == 0
        if (args.case and name == args.case) or (not args.case and due):
            yield name, call, *details


parser = argparse.ArgumentParser("scripts/sweep")
parser.add_argument("kind", choices=KINDS)
parser.add_argument("--wal", action="store_true")
parser.add_argument("--every", type=int, default=1)
parser.add_argument("--from", dest="first", type=int, default=1)
parser.add_argument("case", nargs="?")
args = parser.parse_intermixed_args()

appliance = Appliance(args.wal)
check = partial(CHECKS[args.kind], appliance)
found = chosen(KINDS[args.kind](appliance), args)
name = args.kind + (" --wal" if args.wal else "")
sys.exit(cases.run(name, found, args.case, check))
