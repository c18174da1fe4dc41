"""Makes the inputs, and runs the tool, the library and their peers on them."""

import collections
import itertools
import json
import os
import re
import shutil
import sqlite3
import statistics
import subprocess
import time
from pathlib import Path

from .table import SIZES

ROOT = Path(__file__).resolve().parents[2]
BUILD = ROOT / "build/bench"
TOOL = BUILD / "main/tesselupgrader"
CALLS = BUILD / "tools/bench/calls"
TARGET = Path("/var/packages/Camveld/target")
DATABASE = TARGET / "system.db"
START = Path("/var/start.db")  # what is copied to DATABASE before each run
FILES = Path("/var/files")
RESULT = Path("/var/result")  # of a program that measures another
# Not /dev/null: some programs do less when their output goes there.
OUTPUT = [(os.POSIX_SPAWN_OPEN, 1, "/var/out", os.O_WRONLY | os.O_CREAT | os.O_TRUNC, 0o600)]


def run(command):
    """Returns a command's wall and user time in seconds, and its peak memory in KiB."""
    # wait4() returns at least this program's own memory. That of GNU time is smaller.
    timed = ["time", "-f", "%M", "-o", RESULT, *command]
    start = time.perf_counter()
    pid = os.posix_spawnp(timed[0], timed, os.environ, file_actions=OUTPUT)
    _, status, usage = os.wait4(pid, 0)
    wall = time.perf_counter() - start
    if status != 0:
        raise subprocess.CalledProcessError(os.waitstatus_to_exitcode(status), command)
    return {"wall": wall, "user": usage.ru_utime, "memory": int(RESULT.read_text())}


def interleave(commands, rounds, prepare=lambda: None):
    """Runs the named commands in turn, and returns the medians of each."""
    runs = {name: [] for name in commands}
    for _ in range(rounds):
        for name, command in commands.items():
            prepare()
            runs[name].append(run(command))
    return {
        name: {figure: statistics.median(run[figure] for run in done) for figure in done[0]}
        for name, done in runs.items()
    }


def system_calls(command, which="!%memory,getrandom"):
    """Counts system calls, but not getrandom(): mkostemp() makes it by chance."""
    strace = ["strace", "-fc", "-U", "calls,name", "-e", which, "-o", RESULT, *command]
    subprocess.run(strace, check=True)
    counts = re.findall(r"^ *(\d+) (?!total)(\w+)$", RESULT.read_text(), re.MULTILINE)
    return collections.Counter({name: int(count) for count, name in counts})


def instructions(command):
    valgrind = ["valgrind", "-q", "--tool=callgrind", f"--callgrind-out-file={RESULT}", *command]
    subprocess.run(valgrind, check=True)
    return int(re.search(r"^totals: (\d+)", RESULT.read_text(), re.MULTILINE)[1])


def make_cameras(count):
    """Makes START of so many cameras of 600 bytes. An upgrade changes 30 % of them."""
    START.unlink(missing_ok=True)
    database = sqlite3.connect(START, isolation_level=None)
    database.executescript((ROOT / "examples/appliance.sql").read_text())
    kind = "SELECT * FROM camera WHERE name = ? AND model <> 'A8105-E' ORDER BY id"
    changing = itertools.cycle(database.execute(kind, ["changes"]).fetchall())
    staying = itertools.cycle(database.execute(kind, ["must stay"]).fetchall())
    database.executescript("BEGIN; DELETE FROM camera")
    for row in range(count):
        _, *values = next(changing if row % 10 < 3 else staying)
        database.execute(f"INSERT INTO camera VALUES (?{',?' * len(values)})", (row, *values))
    database.execute("UPDATE camera SET motion_area = zeroblob(345)")
    database.execute("COMMIT")
    database.close()


def fresh_database():
    """Brings START back. No run waits until it is on stable storage."""
    shutil.copyfile(START, DATABASE)
    os.sync()


