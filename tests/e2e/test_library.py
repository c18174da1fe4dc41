"""The library in programs of the package: from start to end, in failing calls, side by side."""

import os
import re
import time
from subprocess import Popen

import pytest
from conftest import wait_until


def test_configuration_is_attached_from_start_to_end(appliance):
    file = appliance.directory / "f"
    client = appliance.command("client", "get", file, "key")
    # Before main, in it, after it, and at the very end of each process.
    assert appliance.inside(*client).stdout == "0000"
    appliance.inside(*appliance.command("kidbglog", "create"))
    assert appliance.inside(*client).stdout == "0110"


FAILURES = [
    # What the client does, the call that fails, and the function and line that log it.
    ("get", "flock:error=ENOLCK:when=1", "GetKeyVals", "lock file [F] with errno [37]"),
    ("get", "openat:error=EACCES:when=2", "GetKeyVals", "open file [F] with errno [13]"),
    ("set", "flock:error=ENOLCK:when=1", "UpdateKeyVals", "lock file [F] with errno [37]"),
    ("set", "openat:error=EACCES:when=2", "UpdateKeyVals", "open file [F] with errno [13]"),
    ("set", "read:error=EIO:when=2", "UpdateKeyVals", "open file [F] with errno [5]"),
    ("set", "write:error=ENOSPC:when=1", "WriteToFile", "wrtie file [F.tmp] with errno [28]."),
    ("set", "/chown:error=EPERM", "WriteToFileAtomic", "chown [F.tmp] with errno [1]"),
    ("set", "/chmod:error=EPERM", "WriteToFileAtomic", "chmod [F.tmp] with errno [1]"),
    (
        "set",
        "/rename:error=EBUSY",
        "WriteToFileAtomic",
        "rename file [F.tmp] to [F] with errno [16]",
    ),
]


@pytest.mark.parametrize("action, failure, function, message", FAILURES)
def test_failing_step_is_logged_and_leaves_the_file(appliance, action, failure, function, message):
    if "write" in failure and "thread" in appliance.sanitizers:
        pytest.skip("ThreadSanitizer makes calls of write of its own")
    file = appliance.directory / "files/f"
    file.parent.mkdir()
    text = "a=1\n" + "x" * 8000
    file.write_text(text)
    strace = ["strace", "-o", "/dev/null", "-e", f"inject={failure}"]
    if "when" in failure and "write" not in failure:
        strace += ["-P", file]
    ended = appliance.inside(*strace, *appliance.command("client", action, file, "b", "2"))
    line = re.sub(r"\.tmp\.\w{6}", ".tmp", appliance.log_lines()[0].replace(str(file), "F"))
    assert line == f"[utils][error] fileutils.cpp:{function}(): Failed to {message}"
    assert ended.returncode == 1
    assert file.read_text() == text
    assert os.listdir(file.parent) == ["f"]


def test_lines_stay_whole_and_in_order_while_the_log_is_rotated(appliance):
    command = [*appliance.enter, *appliance.command("client", "write")]
    writers = [Popen(command) for _ in range(8)]
    logs = []
    for rotation in range(10):
        time.sleep(0.2)
        wait_until(appliance.log_file.exists)
        logs.append(appliance.log_file.rename(f"{appliance.log_file}.{rotation}"))
    for writer in writers:
        writer.kill()
        writer.wait()
    numbers = {}
    for log in logs:
        check_lines(log, numbers)
    assert len(numbers) >= 4, "fewer than two processes have written"


def check_lines(log, numbers):
    """Checks each line, and that it follows the last one of its thread, whose number it keeps."""
    last_time = ""
    for line in log.read_text().splitlines():
        match = re.fullmatch(r"(.{19}) (\[[][\d]+\]) ?f:1:Fn\(\): (\d+) (0+)", line)
        assert match, f"not a whole line in {log.name}: {line}"
        written, thread, number, zeros = match[1], match[2], int(match[3]), len(match[4])
        assert zeros == number % 300 + 1, f"not a whole line in {log.name}: {line}"
        assert number == numbers.get(thread, 0) + 1, f"out of order in {log.name}: {line}"
        assert written >= last_time, f"earlier than the line before it in {log.name}: {line}"
        numbers[thread] = number
        last_time = written
