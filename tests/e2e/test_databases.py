"""Databases that a customer's appliance may have."""

import re
import sqlite3
import threading
from contextlib import contextmanager

import pytest
from conftest import SOURCE

ACTIONS = (SOURCE / "tests/expected/actions.txt").read_text()
ALL = re.findall(r"^\w+ (\w+)$", ACTIONS, re.M)
REFUSE = "ON {} WHEN {} BEGIN SELECT RAISE(ABORT, 'refused'); END;"


def file(content):
    return lambda example: example.database.write_bytes(content(example.database.read_bytes()))


def damage_the_first_page_of_cameras(example):
    ((page,),) = example.sql("SELECT rootpage FROM sqlite_master WHERE name = 'camera'")
    with example.database.open("r+b") as database:
        database.seek((page - 1) * 4096)
        database.write(b"\xff" * 4096)


DAMAGED = [
    # actions that fail, reason in syslog, what was done to the database
    (ALL, "file is not a database", file(lambda content: b"text" * 1000)),
    (ALL, "no such table: camera", file(lambda content: b"")),
    (ALL, "database disk image is malformed", damage_the_first_page_of_cameras),
    (ALL, "", lambda example: example.database.unlink()),
    (
        ["UpdateAxisA8105E"],
        'near "b": syntax error',
        "UPDATE camera SET connected_wire = 'a''b';",
    ),
    (
        ["RenameAbusTvip62000Reso", "UpdateHjtICZX23Model"],
        "refused",
        "CREATE TRIGGER t BEFORE UPDATE OF resolution, model "
        + REFUSE.format("camera", "new.resolution='640x480' OR new.model='ICZX230'"),
    ),
    (
        ["UpdateAxisA8105E"],
        "refused",
        "CREATE TRIGGER t BEFORE INSERT " + REFUSE.format("camdeviceoutput", "1"),
    ),
]


def failing(log):
    return re.findall(r"^tesselupgrader\.cpp:(\w+)\(\): KiDBExecute", "\n".join(log), re.M)


@pytest.mark.parametrize("actions, reason, damage", DAMAGED)
def test_what_cannot_run_is_an_error_with_its_reason(example, actions, reason, damage):
    damage(example) if callable(damage) else example.sql(damage)
    result = example.upgrade(0)
    assert result.status == 255
    assert failing(result.log) == actions
    assert reason in "\n".join(result.syslog)
    assert (result.changes == []) == (actions == ALL)


@contextmanager
def held(database, seconds):
    """The recorder has a transaction open, for so long or to the end of the block."""
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
    with held(example.database, seconds):
        ended = example.inside(*example.command("tesselupgrader", last - 1))
        assert ended.returncode == status
    assert ("KiDBExecute" in example.log_file.read_text()) == (status != 0)
