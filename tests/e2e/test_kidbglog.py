"""kidbglog, on a machine whose shared memory, settings and log are its own."""

import os
import time
from concurrent.futures import ThreadPoolExecutor
from subprocess import PIPE, STDOUT, Popen

import pytest
from conftest import SOURCE

ROOT = os.getuid() == 0
SETTINGS = "/var/packages/Camveld/etc/settings.conf"
SHMGET = "import ctypes; exit(ctypes.CDLL(None).shmget(0x18180004, {}, 0o1000 | 0o{}) < 0)"


class Machine:
    """Keeps the private namespaces of an appliance for several commands."""

    def __init__(self, appliance):
        self.appliance = appliance
        self.processes = []
        self.enter = [SOURCE / "tools/private-appliance", appliance.directory]
        keeper = self.start("sh", "-c", "mkdir /var/packages/Camveld/etc; echo; exec sleep 300")
        keeper.stdout.readline()
        namespaces = [] if ROOT else ["--user", "--preserve-credentials"]
        self.enter = ["nsenter", f"--target={keeper.pid}", "--mount", "--ipc", *namespaces]

    def start(self, *command):
        self.processes.append(Popen([*self.enter, *command], stdout=PIPE, stderr=STDOUT))
        return self.processes[-1]

    def kidbglog(self, arguments, under=()):
        command = [*under, *self.appliance.command("kidbglog", *arguments.split())]
        process = self.start(*command)
        output = process.communicate()[0].decode()
        return f"{process.returncode} {output}".strip()

    def new_lines(self):
        """Returns what is logged while a client writes some lines."""
        time.sleep(0.1)  # a line may be on its way
        log = self.appliance.log_file
        log.write_text("")
        time.sleep(0.3)
        return log.read_text().splitlines()


@pytest.fixture
def machine(appliance):
    machine = Machine(appliance)
    yield machine
    for process in machine.processes:
        process.kill()
        process.wait()
        process.stdout.close()


def test_a_running_process_logs_what_is_set(machine):
    machine.kidbglog("create")
    client = machine.start(*machine.appliance.command("client", "loop", "38", "5"))
    assert not machine.new_lines()
    for command, logs in [
        ("set utils,rtsp-server debug", True),
        ("set all 3", False),
        (f"pid {client.pid} 7", True),
        (f"pid {client.pid} clear", False),
    ]:
        assert machine.kidbglog(command) == "0"
        assert bool(machine.new_lines()) == logs, command
    machine.kidbglog("set 38 debug")
    machine.kidbglog("ms on")
    assert "." in machine.new_lines()[-1].split(" [")[0]


def test_saved_settings_come_back_and_show_tells_what_differs(machine):
    machine.kidbglog("create")
    machine.kidbglog("set db,87 debug2")
    machine.kidbglog("ms on")
    machine.kidbglog("save")
    for back in ("load", "create"):
        machine.kidbglog("set all alarm")
        machine.kidbglog("ms off")
        assert machine.kidbglog(back) == "0"
        categories = (
            "category 65 (db): debug2\ncategory 87 (mobile): debug2\nother categories: notice"
        )
        assert machine.kidbglog("") == f"0 {categories}\nmilliseconds: on"


def test_of_65_commands_at_once_64_set_a_process_and_one_says_the_table_is_full(machine):
    machine.kidbglog("create")
    sleepers = [machine.start("sleep", "300") for _ in range(65)]
    with ThreadPoolExecutor(8) as pool:
        ended = list(pool.map(lambda it: machine.kidbglog(f"pid {it.pid} info"), sleepers))
    full = "1 kidbglog: the table of processes is full, 'kidbglog pid PID clear' makes room"
    assert sorted(ended) == ["0"] * 64 + [full]
    sleepers[ended.index("0")].kill()
    sleepers[ended.index("0")].wait()
    shown = machine.kidbglog("show")
    assert (shown.count(" (sleep): info\n"), shown.count(", gone: info\n")) == (63, 1)


# Size and mode of a segment, if there is one; command; status and message.
MESSAGES = [
    ("", "show", "1 cannot attach the configuration: there is none, 'kidbglog create' creates it"),
    ("100 666", "show", "1 the segment has 100 bytes, not 2568"),
    ("4096 666", "create", "1 there is a segment of 4096 bytes already, not of 2568"),
    ("2568 644", "user show", "1 cannot attach the configuration: Permission denied"),
    ("2568 666", "user set all info", "0"),
    ("2568 666", "user save", f"1 cannot write {SETTINGS}: Permission denied"),
    ("2568 666", "load", f"1 nothing loaded from {SETTINGS}: it holds no saved settings"),
    ("2568 666", "pid 4194305 info", "1 there is no process 4194305"),
    ("2568 666", "pid 1 clear", "1 process 1 has no threshold of its own"),
    ("", "pid 1x clear", "2 not a process id: '1x'"),
    ("", "set rtps debug", "2 no category 'rtps', the nearest is 'rtp'"),
    ("", "set utils,88 debug", "2 no category '88', see 'kidbglog --help'"),
    ("", "set utils warning", "2 no level 'warning', the nearest is 'warn'"),
    ("", "ms yes", "2 milliseconds are on or off, not 'yes'"),
    ("", "set utils", "2 wrong arguments for 'set', see 'kidbglog --help'"),
    ("", "sow", "2 no command 'sow', see 'kidbglog --help'"),
]


@pytest.mark.parametrize("segment, command, message", MESSAGES)
def test_messages(machine, segment, command, message):
    user = []
    if command.startswith("user "):
        user = ["setpriv", "--reuid=65534", "--clear-groups"]
        if not ROOT or machine.appliance.emulator:
            pytest.skip("takes root, and a user who may read the emulator's script")
    if segment:
        machine.start("python3", "-c", SHMGET.format(*segment.split())).wait()
    ended = machine.kidbglog(command.replace("user ", ""), user)
    assert ended == message.replace(" ", " kidbglog: ", 1)
