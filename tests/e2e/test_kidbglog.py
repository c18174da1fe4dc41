"""kidbglog on an appliance with shared memory, settings and log of its own."""

import ctypes
import fcntl
import os
import re
import struct
import subprocess
import time
from pathlib import Path
from subprocess import DEVNULL, Popen

import pytest
from conftest import CLIENT, KIDBGLOG, SOURCE, STRACE, run

LIBC = ctypes.CDLL(None)
LIBC.shmat.restype = ctypes.c_void_p
SETTINGS = Path("/var/packages/Camveld/etc/settings.conf")


@pytest.fixture
def kidbglog(appliance):
    SETTINGS.parent.mkdir()

    def run_kidbglog(arguments):
        """Returns status and output."""
        command = appliance.command(KIDBGLOG, *arguments.split())
        ended = run("timeout", "20", *command)
        return f"{ended.returncode} {ended.stdout}".strip()

    return run_kidbglog


def test_a_running_process_logs_what_is_set(appliance, kidbglog):
    kidbglog("create")
    client = appliance.command(CLIENT, "loop")
    with Popen(client, stdout=DEVNULL) as process:
        for command, expected in [
            ("show", False),
            ("set utils,rtsp-server debug", True),
            ("set all 3", False),
            (f"pid {process.pid} 7", True),
            (f"pid {process.pid} clear", False),
        ]:
            kidbglog(command)
            time.sleep(0.1)  # a line may be on its way
            appliance.log_file.write_text("")
            time.sleep(0.3)
            assert bool(appliance.log_file.read_text()) == expected, command
        process.terminate()


def test_saved_settings_come_back_and_show_tells_what_differs(kidbglog):
    for command in "create", "set db,87 debug2", "ms on", "save":
        assert kidbglog(command) == "0"
    definitions = (SOURCE / "libkimodule/lib/logcateg.def").read_text()
    total = definitions.count("\nLOG_CATEG_ENTRY(")
    for back in "load", "create":
        kidbglog("set all alarm")
        kidbglog("ms off")
        assert kidbglog(back) == "0"
        assert kidbglog("") == (
            "0 category 65 (db): debug2\n"
            "category 87 (mobile): debug2\n"
            "other categories: notice\n"
            "milliseconds: on"
        )
    names = re.findall(r"category .*\((.*)\): ", kidbglog("show --all"))
    assert len(set(names) - {"unknown"}) == total


def make_segment(size):
    """Makes one for this user only, and returns its id."""
    return LIBC.shmget(0x18180004, size, 0o1600)


def test_the_table_of_processes_loses_only_those_that_are_gone(kidbglog):
    # A larger segment will do, and another program may store any count.
    table = struct.pack("=iii", 2**31 - 1, 4194305, 7)
    table += struct.pack("=ii", 1, 6) * 63
    segment = LIBC.shmat(make_segment(3000), None, 0)
    ctypes.memmove(segment + 2052, table, len(table))
    assert "process 4194305, gone: debug3" in kidbglog("show")
    assert kidbglog(f"pid {os.getpid()} info") == (
        "0 the table of processes was full: "
        "cleared process 4194305, which is gone"
    )
    levels = re.findall(r"process .*: (.*)", kidbglog("show"))
    assert levels == ["debug2"] * 63 + ["info"]
    assert kidbglog(f"pid {os.getppid()} info").startswith(
        "1 kidbglog: the table of processes is full"
    )
    # Numbers beyond those of the categories must not reach the table.
    SETTINGS.write_text("ki_dbglog_settings=" + "3," * 600)
    assert kidbglog("create") == "0"
    refusal = "1 kidbglog: there is no process 4194305"
    assert kidbglog("pid 4194305 info") == refusal
    assert kidbglog("show") == "0 all categories: notice\nmilliseconds: off"
    segments = run("ipcs", "--shmems").stdout
    assert re.search(r"0x18180004 .* 666 +3000 ", segments), segments


def test_changes_wait_for_each_other_and_show_for_none(kidbglog, appliance):
    kidbglog("create")
    directory = os.open("/var/packages/Camveld", os.O_RDONLY)
    fcntl.flock(directory, fcntl.LOCK_SH)
    no_time_passes = [*STRACE, "-e", "inject=/nanosleep:retval=0"]
    held = "another command has held the lock on /var/packages/Camveld"
    for change in "set db 3", "pid 1 clear", "ms on", "create", "load", "save":
        words = appliance.command(KIDBGLOG, *change.split())
        said = run(*no_time_passes, *words).stdout
        assert said == f"kidbglog: {held} for 10 seconds\n", change
    assert kidbglog("show").startswith("0 all categories: notice")
    os.close(directory)


MESSAGES = [
    # size of the segment, or what is done beside the settings; command;
    # status and message
    (0, "show", "1 cannot attach the configuration: there is none"),
    (100, "create", "1 there is a segment of 100 bytes already, 2568 are"),
    (2568, "load", "1 nothing loaded from /var/packages/Camveld/etc/"),
    (2568, "pid 1 clear", "1 process 1 has no threshold of its own"),
    (2568, "pid 1x 7", "2 not a process id: '1x'"),
    (2568, "ms maybe", "2 milliseconds are on or off, not 'maybe'"),
    (2568, "set db,RTPS debug", "2 no category 'RTPS', the nearest is 'rtp'"),
    (2568, "set utils, debug", "2 no category '', see"),
    (2568, "create --all", "2 wrong arguments for 'create', see"),
    ("mkfifo settings.conf", "create", f"1 {SETTINGS} is not a regular file"),
    ("mkfifo settings.conf", "load", f"1 {SETTINGS} is not a regular file"),
    ("mkfifo settings.conf", "save", f"1 {SETTINGS} is not a regular file"),
    ("ln -s settings.conf settings.conf", "create", "1 created with the def"),
    ("rmdir $PWD", "create", "0"),
    ("rmdir $PWD", "save", f"1 cannot write {SETTINGS}: No such file"),
]


@pytest.mark.parametrize("there, command, message", MESSAGES)
def test_messages(kidbglog, there, command, message):
    if isinstance(there, str):
        subprocess.check_call(there, shell=True, cwd=SETTINGS.parent)
        there = 2568
    if there:
        make_segment(there)
    message = message.replace(" ", " kidbglog: ", 1)
    assert kidbglog(command)[: len(message)] == message
