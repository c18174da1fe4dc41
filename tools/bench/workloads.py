"""Runs the workloads of the table, and their peers."""

import collections
import json
import os
import re
import statistics
import subprocess
import sys
import time

from .inputs import (
    CAPS,
    DATABASE,
    FILES,
    ROOT,
    TOOL,
    WORK,
    fresh_database,
    make_cameras,
    make_files,
)
from .inputs import make_settings, open_example, transactions
from .table import ROWS, Cost

CALLS = str(ROOT / "build/bench/tools/bench/calls")
PREVIEW = ROOT / "build/bench/preview/tessel-preview"
SIZES = {100: 21, 1000: 15, 10000: 11, 200000: 7}  # cameras, and how often they are upgraded
# Not /dev/null: some programs do less when their output goes there.
OUTPUT = [(os.POSIX_SPAWN_OPEN, 1, "/var/output", os.O_WRONLY | os.O_CREAT | os.O_TRUNC, 0o600)]


def run(command):
    """Returns a command's wall and user time in seconds."""
    start = time.perf_counter()
    pid = os.posix_spawnp(command[0], command, os.environ, file_actions=OUTPUT)
    _, status, usage = os.wait4(pid, 0)
    wall = time.perf_counter() - start
    if status != 0:
        sys.exit(f"bench: {command}: status {os.waitstatus_to_exitcode(status)}")
    return wall, usage.ru_utime


def memory(command):
    """Returns a command's peak memory in KiB. wait4() would tell this program's own, which the
    system counts to each command that it starts; GNU time is smaller than any of them."""
    run(["time", "-f", "%M", "-o", WORK / "memory", *command])
    return int((WORK / "memory").read_text())


def syncs(command):
    run(["strace", "-fqq", "-e", "trace=fsync,fdatasync", "-o", WORK / "syncs", *command])
    return (WORK / "syncs").read_text().count("\n")


def interleave(commands, rounds, prepare=lambda: None):
    """Runs the named commands in turn, so that what else the machine does falls on all of them.
    Returns the medians of each."""
    runs = {name: [] for name in commands}
    for _ in range(rounds):
        for name, command in commands.items():
            prepare()
            runs[name].append(run(command))
    medians = {name: map(statistics.median, zip(*times)) for name, times in runs.items()}
    return {name: dict(zip(("wall", "user"), times)) for name, times in medians.items()}


def upgrade(count, rounds, changes):
    make_cameras(count, changes)
    script, lines = WORK / "script", WORK / "upgrade.sql"
    script.write_text("".join(f'sqlite3 {DATABASE} "{change}"\n' for change in changes))
    lines.write_text("\n".join(changes))
    commands = {
        "ours": [TOOL, "0"],
        "one sqlite3": ["sqlite3", DATABASE, f".read {lines}"],
        "script": ["sh", "-e", script],
    }
    found = interleave(commands, rounds, fresh_database)
    for name, command in commands.items():
        for figure in memory, syncs:
            fresh_database()
            found[name][figure.__name__] = figure(command)
    return found


def preview(rounds):
    """Of the database that was upgraded last."""
    commands = {"ours": [PREVIEW, "--tool", TOOL, DATABASE, "0"], "upgrade": [TOOL, "0"]}
    found = interleave(commands, rounds, fresh_database)
    fresh_database()
    found["ours"]["memory"] = memory(commands["ours"])
    return {**found, "64 MiB": {"memory": 64 * 1024}}


def unchanged_files():
    make_files(10000, FILES, "pan= continuous\nptz_speed_max = 1\n", "audio = yes\nfov = 90\n")
    others = ["grep", "-c", "=", "-r", FILES]
    return interleave({"ours": [TOOL, "--updateCap", FILES], "grep -c": others}, 9)


def changed_files():
    sed = ["sed", "-i", "-E", r"s/^(pan|tilt) = yes/\1= step/", "{}", "+"]
    others = ["find", FILES, "-type", "f", "-exec", *sed]
    commands = {"ours": [TOOL, "--updateCap", FILES], "sed -i": others}
    return interleave(commands, 9, lambda: make_files(2000, FILES, "pan = yes\ntilt = yes\n"))


def library_calls():
    make_settings()
    options = "enable_random_interleaving=true repetitions=9 min_time=0.1 format=json"
    command = [CALLS, *(f"--benchmark_{option}" for option in options.split())]
    found = collections.defaultdict(dict)
    for timed in json.loads(subprocess.check_output(command))["benchmarks"]:
        if "error_message" in timed:
            sys.exit(f"bench: {timed['name']}: {timed['error_message']}")
        if timed.get("aggregate_name") == "median":
            call, way = timed["run_name"].split("/")
            found[call][way] = {"wall": timed["real_time"] / 1e9}
    return found


def measure():
    """Returns the figures of each workload's ways."""
    changes = transactions()
    found = {}
    for count, rounds in SIZES.items():
        found[f"upgrade of {count} cameras"] = upgrade(count, rounds, changes)
    if PREVIEW.exists():
        found[f"preview of {count} cameras"] = preview(rounds)
    else:
        print(f"bench: there is no {PREVIEW} to measure", file=sys.stderr)
    found["10000 unchanged capability files"] = unchanged_files()
    found["2000 changed capability files"] = changed_files()
    return {**found, **library_calls()}


# --- What no load of the machine changes ---


def prepare_counting():
    """Makes three cameras and nine files that the actions counted change."""
    database = open_example(DATABASE)
    database.execute("DELETE FROM camera")
    camera = "INSERT INTO camera (vendor, model, resolution) VALUES ('ABUS', 'TVIP62000', ?)"
    database.executemany(camera, [["QVGA"], ["VGA"], ["UXGA"]])
    database.close()
    make_files(9, CAPS, "pan= continuous\ntilt = no\n")
    make_settings()
    time.sleep(0.1)  # the tool does not trust what it remembers of a file of this very moment


def system_calls(command):
    """Returns how often each is made, but for those that manage memory."""
    prepare_counting()
    strace = ["strace", "-fc", "-U", "calls,name", "-e", "trace=!%memory", "-o", WORK / "calls"]
    subprocess.run([*strace, *command], check=True)
    counts = re.findall(r"^ *(\d+) (?!total)(\w+)$", (WORK / "calls").read_text(), re.M)
    return collections.Counter({name: int(count) for count, name in counts})


def instructions(command):
    prepare_counting()
    valgrind = ["valgrind", "--tool=callgrind", f"--callgrind-out-file={WORK}/callgrind"]
    subprocess.run([*valgrind, *command], check=True, stderr=subprocess.DEVNULL)
    return int(re.search(r"^totals: (\d+)", (WORK / "callgrind").read_text(), re.M)[1])


def costs():
    """Yields each row that has a budget, its cost and its system calls: what one run costs that
    does the thing once more than another."""
    # The versions from which one action more runs: TVIP62000's resolutions, PTZ speed.
    versions = {"one database action": (83, 82), "one capability-file action": (80, 79)}
    for row in filter(lambda row: row.budget, ROWS):
        once, twice = ([CALLS, "--times", times, row.workload] for times in "12")
        if row.workload in versions:
            once, twice = ([TOOL, str(version)] for version in versions[row.workload])
        calls = system_calls(twice) - system_calls(once)
        syncs = calls["fsync"] + calls["fdatasync"]
        yield row, Cost(calls.total(), syncs, instructions(twice) - instructions(once)), calls
