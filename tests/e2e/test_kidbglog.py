"""kidbglog on an appliance with shared memory, settings and log of its own."""

import ctypes
import fcntl
import os
import re
import shlex
import struct
import subprocess
import threading
import time
from pathlib import Path
from subprocess import DEVNULL, Popen

import pytest
from conftest import CLIENT, KIDBGLOG, SOURCE, STRACE, run

LIBC = ctypes.CDLL(None)
LIBC.shmat.restype = ctypes.c_void_p


@pytest.fixture
def kidbglog(appliance):
    Path("/var/packages/Camveld/etc").mkdir()

    def run_kidbglog(arguments):
        """Returns status and output."""
        command = appliance.command(KIDBGLOG, *shlex.split(arguments))
        ended = run("timeout", "20", *command)
        return f"{ended.returncode} {ended.stdout}".strip()

    return run_kidbglog


def logs(appliance):
    """Returns whether a process goes on logging."""
    time.sleep(0.1)  # a line may be on its way
    appliance.log_file.write_text("")
    time.sleep(0.3)
    return appliance.log_file.read_text() != ""


def test_a_running_process_logs_what_is_set(appliance, kidbglog):
    kidbglog("create")
    client = appliance.command(CLIENT, "loop", "38", "5")
    with Popen(client, stdout=DEVNULL) as process:
        assert not logs(appliance)
        for command, expected in [
            ("set utils,rtsp-server debug", True),
            ("set all 3", False),
            (f"pid {process.pid} 7", True),
            (f"pid {process.pid} clear", False),
        ]:
            assert kidbglog(command) == "0"
            assert logs(appliance) == expected, command
        process.terminate()


def test_saved_settings_come_back_and_show_tells_what_differs(kidbglog):
    for command in "create", "set db,87 debug2", "ms on", "save":
        assert kidbglog(command) == "0"
    definitions = (SOURCE / "libkimodule/lib/logcateg.def").read_text()
    total = definitions.count("\nLOG_CATEG_ENTRY(")
    for back in "load", "create":
        kidbglog("set all alarm")
        assert kidbglog("show").count("): alarm") == total
        kidbglog("ms off")
        assert kidbglog(back) == "0"
        assert kidbglog("") == (
            "0 category 65 (db): debug2\n"
            "category 87 (mobile): debug2\n"
            "other categories: notice\n"
            "milliseconds: on"
        )
    every = kidbglog("show --all")
    assert every.count("category ") == total and "other" not in every


def make_segment(size):
    """Returns its id."""
    flags = 0o1600  # IPC_CREAT, for this user only
    return LIBC.shmget(0x18180004, size, flags)


def test_a_full_table_loses_only_the_processes_that_are_gone(kidbglog):
    # Number and entries of the table: process, level.
    table = struct.pack("=i", 64) + struct.pack("=ii", 1, 7) * 63
    table += struct.pack("=ii", 4194305, 7)
    segment = LIBC.shmat(make_segment(2568), None, 0)
    ctypes.memmove(segment + 2052, table, len(table))
    assert "process 4194305, gone: debug3" in kidbglog("show")
    assert kidbglog(f"pid {os.getpid()} info") == (
        "0 the table of processes was full: "
        "cleared process 4194305, which is gone"
    )
    comm = Path("/proc/self/comm")
    name = comm.read_text()
    comm.write_text("a\x1bb")  # would control the terminal
    assert f"process {os.getpid()} (a?b): info" in kidbglog("show")
    comm.write_text(name)
    assert kidbglog(f"pid {os.getppid()} info").startswith(
        "1 kidbglog: the table of processes is full"
    )


def test_changes_wait_for_each_other_and_show_for_none(kidbglog, appliance):
    kidbglog("create")
    directory = os.open("/var/packages/Camveld", os.O_RDONLY)
    fcntl.flock(directory, fcntl.LOCK_SH)
    no_time_passes = [*STRACE, "-e", "inject=/nanosleep:retval=0"]
    held = "another command has held the lock on /var/packages/Camveld"
    refusal = f"kidbglog: {held} for 10 seconds"
    changes = "set db 3", "pid 1 clear", "ms on", "create", "load", "save"
    for command, expected in [
        ("show", "all categories: notice"),
        *((change, refusal) for change in changes),
    ]:
        words = appliance.command(KIDBGLOG, *command.split())
        said = run(*no_time_passes, *words).stdout
        assert said.startswith(expected), f"{command}: {said}"
    os.close(directory)


def test_create_takes_a_larger_segment_and_opens_it_to_all(kidbglog):
    make_segment(3000)
    assert kidbglog("create") == "0"
    segments = run("ipcs", "--shmems").stdout
    assert re.search(r"0x18180004 .* 666 +3000 ", segments), segments


def test_settings_that_cannot_be_used_are_named(kidbglog):
    settings = Path("/var/packages/Camveld/etc/settings.conf")
    kidbglog("create")
    settings.unlink()
    os.mkfifo(settings)
    for command in "create", "load", "save":
        refusal = f"1 kidbglog: {settings} is not a regular file"
        assert kidbglog(command) == refusal
    settings.unlink()
    settings.symlink_to(settings)
    refusal = f"1 kidbglog: created with the defaults, cannot read {settings}"
    assert kidbglog("create").startswith(refusal)
    settings.unlink()
    settings.parent.rmdir()
    assert kidbglog("create") == "0"
    refusal = f"1 kidbglog: cannot write {settings}: No such file"
    assert kidbglog("save").startswith(refusal)


def test_only_a_process_gets_a_threshold(kidbglog):
    kidbglog("create")
    stop = threading.Event()
    thread = threading.Thread(target=stop.wait, daemon=True)
    thread.start()
    for number in thread.native_id, 4194305:
        refusal = f"1 kidbglog: there is no process {number}"
        assert kidbglog(f"pid {number} info") == refusal
    stop.set()
    thread.join()
    assert "process" not in kidbglog("show")


@pytest.mark.parametrize("command", ["--help", "--version", "show"])
def test_output_that_is_lost_is_a_failure(kidbglog, appliance, command):
    kidbglog("create")
    words = appliance.command(KIDBGLOG, command)
    with open("/dev/full", "w") as full:
        assert subprocess.run(words, stdout=full).returncode == 1


MESSAGES = [
    # size of the segment, if there is one; command; status and message
    (0, "show", "1 cannot attach the configuration: there is none"),
    (100, "show", "1 the segment has 100 bytes, not 2568"),
    (100, "create", "1 there is a segment of 100 bytes already, 2568 are"),
    (2568, "load", "1 nothing loaded from /var/packages/Camveld/etc/"),
    (2568, "pid 1 clear", "1 process 1 has no threshold of its own"),
    (2568, "pid 1x 7", "2 not a process id: '1x'"),
    (2568, "ms maybe", "2 milliseconds are on or off, not 'maybe'"),
    (0, "set db,RTPS debug", "2 no category 'RTPS', the nearest is 'rtp'"),
    (0, "create --all", "2 wrong arguments for 'create', see"),
    (0, "'show --all'", "2 no command 'show --all', see"),
    (0, "set utils, debug", "2 no category '', see"),
    (0, "set utils warning", "2 no level 'warning', the nearest is 'warn'"),
]


@pytest.mark.parametrize("size, command, message", MESSAGES)
def test_messages(appliance, kidbglog, size, command, message):
    if size:
        make_segment(size)
    assert kidbglog(command).startswith(message.replace(" ", " kidbglog: ", 1))
