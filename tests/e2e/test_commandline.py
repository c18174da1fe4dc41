"""The arguments of the tool."""

import re

import pytest

# The name and version of the tool, and how to call it.
USAGE = (
    r"tesselupgrader [\d.]+\nUsage:\ntesselupgrader "
    r"\{pre-upgrade-version\}\|\{--updateCap remote-cap-dir\}\n"
)


@pytest.mark.parametrize("arguments", ["", "1 2", "--updateCap / 3"])
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
    log = appliance.upgrade(argument).log
    assert log[0].endswith(f"TESSEL pre-upgrade version: {number}")
