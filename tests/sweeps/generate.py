"""Generates databases of many kinds, and changes of their rows."""

import sqlite3
from contextlib import suppress
from pathlib import Path
from random import Random

NUMBERS = [
    *(
        0,
        1,
        7,
        2**53 + 1,
        2**63 - 1,
        -(2**63),
        -(2.0**63),
        1.0,
        0.1 + 0.2,
    ),
    *(1e300 / 7, 5e-324, float("inf"), float("-inf")),
]
# Bytes of text. Some are neither UTF-8 nor UTF-16.
TEXTS = [
    *(
        b"",
        b"a",
        b"A",
        b"b ",
        b"b",
        b"1\0002\0",
        b"12",
        b"a\0b",
        b"'\"{i}\x1b",
    ),
    *(b"\0\xd8\x61\0", b"\xff\xfe\x41\0", b"\xc3", b"z" * 3000),
]
KEYS = [
    *("id", "id INTEGER PRIMARY KEY", "id INTEGER PRIMARY KEY AUTOINCREMENT"),
    *("id PRIMARY KEY", "id TEXT COLLATE NOCASE PRIMARY KEY"),
    *("id INTEGER PRIMARY KEY DESC", "id, PRIMARY KEY (id, c0 DESC)"),
]
ENDS_OF_WITHOUT_ROWID = [
    *("PRIMARY KEY (id)", "PRIMARY KEY (c0, id DESC)"),
    "PRIMARY KEY (id COLLATE NOCASE, c1)",
]
TYPES = [
    "",
    "INTEGER",
    "TEXT",
    "REAL",
    "BLOB",
    "NUMERIC",
    "TEXT COLLATE RTRIM",
]
STRICT_TYPES = ["ANY", "INTEGER", "TEXT", "REAL", "BLOB"]
CONSTRAINTS = [
    *("", "", "", "UNIQUE", "UNIQUE ON CONFLICT REPLACE", "CHECK ({} <> 7)"),
    *("NOT NULL ON CONFLICT REPLACE DEFAULT 'x'", "REFERENCES {}"),
    *("REFERENCES {} ON UPDATE CASCADE ON DELETE SET NULL", "DEFAULT 5"),
]
GENERATED = ["", "", "AS (c0 || 'x')", "AS (typeof(c1)) STORED"]
INDEXES = [
    *("INDEX ix{0} ON t{0} (c0)", "INDEX ix{0} ON t{0} (c0) WHERE c1 > 0"),
    "UNIQUE INDEX ix{0} ON t{0} (typeof(c0), c0, hex(c1))",
]
TRIGGERS = """
    CREATE TRIGGER tr{0} AFTER UPDATE ON camera BEGIN
      UPDATE OR IGNORE t{0} SET c0 = new.resolution, c1 = new.id
        WHERE (SELECT count(*) FROM t{0}) % 5 = new.id % 5;
      INSERT OR IGNORE INTO t{0} (id, c0) VALUES (new.id, new.model);
    END;
    CREATE TRIGGER del{0} AFTER DELETE ON t{0} BEGIN
      UPDATE camera SET update_time = old.c0 WHERE id = old.id + 1;
    END;
    CREATE TRIGGER ins{0} AFTER INSERT ON t{0} BEGIN
      UPDATE camera SET channel = new.c1 WHERE id = new.id;
    END"""


