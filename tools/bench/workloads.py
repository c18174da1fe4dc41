"""Makes the inputs, and runs the tool, the library and their peers on them."""

import json
import os
import re
import shutil
import sqlite3
import subprocess
import time
from collections import Counter, defaultdict
from itertools import cycle
from pathlib import Path
from statistics import median

from .table import SIZES

ROOT = Path(__file__).resolve().parents[2]
BUILD = ROOT / "build/bench"
TOOL = BUILD / "sbin/tesselupgrader"
CALLS = BUILD / "tools/bench/calls"
DATABASE = Path("/var/packages/Camveld/target/system.db")
START = Path("/var/start.db")  # what is copied to DATABASE before each run
CAPS = DATABASE.parent / "@camveld/@KICapInfo"
FILES = Path("/var/files")
RESULT = Path("/var/result")  # of a program that measures another

SYNC = "PRAGMA synchronous = EXTRA"  # what the tool promises, too
UPGRADE = [TOOL, "0"]
PREVIEW = [BUILD / "sbin/tessel-preview", DATABASE, "0"]
UPDATE_FILES = [TOOL, "--updateCap", FILES]
GREP = ["grep", "-c", "=", "-r", FILES]
SED = ["sh", "-c", rf"sed -i -E 's/^(pan|tilt) = yes/\1= step/' {FILES}/*"]
# An upgrade from the version before runs one action more.
ACTIONS = {"one database action": 83, "one capability-file action": 80}


def run(command):
    """Returns a command's wall time in seconds, and its peak memory in KiB."""
    timed = ["time", "-f", "%M", "-o", RESULT, *command]
    # Not /dev/null: some programs do less when their output goes there.
    with open("/var/out", "w") as output:
        start = time.perf_counter()
        subprocess.run(timed, stdout=output, check=True)
        wall = time.perf_counter() - start
    return {"wall": wall, "memory": int(RESULT.read_text())}


def interleave(ways, rounds, prepare=lambda: None):
    """Runs the command of each way in turn, and returns their medians."""
    runs = {way: [] for way in ways}
    for way in [*ways] * rounds:
        prepare()
        runs[way].append(run(ways[way]))
    return {
        way: {name: median(run[name] for run in done) for name in done[0]}
        for way, done in runs.items()
    }


def system_calls(command, which="!%memory,getrandom"):
    """Counts calls, but not getrandom(): mkostemp() makes it by chance."""
    strace = ["strace", "-fc", "-U", "calls,name", "-e", which, "-o", RESULT]
    subprocess.run([*strace, *command], check=True)
    counts = re.findall(r"(?m)^ *(\d+) (?!total)(\w+)$", RESULT.read_text())
    return Counter({name: int(count) for count, name in counts})


def instructions(command):
    callgrind = ["--tool=callgrind", f"--callgrind-out-file={RESULT}"]
    subprocess.run(["valgrind", "-q", *callgrind, *command], check=True)
    return int(re.search(r"(?m)^totals: (\d+)", RESULT.read_text())[1])


def make_cameras(count):
    """Makes START, with cameras of 600 bytes. An upgrade changes 30 %.

    Without a directory of capability files, an upgrade would fail.
    """
    CAPS.mkdir(parents=True, exist_ok=True)
    START.unlink(missing_ok=True)
    db = sqlite3.connect(START)
    db.executescript((ROOT / "examples/appliance.sql").read_text())
    models = "SELECT * FROM camera WHERE name = ? AND model <> 'A8105-E'"
    changing = cycle(db.execute(models, ["changes"]).fetchall())
    staying = cycle(db.execute(models, ["must stay"]).fetchall())
    db.execute("DELETE FROM camera")
    for row in range(count):
        _, *camera = next(changing if row % 10 < 3 else staying)
        fields = ",?" * len(camera)
        db.execute(f"INSERT INTO camera VALUES (?{fields})", (row, *camera))
    db.execute("UPDATE camera SET motion_area = zeroblob(345)")
    db.commit()
    db.close()


