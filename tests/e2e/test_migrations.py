"""What the actions do to the example, beside tests/expected/.

A message "to accept" shows how the result differs from those files. Where
that is intended, scripts/test --accept writes them anew. Every other message
says what is wrong, and then nothing is accepted.
"""

import re
import sqlite3
from dataclasses import dataclass
from pathlib import Path

import pytest
from conftest import EXPECTED, SOURCE, STRACE
from conftest import complain, new_appliance, row_name, run

# A row of an action table: threshold and name.
TABLE_ROW = re.compile(r"^ *\{(\d+), (?!nullptr)(\w+)\},$", re.M)
TRACE = Path("/var/trace")
FAST = ["--trace=openat", "--seccomp-bpf", "-f", "-o", TRACE]
# What an action logs of a text that fails: its own name, and the text.
FAILURE = re.compile(
    r"cpp:(\w+)\(\): KiDBExecute command \((.*?)\) error\.$", re.S | re.M
)
# A string or a number.
LITERAL = re.compile(r"x?'(?:[^']|'')*'|(?<![\w.])\d+(?:\.\d+)?(?![\w.])")
# A name, perhaps in quotes, as all that is assigned or compared with.
NAME_AS_VALUE = re.compile(
    r"""[=<>]\s*(['"]?)([a-z_]\w*)\1(?=\s*([,;)]|$|\b(WHERE|AND|OR)\b))""",
    re.I,
)
# One process runs these tests, since finding all transactions takes seconds.
pytestmark = pytest.mark.xdist_group("migrations")


@dataclass
class Transaction:
    """An SQL text that the tool runs, and the changes missing without it."""

    action: str
    text: str
    missing: list


def tables():
    """Returns threshold and name of each row of both tables of actions."""
    source = (SOURCE / "main/tesselupgrader.cpp").read_text()
    parts = source.split("grgCamveldRemoteCapUpgradeAction[]")[:2]
    return [
        [(int(threshold), name) for threshold, name in TABLE_ROW.findall(part)]
        for part in parts
    ]


def failures(result):
    """Returns action and text of each transaction that failed."""
    return FAILURE.findall("\n".join(result.log))


def last_action(example, start, rows, is_wrong):
    """Returns the last action with which an upgrade from there is wrong."""
    for threshold in sorted({row[0] for row in rows}, reverse=True):
        example.restore(start)
        if is_wrong(example.upgrade(threshold - 1)):
            return " or ".join(row[1] for row in rows if row[0] == threshold)
    return "no action alone"


def upgrade(example):
    """Upgrades from version 0, which has to succeed."""
    start = example.save()
    result = example.upgrade(0)
    if result.status == 0:
        return result
    for action, text in failures(result):
        reason = "but its text alone does not"
        try:
            example.sql(f"BEGIN;{text};COMMIT;")
        except sqlite3.Error as error:
            reason = error
        complain(f"{action} fails: {reason}", [text])
    rows = sum(tables(), [])
    output = re.sub(r"==\d+==|0x\w+ ", "", result.output)
    lines = output.splitlines()
    own = [line for line in lines if "main/tesselupgrader.cpp" in line]
    named = [name for _, name in rows if re.search(rf"\b{name}\b", str(own))]
    action = " or ".join(dict.fromkeys(named)) or last_action(
        example, start, rows, lambda again: again.status == result.status
    )
    title = f"{action} ends the tool with status {result.status}"
    reason = re.findall("(?i)error: .*", output)
    complain(": ".join([title, *reason[:1]]), (own or lines) + result.log)


def find_transactions(example):
    """Returns all transactions of an upgrade from version 0, in order."""
    found = []
    start = example.save()
    whole = upgrade(example)
    # The tool logs a text that it cannot run, and goes on with the next
    # action. Here, it cannot open the database for the text.
    for number in range(1, 1000):
        example.restore(start)
        inject = f"--inject=openat:error=EIO:when={number}"
        under = [*STRACE, *FAST, "-P", example.database, inject]
        result = example.upgrade(0, under=under)
        if "INJECTED" not in TRACE.read_text():
            break
        failed = failures(result)
        if not failed:
            example.database.unlink()
            logged = {name for name, _ in failures(example.upgrade(0))}
            silent = [name for _, name in tables()[0] if name not in logged]
            action = (silent or [found[-1].action])[0]
            title = f"{action} does not log a text that fails"
            complain(f"{title}: it must use RunSql()")
        action, text = failed[0]
        if result.status != 255:
            title = f"{action} hides a failure: it must return -1 when"
            complain(f"{title} this text fails", [text])
        done = set(result.changes)
        missing = [line for line in whole.changes if line not in done]
        found.append(Transaction(action, text, missing))
    return found


def author(transactions, line):
    """Returns the action that makes a change."""
    makers = [each.action for each in transactions if line in each.missing]
    return makers[-1] if makers else "no action alone"


@pytest.fixture(scope="module")
def transactions(request):
    with new_appliance(request.config) as example:
        example.load_example()
        return find_transactions(example)


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
            differ = sorted({*selected} ^ {*above}) or "all, in their order"
            title = f"an upgrade from {version} does not run or not log"
            complain(f"{title}, or must not run: {differ}")


