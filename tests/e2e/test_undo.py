"""How tessel-undo takes an upgrade back, and what it leaves."""

import os
import re
import shutil
import sqlite3
import subprocess
import time
from contextlib import closing

import pytest
from conftest import SOURCE, STRACE, UNDO, changed_rows, run
from test_documents import options

MAKE = "tests/makechanges"
# Values that must be unique: two cameras exchange one, and a third loses one.
# Rows that only a rowid identifies. Rows that others can refer to. Values that
# differ only in case or type.
START = """
    CREATE UNIQUE INDEX place ON camera (fov) WHERE fov LIKE '% side';
    UPDATE camera SET fov = 'left side' WHERE id = 3;
    UPDATE camera SET fov = 'right side' WHERE id = 4;
    UPDATE camera SET fov = 'rear side' WHERE id = 5;
    CREATE TABLE note (t);
    INSERT INTO note VALUES ('a'), ('b'), ('''; ATTACH ''x'' AS x; --');
    CREATE TABLE relay (id INTEGER PRIMARY KEY,
      output REFERENCES camdeviceoutput);
    INSERT INTO relay VALUES (7, 3);
    CREATE TABLE word (id INTEGER PRIMARY KEY, w COLLATE NOCASE, n);
    INSERT INTO word VALUES (1, 'case', 1), (2, '', 1);
    CREATE TABLE tag (t TEXT COLLATE NOCASE PRIMARY KEY, number UNIQUE);
    INSERT INTO tag VALUES ('x', 1), ('y', 2);
    CREATE TABLE tagged (number REFERENCES tag (number));
    CREATE VIRTUAL TABLE manual USING fts5 (page);
    INSERT INTO manual VALUES ('pan and tilt')"""
UPGRADE = """
    UPDATE camera SET fov = '' WHERE id = 3;
    UPDATE camera SET fov = 'left side' WHERE id = 4;
    UPDATE camera SET fov = 'right side' WHERE id = 3;
    UPDATE camera SET fov = '' WHERE id = 5;
    UPDATE note SET t = t || '!';
    UPDATE word SET w = 'CASE' WHERE id = 1;
    UPDATE word SET n = 1.0 WHERE id = 2;
    DELETE FROM relay;
    DELETE FROM tag WHERE t = 'y';
    UPDATE tag SET t = 'X', number = 3 WHERE t = 'x'"""


@pytest.fixture
def upgraded(example, tmp_path):
    """Upgrades the example, with more changes, and makes a change file."""

    def upgrade(more=UPGRADE, start=START, name="changes"):
        example.sql(start + ";")
        shutil.copy(example.database, tmp_path / "before.db")
        shutil.copytree(example.caps, tmp_path / "caps", dirs_exist_ok=True)
        example.rows_before = example.rows()
        example.files_before = example.capability_files()
        example.upgrade(0)
        example.sql(more + ";")
        shutil.copy(example.database, tmp_path / "after.db")
        states = tmp_path / "before.db", tmp_path / "after.db"
        files = tmp_path / "caps", example.caps
        file = example.directory / name
        command = [file, *states, example.database, *files]
        subprocess.check_call(example.command(MAKE, *command))
        return file

    return upgrade


def undo(example, *arguments, status=0):
    ended = run(*example.command(UNDO, *arguments))
    assert ended.returncode == status, ended.stdout
    return ended.stdout


def left(output):
    return [line for line in output.splitlines() if line.startswith("left: ")]


def test_all_goes_back_once(example, upgraded):
    file = upgraded()
    (example.caps / "link").symlink_to("EX-2100")
    os.chmod(example.caps / "EX-2100", 0o640)
    dry = undo(example, "--dry-run", file)
    assert example.rows() != example.rows_before
    assert undo(example, file) == dry
    counts = dry.splitlines()[-1].split()
    assert counts[3:5] == ["0", "left,"]
    assert changed_rows(example.rows_before, example.rows()) == []
    files = example.capability_files()
    assert files.pop("link") == files["EX-2100"]
    assert files == example.files_before
    assert (example.caps / "EX-2100").stat().st_mode & 0o777 == 0o640
    again = undo(example, file).splitlines()[-1]
    assert again == f"0 set back, 0 left, {counts[0]} already as before"


