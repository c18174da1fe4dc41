"""Takes back upgrades of generated databases, and kills the undo."""

import re
import sqlite3
import subprocess
from collections import Counter
from contextlib import closing, suppress
from functools import partial
from pathlib import Path

import generate
from appliance import CAPS, SYSTEM, TARGET, TOOL, Recording
from appliance import create, read_disk, run

PREVIEW = "build/release/sbin/tessel-preview"
UNDO = "build/release/sbin/tessel-undo"
KEPT = "/var/changes"  # the change file
# Runs the tool, and then changes the rows of other tables.
UPGRADE = Path("/var/upgrade")
SCRIPT = f"""#!/bin/sh
[ $# = 1 ] || exit 1
{Path(TOOL[0]).resolve()} "$@"
exec /usr/bin/python3 {Path(generate.__file__).resolve()} {{}}
"""
# Two rows are the same if these values of their keys are equal.
FOLD = {"BINARY": "", "NOCASE": "lower", "RTRIM": "rtrim"}
KEY = "iif(typeof({0}) = 'text', hex(CAST({1}({0}) AS BLOB)), {0})"
# Two values are the same if their types and bytes are equal.
BYTES = "iif(typeof({0}) = 'text', CAST({0} AS BLOB), {0})"
CELL = f"typeof({{0}}) || ' ' || quote({BYTES})"
KEYS = """
    SELECT k.name, k.coll
    FROM pragma_index_list('{}') AS i, pragma_index_xinfo(i.name) AS k
    WHERE i.origin = 'pk' AND k.key"""
TABLES = """
    SELECT name, rowid_only FROM main.sqlite_schema
    LEFT JOIN kept.covered USING (name)
    WHERE type = 'table' AND name <> 'sqlite_sequence'"""


def call(*command):
    done = subprocess.run(command, capture_output=True, timeout=60)
    text = done.stdout + done.stderr
    return done.returncode, text.decode(errors="backslashreplace")


def preview(tool, kept):
    """Keeps what the tool would change. Returns the summary."""
    Path(kept).unlink(missing_ok=True)
    options = ["--summary", "--undo", kept, "--tool", tool]
    status, text = call("env", "TMPDIR=/var", PREVIEW, *options, SYSTEM, "0")
    assert status == 0, f"no preview: {text}"
    return text.splitlines()[-1]


def query(sql):
    with closing(sqlite3.connect(SYSTEM)) as db:
        db.execute("ATTACH ? AS kept", [KEPT])
        return db.execute(sql).fetchall()


def read_all():
    """The cells by table, key and column. The column "" is that of a row.

    Each capability file is a row.
    """
    files = Path(TARGET, CAPS).iterdir()
    found = {("file", path.name, ""): path.read_bytes() for path in files}
    for table, rowid_only in query(TABLES):
        keys = [] if rowid_only else query(KEYS.format(table))
        keys = [KEY.format(name, FOLD[collation]) for name, collation in keys]
        keys = keys or ["rowid"]
        columns = [row[1] for row in query(f"PRAGMA table_info({table})")]
        cells = [CELL.format(name) for name in columns]
        for row in query(f"SELECT {', '.join(keys + cells)} FROM {table}"):
            key, values = row[: len(keys)], row[len(keys) :]
            found[table, key, ""] = "there"
            for column, value in zip(columns, values):
                found[table, key, column] = value
    return found


def dangling():
    """Counts the references that lead nowhere."""
    with suppress(sqlite3.Error):  # some refer to what is not unique
        found = query("PRAGMA foreign_key_check")
        return Counter((child, parent, key) for child, _, parent, key in found)
    return Counter()


def disturb_rows(seed):
    """What somebody does after an upgrade. Returns whether it renumbers."""
    others = generate.Rows(f"others {seed}")
    for column in "resolution", "vendor", "motion_area":
        others.run(f"UPDATE camera SET {column} = 'MINE' WHERE chance(0.1)")
    others.run("DELETE FROM camera WHERE chance(0.05)")
    others.run("UPDATE camdeviceoutput SET name = 'Gate' WHERE chance(0.3)")
    others.change(5)
    Path(TARGET, CAPS, "EX-4300PTZ").write_text("mine = yes\n")
    renumbers = others.chance(0.6)
    others.run("VACUUM" if renumbers else "")
    others.db.close()
    return renumbers


