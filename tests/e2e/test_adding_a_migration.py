"""docs/adding-a-migration.md works to the letter, in a scratch copy of the sources."""

import re
import shutil
import subprocess

import pytest
from conftest import SOURCE

PAGE = SOURCE / "docs/adding-a-migration.md"
STEP = re.compile(r"^Insert into `([^`]+)`, ([^\n]+):\n\n```\w*\n(.*?)```", re.M | re.S)
TESTS = (
    "/usr/bin/python3 -m pytest tests/e2e/test_migrations.py -q --build=build/release -n 2".split()
)


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
    copy = tmp_path / "copy"
    files = subprocess.check_output(["git", "ls-files", "-z"], cwd=SOURCE, text=True)
    for name in files.strip("\0").split("\0"):
        (copy / name).parent.mkdir(parents=True, exist_ok=True)
        shutil.copy(SOURCE / name, copy / name)
    steps = STEP.findall(PAGE.read_text())
    assert len(steps) == PAGE.read_text().count("\nInsert into") > 0
    for name, place, code in steps:
        insert(copy / name, place, code)

    def run(*command):
        ended = subprocess.run(command, cwd=copy, capture_output=True, text=True)
        assert ended.returncode == 0, ended.stdout[-2000:] + ended.stderr[-2000:]

    run("cmake", "--preset", "release")
    run("cmake", "--build", "--preset", "release", "--target", "tesselupgrader")
    run(*TESTS, "--accept")
    for path in sorted((SOURCE / "tests/expected").iterdir()):
        before = path.read_text().splitlines()
        after = (copy / "tests/expected" / path.name).read_text().splitlines()
        assert [line for line in before if line not in after] == [], f"lost from {path.name}"
        same = path.name in ("failures.txt", "second-upgrade.txt")
        assert (before == after) == same, path.name
    run(*TESTS)