def make_files(count, text, directory=FILES):
    """Makes so many capability files of some 40 lines, with the text in the middle of each."""
    shutil.rmtree(directory, ignore_errors=True)
    directory.mkdir()
    lines = "".join(f"resolution_{line} = 1920x1080,1280x720\n" for line in range(18))
    for number in range(count):
        (directory / f"{number:05}").write_text(lines + text + lines)


def make_settings():
    """Makes what the library's calls read and change, also with the group that GKeyFile needs."""
    lines = "".join(f"camera{line}=the setting of {line}\n" for line in range(1000, 2000))
    Path("/var/settings").write_text(lines)
    Path("/var/settings.ini").write_text("[settings]\n" + lines)


def upgrade(count, rounds):
    actions = (ROOT / "tests/expected/actions.txt").read_text()
    texts = re.findall(r"^\* (.*(?:\n  .*)*)", actions, re.MULTILINE)
    # Without the cameras that make_cameras() leaves out: they have transactions of their own.
    changes = [f"BEGIN;{text};COMMIT;" for text in texts if not re.match("INSERT|.* id=", text)]
    commands = {
        "ours": [TOOL, "0"],
        "one sqlite3": ["sqlite3", DATABASE, *changes],
        "script": ["sh", "-ec", "\n".join(f'sqlite3 {DATABASE} "{text}"' for text in changes)],
    }
    make_cameras(count)
    found = interleave(commands, rounds, fresh_database)
    for name, command in commands.items():
        fresh_database()
        found[name]["syncs"] = system_calls(command, "fsync,fdatasync").total()
    return found


def library_calls():
    make_settings()
    options = "enable_random_interleaving=true repetitions=9 min_time=0.1 format=json"
    command = [CALLS, *(f"--benchmark_{option}" for option in options.split())]
    found = collections.defaultdict(dict)
    for timed in json.loads(subprocess.check_output(command))["benchmarks"]:
        if timed.get("aggregate_name") == "median":
            call, way = timed["run_name"].split("/")
            found[call][way] = {"wall": timed["real_time"] / 1e9}
    return found


def measure():
    """Returns the figures of each workload, by the ways in which it is done."""
    found = {}
    for count, rounds in SIZES.items():
        found[f"upgrade of {count} cameras"] = upgrade(count, rounds)
    preview = [BUILD / "preview/tessel-preview", "--tool", TOOL, DATABASE, "0"]
    ways = {"ours": preview, "upgrade": [TOOL, "0"]}
    found[f"preview of {count} cameras"] = interleave(ways, rounds, fresh_database)
    ours = [TOOL, "--updateCap", FILES]
    make_files(10000, "pan= continuous\nptz_speed_max = 1\n")
    ways = {"ours": ours, "grep -c": ["grep", "-c", "=", "-r", FILES]}
    found["10000 unchanged capability files"] = interleave(ways, 9)
    sed = rf"sed -i -E 's/^(pan|tilt) = yes/\1= step/' {FILES}/*"
    ways = {"ours": ours, "sed -i": ["sh", "-c", sed]}
    text = "pan = yes\ntilt = yes\n"
    found["2000 changed capability files"] = interleave(ways, 9, lambda: make_files(2000, text))
    return {**found, **library_calls()}


def count(workload):
    """Returns the system calls and instructions of doing it once more."""
    # An upgrade from the lower version runs one action more.
    arguments = {"one database action": "83 82", "one capability-file action": "80 79"}
    program = [TOOL] if workload in arguments else [CALLS, f"{workload}/ours"]
    counted = []
    for argument in arguments.get(workload, "1 2").split():
        for tool in system_calls, instructions:
            make_cameras(3)  # TVIP62000, the example's first, which the counted action changes
            fresh_database()
            make_files(9, "pan= continuous\ntilt = no\n", TARGET / "@camveld/@KICapInfo")
            make_settings()
            counted.append(tool([*program, argument]))
    return counted[2] - counted[0], counted[3] - counted[1]
