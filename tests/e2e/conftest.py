"""What the tests of programs share: an appliance to run them on."""

import difflib
import os
import re
import shlex
import shutil
import socket
import sqlite3
import subprocess
from contextlib import closing, contextmanager, suppress
from dataclasses import dataclass
from pathlib import Path
from subprocess import PIPE, STDOUT

import pytest

SOURCE = Path(__file__).resolve().parents[2]
TOOL = "sbin/tesselupgrader"
PREVIEW = "sbin/tessel-preview"
UNDO = "sbin/tessel-undo"
KIDBGLOG = "sbin/kidbglog"
CLIENT = "tests/unit/client"
# The leak checker does not work in a traced program.
STRACE = "strace -o /dev/null -E ASAN_OPTIONS=detect_leaks=0".split()
# Time, process and line number of a log line.
LOG_PREFIX = re.compile(r"^.{15}[.\d]* \[\d+\] ?|(?<=\.cpp):\d+")

# User, error, time and program of a syslog record.
SYSLOG_PREFIX = re.compile(r"^<11>.{15} tesselupgrader: ")


def pytest_addoption(parser):
    parser.addoption("--build", default="build/dev", help="the build tree")
    parser.addoption("--accept", action="store_true", help="see scripts/test")


@dataclass
class Result:
    """What one run returned, printed, logged and changed."""

    status: int
    output: str
    log: list
    changes: list  # a line for each changed cell, added or removed row
    diffs: str  # of the capability files


class Appliance:
    """The recorder's directories below a /var that only the test sees."""

    directory = Path("/var/packages/Camveld/target")
    database = directory / "system.db"
    caps = directory / "@camveld/@KICapInfo"
    log_file = Path("/var/log/camveld/camveld.log")

    def __init__(self, build):
        self.build = build
        self.preset = build.name
        armhf = self.preset == "armhf"
        self.emulator = [SOURCE / "tools/run-armhf"] if armhf else []

    def sql(self, text, row_factory=None):
        """Runs a statement and returns its rows, or runs several."""
        database = sqlite3.connect(self.database, timeout=30)
        database.isolation_level = None
        database.row_factory = row_factory
        database.text_factory = os.fsdecode
        with closing(database):
            if ";" in text:
                database.executescript(text)
                return []
            return database.execute(text).fetchall()

    def load_example(self):
        self.sql((SOURCE / "examples/appliance.sql").read_text())
        files = SOURCE / "examples/KICapInfo"
        shutil.copytree(files, self.caps, dirs_exist_ok=True)

    def capability_file(self, name, text):
        path = self.caps / name
        path.write_text(text, newline="")
        return path

    def upgrade(self, *arguments, under=()):
        """Runs the tool, under a command such as strace if there is one."""
        rows, files = self.rows(), self.capability_files()
        self.log_file.unlink(missing_ok=True)
        ended = run(*under, *self.command(TOOL, *arguments))
        return Result(
            status=ended.returncode,
            output=ended.stdout,
            log=self.log(),
            changes=changed_rows(rows, self.rows()),
            diffs=unified_diffs(files, self.capability_files()),
        )

    def command(self, program, *arguments):
        """Returns the command line of a program of the build tree."""
        return [*self.emulator, self.build / program, *map(str, arguments)]

    def script(self, path, program, *options):
        """Writes a script that runs a program, in an emulator if need be."""
        command = shlex.join(map(str, self.command(program, *options)))
        path.write_text(f'#!/bin/sh\nexec {command} "$@"\n')
        path.chmod(0o755)
        return path

    def log(self):
        """Returns the log without time, process and line number."""
        if not self.log_file.exists():
            return []
        lines = read(self.log_file).splitlines()
        return [LOG_PREFIX.sub("", line) for line in lines]

    def rows(self):
        """Returns all rows by table and first column, if it can."""
        if not self.database.exists():
            return {}
        tables = "SELECT name FROM sqlite_schema WHERE type = 'table'"
        try:
            return {
                (table, row[0]): dict(row)
                for (table,) in self.sql(tables)
                for row in self.sql(f"SELECT * FROM [{table}]", sqlite3.Row)
                if table != "sqlite_sequence"
            }
        except sqlite3.DatabaseError:
            return {}

    def capability_files(self):
        """Returns the text of each file by its name."""
        files = filter(Path.is_file, self.caps.glob("*"))
        return {path.name: read(path) for path in files}


def run(*command):
    return subprocess.run(
        command,
        stdout=PIPE,
        stderr=STDOUT,
        text=True,
        errors="backslashreplace",
        timeout=300,
    )


def read(path):
    return path.read_text(errors="backslashreplace")


def show(value):
    return "NULL" if value is None else repr(value)


def changed_rows(before, after):
    lines = []
    for key in sorted(before.keys() | after.keys()):
        old, new = before.get(key), after.get(key)
        name = f"{key[0]} {key[1]}"
        if old is None or new is None:
            row = (old or new).items()
            cells = [f"{column}={show(value)}" for column, value in row]
            kind = "removed" if old else "added"
            lines.append(f"{name} {kind}: {', '.join(cells)}")
            continue
        if key[0] == "camera":
            name += f" ({old['vendor']} {old['model']})"
        for column in old:
            cells = show(old[column]), show(new[column])
            if cells[0] != cells[1]:
                lines.append(f"{name} {column}: {cells[0]} -> {cells[1]}")
    return lines


def unified_diffs(before, after):
    text = ""
    for name in sorted(before.keys() | after.keys()):
        old, new = (
            re.findall(r".*\n|.+$", files.get(name, ""))
            for files in (before, after)
        )
        names = f"before/{name}", f"after/{name}"
        for line in difflib.unified_diff(old, new, *names):
            if not line.endswith("\n"):
                line += "\n\\ No newline at end of file\n"
            text += line
    return text


@contextmanager
def new_appliance(config):
    """Makes /var an appliance of its own until the block ends."""
    assert "TESSEL_PRIVATE_VAR" in os.environ, "needs tools/private-var"
    subprocess.check_call(["mount", "-t", "tmpfs", "tmpfs", "/var"])
    appliance = Appliance(SOURCE / config.getoption("build"))
    for path in appliance.caps, appliance.log_file.parent:
        path.mkdir(parents=True)
    Path("/var/services/camveld").mkdir(parents=True)
    try:
        yield appliance
    finally:
        subprocess.check_call(["umount", "--lazy", "/var"])
        subprocess.check_call(["ipcrm", "--all=shm"])


@pytest.fixture
def appliance(request):
    """An appliance with its directories and nothing in them."""
    with new_appliance(request.config) as appliance:
        yield appliance


@pytest.fixture
def example(appliance):
    """The appliance of examples/: old cameras and some capability files."""
    appliance.load_example()
    return appliance


@pytest.fixture
def syslog():
    """A function that returns the tool's records since its last call.

    More than ten unread records stall their sender.
    """
    with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as log:
        log.bind("/dev/log")
        log.setblocking(False)

        def records():
            found = []
            with suppress(BlockingIOError):
                while True:
                    found.append(log.recv(65536).decode())
            return [SYSLOG_PREFIX.sub("", record) for record in found]

        yield records
    os.unlink("/dev/log")