CAMERA_1 = "camera 1 (ABUS TVIP62000) changed: before resolution='QVGA'"
ALL = "resolution='320x240', live_resolution='320x240'"
OUTPUT_12 = "camdeviceoutput 12 added: before none; after id=12, "
FORBIDDEN = "UNIQUE, CHECK or NOT NULL forbids it now"
# What somebody does after the upgrade, and how the line on what is left
# begins and ends. Only these rows differ from those at the start.
LEFT = {
    "UPDATE camera SET resolution = 'MINE' WHERE id = 1": (
        f"{CAMERA_1}; after resolution='320x240'; now resolution='MINE'",
        "it has been changed since",
    ),
    "UPDATE camera SET vendor = 'Acme', model = 'X' WHERE id = 1": (
        f"{CAMERA_1}, live_resolution='QVGA'; after {ALL}; now {ALL}",
        "it is another camera now",
    ),
    "DELETE FROM camera WHERE id = 1": (
        f"{CAMERA_1}, live_resolution='QVGA'; after {ALL}; now none",
        "the row is gone",
    ),
    "UPDATE camdeviceoutput SET name = 'Gate' WHERE id = 12": (
        OUTPUT_12,
        "the row has been changed since",
    ),
    "INSERT INTO relay VALUES (1, 12)": (
        OUTPUT_12,
        "a row of relay refers to it",
    ),
    "DELETE FROM camdeviceoutput WHERE id = 3": (
        "relay 7 removed: before id=7, output=3; after none; now none",
        "it refers to a row of camdeviceoutput that is gone",
    ),
    "INSERT INTO tagged VALUES (3)": (
        "tag 'x' changed: before t='x', number=1; after t='X', number=3; now",
        "a row of tagged refers to it",
    ),
    "UPDATE camera SET fov = 'rear side' WHERE id = 6;"
    "UPDATE camera SET name = 'Mine' WHERE id = 5": (
        "camera 5 (ABUS TVIP62000) changed: before fov='rear side'; ",
        FORBIDDEN,
    ),
    "UPDATE camera SET fov = 'rear side' WHERE id = 6": (
        "camera 5 (ABUS TVIP62000) changed: before fov='rear side'; ",
        FORBIDDEN,
    ),
    "DELETE FROM note WHERE t = 'a!'; VACUUM": (
        "note: 3 rows",
        "its rows may have been renumbered since",
    ),
    "ALTER TABLE note ADD COLUMN u": (
        "note: 3 rows",
        "its definition has been changed since",
    ),
    "INSERT INTO note VALUES ('c'); UPDATE note SET t = 'd' WHERE rowid = 1": (
        "note 1 changed: before t='a'; after t='a!'; now t='d'",
        "the row has been changed since",
    ),
}


def names(before, after):
    lines = changed_rows(before, after)
    words = [line.lower().replace("'", "").split() for line in lines]
    return {f"{table} {key}" for table, key, *_ in words}


@pytest.mark.parametrize("since", LEFT)
def test_what_somebody_has_changed_is_left_and_named(example, upgraded, since):
    file = upgraded()
    rows = example.rows()
    example.sql(since + ";")
    allowed = names(rows, example.rows())
    begin, end = LEFT[since]
    (line,) = left(undo(example, file, status=3))
    assert re.fullmatch(f"left: {re.escape(begin)}.*\\({end}\\)", line)
    allowed.add(" ".join(line.replace("'", "").split()[1:3]))
    remaining = names(example.rows_before, example.rows())
    # The rows of notes have no names.
    assert {row for row in remaining if "note" not in row} <= allowed


