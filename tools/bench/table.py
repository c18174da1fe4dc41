"""What is measured, beside what, and what it may cost."""

from typing import NamedTuple, Optional


class Cost(NamedTuple):
    """What one more run costs, however many migrations there are."""

    calls: int  # to the system
    syncs: int
    instructions: int  # with 5 % of room, for other versions of compiler and libraries


class Row(NamedTuple):
    """The workload's figure (wall, memory or syncs) is at most goal times the peer's."""

    workload: str
    figure: str = ""
    peer: str = ""
    goal: float = 0
    budget: Optional[Cost] = None


ROWS = [
    Row("upgrade of 100 cameras", "wall", "one sqlite3", 1.5),
    Row("upgrade of 100 cameras", "wall", "script", 0.2),
    Row("upgrade of 10000 cameras", "wall", "one sqlite3", 1.05),
    Row("upgrade of 10000 cameras", "wall", "script", 0.8),
    Row("upgrade of 10000 cameras", "syncs", "one sqlite3", 1),
    Row("upgrade of 200000 cameras", "wall", "one sqlite3", 1),
    Row("upgrade of 200000 cameras", "wall", "script", 1),
    Row("upgrade of 200000 cameras", "memory", "one sqlite3", 1),
    Row("preview of 200000 cameras", "wall", "upgrade", 1.5),
    Row("preview of 200000 cameras", "memory", "64 MiB", 1),
    Row("10000 unchanged capability files", "wall", "grep -c", 4),
    Row("2000 changed capability files", "wall", "sed -i", 1),
    Row("one database action", budget=Cost(196, 12, 1850000)),
    Row("one capability-file action", budget=Cost(194, 18, 229400)),
    Row("KiPrintf", "wall", "system calls", 1.3, Cost(7, 0, 7800)),
    Row("HttpBase64Encode", "wall", "OpenSSL", 1.3, Cost(0, 0, 52500)),
    Row("urlEncoding", "wall", "libcurl", 1, Cost(0, 0, 141400)),
    Row("KiFileGetVal", "wall", "libinih", 1, Cost(15, 0, 390000)),
    Row("KiFileGetAllKeyVals", "wall", "libinih", 1, Cost(15, 0, 1139000)),
    Row("KiFileSetVals", "wall", "GKeyFile", 1, Cost(26, 0, 1478000)),
]
