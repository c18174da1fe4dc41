"""What tessel-preview shows and writes, and that it leaves everything else as it was."""

import json
import os
import re
import signal
import subprocess
import time
from pathlib import Path

import pytest
from conftest import show

# Names and values of all kinds, which a trigger changes in turn.
AWKWARD = r"""
    CREATE TABLE "o'd ""name"" rowid" (rowid, "a b" UNIQUE, c AS (rowid || '!'), d TEXT);
    INSERT INTO "o'd ""name"" rowid" (rowid, "a b", d) VALUES
      (1, x'00ff', CAST(x'ff41' AS TEXT)), (NULL, 1.5, 'x'), (7, CAST(x'410042' AS TEXT), '');
    CREATE TABLE pairs (a TEXT COLLATE NOCASE, b, v, PRIMARY KEY (b DESC, a)) WITHOUT ROWID;
    INSERT INTO pairs VALUES ('x', 1, 0.1 + 0.2), ('y', 1, NULL), ('Z', x'31', 1e300 / 3);
    CREATE TABLE added (id INTEGER PRIMARY KEY AUTOINCREMENT, v);
    CREATE VIEW seen AS SELECT * FROM camera;
    CREATE VIRTUAL TABLE words USING fts5 (word);
    CREATE TRIGGER upgraded AFTER UPDATE OF vendor ON camera WHEN new.vendor = 'SIEMENS' BEGIN
      UPDATE "o'd ""name"" rowid" SET rowid = x'01', d = d || CAST(x'c3280a' AS TEXT);
      UPDATE "o'd ""name"" rowid" SET "a b" = 'it''s \' WHERE "a b" = 1.5;
      UPDATE pairs SET a = upper(a), v = 1e300 / 7 WHERE b = 1;
      DELETE FROM pairs WHERE b = x'31';
      INSERT INTO words VALUES ('word');
      INSERT INTO added (v) VALUES (NULL), (-9223372036854775807 - 1), (0.1 + 0.2), (1e-300 / 3),
        (char(0, 13, 10, 34, 39, 92)), (x''), (x'00ff'), (CAST(x'ed' AS TEXT));
    END;"""


class Preview:
    """Runs the program on an appliance; nothing but what --undo writes may change."""

    def __init__(self, appliance, directory):
        self.appliance = appliance
        self.temporary = directory / "tmp"
        self.temporary.mkdir()
        self.environment = dict(os.environ, TMPDIR=str(self.temporary))
        self.tool = directory / "tool"  # a script, since the tool may need an emulator
        self.set_tool("exec " + " ".join(appliance.command("tesselupgrader")) + ' "$@"')

    def set_tool(self, text):
        self.tool.write_text(f"#!/bin/sh\n{text}\n")
        self.tool.chmod(0o755)

    def command(self, *arguments):
        return self.appliance.command("tessel-preview", "--tool", self.tool, *arguments)

    def files(self):
        paths = [*self.appliance.directory.glob("*"), *self.appliance.caps.iterdir()]
        return {path: path.read_bytes() for path in paths if path.is_file()}

    def __call__(self, *arguments, status=0, under=()):
        before = self.files()
        command = [*under, *self.command(*arguments)]
        ended = subprocess.run(command, capture_output=True, text=True, env=self.environment)
        assert ended.returncode == status, ended.stdout + ended.stderr
        assert self.files() == before and not list(self.temporary.iterdir())
        assert len(ended.stderr.splitlines()) == (status == 2), ended.stderr
        return ended.stderr if status == 2 else ended.stdout


@pytest.fixture
def preview(example, tmp_path_factory):
    return Preview(example, tmp_path_factory.mktemp("p"))


def test_shows_what_the_upgrade_then_changes(preview):
    output = preview(preview.appliance.database, 0)
    version = preview.appliance.run().output.splitlines()[0]
    upgrade = preview.appliance.upgrade(0)
    assert output.startswith(f"{version} ({preview.tool})\n")
    changes = re.findall("^.*: .* -> .*$|^.* added: .*$", output, re.MULTILINE)
    assert sorted(changes) == sorted(upgrade.changes)
    assert output.endswith(
        f"\n{upgrade.diffs}206 cells in 111 cameras, 0 other cells, 9 rows added, "
        "0 rows removed, 6 files changed, 0 actions failed\n"
    )


