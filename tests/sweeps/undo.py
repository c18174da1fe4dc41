"""Takes back upgrades of generated databases, and kills the undo."""

import argparse
import json
import re
import shutil
import sqlite3
import subprocess
import sys
from collections import Counter
from contextlib import closing, suppress
from pathlib import Path

import generate
from appliance import CAPS, DATABASE, TARGET, TOOL
from appliance import different, disturb, read_disk, record, rows
from appliance import run as run_on
from cases import run

UNDO = "build/release/sbin/tessel-undo"
MAKE = "build/release/tests/makechanges"
BEFORE, AFTER, FILE = "/var/before.db", "/var/after.db", "/var/changes"
KEPT = "changes"  # FILE on a disk of its own
SYSTEM = f"{TARGET}/{DATABASE}"
CHANGES = "p?write|ftruncate|f(data)?sync|fch|rename|unlink|open.*O_CREAT"


def copy(database, to):
    with closing(sqlite3.connect(database)) as source:
        with closing(sqlite3.connect(to)) as target:
            source.backup(target)


def clear():
    """An appliance without a database."""
    shutil.rmtree(TARGET, ignore_errors=True)
    shutil.copytree("examples/KICapInfo", f"{TARGET}/{CAPS}")
    for path in BEFORE, FILE, AFTER:
        Path(path).unlink(missing_ok=True)


def upgrade(change=lambda: None):
    """Runs the tool and another change, and makes the change file."""
    copy(SYSTEM, BEFORE)
    shutil.rmtree("/var/caps", ignore_errors=True)
    shutil.copytree(f"{TARGET}/{CAPS}", "/var/caps")
    subprocess.run(TOOL, capture_output=True, check=False)
    change()
    copy(SYSTEM, AFTER)
    command = [MAKE, FILE, BEFORE, AFTER, SYSTEM]
    subprocess.run([*command, "/var/caps", f"{TARGET}/{CAPS}"], check=True)


def upgraded(seed, plain=False):
    """A generated database after an upgrade."""
    clear()
    database = generate.Database(SYSTEM, seed, plain)
    upgrade(lambda: database.change(12))
    return database


def undo(*options):
    command = [UNDO, *options, FILE, SYSTEM]
    done = subprocess.run(command, capture_output=True, timeout=60)
    text = (done.stdout + done.stderr).decode(errors="backslashreplace")
    assert done.returncode in (0, 3), f"ended with {done.returncode}: {text}"
    return done.returncode, text


def covered():
    sql = "SELECT number, name, keys, collations, columns, rowid_only"
    with closing(sqlite3.connect(FILE)) as changes:
        tables = changes.execute(f"{sql} FROM covered WHERE reason = ''")
        for number, name, keys, collations, columns, rowid_only in tables:
            nocase = [c == "NOCASE" for c in json.loads(collations)]
            lists = json.loads(keys), nocase, json.loads(columns)
            yield number, name, *lists, rowid_only


def read(db, relation, keys, collations, columns, names=None):
    """Rows by their keys. Each value is its type and its bytes."""
    cell = "typeof({0}), iif(typeof({0}) = 'text', CAST({0} AS BLOB), {0})"
    cells = ", ".join(cell.format(name) for name in [*keys, *columns])
    db.text_factory = bytes
    found = {}
    for row in db.execute(f"SELECT {cells} FROM {relation}"):
        values = list(zip(row[::2], row[1::2]))
        key = tuple(
            value.lower()
            if nocase and kind == b"text"
            else (kind == b"text", value)
            for (kind, value), nocase in zip(values, collations)
        )
        found[key] = dict(zip(names or columns, values[len(keys) :]))
    return found


def content(path):
    """All rows of the tables that the change file covers."""
    with closing(sqlite3.connect(path)) as db:
        return {
            name: read(db, name, keys, nocase, columns)
            for _, name, keys, nocase, columns, _ in covered()
        }


def dangling(path):
    """Counts the references that lead nowhere."""
    with closing(sqlite3.connect(path)) as db, suppress(sqlite3.Error):
        violations = db.execute("PRAGMA foreign_key_check").fetchall()
        return Counter(
            (child, parent, key) for child, _, parent, key in violations
        )
    return Counter()


