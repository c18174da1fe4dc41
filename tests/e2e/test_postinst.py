"""The example of a maintainer script: whatever happens is said, and the package gets configured."""

import shlex
import subprocess

import pytest
from conftest import SOURCE

WAY_BACK = 'ln -s "$0" /var/packages/Camveld/undo; exec "$@"'


class Package:
    """An example appliance on which the programs can be called by name."""

    def __init__(self, example):
        self.appliance = example
        self.programs, self.undo = example.directory / "bin", example.directory / "undo"
        self.programs.mkdir()
        self.undo.mkdir()
        tool = example.command("tesselupgrader")
        preview = example.command("tessel-preview", "--tool", self.install("tool", tool))
        self.install("tesselupgrader", tool)
        self.install("tessel-preview", preview)

    def install(self, name, command):
        program = self.programs / name
        program.write_text(f'#!/bin/sh\n{shlex.join(command)} "$@"\n')
        program.chmod(0o755)
        return program

    def postinst(self, *arguments):
        path = f"PATH={self.programs}:/usr/sbin:/usr/bin:/sbin:/bin"
        command = ["env", path, "sh", "-c", WAY_BACK, self.undo]
        ended = self.appliance.inside(*command, SOURCE / "examples/installer-postinst", *arguments)
        return ended.returncode, ended.stdout


def test_the_way_back_leads_back_also_after_a_second_attempt(example):
    package, before = Package(example), example.rows()
    status, output = package.postinst("configure", "8.2.0-82")
    assert status == 0 and "'tessel-preview 82' shows it" in output
    assert example.rows() != before
    assert package.postinst("configure", "8.2.0-82")[0] == 0
    for name in ("8.2.0-82.2", "8.2.0-82"):
        undo = (package.undo / name / "system.db.sql").read_bytes()
        subprocess.run(["sqlite3", example.database], input=undo, check=True)
    assert example.rows() == before


@pytest.mark.parametrize(
    "arguments, tool, status, message",
    [
        ("configure", "true", 0, ""),
        ("configure 8.2.0", "true", 0, "no package number in version 8.2.0"),
        ("configure 8.2.0-85", "exit 255", 0, "failed: UpdateCameraModelConfRenameSiemens: no\n"),
        ("configure 8.2.0-85", "exit 127", 0, "ended with status 127, to try it again"),
        ("configure 8.2.0-85", "kill -9 $$", 1, "ended by signal 9, configure the package again"),
    ],
)
def test_a_failure_is_said(example, arguments, tool, status, message):
    example.sql("CREATE TRIGGER t BEFORE UPDATE ON camera BEGIN SELECT RAISE(ABORT, 'no'); END;")
    package = Package(example)
    package.install("tesselupgrader", ["sh", "-c", tool, "sh"])
    ended, output = package.postinst(*arguments.split())
    assert (ended, message in output, not message) == (status, True, not output)
