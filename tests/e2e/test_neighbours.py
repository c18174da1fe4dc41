"""Whole runs: under Valgrind, and beside other processes."""

import sqlite3
import threading
from contextlib import closing

import pytest
from conftest import new_appliance


def test_valgrind_finds_nothing(example):
    if example.sanitizers or example.emulator:
        pytest.skip("Valgrind runs neither sanitized nor foreign programs")
    valgrind = ["valgrind", "-q", "--error-exitcode=99", "--leak-check=full"]
    result = example.upgrade(0, under=valgrind)
    assert (result.status, result.output) == (0, "")


class Recorder(threading.Thread):
    """Changes another column of the cameras until it is told to end."""

    def __init__(self, database):
        super().__init__()
        self.database = database
        self.ended = threading.Event()
        self.count = 0

    def run(self):
        with closing(sqlite3.connect(self.database, timeout=60, isolation_level=None)) as own:
            while not self.ended.wait(0.02):
                own.execute("UPDATE camera SET update_time = ifnull(update_time, 0) + 1")
                self.count += 1


def left_behind(appliance):
    outputs = "SELECT cam_id, type, idx, name, count(*) FROM camdeviceoutput GROUP BY 1, 2, 3, 4"
    appliance.sql("UPDATE camera SET update_time = NULL")
    rows = appliance.sql("SELECT * FROM camera") + appliance.sql(outputs)
    return rows, appliance.capability_texts()


@pytest.mark.parametrize("mode", ["delete", "wal"])
def test_two_runs_beside_the_recorder_are_like_one_after_the_other(request, example, mode):
    with new_appliance(request.config) as twin:
        twin.load_example()
        assert [twin.upgrade(0).status, twin.upgrade(0).status] == [0, 0]
        expected = left_behind(twin)

    example.sql(f"PRAGMA journal_mode = {mode}")
    # Long enough for each capability file that both runs are at work on the same.
    slow = ["strace", "-f", "-o", "/dev/null", "-e", "inject=rename:delay_enter=100000"]
    tool = ([] if example.emulator else slow) + example.command("tesselupgrader", 0)
    recorder = Recorder(example.database)
    with closing(sqlite3.connect(example.database, isolation_level=None)) as reader:
        if mode == "wal":  # a transaction keeps what was there when it began
            reader.execute("BEGIN")
        names = "SELECT group_concat(vendor || model || fov) FROM camera"
        before = reader.execute(names).fetchone()
        recorder.start()
        both = example.inside("sh", "-c", '"$@" & "$@" && wait $!', "sh", *tool)
        recorder.ended.set()
        recorder.join()
        assert both.returncode == 0, both.stdout
        assert (reader.execute(names).fetchone() == before) == (mode == "wal")
    assert example.sql("SELECT DISTINCT update_time FROM camera") == [(recorder.count,)]
    assert left_behind(example) == expected
