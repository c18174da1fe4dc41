"""The example appliance: its disk, its runs, and what they may leave."""

import ast
import re
import shutil
import sqlite3
import subprocess
from collections import Counter
from contextlib import closing
from functools import lru_cache
from itertools import product
from pathlib import Path
from typing import NamedTuple

TARGET = "/var/packages/Camveld/target"
TOOL = ["build/release/sbin/tesselupgrader", "0"]
DATABASE = "system.db"
SYSTEM = f"{TARGET}/{DATABASE}"
CAPS = "@camveld/@KICapInfo"
LOG = Path("/var/log/camveld/camveld.log")
TRACE = Path("/var/trace")
LATEST = 16  # of more unsynced changes, the earlier ones are all there or none


def read_disk():
    paths = list(filter(Path.is_file, Path(TARGET).rglob("*")))
    return {str(p.relative_to(TARGET)): p.read_bytes() for p in paths}


def write_disk(disk, directory=TARGET):
    shutil.rmtree(directory, ignore_errors=True)
    for name, content in disk.items():
        path = Path(directory, name)
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_bytes(content)


class Model(NamedTuple):
    files: dict  # by number: the synced content, and the changes since
    listings: tuple  # numbers by name: when synced, and after each change

    def live(self):
        names = self.listings[-1].items()
        return {name: changed(*self.files[number]) for name, number in names}

    def cuts(self):
        """The disks that a cut may leave. First, everything is there."""
        for names in reversed(self.listings):
            choices = [versions(*self.files[n]) for n in names.values()]
            for contents in product(*choices):
                yield dict(zip(names, contents))

    def after(self, line):
        """The model after a traced call."""
        paths = re.findall(rf'[<"]{TARGET}/?([^>"]*)[>"]', line)
        if not paths or "-shm" in paths[0] or " = -1 " in line:
            return self
        files, names, path = self.files, dict(self.listings[-1]), paths[0]
        moved = line.startswith(("rename", "unlink"))
        assert path in names or not moved, f"not in the model: {line}"
        match line.split("(")[0]:
            case "rename":
                names[paths[1]] = names.pop(path)
            case "unlink":
                del names[path]
            case "openat" if "O_CREAT" in line and path not in names:
                names[path] = len(files)
                files = files | {len(files): (b"", ())}
            case "fsync" | "fdatasync" if path not in names:
                # A directory. As a journal does, it stores all names.
                return Model(files, (names,))
            case call if path in names:
                file = after(*files[names[path]], call, line)
                return Model(files | {names[path]: file}, self.listings)
            case _:
                return self
        return Model(files, (*self.listings, names))


def after(synced, changes, call, line):
    """A file after a traced call. A change is an offset and its data."""
    match call:
        case "fsync" | "fdatasync":
            return changed(synced, changes), ()
        case "write":  # only new files are written without an offset
            offset = len(changed(synced, changes))
        case "pwrite64" | "ftruncate":
            offset = int(re.match(r".*, (\d+)\) += ", line)[1])
        case _:
            return synced, changes
    string = re.search(r'"(?:[^"\\]|\\.)*"', line)
    data = ast.literal_eval("b" + string[0]) if string else b""
    return synced, (*changes, (offset, data))


def changed(content, changes):
    for offset, data in changes:
        before = content[:offset].ljust(offset, b"\0")
        # Without data, the file ends there.
        rest = content[offset + len(data) :] if data else b""
        content = before + data + rest
    return content


@lru_cache(maxsize=64)
def versions(synced, changes):
    """All, none, each, all but one of the changes, or the last one torn."""
    choices = [changes, ()]
    for place in range(max(0, len(changes) - LATEST), len(changes)):
        others = changes[:place] + changes[place + 1 :]
        choices += [changes[place : place + 1], others]
    for offset, data in changes[-1:]:
        ends = range(512 - offset % 512, len(data), 512)  # of sectors
        choices += [(*changes[:-1], (offset, data[:end])) for end in ends]
    return list(dict.fromkeys(changed(synced, choice) for choice in choices))


def run(disk, *command):
    """Runs a command on a disk. Returns its status and the disk it leaves."""
    write_disk(disk)
    LOG.parent.mkdir(parents=True, exist_ok=True)
    LOG.unlink(missing_ok=True)
    done = subprocess.run(command, capture_output=True, timeout=60)
    return done.returncode, read_disk()


