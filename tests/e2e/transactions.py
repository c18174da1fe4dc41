"""transactions.py THRESHOLDS COMMAND...

Runs inside a private appliance. Prints as JSON which database actions the tool runs for the
version below each of the comma-separated thresholds and for the threshold itself, and all
transactions of every action in order.

The tool logs the text of a transaction that it cannot run, and goes on with the next action. So
the N-th and all later openings of the database are made to fail, for N = 1, 2, ...
"""

import json
import os
import re
import subprocess
import sys
from pathlib import Path

DATABASE = Path("/var/packages/Camveld/target/system.db")
LOG = Path("/var/log/camveld/camveld.log")
FAILURE = re.compile(
    r"tesselupgrader\.cpp:\d+:(\w+)\(\): KiDBExecute command \((.*?)\) error\.\n", re.S
)


def failures(command):
    """Returns name and text of the actions that a run of the command could not complete."""
    LOG.unlink(missing_ok=True)
    subprocess.run(command, stdout=subprocess.DEVNULL)
    return FAILURE.findall(LOG.read_text(errors="backslashreplace"))


def fail_opening(number):
    options = ["-f", "--seccomp-bpf", "-e", "trace=openat", "--quiet=path-resolution"]
    inject = f"inject=openat:error=EIO:when={number}+"
    return ["strace", *options, "-o", "/dev/null", "-P", DATABASE.resolve(), "-e", inject]


def transactions(threshold, first, names, command, example):
    """Yields name and text of every transaction of the actions of this threshold: the first one,
    and what fails when that succeeds, and so on."""
    failed = [first]
    for number in range(2, 1000):
        if not failed or failed[0][0] not in names:
            return
        yield failed[0]
        DATABASE.write_bytes(example)
        failed = failures([*fail_opening(number), *command, str(threshold - 1)])


def main():
    os.environ["ASAN_OPTIONS"] = "detect_leaks=0"  # it cannot look for them when traced
    thresholds = [int(threshold) for threshold in sys.argv[1].split(",")]
    command = sys.argv[2:]
    example = DATABASE.read_bytes()
    DATABASE.unlink()
    selected = {}
    versions = sorted({0, *thresholds, *(threshold - 1 for threshold in thresholds)})
    for version in versions:
        selected[version] = failures([*command, str(version)])
    names = {version: [name for name, _ in selected[version]] for version in versions}
    found = []
    for threshold in thresholds:
        group = set(names[threshold - 1]) - set(names[threshold])
        for first in selected[threshold - 1][:1]:
            found += transactions(threshold, first, group, command, example)
    print(json.dumps({"selected": names, "transactions": found}))


main()
