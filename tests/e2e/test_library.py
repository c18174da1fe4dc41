"""The library in programs: from start to end, in failing calls, together."""

import errno
import fcntl
import os
import re
import time
from subprocess import Popen

import pytest
from conftest import CLIENT, KIDBGLOG, LOG_LINE, STRACE, run

# What the client writes: the number of the line, and some zeros.
NUMBERED = re.compile(r"f:1:Fn\(\): (\d+) (0+)")


def test_configuration_is_attached_from_start_to_end(appliance):
    file = appliance.directory / "f"
    client = appliance.command(CLIENT, "get", file, "key")
    # Before main, in it, after it, and at the very end of each process.
    assert run(*client).stdout == "0000"
    assert appliance.log() == ["[event][alarm] client.cpp:End(): End"] * 2
    run(*appliance.command(KIDBGLOG, "create"))
    assert run(*client).stdout == "0110"


FAILURES = [
    # what the client does; call that fails, error, number; message
    ("get", "flock ENOLCK 1", "GetKeyVals(): Failed to lock file [F]"),
    ("get", "openat EACCES 2", "GetKeyVals(): Failed to open file [F]"),
    ("set", "flock ENOLCK 1", "UpdateKeyVals(): Failed to lock file [F]"),
    ("set", "read EIO 2", "UpdateKeyVals(): Failed to open file [F]"),
    ("set", "write ENOSPC 1", "WriteToFile(): Failed to wrtie file [F.tmp]"),
    ("set", "/chown EPERM 1", "WriteToFileAtomic(): Failed to chown [F.tmp]"),
    ("set", "/chmod EPERM 1", "WriteToFileAtomic(): Failed to chmod [F.tmp]"),
    ("set", "/rename EBUSY 1", "WriteToFileAtomic(): Failed to rename file"),
]


@pytest.mark.parametrize("action, call, message", FAILURES)
def test_a_failing_call_is_logged_and_leaves_the_file(
    appliance, action, call, message
):
    name, error, number = call.split()
    if name == "write" and appliance.preset == "tsan":
        pytest.skip("ThreadSanitizer makes calls of write of its own")
    file = appliance.directory / "files/f"
    file.parent.mkdir()
    text = "a=1\n" + "x" * 8000
    file.write_text(text)
    strace = [*STRACE, "-e", f"inject={name}:error={error}:when={number}"]
    if name in ("flock", "openat", "read"):
        strace += ["-P", file]
    client = appliance.command(CLIENT, action, file, "b", "2")
    ended = run(*strace, *client)
    line = appliance.log()[0].replace(str(file), "F")
    line = re.sub(r"\.tmp\.\w{6}", ".tmp", line)
    assert line.startswith(f"[utils][error] fileutils.cpp:{message}")
    assert f"with errno [{getattr(errno, error)}]" in line
    assert ended.returncode == 1
    assert file.read_text() == text
    assert os.listdir(file.parent) == ["f"]


def test_a_log_that_stays_locked_loses_a_line_and_holds_nobody(appliance):
    no_time_passes = [*STRACE, "-e", "inject=/nanosleep:retval=0"]
    client = appliance.command(CLIENT, "get", "/missing/f", "key")
    with appliance.log_file.open("w") as log:
        fcntl.flock(log, fcntl.LOCK_SH)
        assert run(*no_time_passes, *client).returncode == 1
    assert appliance.log() == []


def test_lines_stay_whole_and_in_order_while_the_log_is_rotated(appliance):
    client = appliance.command(CLIENT, "write")
    writers = [Popen(client) for _ in range(8)]
    logs = []
    for rotation in range(10):
        for _ in range(300):  # up to a minute, on a busy machine
            time.sleep(0.2)
            if appliance.log_file.exists():
                break
        old = f"{appliance.log_file}.{rotation}"
        logs.append(appliance.log_file.rename(old))
    for writer in writers:
        writer.kill()
        writer.wait()
    numbers = {}
    for log in logs:
        check_lines(log, numbers)
    assert len(numbers) >= 4, "fewer than two processes have written"


def check_lines(log, numbers):
    """Checks each line, and that it follows the last one of its thread."""
    last_time = ""
    for line in log.read_text().splitlines():
        parts = LOG_LINE.fullmatch(line)
        text = NUMBERED.fullmatch(parts[3]) if parts else None
        assert text, f"not a whole line in {log.name}: {line}"
        written, thread, number = parts[1], parts[2], int(text[1])
        assert len(text[2]) == number % 300 + 1, f"not a whole line: {line}"
        assert written >= last_time, f"earlier than the line before: {line}"
        last = numbers.get(thread, 0)
        assert number == last + 1, f"not behind {last} in {log.name}: {line}"
        numbers[thread] = number
        last_time = written