def test_every_statement_says_what_it_means(transactions, example):
    columns = {name for row in example.rows().values() for name in row}
    wrong = []
    for transaction in transactions:
        texts = statements(transaction.text)
        for text in texts:
            for _, name, *_ in NAME_AS_VALUE.findall(text):
                if name in columns:
                    title = f"{transaction.action} uses the name of a column"
                    hint = f"as a value: if it has to, write ({name})"
                    wrong.append(f"{title} {hint}: {text}")
        off = ["sqlite3", example.database, ".dbconfig dqs_dml off"]
        ended = run(*off, *(f"EXPLAIN {text}" for text in texts))
        if ended.returncode != 0:
            reason = re.search(".*[Ee]rror.*", ended.stdout)[0]
            title = f"{transaction.action} has a string in double quotes"
            wrong.append(f"{title}: {reason}: {transaction.text}")
    if wrong:
        complain(wrong[0], wrong[1:])


def test_the_example_needs_every_literal(transactions, example):
    wrong = []
    database = sqlite3.connect(example.database, isolation_level=None)
    for transaction in transactions:
        for text in statements(transaction.text):
            found, _ = result = outcome(database, text)
            reasons = list(idle_literals(database, text, result))
            if not found:
                reasons = ["finds no row of the example"]
            wrong += [
                f"{transaction.action}: {why}: {text}" for why in reasons
            ]
            database.execute(text).fetchall()
    if wrong:
        complain(wrong[0], wrong[1:])


def outcome(database, text):
    """Returns what a statement finds and leaves. Takes it back."""
    tables = "SELECT name FROM sqlite_schema WHERE type = 'table'"
    database.execute("SAVEPOINT before")
    try:
        cursor = database.execute(text)
        return cursor.fetchall() or max(cursor.rowcount, 0), [
            database.execute(f"SELECT * FROM [{name}]").fetchall()
            for (name,) in database.execute(tables).fetchall()
        ]
    except sqlite3.Error as error:
        return error
    finally:
        database.execute("ROLLBACK TO before")
        database.execute("RELEASE before")


def idle_literals(database, text, result):
    """Yields the literals that others could replace."""
    for literal in LITERAL.finditer(text):
        others = {"'another'": f"needs {literal[0]}"}
        if literal[0].isdigit():
            near = [int(literal[0]) + step for step in (-1, 1)]
            others = {f"({n})": f"tells {literal[0]} from {n}" for n in near}
        for other, what in others.items():
            changed = text[: literal.start()] + other + text[literal.end() :]
            if outcome(database, changed) == result:
                yield f"no row of the example {what}"


def test_an_upgrade_changes_these_rows(example, accepts):
    changes = upgrade(example).changes
    expected = (EXPECTED / "upgrade.txt").read_text().splitlines()
    lost, new = (
        {re.sub(r"(^\w+ |id=)-?\d+", r"\1#", line): line for line in lines}
        for lines in ({*expected} - {*changes}, {*changes} - {*expected})
    )
    moved = [new[line] for line in new if line in lost]
    if moved:
        complain("rows of the example have other ids than before", moved)
    accepts("upgrade.txt", "the changed rows differ", changes)


def test_a_second_upgrade_changes_no_row_and_no_file(example, accepts):
    upgrade(example)
    start = example.save()
    second = upgrade(example)
    added = re.compile("camdeviceoutput .* added: ")
    again = [line for line in second.changes if not added.match(line)]
    if again:
        example.restore(start)
        action = author(find_transactions(example), again[0])
        complain(f"{action} changes rows again in a second upgrade", again)
    if second.diffs:
        files = tables()[1]
        action = last_action(example, start, files, lambda run: run.diffs)
        title = f"{action} changes files again in a second upgrade"
        complain(title, second.diffs.splitlines())
    title = "the rows that a second upgrade adds differ"
    accepts("second-upgrade.txt", title, second.changes)


def test_rows_do_what_they_say_and_none_is_removed(transactions, example):
    rows = example.rows()
    changes = upgrade(example).changes
    wrong = []
    for line in changes:
        if " removed: " in line:
            action = author(transactions, line)
            wrong.append(f"{action} removes a row, which none may: {line}")
    for key, row in rows.items():
        mark = row.get("note", row.get("name"))
        name = row_name(key)
        own = [line for line in changes if line.startswith(f"{name} ")]
        if own and mark == "must stay":
            action = author(transactions, own[0])
            wrong.append(f"{action} changes a row that must stay: {own[0]}")
        if not own and mark == "changes":
            wrong.append(f"no action changes {name}: {list(row.values())[:8]}")
    if wrong:
        complain(wrong[0], wrong[1:])


def test_capability_files_do_what_they_say(example):
    start, files = example.save(), example.capability_files()
    diffs = upgrade(example).diffs
    for name, text in files.items():
        mark = text.split("\n")[0].strip("# \r")
        header = f"--- before/{name}\n"
        if mark == "must stay" and header in diffs:
            action = last_action(
                example, start, tables()[1], lambda run: header in run.diffs
            )
            complain(f"{action} changes {name}, which must stay")
        if mark == "changes" and header not in diffs:
            complain(f"no action changes the capability file {name}")
        if mark not in ("must stay", "changes"):
            complain(f"{name} begins with neither # changes nor # must stay")


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
    start = example.save()
    upgrade(example)
    lines = []
    for threshold, name in tables()[1]:
        diffs = []
        for version in (threshold - 1, threshold):
            example.restore(start)
            diffs.append(example.upgrade(version).diffs)
        if diffs[0] == diffs[1]:
            complain(f"{name} changes no capability file of the example")
        lines.append(f"An upgrade from {threshold - 1}:")
        lines += diffs[0].splitlines()
    title = "the changed capability files differ"
    accepts("capability-files.diff", title, lines)
