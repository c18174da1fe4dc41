"""What tessel-preview shows and writes, and that it leaves everything else as it was."""

import json
import os
import re
import shutil
import signal
import sqlite3
import subprocess
from contextlib import closing

import pytest
from conftest import show, wait_until

# Names and values of all kinds, which a trigger changes in turn.
AWKWARD = r"""
    CREATE TABLE "o'd ""name"" rowid" (rowid, "a b" UNIQUE, c AS (rowid || '!'), d TEXT);
    INSERT INTO "o'd ""name"" rowid" (rowid, "a b", d) VALUES
      (1, x'00ff', CAST(x'ff41' AS TEXT)), (NULL, 1.5, 'x'), (7, CAST(x'410042' AS TEXT), '');
    CREATE TABLE pairs (a TEXT COLLATE NOCASE, b, v, PRIMARY KEY (b DESC, a)) WITHOUT ROWID;
    INSERT INTO pairs VALUES ('x', 1, 0.1 + 0.2), ('y', 1, NULL), ('Z', x'31', 1e300 / 3);
    CREATE TABLE added (id INTEGER PRIMARY KEY AUTOINCREMENT, v);
    CREATE VIEW seen AS SELECT * FROM camera;
    CREATE TRIGGER upgraded AFTER UPDATE OF vendor ON camera WHEN new.vendor = 'SIEMENS' BEGIN
      UPDATE "o'd ""name"" rowid" SET rowid = x'01', d = d || CAST(x'c3280a' AS TEXT);
      UPDATE "o'd ""name"" rowid" SET "a b" = 'it''s \' WHERE "a b" = 1.5;
      UPDATE pairs SET a = upper(a), v = 1e300 / 7 WHERE b = 1;
      DELETE FROM pairs WHERE b = x'31';
      INSERT INTO added (v) VALUES (NULL), (-9223372036854775807 - 1), (0.1 + 0.2), (1e-300 / 3),
        (char(0, 13, 10, 34, 39, 92)), (x''), (x'00ff'), (CAST(x'ed' AS TEXT));
    END;"""


class Preview:
    """Runs the program on an appliance; nothing but what --undo writes may change."""

    def __init__(self, example):
        self.example = example
        self.temporary = example.directory / "tmp"
        self.temporary.mkdir()
        self.environment = dict(os.environ, TMPDIR=str(self.temporary))
        self.tool = example.directory / "tool"  # a script, since the tool may need an emulator
        self.set_tool("exec " + " ".join(example.command("tesselupgrader")) + ' "$@"')

    def set_tool(self, text):
        self.tool.write_text(f"#!/bin/sh\n{text}\n")
        self.tool.chmod(0o755)

    def command(self, *arguments):
        return self.example.command("tessel-preview", "--tool", self.tool, *arguments)

    def state(self):
        return self.example.rows(), self.example.capability_texts(), os.listdir(self.temporary)

    def __call__(self, *arguments, status=0):
        before = self.state()
        command = self.command(*arguments)
        ended = subprocess.run(command, capture_output=True, text=True, env=self.environment)
        assert ended.returncode == status, ended.stdout + ended.stderr
        assert self.state() == before
        assert len(ended.stderr.splitlines()) == (status == 2), ended.stderr
        return ended.stderr if status == 2 else ended.stdout


@pytest.fixture
def preview(example):
    return Preview(example)


def test_shows_what_the_upgrade_then_changes(preview):
    lines = preview(preview.example.database, 0).splitlines()
    objects = preview("--json", preview.example.database, 0).splitlines()
    upgrade = preview.example.upgrade(0)
    cells = [line for line in upgrade.changes if " -> " in line]
    added = len(upgrade.changes) - len(cells)
    cameras = {line.split()[1] for line in cells}
    changed = upgrade.diffs.count("--- ")
    assert sorted(re.findall(".*: .* -> .*|.* added: .*", "\n".join(lines))) == sorted(
        upgrade.changes
    )
    assert "\n".join(lines).endswith(
        f"\n{upgrade.diffs}{len(cells)} cells in {len(cameras)} cameras, 0 other cells, "
        f"{added} rows added, 0 rows removed, {changed} files changed, 0 actions failed"
    )
    changes = [json.loads(line) for line in objects]
    assert sorted(cells) == sorted(
        "camera {row} ({vendor} {model}) {column}: ".format(**change)
        + f"{show(change['before'])} -> {show(change['after'])}"
        for change in changes
        if change.get("change") == "cell"
    )
    assert (changes[-1]["camera_cells"], changes[-1]["rows_added"]) == (len(cells), added)


def everything(appliance):
    """Returns all rows, also of SQLite's own tables, and all capability files."""
    quoted = """SELECT '"' || replace(name, '"', '""') || '"' FROM sqlite_schema"""
    tables = appliance.sql(quoted + " WHERE type = 'table'")
    rows = {name: appliance.sql(f"SELECT * FROM {name}") for (name,) in tables}
    return rows, appliance.capability_texts()


