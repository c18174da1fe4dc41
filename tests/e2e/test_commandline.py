import re

import pytest

PACKAGE = "/var/packages/Camveld/target/@camveld"
USAGE = (
    r"tesselupgrader [\d.]+\nUsage:\n"
    r"tesselupgrader \{pre-upgrade-version\}\|\{--updateCap remote-cap-dir\}\n"
)


@pytest.mark.parametrize("arguments", ["", "1 2", "1 2 3", "--updatecap /tmp", "--updateCap / 3"])
def test_other_arguments_print_the_usage_and_do_nothing(example, arguments):
    result = example.run(*arguments.split())
    assert result.status == 1
    assert re.fullmatch(USAGE, result.output)
    assert (result.changes, result.diffs, result.log) == ([], "", [])


NUMBERS = [
    ("-1", 4294967295),
    (" +99999x", 99999),
    ("99999999999", 2147483647),
    ("-99999999999999999999", 2147483648),
]


@pytest.mark.parametrize("argument, number", NUMBERS)
def test_a_version_counts_as_far_as_it_is_a_number(appliance, argument, number):
    result = appliance.run(argument)
    assert result.status == 0
    assert result.log == [f"tesselupgrader.cpp:main(): TESSEL pre-upgrade version: {number}"]


def test_a_single_argument_is_a_version_whatever_it_is(example):
    result = example.run("--updateCap")
    assert result.log[0].endswith("version: 0")
    assert result.changes


MISSING = [
    # what becomes of the package's directory, arguments, exit status
    ("rm -r $0/*", [0], 0),
    ("rm -r $0", [0], 255),
    ("rm -r $0", ["--updateCap", ""], 255),
    ("rm -r $0; touch $0", [0], 255),
]


@pytest.mark.parametrize("replace, arguments, status", MISSING)
def test_without_the_packages_directory(example, replace, arguments, status):
    program = example.command("tesselupgrader", *arguments)
    ended = example.inside("sh", "-c", f'{replace}; "$@"', PACKAGE, *program)
    assert (ended.returncode, ended.stdout) == (status, "")
