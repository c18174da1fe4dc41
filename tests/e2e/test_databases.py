"""Databases that a customer's appliance may have."""

import os
import re
import sqlite3
from contextlib import closing
from pathlib import Path

import pytest
from conftest import STRACE, TOOL, complain, run
from test_migrations import tables

ABSENT = [
    # what is in place of the database, the reason that syslog has
    (lambda path: None, "No such file or directory"),
    (lambda path: path.mkdir(), "Is a directory"),
    (lambda path: path.symlink_to(path), "Too many levels of symbolic links"),
    (os.mkfifo, "Not a regular file"),
]


@pytest.mark.parametrize("make, reason", ABSENT)
def test_without_a_database_syslog_says_why(appliance, syslog, make, reason):
    last, name = tables()[0][-1]
    make(appliance.database)
    appliance.upgrade(last - 1).must_be(255)
    assert syslog() == [f"{name}: {appliance.database}: {reason}"]


def test_a_file_that_is_no_database_is_an_error_and_stays(example):
    image = b"text" * 1000
    example.database.write_bytes(image)
    example.upgrade(0).must_be(255)
    assert example.database.read_bytes() == image


def test_an_action_waits_five_seconds_for_the_recorder(example, syslog):
    thresholds = [threshold for threshold, _ in tables()[0]]
    trace = Path("/var/trace")
    no_time_passes = ["--trace=/nanosleep", "--inject=/nanosleep:retval=0"]
    under = [*STRACE, "-o", trace, *no_time_passes]
    with closing(sqlite3.connect(example.database)) as recorder:
        recorder.execute("BEGIN EXCLUSIVE")
        ended = run(*under, *example.command(TOOL, max(thresholds) - 1))
    assert ended.returncode == 255, ended.stdout
    name = tables()[0][-1][1]
    assert syslog()[-1] == f"{name}: database is locked (extended code 5)"
    # How long each call would have waited.
    sleeps = re.findall(r"tv_sec=(\d+), tv_nsec=(\d+)", trace.read_text())
    seconds = sum(int(s) + int(nanos) / 1e9 for s, nanos in sleeps)
    seconds /= thresholds.count(max(thresholds))
    if round(seconds, 3) != 5:
        complain(f"an action waits {seconds} seconds for the database, not 5")


@pytest.mark.parametrize("escape", ["ATTACH {} AS o", "VACUUM INTO {}"])
def test_a_value_reaches_no_other_file(example, syslog, escape):
    outside = example.directory / "outside"
    outside.touch()
    # UpdateAxisA8105E writes this value between quotes as it is.
    escape = escape.format(f"'{outside}'") + "; CREATE TABLE o.t (n)"
    value = f"..'; COMMIT; {escape}; BEGIN; --".replace("'", "''")
    wired = f"SET connected_wire = '{value}' WHERE model = 'A8105-E'"
    example.sql(f"UPDATE camera {wired}")
    example.upgrade(2400).must_be(255)
    assert outside.read_bytes() == b""
    reason = "too many attached databases - max 0 (extended code 1)"
    assert syslog() == [f"UpdateAxisA8105E: {reason}"]


def test_a_failed_action_has_one_record_of_one_line(example, syslog):
    example.upgrade(0).must_be(0)
    assert syslog() == []
    example.sql(
        "CREATE TRIGGER guard BEFORE UPDATE ON camera BEGIN "
        "SELECT raise(ABORT, 'guard says\n<3>no'); END;"
        "INSERT INTO camera (vendor, model) VALUES ('ASUS', 'AiCam NightView')"
    )
    example.upgrade(2472).must_be(255)
    reason = "guard says?<3>no (extended code 1811)"
    assert syslog() == [f"RenameASUSAiCamNightViewModel: {reason}"]


def test_many_cameras_need_no_temporary_file(example, tmp_path):
    # UpdateDAHUASD4XC212S changes these cameras twice in one transaction.
    example.sql(
        "INSERT INTO camera (vendor, model, resolution, rec_bitrate_ctrl) "
        "SELECT 'DAHUA', 'SD40212S-HN', '640x480', 2 FROM camera, camera"
    )
    trace = tmp_path / "trace"
    under = [*STRACE, "-o", trace, "-e", "openat"]
    example.upgrade(563, under=under).must_be(0)
    assert trace.read_text().count("/etilqs_") == 0