def rows(disk):
    """The database as lines of SQL, without the counters of ids."""
    write_disk(disk, "/var/copy")
    with closing(sqlite3.connect(f"/var/copy/{DATABASE}")) as database:
        integrity = database.execute("PRAGMA integrity_check").fetchall()
        assert integrity == [("ok",)], f"the database is damaged: {integrity}"
        dump = database.iterdump()
        return tuple(line for line in dump if "sqlite_sequence" not in line)


def different(disk, other):
    """The names of the files that differ, or that one of them lacks."""
    return {name for name, _ in disk.items() ^ other.items()}


def capabilities(disk):
    return {name: disk[name] for name in disk if name.startswith(CAPS)}


def create(*settings):
    """Puts the example on the disk, with settings of its database."""
    write_disk({})
    shutil.copytree("examples/KICapInfo", f"{TARGET}/{CAPS}")
    with closing(sqlite3.connect(SYSTEM)) as db:
        for setting in settings:
            db.execute(f"PRAGMA {setting}")
        script = Path("examples/appliance.sql").read_text()
        db.executescript(f"BEGIN; {script}; COMMIT")
    return read_disk()


class Call(NamedTuple):
    name: str  # and its number among the calls of this name, from 1
    line: str
    disk: Model  # after the call
    step: int  # the last step before it


class Recording:
    """A run of a command on a disk, and what it may leave if disturbed."""

    def __init__(self, start, *command):
        self.start, self.command = start, command
        strace = ["strace", "-qq", "-y", "-s", "1000000", "-o", TRACE]
        status, end = run(start, *strace, *command)
        assert status == 0, f"{command} ended with {status}"
        self.calls = []
        self.steps = [rows(start)]  # the rows after each transaction
        self.failures = []  # the rows after one failed transaction
        self.versions = set(capabilities(start).items())
        files = {n: (content, ()) for n, content in enumerate(start.values())}
        model, count = Model(files, (dict(zip(start, files)),)), Counter()
        for line in TRACE.read_text().splitlines():
            model = model.after(line)
            if re.match(f"close.*/{DATABASE}>", line):
                now = rows(model.live())
                self.steps += [now] if now != self.steps[-1] else []
            if re.match(f'openat.*/{CAPS}", .*O_NONBLOCK|exit_group', line):
                self.versions.update(capabilities(model.live()).items())
            name = line.split("(")[0]
            count[name] += 1
            name, step = f"{name} {count[name]}", len(self.steps) - 1
            self.calls.append(Call(name, line, model, step))
        self.end = model.live()
        assert self.end.items() <= end.items(), "the model is wrong"

    def changes(self):
        """The calls that can change something."""
        change = "p?write|ftrunc|f(data)?sync|fch|rename|unlink|open.*O_CREAT"
        return [call for call in self.calls if re.match(change, call.line)]

    def disturb(self, call, what):
        """Disturbs a call or, with a plus, all from there."""
        name, number = call.name.split()
        # The filter is faster, but signals do not come through it.
        fast = [] if "signal" in what else ["--seccomp-bpf", "-f"]
        when = number + ("+" if what.endswith("+") else "")
        inject = f"--inject={name}:{what.rstrip('+')}:when={when}"
        strace = ["strace", *fast, "-o", TRACE, f"--trace={name}", inject]
        status, left = run(self.start, *strace, *self.command)
        came = status == -9 or "INJECTED" in TRACE.read_text()
        assert came, "the call did not come"
        return status, left

    def check(self, left):
        """Rows and files are whole, and a next run makes up. Returns rows."""
        now = rows(left)
        whole = now in self.steps or now in self.failures
        near = min((set(step) ^ set(now) for step in self.steps), key=len)
        assert whole, f"no whole number of transactions: {list(near)[:4]}"
        parts = capabilities(left).items() - self.versions
        parts = {name for name, _ in parts} & self.start.keys()
        assert not parts, f"neither an old nor a new version: {parts}"
        status, end = run(left, *self.command)
        assert status == 0, "the next run fails"
        # UpdateAxisA8105E adds its rows each time. After a failed action,
        # UpdatePanasoniciPro2Panasonic renames that action's cameras.
        known = "DO 2" if now in self.steps else "DO 2|Panasonic"
        other = set(rows(end)) ^ set(self.steps[-1])
        other = [line for line in other if not re.search(known, line)]
        assert not other, f"the next run comes to other rows: {other[:4]}"
        other = different(end, self.end) - {DATABASE}
        assert not other, f"the next run comes to other files: {other}"
        return now

    def check_kill(self, call):
        self.check(self.disturb(call, "signal=KILL")[1])
