"""Databases that a customer's appliance may have."""

import os
import re
import sqlite3
from contextlib import closing
from pathlib import Path

import pytest
from conftest import STRACE, TOOL, run
from test_migrations import tables

NO_DATABASE = "file is not a database (extended code 26)"
ABSENT = [
    # what is in place of the database, the reason that syslog has
    (lambda p: None, "{}: No such file or directory"),
    (Path.mkdir, "{}: Is a directory"),
    (os.mkfifo, "{}: Not a regular file"),
    (lambda p: p.symlink_to(p), "{}: Too many levels of symbolic links"),
    (lambda p: p.write_text("text"), NO_DATABASE),
]


@pytest.mark.parametrize("make, reason", ABSENT)
def test_without_a_database_syslog_says_why(appliance, syslog, make, reason):
    last, name = tables()[0][-1]
    make(appliance.database)
    appliance.upgrade(last - 1).must_be(255)
    assert syslog() == [f"{name}: {reason.format(appliance.database)}"]


def test_an_action_waits_five_seconds_for_the_recorder(example, syslog):
    last, name = tables()[0][-1]
    actions = [threshold for threshold, _ in tables()[0]].count(last)
    trace = Path("/var/trace")
    no_time_passes = ["--trace=/nanosleep", "--inject=/nanosleep:retval=0"]
    under = [*STRACE, "-o", trace, *no_time_passes]
    with closing(sqlite3.connect(example.database)) as recorder:
        recorder.execute("BEGIN EXCLUSIVE")
        ended = run(*under, *example.command(TOOL, last - 1))
    assert ended.returncode == 255, ended.stdout
    assert syslog()[-1] == f"{name}: database is locked (extended code 5)"
    # How long each call would have waited.
    sleeps = re.findall(r"tv_sec=(\d+), tv_nsec=(\d+)", trace.read_text())
    seconds = sum(int(s) + int(nanos) / 1e9 for s, nanos in sleeps)
    assert round(seconds / actions, 3) == 5, "seconds of an action"


NO_FILE = "too many attached databases - max 0 (extended code 1)"
VALUES = [
    # a text in the value of a camera, the reason of the failure
    ("ATTACH '/var/outside' AS o", NO_FILE),
    ("SELECT 1", "the text leaves a transaction open (extended code 0)"),
    ("VACUUM INTO '/var/outside'", NO_FILE),
    ("SELECT [a\n<3>b]", "no such column: a?<3>b (extended code 1)"),
]


@pytest.mark.parametrize("text, reason", VALUES)
def test_a_value_reaches_no_other_file_and_no_other_record(
    example, syslog, text, reason
):
    # UpdateAxisA8105E writes this value between quotes as it is.
    value = f"..'; COMMIT; {text}; BEGIN; --".replace("'", "''")
    wired = f"SET connected_wire = '{value}' WHERE model = 'A8105-E'"
    example.sql(f"UPDATE camera {wired};")
    example.upgrade(2400).must_be(255)
    assert syslog() == [f"UpdateAxisA8105E: {reason}"]


def test_many_cameras_need_no_temporary_file(example, syslog):
    # UpdateDAHUASD4XC212S changes these cameras twice in one transaction.
    example.sql(
        "INSERT INTO camera (vendor, model, resolution, rec_bitrate_ctrl) "
        "SELECT 'DAHUA', 'SD40212S-HN', '640x480', 2 FROM camera, camera "
        "LIMIT 5000"
    )
    trace = Path("/var/trace")
    under = [*STRACE, "-o", trace, "-e", "openat"]
    example.upgrade(563, under=under).must_be(0)
    assert trace.read_text().count("/etilqs_") == 0
    assert syslog() == []
