"""Databases that a customer's appliance may have."""

import re
import sqlite3
import threading
from contextlib import contextmanager

import pytest
from conftest import SOURCE

ACTIONS = (SOURCE / "tests/expected/actions.txt").read_text()
ALL = re.findall(r"^\d+ (\w+)$", ACTIONS, re.M)


def damage_the_first_page_of_cameras(example):
    ((page,),) = example.sql("SELECT rootpage FROM sqlite_master WHERE name = 'camera'")
    with example.database.open("r+b") as database:
        database.seek((page - 1) * 4096)
        database.write(b"\xff" * 4096)


def overwrite(text):
    return lambda example: example.database.write_text(text)


REFUSE = "CREATE TRIGGER t BEFORE {} BEGIN SELECT RAISE(ABORT, 'refused'); END;"
SIEMENS = REFUSE.format("UPDATE ON camera WHEN new.vendor = 'SIEMENS'")
OUTPUTS = REFUSE.format("INSERT ON camdeviceoutput")
QUOTE = "UPDATE camera SET connected_wire = 'a''b';"
BAD = [
    # what is done to the database, actions that fail, reason in syslog
    (lambda example: example.database.unlink(), ALL, ""),
    (overwrite("text" * 1000), ALL, "file is not a database"),
    (overwrite(""), ALL, "no such table: camera"),
    (damage_the_first_page_of_cameras, ALL, "database disk image is malformed"),
    (lambda example: example.sql(QUOTE), ["UpdateAxisA8105E"], 'near "b": syntax error'),
    (lambda example: example.sql(OUTPUTS), ["UpdateAxisA8105E"], "refused"),
    (lambda example: example.sql(SIEMENS), ["UpdateCameraModelConfRenameSiemens"], "refused"),
]


def failing(log):
    return re.findall(r"^tesselupgrader\.cpp:(\w+)\(\): KiDBExecute", "\n".join(log), re.M)


@pytest.mark.parametrize("damage, actions, reason", BAD)
def test_what_cannot_run_is_an_error_with_its_reason(example, damage, actions, reason):
    damage(example)
    result = example.upgrade(0)
    assert result.status == 255
    assert failing(result.log) == actions
    assert reason in "\n".join(result.syslog)
    assert (result.changes == []) == (actions == ALL)


@contextmanager
def locked(database, seconds):
    """Holds an exclusive lock for so long, or to the end of the block."""
    holder = sqlite3.connect(database, isolation_level=None, check_same_thread=False)
    holder.execute("BEGIN EXCLUSIVE")
    timer = threading.Timer(seconds, holder.rollback)
    timer.start()
    yield
    timer.cancel()
    holder.close()


@pytest.mark.parametrize("seconds, status", [(3, 0), (300, 255)])
def test_the_tool_waits_some_seconds_for_the_recorder(example, seconds, status):
    last = int(re.findall(r"^\d+", ACTIONS, re.M)[-1])
    with locked(example.database, seconds):
        ended = example.inside(*example.command("tesselupgrader", last - 1))
    assert ended.returncode == status
    assert len(failing(example.log_lines())) == (status != 0)
