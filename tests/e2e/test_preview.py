"""What tessel-preview shows and writes; it leaves all else as it was."""

import json
import os
import re
import shutil
import sqlite3
import subprocess

import pytest
from conftest import PREVIEW, TOOL, run

# Names and values of all kinds, which a trigger changes in turn.
AWKWARD = r"""
    CREATE TABLE "o'd ""tab"" 1" (rowid, "a b" UNIQUE, c AS (rowid+1), d);
    INSERT INTO "o'd ""tab"" 1" (rowid, "a b", d) VALUES
      (1, x'00ff', CAST(x'ff41' AS TEXT)), (NULL, 1.5, 'x'),
      (7, CAST(x'410042' AS TEXT), '');
    CREATE TABLE pairs (a COLLATE NOCASE, b, v, PRIMARY KEY (b DESC, a))
      WITHOUT ROWID;
    INSERT INTO pairs VALUES ('x', 1, 0.1 + 0.2), ('y', 1, NULL), ('Z', 2, 3);
    CREATE TABLE added (id INTEGER PRIMARY KEY AUTOINCREMENT, v);
    INSERT INTO added (v) VALUES (1);
    CREATE TRIGGER t AFTER UPDATE ON camera WHEN new.vendor = 'SIEMENS' BEGIN
      UPDATE "o'd ""tab"" 1" SET rowid = x'01', d = d || CAST(x'c3' AS TEXT);
      UPDATE "o'd ""tab"" 1" SET "a b" = 'it''s \' WHERE "a b" = 1.5;
      UPDATE pairs SET a = upper(a), v = 1e300 / 7 WHERE b = 1;
      DELETE FROM pairs WHERE b = 2;
      INSERT INTO added (v) VALUES (NULL), (-9223372036854775807 - 1),
        (1e-300 / 3), (char(0, 13, 10, 34, 39, 92)), (x''), (x'00ff');
    END;"""


@pytest.fixture
def preview(example, tmp_path):
    """Runs the program, which must leave nothing and change nothing."""
    tool = example.script(tmp_path / "tool", TOOL)
    temporary = tmp_path / "tmp"
    temporary.mkdir()

    def run_preview(*arguments, under=(), status=0):
        before = everything(example)
        command = example.command(PREVIEW, "--tool", tool, *arguments)
        ended = run("env", f"TMPDIR={temporary}", *under, *command)
        assert ended.returncode == status, ended.stdout
        assert everything(example) == before
        assert not os.listdir(temporary)
        return ended.stdout

    return run_preview


def everything(example):
    sequences = example.sql("SELECT * FROM sqlite_sequence")
    return example.rows(), sequences, example.capability_files()


def test_shows_what_the_upgrade_then_changes(example, preview):
    text = preview(0)
    objects = preview("--json", 0).splitlines()
    upgrade = example.upgrade(0)
    shown = re.findall("^.*: .* -> .*|^.* added: .*", text, re.M)
    assert sorted(shown) == sorted(upgrade.changes)
    cells = [line for line in upgrade.changes if " -> " in line]
    added = len(upgrade.changes) - len(cells)
    cameras = {line.split()[1] for line in cells}
    files = upgrade.diffs.count("--- ")
    assert text.endswith(
        f"\n{upgrade.diffs}{len(cells)} cells in {len(cameras)} cameras, "
        f"0 other cells, {added} rows added, 0 rows removed, "
        f"{files} files changed, 0 actions failed\n"
    )
    *changes, summary = map(json.loads, objects)
    assert summary["camera_cells"] == len(cells)
    line = "camera {row} ({vendor} {model}) {column}: {before!r} -> {after!r}"
    cell = next(change for change in changes if change["change"] == "cell")
    assert line.format(**cell) in cells


def undo(example):
    """Returns the last line that the script prints, which counts."""
    script = example.directory / "undo/system.db.sql"
    command = ["sqlite3", example.database, f".read {script}"]
    return subprocess.check_output(command, text=True).splitlines()[-1]


