"""The arguments of the tool, and the directories that it needs."""

import re
import shutil

import pytest

# The name and version of the tool, and how to call it.
USAGE = (
    r"tesselupgrader [\d.]+\nUsage:\ntesselupgrader "
    r"\{pre-upgrade-version\}\|\{--updateCap remote-cap-dir\}\n"
)

OTHERS = ["", "1 2", "1 2 3", "--updatecap /tmp", "--updateCap / 3"]


@pytest.mark.parametrize("arguments", OTHERS)
def test_other_arguments_only_print_the_usage(example, arguments):
    result = example.upgrade(*arguments.split())
    result.must_be(1)
    assert re.fullmatch(USAGE, result.output)
    assert (result.changes, result.diffs, result.log) == ([], "", [])


NUMBERS = [
    ("-1", 4294967295),
    (" +99999x", 99999),
    ("--updateCap", 0),
    ("-99999999999999999999", 2147483648),
]


@pytest.mark.parametrize("argument, number", NUMBERS)
def test_a_version_counts_as_far_as_it_is_a_number(
    appliance, argument, number
):
    result = appliance.upgrade(argument)
    start = "tesselupgrader.cpp:main(): TESSEL pre-upgrade version"
    assert result.log[0] == f"{start}: {number}"


MISSING = [
    # what is missing below the target directory, arguments, exit status
    ("@camveld/@KICapInfo", [0], 0),
    ("@camveld", [0], 255),
    ("@camveld", ["--updateCap", ""], 255),
]


@pytest.mark.parametrize("missing, arguments, status", MISSING)
def test_without_the_packages_directory(example, missing, arguments, status):
    directory = example.directory / missing
    shutil.rmtree(directory)
    example.upgrade(*arguments).must_be(status)
    directory.touch()
    example.upgrade(*arguments).must_be(status)