def undo(appliance):
    script = (appliance.directory / "undo/system.db.sql").read_bytes()
    return subprocess.check_output(["sqlite3", appliance.database], input=script).decode()


def test_undo_sets_everything_back(preview):
    example = preview.example
    example.sql(AWKWARD + "INSERT INTO added (v) VALUES (1);")
    before = everything(example)
    preview("--undo", example.directory / "undo", example.database, 0)
    example.upgrade(0)
    assert everything(example)[0] != before[0]
    done = undo(example)
    patch = example.directory / "undo/KICapInfo.patch"
    subprocess.check_call(["patch", "-s", "-p1", "-d", example.caps, "-i", patch])
    assert everything(example) == before
    count = done.splitlines()[-1].split()[0]
    assert done.endswith(f"{count} set back, 0 changed since and left, 0 already as before\n")
    assert undo(example).endswith(f"0 changed since and left, {count} already as before\n")
    assert everything(example) == before


def test_undo_keeps_what_somebody_else_has_changed_since(preview):
    example = preview.example
    before = example.rows()
    preview("--undo", example.directory / "undo", example.database, 0)
    changes = len(example.upgrade(0).changes)
    example.sql("UPDATE camera SET model = CAST(model AS BLOB) WHERE id BETWEEN 10 AND 19")
    example.sql("UPDATE camdeviceoutput SET name = 'Gate' WHERE id = 12")
    kept = {key: row for key, row in example.rows().items() if row.get("name") == "Gate"}
    for id in range(10, 20):
        ((model,),) = example.sql(f"SELECT model FROM camera WHERE id = {id}")
        before["camera", id]["model"] = model
    assert f"{changes - 11} set back, 11 changed since and left, " in undo(example)
    assert example.rows() == {**before, **kept}


def test_a_database_in_use_is_seen_as_committed(preview, tmp_path):
    database = preview.example.database
    committed = "camera 3 (Eyseo TVIP62000) resolution: 'VGA' -> '640x480'"
    for mode in ("delete", "wal"):
        preview.example.sql(f"PRAGMA journal_mode = {mode}")
        preview.example.sql("UPDATE camera SET resolution = 'VGA' WHERE id = 3")
        with closing(sqlite3.connect(database, isolation_level=None)) as writer:
            # Too much for the cache: part of the transaction is in the files.
            writer.executescript(
                "PRAGMA cache_size = 5; BEGIN;"
                "UPDATE camera SET resolution = 'QVGA', motion_area = zeroblob(3000);"
            )
            crashed = tmp_path / mode
            crashed.mkdir()
            for file in database.parent.glob("system.db*"):
                shutil.copy(file, crashed)
            if mode == "wal":
                assert committed in preview(database, 0)
        assert committed in preview(crashed / "system.db", 0)


def test_a_failed_action_has_its_name_and_the_reason(preview):
    preview.example.sql("ALTER TABLE camera RENAME COLUMN audio_format TO sound")
    output = preview(preview.example.database, 364, status=255)
    assert "\nfailed: UpdateTrendNetAdoFmt: no such column: audio_format\n" in output
    assert output.endswith(", 1 actions failed\n")


def test_check_tells_whether_anything_is_left(preview):
    assert preview("--check", preview.example.database, 2401, status=3) == ""
    preview.example.upgrade(2401)
    assert preview("--check", preview.example.database, 2401) == ""


def test_a_signal_leaves_nothing_behind(preview):
    started = preview.example.directory / "started"
    command = preview.command(preview.example.database, 0)
    preview.set_tool(f"touch {started}; exec sleep 60")
    with subprocess.Popen(command, env=preview.environment) as process:
        wait_until(started.exists)
        process.send_signal(signal.SIGTERM)
    assert process.returncode == -signal.SIGTERM
    assert not os.listdir(preview.temporary)


MESSAGES = [
    ("--colour 0", "option: --colour (--help says more)"),
    ("4294967296", "version 4294967296 is beyond 32 bits"),
    ("8.2.0-2401", "8.2.0-2401 (give the number behind the dash: 2401)"),
    ("{}/@camveld 0", "@camveld is a directory, not a database"),
    ("--undo {0}/@camveld {0}/system.db 0", "@camveld is not empty"),
    ("{}/TEXT 0", "TEXT is damaged: file is not a database"),
    ("{}/DAMAGED 0", "DAMAGED is damaged: "),
]


@pytest.mark.parametrize("arguments, message", MESSAGES)
def test_one_line_says_why_there_is_no_preview(preview, arguments, message):
    directory = preview.example.directory
    image = preview.example.database.read_bytes()
    (directory / "TEXT").write_text("text " * 1000)
    (directory / "DAMAGED").write_bytes(image[:4096] + b"\xee" * 8192 + image[12288:])
    error = preview(*arguments.format(directory).split(), status=2)
    assert error.startswith("tessel-preview: ") and message in error
