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
EXPECTED = SOURCE / "tests/expected"
TOOL = "sbin/tesselupgrader"
PREVIEW = "sbin/tessel-preview"
UNDO = "sbin/tessel-undo"
KIDBGLOG = "sbin/kidbglog"
CLIENT = "tests/unit/client"
# The leak checker does not work in a traced program.
STRACE = "strace -o /dev/null -E ASAN_OPTIONS=detect_leaks=0".split()
# How a line of the log begins: the time, the process.
LOG_START = re.compile(r"^\w{3} [ \d]\d [\d:]{8} \[\d+\] ?", re.M)
TO_ACCEPT = "to accept: "
ACCEPTED = pytest.StashKey[dict]()  # texts of the expected files by path
complaints = set()  # of all tests so far
# User, error, time and program of a syslog record.
SYSLOG_PREFIX = re.compile(r"^<11>.{15} tesselupgrader: ")


def pytest_addoption(parser):
    parser.addoption("--build", default="build/dev", help="the build tree")
    parser.addoption("--accept", action="store_true", help="see scripts/test")


def pytest_configure(config):
    config.stash[ACCEPTED] = {}


@pytest.hookimpl(hookwrapper=True)
def pytest_runtest_makereport(call):
    """Lets only one of the tests fail that complain of the same."""
    report = (yield).get_result()
    if report.failed and call.excinfo.errisinstance(pytest.fail.Exception):
        complaint = str(call.excinfo.value)
        if complaint in complaints:
            report.outcome = "skipped"
            report.longrepr = (__file__, 0, "fails as another test does")
        complaints.add(complaint)


def pytest_runtest_logreport(report):
    """Keeps pytest from printing which worker has run a failed test."""
    vars(report).pop("node", None)


def pytest_terminal_summary(terminalreporter, exitstatus, config):
    """Writes what is accepted, and says what is left to do."""
    failed = [
        str(report.longrepr)
        for kind in ("failed", "error")
        for report in terminalreporter.stats.get(kind, [])
    ]
    to_accept = [text for text in failed if text.startswith(TO_ACCEPT)]
    verdict = "first set right what is wrong, then accept the changes"
    if config.getoption("accept"):
        verdict = "accepted" if exitstatus == 0 else "wrong: nothing accepted"
        if exitstatus == 0:
            for path, text in config.stash[ACCEPTED].items():
                path.write_text(text)
    elif not to_accept:
        return
    elif len(to_accept) == len(failed):
        verdict = (
            "nothing is wrong: if the changes are intended, "
            "scripts/test --accept writes tests/expected/"
        )
    terminalreporter.write_line(verdict)


def complain(title, lines=(), most=4):
    """Fails with a title and few enough lines for a screen."""
    if len(lines) > most:
        rest = len(lines) - most + 1
        lines = [*lines[: most - 1], f"and {rest} lines more"]
    lines = [line[:240] for line in (title, *lines)]
    pytest.fail("\n".join(lines), pytrace=False)