def whole():
    """The database is not damaged. Some are from the start, by SQLite."""
    found = []
    for path in SYSTEM, BEFORE:
        with closing(sqlite3.connect(path)) as db:
            found.append(db.execute("PRAGMA integrity_check").fetchall())
    assert found[0] in ([("ok",)], found[1]), f"damaged: {found[0][:3]}"


def some(rows_a, rows_b):
    """The first difference, for a message."""
    for table in rows_a:
        for key in rows_a[table].keys() | rows_b[table].keys():
            pair = rows_a[table].get(key), rows_b[table].get(key)
            if pair[0] != pair[1]:
                return f"{table} {key}: {pair[0]} instead of {pair[1]}"


# --- Upgrades that are taken back ---


def check_upgrade(seed):
    """Everything is as at the start."""
    database = upgraded(seed)
    before = content(BEFORE)
    status, text = undo()
    now = content(SYSTEM)
    assert now == before, some(now, before)
    database.db.close()
    files = {
        path.name: path.read_bytes() for path in Path("/var/caps").iterdir()
    }
    left = {Path(n).name: v for n, v in read_disk().items() if CAPS in n}
    assert left == files, "the files are not as before"
    whole()
    assert status == 0, f"something is left: {text}"
    again = undo()[1].splitlines()[-1]
    assert re.match(r"0 set back, 0 left, \d+ already", again), again


def disturb_rows(database):
    """What somebody does between an upgrade and the undo."""
    run_sql, chance = database.run, database.chance
    for column in "resolution", "vendor", "motion_area":
        run_sql(f"UPDATE camera SET {column} = 'MINE' WHERE chance(0.1)")
    run_sql("DELETE FROM camera WHERE chance(0.05)")
    run_sql("UPDATE camdeviceoutput SET name = 'Gate' WHERE chance(0.3)")
    database.change(5)
    Path(TARGET, CAPS, "EX-4300PTZ").write_text("mine = yes\n")
    if chance(0.2):
        run_sql("VACUUM")
        return True
    return False


def count_left(before, after, now, end, rebuilt):
    """Counts the changes that are left, and the names of rows and tables.

    Asserts that nothing else is touched.
    """
    left, names = 0, Counter()
    for _, table, _, _, columns, rowid_only in covered():
        rows_of = [state[table] for state in (before, after, now, end)]
        for key in set().union(*rows_of):
            b, a, n, e = (rows.get(key) for rows in rows_of)
            where = f"{table} {key}"
            if rebuilt and rowid_only:
                assert e == n, f"{where} was not known any longer"
                names[table] |= a != b
                left += a != b
                continue
            kept = [c for c in columns if n and a and n[c] != a[c]]
            assert all(e and e[c] == n[c] for c in kept), f"{where}: {kept}"
            assert n is None or a or b or e == n, f"{where} is a new row"
            assert n or not a or not e, f"{where} was deleted"
            assert a != b or e == n, f"{where} is no change of the upgrade"
            if a and b:
                changed = [c for c in columns if a[c] != b[c]]
                names[where] = sum(not e or e[c] != b[c] for c in changed)
            elif a or b:
                names[where] = e != b
            left += names[where]
    return left, len(+names)


def check_changes(seed):
    """What somebody has changed stays; what is left is named."""
    database = upgraded(seed)
    before, after = content(BEFORE), content(SYSTEM)
    rebuilt = disturb_rows(database)
    database.db.close()
    now, broken = content(SYSTEM), dangling(SYSTEM)
    disk = read_disk()
    dry = undo("--dry-run")
    assert read_disk() == disk, "a dry run has changed something"
    status, text = undo()
    assert (status, text) == dry, f"a dry run prints other things: {dry[1]}"
    end = content(SYSTEM)
    left, names = count_left(before, after, now, end, rebuilt)
    left, names = left + 1, names + 1  # the file
    named = len(re.findall("(?m)^left: ", text))
    assert named == names, f"{named} of {names} are named: {text}"
    assert f" {left} left, " in text and status == 3, f"not {left}: {text}"
    new = dangling(SYSTEM) - broken - dangling(BEFORE)
    assert not new, f"references lead nowhere: {new}"
    again = undo()[1]
    assert content(SYSTEM) == end, some(content(SYSTEM), end)
    lefts = [re.findall("(?m)^left.*", printed) for printed in (text, again)]
    assert lefts[0] == lefts[1], f"a second run leaves other things: {again}"
    whole()


