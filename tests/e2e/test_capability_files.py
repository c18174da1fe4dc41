"""What the tool makes of capability files, also of strange ones."""

import fcntl
import os
import shutil
import time
from contextlib import suppress

import pytest
from conftest import STRACE
from test_migrations import tables

CAPS = "/var/packages/Camveld/target/@camveld/@KICapInfo"
ACTIONS = [name for _, name in tables()[1]]
MOVE, SPEED = ACTIONS[:2]
MARKED = "ptz_continuous_move=yes\n"

DISTURBED = [
    # text of a file; call that fails, error, number; status, reason
    # Only the removal of the marker has to work.
    (MARKED, "read EINTR 1", 0, ""),
    (MARKED, "fsync EINVAL 2", 0, ""),  # directories cannot be synced
    (MARKED, "fsync EIO 2", 255, "fsync of the directory"),
    (MARKED, "/rename EIO 1", 255, "rename"),
    ("pan=yes\n", "/rename EIO 1", 0, "rename"),
]


@pytest.mark.parametrize("text, call, status, reason", DISTURBED)
def test_what_a_failed_call_costs(
    appliance, syslog, text, call, status, reason
):
    file = appliance.capability_file("camera", text)
    name, error, number = call.split()
    under = [*STRACE, "-e", f"inject={name}:error={error}:when={number}"]
    for path in CAPS, file, f"{CAPS}/.zamoc.tmp":
        under += ["-P", path]
    appliance.upgrade("--updateCap", CAPS, under=under).must_be(status)
    assert (file.read_text() == text) == (reason == "rename")
    end = "; later files are left alone" if status else ""
    record = f"{MOVE}: camera: {reason}: Input/output error{end}"
    assert syslog() == ([record] if reason else [])


MISSING = [
    # what is missing below the target directory, arguments; status, reason
    ("@camveld/@KICapInfo", [0], 0, f"{CAPS}: No such file or directory"),
    ("@camveld", [0], 255, "there is no capability directory"),
    ("@camveld", ["--updateCap", ""], 255, "there is no capability directory"),
]


@pytest.mark.parametrize("missing, arguments, status, reason", MISSING)
def test_without_a_directory_syslog_says_so(
    example, syslog, missing, arguments, status, reason
):
    shutil.rmtree(example.directory / missing)
    example.upgrade(*arguments).must_be(status)
    assert syslog() == [f"{name}: {reason}" for name in ACTIONS]


STEP = b"pan= step\n"
BINARY = bytes(range(11, 256)) * 400 + b"\na=\0\n"
OTHERS = b"#pan=yes\nPAN=yes\npann=yes\nx=pan\n=pan\npan\n\r\n \n"
LARGE = b"pan=yes\n".ljust(2**24 + 1, b"x")
FILES = {
    # a name, the file's text before and after an upgrade
    "../where a link leads": (b"pan=yes\n", STEP),
    "new\nline": (b"pan=yes\n", STEP),
    ".hidden": (b"pan=yes\n", STEP),
    "binary": (BINARY + b"pan=yes", BINARY + STEP),
    "large": (LARGE, LARGE),
    "others": (OTHERS, OTHERS),
    "twice": (b"pan=yes\na=1\npan=4\n\n pan\t=5", STEP + b"a=1\n\n"),
    "blanks": (b" pan\t=\t yes \t\r\nb=3", STEP + b"b=3"),
    "quoted": (b'pan = "yes"\r\n', STEP),
    "quoted twice": (b'pan=""yes""\n', b'pan=""yes""\n'),
    "one quote": (b'pan="yes.\ntilt=.yes"\n', b'pan="yes.\ntilt=.yes"\n'),
}


def test_a_directory_of_strange_files(appliance, syslog):
    caps = appliance.caps
    for name, (before, _) in FILES.items():
        (caps / name).write_bytes(before)
    with suppress(OSError):  # an ordinary user may not
        os.chown(caps / ".hidden", 12, 34)
    (caps / ".hidden").chmod(0o6440)
    rights = (caps / ".hidden").stat()
    (caps / "link").symlink_to("../where a link leads")
    (caps / "dangling").symlink_to("none")
    (caps / "directory").mkdir()
    os.mkfifo(caps / "fifo")
    entries = sorted(os.listdir(caps))
    (caps / ".zamoc.tmp").write_text("of a killed run")

    appliance.upgrade("--updateCap", CAPS).must_be(0)
    for name, (_, after) in FILES.items():
        assert (caps / name).read_bytes() == after, name
    reason = "large: larger than 16 MiB"
    assert syslog() == [f"{name}: {reason}" for name in ACTIONS]
    now = (caps / ".hidden").stat()
    assert now.st_mode == rights.st_mode
    assert (now.st_uid, now.st_gid) == (rights.st_uid, rights.st_gid), "owner"
    assert (caps / "link").is_symlink()
    assert sorted(os.listdir(caps)) == entries


def test_a_run_waits_ten_seconds_for_the_directory(appliance, syslog):
    text = "pan=yes\ntilt=continuous\n"  # both actions would change it
    file = appliance.capability_file("camera", text)
    lock = os.open(CAPS, os.O_RDONLY)
    fcntl.flock(lock, fcntl.LOCK_EX)
    start = time.monotonic()
    appliance.upgrade("--updateCap", CAPS).must_be(0)
    assert 9 < time.monotonic() - start < 19
    os.close(lock)
    assert file.read_text() == text
    reason = "lock of the directory: Resource temporarily unavailable"
    end = f"camera: {reason}; later files are left alone"
    assert syslog()[:2] == [f"{MOVE}: {end}", f"{SPEED}: {end}"]
