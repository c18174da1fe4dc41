import os

import pytest

CAPS = "/var/packages/Camveld/target/@camveld/@KICapInfo"
TEMPORARY_FILE = ".zamoc.tmp"
KEYS = [
    # version, file before, file after
    (80, "pan=yes\ntilt=continuous\n", "pan=yes\ntilt=continuous\n"),
    (68, "pan=yes\ntilt=continuous\n", "pan=yes\ntilt=continuous\nptz_speed_max = 1\n"),
    (67, "pan=yes\ntilt=continuous\n", "pan= step\ntilt=continuous\nptz_speed_max = 1\n"),
    (0, "ptz_continuous_move=yes\npan=yes\n", "pan= continuous\nptz_speed_max = 1\n"),
    (0, 'zoom="yes"\r\nptz_continuous_move = "yes"\r\n', "zoom= continuous\n"),
    (0, "ptz_continuous_move=Yes\npan=YES\n", "ptz_continuous_move=Yes\npan=YES\n"),
    (0, "tilt=yes\nzoom=yes", "tilt= step\nzoom= step\n"),
    (0, "pan=continuous\nptz_speed_max=7\n", "pan=continuous\nptz_speed_max=7\n"),
    (0, "ptz_speed_max=\npan=continuous\n", "ptz_speed_max = 1\npan=continuous\n"),
]


@pytest.mark.parametrize("version, before, after", KEYS)
def test_keys_change(appliance, version, before, after):
    file = appliance.capability_file("camera", before)
    appliance.upgrade(version)
    assert file.read_bytes().decode() == after


@pytest.mark.parametrize("marker, status", [("", 0), ("ptz_continuous_move=yes\n", 255)])
def test_only_the_removal_of_the_marker_has_to_succeed(appliance, marker, status):
    (appliance.caps / TEMPORARY_FILE).mkdir()
    file = appliance.capability_file("camera", "pan=yes\n" + marker)
    assert appliance.run("--updateCap", CAPS).status == status
    assert file.read_text() == "pan=yes\n" + marker


def test_a_directory_of_strange_files(appliance):
    # The tool uses 511 bytes of its argument.
    parent = "d/" + "e" * 240
    name = "f" * (511 - len(f"/var/packages/Camveld/target/{parent}/"))
    caps = appliance.directory / parent / name
    caps.mkdir(parents=True)
    outside = appliance.directory / "outside"
    files = [outside, caps / "a", caps / "new\nline", caps / ("x" * 255), caps / ".hidden"]
    for file in files:
        file.write_text("pan=yes\n")
    (caps / "a").chmod(0o400)
    binary = bytes(range(11, 256)) * 400 + b"\n"
    (caps / "binary").write_bytes(binary + b"ptz_continuous_move=yes\npan=yes\n")
    (caps / "directory").mkdir()
    os.mkfifo(caps / "fifo")
    (caps / "link").symlink_to(outside)
    (caps / "device").symlink_to("/dev/zero")
    (caps / "dangling").symlink_to("none")
    entries = sorted(os.listdir(caps))

    argument = f"/var/packages/Camveld/target/{parent}/{name}behind"
    assert appliance.run("--updateCap", argument).status == 0
    assert [file.read_text() for file in files] == ["pan= step\n"] * len(files)
    assert (caps / "a").stat().st_mode & 0o777 == 0o400
    assert (caps / "binary").read_bytes() == binary + b"pan= continuous\nptz_speed_max = 1\n"
    assert (caps / "link").is_symlink()
    assert sorted(os.listdir(caps)) == entries


@pytest.mark.parametrize("call", ["%%stat", "openat", "read"])
def test_a_file_that_cannot_be_read_stays_and_the_others_change(appliance, call):
    files = [appliance.capability_file(name, "pan=yes\n") for name in "abc"]
    trace = appliance.directory / "trace"
    inject = f"inject={call}:error=EIO:when=1"
    strace = ["strace", "-f", "-o", trace, "-P", f"{CAPS}/b", "-e", inject]
    assert appliance.run("--updateCap", CAPS, under=strace).status == 0
    assert [file.read_text() for file in files] == ["pan= step\n", "pan=yes\n", "pan= step\n"]
    assert trace.read_text().count("INJECTED") == 1


# EINVAL says that the file system cannot sync directories.
@pytest.mark.parametrize("error, status", [("EINVAL", 0), ("EIO", 255)])
def test_only_a_failed_sync_of_the_directory_stops_the_walk(appliance, error, status):
    files = [appliance.capability_file(name, "ptz_continuous_move=yes\n") for name in "ab"]
    strace = ["strace", "-f", "-o", "/dev/null", "-P", CAPS, "-e", f"inject=fsync:error={error}"]
    assert appliance.run("--updateCap", CAPS, under=strace).status == status
    emptied = [file for file in files if file.read_text() == ""]
    assert len(emptied) == (2 if status == 0 else 1)
