"""What the tests of programs share: an appliance of their own to run them on."""

import difflib
import os
import re
import shutil
import socket
import sqlite3
import subprocess
import tempfile
import time
from contextlib import closing, contextmanager
from dataclasses import dataclass
from pathlib import Path
from subprocess import PIPE, STDOUT
from threading import Thread

import pytest

SOURCE = Path(__file__).resolve().parents[2]
PROGRAMS = {
    "tesselupgrader": "main/tesselupgrader",
    "tessel-preview": "preview/tessel-preview",
    "kidbglog": "tools/kidbglog",
    "client": "tests/unit/client",
}
# Time, process and line number of a log line.
LOG_PREFIX = re.compile(r"^.{15}[.\d]* \[\d+\] ?|(?<=\.cpp):\d+")
# Priority, time and program of a message to syslog.
SYSLOG_PREFIX = re.compile(r"^<\d+>.{15} [^:]*: ?")


def pytest_addoption(parser):
    parser.addoption("--build", default="build/dev", help="the build tree of the programs")
    parser.addoption("--accept", action="store_true", help="write tests/expected/ anew")


@dataclass
class Result:
    """What one run returned, printed, logged and changed."""

    status: int
    output: str
    log: list
    syslog: list
    changes: list  # a line for each changed cell, and each added or removed row
    diffs: str  # of the capability files


class Appliance:
    """A recorder's directory, on which programs run as root would run them."""

    def __init__(self, directory, build):
        self.directory = directory
        self.build = build
        self.database = directory / "system.db"
        self.caps = directory / "@camveld/@KICapInfo"
        self.log_file = directory / "log/camveld.log"
        self.enter = [SOURCE / "tools/private-appliance", directory]
        cache = (build / "CMakeCache.txt").read_text()
        self.emulator = re.findall(r"^CMAKE_CROSSCOMPILING_EMULATOR:\w+=(.+)$", cache, re.M)
        self.sanitizers = re.findall(r"^TESSEL_SANITIZE:\w+=(.+)$", cache, re.M)

    def load_example(self):
        self.sql((SOURCE / "examples/appliance.sql").read_text())
        shutil.copytree(SOURCE / "examples/KICapInfo", self.caps, dirs_exist_ok=True)

    def sql(self, text, row_factory=None):
        """Runs one statement and returns its rows, or several that each end in a semicolon."""
        database = sqlite3.connect(self.database, timeout=30, isolation_level=None)
        database.row_factory = row_factory
        database.text_factory = lambda text: text.decode(errors="surrogateescape")
        with closing(database):
            database.execute("PRAGMA synchronous = off")
            if ";" in text:
                database.executescript(text)
                return []
            return database.execute(text).fetchall()

    def capability_file(self, name, text):
        path = self.caps / name
        path.write_text(text, newline="")
        return path

    def upgrade(self, version, under=()):
        """Runs the tool as the installer does that replaces a package of this version."""
        return self.run(str(version), under=under)

    def run(self, *arguments, under=()):
        """Runs the tool, under a command such as strace if there is one."""
        rows, texts = self.rows(), self.capability_texts()
        self.log_file.unlink(missing_ok=True)
        with syslog(self.directory / "syslog") as messages:
            ended = self.inside(*under, *self.command("tesselupgrader", *arguments))
        return Result(
            status=ended.returncode,
            output=ended.stdout,
            log=self.log_lines(),
            syslog=messages,
            changes=changed_rows(rows, self.rows()),
            diffs=unified_diffs(texts, self.capability_texts()),
        )

    def command(self, name, *arguments):
        """Returns the command line that runs a program of the build tree."""
        return [*self.emulator, str(self.build / PROGRAMS[name]), *map(str, arguments)]

    def inside(self, *command):
        """Runs any command where this is the machine's appliance."""
        environment = dict(os.environ)
        if "strace" in command:
            # The leak checker does not work in a traced program.
            environment["ASAN_OPTIONS"] = "detect_leaks=0"
        return subprocess.run(
            [*self.enter, *command],
            stdout=PIPE,
            stderr=STDOUT,
            text=True,
            errors="backslashreplace",
            env=environment,
            timeout=300,
        )

    def log_lines(self):
        """Returns the lines of the log, without time, process and line number."""
        if not self.log_file.exists():
            return []
        text = self.log_file.read_text(errors="backslashreplace")
        return [LOG_PREFIX.sub("", line) for line in text.splitlines()]

    def rows(self):
        """Returns all rows by table and first column; none if the database cannot be read."""
        if not self.database.exists():
            return {}
        tables = "SELECT name FROM sqlite_schema WHERE type = 'table' AND name NOT LIKE 'sqlite%'"
        try:
            return {
                (table, row[0]): dict(row)
                for (table,) in self.sql(tables)
                for row in self.sql(f"SELECT * FROM {table}", sqlite3.Row)
            }
        except sqlite3.DatabaseError:
            return {}

    def capability_texts(self):
        """Returns the text of each regular file by its name."""
        return {
            path.name: path.read_text(errors="backslashreplace")
            for path in self.caps.glob("*")
            if path.is_file() and not path.is_symlink()
        }


def wait_until(condition):
    for _ in range(6000):
        if condition():
            return
        time.sleep(0.01)
    pytest.fail("nothing happens for a minute")


@contextmanager
def syslog(path):
    """Yields a list of what the socket receives until the block ends."""
    messages = []

    def receive():
        while record := server.recv(65536):
            text = record.decode(errors="backslashreplace").rstrip("\0\n")
            messages.append(SYSLOG_PREFIX.sub("", text))

    with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as server:
        server.bind(str(path))
        receiver = Thread(target=receive)
        receiver.start()
        yield messages
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as last:
            last.sendto(b"", str(path))
        receiver.join()
    path.unlink()


def show(value):
    return "NULL" if value is None else repr(value)


def changed_rows(before, after):
    lines = []
    for key in sorted(before.keys() | after.keys()):
        old, new = before.get(key), after.get(key)
        name = f"{key[0]} {key[1]}"
        if old is None or new is None:
            cells = [f"{column}={show(value)}" for column, value in (old or new).items()]
            lines.append(f"{name} {'removed' if old else 'added'}: {', '.join(cells)}")
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
        lines = [re.findall(r".*\n|.+$", files.get(name, "")) for files in (before, after)]
        for line in difflib.unified_diff(*lines, f"before/{name}", f"after/{name}"):
            text += line if line.endswith("\n") else line + "\n\\ No newline at end of file\n"
    return text


@contextmanager
def new_appliance(config):
    """Makes an appliance, and keeps its namespaces until the block ends."""
    build = (SOURCE / config.getoption("build")).resolve()
    # In memory, where syncing costs nothing.
    with tempfile.TemporaryDirectory(prefix="tessel-", dir="/dev/shm") as directory:
        appliance = Appliance(Path(directory), build)
        keeper = subprocess.Popen(
            [*appliance.enter, "sh", "-c", "echo; cat"], stdin=PIPE, stdout=PIPE
        )
        keeper.stdout.readline()
        namespaces = ["--mount", "--ipc"]
        if os.getuid() != 0:
            namespaces += ["--user", "--preserve-credentials"]
        appliance.enter = ["nsenter", f"--target={keeper.pid}", *namespaces]
        yield appliance
        keeper.communicate()


@pytest.fixture
def appliance(request):
    """An appliance with its directories and nothing in them."""
    with new_appliance(request.config) as appliance:
        yield appliance


@pytest.fixture
def example(appliance):
    """The appliance of examples/: many old cameras and some capability files."""
    appliance.load_example()
    return appliance