def as_text(change):
    """Returns the line of text that shows the same as an object of JSON."""

    def value(item):
        if not isinstance(item, dict):
            return show(item)
        if "blob" in item:
            return show(bytes.fromhex(item["blob"]))
        return show(bytes.fromhex(item["text"]).decode(errors="surrogateescape"))

    kind = change["change"]
    if kind == "not compared":
        return f"not compared: {change['table']} ({change['reason']})"
    keys = change["row"] if isinstance(change["row"], list) else [change["row"]]
    name = f"{change['table']} {', '.join(map(value, keys))}"
    if kind == "cell":
        camera = f" ({change['vendor']} {change['model']})" if "vendor" in change else ""
        cell = f"{value(change['before'])} -> {value(change['after'])}"
        return f"{name}{camera} {change['column']}: {cell}"
    cells = (f"{column}={value(item)}" for column, item in change["values"].items())
    return f"{name} {kind}: {', '.join(cells)}"


def test_json_has_the_same_changes_as_the_text(preview):
    preview.appliance.sql(AWKWARD)
    arguments = "--caps", preview.temporary, preview.appliance.database, 0
    changes = [json.loads(line) for line in preview("--json", *arguments).splitlines()]
    lines = preview(*arguments).splitlines()
    assert [as_text(change) for change in changes[:-1]] == lines[1:-1]
    assert {"not compared: seen (view)", "not compared: words (virtual table)"} <= set(lines)
    assert changes[-1]["camera_cells"] == 206 and changes[-1]["rows_removed"] == 1


def everything(appliance):
    """Returns all rows, also of SQLite's own tables, and all capability files."""
    tables = appliance.sql(
        """SELECT name, '"' || replace(name, '"', '""') || '"'
        FROM sqlite_schema WHERE type = 'table' AND sql NOT LIKE 'CREATE VIRTUAL%'"""
    )
    rows = {name: appliance.sql(f"SELECT * FROM {quoted}") for name, quoted in tables}
    return rows, appliance.capability_texts()


def undo(appliance):
    with (appliance.directory / "undo/system.db.sql").open() as script:
        output = subprocess.check_output(["sqlite3", appliance.database], stdin=script, text=True)
    return output.splitlines()[-1]


def test_undo_sets_everything_back(preview):
    appliance = preview.appliance
    appliance.sql(AWKWARD + "INSERT INTO added (v) VALUES (1);")
    before = everything(appliance)
    preview("--undo", appliance.directory / "undo", appliance.database, 0)
    appliance.upgrade(0)
    assert everything(appliance)[0] != before[0]
    done = undo(appliance)
    patch = appliance.directory / "undo/KICapInfo.patch"
    subprocess.check_call(["patch", "-s", "-p1", "-d", appliance.caps, "-i", patch])
    assert everything(appliance) == before
    count = done.split()[0]
    assert done == f"{count} set back, 0 changed since and left, 0 already as before"
    assert undo(appliance) == f"0 set back, 0 changed since and left, {count} already as before"
    assert everything(appliance) == before


def test_undo_keeps_what_somebody_else_has_changed_since(preview):
    appliance = preview.appliance
    before = appliance.rows()
    preview("--undo", appliance.directory / "undo", appliance.database, 0)
    upgraded = appliance.upgrade(0).after
    appliance.sql("UPDATE camera SET model = CAST(model AS BLOB) WHERE id BETWEEN 10 AND 19")
    appliance.sql("UPDATE camdeviceoutput SET name = 'Gate' WHERE id = 12")
    assert undo(appliance) == "204 set back, 11 changed since and left, 0 already as before"
    for id in range(10, 20):
        before["camera", (id,)]["model"] = upgraded["camera", (id,)]["model"].encode()
    before["camdeviceoutput", (12,)] = {**upgraded["camdeviceoutput", (12,)], "name": "Gate"}
    assert appliance.rows() == before


WRITER = """
import os, sqlite3, sys
db = sqlite3.connect(sys.argv[1], isolation_level=None)
db.executescript(sys.argv[2] + "; UPDATE camera SET resolution = 'VGA' WHERE id = 3")
db.executescript("PRAGMA cache_size = 5; BEGIN; UPDATE camera SET resolution = 'QVGA', "
                 "motion_area = zeroblob(3000)")
print("ready", flush=True)
sys.stdin.read()
os.kill(os.getpid(), 9)
"""