# --- The change file and sqldiff ---


def check_sqldiff(seed):
    """The cells are those that sqldiff names."""
    upgraded(seed, plain=True)
    command = ["sqldiff", "--primarykey", BEFORE, AFTER]
    text = subprocess.check_output(command).decode(errors="replace")
    text = re.sub(r"'(?:[^']|'')*'", "?", text)
    theirs = Counter()
    for verb, table, rest in re.findall(
        r"(?m)^(\w+)(?: \w+)? (t\d|cam\w+)(.*)", text
    ):
        columns = re.findall(r"(?:SET |, )(\w+)=", rest.split(" WHERE ")[0])
        theirs.update((table, c) for c in (columns or [verb]))
    ours = Counter()
    with closing(sqlite3.connect(FILE)) as db:
        for number, table, keys, nocase, names, _ in covered():
            cells = [f"k{i}" for i in range(len(keys))], nocase
            cells = *cells, [f"c{i}" for i in range(len(names))], names
            before, after = (
                read(db, f"{side}_{number}", *cells)
                for side in ("before", "after")
            )
            ours.update(
                (table, "DELETE") for _ in before.keys() - after.keys()
            )
            ours.update(
                (table, "INSERT") for _ in after.keys() - before.keys()
            )
            for key in before.keys() & after.keys():
                old, new = before[key], after[key]
                ours.update((table, n) for n in names if old[n] != new[n])
    assert ours == theirs, f"not in both: {ours - theirs} {theirs - ours}"


# --- Kills ---


def tables(disk):
    """The rows without the counters of ids, which stay."""
    return [line for line in rows(disk) if "sqlite_sequence" not in line]


def check_kill(start, command, call, old, new, files):
    """Old or new rows and files, and the next run makes up."""
    left = disturb(start, call.name, "signal=KILL", command)[1]
    now = tables(left)
    assert now in (old, new), "neither the old nor the new rows"
    for name, content in left.items():
        assert CAPS not in name or content in files.get(name, [content]), name
    status, end = run_on(left, *command)
    assert status == 0 and tables(end) == old, f"the next run: {status}"
    wanted = {name: versions[0] for name, versions in files.items()}
    wrong = different(end, wanted) - {DATABASE, KEPT}
    assert not wrong, f"the next run leaves these files: {wrong}"


def kills(mode):
    """The calls of an undo that can change something."""
    clear()
    with closing(sqlite3.connect(SYSTEM)) as db:
        db.execute(f"PRAGMA journal_mode = {mode}")
        db.executescript(Path("examples/appliance.sql").read_text())
    before = read_disk()
    upgrade()
    start = read_disk()
    old, new = tables(before), tables(start)
    files = {n: [before[n], start[n]] for n in start if CAPS in n}
    start[KEPT] = Path(FILE).read_bytes()
    command = [UNDO, "--force", f"{TARGET}/{KEPT}", SYSTEM]
    for call in record(start, *command)[0]:
        if re.match(CHANGES, call.line):
            case = start, command, call, old, new, files
            yield f"{mode} {call.name}", check_kill, *case


def all_cases():
    for kind, check, count in [
        ("upgrade", check_upgrade, 500),
        ("changes", check_changes, 300),
        ("sqldiff", check_sqldiff, 100),
    ]:
        for seed in range(1, count + 1):
            yield f"{kind} {seed}", check, seed
    yield from kills("delete")
    yield from kills("wal")


def chosen(args):
    for number, (name, *case) in enumerate(all_cases(), 1):
        due = number >= args.first and number % args.every == 0
        if (args.case and name == args.case) or (not args.case and due):
            yield name, *case


def check_case(check, *case):
    check(*case)


parser = argparse.ArgumentParser("scripts/sweep")
parser.add_argument("kind", choices=["undo"])
parser.add_argument("--every", type=int, default=1)
parser.add_argument("--from", dest="first", type=int, default=1)
parser.add_argument("case", nargs="?")
args = parser.parse_intermixed_args()
sys.exit(run("undo", chosen(args), args.case, check_case))