def test_an_interrupted_upgrade_goes_back(example, upgraded):
    file = upgraded(name="100%41#?")
    os.chmod(example.directory, 0o1777)  # only owners can replace files
    vendor = example.rows_before["camera", 31]["vendor"]
    example.sql(f"UPDATE camera SET vendor = '{vendor}' WHERE id = 31")
    example.sql("UPDATE camera SET resolution = 'QVGA' WHERE id = 1")
    example.sql("UPDATE note SET t = 'a' WHERE t = 'a!'")
    example.sql("DELETE FROM camdeviceoutput WHERE id = 12")
    assert not left(undo(example, file))
    assert changed_rows(example.rows_before, example.rows()) == []


def test_a_rowid_that_is_taken_keeps_no_row_away(example, upgraded):
    file = upgraded()
    example.sql("INSERT INTO tag (t) VALUES ('z')")
    undo(example, file)
    tags = "SELECT t FROM tag ORDER BY t"
    assert example.sql(tags) == [("x",), ("y",), ("z",)]


def test_the_later_upgrade_goes_back_first(example, upgraded):
    first = upgraded()
    more = "UPDATE camera SET resolution = 'twice' WHERE id = 1"
    second = upgraded(more, "", "second")
    (line,) = left(undo(example, first, status=3))
    assert line.startswith(f"left: {CAMERA_1}; after ")
    undo(example, second)
    undo(example, first)
    cameras = example.sql("SELECT resolution FROM camera WHERE id = 1")
    assert cameras == [("QVGA",)]


MODULES = """;
    CREATE TABLE face_data (x);
    PRAGMA writable_schema = ON;
    INSERT INTO sqlite_schema VALUES ('table', 'face', 'face', 0,
      'CREATE VIRTUAL TABLE face USING module_of_the_recorder (x)')"""


def test_an_index_of_words_stays_whole(example, upgraded):
    more = "UPDATE manual SET page = 'zoom'; INSERT INTO face_data VALUES (1)"
    file = upgraded(more, START + MODULES)
    output = undo(example, file, status=3)
    for part in "manual_content", "face_data":
        reason = "holds the content of a virtual table"
        assert f"not in the undo: {part} ({reason})" in output
    assert example.sql("SELECT * FROM face_data") == [(1,)]
    found = "SELECT page FROM manual WHERE manual MATCH 'zoom'"
    assert example.sql(found) == [("zoom",)]


def test_a_changed_capability_file_is_left(example, upgraded):
    file = upgraded()
    # A name that leads out of the directory is none of an upgrade.
    outside = example.caps / "../EX-2200"
    shutil.copy(example.caps / "EX-2200", outside)
    with closing(sqlite3.connect(file)) as changes, changes:
        changes.execute(
            "UPDATE file SET name = '../EX-2200' WHERE name = 'EX-2200'"
        )
    example.capability_file("EX-2100", "mine\n")
    (example.caps / "EX-4310").unlink()
    (example.caps / "EX-4310").mkdir()
    changed, unreadable = left(undo(example, file, status=3))
    assert changed.startswith("left: file EX-2100: before ")
    assert changed.endswith("now 5 bytes (it has been changed since)")
    assert unreadable.startswith("left: file EX-4310: ")
    assert example.capability_files()["EX-2100"] == "mine\n"
    assert outside.read_text() == example.capability_files()["EX-2200"]


def test_a_file_that_cannot_be_written_is_named(example, upgraded):
    file = upgraded()
    (example.caps / ".zamoc.tmp").mkdir()
    lines = left(undo(example, file, status=3))
    reason = "(creation of a temporary file: Is a directory)"
    assert lines and all(line.endswith(reason) for line in lines)
    assert changed_rows(example.rows_before, example.rows()) == []


