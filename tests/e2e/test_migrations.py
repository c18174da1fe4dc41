"""What the migration actions do to the example, compared with tests/expected/.

Where a change is intended, scripts/test --accept writes the expected files anew.
"""

import json
import re
import sqlite3
import sys
from concurrent.futures import ThreadPoolExecutor
from dataclasses import dataclass
from pathlib import Path

import pytest
from conftest import SOURCE, load_example, new_appliance, row_changes

EXPECTED = SOURCE / "tests/expected"
# Tests that need the list of actions share a process, since it takes seconds to make.
with_actions = pytest.mark.xdist_group("actions")


@dataclass
class Action:
    threshold: int
    name: str
    texts: list  # one a transaction

    def statements(self):
        return [statement for text in self.texts for statement in split(text)]


def split(text):
    """Splits a text behind each ; that ends a statement."""
    statements = [""]
    for part in re.split(r"(?<=;)", text):
        if sqlite3.complete_statement(statements[-1]):
            statements.append("")
        statements[-1] += part
    return [statement for statement in statements if statement.strip()]


def printable(text):
    return re.sub("[^ -~]", lambda character: f"\\x{ord(character[0]):02x}", text)


def table_rows():
    """Threshold and name of every row of the action tables, as they are written."""
    source = (SOURCE / "main/tesselupgrader.cpp").read_text()
    rows = re.findall(r"^ *\{(\d+), (\w+)\},$", source, re.M)
    return [(int(threshold), name) for threshold, name in rows if name != "nullptr"]


def complain(title, lines):
    """Fails with a title and few enough lines for a screen with several failures."""
    if len(lines) > 8:
        lines = [*lines[:7], f"and {len(lines) - 7} lines more"]
    pytest.fail("\n".join([title, *(line[:200] for line in lines)]), pytrace=False)


@pytest.fixture
def accepts(request):
    """Compares lines with those of an expected file, or writes the file."""

    def compare(name, title, lines):
        path = EXPECTED / name
        if request.config.getoption("accept"):
            path.write_text("".join(line + "\n" for line in lines))
            return
        expected = path.read_text().splitlines()
        missing = [f"- {line}" for line in expected if line not in set(lines)]
        new = [f"+ {line}" for line in lines if line not in set(expected)]
        if missing or new:
            complain(f"{title} (tests/expected/{name}, --accept writes it anew):", missing + new)
        assert lines == expected, f"{title}: the order differs from tests/expected/{name}"

    return compare


def list_actions(config, thresholds):
    program = Path(__file__).with_name("transactions.py")
    text = ",".join(map(str, thresholds))
    with new_appliance(config) as appliance:
        load_example(appliance)
        command = appliance.command("tesselupgrader")
        ended = appliance.inside(sys.executable, program, text, *command)
    assert ended.returncode == 0, ended.stdout
    return json.loads(ended.stdout.splitlines()[-1])


@pytest.fixture(scope="module")
def listed(request):
    """Which database actions run for which version, and all transactions of each."""
    thresholds = sorted({threshold for threshold, _ in table_rows() if threshold > 0})
    halves = [thresholds[0::2], thresholds[1::2]]
    with ThreadPoolExecutor() as pool:
        first, second = pool.map(lambda half: list_actions(request.config, half), halves)
    return {
        "selected": {**first["selected"], **second["selected"]},
        "transactions": first["transactions"] + second["transactions"],
    }


@pytest.fixture
def selected(listed):
    """The names of the database actions that run, by version."""
    return {int(version): names for version, names in listed["selected"].items()}


@pytest.fixture
def actions(listed, selected):
    """The database actions, in the order in which they run."""
    actions = []
    for name in selected[0]:
        texts = [text for action, text in listed["transactions"] if action == name]
        above = [version + 1 for version, names in selected.items() if name in names]
        threshold = 0 if name in selected[max(selected)] else max(above)
        actions.append(Action(threshold, name, texts))
    return actions


@with_actions
def test_every_action_has_its_threshold_and_texts(actions, selected, accepts):
    lines = ["# Threshold and name of each database action; * begins a transaction."]
    for action in actions:
        lines.append(f"{action.threshold or 'always'} {action.name}")
        for text in action.texts:
            first, *others = split(text)
            lines += [f"* {printable(first)}", *(f"  {printable(other)}" for other in others)]
    accepts("actions.txt", "the list of actions differs", lines)
    for version, names in sorted(selected.items()):
        above = [action.name for action in actions if not 0 < action.threshold <= version]
        assert names == above, f"an upgrade from {version} selects other actions"


