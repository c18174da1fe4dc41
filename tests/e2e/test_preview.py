"""What tessel-preview shows and keeps; it leaves all else as it was."""

import json
import os
import re
import shutil
import sqlite3
import subprocess
from contextlib import closing
from pathlib import Path

import pytest
from conftest import PREVIEW, SOURCE, STRACE, TOOL, run
from test_migrations import tables

# Names and values of all kinds, which a trigger changes in turn.
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
    CREATE VIEW seen AS SELECT 1;
    CREATE TRIGGER t AFTER UPDATE ON camera WHEN new.vendor = 'SIEMENS' BEGIN
      UPDATE "o'd ""tab"" 1" SET rowid = x'01', d = d || CAST(x'c3' AS TEXT);
      UPDATE "o'd ""tab"" 1" SET "a b" = 'it''s \' WHERE "a b" = 1.5;
      UPDATE pairs SET v = 1.0 / 3 WHERE b = 1;
      DELETE FROM pairs WHERE b = 2;
      INSERT INTO added (v) VALUES (NULL), (-9223372036854775807 - 1), (9e999),
        (1e-300 / 3), (char(0, 13, 10, 34, 39, 92, 233)), (x''), (x'00ff');
    END;"""


@pytest.fixture
def preview(example, tmp_path):
    """Runs the program, which must leave nothing and change nothing."""
    tool = example.script(tmp_path / "tool", TOOL)
    temporary = tmp_path / "tmp"
    temporary.mkdir()

    def run_preview(*arguments, under=(), status=0, tool=tool):
        before = everything(example)
        command = example.command(PREVIEW, "--tool", tool, *arguments)
        ended = run("env", f"TMPDIR={temporary}", *under, *command)
        assert ended.returncode == status, ended.stdout
        assert everything(example) == before
        assert not os.listdir(temporary)
        return ended.stdout

    return run_preview


@pytest.fixture
def kept():
    """The name of a change file, in a directory of its own."""
    directory = Path("/var/kept")
    directory.mkdir(mode=0o700)
    return directory / "from-0"


def everything(example):
    return example.rows(), example.capability_files()


def test_shows_what_the_upgrade_then_changes(example, preview):
    text = preview(0)
    upgrade = example.upgrade(0)
    shown = re.findall("^.*: .* -> .*|^.* added: .*", text, re.M)
    assert sorted(shown) == sorted(upgrade.changes)
    cells = [line for line in upgrade.changes if " -> " in line]
    added = len(upgrade.changes) - len(cells)
    others = [line for line in cells if not line.startswith("camera ")]
    count = len(cells) - len(others)
    cameras = {line.split()[1] for line in cells if line not in others}
    files = upgrade.diffs.count("--- ")
    assert text.endswith(
        f"\n{upgrade.diffs}{count} cells in {len(cameras)} cameras, "
        f"{len(others)} other cells, {added} rows added, 0 rows removed, "
        f"{files} files changed, 0 actions failed\n"
    )
    example.database.unlink()
    example.load_example()
    first, *_, last = text.splitlines()
    assert preview("--summary", 0).splitlines() == [first, last]


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
    assert ", capability files not looked at, " in preview(2475)
    assert json.loads(preview("--json", 2475))["files"] is None


def escaped(match):
    return f"\\x{ord(match[0]):02x}"


def shown(value):
    """A value of the JSON output as the text shows it."""
    match value:
        case None:
            return "NULL"
        case {"blob": digits}:
            return f"x'{digits}'"
        case {"real": name}:
            return name.lower()
        case str() | {"text": _}:
            is_text = isinstance(value, str)
            raw = value.encode() if is_text else bytes.fromhex(value["text"])
            raw = re.sub(rb"(['\\])", rb"\\\1", raw).decode("latin-1")
            return "'" + re.sub("[^ -~]", escaped, raw) + "'"
        case _:
            return str(value)


def line_of(change):
    """An object of the JSON output as a line of the text."""
    match change:
        case {"change": "not compared"}:
            return "not compared: {table} ({reason})".format(**change)
        case {"change": "file"}:
            return change["diff"].removesuffix("\n")
        case {"change": "failed"}:
            return "failed: {action}: {reason}".format(**change)
    row = change["row"] if isinstance(change["row"], list) else [change["row"]]
    start = f"{change['table']} {', '.join(map(shown, row))}"
    if change["change"] != "cell":
        cells = [f"{k}={shown(v)}" for k, v in change["values"].items()]
        return f"{start} {change['change']}: {', '.join(cells)}"
    if change["table"] == "camera":
        start += f" ({change['vendor']} {change['model']})"
    cells = shown(change["before"]), shown(change["after"])
    return f"{start} {change['column']}: {' -> '.join(cells)}"


@pytest.mark.parametrize("encoding", ["UTF-8", "UTF-16be"])
def test_json_says_the_same_as_the_text(example, preview, encoding):
    example.database.unlink()
    text = (SOURCE / "examples/appliance.sql").read_text()
    example.sql(f"PRAGMA encoding = '{encoding}'; {text} {AWKWARD}")
    example.sql("ALTER TABLE camera RENAME audio_format TO sound")
    tool, *lines, last = preview(0, status=255).splitlines()
    assert "tesselupgrader " in tool
    *changes, summary = preview("--json", 0, status=255).splitlines()
    changes = [line_of(json.loads(change)) for change in changes]
    assert "\n".join(changes).splitlines() == lines
    for shown in lines, preview("--summary", 0, status=255).splitlines():
        others = [line for line in shown if line.startswith("not compared")]
        assert others == ["not compared: seen (view)"]
    number = "0.30000000000000004 -> 0.3333333333333333"
    assert f"pairs 1, 'x' v: {number}" in lines
    numbers = map(int, re.findall(r"\d+", last))
    assert list(json.loads(summary).values()) == ["summary", *numbers, 255]


@pytest.mark.parametrize("mode", ["delete", "wal", "wal without shm"])
@pytest.mark.parametrize("name", ["system.db", "link.db", "link/../system.db"])
def test_a_crashed_database_is_seen_as_committed(
    example, tmp_path, mode, name
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
    tool = example.script(tmp_path / "tool", TOOL)
    shown = run(*example.command(PREVIEW, "--tool", tool, path, 0)).stdout
    change = "camera 3 (Eyseo TVIP62000) resolution: 'VGA' -> '640x480'"
    assert change in shown


COLUMNS = ", ".join(f"c{number}" for number in range(480))
WIDE = f"CREATE TABLE wide ({COLUMNS}{{}})"
TOO_WIDE = "not compared: wide (more than 480 columns)\n"
THEIRS = "CREATE TABLE t (a COLLATE theirs PRIMARY KEY) WITHOUT ROWID"
NO_ORDER = "not compared: t (no such collation sequence: theirs)\n"
NO_ROWID = "not compared: ids (columns hide every name of its rowid)\n"
CHECKS = [
    # what is done to the database, version, status, what is said
    ("", 2475, 0, ""),
    ("", 2401, 3, ""),
    ("DELETE FROM camera", 0, 3, ""),  # capability files change
    (WIDE.format(", more AS (c1)"), 2475, 0, ""),
    (WIDE.format(", more"), 2475, 2, TOO_WIDE),
    ("CREATE TABLE ids (oid, rowid, _rowid_)", 2475, 2, NO_ROWID),
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


def test_list_names_the_actions_in_their_order(preview):
    rows = [name for table in tables() for _, name in table]
    assert preview("--list", 0).split() == rows
    assert preview("--list", 2474).split() == rows[-3:-2]


def other_tool(tmp_path, commands):
    """A tool that runs commands in the place of an upgrade."""
    tool = tmp_path / "other-tool"
    tool.write_text(f"#!/bin/sh\n[ $# = 1 ] || exit 1\n{commands}\n")
    tool.chmod(0o755)
    return tool


def test_an_action_with_two_reasons_counts_once(preview, tmp_path):
    record = "logger -p user.err -t tesselupgrader Upgrade: EX"
    tool = other_tool(tmp_path, f"{record}-1: no; {record}-2: no; exit 255")
    text = preview(0, tool=tool, status=255)
    assert "failed: Upgrade: EX-1: no\nfailed: Upgrade: EX-2: no\n" in text
    assert text.endswith(", 1 actions failed\n")


def test_a_signal_leaves_nothing_behind(preview, tmp_path):
    sleep = f"sleep 60.{os.getpid()}"  # unlike that of another run
    tool = other_tool(tmp_path, f"exec {sleep}")
    # It does not wait for the tool to end.
    under = "timeout --preserve-status --foreground --kill-after=20 1".split()
    preview(0, under=under, status=143, tool=tool)
    assert run("pgrep", "-xf", sleep).stdout == ""


def test_the_tool_writes_nothing_but_its_copies(preview, tmp_path):
    outside = tmp_path / "outside"
    outside.mkdir()
    files = f"{outside}/file /dev/shm/file /var/packages/Camveld/target/file"
    preview(0, tool=other_tool(tmp_path, f"touch {files}; exit 0"))
    assert not os.listdir(outside) + list(Path("/dev/shm").glob("file"))


def test_programs_and_copies_may_be_below_var(example, kept):
    sbin, libexec = "/var/programs/sbin", "/var/programs/libexec"
    Path(sbin).mkdir(parents=True)
    shutil.copy(example.build / PREVIEW, sbin)
    shutil.copy(example.build / TOOL, sbin)
    shutil.copytree(example.build / "libexec", libexec)
    tool = example.script(Path("/var/programs/tool"), TOOL)
    options = ["--tool", tool] if example.emulator else []
    command = [*example.emulator, f"{sbin}/tessel-preview", *options, "0"]
    ended = run("env", "TMPDIR=/var/programs", *command)
    assert (ended.returncode, ", 0 actions failed" in ended.stdout) == (
        0,
        True,
    )


def test_the_change_file_is_complete_before_the_first_line(example, kept):
    tool = example.script(kept.parent / "tool", TOOL)
    options = ["--tool", tool, "--undo", kept]
    command = example.command(PREVIEW, *options, "0")
    with subprocess.Popen(command, stdout=subprocess.PIPE) as process:
        process.stdout.readline()
        process.kill()
    assert kept.stat().st_mode & 0o777 == 0o600
    with closing(sqlite3.connect(kept)) as changes:
        files = changes.execute("SELECT count(*) FROM file").fetchone()
    assert files == (example.upgrade(0).diffs.count("--- "),)


FULL = "head -c 9M /dev/zero >/var/packages/Camveld/target/file 2>/dev/null"
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
    tool = other_tool(tmp_path, f'{fill}; exec {tool} "$@"')
    size = f"size={room}m"
    mount = ["mount", "-t", "tmpfs", "-o", size, "tmpfs", tmp_path / "tmp"]
    subprocess.check_call(mount)
    try:
        output = preview("--undo", kept, 0, tool=tool, status=2)
    finally:
        subprocess.check_call(["umount", tmp_path / "tmp"])
    assert said in output
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
    ("8.2.0-2401", "8.2.0-2401 (give the number after the last hyphen: 2401)"),
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
    crash = other_tool(directory, "kill -SEGV $$")
    crash.rename(directory / "crash")
    words = arguments.replace("{}", str(directory)).split()
    last = preview(*words, status=2).splitlines()[-1]
    assert "tessel-preview: " in last
    assert message.replace("{}", str(directory)) in last
