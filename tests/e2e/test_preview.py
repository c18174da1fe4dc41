"""What tessel-preview shows and writes, and that it leaves everything else as it was."""

import json
import os
import re
import signal
import sqlite3
import subprocess
import time
from contextlib import closing
from pathlib import Path

import pytest
from conftest import show

ADDED_BY_TRIGGER = (None, 0.1 + 0.2, 1e300, -(2**63), "it's \\ \"x\"\n\r", "\0", b"\0'\xff")
AWKWARD = r"""
    CREATE TABLE "o'd ""name"" rowid" (rowid, "a b" UNIQUE, c AS (rowid || '!'), d TEXT);
    INSERT INTO "o'd ""name"" rowid" (rowid, "a b", d) VALUES
      (1, x'00ff', CAST(x'ff41' AS TEXT)), (NULL, 1.5, 'x'), (7, CAST(x'410042' AS TEXT), '');
    CREATE TABLE pairs (a TEXT COLLATE NOCASE, b, v, PRIMARY KEY (b DESC, a)) WITHOUT ROWID;
    INSERT INTO pairs VALUES ('x', 1, 0.1), ('y', 1, NULL), ('Z', x'31', 12);
    CREATE TABLE added (id INTEGER PRIMARY KEY, v);
    CREATE TABLE hidden (rowid, _rowid_, oid);
    CREATE VIEW seen AS SELECT * FROM camera;
    CREATE VIRTUAL TABLE words USING fts5 (word);
    CREATE TRIGGER upgraded AFTER UPDATE OF vendor ON camera WHEN new.vendor = 'SIEMENS' BEGIN
      UPDATE "o'd ""name"" rowid" SET rowid = x'01', d = d || CAST(x'c3280a' AS TEXT);
      UPDATE "o'd ""name"" rowid" SET "a b" = 'it''s' WHERE "a b" = 1.5;
      UPDATE pairs SET a = upper(a), v = 1e300 * (1 + 1e-15) WHERE b = 1;
      DELETE FROM pairs WHERE b = x'31';
      INSERT INTO words VALUES ('word');
      VALUES_OF_ADDED
    END;"""


class Preview:
    """Runs the program on an appliance; nothing but what --undo writes may change."""

    def __init__(self, appliance, directory):
        self.appliance = appliance
        self.temporary = directory / "tmp"
        self.temporary.mkdir()
        self.tool = directory / "tesselupgrader"  # a script, since the tool may need an emulator
        self.set_tool("exec " + " ".join(appliance.command("tesselupgrader")) + ' "$@"')

    def set_tool(self, text):
        self.tool.write_text(f"#!/bin/sh\n{text}\n")
        self.tool.chmod(0o755)

    def command(self, *arguments):
        return self.appliance.command("tessel-preview", "--tool", self.tool, *arguments)

    def environment(self):
        return dict(os.environ, TMPDIR=str(self.temporary))

    def files(self):
        paths = [*self.appliance.directory.glob("system.db*"), *self.appliance.caps.iterdir()]
        return {path: path.read_bytes() for path in paths if path.is_file()}

    def __call__(self, *arguments, status=0, under=()):
        before = self.files()
        ended = subprocess.run(
            [*under, *self.command(*arguments)],
            capture_output=True,
            text=True,
            env=self.environment(),
            timeout=120,
        )
        assert ended.returncode == status, ended.stdout + ended.stderr
        assert self.files() == before
        assert not list(self.temporary.iterdir())
        assert len(ended.stderr.splitlines()) == (status == 2), ended.stderr
        return ended.stderr if status == 2 else ended.stdout


@pytest.fixture
def preview(example, tmp_path_factory):
    return Preview(example, tmp_path_factory.mktemp("p"))


