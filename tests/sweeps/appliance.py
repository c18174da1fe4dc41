"""The example appliance in a private /var: its disk, its runs, and what a run may leave of it.

A disk is a dictionary from the name of a file below TARGET to its File.
"""

import functools
import re
import shutil
import sqlite3
import subprocess
from collections import Counter
from pathlib import Path
from typing import NamedTuple

TARGET = Path("/var/packages/Camveld/target")
LOG = Path("/var/log/camveld/camveld.log")
DATABASE = "system.db"
CAPS = "@camveld/@KICapInfo/"
TOOL = "build/release/main/tesselupgrader"
HANGS = 124


class File(NamedTuple):
    content: bytes
    mode: int
    owner: tuple


class Call(NamedTuple):
    name: str
    number: int  # among the calls of this name, from 1
    line: str


class Wrong(Exception):
    """What a case shows to be wrong."""


def read_disk():
    disk = {}
    for path in TARGET.rglob("*"):
        if path.is_file():
            stat = path.stat()
            owner = (stat.st_uid, stat.st_gid)
            name = str(path.relative_to(TARGET))
            disk[name] = File(path.read_bytes(), stat.st_mode & 0o7777, owner)
    return disk


def write_disk(disk):
    shutil.rmtree(TARGET, ignore_errors=True)
    LOG.unlink(missing_ok=True)
    (TARGET / CAPS).mkdir(parents=True)
    LOG.parent.mkdir(parents=True, exist_ok=True)
    for name, file in disk.items():
        (TARGET / name).write_bytes(file.content)
        (TARGET / name).chmod(file.mode)
        shutil.chown(TARGET / name, *file.owner)


def capability_files(disk):
    return {name: file for name, file in disk.items() if name.startswith(CAPS)}


def rows(disk):
    """All rows of the database, as lines."""
    names = (DATABASE, f"{DATABASE}-journal", f"{DATABASE}-wal")
    return recovered(tuple((name, disk[name].content) for name in names if name in disk))


@functools.lru_cache(maxsize=64)
def recovered(files):
    """Works on a copy, so that what there is to recover is left to the next run."""
    copy = Path("/var/copy")
    shutil.rmtree(copy, ignore_errors=True)
    copy.mkdir()
    for name, content in files:
        (copy / name).write_bytes(content)
    database = sqlite3.connect(copy / DATABASE)
    database.text_factory = bytes
    try:
        if database.execute("PRAGMA integrity_check").fetchall() != [(b"ok",)]:
            raise Wrong("the database is damaged")
        lines = [f"journal_mode {database.execute('PRAGMA journal_mode').fetchall()}"]
        tables = database.execute("SELECT name, sql FROM sqlite_master").fetchall()
        lines += [str(table) for table in tables]
        for name, _ in [(b"sqlite_sequence", None)] + tables:
            for row in database.execute(f"SELECT * FROM '{name.decode()}'"):
                lines.append(f"{name.decode()} {row}")
    except sqlite3.Error as error:
        raise Wrong(f"the database cannot be read: {error}") from error
    finally:
        database.close()
    return tuple(lines)


def run(*arguments, under=()):
    """Runs the tool, and returns its status, which is negative after a signal."""
    command = [*under, TOOL, *arguments]
    try:
        null = subprocess.DEVNULL
        return subprocess.run(command, stdout=null, stderr=null, timeout=60).returncode
    except subprocess.TimeoutExpired:
        return HANGS


def inject(call, what):
    """The command that a disturbed run is run under: its trace of such calls is in /var/trace."""
    name, number = call
    # The filter is faster, but signals do not come through it.
    fast = [] if "signal" in what else ["--seccomp-bpf", "-f"]
    options = [f"--trace={name}", f"--inject={name}:{what}:when={number}"]
    return ["strace", *fast, "-o", "/var/trace", *options]


def trace(*options, command=(TOOL, "0")):
    """The calls of an undisturbed run."""
    strace = ["strace", *options, "-o", "/var/trace", *command]
    subprocess.run(strace, check=True, stdout=subprocess.DEVNULL)
    return list(numbered(Path("/var/trace").read_text().splitlines()))


def numbered(lines):
    count = Counter()
    for line in lines:
        name = re.match(r"[a-z]\w*(?=\()", line)
        if name:
            count[name[0]] += 1
            yield Call(name[0], count[name[0]], line)


def without_outputs(lines):
    """What each next run must come to, for UpdateAxisA8105E adds its rows again."""
    return [line for line in lines if "DO 2" not in line and "sqlite_sequence" not in line]


