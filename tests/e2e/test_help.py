"""Every script and program explains itself, and refuses what it does not know."""

import subprocess

import pytest
from conftest import SOURCE

SCRIPTS = [
    *(
        str(path.relative_to(SOURCE))
        for path in SOURCE.glob("scripts/*")
        if path.stat().st_mode & 1
    ),
    ".ci/run",
]
RUNNERS = ["tools/private-appliance", "tools/private-var", "tools/run-armhf"]
PROGRAMS = ["kidbglog", "tessel-preview"]
# What each script would otherwise begin with.
WORK = ["apt-get", "cmake", "dpkg-query", "rm", "sudo", "unshare"]


@pytest.fixture
def idle(tmp_path):
    """Returns a function that runs a script, and fails when the script begins to work."""
    for name in WORK:
        program = tmp_path / name
        program.write_text('#!/bin/sh\necho "begins to work: $0 $*"\nexit 99\n')
        program.chmod(0o755)

    def run(script, *arguments):
        environment = {"PATH": f"{tmp_path}:/usr/bin:/bin"}
        command = [SOURCE / script, *arguments]
        ended = subprocess.run(command, env=environment, capture_output=True, text=True, timeout=60)
        assert "begins to work" not in ended.stdout + ended.stderr
        return ended

    return run


@pytest.mark.parametrize("script", SCRIPTS + RUNNERS)
def test_script_prints_its_header(idle, script):
    ended = idle(script, "--help")
    assert (ended.returncode, ended.stderr) == (0, "")
    name = script.rpartition("/")[2]
    assert name in ended.stdout.splitlines()[0]
    assert "set -" not in ended.stdout and len(ended.stdout.splitlines()) > 2


REFUSED = [(script, 2, "--nonsense") for script in SCRIPTS]
REFUSED += [(script, 125, "--nonsense") for script in RUNNERS]  # 2 may be the command's status
REFUSED += [
    ("scripts/bootstrap", 2, "demo nonsense"),
    ("scripts/check-packages", 2, "release nonsense"),
    ("scripts/demo", 2, "nonsense"),
    ("scripts/fuzz", 2, "20 nonsense"),
    ("scripts/package", 2, "release nonsense"),
    ("scripts/sweep", 2, "nonsense"),
    ("scripts/sweep", 2, "all --nonsense"),
    ("scripts/test", 2, "dev -k name nonsense"),
]


@pytest.mark.parametrize("script, status, arguments", REFUSED)
def test_script_refuses_an_unknown_argument(idle, script, status, arguments):
    ended = idle(script, *arguments.split())
    assert (ended.returncode, ended.stdout) == (status, "")
    assert "nonsense" in ended.stderr or "usage" in ended.stderr


@pytest.mark.parametrize("program", PROGRAMS)
def test_program_explains_itself(appliance, program):
    helped = appliance.inside(*appliance.command(program, "--help"))
    assert helped.returncode == 0 and program in helped.stdout
    refused = appliance.inside(*appliance.command(program, "--nonsense"))
    assert refused.returncode == 2 and "nonsense" in refused.stdout


def test_tool_refuses_three_arguments(appliance):
    ended = appliance.inside(*appliance.command("tesselupgrader", "1", "2", "3"))
    assert ended.returncode == 1 and "Usage:" in ended.stdout
