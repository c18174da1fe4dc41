"""What documents say of programs, scripts and files."""

import re

import pytest
from conftest import KIDBGLOG, PREVIEW, SOURCE, TOOL, complain, run
from test_migrations import tables

# For each status of a program's man page, arguments that lead to it.
STATUSES = {
    TOOL: "99999||0",
    KIDBGLOG: "--help|show|--nonsense",
    PREVIEW: "--help|-x|--tool {} --check {} 0|--tool {} --check {}.old 0",
}


def statuses(page):
    """Returns those that begin a paragraph of a man page, or a table row."""
    return set(map(int, re.findall(r"^(?:\.B|\|) (\d+)", page, re.M)))


def options(text):
    """Returns the long options that a text names."""
    return set(re.findall("--[a-z]+", text)) - {"--help", "--version"}


@pytest.mark.parametrize("program", STATUSES)
def test_man_page_is_right(appliance, tmp_path, program):
    appliance.load_example()
    # A database on which no action fails, and one on which all do.
    appliance.database.rename(f"{appliance.database}.old")
    appliance.database.touch()
    appliance.capability_file("camera", "pan=yes\n")
    tool = appliance.script(tmp_path / "tool", TOOL)
    page = (SOURCE / f"docs/{program.split('/')[1]}.8").read_text()
    seen = set()
    for command in STATUSES[program].split("|"):
        arguments = command.format(tool, appliance.database).split()
        ended = run(*appliance.command(program, *arguments))
        seen.add(ended.returncode)
        if command == "--help":
            named = options(page.replace("\\-", "-"))
            assert options(ended.stdout) == named
    assert seen == statuses(page)
    if program == TOOL:
        assert seen == statuses((SOURCE / "README.md").read_text())


def test_the_page_on_migrations_lists_every_action():
    page = (SOURCE / "docs/migrations.md").read_text()
    listed = re.findall(r"^\| (\d+) \| `(\w+)` \|", page, re.M)
    actions = [(str(row[0]), row[1]) for table in tables() for row in table]
    lacks = [f"lacks {row}" for row in actions if row not in listed]
    lacks += [f"lists {row}" for row in listed if row not in actions]
    if lacks or listed != actions:
        title = "docs/migrations.md does not list the actions in their order"
        complain(title, lacks)
