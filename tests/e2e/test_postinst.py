"""The example of a maintainer script, which a package's installer runs."""

import shlex
import subprocess

import pytest
from conftest import SOURCE

UNDO = "/var/packages/Camveld/undo"


class Package:
    """An example appliance on which the programs can be called by name."""

    def __init__(self, example):
        self.example = example
        self.programs = example.directory / "bin"
        self.programs.mkdir()
        example.inside("ln", "-s", example.directory, UNDO)
        tool = self.install("tool", *example.command("tesselupgrader"))
        self.install("tesselupgrader", tool)
        preview = example.command("tessel-preview", "--tool", tool)
        self.install("tessel-preview", *preview)

    def install(self, name, *command):
        program = self.programs / name
        program.write_text(f'#!/bin/sh\n{shlex.join(map(str, command))} "$@"\n')
        program.chmod(0o755)
        return program

    def postinst(self, *arguments):
        path = f"PATH={self.programs}:/usr/sbin:/usr/bin:/sbin:/bin"
        script = SOURCE / "examples/installer-postinst"
        ended = self.example.inside("env", path, script, *arguments)
        return ended.returncode, ended.stdout


def test_the_way_back_leads_back_also_after_a_second_attempt(example):
    package = Package(example)
    before = example.rows()
    for _ in range(2):
        status, output = package.postinst("configure", "8.2.0-82")
        assert status == 0 and "'tessel-preview 82' shows it" in output
    assert example.rows() != before
    for name in ("8.2.0-82.2", "8.2.0-82"):
        undo = (example.directory / name / "system.db.sql").read_bytes()
        subprocess.run(["sqlite3", example.database], input=undo, check=True)
    assert example.rows() == before


FAILURES = [
    # arguments, what the tool does, exit status, message
    ("configure 8.2.0", "true", 0, "no package number in version 8.2.0"),
    ("configure 8.2.0-85", "exit 255", 0, "failed: UpdateCameraModelConfRenameSiemens: no\n"),
    ("configure 8.2.0-85", "exit 127", 0, "ended with status 127, to try it again"),
    ("configure 8.2.0-85", "kill -9 $$", 1, "ended by signal 9, configure the package again"),
]


@pytest.mark.parametrize("arguments, tool, status, message", FAILURES)
def test_a_failure_is_said(example, arguments, tool, status, message):
    example.sql("CREATE TRIGGER t BEFORE UPDATE ON camera BEGIN SELECT RAISE(ABORT, 'no'); END;")
    package = Package(example)
    package.install("tesselupgrader", "sh", "-c", tool, "sh")
    ended, output = package.postinst(*arguments.split())
    assert ended == status
    assert message in output
