"""What is measured on: databases, capability files and settings."""

import itertools
import os
import re
import shutil
import sqlite3
import subprocess
from pathlib import Path

ROOT = Path(__file__).resolve().parents[2]
TOOL = str(ROOT / "build/bench/main/tesselupgrader")
TARGET = Path("/var/packages/Camveld/target")
DATABASE = TARGET / "system.db"
START = TARGET / "start.db"
CAPS = TARGET / "@camveld/@KICapInfo"
LOG = Path("/var/log/camveld/camveld.log")
WORK = Path("/var/work")
FILES = WORK / "files"
FAILURE = re.compile(r"KiDBExecute command \((.*?)\) error\.\n", re.S)


def make_appliance(target):
    """Makes the directories; TARGET leads to the given one, if any."""
    for directory in TARGET.parent, LOG.parent, WORK:
        directory.mkdir(parents=True)
    if target:
        TARGET.symlink_to(target)
    CAPS.mkdir(parents=True)


def fresh_database():
    """Brings the database back, on stable storage, so that no run waits for that."""
    shutil.copyfile(START, DATABASE)
    with DATABASE.open("rb") as copied:
        os.fsync(copied.fileno())


def open_example(path):
    """Makes the example's database, without the cameras that take transactions of their own."""
    path.unlink(missing_ok=True)
    database = sqlite3.connect(path, isolation_level=None)
    database.executescript((ROOT / "examples/appliance.sql").read_text())
    database.execute("DELETE FROM camera WHERE model = 'A8105-E'")
    return database


def transactions():
    """Returns an upgrade's transactions: the tool logs the first that cannot open the
    database."""
    open_example(START).close()
    found = []
    for number in itertools.count(1):
        fresh_database()
        LOG.unlink(missing_ok=True)
        inject = f"inject=openat:error=EIO:when={number}+"
        strace = ["strace", "-f", "-o", "/dev/null", "-P", DATABASE.resolve(), "-e", inject]
        subprocess.run([*strace, TOOL, "0"], stderr=subprocess.DEVNULL)
        failed = FAILURE.search(LOG.read_text())
        if not failed:
            return found
        found.append(f"BEGIN;{failed[1]};COMMIT;")


def make_cameras(count, changes):
    """Makes START of so many cameras of 600 bytes, 30 % of which the transactions change."""
    database = open_example(START)
    database.execute("UPDATE camera SET motion_area = zeroblob(345)")
    before = database.execute("SELECT * FROM camera ORDER BY id").fetchall()
    database.executescript("PRAGMA synchronous = OFF;" + "".join(changes))
    pairs = list(zip(before, database.execute("SELECT * FROM camera ORDER BY id")))
    changing = itertools.cycle(old[1:] for old, new in pairs if old != new)
    staying = itertools.cycle(old[1:] for old, new in pairs if old == new)
    rows = ((row, *next(changing if row % 10 < 3 else staying)) for row in range(count))
    database.executescript("BEGIN; DELETE FROM camera")
    marks = ",".join("?" * len(before[0]))
    database.executemany(f"INSERT INTO camera VALUES ({marks})", rows)
    database.execute("COMMIT")
    database.close()


def make_files(count, directory, *texts):
    """Makes so many capability files of some 40 lines, one of the texts in the middle of each."""
    shutil.rmtree(directory, ignore_errors=True)
    directory.mkdir(parents=True)
    lines = "".join(f"resolution_{line} = 1920x1080,1280x720\n" for line in range(18))
    for number, text in zip(range(count), itertools.cycle(texts)):
        (directory / f"{number:05}").write_text(lines + text + lines)


def make_settings():
    """Makes what the library's calls read and change, also as GKeyFile needs it."""
    lines = "".join(f"camera{line}=the setting of {line}\n" for line in range(1000, 2000))
    Path("/var/settings").write_text(lines)
    Path("/var/settings.ini").write_text("[settings]\n" + lines)