@dataclass
class Result:
    """What one run returned, printed, logged and changed."""

    status: int
    output: str
    log: list
    changes: list  # a line for each changed cell, added or removed row
    diffs: str  # of the capability files

    def must_be(self, status):
        if self.status != status:
            title = f"the tool ends with {self.status} instead of {status}"
            complain(title, self.output.splitlines() + self.log)


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

    def save(self):
        """Returns database and capability files by path, for restore()."""
        files = filter(Path.is_file, [self.database, *self.caps.glob("*")])
        return {path: path.read_bytes() for path in files}

    def restore(self, saved):
        for path, content in saved.items():
            path.write_bytes(content)

    def state(self):
        """Returns rows and capability files, for must_be_as()."""
        return self.rows(), self.capability_files()

    def must_be_as(self, state):
        changes = changed_rows(state[0], self.rows())
        diffs = unified_diffs(state[1], self.capability_files())
        if changes or diffs:
            complain("differs from before", changes + diffs.splitlines())

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

    def script(self, path, program):
        """Writes a script that runs a program, in an emulator if need be."""
        command = shlex.join(map(str, self.command(program)))
        return write_script(path, f'exec {command} "$@"')

    def log(self):
        """Returns the log without time, process and line number."""
        text = read(self.log_file) if self.log_file.exists() else ""
        text = LOG_START.sub("", text)
        return re.sub(r"(?<=\.cpp):\d+", "", text).splitlines()

    def rows(self):
        """Returns all rows by table and primary key, if it can."""
        if not self.database.exists():
            return {}
        tables = "SELECT name FROM sqlite_schema WHERE type = 'table'"
        rows = {}
        try:
            for (table,) in self.sql(tables):
                if table != "sqlite_sequence":
                    rows |= self.rows_of(table)
        except sqlite3.DatabaseError:
            return {}
        return rows

    def rows_of(self, table):
        info = f"FROM pragma_table_info('{table}') WHERE pk ORDER BY pk"
        keys = [f"[{name}]" for (name,) in self.sql(f"SELECT name {info}")]
        keys = keys or ["rowid"]
        text = f"SELECT {', '.join(keys)}, * FROM [{table}]"
        rows = {}
        for row in self.sql(text, sqlite3.Row):
            cells = zip(row.keys()[len(keys) :], row[len(keys) :])
            rows[table, *row[: len(keys)]] = dict(cells)
        return rows

    def capability_files(self):
        """Returns the text of each file by its name."""
        files = filter(Path.is_file, self.caps.glob("*"))
        return {path.name: read(path) for path in files}


def write_script(path, commands):
    """Writes a shell script. Returns its path."""
    path.write_text(f"#!/bin/sh\n{commands}\n")
    path.chmod(0o755)
    return path


def other_tool(path, commands):
    """Writes a tool that runs commands in the place of an upgrade."""
    # A preview calls it without an argument, for its name and version.
    return write_script(path, f"[ $# = 1 ] || exit 1\nset -e\n{commands}")


def run(*command, cwd=None):
    return subprocess.run(
        command,
        cwd=cwd,
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


def row_name(key):
    table, *values = key
    return f"{table} {', '.join(map(show, values))}"


def changed_rows(before, after):
    lines = []
    for key in sorted(before.keys() | after.keys()):
        old, new = before.get(key), after.get(key)
        name = row_name(key)
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
        # Lines, of which the last one may lack its end.
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
def preview(example):
    """Runs the preview, which must leave nothing and change nothing.

    As on an appliance, it is in a mounted directory below /var.
    """
    own_tool = example.script(Path("/var/tool"), TOOL)
    programs, temporary = Path("/var/programs"), Path("/var/tmp")
    for path in programs, temporary:
        path.mkdir()
    subprocess.check_call(["mount", "--bind", example.build, programs])
    example.directory.chmod(0o755)  # others cannot replace a change file

    def run_preview(*arguments, under=(), status=0, tool=own_tool):
        before, saved = example.state(), example.save()
        program = programs / PREVIEW
        command = example.command(program, "--tool", tool, *arguments)
        ended = run("env", f"TMPDIR={temporary}", *under, *command)
        assert ended.returncode == status, ended.stdout
        example.must_be_as(before)
        assert example.save() == saved, "its database or a file was written"
        assert not os.listdir(temporary)
        return ended.stdout

    return run_preview


@pytest.fixture
def accepts(request):
    """Compares lines with those of an expected file, or accepts them."""

    def compare(name, title, lines):
        path = EXPECTED / name
        if request.config.getoption("accept"):
            text = "".join(line + "\n" for line in lines)
            request.config.stash[ACCEPTED][path] = text
            return
        text = path.read_text() if path.exists() else ""
        expected = text.splitlines()
        missing = [f"- {line}" for line in expected if line not in lines]
        new = [f"+ {line}" for line in lines if line not in expected]
        title = f"{TO_ACCEPT}{title} (tests/expected/{name})"
        if missing or new:
            complain(title, missing + new, most=3)
        if lines != expected:
            complain(f"{title}: only the order of lines")

    return compare


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
