"""The appliance's disk, and a model of what a power cut leaves of it."""

import ast
import itertools
import re
import shutil
from functools import lru_cache, partial
from pathlib import Path
from typing import NamedTuple

TARGET = Path("/var/packages/Camveld/target")
CAPS = "@camveld/@KICapInfo"
LOG = Path("/var/log/camveld/camveld.log")
SECTOR = 512
LATEST = 16  # of more unsynced changes, the earlier ones are all there or none
LAST = re.compile(r"(?:.*, (\d+)\) += )?")
STRING = re.compile(r'"(?:[^"\\]|\\.)*"')
NAME = re.compile(rf'[<"]{TARGET}/?([^>"]*)[>"]')


class File(NamedTuple):
    content: bytes
    mode: int


def read_disk():
    paths = [path for path in TARGET.rglob("*") if path.is_file()]
    files = [File(path.read_bytes(), path.stat().st_mode & 0o7777) for path in paths]
    return {str(path.relative_to(TARGET)): file for path, file in zip(paths, files)}


def write_disk(disk):
    shutil.rmtree(TARGET, ignore_errors=True)
    LOG.unlink(missing_ok=True)
    LOG.parent.mkdir(parents=True, exist_ok=True)
    (TARGET / CAPS).mkdir(parents=True)
    for name, file in disk.items():
        (TARGET / name).write_bytes(file.content)
        (TARGET / name).chmod(file.mode)


def model(disk):
    """The state: files (stable, and changes) and names (stable, and after each change)."""
    files = tuple((file, ()) for file in disk.values())
    return files, ({name: number for number, name in enumerate(disk)},)


def cut_disks(files, listings):
    """What a power cut may leave, each file on its own; first, everything is there."""
    for names in reversed(listings):
        for chosen in itertools.product(*(versions(*files[number]) for number in names.values())):
            yield dict(zip(names, chosen))


@lru_cache(maxsize=64)
def versions(stable, pending):
    """All, none, each, all but one of the changes, or all and the last one torn."""
    choices = [pending, ()]
    for place in range(max(0, len(pending) - LATEST), len(pending)):
        choices += [pending[place : place + 1], pending[:place] + pending[place + 1 :]]
    if pending and isinstance(pending[-1], partial):
        offset, data = pending[-1].args
        ends = range(SECTOR - offset % SECTOR, len(data), SECTOR)
        choices += [(*pending[:-1], partial(write, offset, data[:end])) for end in ends]
    return list(dict.fromkeys(changed(stable, choice) for choice in choices))


def changed(file, changes):
    for change in changes:
        file = change(file)
    return file


def write(offset, data, file):
    before = file.content[:offset].ljust(offset, b"\0")
    after = file.content[offset + len(data) :]
    return file._replace(content=before + data + after)


def replay(state, line):
    """The state after a traced call."""
    files, listings = state
    found = NAME.findall(line)
    if not found or "-shm" in found[0] or " = -1 " in line:
        return state
    value = LAST.search(line)[1]
    value = int(value, 8 if value.startswith("0") else 10) if value else None
    names = dict(listings[-1])
    number = names.get(found[0], len(files))
    stable, pending = files[number] if found[0] in names else (None, ())
    match line.split("(")[0]:
        case "rename":
            names[found[1]] = names.pop(found[0])
        case "unlink":
            del names[found[0]]
        case "openat" if "O_CREAT" in line and found[0] not in names:
            names[found[0]] = number
            stable = File(b"", value & ~0o022)
        case "fsync" | "fdatasync" if found[0] not in names:
            # A directory; as the journal of a file system, it stores the names of all of them.
            return files, listings[-1:]
        case "fsync" | "fdatasync":
            stable, pending = changed(stable, pending), ()
        case "pwrite64":
            pending += (partial(write, value, written(line)),)
        case "write":  # only new files are written without an offset
            offset = len(changed(stable, pending).content)
            pending += (partial(write, offset, written(line)),)
        case "ftruncate":
            pending += (lambda file: file._replace(content=file.content[:value]),)
        case "fchmod" | "chmod":
            pending += (lambda file: file._replace(mode=value),)
        case _:
            return state
    files = (*files[:number], (stable, pending), *files[number + 1 :])
    return files, listings if names == listings[-1] else (*listings, names)


def written(line):
    return ast.literal_eval("b" + STRING.search(line)[0])
