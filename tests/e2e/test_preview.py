"""What tessel-preview shows and keeps; it leaves all else as it was."""

import json
import os
import re
import shutil
import sqlite3
import subprocess
import time
from contextlib import closing
from pathlib import Path

import pytest
from conftest import PREVIEW, SOURCE, STRACE, TOOL, complain, other_tool, run
from test_migrations import tables

# An upgrade from this version runs no action.
LAST = max(threshold for table in tables() for threshold, _ in table)

# Names and values of all kinds, and what changes them.
# The text d8c3 is invalid in each encoding.
AWKWARD = r"""
    CREATE TABLE "o'd ""tab"" 1" (rowid, "a b" UNIQUE, d);
    INSERT INTO "o'd ""tab"" 1" (rowid, "a b", d) VALUES
      (1, x'00ff', CAST(x'ff41' AS TEXT)),
      (NULL, 1.5, CAST(x'e08080' AS TEXT)),
      (7, CAST(x'410042' AS TEXT), '');
    CREATE TABLE pairs (a COLLATE NOCASE, b, v, PRIMARY KEY (b DESC, a))
      WITHOUT ROWID;
    INSERT INTO pairs VALUES ('x', 1, 0.1 + 0.2), ('y', 1, NULL), ('Z', 2, 3);
    CREATE TABLE added (id INTEGER PRIMARY KEY AUTOINCREMENT, v);
    CREATE VIEW seen AS SELECT 1;"""
CHANGES = r"""
    CREATE TABLE fresh (v); DROP TABLE setting;
    UPDATE camera SET resolution = 'it''s \', motion_area = x'00' WHERE id = 3;
    UPDATE "o'd ""tab"" 1" SET rowid = x'01', d = d || CAST(x'd8c3' AS TEXT);
    UPDATE "o'd ""tab"" 1" SET "a b" = 'it''s \' WHERE "a b" = 1.5;
    UPDATE pairs SET v = 1.0 / 3 WHERE b = 1;
    DELETE FROM pairs WHERE b = 2;
    INSERT INTO added (v) VALUES (NULL), (-9223372036854775807 - 1), (9e999),
      (1e-300 / 3), (char(0, 13, 10, 34, 39, 92, 233)), (x''), (x'00ff');"""
# A tool that makes these changes, and two failures of one action.
CHANGING_TOOL = """
    cd /var/packages/Camveld/target
    sqlite3 system.db <changes.sql
    printf 'added=1' >>@camveld/@KICapInfo/EX-2100
    for name in EX-1 EX-2; do
      logger -p user.err -t tesselupgrader "Upgrade: $name: it's full"
    done
    exit 255"""


@pytest.fixture
def kept():
    """The name of a change file, in a directory of its own."""
    directory = Path("/var/kept")
    directory.mkdir(mode=0o700)
    return directory / "from-0"


def test_shows_what_the_upgrade_then_changes(example, preview):
    first, *lines, last = preview(0).splitlines()
    assert preview("--summary", 0).splitlines() == [first, last]
    example.database.unlink()
    example.load_example()
    upgrade = example.upgrade(0)
    diffs = upgrade.diffs.splitlines()
    assert lines[-len(diffs) :] == diffs
    differ = {*upgrade.changes} ^ {*lines[: -len(diffs)]}
    if differ:
        complain("preview and upgrade differ", sorted(differ))


@pytest.mark.parametrize("encoding", ["UTF-8", "UTF-16be"])
def test_awkward_names_and_values_are_shown_as_expected(
    example, preview, tmp_path, accepts, encoding
):
    example.database.unlink()
    text = (SOURCE / "examples/appliance.sql").read_text()
    example.sql(f"PRAGMA encoding = '{encoding}'; {text} {AWKWARD}")
    changes = tmp_path / "changes.sql"
    changes.write_text(CHANGES)
    tool = other_tool(
        tmp_path / "tool2", CHANGING_TOOL.replace("changes.sql", str(changes))
    )
    lines = []
    for mode in "", "--json", "--summary":
        shown = preview(*mode.split(), 0, tool=tool, status=255).splitlines()
        lines.append(f"tessel-preview {mode}")
        lines += [line for line in shown if str(tool) not in line]
    title = "the preview prints other lines"
    accepts(f"preview-{encoding.lower()}.txt", title, lines)