def test_undo_sets_everything_back(example, preview):
    example.sql(AWKWARD)
    before = everything(example)
    preview("--undo", example.directory / "undo", 0)
    run(*example.command(TOOL, 0))
    assert everything(example) != before
    done = undo(example)
    patch = example.directory / "undo/KICapInfo.patch"
    command = ["patch", "-s", "-p1", "-d", example.caps, "-i", patch]
    subprocess.check_call(command)
    assert everything(example) == before
    count = done.split()[0]
    left = "0 changed since and left"
    assert done == f"{count} set back, {left}, 0 already as before"
    assert undo(example).endswith(f"{left}, {count} already as before")
    assert everything(example) == before


def test_undo_keeps_what_somebody_else_has_changed_since(example, preview):
    before = example.rows()
    preview("--undo", example.directory / "undo", 0)
    changes = len(example.upgrade(0).changes)
    example.sql("UPDATE camera SET model = 'MINE' WHERE id = 10")
    example.sql("UPDATE camdeviceoutput SET name = 'Gate' WHERE id = 12")
    before["camera", 10]["model"] = "MINE"
    before["camdeviceoutput", 12] = example.rows()["camdeviceoutput", 12]
    done = undo(example)
    assert done.startswith(f"{changes - 2} set back, 2 changed since and left")
    assert example.rows() == before


@pytest.mark.parametrize("mode", ["delete", "wal"])
def test_a_crashed_database_is_seen_as_committed(
    example, preview, tmp_path, mode
):
    example.sql(f"PRAGMA journal_mode = {mode}")
    example.sql("UPDATE camera SET resolution = 'VGA' WHERE id = 3")
    writer = sqlite3.connect(example.database)
    # Too much for the cache: part of the transaction is in the files.
    writer.execute("PRAGMA cache_size = 5")
    writer.execute("UPDATE camera SET motion_area = zeroblob(3000)")
    writer.execute("UPDATE camera SET resolution = 'QVGA'")
    for file in example.directory.glob("system.db*"):
        shutil.copy(file, tmp_path)
    writer.close()
    shown = preview(tmp_path / "system.db", 0)
    change = "camera 3 (Eyseo TVIP62000) resolution: 'VGA' -> '640x480'"
    assert change in shown


def test_a_failed_action_has_its_name_and_the_reason(example, preview):
    example.sql("ALTER TABLE camera RENAME audio_format TO sound")
    output = preview(364, status=255)
    reason = "UpdateTrendNetAdoFmt: no such column: audio_format"
    assert f"\nfailed: {reason}\n" in output
    assert output.endswith(", 1 actions failed\n")


def test_check_tells_whether_anything_is_left(example, preview):
    assert preview("--check", 2401, status=3) == ""
    example.upgrade(2401)
    assert preview("--check", 2401) == ""


def test_a_signal_leaves_nothing_behind(preview, tmp_path):
    (tmp_path / "tool").write_text("#!/bin/sh\nexec sleep 60\n")
    preview(0, under=["timeout", "--preserve-status", "1"], status=143)


MESSAGES = [
    ("--colour 0", "option: --colour (--help says more)"),
    ("4294967296", "version 4294967296 is beyond 32 bits"),
    ("8.2.0-2401", "8.2.0-2401 (give the number behind the dash: 2401)"),
    ("{}/@camveld 0", "@camveld is a directory, not a database"),
    ("--undo {0}/@camveld {0}/system.db 0", "@camveld is not empty"),
    ("{}/text 0", "text is damaged: file is not a database"),
    ("{}/torn 0", "torn is damaged: "),
]


@pytest.mark.parametrize("arguments, message", MESSAGES)
def test_one_line_says_why_there_is_no_preview(
    example, preview, arguments, message
):
    (example.directory / "text").write_text("text " * 1000)
    image = bytearray(example.database.read_bytes())
    image[4096:12288] = b"\xee" * 8192
    (example.directory / "torn").write_bytes(image)
    words = arguments.format(example.directory).split()
    last = preview(*words, status=2).splitlines()[-1]
    assert last.startswith("tessel-preview: ") and message in last
