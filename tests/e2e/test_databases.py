"""Databases that a customer's appliance may have."""

import os
import sqlite3
from contextlib import closing
from threading import Timer

import pytest
from conftest import STRACE, TOOL, run
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
    assert appliance.upgrade(last - 1).status == 255
    assert syslog() == [f"{name}: {appliance.database}: {reason}"]


DAMAGE = [
    lambda image: b"",
    lambda image: b"text" * 1000,
    lambda image: image[:4096] + b"\xff" * 4096,
]


@pytest.mark.parametrize("damage", DAMAGE)
def test_a_file_that_is_no_database_is_an_error_and_stays(example, damage):
    image = damage(example.database.read_bytes())
    example.database.write_bytes(image)
    assert example.upgrade(0).status == 255
    assert example.database.read_bytes() == image


@pytest.mark.parametrize("seconds, status", [(3, 0), (300, 255)])
def test_an_action_waits_some_seconds_for_the_recorder(
    example, seconds, status
):
    last = max(threshold for threshold, _ in tables()[0])
    recorder = sqlite3.connect(example.database, check_same_thread=False)
    with closing(recorder):
        recorder.execute("BEGIN EXCLUSIVE")
        timer = Timer(seconds, recorder.rollback)
        timer.start()
        ended = run(*example.command(TOOL, last - 1))
        timer.cancel()
        timer.join()
    assert ended.returncode == status


@pytest.mark.parametrize("escape", ["ATTACH {} AS o", "VACUUM INTO {}"])
def test_a_value_reaches_no_other_file(example, syslog, escape):
    outside = example.directory / "outside"
    outside.touch()
    # UpdateAxisA8105E writes this value between quotes as it is.
    escape = escape.format(f"'{outside}'") + "; CREATE TABLE o.t (n)"
    value = f"..'; COMMIT; {escape}; BEGIN; --".replace("'", "''")
    wired = f"SET connected_wire = '{value}' WHERE model = 'A8105-E'"
    example.sql(f"UPDATE camera {wired}")
    assert example.upgrade(2400).status == 255
    assert outside.read_bytes() == b""
    reason = "too many attached databases - max 0 (extended code 1)"
    assert syslog() == [f"UpdateAxisA8105E: {reason}"]


def test_a_failed_action_has_one_record_of_one_line(example, syslog):
    assert (example.upgrade(0).status, syslog()) == (0, [])
    example.sql(
        "CREATE TRIGGER guard BEFORE UPDATE ON camera BEGIN "
        "SELECT raise(ABORT, 'guard says\n<3>no'); END;"
        "INSERT INTO camera (vendor, model) VALUES ('ASUS', 'AiCam NightView')"
    )
    assert example.upgrade(2472).status == 255
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
    assert example.upgrade(563, under=under).status == 0
    assert trace.read_text().count("/etilqs_") == 0
