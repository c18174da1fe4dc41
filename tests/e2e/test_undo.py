"""How tessel-undo takes an upgrade back, and what it leaves."""

import os
import re
import shutil
import sqlite3
import subprocess
import time
from contextlib import closing

import pytest
from conftest import SOURCE, STRACE, TOOL, UNDO
from conftest import changed_rows, other_tool, run
from test_documents import options

# Values that must be unique: two cameras exchange one, and a third loses one.
# Rows that only a rowid identifies. Rows that others can refer to. Values that
# differ only in case or type.
START = """
    INSERT INTO camera (id, vendor, model, fov, resolution) VALUES
      (901, 'Mine', 'A', '', 'QVGA'), (902, 'Mine', 'B', 'left side', ''),
      (903, 'Mine', 'C', 'right side', ''),
      (904, 'Mine', 'D', 'rear side', ''),
      (905, 'Mine', 'E', '', '');
    CREATE UNIQUE INDEX place ON camera (fov) WHERE fov LIKE '% side';
    CREATE TABLE note (t);
    INSERT INTO note VALUES ('a'), ('b'), ('''; ATTACH ''x'' AS x; --');
    CREATE TABLE output (id INTEGER PRIMARY KEY, name);
    INSERT INTO output VALUES (3, 'Door');
    CREATE TABLE relay (id INTEGER PRIMARY KEY, output REFERENCES output);
    INSERT INTO relay VALUES (7, 3);
    CREATE TABLE wire (id PRIMARY KEY, output REFERENCES output) WITHOUT ROWID;
    INSERT INTO wire VALUES ('cut', 99), ('whole', 3);
    CREATE TABLE word (id INTEGER PRIMARY KEY, w COLLATE NOCASE, n);
    INSERT INTO word VALUES (1, 'case', 1), (2, '', 1);
    CREATE TRIGGER act AFTER INSERT ON word
      BEGIN INSERT INTO note VALUES ('acted'); END;
    CREATE TABLE tag (t TEXT COLLATE NOCASE PRIMARY KEY, number UNIQUE);
    INSERT INTO tag VALUES ('x', 1), ('y', 2);
    CREATE TABLE tagged (number REFERENCES tag (number));
    CREATE VIRTUAL TABLE manual USING fts5 (page);
    INSERT INTO manual VALUES ('pan and tilt');"""
UPGRADE = """
    UPDATE camera SET resolution = '320x240', live_resolution = ''
      WHERE id = 901;
    UPDATE camera SET fov = '' WHERE id = 902;
    UPDATE camera SET fov = 'left side' WHERE id = 903;
    UPDATE camera SET fov = 'right side' WHERE id = 902;
    UPDATE camera SET fov = '', vendor = 'Ours' WHERE id = 904;
    UPDATE note SET t = t || '!';
    UPDATE word SET w = 'CASE' WHERE id = 1;
    UPDATE word SET n = 1.0 WHERE id = 2;
    DELETE FROM relay;
    DELETE FROM wire WHERE id = 'whole';
    INSERT INTO output VALUES (4, 'Siren');
    DELETE FROM tag WHERE t = 'y';
    UPDATE tag SET t = 'X', number = 3, rowid = 2 WHERE t = 'x';"""


@pytest.fixture
def upgraded(example, preview, tmp_path):
    """Previews an upgrade, which keeps a change file, and upgrades."""

    def upgrade(sql=UPGRADE, start=START, name="changes", tool=":"):
        example.sql(f"{start};")
        example.before = example.state()
        changes = tmp_path / "changes.sql"
        changes.write_text(sql)
        commands = f"""{tool} "$@"
            cd {example.directory}
            sqlite3 system.db <{changes}
            for name in EX-2100 EX-2200 EX-4310; do
              echo new=1 >>"@camveld/@KICapInfo/$name"
            done"""
        upgrade_tool = other_tool(tmp_path / "upgrade-tool", commands)
        file = example.directory / name
        preview("--undo", file, 0, tool=upgrade_tool)
        subprocess.check_call([upgrade_tool, "0"])
        return file

    return upgrade


def undo(example, *arguments, status=0):
    ended = run(*example.command(UNDO, *arguments))
    assert ended.returncode == status, ended.stdout
    return ended.stdout


def left(output):
    return re.findall("^left: (.*)", output, re.M)


def test_all_goes_back_once(example, upgraded, tmp_path):
    file = upgraded(tool=example.script(tmp_path / "tool", TOOL))
    (example.caps / "link").symlink_to("EX-2100")
    os.chmod(example.caps / "EX-2100", 0o640)
    end = example.state()
    dry = undo(example, "--dry-run", file)
    example.must_be_as(end)
    assert undo(example, file) == dry
    rows, files = example.before
    example.must_be_as((rows, files | {"link": files["EX-2100"]}))
    assert (example.caps / "EX-2100").stat().st_mode & 0o777 == 0o640
    count = dry.splitlines()[-1].split()[0]
    assert dry.endswith(f"{count} set back, 0 left, 0 already as before\n")
    again = undo(example, file)
    assert again.endswith(f"\n0 set back, 0 left, {count} already as before\n")