def count(cells, before, after, stay):
    """Counts changes by row: cells, but one if the row comes or goes."""
    counts = Counter(cell[:2] for cell in cells)
    for table, key in counts:
        row = (table, key, "")
        if table in stay or (row in before) != (row in after):
            counts[table, key] = 1
    return counts


def find_left(before, after, now, end, stay):
    """The cells that the upgrade has changed, and those that are left.

    All else must be back; but what somebody has changed since must stay, and
    so must some tables.
    """
    changed, left = [], []
    for cell in before.keys() | after.keys() | now.keys() | end.keys():
        b, a, n, e = (state.get(cell) for state in (before, after, now, end))
        stays = a == b or n != a or cell[0] in stay
        assert e == n or not stays, f"{cell} is {e} and not {n}"
        if a != b:
            changed.append(cell)
            left += [cell] if e != b or cell[0] in stay else []
    return changed, left


def check_upgrade(seed, disturbs):
    """All goes back but what somebody has changed since, which is named."""
    generate.create(seed)
    UPGRADE.write_text(SCRIPT.format(seed))
    UPGRADE.chmod(0o755)
    summary = preview(UPGRADE, KEPT)
    before, dangled = read_all(), dangling()
    assert call(UPGRADE, "0")[0] == 0
    after = read_all()
    renumbered = disturbs and disturb_rows(seed)
    stay = [name for name, only in query(TABLES) if renumbered and only]
    now, broken, disk = read_all(), dangling(), read_disk()

    dry = call(UNDO, "--dry-run", KEPT)
    assert read_disk() == disk, "a dry run has changed something"
    status, text = call(UNDO, KEPT)
    other = set(dry[1].splitlines()) ^ set(text.splitlines())
    assert (status, text) == dry, f"a dry run differs: {list(other)[:2]}"
    end = read_all()
    changed, left = find_left(before, after, now, end, stay)
    assert disturbs or not left, f"not as before: {left[:3]}"
    cameras = {key for table, key, _ in changed if table == "camera"}
    said = f" cells in {len(cameras)} cameras, "
    assert said in summary, f"{summary}, not{said}"
    named = {cell[0] if cell[0] in stay else cell[:2] for cell in left}
    lines = re.findall("(?m)^left: .*", text)
    assert len(lines) == len(named), f"{len(named)} rows: {lines[:3]}"
    total = count(changed, before, after, stay).total()
    count_left = count(left, before, after, stay).total()
    last = text.splitlines()[-1]
    counts = list(map(int, re.findall(r"\d+", last)))
    right = counts[1] == count_left and sum(counts) == total
    assert right, f"{last}, but {count_left} of {total} are left"
    assert status == (3 if left else 0), f"ended with {status}"
    new = dangling() - broken - dangled
    assert not new, f"references lead nowhere: {new}"

    text = call(UNDO, KEPT)[1]
    assert read_all() == end, "a second run changes something"
    again = re.findall("(?m)^left: .*", text)
    assert again == lines, f"a second run leaves other things: {again}"


def kills(mode):
    """The calls of an undo that can change something."""
    before, kept = create(f"journal_mode={mode}"), f"/var/{mode}"
    preview(TOOL[0], kept)
    _, after = run(before, *TOOL)
    undo = Recording(after, UNDO, "--force", kept, SYSTEM)
    for call in undo.changes():
        yield f"{mode} {call.name}", False, partial(undo.check_kill, call)


def undos():
    """The cases: their names, whether always, and the checks."""
    for seed in range(1, 501):
        yield f"upgrade {seed}", False, partial(check_upgrade, seed, False)
    for seed in range(1, 301):
        yield f"changes {seed}", False, partial(check_upgrade, seed, True)
    yield from kills("delete")
    yield from kills("wal")