def test_relative_names_and_links_lead_to_what_they_say(
    example, preview, kept
):
    (kept.parent / "EX-4310").symlink_to(example.caps / "EX-4310")
    (kept.parent / "from-0.part").touch()  # of a killed preview
    options = ["--caps", "kept", "--undo", "kept/from-0"]
    database = "packages/Camveld/target/system.db"
    text = preview(*options, database, 0, under=["env", "--chdir=/var"])
    assert re.findall("^--- before/(.*)", text, re.M) == ["EX-4310"]
    assert kept.exists()


def test_the_summary_says_when_there_are_no_capability_files(example, preview):
    shutil.rmtree(example.caps)
    assert ", capability files not looked at, " in preview(LAST)
    assert json.loads(preview("--json", LAST))["files"] is None


@pytest.mark.parametrize("mode", ["delete", "wal", "wal without shm"])
@pytest.mark.parametrize("name", ["system.db", "link.db", "link/../system.db"])
def test_a_crashed_database_is_seen_as_committed(
    example, preview, tmp_path, mode, name
):
    example.sql(f"PRAGMA journal_mode = {mode.split()[0]}")
    writer = sqlite3.connect(example.database)
    writer.execute("UPDATE camera SET resolution = 'VGA' WHERE id = 3")
    writer.commit()
    # Too much for the cache: part of the transaction is in the files.
    writer.execute("PRAGMA cache_size = 5")
    writer.execute("UPDATE camera SET motion_area = zeroblob(3000)")
    writer.execute("UPDATE camera SET resolution = 'QVGA'")
    crashed = tmp_path / "crashed"
    (crashed / "below").mkdir(parents=True)
    for file in example.directory.glob("system.db*"):
        shutil.copy(file, crashed)
    writer.close()
    if "without" in mode:
        (crashed / "system.db-shm").unlink()
    (tmp_path / "link.db").symlink_to(crashed / "system.db")
    (tmp_path / "link").symlink_to(crashed / "below")
    path = crashed / name if name == "system.db" else f"{tmp_path}/{name}"
    change = "camera 3 (Eyseo TVIP62000) resolution: 'VGA' -> '640x480'"
    assert change in preview(path, 0)


COLUMNS = ", ".join(f"c{number}" for number in range(480))
WIDE = f"CREATE TABLE wide ({COLUMNS}{{}})"
TOO_WIDE = "not compared: wide (more than 480 columns)\n"
THEIRS = "CREATE TABLE t (a COLLATE theirs PRIMARY KEY) WITHOUT ROWID"
NO_ORDER = "not compared: t (no such collation sequence: theirs)\n"
NO_ROWID = "not compared: ids (columns hide every name of its rowid)\n"
CHECKS = [
    # what is done to the database, version, status, what is said
    ("", LAST, 0, ""),
    ("", 2401, 3, ""),
    ("DELETE FROM camera", 0, 3, ""),  # capability files change
    (WIDE.format(", more AS (c1)"), LAST, 0, ""),
    (WIDE.format(", more"), LAST, 2, TOO_WIDE),
    ("CREATE TABLE ids (oid, rowid, _rowid_)", LAST, 2, NO_ROWID),
    (THEIRS, 2401, 2, NO_ORDER),
    (f"{THEIRS}; ALTER TABLE camera DROP audio_format", 364, 255, NO_ORDER),
]


@pytest.mark.parametrize("change, version, status, said", CHECKS)
def test_check_tells_what_is_sure(
    example, preview, change, version, status, said
):
    with closing(sqlite3.connect(example.database)) as database:
        database.create_collation("theirs", lambda a, b: 0)
        database.executescript(change)
    assert preview("--check", version, status=status) == said


def test_list_needs_no_database(example, preview):
    example.database.unlink()
    rows = [row for table in tables() for row in table]
    for version in 0, 2474:
        selected = [name for above, name in rows if above > version]
        assert preview("--list", version).split() == selected


def test_a_signal_leaves_nothing_behind(preview, tmp_path):
    tool = other_tool(tmp_path / "tool2", "exec sleep 60")
    under = "timeout --preserve-status --foreground --kill-after=20 1".split()
    begin = time.monotonic()
    preview(0, under=under, status=143, tool=tool)
    # What cleans up behind a preview waits until the tool has ended.
    assert time.monotonic() - begin < 30, "the tool runs on"