# What somebody does after the upgrade.
SINCE = [
    "UPDATE camera SET resolution = 'MINE' WHERE id = 901",
    "UPDATE camera SET vendor = 'Acme', model = 'X' WHERE id = 901",
    "DELETE FROM word WHERE id = 1",
    "UPDATE output SET name = 'Gate' WHERE id = 4",
    "INSERT INTO relay VALUES (1, 4)",
    "DELETE FROM output WHERE id = 3",
    "INSERT INTO tagged VALUES (3)",
    "UPDATE camera SET fov = 'rear side' WHERE id = 905",
    "UPDATE camera SET fov = 'rear side' WHERE id = 905; "
    "UPDATE camera SET name = 'Mine' WHERE id = 904",
    "DELETE FROM note WHERE t = 'a!'; VACUUM",
    "ALTER TABLE note ADD COLUMN u",
    "INSERT INTO note VALUES ('c'); UPDATE note SET t = 'd' WHERE rowid = 1",
    # A taken rowid keeps no row away.
    "INSERT INTO tag (t) VALUES ('z')",
    # An interrupted upgrade: some of it is as before.
    "UPDATE camera SET resolution = 'QVGA' WHERE id = 901; "
    "UPDATE camera SET vendor = 'Mine' WHERE id = 904; "
    "UPDATE note SET t = 'a' WHERE t = 'a!'; DELETE FROM output WHERE id = 4",
]


def test_what_somebody_has_changed_is_left_as_expected(
    example, upgraded, accepts
):
    file = upgraded(name="100%41#?")
    os.chmod(example.directory, 0o1777)  # only owners can replace files
    end = example.save()
    lines = []
    for since in SINCE:
        example.restore(end)
        example.sql(f"{since};")
        ended = run(*example.command(UNDO, file))
        said = ended.stdout.splitlines()
        said = [line for line in said if not line.startswith("not in the")]
        lines += ["", f"After {since};", *said]
        differ = changed_rows(example.before[0], example.rows())
        lines += [f"status {ended.returncode}, differs:", *differ]
    accepts("undo.txt", "what the undo leaves differs", lines)


def test_the_later_upgrade_goes_back_first(example, upgraded):
    first = upgraded()
    start = example.before
    more = "UPDATE camera SET resolution = 'twice' WHERE id = 901"
    second = upgraded(more, "", "second")
    row, *files = left(undo(example, first, status=3))
    assert row.startswith("camera 901 (Mine A) changed: ")
    assert len(files) == 3
    undo(example, second)
    undo(example, first)
    example.must_be_as(start)


MODULES = """
    CREATE TABLE face_data (x);
    PRAGMA writable_schema = ON;
    INSERT INTO sqlite_schema VALUES ('table', 'face', 'face', 0,
      'CREATE VIRTUAL TABLE face USING module_of_the_recorder (x)')"""


def test_an_index_of_words_stays_whole(example, upgraded):
    more = "UPDATE manual SET page = 'zoom'; INSERT INTO face_data VALUES (1)"
    output = undo(example, upgraded(more, START + MODULES), status=3)
    for part in "manual_content", "face_data":
        reason = "holds the content of a virtual table"
        assert f"not in the undo: {part} ({reason})" in output
    assert example.sql("SELECT * FROM face_data") == [(1,)]
    found = "SELECT page FROM manual WHERE manual MATCH 'zoom'"
    assert example.sql(found) == [("zoom",)]


def test_a_capability_file_that_cannot_go_back_is_left(example, upgraded):
    file = upgraded()
    files = example.capability_files()
    # A name that leads out of the directory is none of an upgrade.
    outside = example.caps / "../EX-2200"
    shutil.copy(example.caps / "EX-2200", outside)
    rename = "UPDATE file SET name = '../EX-2200' WHERE name = 'EX-2200'"
    subprocess.check_call(["sqlite3", file, rename])
    example.capability_file("EX-2100", "mine\n")
    (example.caps / ".zamoc.tmp").mkdir()
    changed, unwritable = left(undo(example, file, status=3))
    assert changed.startswith("file EX-2100: before ")
    assert changed.endswith("now 5 bytes (it has been changed since)")
    assert unwritable.startswith("file EX-4310: before ")
    reason = "(creation of a temporary file: Is a directory)"
    assert unwritable.endswith(reason)
    assert outside.read_text() == files["EX-2200"]
    rows, _ = example.before
    example.must_be_as((rows, files | {"EX-2100": "mine\n"}))


def test_a_link_leads_to_the_database_that_sqlite_opens(
    example, upgraded, tmp_path
):
    file = upgraded()
    (tmp_path / "a/b").mkdir(parents=True)
    (tmp_path / "link").symlink_to(tmp_path / "a/b")
    # As text, link/.. would be tmp_path.
    (tmp_path / "a/system.db").symlink_to(example.database)
    database = tmp_path / "link/../system.db"
    beside = tmp_path / "a/@camveld"
    shutil.copytree(example.caps.parent, beside)
    undo(example, "--caps", file, file, database, status=2)
    files = example.capability_files()
    undo(example, file, database)
    example.must_be_as((example.before[0], files))
    undo(example, "--caps", example.caps, file, database)
    example.must_be_as(example.before)
    example.caps = beside / "@KICapInfo"
    example.must_be_as(example.before)


def test_nobody_need_read_the_output(example, upgraded):
    command = example.command(UNDO, upgraded())
    unread = ["bash", "-o", "pipefail", "-c", '"$@" | true', "bash"]
    ended = run(*unread, *command)
    assert ended.stdout.endswith("cannot write the output: Broken pipe\n")
    assert ended.returncode == 0
    example.must_be_as(example.before)


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
        example.must_be_as(example.before)


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
    end = example.state()
    error = ["-e", "inject=/sync:error=EIO", "-P", example.database]
    ended = run(*STRACE, *error, *example.command(UNDO, file))
    assert ended.stdout.endswith("system.db: disk I/O error\n")
    assert ended.returncode == 2
    example.must_be_as(end)


def test_the_man_page_has_all_options(appliance):
    page = (SOURCE / "docs/tessel-undo.8").read_text().replace("\\-", "-")
    assert options(undo(appliance, "-h")) == options(page)
    assert undo(appliance, "-V").startswith("tessel-undo ")