@pytest.fixture
def awkward(preview):
    """The example with names and values of all kinds, which a trigger changes in turn."""
    rows = "".join(
        f"INSERT INTO added (v) VALUES (CAST(x'{v.encode().hex()}' AS TEXT));"
        if isinstance(v, str)
        else f"INSERT INTO added (v) VALUES ({show(v)});"
        for v in ADDED_BY_TRIGGER
    )
    preview.appliance.sql(AWKWARD.replace("VALUES_OF_ADDED", rows))
    return preview


def test_shows_what_the_upgrade_then_changes(preview):
    database = preview.appliance.database
    output = preview(database, 0)
    summary = preview("--summary", database, "0").splitlines()
    assert output.startswith(f"tesselupgrader 1.0.0 ({preview.tool})\n")
    assert summary == [output.splitlines()[0], output.splitlines()[-1]]
    upgrade = preview.appliance.upgrade(0)
    lines = output.splitlines()
    assert [line for line in lines if re.search(r": .* -> | added: ", line)] == sorted(
        upgrade.changes, key=lambda line: lines.index(line)
    )
    assert output.endswith(
        f"\n{upgrade.diffs}206 cells in 111 cameras, 0 other cells, 9 rows added, "
        "0 rows removed, 6 files changed, 0 actions failed\n"
    )


def test_json_has_the_same_changes_as_the_text(awkward):
    def value(item):
        if not isinstance(item, dict):
            return show(item)
        ((kind, digits),) = item.items()
        data = bytes.fromhex(digits)
        return show(data if kind == "blob" else data.decode(errors="surrogateescape"))

    lines = []
    for line in awkward("--json", awkward.appliance.database, 0).splitlines():
        change = json.loads(line)
        keys = change.get("row") if isinstance(change.get("row"), list) else [change.get("row")]
        name = f"{change.get('table')} {', '.join(value(key) for key in keys)}"
        if change["change"] == "cell":
            if change["table"] == "camera":
                name += f" ({change['vendor']} {change['model']})"
            cell = f"{value(change['before'])} -> {value(change['after'])}"
            lines.append(f"{name} {change['column']}: {cell}")
        elif change["change"] in ("added", "removed"):
            cells = (f"{column}={value(item)}" for column, item in change["values"].items())
            lines.append(f"{name} {change['change']}: {', '.join(cells)}")
        elif change["change"] == "not compared":
            lines.append(f"not compared: {change['table']} ({change['reason']})")
    text = awkward(awkward.appliance.database, 0).splitlines()
    assert [line for line in text[1:-1] if line[0] not in "-+@ \\" or line in lines] == lines
    assert json.loads(line)["camera_cells"] == 206
    assert {"not compared: seen (view)", "not compared: words (virtual table)"} <= set(lines)


def everything(appliance):
    """Returns all rows, with the highest row numbers given out, and all capability files."""
    rows = dict(appliance.rows())
    rows["sequence"] = appliance.sql("SELECT * FROM sqlite_sequence")
    return rows, appliance.capability_texts()


def undo(appliance):
    script = appliance.directory / "undo/system.db.sql"
    output = subprocess.check_output(["sqlite3", appliance.database], stdin=script.open())
    return output.decode().splitlines()[-1]


@pytest.mark.parametrize("fixture", ["preview", "awkward"])
def test_undo_sets_everything_back(fixture, request):
    preview = request.getfixturevalue(fixture)
    appliance = preview.appliance
    before = everything(appliance)
    preview("--undo", appliance.directory / "undo", appliance.database, 0)
    appliance.upgrade(0)
    assert everything(appliance) != before
    count = int(undo(appliance).split()[0])
    patch = ["patch", "-s", "-p1", "-d", appliance.caps]
    subprocess.check_call([*patch, "-i", appliance.directory / "undo/KICapInfo.patch"])
    assert everything(appliance) == before
    assert undo(appliance) == f"0 set back, 0 changed since and left, {count} already as before"
    assert everything(appliance) == before