def test_the_tool_writes_nothing_but_its_copies(preview, tmp_path):
    outside = tmp_path / "outside"
    outside.mkdir()
    files = f"{outside}/file /dev/shm/file /var/packages/Camveld/target/file"
    preview(0, tool=other_tool(tmp_path / "tool2", f"touch {files} || :"))
    assert not os.listdir(outside) + list(Path("/dev/shm").glob("file"))


def test_the_change_file_is_complete_before_the_first_line(example, kept):
    tool = example.script(kept.parent / "tool", TOOL)
    command = example.command(PREVIEW, "--tool", tool, "--undo", kept, 0)
    with subprocess.Popen(command, stdout=subprocess.PIPE) as process:
        process.stdout.readline()
        process.kill()
    assert kept.stat().st_mode & 0o777 == 0o600
    with closing(sqlite3.connect(kept)) as changes:
        files = changes.execute("SELECT count(*) FROM file").fetchone()
    assert files == (example.upgrade(0).diffs.count("--- "),)


FULL = "head -c 9M /dev/zero >/var/packages/Camveld/target/file 2>&1 || :"
ROOM = [
    # MB in TMPDIR, what fills it, what is said
    (1, ":", "TMPDIR needs 2 MB, has 1"),
    (3, FULL, "the copy cannot be upgraded: "),
]


@pytest.mark.parametrize("room, fill, said", ROOM)
def test_too_little_room_is_no_failure_of_the_upgrade(
    example, preview, tmp_path, kept, room, fill, said
):
    tool = example.script(tmp_path / "real-tool", TOOL)
    tool = other_tool(tmp_path / "tool2", f'{fill}; exec {tool} "$@"')
    run("mount", "-t", "tmpfs", "-o", f"size={room}m", "tmpfs", "/var/tmp")
    assert said in preview("--undo", kept, 0, tool=tool, status=2)
    assert not os.listdir(kept.parent)


@pytest.mark.parametrize("synced", ["from-0.part", "."])
def test_a_change_file_that_cannot_be_synced_is_not_kept(
    preview, kept, synced
):
    error = ["-e", "inject=fsync:error=EIO", "-P", kept.parent / synced]
    said = preview("--undo", kept, 0, under=[*STRACE, "-f", *error], status=2)
    assert said == f"tessel-preview: cannot write {kept}: Input/output error\n"
    assert not os.listdir(kept.parent)


@pytest.mark.parametrize("argument", ["0", "-h", "-V"])
def test_output_that_is_lost_is_a_failure(preview, argument):
    full = ["sh", "-c", 'exec "$@" >/dev/full', "sh"]
    said = preview(argument, under=full, status=2)
    assert said.startswith("tessel-preview: cannot write the output")


MESSAGES = [
    ("--colour 0", "unrecognized option '--colour'"),
    ("--json --check 0", "only one of --summary, --json, --list and --check"),
    ("4294967296", "version 4294967296 is beyond 32 bits"),
    ("8.2.0-2401", "0-2401' (give the number after the last hyphen: 2401)"),
    ("{}/@camveld 0", "@camveld is not a regular file"),
    ("{}/no\x9bne 0", "no\\xc2\\x9bne: No such file or directory"),
    ("{}/text 0", "text: file is not a database"),
    ("--undo {}/text {}/system.db 0", "text exists already"),
    ("--undo {}/open/new {}/system.db 0", "others can write the directory"),
    ("--undo {}/link/new {}/system.db 0", "link is a link"),
    ("--caps {}/text {}/system.db 0", "text is not a directory"),
    ("--tool {}/text {}/system.db 0", "cannot run {}/text: Permission denied"),
    ("--tool {}/crash {}/system.db 0", "crash: it was ended by Segmentation"),
]


@pytest.mark.parametrize("arguments, message", MESSAGES)
def test_one_line_says_why_there_is_no_preview(
    example, preview, arguments, message
):
    directory = example.directory
    (directory / "text").write_text("text " * 1000)
    (directory / "open").mkdir()
    (directory / "open").chmod(0o775)
    (directory / "link").symlink_to(directory)
    other_tool(directory / "crash", "kill -SEGV $$")
    words = arguments.replace("{}", str(directory)).split()
    last = preview(*words, status=2).splitlines()[-1]
    assert "tessel-preview: " in last
    assert message.replace("{}", str(directory)) in last
