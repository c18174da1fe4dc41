"""Whole runs beside other processes."""

from subprocess import Popen

import pytest
from conftest import STRACE, TOOL, run


def left_behind(appliance):
    outputs = "SELECT cam_id, idx, name FROM camdeviceoutput ORDER BY 1, 2, 3"
    rows = appliance.sql("SELECT * FROM camera") + appliance.sql(outputs)
    return rows, appliance.capability_files()


@pytest.mark.parametrize("mode", ["delete", "wal"])
def test_two_runs_beside_the_recorder_are_like_one_after_the_other(
    example, mode
):
    for _ in range(2):
        example.upgrade(0).must_be(0)
    expected = left_behind(example)

    example.database.unlink()
    example.load_example()
    example.sql(f"PRAGMA journal_mode = {mode}")
    # Both runs are at work on the same capability file for a while.
    slow = [*STRACE, "-e", "inject=rename:delay_enter=100000"]
    tool = ([] if example.emulator else slow) + example.command(TOOL, 0)
    count = "UPDATE camera SET update_time = ifnull(update_time, 0) + 1"
    recorder = ["sqlite3", "-cmd", ".timeout 60000", example.database]
    with Popen([*recorder, *[count] * 300]), Popen(tool) as other:
        ended = run(*tool)
    assert (ended.returncode, other.returncode) == (0, 0), ended.stdout
    assert example.sql("SELECT DISTINCT update_time FROM camera") == [(300,)]
    example.sql("UPDATE camera SET update_time = NULL")
    assert left_behind(example) == expected