def test_undo_keeps_what_somebody_else_has_changed_since(preview):
    appliance = preview.appliance
    before = appliance.rows()
    preview("--undo", appliance.directory / "undo", appliance.database, 0)
    upgraded = appliance.upgrade(0).after
    changed = [("camera", (id,)) for id in range(10, 20)]  # DS2CD864FWD-E and those after it
    appliance.sql("UPDATE camera SET model = CAST(model AS BLOB) WHERE id BETWEEN 10 AND 19")
    appliance.sql("UPDATE camdeviceoutput SET name = 'Gate' WHERE id = 12")
    assert undo(appliance) == "204 set back, 11 changed since and left, 0 already as before"
    after = appliance.rows()
    for key in changed:
        assert after.pop(key) == {**before.pop(key), "model": upgraded[key]["model"].encode()}
    assert after.pop(("camdeviceoutput", (12,)))["name"] == "Gate"
    assert after == before


# --- Databases in use ---

COMMITTED = "camera 3 (Eyseo TVIP62000) resolution: 'UXGA' -> '1600x1200'"
WRITER = """
import os, sqlite3, sys
db = sqlite3.connect(sys.argv[1], isolation_level=None)
db.executescript(sys.argv[2] + "; UPDATE camera SET name = 'committed' WHERE id = 3")
db.executescript("PRAGMA cache_size = 5; BEGIN; UPDATE camera SET resolution = 'QVGA', "
                 "motion_area = zeroblob(3000)")
print("ready", flush=True)
sys.stdin.read()
os.kill(os.getpid(), 9)
"""


@pytest.mark.parametrize("killed", [False, True])
@pytest.mark.parametrize("mode", ["wal", "delete", "wal without shared memory"])
def test_a_database_in_use_is_seen_as_committed(preview, mode, killed):
    if not killed and mode != "wal":
        pytest.skip("a writer that has begun to write locks the database")
    database = preview.appliance.database
    pragma = f"PRAGMA journal_mode = {mode.split()[0]}"
    command = ["/usr/bin/python3", "-c", WRITER, database, pragma]
    pipe = subprocess.PIPE
    with subprocess.Popen(command, stdin=pipe, stdout=pipe, text=True) as writer:
        assert writer.stdout.readline() == "ready\n"
        if killed:
            writer.communicate("")
        if mode.endswith("memory"):
            Path(f"{database}-shm").unlink()
        if mode == "delete":
            assert Path(f"{database}-journal").stat().st_size > 1000
        assert COMMITTED in preview(database, 0)
        if not killed:
            writer.communicate("")


@pytest.mark.parametrize("setting", ["PRAGMA journal_mode = WAL", "PRAGMA journal_mode = PERSIST"])
def test_an_idle_database_stays_alone(preview, setting):
    preview.appliance.sql(f"{setting}; UPDATE camera SET name = 'x';")
    assert COMMITTED in preview(preview.appliance.database, 0)


# --- Failed actions, lists and checks ---


def test_a_failed_action_has_its_name_and_the_reason(preview):
    preview.appliance.sql("ALTER TABLE camera RENAME COLUMN audio_format TO sound")
    output = preview(preview.appliance.database, 364, status=255)
    assert "\nfailed: UpdateTrendNetAdoFmt: no such column: audio_format\n" in output
    assert output.endswith(", 1 actions failed\n")


def test_list_names_the_actions_in_order(preview):
    for version, count in ((0, 32), (79, 32), (80, 31), (2473, 1), (2474, 1), (2475, 0)):
        assert len(preview("--list", version).splitlines()) == count, version
    names = preview("--list", "67").splitlines()
    assert names[0] == "RenameAbusTvip62000Reso"
    assert names[-1] == "2 capability-file actions, which log no names"


def test_check_tells_whether_anything_is_left(preview):
    assert preview("--check", preview.appliance.database, 0, status=3) == ""
    preview.appliance.upgrade(0)
    assert preview("--check", preview.appliance.database, 0, status=3) == ""  # the AXIS A8105-E
    assert preview("--check", preview.appliance.database, 2401) == ""


