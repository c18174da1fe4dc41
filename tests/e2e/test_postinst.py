"""The example of a maintainer script, which a package's installer runs."""

import shlex
import subprocess

from conftest import SOURCE

UNDO = "/var/packages/Camveld/undo"


class Package:
    """An example appliance on which the programs can be called by name."""

    def __init__(self, example):
        self.example = example
        self.programs = example.directory / "bin"
        self.programs.mkdir()
        example.inside("ln", "-s", example.directory, UNDO)
        self.install("tesselupgrader")
        self.install("tessel-preview", "--tool", self.programs / "tesselupgrader")

    def install(self, name, *options):
        program = self.programs / name
        command = shlex.join(self.example.command(name, *options))
        program.write_text(f'#!/bin/sh\n{command} "$@"\n')
        program.chmod(0o755)

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


def test_a_failure_is_said_with_its_reason(example):
    example.sql("CREATE TRIGGER t BEFORE UPDATE ON camera BEGIN SELECT RAISE(ABORT, 'no'); END;")
    status, output = Package(example).postinst("configure", "8.2.0-85")
    assert status == 0
    assert "failed: UpdateCameraModelConfRenameSiemens: no\n" in output


def test_a_version_without_a_number_changes_nothing(example):
    status, output = Package(example).postinst("configure", "8.2.0")
    assert status == 0
    assert "no package number in version 8.2.0" in output
    assert not example.log_file.exists()
