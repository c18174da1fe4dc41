"""A failed upgrade: what says so, and how it is answered."""

import json
import os
import re
import sqlite3
import subprocess
import time
from contextlib import closing

import pytest
from conftest import PREVIEW, STRACE, TOOL, UNDO
from conftest import changed_rows, run
from test_migrations import tables

GUARD = """
    CREATE TRIGGER guard BEFORE UPDATE ON camera WHEN old.id = 31
    BEGIN SELECT RAISE(ABORT, 'guard says no'); END;"""
GUARDED = "UpdateFisheyeConfPanasonic438: guard says no"


@pytest.fixture
def preview(example, tmp_path):
    """Runs the preview with the tool of the build tree."""
    tool = example.script(tmp_path / "tool", TOOL)

    def run_preview(*arguments, tool=tool):
        command = example.command(PREVIEW, "--tool", tool, *arguments)
        return run(*command).stdout.splitlines()

    return run_preview


def failed(lines):
    return [line for line in lines if line.startswith("failed: ")]


def test_take_back_remove_the_cause_upgrade_again(example, preview, syslog):
    start, files = example.rows(), example.capability_files()
    example.upgrade(0)
    end, upgraded_files = example.rows(), example.capability_files()
    example.database.unlink()
    example.load_example()
    example.sql(GUARD)

    os.chmod(example.directory, 0o755)
    file = example.directory / "from-0"
    lines = preview("--undo", file, 0)
    assert f"failed: {GUARDED} (camera 31 alone is enough)" in lines
    assert example.upgrade(0).status == 255
    assert syslog()[0] == f"{GUARDED} (extended code 1811)"
    # Later actions have renamed its vendor: a second call finds nothing.
    assert example.rows() != end
    run(*example.command(UNDO, file))
    assert changed_rows(start, example.rows()) == []
    assert example.capability_files() == files
    example.sql("DROP TRIGGER guard;")
    assert example.upgrade(0).status == 0
    # The ids of the outputs go on.
    changes = changed_rows(end, example.rows())
    assert all(
        re.match("camdeviceoutput .* (added|removed)", c) for c in changes
    )
    assert len(changes) == 2 * 9
    assert example.capability_files() == upgraded_files


RENAMED = "UpdatePanasoniciPro2Panasonic: guard says no"
SIEMENS = "UpdateCameraModelConfRenameSiemens"
FORGED = """x'', 1
<11>Jan  1 00:00:00 tesselupgrader: UpdateTpLinkNC450: forged
Jan  1 00:00:00 [1] tesselupgrader.cpp:1:UpdateTpLinkNC450(): KiDBExecute \
command (DELETE FROM camera) error."""

PREVIEWED = [
    # what is done to the example, version, failures, what is enough for each
    (GUARD, 308, [GUARDED, RENAMED], "camera 31"),
    (
        "ALTER TABLE camera RENAME audio_format TO sound",
        364,
        ["UpdateTrendNetAdoFmt: no such column: audio_format"],
        "",
    ),
    (
        "CREATE UNIQUE INDEX one ON camera (vendor) WHERE vendor = 'SIEMENS'",
        85,
        [f"{SIEMENS}: UNIQUE constraint failed: camera.vendor"],
        "",  # it takes two
    ),
    (
        f"UPDATE camera SET connected_wire = '{FORGED}' WHERE id = 151",
        2400,
        ['UpdateAxisA8105E: near "1": syntax error'],
        "",
    ),
]


@pytest.mark.parametrize("change, version, failures, enough", PREVIEWED)
def test_the_preview_names_action_reason_and_row(
    example, preview, change, version, failures, enough
):
    example.sql(change + ";")
    shown = f" ({enough} alone is enough)" if enough else ""
    expected = [f"failed: {failure}{shown}" for failure in failures]
    assert failed(preview(version)) == expected
    objects = map(json.loads, preview("--json", version))
    found = [o for o in objects if o["change"] == "failed"]
    assert [f"{o['action']}: {o['reason']}" for o in found] == failures
    assert {o["enough"] for o in found} == {enough}


def test_among_many_cameras_the_one_is_found_soon(example, preview):
    copies = "SELECT a.vendor, a.model, a.fov FROM camera a, camera, camera"
    copies += " WHERE a.model <> 'A8105-E' LIMIT 100000"
    example.sql(f"INSERT INTO camera (vendor, model, fov) {copies};")
    seconds = []
    for guard, failures in ("", 0), (GUARD, 2):
        example.sql(f"{guard};")
        begin = time.monotonic()
        assert len(failed(preview(308))) == failures
        seconds.append(time.monotonic() - begin)
    assert seconds[1] < 3 * seconds[0]


THRESHOLD, LAST = tables()[0][-1]
MOVE, SPEED = [name for _, name in tables()[1]][:2]
READ_ONLY = "creation of a temporary file: Read-only file system"


@pytest.fixture
def read_only(appliance):
    """A capability file in a directory that is mounted read-only."""
    appliance.capability_file(
        "camera", "ptz_continuous_move=yes\npan=continuous"
    )
    for options in ["--bind"], ["-o", "remount,bind,ro"]:
        mount = ["mount", *options, appliance.caps, appliance.caps]
        subprocess.check_call(mount)
    yield
    subprocess.check_call(["umount", appliance.caps])


def test_a_database_that_is_held_has_no_preview(example, preview):
    with closing(sqlite3.connect(example.database)) as recorder:
        recorder.execute("BEGIN EXCLUSIVE")
        (line,) = preview(0)
    assert line.endswith("(another process has held it for five seconds)")


def test_a_full_disk_has_one_record(example, syslog):
    full = ["-P", example.database, "-e", "inject=pwrite64:error=ENOSPC"]
    result = example.upgrade(THRESHOLD - 1, under=[*STRACE, *full])
    assert (result.status, result.changes) == (255, [])
    assert syslog() == [f"{LAST}: database or disk is full (extended code 13)"]


def test_a_read_only_directory_has_one_record_an_action(
    appliance, read_only, syslog
):
    assert appliance.upgrade("--updateCap", appliance.caps).status == 255
    assert syslog()[:2] == [
        f"{MOVE}: camera: {READ_ONLY}; later files are left alone",
        f"{SPEED}: camera: {READ_ONLY}",
    ]
