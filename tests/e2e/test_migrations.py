"""What the actions do to the example, beside tests/expected/.

Where a change is intended, scripts/test --accept writes those files anew.
"""

import re
import sqlite3
from dataclasses import dataclass

import pytest
from conftest import PREVIEW, SOURCE, STRACE, new_appliance, run

EXPECTED = SOURCE / "tests/expected"
TABLE_ROW = re.compile(r"^ *\{(\d+), (?!nullptr)(\w+)\},$", re.M)
FAST = "--trace=openat --seccomp-bpf -f".split()
FAILURE = re.compile(
    r"cpp:(\w+)\(\): KiDBExecute command \((.*?)\) error\.$", re.S | re.M
)
# These tests share a process, since finding all transactions takes seconds.
with_transactions = pytest.mark.xdist_group("transactions")


@dataclass
class Transaction:
    """An SQL text that the tool runs, and the changes missing without it."""

    action: str
    text: str
    missing: list


def complain(title, lines=()):
    """Fails with a title and few enough lines for a screen."""
    if len(lines) > 5:
        lines = [*lines[:2], f"and {len(lines) - 2} lines more"]
    lines = [title, *(line[:200] for line in lines)]
    pytest.fail("\n".join(lines), pytrace=False)


def upgrade(example):
    result = example.upgrade(0)
    if result.status != 0:
        shown = run(*example.command(PREVIEW, 0)).stdout.splitlines()
        failed = [line for line in shown if line.startswith("failed: ")]
        complain("the upgrade of the example fails", failed)
    return result


def failures(result):
    """Returns action and text of each transaction that failed."""
    return FAILURE.findall("\n".join(result.log))


@pytest.fixture(scope="module")
def transactions(request):
    """All transactions of an upgrade from version 0, in order."""
    found = []
    with new_appliance(request.config) as example:
        example.load_example()
        start = example.database.read_bytes()
        whole = upgrade(example)
        # The tool logs a text that it cannot run, and goes on with the next
        # action. Here, it cannot open the database for the text.
        for number in range(1, 1000):
            example.database.write_bytes(start)
            inject = f"--inject=openat:error=EIO:when={number}"
            under = [*STRACE, *FAST, "-P", example.database, inject]
            result = example.upgrade(0, under=under)
            failed = failures(result)
            if not failed:
                break
            assert (result.status, len(failed)) == (255, 1), failed
            done = set(result.changes)
            missing = [line for line in whole.changes if line not in done]
            found.append(Transaction(*failed[0], missing))
    return found


def tables():
    """Returns threshold and name of each row of both tables of actions."""
    source = (SOURCE / "main/tesselupgrader.cpp").read_text()
    parts = source.split("grgCamveldRemoteCapUpgradeAction[]")[:2]
    return [
        [(int(threshold), name) for threshold, name in TABLE_ROW.findall(part)]
        for part in parts
    ]


@pytest.fixture
def accepts(request):
    """Compares lines with those of an expected file, or writes the file."""

    def compare(name, title, lines):
        path = EXPECTED / name
        if request.config.getoption("accept"):
            path.write_text("".join(line + "\n" for line in lines))
            return
        expected = path.read_text().splitlines()
        missing = [f"- {line}" for line in expected if line not in lines]
        new = [f"+ {line}" for line in lines if line not in expected]
        if missing or new:
            complain(f"{title} (tests/expected/{name})", missing + new)
        assert lines == expected, f"{title}: the order in {name}"

    return compare


@with_transactions
def test_the_actions_and_their_transactions(transactions, accepts):
    thresholds = {name: threshold for threshold, name in tables()[0]}
    lines = ["# Threshold and name of each action; * begins a transaction."]
    last = None
    for transaction in transactions:
        if transaction.action != last:
            last = transaction.action
            lines.append(f"{thresholds[last]} {last}")
        first, *others = map(printable, statements(transaction.text))
        lines += [f"* {first}", *(f"  {other}" for other in others)]
    accepts("actions.txt", "the list of actions differs", lines)


def printable(text):
    return text.encode("unicode_escape").decode()


def statements(text):
    """Splits a text behind each semicolon that ends a statement."""
    found = [""]
    for part in re.split("(?<=;)", text):
        if sqlite3.complete_statement(found[-1]):
            found.append("")
        found[-1] += part
    return [statement for statement in found if statement.strip()]


def test_each_version_selects_the_actions_above_it(appliance):
    rows, _ = tables()
    thresholds = {threshold for threshold, _ in rows}
    for version in thresholds | {threshold - 1 for threshold in thresholds}:
        # Each action fails, since there is no database. None makes one.
        selected = [name for name, _ in failures(appliance.upgrade(version))]
        assert not appliance.database.exists()
        above = [name for threshold, name in rows if threshold > version]
        if selected != above:
            title = f"an upgrade from {version} selects other actions"
            complain(title, selected)


@with_transactions
def test_every_statement_finds_a_camera_in_the_example(transactions, example):
    idle = []
    with sqlite3.connect(example.database) as database:
        for transaction in transactions:
            for statement in statements(transaction.text):
                rows = database.execute(statement)
                found = rows.fetchone() if rows.description else rows.rowcount
                if not found:
                    title = "finds no camera in the example"
                    idle.append(f"{transaction.action} {title}: {statement}")
    if idle:
        complain(idle[0], idle[1:])


def test_an_upgrade_changes_these_cells(example, accepts):
    changes = upgrade(example).changes
    accepts("upgrade.txt", "the changed cells differ", changes)


def test_a_second_upgrade_adds_outputs_and_changes_no_camera(example, accepts):
    upgrade(example)
    changes = upgrade(example).changes
    again = [line for line in changes if line.startswith("camera ")]
    if again:
        camera = " ".join(again[0].split()[:2])
        complain(f"a second run changes {camera} again", again)
    title = "what a second upgrade changes differs"
    accepts("second-upgrade.txt", title, changes)


def test_cameras_do_what_their_name_says(example):
    cameras = example.sql("SELECT id, name, vendor, model FROM camera")
    changes = upgrade(example).changes
    wrong = []
    for id, name, vendor, model in cameras:
        own = [line for line in changes if line.startswith(f"camera {id} ")]
        if name == "must stay":
            wrong += own
        elif name == "changes" and not own:
            wrong.append(f"camera {id} ({vendor} {model}) stays")
    if wrong:
        complain("cameras do not do what their name says", wrong)


@with_transactions
def test_an_action_that_fails_in_the_middle_leaves_this(transactions, accepts):
    lines = ["# What is not done if an action's second transaction fails."]
    actions = []
    for transaction in transactions:
        actions.append(transaction.action)
        if actions.count(transaction.action) == 2:
            lines += [f"{transaction.action}:", *transaction.missing]
    title = "what a failure in the middle leaves differs"
    accepts("failures.txt", title, lines)


def test_every_capability_action_changes_a_file(example, accepts):
    example.database.unlink()
    files = example.capability_files()
    lines = []
    for threshold, name in tables()[1]:
        diffs = []
        for version in (threshold - 1, threshold):
            for file, text in files.items():
                example.capability_file(file, text)
            diffs.append(example.upgrade(version).diffs)
        if diffs[0] == diffs[1]:
            complain(f"{name} changes no capability file of the example")
        lines.append(f"An upgrade from {threshold - 1}:")
        lines += diffs[0].splitlines()
    title = "the changed capability files differ"
    accepts("capability-files.diff", title, lines)
