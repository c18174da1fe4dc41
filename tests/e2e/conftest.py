"""What the tests of programs share: an appliance of their own to run them on.

    def test_siemens_changes_its_name(example):
        result = example.upgrade(0)
        assert result.status == 0
        assert "camera 7 (Siemens CCMS2025) vendor: 'Siemens' -> 'SIEMENS'" in result.changes
"""

import difflib
import os
import re
import shutil
import socket
import sqlite3
import subprocess
import tempfile
import threading
from contextlib import closing, contextmanager
from dataclasses import dataclass
from pathlib import Path

import pytest

SOURCE = Path(__file__).resolve().parents[2]
PROGRAMS = {
    "tesselupgrader": "main/tesselupgrader",
    "tessel-preview": "preview/tessel-preview",
    "kidbglog": "tools/kidbglog",
    "client": "tests/unit/client",
}
# Where a capability file is written anew before it gets its name.
TEMPORARY_FILE = re.search(r"\.\w+\.tmp", (SOURCE / "platform/zamoc.h").read_text())[0]
# Nov 24 10:00:00 [4711] tesselupgrader.cpp:123:
LOG_PREFIX = re.compile(r"^\w{3} [ \d]\d [\d:.]+ \[\d+\](?:\[\d+\])? ?((?:\[.*?\] )?[^:]*:)\d+:")
# <11>Nov 24 10:00:00 tesselupgrader:
SYSLOG_PREFIX = re.compile(r"^<\d+>.{15} [^:]*: ?")


def pytest_addoption(parser):
    parser.addoption("--build", default="build/dev", help="the build tree of the tested programs")
    parser.addoption("--accept", action="store_true", help="write tests/expected/ anew")


@dataclass
class Result:
    """What one run returned, printed, logged and changed."""

    status: int
    output: str
    log: list
    syslog: list
    before: dict
    after: dict
    diffs: str

    @property
    def changes(self):
        """A line for each changed cell and each added or removed row."""
        lines = []
        for key in sorted(self.before.keys() | self.after.keys(), key=row_order):
            lines += row_changes(key, self.before.get(key), self.after.get(key))
        return lines


def show(value):
    """Returns the value in printable ASCII, different from every other value."""
    if value is None:
        return "NULL"
    if isinstance(value, bytes):
        return f"x'{value.hex()}'"
    if not isinstance(value, str):
        return str(value)
    return "'" + escape(value) + "'"


def escape(text):
    shown = ""
    for byte in text.encode(errors="surrogateescape"):
        if chr(byte) in "'\\":
            shown += "\\"
        shown += chr(byte) if 0x20 <= byte < 0x7F else f"\\x{byte:02x}"
    return shown


def row_order(key):
    table, row = key
    numbers = (int, float)
    return table, [(0, v, "") if isinstance(v, numbers) else (1, 0, show(v)) for v in row]


def row_changes(key, before, after):
    table, row = key
    name = f"{table} {', '.join(show(value) for value in row)}"
    if before is None or after is None:
        cells = [f"{column}={show(value)}" for column, value in (before or after).items()]
        return [f"{name} {'removed' if after is None else 'added'}: {', '.join(cells)}"]
    if table == "camera" and "vendor" in before and "model" in before:
        name += " ({} {})".format(*(escape(str(before[column])) for column in ("vendor", "model")))
    return [
        f"{name} {column}: {show(value)} -> {show(after[column])}"
        for column, value in before.items()
        if (type(value), value) != (type(after[column]), after[column])
    ]


class Syslog:
    """Receives what is sent to a socket while the block runs."""

    def __init__(self, path):
        self.messages = []
        self._path = path
        self._reader = threading.Thread(target=self._read)

    def __enter__(self):
        self._path.unlink(missing_ok=True)
        self._socket = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self._socket.bind(str(self._path))
        self._reader.start()
        return self

    def __exit__(self, *_):
        with socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM) as end:
            end.sendto(b"", str(self._path))
        self._reader.join()
        self._socket.close()
        self._path.unlink()

    def _read(self):
        while record := self._socket.recv(65536):
            text = record.decode(errors="backslashreplace").rstrip("\0\n")
            self.messages.append(SYSLOG_PREFIX.sub("", text))


