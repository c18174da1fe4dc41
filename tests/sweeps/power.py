"""Cuts the power after each operation of a recorded run, and upgrades what the disk then holds.

The runs have synchronous = FULL, SQLite's default, and NORMAL. In WAL mode two more run beside a
recorder that has the database open, so that nothing is moved from the log to the database. One run
sets a value in a settings file.
"""

import contextlib
import subprocess
from pathlib import Path
from typing import NamedTuple

import appliance
import disk
from appliance import DATABASE, TARGET, File, Wrong

PRELOADED = "build/release/synchronous.so"
SETTINGS = "settings"
JOURNAL = DATABASE + "-journal"
OLD = File(b"".join(b'key%d="value"\n' % n for n in range(100)), 0o640, (0, 0))
# How many finished transactions that changed rows a power cut may take back: the removal of a
# rollback journal is not synced. Of a log that is not synced, all may be missing.
TAKEN_BACK = {"FULL": 1, "NORMAL": 1, "FULL-wal": 0, "NORMAL-wal": 0, "FULL-recorder": 0}


class Moment(NamedTuple):
    """A recorded run after one of its operations."""

    line: str
    state: tuple
    done: int  # how many transactions
    journal: File  # as it is without a cut


@contextlib.contextmanager
def recorder():
    """A process that has the database open."""
    pipe = subprocess.PIPE
    shell = subprocess.Popen(["sqlite3", TARGET / DATABASE], stdin=pipe, stdout=pipe, text=True)
    print("SELECT count(*) FROM camera;", file=shell.stdin, flush=True)
    shell.stdout.readline()
    yield
    shell.communicate()


def client():
    """The program that sets a value."""
    return next(path for path in Path("build/release/tests").rglob("client") if path.is_file())


def kept():
    """What the appliance holds, but for shared memory, which is made anew after a power cut."""
    held = appliance.read_disk().items()
    return {name: file for name, file in held if not name.endswith("-shm")}


def record(command, options=()):
    """Traces a run on what the appliance holds. Returns its moments."""
    model = disk.Model(kept())
    moments = []
    done = 0
    in_use = False
    for call in appliance.trace(*disk.TRACE, *options, command=command):
        if model.replay(call.line):
            line = f"{call.name} {call.number}"
            moments.append(Moment(line, model.state(), done, model.live_file(JOURNAL)))
        done += in_use and not model.is_open(DATABASE)
        in_use = model.is_open(DATABASE)
    if model.live_disk() != kept():
        raise SystemExit("the recorded calls do not make the files that the run has left")
    return moments


class Sweep:
    def __init__(self, target):
        self.appliance = target
        source = "tests/sweeps/synchronous.cpp"
        subprocess.run(["c++", "-shared", "-fPIC", source, "-o", PRELOADED], check=True)
        end = "-wal" if target.wal else ""
        self.runs = {name + end: self.upgrade(name) for name in ("FULL", "NORMAL")}
        if target.wal:
            for name in ("FULL", "NORMAL"):
                self.runs[name + "-recorder"] = self.upgrade(name, recorder())
        appliance.write_disk({SETTINGS: OLD})
        self.runs["settings"] = record([client(), "set", TARGET / SETTINGS, "key7", "new"])
        self.new = appliance.read_disk()[SETTINGS]

    def upgrade(self, synchronous, beside=contextlib.nullcontext()):
        preload = [f"-ELD_PRELOAD={PRELOADED}", f"-ESYNCHRONOUS={synchronous}"]
        appliance.write_disk(self.appliance.start)
        with beside:
            options = [] if synchronous == "FULL" else preload
            return record([appliance.TOOL, "0"], options)

    def cases(self):
        seen = set()
        transactions = len(self.appliance.connections())
        for name, moments in self.runs.items():
            for number, moment in enumerate(moments):
                ended = moment is moments[-1]
                in_full = name == "settings" or "FULL" in name and moment.done == transactions
                for cut, left in enumerate(disk.cut_disks(*moment.state)):
                    # A disk that an early cut may leave can be too old for a later one.
                    key = hash((ended, moment.done, frozenset(left.items())))
                    if key not in seen:
                        seen.add(key)
                        yield f"{name} {number} {cut}", in_full

    def check(self, case):
        name, number, cut = case.split()
        moment = self.runs[name][int(number)]
        left = list(disk.cut_disks(*moment.state))[int(cut)]
        try:
            if name == "settings":
                self.check_settings(left)
            else:
                ended = moment is self.runs[name][-1]
                self.check_upgrade(name, left, moment.done, ended)
        except Wrong as wrong:
            # With NORMAL only checksums tell a torn journal, and they are of each 200th byte.
            if name != "NORMAL" or left.get(JOURNAL) in (None, moment.journal):
                raise Wrong(f"after {moment.line}: {wrong}") from wrong
            self.appliance.notes.append("NORMAL: a torn journal damages the database")

    def check_upgrade(self, name, left, done, ended):
        target = self.appliance
        steps = target.steps
        back = target.step_after[done] - steps.index(target.check(left))
        if back > 0:
            much = "a transaction" if back == 1 else "several transactions"
            target.notes.append(f"{name}: {much} taken back")
        if back > TAKEN_BACK.get(name, len(steps)):
            raise Wrong(f"takes back {back} transactions")
        files = appliance.capability_files
        if ended and files(left) != files(target.end):
            raise Wrong("a change of a capability file is taken back after the end")

    def check_settings(self, left):
        file = left.pop(SETTINGS, None)
        if file in (OLD, self.new):
            what = "the old file" if file == OLD else "the new file"
        elif file and file.content in (OLD.content, self.new.content):
            what = "a whole file with the mode or owner of a temporary one"
        elif file:
            what = "a part of the new file" if file.content else "an empty file"
        else:
            raise Wrong("the settings are gone")
        self.appliance.notes.append(f"settings: {what}")
