"""kidbglog, on a machine whose shared memory, settings and log are its own."""

import os
import time
from subprocess import DEVNULL, Popen

import pytest

SETTINGS = "/var/packages/Camveld/etc/settings.conf"
SHMGET = "import ctypes; exit(ctypes.CDLL(None).shmget(0x18180004, {}, 0o1000 | 0o{}) < 0)"


@pytest.fixture
def kidbglog(appliance):
    appliance.inside("mkdir", "/var/packages/Camveld/etc")

    def run(arguments, under=()):
        """Returns status and output."""
        command = appliance.command("kidbglog", *arguments.split())
        ended = appliance.inside(*under, *command)
        return f"{ended.returncode} {ended.stdout}".strip()

    return run


def logs(appliance):
    """Returns whether a process goes on logging."""
    time.sleep(0.1)  # a line may be on its way
    appliance.log_file.write_text("")
    time.sleep(0.3)
    return appliance.log_file.read_text() != ""


def test_a_running_process_logs_what_is_set(appliance, kidbglog):
    kidbglog("create")
    command = [*appliance.enter, *appliance.command("client", "loop", "38", "5")]
    with Popen(command, stdout=DEVNULL) as client:
        assert not logs(appliance)
        for command, expected in [
            ("set utils,rtsp-server debug", True),
            ("set all 3", False),
            (f"pid {client.pid} 7", True),
            (f"pid {client.pid} clear", False),
        ]:
            assert kidbglog(command) == "0"
            assert logs(appliance) == expected, command
        client.kill()


def test_saved_settings_come_back_and_show_tells_what_differs(kidbglog):
    kidbglog("create")
    kidbglog("set db,87 debug2")
    kidbglog("ms on")
    kidbglog("save")
    for back in ("load", "create"):
        kidbglog("set all alarm")
        kidbglog("ms off")
        assert kidbglog(back) == "0"
        assert kidbglog("") == (
            "0 category 65 (db): debug2\ncategory 87 (mobile): debug2\n"
            "other categories: notice\nmilliseconds: on"
        )


MESSAGES = [
    # size and mode of a segment, if there is one; command; status and message
    ("", "show", "1 cannot attach the configuration: there is none, 'kidbglog create' creates it"),
    ("100 666", "show", "1 the segment has 100 bytes, not 2568"),
    ("2568 644", "user show", "1 cannot attach the configuration: Permission denied"),
    ("2568 666", "user save", f"1 cannot write {SETTINGS}: Permission denied"),
    ("2568 666", "load", f"1 nothing loaded from {SETTINGS}: it holds no saved settings"),
    ("2568 666", "pid 4194305 info", "1 there is no process 4194305"),
    ("2568 666", "pid 1 clear", "1 process 1 has no threshold of its own"),
    ("", "set rtps debug", "2 no category 'rtps', the nearest is 'rtp'"),
    ("", "set utils warning", "2 no level 'warning', the nearest is 'warn'"),
    ("", "set utils", "2 wrong arguments for 'set', see 'kidbglog --help'"),
    ("", "sow", "2 no command 'sow', see 'kidbglog --help'"),
]


@pytest.mark.parametrize("segment, command, message", MESSAGES)
def test_messages(appliance, kidbglog, segment, command, message):
    user = []
    if command.startswith("user "):
        user = ["setpriv", "--reuid=65534", "--clear-groups"]
        if os.getuid() != 0 or appliance.emulator:
            pytest.skip("takes root, and a user who may read the emulator's script")
    if segment:
        appliance.inside("python3", "-c", SHMGET.format(*segment.split()))
    ended = kidbglog(command.replace("user ", ""), user)
    assert ended == message.replace(" ", " kidbglog: ", 1)
