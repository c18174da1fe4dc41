"""Runs a sweep: disturbs upgrades of the example appliance, once a case."""

import argparse
import re
import sys
from functools import partial
from itertools import dropwhile, islice, pairwise

from appliance import CAPS, DATABASE, LOG, TOOL, Recording
from appliance import capabilities, create, different, rows
from undo import undos

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
MOST = 1000  # more disks than a cut can leave if the tool syncs


def kills(upgrade):
    return [(call,) for call in upgrade.changes()]


def faults(upgrade):
    """Each error that a call can have, after the loader's calls."""
    calls = dropwhile(lambda call: LOG.name not in call.line, upgrade.calls)
    for call in calls:
        found = (ERRORS[kind] for kind in ERRORS if re.match(kind, call.line))
        for error in next(found, "").split():
            yield call, error
        if re.match(f'openat.*/{DATABASE}", O_RDWR', call.line):
            left = upgrade.disturb(call, "error=EIO")[1]
            upgrade.failures.append(rows(left))


def check_fault(upgrade, call, error):
    status, left = upgrade.disturb(call, f"error={error}")
    log = LOG.read_text() if LOG.exists() else ""
    lasts = "+" in error
    complete = upgrade.check(left) == upgrade.steps[-1]
    if status == 0:
        assert complete, "ended with 0 and other rows"
        stay = different(capabilities(left), capabilities(upgrade.end))
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


def cuts(upgrade):
    """The disks that a power cut can leave after each change."""
    seen = set()
    for before, call in pairwise(upgrade.calls):
        ended = "exit_group" in call.line
        changed = ended or call.disk != before.disk
        disks = call.disk.cuts() if changed else ()
        for number, left in enumerate(islice(disks, MOST)):
            # What an early cut may leave can be too old for a later one.
            key = hash((call.step, ended, frozenset(left.items())))
            if key not in seen:
                seen.add(key)
                yield call, str(number)


def check_cut(upgrade, call, number):
    left = next(islice(call.disk.cuts(), int(number), None))
    back = call.step - upgrade.steps.index(upgrade.check(left))
    assert back <= 0, f"takes back {back} transactions"
    kept = capabilities(left) == capabilities(call.disk.live())
    assert kept or "exit_group" not in call.line, "takes back a finished file"


def upgrades(kind, wal):
    """The cases of a kind: their names, whether always, and the checks."""
    start = create(f"journal_mode={'wal' if wal else 'delete'}")
    upgrade = Recording(start, *TOOL)
    # The second action on capability files alone, as after a failed first.
    upgrade.versions |= Recording(start, TOOL[0], "70").versions
    find, check = {
        "kill": (kills, Recording.check_kill),
        "fault": (faults, check_fault),
        "power": (cuts, check_cut),
    }[kind]
    for call, *details in find(upgrade):
        name = " ".join([call.name, *details])
        always = re.search(f"{CAPS}|exit_group", call.line)
        yield name, always, partial(check, upgrade, call, *details)


parser = argparse.ArgumentParser("scripts/sweep", allow_abbrev=False)
parser.add_argument("kind")
parser.add_argument("--wal", action="store_true")
parser.add_argument("--every", type=int, default=1)
parser.add_argument("case", nargs="?")
args = parser.parse_intermixed_args()
if args.every < 1 or (args.wal and args.kind == "undo"):
    parser.error("--every needs a number above 0, and undo takes no --wal")
sweep = args.kind + (" --wal" if args.wal else "")
cases = undos() if args.kind == "undo" else upgrades(args.kind, args.wal)

chosen = []
for number, (name, always, check) in enumerate(cases, 1):
    due = always or number % args.every == 0
    if name == args.case or (due and not args.case):
        chosen.append((name, check))
if not chosen:
    parser.error(f"no case '{args.case}'" if args.case else "no case is due")
failed = done = 0
for done, (name, check) in enumerate(chosen, 1):
    try:
        check()
    except Exception as reason:
        failed += 1
        text = reason if isinstance(reason, AssertionError) else repr(reason)
        print(f"scripts/sweep {sweep} '{name}': {text}", flush=True)
        if failed == 20:  # one fault makes many cases fail
            break
print(f"{sweep}: {done} of {len(chosen)} cases, {failed} failed")
sys.exit(failed > 0)