@pytest.mark.parametrize("mode", ["delete", "wal"])
def test_a_database_in_use_is_seen_as_committed(preview, mode):
    database = preview.appliance.database
    command = ["/usr/bin/python3", "-c", WRITER, database, f"PRAGMA journal_mode = {mode}"]
    pipe = subprocess.PIPE
    committed = "camera 3 (Eyseo TVIP62000) resolution: 'VGA' -> '640x480'"
    with subprocess.Popen(command, stdin=pipe, stdout=pipe, text=True) as writer:
        assert writer.stdout.readline() == "ready\n"
        if mode == "wal":
            assert committed in preview(database, 0)
        else:
            assert "has held the database locked" in preview(database, 0, status=2)
        writer.communicate("")
    assert committed in preview(database, 0)  # after a crash
    if mode == "wal":
        Path(f"{database}-shm").unlink()
        assert committed in preview(database, 0)
    preview.appliance.sql("VACUUM")
    assert committed in preview(database, 0)  # nobody uses it


def test_a_failed_action_has_its_name_and_the_reason(preview):
    preview.appliance.sql("ALTER TABLE camera RENAME COLUMN audio_format TO sound")
    output = preview(preview.appliance.database, 364, status=255)
    assert "\nfailed: UpdateTrendNetAdoFmt: no such column: audio_format\n" in output
    assert output.endswith(", 1 actions failed\n")


def test_list_names_the_actions_in_order(preview):
    for version, count in ((79, 32), (80, 31), (2473, 1), (2475, 0)):
        assert len(preview("--list", version).splitlines()) == count, version
    names = preview("--list", 0).splitlines()
    assert names[0] == "RenameAbusTvip62000Reso"
    assert names[-1] == "2 capability-file actions, which log no names"


def test_check_tells_whether_anything_is_left(preview):
    assert preview("--check", preview.appliance.database, 2401, status=3) == ""
    preview.appliance.upgrade(2401)
    assert preview("--check", preview.appliance.database, 2401) == ""


def test_a_signal_leaves_nothing_behind(preview):
    pid = preview.tool.with_name("pid")
    preview.set_tool(f"echo $$ >{pid}.new; mv {pid}.new {pid}; exec sleep 60")
    command = preview.command(preview.appliance.database, 0)
    with subprocess.Popen(command, env=preview.environment) as process:
        while not pid.exists():
            time.sleep(0.01)
        process.send_signal(signal.SIGTERM)
        assert process.wait() == -signal.SIGTERM
    assert not list(preview.temporary.iterdir())
    tool = Path(f"/proc/{pid.read_text().strip()}")
    for _ in range(1000):  # an emulator lets the preview end before it
        if tool.exists():
            time.sleep(0.01)
    assert not tool.exists()


WITHOUT_SYSTEM = ("setpriv", "--bounding-set=-sys_admin")
WITHOUT_ACCESS = ("setpriv", "--bounding-set=-dac_override,-dac_read_search")


@pytest.mark.parametrize(
    "message, arguments, under",
    [
        ("option: --colour (--help says more)", "--colour 0", ()),
        ("version 4294967296 is beyond 32 bits", "4294967296", ()),
        ("8.2.0-2401 (give the number behind the dash: 2401)", "8.2.0-2401", ()),
        ("@camveld is a directory, not a database", "@camveld 0", ()),
        ("@camveld is not empty", "--undo @camveld system.db 0", ()),
        ("TEXT is damaged: file is not a database", "TEXT 0", ()),
        ("DAMAGED is damaged: ", "DAMAGED 0", ()),
        ("cannot open {}/SECRET: Permission denied", "SECRET 0", WITHOUT_ACCESS),
        ("WAL: its write-ahead log needs its owner: ", "WAL 0", WITHOUT_ACCESS),
        ("unshare: unshare failed: Operation not permitted", "system.db 0", WITHOUT_SYSTEM),
    ],
)
def test_one_line_says_why_there_is_no_preview(preview, message, arguments, under):
    if under and os.geteuid() != 0:
        pytest.skip("only root can give up a capability")
    directory = preview.appliance.directory
    image = preview.appliance.database.read_bytes()
    (directory / "TEXT").write_text("text " * 1000)
    (directory / "DAMAGED").write_bytes(image[:4096] + b"\xee" * 8192 + image[12288:])
    for name in ("SECRET", "WAL", "WAL-wal", "WAL-shm"):
        (directory / name).write_bytes(image[:18] + b"\2\2" + image[20:])
    (directory / "SECRET").chmod(0)
    (directory / "WAL-shm").chmod(0)
    files = [re.sub("^(?=[@sA-Z])", f"{directory}/", word) for word in arguments.split()]
    error = preview(*files, status=2, under=under)
    assert error.startswith("tessel-preview: ") and message.format(directory) in error
