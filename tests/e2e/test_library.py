"""The library in programs: from start to end, and in failing calls."""

import errno
import fcntl
import os
import re
from pathlib import Path

import pytest
from conftest import CLIENT, KIDBGLOG, STRACE, run

FILE = Path("/var/services/camveld/f")


def test_configuration_is_attached_from_start_to_end(appliance):
    client = appliance.command(CLIENT, "get", FILE, "key")
    # Before main, in it, after it, and at the very end of each process.
    assert run(*client).stdout == "0000"
    assert appliance.log() == ["[event][alarm] client.cpp:End(): End"] * 2
    run(*appliance.command(KIDBGLOG, "create"))
    assert run(*client).stdout == "0110"
    forbidden = [*STRACE, "-e", "inject=shmat:error=EACCES"]
    assert run(*forbidden, *client).stdout == "0000"


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
    text = "a=1\n" + "x" * 8000
    FILE.write_text(text)
    strace = [*STRACE, "-e", f"inject={name}:error={error}:when={number}"]
    if name in ("flock", "openat", "read"):
        strace += ["-P", FILE]
    client = appliance.command(CLIENT, action, FILE, "b", "2")
    ended = run(*strace, *client)
    line = appliance.log()[0].replace(str(FILE), "F")
    line = re.sub(r"\.tmp\.\w{6}", ".tmp", line)
    assert line.startswith(f"[utils][error] fileutils.cpp:{message}")
    assert f"with errno [{getattr(errno, error)}]" in line
    assert ended.returncode == 1
    assert FILE.read_text() == text
    assert os.listdir(FILE.parent) == ["f"]


def test_a_change_opens_nothing_for_others(appliance):
    FILE.touch()
    FILE.chmod(0o6640)
    trace = Path("/var/trace")
    client = appliance.command(CLIENT, "set", FILE, "key", "value")
    signal = "inject=flock:error=EINTR:when=1"
    run(*STRACE, "-o", trace, "-e", "%file,flock", "-e", signal, *client)
    assert FILE.read_text() == 'key="value"\n'
    assert oct(FILE.stat().st_mode) == "0o106640"
    calls = re.findall(r'^\w+\(.*"/var/.*', trace.read_text(), re.M)
    # Who may write the directory can put a link in place of the new file.
    new = [call for call in calls if f"{FILE}.tmp." in call]
    assert len(new) == 2 and "O_EXCL" in new[0] and "rename" in new[1], new
    # A child that inherits a descriptor keeps its lock.
    inherited = [c for c in calls if "open" in c and "O_CLOEXEC" not in c]
    assert inherited == []


def test_a_log_that_stays_locked_loses_a_line_and_holds_nobody(appliance):
    no_time_passes = [*STRACE, "-e", "inject=/nanosleep:retval=0"]
    client = appliance.command(CLIENT, "get", "/missing/f", "key")
    with appliance.log_file.open("w") as log:
        fcntl.flock(log, fcntl.LOCK_SH)
        assert run(*no_time_passes, *client).returncode == 1
    assert appliance.log() == []
