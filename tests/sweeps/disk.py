"""A model of a disk: what a power cut can leave of what a recorded run has written."""

import functools
import itertools
from typing import NamedTuple

from appliance import TARGET, File

CALLS = "write,pwrite64,ftruncate,chown,chmod,fchown,fchmod,fsync,fdatasync,rename,unlink"
TRACE = ["-xx", "-s", "1000000", f"--trace=openat,close,{CALLS}"]
SECTOR = 512
# Of more unsynced writes, the earlier ones are all there or none.
LATEST = 16
# More disks than an upgrade that syncs can leave at one moment.
MOST = 1000


class Write(NamedTuple):
    offset: int
    data: bytes


class Node(NamedTuple):
    """A file, whatever its names: what is on stable storage, and the changes since."""

    stable: File
    pending: tuple = ()  # of Write, of a size, or of new fields of File


class Directory(NamedTuple):
    stable: dict  # the number of a node by its name
    pending: tuple = ()  # changes of it, each at once; None for a name that goes

    def after(self, changes):
        entries = dict(self.stable)
        for change in self.pending[:changes]:
            entries.update(change)
        return {name: node for name, node in entries.items() if node is not None}


def changed(file, operations):
    content = bytearray(file.content)
    for operation in operations:
        if isinstance(operation, Write):
            end = operation.offset + len(operation.data)
            content.extend(bytes(max(0, end - len(content))))
            content[operation.offset : end] = operation.data
        elif isinstance(operation, int):
            content[operation:] = bytes(max(0, operation - len(content)))
        else:
            file = file._replace(**dict(operation))
    return file._replace(content=bytes(content))


def tears(write):
    """The beginnings of a write that end where a sector does."""
    if not isinstance(write, Write):
        return []
    ends = range(SECTOR - write.offset % SECTOR, len(write.data), SECTOR)
    return [Write(write.offset, write.data[:end]) for end in ends]


@functools.lru_cache(maxsize=64)
def versions(node):
    """What may be there: none, all, each one, all but one of the changes, or one of them torn.

    The newest is torn at each sector, the others at one.
    """
    done = node.pending
    choices = [(), done]
    for place in range(max(0, len(done) - LATEST), len(done)):
        before, after = done[:place], done[place + 1 :]
        choices += [(done[place],), before + after]
        torn = tears(done[place])
        if after:
            torn = torn[len(torn) // 2 :][:1]
        choices += [(*before, part, *after) for part in torn]
    return list(dict.fromkeys(changed(node.stable, choice) for choice in choices))


def cut_disks(nodes, directories):
    """The disks that a power cut may leave, each file and directory independent of the others."""
    orders = [range(len(directory.pending) + 1) for directory in directories]
    for lengths in itertools.product(*orders):
        entries = {}
        for directory, length in zip(directories, lengths):
            entries.update(directory.after(length))
        choices = itertools.product(*(versions(nodes[node]) for node in entries.values()))
        for files in itertools.islice(choices, MOST):
            yield dict(zip(entries, files))


class Model:
    def __init__(self, disk):
        self.nodes = list(map(Node, disk.values()))
        self.directories = {}  # by its name, which is empty or ends with a slash
        for number, name in enumerate(disk):
            place = self.directories.setdefault(directory_of(name), Directory({}))
            place.stable[name] = number
        self.open = {}  # by descriptor: the number of a node, or the name of a directory
        self.offsets = {}

    def state(self):
        """What cut_disks needs, as it is now."""
        return tuple(self.nodes), tuple(self.directories.values())

    def live(self):
        entries = {}
        for directory in self.directories.values():
            entries.update(directory.after(None))
        return entries

    def is_open(self, name):
        return self.live().get(name) in self.open.values()

    def live_file(self, name):
        number = self.live().get(name)
        return None if number is None else changed(*self.nodes[number])

    def live_disk(self):
        return {name: self.live_file(name) for name in self.live()}

    def replay(self, line):
        """Makes the change of a traced call. Returns whether it makes one."""
        name, rest = line.split("(", 1)
        rest, result = rest.rsplit(" = ", 1)
        arguments = rest.rstrip(" )").split(", ")
        strings = [bytes.fromhex(a[3:-1].replace("\\x", "")) for a in arguments if a[0] == '"']
        numbers = [int(a, 8 if a[0] == "0" else 10) for a in arguments if a.isdigit()]
        if result.startswith("-1"):
            return False
        before = self.state()
        if name == "close":
            self.open.pop(numbers[0], None)
        elif name == "openat":
            self.opened(int(result), name_of(strings[0]), rest, numbers)
        elif name == "rename":
            self.renamed(*map(name_of, strings))
        elif name == "unlink":
            self.unlinked(name_of(strings[0]))
        elif name in ("chown", "chmod"):
            self.change(self.live().get(name_of(strings[0])), status(numbers))
        elif name in ("fsync", "fdatasync"):
            self.synced(self.open.get(numbers[0]), name)
        elif name in ("fchown", "fchmod"):
            self.change(self.open.get(numbers[0]), status(numbers[1:]))
        elif name == "ftruncate":
            self.change(self.open.get(numbers[0]), numbers[1])
        else:
            self.written(numbers, strings[0][: int(result)])
        return before != self.state()

    def opened(self, descriptor, name, flags, numbers):
        self.offsets[descriptor] = 0
        if name is None or name + "/" in self.directories or not name:
            self.open[descriptor] = name and name + "/"
            return
        if name not in self.live():
            self.created(name, numbers[-1])
        number = self.open[descriptor] = self.live()[name]
        if "O_TRUNC" in flags:
            self.change(number, 0)

    def created(self, name, mode):
        self.nodes.append(Node(File(b"", mode & ~0o022, (0, 0))))
        self.change_names({name: len(self.nodes) - 1})

    def renamed(self, old, new):
        if old is not None:
            self.change_names({old: None, new: self.live()[old]})

    def unlinked(self, name):
        if name is not None:
            self.change_names({name: None})

    def change_names(self, change):
        for place in {directory_of(name) for name in change}:
            directory = self.directories[place]
            self.directories[place] = directory._replace(pending=(*directory.pending, change))

    def written(self, numbers, data):
        descriptor = numbers[0]
        offset = numbers[2] if len(numbers) > 2 else self.offsets.get(descriptor)
        if len(numbers) == 2 and descriptor in self.offsets:
            self.offsets[descriptor] += len(data)
        self.change(self.open.get(descriptor), Write(offset, data))

    def change(self, number, operation):
        if isinstance(number, int):
            node = self.nodes[number]
            self.nodes[number] = node._replace(pending=(*node.pending, operation))

    def synced(self, what, call):
        if isinstance(what, str):
            self.directories[what] = Directory(self.directories[what].after(None))
        elif what is not None:
            node = self.nodes[what]
            # Mode and owner are not what fdatasync is for.
            rest = tuple(p for p in node.pending if call == "fdatasync" and is_status(p))
            data = [p for p in node.pending if p not in rest]
            self.nodes[what] = Node(changed(node.stable, data), rest)


def is_status(operation):
    return isinstance(operation, tuple) and not isinstance(operation, Write)


def status(numbers):
    if len(numbers) == 1:
        return (("mode", numbers[0]),)
    return (("owner", tuple(numbers)),)


def directory_of(name):
    return name[: name.rfind("/") + 1]


def name_of(path):
    """The name on the disk, None for what is elsewhere or, like shared memory, made anew."""
    path = path.decode() + "/"
    name = path.removeprefix(f"{TARGET}/").rstrip("/")
    return name if path.startswith(f"{TARGET}/") and not name.endswith("-shm") else None