def fresh_database():
    """Brings START back. No run waits until it is on stable storage."""
    shutil.copyfile(START, DATABASE)
    os.sync()


def make_files(count, text, directory=FILES):
    """Makes capability files of some 40 lines, with the text in the middle."""
    shutil.rmtree(directory, ignore_errors=True)
    directory.mkdir(parents=True)
    lines = [f"resolution_{line} = 1920x1080,1280x720\n" for line in range(18)]
    for number in range(count):
        file = directory / f"{number:05}"
        file.write_text("".join([*lines, text, *lines]))


def make_settings():
    """Makes what the library and GKeyFile, which needs a group, change."""
    lines = [f"camera{n}=the setting of {n}\n" for n in range(1000, 2000)]
    Path("/var/settings").write_text("".join(lines))
    Path("/var/settings.ini").write_text("[settings]\n" + "".join(lines))


def upgrade(count, rounds):
    actions = (ROOT / "tests/expected/actions.txt").read_text()
    # Without the cameras that make_cameras() leaves out.
    texts = re.findall(r"(?m)^\* (?!INSERT|.* id=)(.*(?:\n  .*)*)", actions)
    changes = [f"BEGIN;{text};COMMIT;" for text in texts]
    script = [f'sqlite3 {DATABASE} "{change}"' for change in changes]
    ways = {
        "ours": UPGRADE,
        "one sqlite3": ["sqlite3", DATABASE, SYNC, *changes],
        "script": ["sh", "-ec", "\n".join(script)],
    }
    make_cameras(count)
    found = interleave(ways, rounds, fresh_database)
    for way, command in ways.items():
        fresh_database()
        found[way]["syncs"] = system_calls(command, "fsync,fdatasync").total()
    return found


def library_calls():
    make_settings()
    options = "enable_random_interleaving=true repetitions=9 min_time=0.1"
    options = [f"--benchmark_{option}" for option in options.split()]
    timed = [CALLS, "--benchmark_format=json", *options]
    found = defaultdict(dict)
    for row in json.loads(subprocess.check_output(timed))["benchmarks"]:
        if row.get("aggregate_name") == "median":
            call, way = row["run_name"].split("/")
            found[call][way] = {"wall": row["real_time"] / 1e9}
    return found


def measure():
    """Returns the figures of each workload, by the ways to do it."""
    found = {}
    for cameras, rounds in SIZES.items():
        found[f"upgrade of {cameras} cameras"] = upgrade(cameras, rounds)
    ways = {"ours": PREVIEW, "upgrade": UPGRADE}
    previews = interleave(ways, rounds, fresh_database)
    found[f"preview of {cameras} cameras"] = previews
    make_files(10000, "pan= continuous\nptz_speed_max = 1\n")
    ways = {"ours": UPDATE_FILES, "grep -c": GREP}
    found["10000 unchanged capability files"] = interleave(ways, 9)
    ways = {"ours": UPDATE_FILES, "sed -i": SED}
    text = "pan = yes\ntilt = yes\n"
    changed = interleave(ways, 9, lambda: make_files(2000, text))
    found["2000 changed capability files"] = changed
    return found | library_calls()


def count(workload):
    """Returns the system calls and instructions of doing it once more."""
    program, less, more = [CALLS, f"{workload}/ours"], 1, 2
    if workload in ACTIONS:
        program, less, more = [TOOL], ACTIONS[workload], ACTIONS[workload] - 1

    def counted(counter, argument):
        make_cameras(3)  # TVIP62000, the first, which the action changes
        fresh_database()
        make_files(9, "pan= continuous\ntilt = no\n", CAPS)
        make_settings()
        return counter([*program, str(argument)])

    for counter in system_calls, instructions:
        yield counted(counter, more) - counted(counter, less)