def test_a_signal_leaves_nothing_behind(preview):
    preview.set_tool(f"echo $$ >{preview.temporary.parent}/pid; exec sleep 60")
    pid = preview.temporary.parent / "pid"
    command = preview.command(preview.appliance.database, 0)
    with subprocess.Popen(command, env=preview.environment()) as process:
        while not (pid.exists() and pid.read_text()):
            time.sleep(0.01)
        process.send_signal(signal.SIGTERM)
        assert process.wait(20) == -signal.SIGTERM
    assert not list(preview.temporary.iterdir())
    assert not Path(f"/proc/{pid.read_text().strip()}").exists()


# --- When there is no preview ---

WITHOUT = ("setpriv", "--bounding-set")


@pytest.mark.parametrize(
    "message, arguments, under",
    [
        ("unknown, ambiguous or incomplete option: --colour", ["--colour", 0], ()),
        ("VERSION is missing", [], ()),
        ("version 4294967296 is beyond 32 bits", [4294967296], ()),
        ("(give the number behind the dash: 2401)", ["8.2.0-2401"], ()),
        ("not a version number: 4o0", ["4o0"], ()),
        ("only one of --summary, --json, --list and --check", ["--json", "--check", 0], ()),
        ("cannot open NONE: No such file or directory", ["NONE", 0], ()),
        ("DIRECTORY is a directory, not a database", ["DIRECTORY", 0], ()),
        ("no such directory: NONE", ["--caps", "NONE", "DATABASE", 0], ()),
        ("DIRECTORY is not empty", ["--undo", "DIRECTORY", "DATABASE", 0], ()),
        ("cannot run NONE: No such file or directory", ["--tool=NONE", "DATABASE", 0], ()),
        ("TEXT is damaged: file is not a database", ["TEXT", 0], ()),
        ("DAMAGED is damaged: ", ["DAMAGED", 0], ()),
        ("LOCKED: another process has held the database locked", ["LOCKED", 0], ()),
        ("WAL: its write-ahead log needs its owner: ", ["WAL", 0], ()),
        ("cannot open SECRET: Permission denied", ["SECRET", 0], (*WITHOUT, "-dac_override")),
        ("unshare: unshare failed: Operation not permitted", [0], (*WITHOUT, "-sys_admin")),
    ],
    ids=lambda value: value if isinstance(value, str) else "",
)
def test_one_line_says_why_there_is_no_preview(preview, message, arguments, under):
    if under and os.geteuid() != 0:
        pytest.skip("only root can give up a capability")
    directory = preview.appliance.directory
    image = preview.appliance.database.read_bytes()
    (directory / "TEXT").write_text("text " * 1000)
    (directory / "DIRECTORY/x").mkdir(parents=True)
    (directory / "DAMAGED").write_bytes(image[:4096] + b"\xee" * 8192 + image[12288:])
    for name in ("LOCKED", "WAL", "SECRET"):
        (directory / name).write_bytes(image)
    (directory / "SECRET").chmod(0)
    (directory / "WAL-wal").touch()
    (directory / "WAL-shm").mkdir()
    names = "NONE DIRECTORY DATABASE TEXT DAMAGED LOCKED WAL SECRET".split()
    paths = {name: str(directory / name) for name in names}
    paths["DATABASE"] = str(preview.appliance.database)
    pattern = re.compile(rf"\b({'|'.join(names)})\b")

    def place(text):
        return pattern.sub(lambda match: paths[match[0]], str(text))

    database = [paths["DATABASE"]] if arguments == [0] else []
    with closing(sqlite3.connect(paths["LOCKED"], isolation_level=None)) as holder:
        holder.execute("BEGIN EXCLUSIVE")
        error = preview(*database, *map(place, arguments), status=2, under=under)
    assert error.startswith("tessel-preview: ") and place(message) in error