class Database:
    """A database with tables t0, t1, ... and the cameras of the example."""

    def __init__(self, path, seed, plain):
        self.random = Random(seed)
        # What sqldiff takes for equal does not occur in a plain one.
        self.numbers = NUMBERS[:6] if plain else NUMBERS
        self.texts = TEXTS[1:2] + TEXTS[4:5] if plain else TEXTS
        self.plain = plain
        self.db = sqlite3.connect(path, isolation_level=None)
        self.db.create_function("chance", 1, self.chance)
        choice = self.random.choice
        self.db.execute(f"PRAGMA page_size = {choice([512, 4096, 65536])}")
        encoding = choice(["UTF-8", "UTF-8", "UTF-16le", "UTF-16be"])
        self.db.execute(f"PRAGMA encoding = '{encoding}'")
        self.db.execute(f"PRAGMA journal_mode = {choice(['delete', 'wal'])}")
        cameras = Path("examples/appliance.sql").read_text()
        self.db.executescript(f"BEGIN; {cameras}; COMMIT; BEGIN")
        self.tables = range(choice([1, 2, 3]))
        for number in self.tables:
            self.create(number)
        for _ in range(40):
            self.insert(choice(self.tables))
        self.run("COMMIT")

    def chance(self, probability):
        return self.random.random() < probability

    def create(self, number):
        choice = self.random.choice
        strict, without_rowid = self.chance(0.2), self.chance(0.3)
        types = STRICT_TYPES if strict else TYPES
        parent = f"t{choice(self.tables)}"
        columns = [
            f"c{i} {choice(types)} {choice(CONSTRAINTS)}"
            for i in range(choice([2, 3, 5]))
        ]
        columns = [c.format(parent if "REF" in c else c[:2]) for c in columns]
        if generated := choice(GENERATED):
            columns.append(f"g {'TEXT' if strict else ''} {generated}")
        key, *rest = choice(KEYS).split(", ", 1)
        if without_rowid or strict:
            key = "id ANY" if strict else "id"
            rest = [choice(ENDS_OF_WITHOUT_ROWID)] if without_rowid else []
        options = ["STRICT"] * strict + ["WITHOUT ROWID"] * without_rowid
        body = ", ".join([key, *columns, *rest])
        if self.plain:
            body = body.replace("COLLATE NOCASE", "").replace(
                "RTRIM", "BINARY"
            )
        self.db.execute(f"CREATE TABLE t{number} ({body}) {','.join(options)}")
        with suppress(sqlite3.Error):
            self.db.execute(f"CREATE {choice(INDEXES)}".format(number))
        if self.chance(0.5):
            for trigger in TRIGGERS.format(number).split("END;"):
                self.db.execute(trigger.removesuffix("END") + "END")

    def value(self):
        """An expression, and its parameters."""
        kind = self.random.choice("nnnttb0")
        if kind == "n":
            small = self.random.randrange(30)
            return "?", [self.random.choice([*self.numbers, small, small])]
        if kind == "0":
            return ("99" if self.plain else "NULL"), []
        text = "CAST(? AS TEXT)" if kind == "t" else "?"
        return text, [self.random.choice(self.texts)]

    def run(self, sql, parameters=()):
        with suppress(sqlite3.Error):
            self.db.execute(sql, parameters)

    def insert(self, table):
        values = [self.value() for _ in range(3)]
        marks = ", ".join(mark for mark, _ in values)
        parameters = [value for _, some in values for value in some]
        self.run(
            f"INSERT INTO t{table} (id, c0, c1) VALUES ({marks})", parameters
        )

    def update(self, table):
        column = self.random.choice(["id", "c0", "c1", "c1"])
        value, parameters = self.value()
        if self.chance(0.3) and not self.plain:
            # Only types and bytes tell these from what was there.
            same = self.random.choice(["upper({})", "trim({})", "{} + 0.0"])
            value, parameters = same.format(column), []
        sql = f"UPDATE t{table} SET {column} = {value} WHERE chance(0.15)"
        self.run(sql, parameters)

    def exchange(self, table):
        """Two rows change a value that may be unique."""
        rows = (
            f"SELECT c0 FROM t{table} WHERE c0 NOT NULL ORDER BY chance(0.5)"
        )
        with suppress(sqlite3.Error, ValueError):
            (first,), (second,) = self.db.execute(rows + " LIMIT 2").fetchall()
            for old, new in [(first, -99), (second, first), (-99, second)]:
                self.run(
                    f"UPDATE t{table} SET c0 = ? WHERE c0 = ?", [new, old]
                )

    def delete(self, table):
        self.run(f"DELETE FROM t{table} WHERE chance(0.07)")

    def change(self, count):
        """What a tool or a recorder does to the tables."""
        on = self.random.choice(["ON", "OFF"])
        self.db.execute(f"PRAGMA foreign_keys = {on}")
        self.db.execute("BEGIN")
        ways = [
            self.insert,
            self.update,
            self.update,
            self.exchange,
            self.delete,
        ]
        for _ in range(count):
            self.random.choice(ways)(self.random.choice(self.tables))
        self.run("COMMIT")
