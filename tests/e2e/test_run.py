"""What a whole run does to the machine, and beside other processes."""

import re
import shutil
import sqlite3
import subprocess
import threading
from contextlib import closing

import pytest
from conftest import SOURCE, TEMPORARY_FILE, Appliance

WRITES = re.compile(
    r"\bopen\w*\(.*O_(WRONLY|RDWR|CREAT)"
    r"|\b(rename|unlink|link|symlink|mkdir|mknod|truncate|chmod|chown)\w*\("
)


def test_a_run_writes_only_its_files(example):
    # They change twice in one transaction: what may have to be undone stays in memory.
    rows = ", ".join(["('FOSCAM', 'R4', '2048x1536', '2048x1536')"] * 300)
    example.sql(f"INSERT INTO camera (vendor, model, resolution, live_resolution) VALUES {rows}")
    trace = example.directory / "trace"
    assert example.upgrade(0, under=["strace", "-f", "-e", "%file", "-o", trace]).status == 0
    lines = [line for line in trace.read_text().splitlines() if WRITES.search(line)]
    written = {re.search('"([^"]+)"', line)[1] for line in lines}
    assert {path for path in written if not path.startswith("/tmp/tsan")} == {
        "/var/log/camveld/camveld.log",
        f"/var/packages/Camveld/target/@camveld/@KICapInfo/{TEMPORARY_FILE}",
        f"{example.database}",
        f"{example.database}-journal",
    }


def test_valgrind_finds_nothing(example):
    if example.sanitizers or example.emulator:
        pytest.skip("Valgrind runs neither sanitized nor foreign programs")
    valgrind = ["valgrind", "-q", "--error-exitcode=99", "--leak-check=full"]
    result = example.upgrade(0, under=valgrind)
    assert (result.status, result.output) == (0, "")


def count_up(database, ended, counts):
    """Changes another column of the same rows, as the recorder does, until it is told to end."""
    with closing(sqlite3.connect(database, timeout=60, isolation_level=None)) as recorder:
        while not ended.wait(0.02):
            recorder.execute("UPDATE camera SET update_time = ifnull(update_time, 0) + 1")
            counts.append(len(counts) + 1)


def left_behind(appliance):
    appliance.sql("UPDATE camera SET update_time = NULL")
    outputs = "SELECT cam_id, type, idx, name, count(*) FROM camdeviceoutput GROUP BY 1, 2, 3, 4"
    rows = appliance.sql("SELECT * FROM camera") + appliance.sql(outputs)
    return rows, appliance.capability_texts()


@pytest.mark.parametrize("mode", ["delete", "wal"])
def test_two_runs_beside_the_recorder_do_what_one_after_the_other_does(example, mode):
    twin = Appliance(example.directory / "twin", example.build)
    shutil.copy(example.database, twin.database)
    shutil.copytree(example.caps, twin.caps, dirs_exist_ok=True)
    assert [twin.upgrade(0).status, twin.upgrade(0).status] == [0, 0]

    example.sql(f"PRAGMA journal_mode = {mode}")
    # Long enough for each capability file that both are at work on the same.
    slow = ["strace", "-f", "-o", "/dev/null", "-e", "inject=rename:delay_enter=100000"]
    tool = ([] if example.emulator else slow) + example.command("tesselupgrader", 0)
    names = "SELECT group_concat(vendor || model || fov) FROM camera"
    ended, counts = threading.Event(), []
    other = threading.Thread(target=count_up, args=[example.database, ended, counts])
    with closing(sqlite3.connect(example.database, isolation_level=None)) as reader:
        if mode == "wal":  # a transaction keeps what was there when it began
            reader.execute("BEGIN")
        before = reader.execute(names).fetchone()
        other.start()
        both = example.inside("sh", "-c", '"$@" & "$@" && wait $!', "sh", *tool)
        ended.set()
        other.join()
        assert both.returncode == 0, both.stdout
        assert (reader.execute(names).fetchone() == before) == (mode == "wal")
    assert example.sql("SELECT DISTINCT update_time FROM camera") == [(counts[-1],)]
    assert left_behind(example) == left_behind(twin)


def test_the_tool_runs_in_a_bare_root_with_little_memory(example):
    """The root holds the tool, libc and the loader: no locale, /usr, /tmp or /proc."""
    if not example.emulator:
        pytest.skip("only a build for the appliance has its libraries")
    root = example.directory / "root"
    target = root / "var/packages/Camveld/target"
    shutil.copytree(example.directory / "@camveld", target / "@camveld")
    shutil.copy(example.database, target)
    libraries = [f"arm-linux-gnueabihf/lib{name}.so.6" for name in "cm"]
    for name in (f"lib/{library}" for library in ["ld-linux-armhf.so.3", *libraries]):
        (root / name).parent.mkdir(parents=True, exist_ok=True)
        shutil.copy(SOURCE / "build/armhf-sysroot" / name, root / name)
    shutil.copy(shutil.which("qemu-arm-static"), root / "emulator")
    shutil.copy(example.build / "main/tesselupgrader", root)
    (root / "var/log/camveld").mkdir(parents=True)
    # Of 256 MB of data the emulator takes more than 128 for itself.
    for megabytes, works in [(128, False), (256, True)]:
        limit = ["prlimit", f"--data={megabytes << 20}", "env", "-i", shutil.which("chroot"), root]
        ended = subprocess.run([*limit, "/emulator", "/tesselupgrader", "0"], capture_output=True)
        assert (ended.returncode == 0) == works, ended.stderr
    assert example.upgrade(0).status == 0
    assert (target / "system.db").read_bytes() == example.database.read_bytes()
    files = target / "@camveld/@KICapInfo"
    assert {path.name: path.read_text() for path in files.iterdir()} == example.capability_texts()


def test_both_processors_share_one_configuration(example):
    if not example.emulator:
        pytest.skip("only a build for the appliance has a second processor")
    here, library = example.directory / "client", SOURCE / "libkimodule/lib"
    sources = [SOURCE / "tests/unit/client.cpp", *library.glob("*.cpp")]
    subprocess.run(["c++", "-std=c++17", f"-I{library}", *sources, "-o", here], check=True)
    contents, shown = [], []
    for writer, reader in [
        ([here], example.command("client")),
        (example.command("client"), [here]),
    ]:
        file = example.directory / f"written-by-{len(shown)}"
        subprocess.run([*writer, "fill", file], check=True)
        contents.append(file.read_bytes())
        shown.append(subprocess.check_output([*reader, "show", file]))
    assert contents[0] == contents[1] and len(contents[0]) == 2568
    assert shown[0] == shown[1]
