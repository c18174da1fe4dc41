"""What a whole run does to the machine, and beside other processes."""

import re
import shutil
import sqlite3
import threading
from contextlib import closing

import pytest
from conftest import TEMPORARY_FILE, Appliance

WRITES = re.compile(
    r"\bopen\w*\(.*O_(WRONLY|RDWR|CREAT)"
    r"|\b(rename|unlink|link|symlink|mkdir|mknod|truncate|chmod|chown)\w*\("
)


def test_a_run_writes_only_its_files(example):
    # They change twice in one transaction: what may have to be undone stays in memory.
    rows = ", ".join(["('FOSCAM', 'R4', '2048x1536', '2048x1536')"] * 300)
    example.sql(f"INSERT INTO camera (vendor, model, resolution, live_resolution) VALUES {rows}")
    trace = example.directory / "trace"
    assert example.upgrade(0, under=["strace", "-f", "-e", "%file", "-o", trace]).status == 0
    lines = [line for line in trace.read_text().splitlines() if WRITES.search(line)]
    written = {re.search('"([^"]+)"', line)[1] for line in lines}
    assert {path for path in written if not path.startswith("/tmp/tsan")} == {
        "/var/log/camveld/camveld.log",
        f"/var/packages/Camveld/target/@camveld/@KICapInfo/{TEMPORARY_FILE}",
        f"{example.database}",
        f"{example.database}-journal",
    }


def test_valgrind_finds_nothing(example):
    if example.sanitizers or example.emulator:
        pytest.skip("Valgrind runs neither sanitized nor foreign programs")
    valgrind = ["valgrind", "-q", "--error-exitcode=99", "--leak-check=full"]
    result = example.upgrade(0, under=valgrind)
    assert (result.status, result.output) == (0, "")


def count_up(database, ended, counts):
    """Changes another column of the same rows, as the recorder does, until it is told to end."""
    with closing(sqlite3.connect(database, timeout=60, isolation_level=None)) as recorder:
        while not ended.wait(0.02):
            recorder.execute("UPDATE camera SET update_time = ifnull(update_time, 0) + 1")
            counts.append(len(counts) + 1)


def left_behind(appliance):
    appliance.sql("UPDATE camera SET update_time = NULL")
    outputs = "SELECT cam_id, type, idx, name, count(*) FROM camdeviceoutput GROUP BY 1, 2, 3, 4"
    rows = appliance.sql("SELECT * FROM camera") + appliance.sql(outputs)
    return rows, appliance.capability_texts()


@pytest.mark.parametrize("mode", ["delete", "wal"])
def test_two_runs_beside_the_recorder_do_what_one_after_the_other_does(example, mode):
    twin = Appliance(example.directory / "twin", example.build)
    shutil.copy(example.database, twin.database)
    shutil.copytree(example.caps, twin.caps, dirs_exist_ok=True)
    assert [twin.upgrade(0).status, twin.upgrade(0).status] == [0, 0]

    example.sql(f"PRAGMA journal_mode = {mode}")
    # Long enough for each capability file that both are at work on the same.
    slow = ["strace", "-f", "-o", "/dev/null", "-e", "inject=rename:delay_enter=100000"]
    tool = ([] if example.emulator else slow) + example.command("tesselupgrader", 0)
    names = "SELECT group_concat(vendor || model || fov) FROM camera"
    ended, counts = threading.Event(), []
    other = threading.Thread(target=count_up, args=[example.database, ended, counts])
    with closing(sqlite3.connect(example.database, isolation_level=None)) as reader:
        if mode == "wal":  # a transaction keeps what was there when it began
            reader.execute("BEGIN")
        before = reader.execute(names).fetchone()
        other.start()
        both = example.inside("sh", "-c", '"$@" & "$@" && wait $!', "sh", *tool)
        ended.set()
        other.join()
        assert both.returncode == 0, both.stdout
        assert (reader.execute(names).fetchone() == before) == (mode == "wal")
    assert example.sql("SELECT DISTINCT update_time FROM camera") == [(counts[-1],)]
    assert left_behind(example) == left_behind(twin)