@with_actions
def test_every_statement_finds_a_camera_in_the_example(actions, example):
    idle = []
    with sqlite3.connect(example.database) as database:
        for action in actions:
            for statement in action.statements():
                try:
                    rows = database.execute(statement)
                except sqlite3.Error as error:
                    complain(f"{action.name}: {error}", [printable(statement)])
                if not (rows.fetchone() if rows.description else rows.rowcount > 0):
                    idle.append(f"{action.name} finds no camera in the example: {statement}")
    if idle:
        complain(idle[0], idle[1:])


def upgraded(example):
    result = example.upgrade(0)
    if result.status != 0:
        failed = [line for line in result.log if "error" in line]
        complain("the upgrade of the example fails", failed + result.syslog)
    return result


def test_an_upgrade_changes_these_cells(example, accepts):
    accepts("upgrade.txt", "the changed cells differ", upgraded(example).changes)


def test_a_second_upgrade_adds_outputs_and_changes_no_camera(example, accepts):
    upgraded(example)
    changes = upgraded(example).changes
    again = [line for line in changes if line.startswith("camera ")]
    if again:
        complain(f"a second run changes {' '.join(again[0].split()[:2])} again", again)
    accepts("second-upgrade.txt", "what a second upgrade changes differs", changes)


def test_cameras_that_must_stay_never_change(example):
    wrong = []
    result = upgraded(example)
    for key, before in result.before.items():
        changes = row_changes(key, before, result.after.get(key))
        if before.get("name") == "must stay" and changes:
            wrong += changes
        if before.get("name") == "changes" and not changes:
            wrong.append(f"{key[0]} {key[1][0]} ({before['vendor']} {before['model']}) stays")
    if wrong:
        complain("cameras do not do what their name says", wrong)


def last_changes(actions, example):
    """The last cell of a camera that each action of several statements changes."""
    cells = {}
    before = example.rows()
    for action in actions:
        statements = action.statements()
        for statement in statements:
            example.sql(statement.rstrip("; "))
            after = example.rows()
            for (table, row), values in after.items():
                for column, value in values.items():
                    old = before.get((table, row), values)[column]
                    if table == "camera" and old != value and len(statements) > 1:
                        cells[action.name] = (row[0], column, value)
            before = after
    return cells


@with_actions
def test_a_failure_at_the_last_statement_leaves_this(actions, example, accepts):
    start = example.database.read_bytes()
    expected = upgraded(example).changes
    example.database.write_bytes(start)
    cells = last_changes(actions, example)
    example.database.write_bytes(start)
    for name, (row, column, value) in cells.items():
        ((quoted,),) = example.sql("SELECT quote(?)", value)
        example.sql(
            f'CREATE TRIGGER "{name}" BEFORE UPDATE OF {column} ON camera WHEN new.id = {row} '
            f"AND new.{column} IS {quoted} BEGIN SELECT RAISE(ABORT, 'refused'); END;"
        )
    result = example.upgrade(0)
    assert result.status == 255
    lines = [f"{name} fails" for name in cells if f":{name}(): " in "".join(result.log)]
    lines += [f"not done: {line}" for line in expected if line not in result.changes]
    accepts("failures.txt", "what a failure in the middle leaves differs", lines)


@with_actions
def test_every_capability_action_changes_a_file(selected, example, accepts):
    example.database.unlink()
    start = example.capability_texts()
    lines, diffs = [], {}
    capability_rows = [row for row in table_rows() if row[1] not in selected[0]]
    for threshold, name in capability_rows:
        for version in (threshold - 1, threshold):
            for file, text in start.items():
                example.capability_file(file, text)
            diffs[version] = example.upgrade(version).diffs
        if diffs[threshold - 1] == diffs[threshold]:
            complain(f"{name} changes no capability file of the example", [])
        lines += [f"An upgrade from {threshold - 1}:", *diffs[threshold - 1].splitlines()]
    accepts("capability-files.diff", "the changed capability files differ", lines)