class Appliance:
    """A recorder's directory, on which programs of a build tree run as root would run them."""

    def __init__(self, directory, build):
        self.directory = directory
        self.build = build
        self.database = directory / "system.db"
        self.caps = directory / "@camveld/@KICapInfo"
        self.log_file = directory / "log/camveld.log"
        self.caps.mkdir(parents=True)
        self.log_file.parent.mkdir()
        cache = (build / "CMakeCache.txt").read_text()
        self.emulator = re.findall(r"^CMAKE_CROSSCOMPILING_EMULATOR:\w+=(.+)$", cache, re.M)
        self.sanitizers = re.findall(r"^TESSEL_SANITIZE:\w+=(.+)$", cache, re.M)

    def sql(self, text, *parameters):
        """Runs one statement, and returns its rows, or a script of statements that end in ;."""
        database = sqlite3.connect(self.database, timeout=30, isolation_level=None)
        database.text_factory = lambda text: text.decode(errors="surrogateescape")
        with closing(database):
            database.execute("PRAGMA synchronous = off")
            if ";" in text and not parameters:
                database.executescript(text)
                return []
            return database.execute(text, parameters).fetchall()

    def capability_file(self, name, text):
        path = self.caps / name
        path.write_bytes(text if isinstance(text, bytes) else text.encode())
        return path

    def upgrade(self, version, under=()):
        """Runs the tool as an installer that replaces a package of that version does."""
        return self.run(str(version), under=under)

    def run(self, *arguments, under=()):
        """Runs the tool, under a command such as strace if there is one."""
        before, files = self.rows(), self.capability_texts()
        logged = self.log_file.stat().st_size if self.log_file.exists() else 0
        with Syslog(self.directory / "syslog") as syslog:
            ended = self.inside(*under, *self.command("tesselupgrader", *arguments))
        log = b""
        if self.log_file.exists():
            log = self.log_file.read_bytes()[logged:]
        lines = log.decode(errors="backslashreplace").split("\n")
        return Result(
            status=ended.returncode,
            output=ended.stdout,
            log=[LOG_PREFIX.sub(r"\1", line) for line in lines[:-1]],
            syslog=syslog.messages,
            before=before,
            after=self.rows(),
            diffs=unified_diffs(files, self.capability_texts()),
        )

    def command(self, name, *arguments):
        """Returns the command line that runs a program of the build tree."""
        return [*self.emulator, str(self.build / PROGRAMS[name]), *map(str, arguments)]

    def inside(self, *command):
        """Runs any command where this is the machine's appliance."""
        environment = dict(os.environ)
        if "strace" in command:
            environment["ASAN_OPTIONS"] = "detect_leaks=0"  # it cannot look for them when traced
        return subprocess.run(
            [SOURCE / "tools/private-appliance", self.directory, *command],
            stdout=subprocess.PIPE,
            stderr=subprocess.STDOUT,
            text=True,
            errors="backslashreplace",
            env=environment,
            timeout=300,
        )

    def rows(self):
        """Returns the columns of every row, by its table and key; none if they cannot be read."""
        rows = {}
        if not self.database.exists():
            return rows
        try:
            for _, table, kind, _, without_rowid, _ in self.sql("PRAGMA main.table_list"):
                if kind == "table" and not table.startswith("sqlite_"):
                    rows.update(self.table_rows(table, without_rowid))
        except sqlite3.DatabaseError:
            return {}
        return rows

    def table_rows(self, table, without_rowid):
        columns = self.sql(f'PRAGMA table_info("{table}")')
        names = [column[1] for column in columns]
        key = [f'"{column[1]}"' for column in columns if column[5]] if without_rowid else ["rowid"]
        for row in self.sql(f'SELECT {", ".join(key)}, * FROM "{table}"'):
            yield (table, row[: len(key)]), dict(zip(names, row[len(key) :]))

    def capability_texts(self):
        """Returns the text of every regular file of some size at most, by name."""
        if not self.caps.is_dir():
            return {}
        return {
            path.name: path.read_text(errors="backslashreplace")
            for path in self.caps.iterdir()
            if path.is_file() and not path.is_symlink() and path.stat().st_size < 1000000
        }


def unified_diffs(before, after):
    text = ""
    for name in sorted(before.keys() | after.keys()):
        lines = [re.findall(r".*\n|.+$", files.get(name, "")) for files in (before, after)]
        for line in difflib.unified_diff(*lines, f"before/{name}", f"after/{name}"):
            text += line if line.endswith("\n") else line + "\n\\ No newline at end of file\n"
    return text


@contextmanager
def new_appliance(config):
    build = (SOURCE / config.getoption("build")).resolve()
    with tempfile.TemporaryDirectory(prefix="tessel-", dir="/tmp") as directory:
        yield Appliance(Path(directory), build)


def load_example(appliance):
    appliance.sql((SOURCE / "examples/appliance.sql").read_text())
    shutil.copytree(SOURCE / "examples/KICapInfo", appliance.caps, dirs_exist_ok=True)


@pytest.fixture
def appliance(request):
    """An appliance with its directories and nothing in them."""
    with new_appliance(request.config) as appliance:
        yield appliance


@pytest.fixture
def example(appliance):
    """The appliance of examples/: many old cameras and some capability files."""
    load_example(appliance)
    return appliance
