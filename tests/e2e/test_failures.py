"""A failed upgrade: what says so, and how it is answered."""

import re
import sqlite3
from contextlib import closing

import pytest
from conftest import PREVIEW, STRACE, UNDO, changed_rows, run
from test_migrations import tables

GUARD = """
    CREATE TRIGGER guard BEFORE UPDATE ON camera WHEN old.id = 31
    BEGIN SELECT RAISE(ABORT, 'guard says no'); END;"""
GUARDED = "UpdateFisheyeConfPanasonic438: guard says no"


def failed(text):
    return re.findall("^failed: (.*)", text, re.M)


def test_take_back_remove_the_cause_upgrade_again(example, preview, syslog):
    start = example.state()
    example.upgrade(0)
    rows, files = example.state()
    example.database.unlink()
    example.load_example()
    example.sql(GUARD)

    file = example.directory / "from-0"
    text = preview("--undo", file, 0, status=255)
    assert f"failed: {GUARDED} (camera 31 alone is enough)" in text
    assert example.upgrade(0).status == 255
    assert syslog()[0] == f"{GUARDED} (extended code 1811)"
    # Later actions have renamed its vendor: a second call finds nothing.
    assert example.rows() != rows
    run(*example.command(UNDO, file))
    example.must_be_as(start)
    example.sql("DROP TRIGGER guard;")
    assert example.upgrade(0).status == 0
    # The ids of the outputs go on.
    changes = changed_rows(rows, example.rows())
    outputs = re.compile("camdeviceoutput .* (added|removed)")
    assert not [line for line in changes if not outputs.match(line)]
    assert len(changes) == 2 * 9
    assert example.capability_files() == files


RENAMED = "UpdatePanasoniciPro2Panasonic: guard says no"
ENOUGH = " (camera 31 alone is enough)"
FORGED = """x'', 1
<11>Jan  1 00:00:00 tesselupgrader: UpdateTpLinkNC450: forged
Jan  1 00:00:00 [1] tesselupgrader.cpp:1:UpdateTpLinkNC450(): KiDBExecute \
command (DELETE FROM camera) error."""

PREVIEWED = [
    # what is done to the example, version, failures
    (GUARD, 308, [GUARDED + ENOUGH, RENAMED + ENOUGH]),
    (
        "ALTER TABLE camera RENAME audio_format TO sound",
        364,
        ["UpdateTrendNetAdoFmt: no such column: audio_format"],
    ),
    (  # it takes two cameras
        "CREATE UNIQUE INDEX one ON camera (vendor) WHERE vendor = 'SIEMENS'",
        85,
        [
            "UpdateCameraModelConfRenameSiemens: "
            "UNIQUE constraint failed: camera.vendor"
        ],
    ),
    (
        f"UPDATE camera SET connected_wire = '{FORGED}' WHERE id = 151",
        2400,
        ['UpdateAxisA8105E: near "1": syntax error'],
    ),
]


@pytest.mark.parametrize("change, version, failures", PREVIEWED)
def test_the_preview_names_action_reason_and_row(
    example, preview, change, version, failures
):
    example.sql(f"{change};")
    assert failed(preview(version, status=255)) == failures


THRESHOLD, LAST = tables()[0][-1]
MOVE, SPEED = [name for _, name in tables()[1]][:2]
READ_ONLY = "creation of a temporary file: Read-only file system"


def test_a_database_that_is_held_has_no_preview(example, preview):
    command = example.command(PREVIEW, "--tool", "/var/tool", 0)
    with closing(sqlite3.connect(example.database)) as recorder:
        recorder.execute("BEGIN EXCLUSIVE")
        said = run(*command).stdout
    assert said.endswith("(another process has held it for five seconds)\n")


def test_a_full_disk_has_one_record(example, syslog):
    full = ["-P", example.database, "-e", "inject=pwrite64:error=ENOSPC"]
    result = example.upgrade(THRESHOLD - 1, under=[*STRACE, *full])
    assert (result.status, result.changes) == (255, [])
    assert syslog() == [f"{LAST}: database or disk is full (extended code 13)"]


def test_a_read_only_directory_has_one_record_an_action(appliance, syslog):
    text = "ptz_continuous_move=yes\npan=continuous"
    new = appliance.capability_file("camera", text).with_name(".zamoc.tmp")
    read_only = ["-P", new, "-e", "inject=openat:error=EROFS"]
    under = [*STRACE, *read_only]
    appliance.upgrade("--updateCap", appliance.caps, under=under).must_be(255)
    assert syslog()[:2] == [
        f"{MOVE}: camera: {READ_ONLY}; later files are left alone",
        f"{SPEED}: camera: {READ_ONLY}",
    ]
