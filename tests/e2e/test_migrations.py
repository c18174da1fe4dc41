"""What the migration actions do to the example, compared with tests/expected/.

Where a change is intended, scripts/test --accept writes the expected files anew.
"""

import re
import sqlite3
from dataclasses import dataclass

import pytest
from conftest import SOURCE, new_appliance

EXPECTED = SOURCE / "tests/expected"
TABLE_ROW = re.compile(r"^ *\{(\d+), (?!nullptr)(\w+)\},$", re.M)
FAILURE = re.compile(r"cpp:(\w+)\(\): KiDBExecute command \((.*?)\) error\.$", re.S | re.M)
# These tests share a process, since finding all transactions takes seconds.
with_transactions = pytest.mark.xdist_group("transactions")


@dataclass
class Transaction:
    """An SQL text that the tool runs, and the changes that are missing without it."""

    action: str
    text: str
    missing: list


def complain(title, lines):
    """Fails with a title, and with few enough lines for a screen."""
    if len(lines) > 5:
        lines = [*lines[:2], f"and {len(lines) - 2} lines more"]
    pytest.fail("\n".join([title, *(line[:200] for line in lines)]), pytrace=False)


def upgraded(example):
    result = example.upgrade(0)
    if result.status != 0:
        failed = [line for line in result.log if "error" in line]
        complain("the upgrade of the example fails", failed + result.syslog)
    return result


def failures(result):
    """Returns action and text of each transaction that a run could not do."""
    return FAILURE.findall("\n".join(result.log))


def upgrade_without(example, number):
    """Upgrades while the N-th opening of the database fails."""
    inject = f"inject=openat:error=EIO:when={number}"
    options = ["-f", "--seccomp-bpf", "-o", "/dev/null", "-e", "trace=openat", "-e", inject]
    return example.upgrade(0, under=["strace", *options, "-P", example.database])


@pytest.fixture(scope="module")
def transactions(request):
    """All transactions of an upgrade from version 0, in order."""
    found = []
    with new_appliance(request.config) as example:
        example.load_example()
        start = example.database.read_bytes()
        whole = example.upgrade(0)
        if whole.status != 0:
            pytest.skip("the upgrade of the example fails")
        # The tool logs a text that it cannot run, and goes on with the next action.
        for number in range(1, 1000):
            example.database.write_bytes(start)
            result = upgrade_without(example, number)
            failed = failures(result)
            if not failed:
                break
            assert (result.status, len(failed)) == (255, 1), failed
            missing = [line for line in whole.changes if line not in result.changes]
            found.append(Transaction(*failed[0], missing))
    return found


def tables():
    """Threshold and name of each row: of the database actions, and of the others."""
    source = (SOURCE / "main/tesselupgrader.cpp").read_text()
    parts = source.split("grgCamveldRemoteCapUpgradeAction[]")[:2]
    rows = [TABLE_ROW.findall(part) for part in parts]
    return [[(int(threshold), name) for threshold, name in part] for part in rows]


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


@with_transactions
def test_the_actions_and_their_transactions(transactions, accepts):
    thresholds = {name: threshold for threshold, name in tables()[0]}
    lines = ["# Threshold and name of each database action; * begins a transaction."]
    last = None
    for transaction in transactions:
        if transaction.action != last:
            last = transaction.action
            lines.append(f"{thresholds[last]} {last}")
        first, *others = statements(transaction.text)
        lines += [f"* {printable(first)}", *(f"  {printable(other)}" for other in others)]
    accepts("actions.txt", "the list of actions differs", lines)


def test_each_version_selects_the_actions_above_it(appliance):
    rows, _ = tables()
    for version in sorted({threshold - below for threshold, _ in rows for below in (1, 0)}):
        # Each action fails, since there is no database.
        selected = [name for name, _ in failures(appliance.upgrade(version))]
        above = [name for threshold, name in rows if threshold > version]
        if selected != above:
            complain(f"an upgrade from {version} selects other actions", selected)


def printable(text):
    return re.sub("[^ -~]", lambda character: f"\\x{ord(character[0]):02x}", text)


def statements(text):
    """Splits a text behind each semicolon that ends a statement."""
    found = [""]
    for part in re.split("(?<=;)", text):
        if sqlite3.complete_statement(found[-1]):
            found.append("")
        found[-1] += part
    return [statement for statement in found if statement.strip()]


@with_transactions
def test_every_statement_finds_a_camera_in_the_example(transactions, example):
    idle = []
    with sqlite3.connect(example.database) as database:
        for transaction in transactions:
            for statement in statements(transaction.text):
                rows = database.execute(statement)
                if not (rows.fetchone() if rows.description else rows.rowcount > 0):
                    idle.append(f"{transaction.action} finds no camera in the example: {statement}")
    if idle:
        complain(idle[0], idle[1:])


def test_an_upgrade_changes_these_cells(example, accepts):
    accepts("upgrade.txt", "the changed cells differ", upgraded(example).changes)


def test_a_second_upgrade_adds_outputs_and_changes_no_camera(example, accepts):
    upgraded(example)
    changes = upgraded(example).changes
    again = [line for line in changes if line.startswith("camera ")]
    if again:
        complain(f"a second run changes {' '.join(again[0].split()[:2])} again", again)
    accepts("second-upgrade.txt", "what a second upgrade changes differs", changes)


def test_cameras_do_what_their_name_says(example):
    cameras = example.sql("SELECT id, name, vendor, model FROM camera")
    changes = upgraded(example).changes
    wrong = []
    for id, name, vendor, model in cameras:
        found = [line for line in changes if line.startswith(f"camera {id} ")]
        if name == "must stay":
            wrong += found
        elif name == "changes" and not found:
            wrong.append(f"camera {id} ({vendor} {model}) stays")
    if wrong:
        complain("cameras do not do what their name says", wrong)


@with_transactions
def test_an_action_that_fails_in_the_middle_leaves_this(transactions, accepts):
    lines = ["# What is not done if the second transaction of an action fails."]
    for number, transaction in enumerate(transactions):
        actions = [transaction.action for transaction in transactions[: number + 1]]
        if actions.count(transaction.action) == 2:
            lines += [f"{transaction.action}:", *transaction.missing]
    accepts("failures.txt", "what a failure in the middle leaves differs", lines)


def test_every_capability_action_changes_a_file(example, accepts):
    example.database.unlink()
    start = example.capability_texts()
    lines = []
    for threshold, name in tables()[1]:
        diffs = []
        for version in (threshold - 1, threshold):
            for file, text in start.items():
                example.capability_file(file, text)
            diffs.append(example.upgrade(version).diffs)
        if diffs[0] == diffs[1]:
            complain(f"{name} changes no capability file of the example", [])
        lines += [f"An upgrade from {threshold - 1}:", *diffs[0].splitlines()]
    accepts("capability-files.diff", "the changed capability files differ", lines)
