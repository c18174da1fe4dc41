"""docs/adding-a-migration.md works to the letter, in a scratch copy of the sources."""

import re
import shutil
import subprocess

import pytest
from conftest import SOURCE

PAGE = SOURCE / "docs/adding-a-migration.md"
STEP = re.compile(r"^Insert into `([^`]+)`, ([^\n]+):\n\n```\w*\n(.*?)```", re.M | re.S)
TESTS = ["/usr/bin/python3", "-m", "pytest", "-q", "-p", "no:cacheprovider", "-n", "2"]


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
    if request.config.getoption("build") != "build/dev":
        pytest.skip("the page is followed with the dev build only")
    copy = tmp_path / "copy"
    files = subprocess.check_output(["git", "ls-files", "-z"], cwd=SOURCE, text=True)
    for name in files.strip("\0").split("\0"):
        (copy / name).parent.mkdir(parents=True, exist_ok=True)
        shutil.copy(SOURCE / name, copy / name)
    steps = STEP.findall(PAGE.read_text())
    assert len(steps) == len(re.findall("^Insert into", PAGE.read_text(), re.M)) > 0
    for name, place, code in steps:
        insert(copy / name, place, code)

    def run(*command):
        return subprocess.run(command, cwd=copy, capture_output=True, text=True)

    def failed_tests(*arguments):
        ended = run(*TESTS, "tests/e2e/test_migrations.py", *arguments)
        return re.findall(r"^FAILED tests/e2e/test_migrations.py::(\w+)", ended.stdout, re.M), ended

    build = run("cmake", "--preset", "dev"), run(
        "cmake", "--build", "--preset", "dev", "--target", "tesselupgrader"
    )
    assert build[1].returncode == 0, build[1].stdout[-2000:]
    failed, _ = failed_tests()
    expected_only = {
        "test_every_action_has_its_threshold_and_texts",
        "test_an_upgrade_changes_these_cells",
        "test_a_failure_at_the_last_statement_leaves_this",
        "test_every_capability_action_changes_a_file",
    }
    assert set(failed) == expected_only
    assert failed_tests("--accept")[0] == []
    failed, ended = failed_tests()
    assert (failed, ended.returncode) == ([], 0), ended.stdout[-2000:]
