"""The example appliance: its runs, and what a disturbed one may leave."""

import re
import shutil
import sqlite3
import subprocess
from collections import Counter
from contextlib import closing
from pathlib import Path
from typing import NamedTuple

from disk import CAPS, TARGET, cut_disks, model, read_disk, replay, write_disk

TOOL = "build/release/main/tesselupgrader"
DATABASE = "system.db"
TRACE = Path("/var/trace")


class Call(NamedTuple):
    name: str  # and its number among the calls of this name, from 1
    line: str
    state: tuple  # of the model, after the call
    step: int  # the last step before it


def run(*under):
    """Runs the tool and returns its status."""
    null = subprocess.DEVNULL
    return subprocess.run([*under, TOOL, "0"], stdout=null, stderr=null, timeout=60).returncode


def disturbed(start, call, what):
    """Runs from the start with a call disturbed. Returns the status and the disk."""
    write_disk(start)
    name, number = call.split()
    # The filter is faster, but signals do not come through it.
    fast = [] if "signal" in what else ["--seccomp-bpf", "-f"]
    inject = [f"--trace={name}", f"--inject={name}:{what}:when={number}"]
    status = run("strace", *fast, "-o", TRACE, *inject)
    return status, read_disk()


def record(disk, *command, recorder=False):
    """Traces a run. Returns its calls, the rows after each transaction that changes some, and
    the capability files between its actions."""
    write_disk(disk)
    if recorder:  # has the database open, so that nothing is moved from the log to it
        database = sqlite3.connect(TARGET / DATABASE)
        database.execute("SELECT count(*) FROM camera").fetchall()
    strace = ["strace", "-y", "-s", "1000000", "-o", TRACE, *command]
    subprocess.run(strace, check=True, stdout=subprocess.DEVNULL)
    calls, steps, versions = [], [rows(disk)], set()
    state, count = model(disk), Counter()
    for line in TRACE.read_text().splitlines():
        name = line.split("(")[0]
        count[name] += 1
        state = replay(state, line)
        live = next(cut_disks(*state))
        if re.match(rf"close.*/{DATABASE}>", line) and rows(live) != steps[-1]:
            steps.append(rows(live))
        if re.match(rf'openat.*/{CAPS}", .*O_NONBLOCK|exit_group', line):
            versions.update(capability_files(live).items())
        calls.append(Call(f"{name} {count[name]}", line, state, len(steps) - 1))
    assert live.items() <= read_disk().items(), "the model is wrong"
    return calls, steps, versions


def rows(disk):
    """The database as lines of SQL."""
    # A copy, so that what there is to recover is left to the next run.
    copy = Path("/var/copy")
    shutil.rmtree(copy, ignore_errors=True)
    copy.mkdir()
    for name in {DATABASE, DATABASE + "-journal", DATABASE + "-wal"} & disk.keys():
        (copy / name).write_bytes(disk[name].content)
    with closing(sqlite3.connect(copy / DATABASE)) as database:
        integrity = database.execute("PRAGMA integrity_check").fetchall()
        assert integrity == [("ok",)], f"the database is damaged: {integrity}"
        return tuple(database.iterdump())


def capability_files(disk):
    return {name: file for name, file in disk.items() if name.startswith(CAPS)}


def difference(lines, others):
    return sorted(set(lines) ^ set(others))


class Appliance:
    def __init__(self, wal):
        write_disk({})
        with closing(sqlite3.connect(TARGET / DATABASE)) as database:
            database.execute(f"PRAGMA journal_mode={'wal' if wal else 'delete'}")
            database.executescript(Path("examples/appliance.sql").read_text())
        shutil.copytree("examples/KICapInfo", TARGET / CAPS, dirs_exist_ok=True)
        self.wal = wal
        self.start = read_disk()
        # The second action on capability files alone, as after a failed first one.
        second = record(self.start, TOOL, "70")[2]
        self.calls, self.steps, first = record(self.start, TOOL, "0")
        self.versions = first | second
        self.lines = {call.name: call.line for call in self.calls}
        self.end = read_disk()
        self.failures = set()  # the rows after one failed transaction
        self.checked = {}

    def check(self, left):
        """Rows and files are whole, and a next run makes up. Returns the rows."""
        # All of this depends on nothing but the disk, and many cases leave the same.
        key = hash(frozenset(left.items()))
        if key not in self.checked:
            now = rows(left)
            whole = now in self.steps or now in self.failures
            near = min(self.steps, key=lambda step: len(difference(step, now)))
            assert whole, f"no whole number of transactions: {difference(near, now)[:4]}"
            parts = capability_files(left).items() - self.versions
            parts = {name for name, _ in parts} & self.start.keys()
            assert not parts, f"neither an old nor a new version: {parts}"
            self.check_next_run(left, now)
            self.checked[key] = now
        return self.checked[key]

    def check_next_run(self, left, now):
        write_disk(left)
        assert run() == 0, "the next run fails"
        end = read_disk()
        # UpdateAxisA8105E adds its rows each time. After a failed action,
        # UpdatePanasoniciPro2Panasonic renames cameras that the action has not changed.
        known = "DO 2|sqlite_sequence" + "|Panasonic" * (now not in self.steps)
        other = difference(rows(end), self.steps[-1])
        other = [line for line in other if not re.search(known, line)]
        assert not other, f"the next run comes to other rows: {other[:4]}"
        same = end | {DATABASE: None} == self.end | {DATABASE: None}
        assert same, f"the next run comes to other files: {list(end)}"
