"""docs/adding-a-migration.md works to the letter, in a copy of the tree."""

import re
import shutil

import pytest
from conftest import SOURCE, complain, run
from test_migrations import tables

PAGE = (SOURCE / "docs/adding-a-migration.md").read_text()
# A step: the file, the place in it, the text to insert.
STEP = re.compile(
    r"^Insert into `([^`]+)`, ([^\n]+):\n\n```\w*\n(.*?)```", re.M | re.S
)
CODE = "main/tesselupgrader.cpp"
TEST = "/usr/bin/python3 -m pytest -q -p no:cacheprovider --build=build/quick"


def insert(path, place, code):
    text = path.read_text() if path.exists() else ""
    if place == "at the end":
        position = len(text)
    elif place.startswith("above "):
        position = text.index(place.removeprefix("above ").strip("`"))
    else:
        table = place.removeprefix("as the last rows of ").strip("`")
        position = text.index("    {0, nullptr},", text.index(f"{table}[]"))
    path.write_text(text[:position] + code + text[position:])


def test_the_page_leads_to_migrations(request, tmp_path):
    if request.config.getoption("build") != "build/release":
        pytest.skip("the page is followed with the release build only")
    others = shutil.ignore_patterns("build", ".git", "__pycache__")
    shutil.copytree(SOURCE, tmp_path, ignore=others, dirs_exist_ok=True)
    steps = STEP.findall(PAGE)
    assert len(steps) == PAGE.count("\nInsert into") > 0
    next_version = max(row[0] for table in tables() for row in table) + 1
    for name, place, code in steps:
        if name == CODE:
            code = code.replace("9001", str(next_version))
        insert(tmp_path / name, place, code)
    for command in (
        "cmake --preset quick",
        "cmake --build --preset quick --target tesselupgrader",
        f"{TEST} --accept tests/e2e/test_migrations.py",
    ):
        ended = run(*command.split(), cwd=tmp_path)
        if ended.returncode != 0:
            title = f"{command} fails in a copy with the page's migrations"
            complain(title, ended.stdout.splitlines()[-20:])
    listed = (tmp_path / "tests/expected/actions.txt").read_text()
    assert f"\n{next_version} UpdateAcmeTrioStreams\n" in listed