class Appliance:
    """What runs from version 0 on the example appliance may leave, learnt from runs.

    A run is disturbed, and learnt from, by in_parallel(function, cases), in processes that have
    a /var of their own.
    """

    def __init__(self, wal, in_parallel):
        self.wal = wal
        self.in_parallel = in_parallel
        self.notes = []  # what a case was let through with
        write_disk({})
        database = sqlite3.connect(TARGET / DATABASE)
        database.execute(f"PRAGMA journal_mode={'wal' if wal else 'delete'}")
        database.executescript(Path("examples/appliance.sql").read_text())
        database.close()
        shutil.copytree("examples/KICapInfo", TARGET / CAPS, dirs_exist_ok=True)
        self.start = read_disk()
        self.calls = trace("-y")
        self.end = read_disk()
        self.next = {}  # what the next run makes of rows that may be left
        self.steps = []  # the rows after each transaction that changes some
        self.step_after = []  # the last of these after so many transactions
        self.learn_transactions()
        self.learn_versions()

    def disturbed(self, call, what):
        """Runs from the start with a call disturbed. Returns the status and the disk."""
        write_disk(self.start)
        status = run("0", under=inject(call, what))
        return status, read_disk()

    def connections(self):
        """The calls that open the database, one for each transaction."""
        opens = re.compile(rf'openat.*/{DATABASE}", O_RDWR')
        return [call[:2] for call in self.calls if opens.match(call.line)]

    def learn_transactions(self):
        """Kills a run before each transaction; the next one must make up for it."""
        for left, after in self.in_parallel(self.after_kill, self.connections()):
            self.learn(left, after)
        self.learn(rows(self.end), self.next_rows(self.end))
        for after in self.next.values():
            if without_outputs(after) != without_outputs(self.steps[-1]):
                raise SystemExit("the next run does not make up for a killed one")

    def learn_failures(self):
        """Lets each transaction fail alone: its action ends, and the others run."""
        for left, after in self.in_parallel(self.after_failure, self.connections()):
            self.next.setdefault(left, after)

    def learn(self, left, after):
        if left not in self.next:
            self.steps.append(left)
        self.next[left] = after
        self.step_after.append(len(self.steps) - 1)

    def after_kill(self, connection):
        left = self.disturbed(connection, "signal=KILL")[1]
        return rows(left), self.next_rows(left)

    def after_failure(self, connection):
        status, left = self.disturbed(connection, "error=EIO")
        if status != 255:
            raise SystemExit(f"ended with {status} without a database")
        return rows(left), self.next_rows(left)

    def next_rows(self, left):
        write_disk(left)
        run("0")
        return rows(read_disk())

    def before_last(self, transactions):
        return self.disturbed(self.connections()[-transactions], "signal=KILL")[1]

    def learn_versions(self):
        """The files before, between and after both actions on them, and after the second alone."""
        walk = re.compile(f"openat.*{CAPS[:-1]}.*NONBLOCK.*DIRECTORY")
        walks = [call[:2] for call in self.calls if walk.match(call.line)]
        between = self.disturbed(walks[1], "signal=KILL")[1]
        write_disk(self.start)
        run("70")
        disks = [self.start, between, read_disk(), self.end]
        self.versions = {item for disk in disks for item in capability_files(disk).items()}

    def check(self, left, temporary=True):
        """Transactions and files must be whole, and the next run ends as if nothing had been."""
        now = rows(left)
        if now not in self.next:
            raise Wrong("a transaction is there in part: " + self.difference(now))
        missing = self.start.keys() - left.keys()
        if missing:
            raise Wrong(f"missing: {missing}")
        for item in capability_files(left).items():
            known = item[0] in self.start
            if item not in self.versions if known else not temporary:
                raise Wrong(f"no version of a capability file: {item}")
        write_disk(left)
        status = run("0")
        end = read_disk()
        if status != 0:
            raise Wrong(f"the next run ends with {status}")
        if rows(end) != self.next[now]:
            raise Wrong("the next run comes to other rows")
        if capability_files(end) != capability_files(self.end):
            raise Wrong(f"the next run leaves {set(end.items()) ^ set(self.end.items())}")
        if end.keys() != self.start.keys():
            raise Wrong(f"the next run leaves other files: {end.keys() ^ self.start.keys()}")
        if without_outputs(self.next[now]) != without_outputs(self.steps[-1]):
            self.notes.append("the next run cannot make up for it")
        return now

    def difference(self, now):
        nearest = min(self.next, key=lambda lines: len(set(lines) ^ set(now)))
        return "\n".join(sorted(set(nearest) ^ set(now))[:4])
