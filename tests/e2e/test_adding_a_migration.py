"""docs/adding-a-migration.md works to the letter, in a copy of the tree."""

import re
import shutil
import subprocess

import pytest
from conftest import SOURCE

PAGE = (SOURCE / "docs/adding-a-migration.md").read_text()
STEP = re.compile(
    r"^Insert into `([^`]+)`, ([^\n]+):\n\n```\w*\n(.*?)```", re.M | re.S
)
TEST = "/usr/bin/python3 -m pytest tests/e2e/test_migrations.py -x"
FILES = "git ls-files --cached --others --exclude-standard"
UNCHANGED = ("failures.txt", "second-upgrade.txt")


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


def test_the_page_leads_to_a_migration(request, tmp_path):
    if request.config.getoption("build") != "build/release":
        pytest.skip("the page is followed with the release build only")

    def run(command):
        ended = subprocess.run(
            command.split(), cwd=tmp_path, capture_output=True, text=True
        )
        assert ended.returncode == 0, (
            ended.stdout[-2000:] + ended.stderr[-900:]
        )

    files = subprocess.check_output(FILES.split(), cwd=SOURCE, text=True)
    for name in files.splitlines():
        (tmp_path / name).parent.mkdir(parents=True, exist_ok=True)
        shutil.copy(SOURCE / name, tmp_path / name)
    steps = STEP.findall(PAGE)
    assert len(steps) == PAGE.count("\nInsert into") > 0
    for name, place, code in steps:
        insert(tmp_path / name, place, code)
    run("cmake --preset release")
    run("cmake --build --preset release --target tesselupgrader")
    run(f"{TEST} --build=build/release --accept")
    for path in (SOURCE / "tests/expected").iterdir():
        before = path.read_text().splitlines()
        after = (tmp_path / "tests/expected" / path.name).read_text()
        after = after.splitlines()
        lost = [line for line in before if line not in after]
        assert not lost, path.name
        assert (before == after) == (path.name in UNCHANGED), path.name
    run(f"{TEST} --build=build/release")