def test_a_link_leads_to_the_database_that_sqlite_opens(
    example, upgraded, tmp_path
):
    file = upgraded()
    deep = tmp_path / "a/b"
    deep.mkdir(parents=True)
    (tmp_path / "link").symlink_to(deep)
    # As text, link/.. would be tmp_path.
    (tmp_path / "a/system.db").symlink_to(example.database)
    database = tmp_path / "link/../system.db"
    beside = tmp_path / "a/@camveld"
    shutil.copytree(example.caps.parent, beside)
    undo(example, file, database)
    assert changed_rows(example.rows_before, example.rows()) == []
    assert example.capability_files() != example.files_before
    undo(example, "--caps", file, file, database, status=2)
    undo(example, "--caps", example.caps, file, database)
    assert example.capability_files() == example.files_before
    example.caps = beside / "@KICapInfo"
    assert example.capability_files() == example.files_before


def test_nobody_need_read_the_output(example, upgraded):
    file = upgraded()
    # More lines than a buffer holds.
    example.sql("UPDATE camera SET resolution = 'MINE'")
    command = example.command(UNDO, file)
    pipes = {"stdout": subprocess.PIPE, "stderr": subprocess.PIPE}
    with subprocess.Popen(command, **pipes) as process:
        process.stdout.close()
        assert b"cannot write the output" in process.stderr.read()
    assert example.capability_files() == example.files_before


REFUSED = {
    # what is wrong, and the message
    "chmod 777 .": "others can write /var/packages/Camveld/target/",
    "chmod 666 changes": "others can write /var/packages/Camveld/target/c",
    "echo text >system.db": "file is not a database",
    "cp system.db changes": "changes is not a change file",
    "sqlite3 changes 'PRAGMA user_version = 2'": "format of another version",
    "sqlite3 changes 'DELETE FROM upgrade'": "changes is not complete",
    "chown 1 changes || chmod 666 changes": "others can write /var/packages/",
    "mkfifo a; mv a changes": "changes is not a regular file",
    "mv system.db a; cp a system.db": "system.db has been replaced since",
    "mv system.db /var/b; ln -s /var/b system.db": "the file belongs to",
    "rm changes": "No such file or directory",
    "mkdir a; rm -r a; rm system.db": "No such file or directory",
}


@pytest.mark.parametrize("wrong", REFUSED)
def test_one_line_says_why_nothing_is_done(example, upgraded, wrong):
    file = upgraded()
    files = example.capability_files()
    subprocess.check_call(["sh", "-ec", wrong], cwd=example.directory)
    output = undo(example, file, status=2)
    assert output.startswith("tessel-undo: ") and output.count("\n") == 1
    assert REFUSED[wrong] in output
    assert example.capability_files() == files
    if "has been replaced" in output or "belongs" in output:
        undo(example, "--force", file)
        assert changed_rows(example.rows_before, example.rows()) == []


def test_a_locked_database_is_not_touched(example, upgraded):
    file = upgraded()
    begin = time.monotonic()
    with closing(sqlite3.connect(example.database)) as recorder:
        recorder.execute("BEGIN IMMEDIATE")
        output = undo(example, file, status=2)
    assert time.monotonic() - begin > 4
    assert "another process has held it locked for five seconds" in output


def test_rows_that_cannot_be_synced_do_not_go_back(example, upgraded):
    file = upgraded()
    rows = example.rows()
    error = ["-e", "inject=/sync:error=EIO", "-P", example.database]
    ended = run(*STRACE, *error, *example.command(UNDO, file))
    assert ended.stdout.endswith("system.db: disk I/O error\n")
    assert ended.returncode == 2
    assert changed_rows(rows, example.rows()) == []


def test_the_man_page_has_all_options(appliance):
    page = (SOURCE / "docs/tessel-undo.8").read_text().replace("\\-", "-")
    assert options(undo(appliance, "-h")) == options(page)
    assert undo(appliance, "-V").startswith("tessel-undo ")
