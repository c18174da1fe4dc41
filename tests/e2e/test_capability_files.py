"""What the tool makes of capability files, also of strange ones."""

import fcntl
import os
import time

import pytest
from conftest import STRACE
from test_migrations import tables

CAPS = "/var/packages/Camveld/target/@camveld/@KICapInfo"
MARKER = "ptz_continuous_move"
ACTIONS = [name for _, name in tables()[1]]
MOVE, SPEED = ACTIONS[:2]


@pytest.mark.parametrize("marker, status", [("", 0), (f"{MARKER}=yes\n", 255)])
def test_only_the_removal_of_the_marker_has_to_work(
    appliance, syslog, marker, status
):
    file = appliance.capability_file("camera", "pan=yes\n" + marker)
    under = [*STRACE, "-e", "inject=/rename:error=EIO:when=1"]
    appliance.upgrade("--updateCap", CAPS, under=under).must_be(status)
    assert "pan=yes\n" + marker in file.read_text()
    end = "; later files are left alone" if status else ""
    assert syslog()[0] == f"{MOVE}: camera: rename: Input/output error{end}"


def test_without_a_directory_syslog_says_so(syslog, appliance):
    appliance.upgrade("--updateCap", "").must_be(255)
    appliance.upgrade("--updateCap", "/none").must_be(0)
    reasons = [
        "there is no capability directory",
        "/none: No such file or directory",
    ]
    assert syslog() == [
        f"{name}: {reason}" for reason in reasons for name in ACTIONS
    ]


def test_a_directory_of_strange_files(appliance, syslog):
    plain = appliance.capability_file("plain", "pan=yes\n")
    appliance.upgrade("--updateCap", CAPS).must_be(0)
    upgraded = plain.read_bytes()
    assert b"pan= step\n" in upgraded
    # The tool uses 511 bytes of its argument.
    caps = appliance.directory / ("d" * 240) / "e"
    argument = f"/var/packages/Camveld/target/{caps.parent.name}/"
    caps = caps.with_name("e" * (511 - len(argument)))
    caps.mkdir(parents=True)
    outside = appliance.directory / "outside"
    files = [outside, caps / "a", caps / "new\nline", caps / ".hidden"]
    for file in files:
        file.write_text("pan=yes\n")
    (caps / "a").chmod(0o400)
    (caps / "link").symlink_to(outside)
    (caps / "dangling").symlink_to("none")
    (caps / "directory").mkdir()
    os.mkfifo(caps / "fifo")
    binary = bytes(range(11, 256)) * 400 + b"\n"
    (caps / "binary").write_bytes(binary + b"pan=yes\n")
    large = b"pan=yes\n".rjust(2**24 + 1, b"\n")
    (caps / "large").write_bytes(large)
    entries = sorted(os.listdir(caps))

    argument += caps.name + "behind"
    appliance.upgrade("--updateCap", argument).must_be(0)
    for file in files:
        assert file.read_bytes() == upgraded, file
    reason = "large: larger than 16 MiB"
    assert syslog() == [f"{name}: {reason}" for name in ACTIONS]
    assert (caps / "a").stat().st_mode & 0o777 == 0o400
    assert (caps / "binary").read_bytes() == binary + upgraded
    assert (caps / "large").read_bytes() == large, "above 16 MiB, but changed"
    assert (caps / "link").is_symlink()
    assert sorted(os.listdir(caps)) == entries


DISTURBED = [
    # the call that fails once, its error, how many of two files change
    ("read", "EINTR", 2),
    ("fsync", "EINVAL", 2),  # this file system cannot sync directories
    ("fsync", "EIO", 1),
]


@pytest.mark.parametrize("call, error, changed", DISTURBED)
def test_what_a_failed_call_costs(appliance, call, error, changed):
    for name in "ab":
        appliance.capability_file(name, f"{MARKER}=yes\n")
    inject = f"inject={call}:error={error}:when=1"
    under = [*STRACE, "-P", CAPS, "-P", f"{CAPS}/a", "-e", inject]
    result = appliance.upgrade("--updateCap", CAPS, under=under)
    result.must_be(0 if changed == 2 else 255)
    left = appliance.capability_files()
    assert sum(MARKER not in text for text in left.values()) == changed, left


def test_a_run_waits_ten_seconds_for_the_directory(appliance, syslog):
    # Both actions would change both files.
    for name in "ab":
        appliance.capability_file(name, "pan=yes\ntilt=continuous\n")
    files = appliance.capability_files()
    lock = os.open(CAPS, os.O_RDONLY)
    fcntl.flock(lock, fcntl.LOCK_EX)
    start = time.monotonic()
    result = appliance.upgrade("--updateCap", CAPS)
    waited = time.monotonic() - start
    os.close(lock)
    result.must_be(0)
    assert appliance.capability_files() == files
    assert 9 < waited < 19
    left = "Resource temporarily unavailable; later files are left alone"
    for name, record in zip((MOVE, SPEED), syslog()):
        file, reason = record.split(": lock of the directory: ")
        assert (file[:-1], reason) == (f"{name}: ", left)
