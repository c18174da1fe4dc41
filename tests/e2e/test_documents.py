"""What scripts and programs say of themselves, and what the documents say of them."""

import re
import subprocess

import pytest
from conftest import SOURCE
from test_migrations import tables

TRACKED = subprocess.check_output(["git", "ls-files"], cwd=SOURCE, text=True).split()
DOCUMENTS = [name for name in TRACKED if name.endswith(".md")]
SCRIPTS = [".ci/run"]
SCRIPTS += [name for name in TRACKED if name.startswith("scripts/") and "usage" not in name]
RUNNERS = ["tools/private-appliance", "tools/private-var", "tools/run-armhf"]
# What each script would otherwise begin with.
WORK = ["apt-get", "cmake", "dpkg-query", "rm", "sudo", "unshare"]


@pytest.fixture
def call(tmp_path):
    """Returns a function that runs a script, and fails when the script begins to work."""
    for name in WORK:
        program = tmp_path / name
        program.write_text('#!/bin/sh\necho "begins to work: $0 $*"\nexit 99\n')
        program.chmod(0o755)

    def run(script, *arguments):
        environment = {"PATH": f"{tmp_path}:/usr/bin:/bin"}
        command = [SOURCE / script, *arguments]
        ended = subprocess.run(command, env=environment, capture_output=True, text=True)
        assert "begins to work" not in ended.stdout + ended.stderr
        return ended

    return run


@pytest.mark.parametrize("script", SCRIPTS + RUNNERS)
def test_script_prints_its_header(call, script):
    ended = call(script, "--help")
    assert (ended.returncode, ended.stderr) == (0, "")
    assert script.rpartition("/")[2] in ended.stdout.splitlines()[0]
    assert "set -" not in ended.stdout


REFUSED = [(script, 2, "--nonsense") for script in SCRIPTS]
REFUSED += [(script, 125, "--nonsense") for script in RUNNERS]  # 2 may be the command's status
REFUSED += [
    ("scripts/bootstrap", 2, "demo nonsense"),
    ("scripts/check-packages", 2, "release nonsense"),
    ("scripts/fuzz", 2, "20 nonsense"),
    ("scripts/package", 2, "release nonsense"),
    ("scripts/sweep", 2, "all --nonsense"),
    ("scripts/test", 2, "dev -k name nonsense"),
]


@pytest.mark.parametrize("script, status, arguments", REFUSED)
def test_script_refuses_an_unknown_argument(call, script, status, arguments):
    ended = call(script, *arguments.split())
    assert (ended.returncode, ended.stdout) == (status, "")
    assert "nonsense" in ended.stderr or "usage" in ended.stderr


@pytest.mark.parametrize("program", ["kidbglog", "tessel-preview"])
def test_man_page_and_help_name_the_options_of_the_program(appliance, program):
    helped = appliance.inside(*appliance.command(program, "--help"))
    assert helped.returncode == 0
    page = (SOURCE / f"docs/{program}.8").read_text().replace("\\-", "-")
    named = r"(?<!\w)--[a-z]+"
    others = {"--help", "--follow", "--no"}  # patch has the last two
    assert set(re.findall(named, helped.stdout)) - others == set(re.findall(named, page)) - others
    assert appliance.inside(*appliance.command(program, "--nonsense")).returncode == 2


@pytest.mark.parametrize("document", DOCUMENTS)
def test_links_and_named_files_exist(document):
    text = (SOURCE / document).read_text()
    links = re.findall(r"\]\(([^):#]+)[^):]*\)", text)
    named = r"(?<![\w./-])(?:scripts|tools|examples|docs|tests|packaging)/[\w./-]*\w"
    paths = [(SOURCE / document).parent / link for link in links]
    paths += [SOURCE / name for name in re.findall(named, text)]
    missing = [path for path in paths if not path.exists()]
    assert not [path for path in missing if path.parent.name != "KICapInfo"]  # a reader's new file


def test_the_page_on_migrations_lists_every_action():
    page = (SOURCE / "docs/migrations.md").read_text()
    listed = re.findall(r"^\| (\d+) \| `(\w+)` \|", page, re.M)
    actions = [(str(threshold), name) for table in tables() for threshold, name in table]
    assert listed == actions
