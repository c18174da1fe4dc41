"""What is measured, beside what, and what it costs."""

from typing import NamedTuple

SIZES = {100: 21, 1000: 15, 10000: 11, 200000: 7}  # cameras: upgrades


class Row(NamedTuple):
    workload: str
    figure: str = ""  # wall, memory or syncs
    peer: str = ""
    goal: float = 0  # the most that it may be, in figures of the peer
    calls: int = 0  # to the system, of doing it once more
    instructions: int = 0  # within 5 %, as other compilers and libraries take


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
    Row("10000 unchanged capability files", "wall", "grep -c", 2),
    Row("2000 changed capability files", "wall", "sed -i", 1),
    Row("one database action", calls=205, instructions=1966000),
    Row("one capability-file action", calls=194, instructions=234800),
    Row("KiPrintf", "wall", "system calls", 1.3, 7, 7700),
    Row("HttpBase64Encode", "wall", "OpenSSL", 1.3, 0, 51300),
    Row("KiFileSetVals", "wall", "GKeyFile", 1, 24, 1478000),
]
