"""Makes databases of many kinds, and changes their rows.

generate.py SEED changes rows. The same rows and seed give the same.
"""

import sqlite3
import sys
from contextlib import suppress
from random import Random

import appliance
from appliance import SYSTEM

# The first {} is the name, the second stands for the columns.
TABLES = """
CREATE TABLE {} (id, {})
CREATE TABLE {} (id INTEGER PRIMARY KEY, {})
CREATE TABLE {} (id INTEGER PRIMARY KEY AUTOINCREMENT, {})
CREATE TABLE {} (id INTEGER PRIMARY KEY DESC, {})
CREATE TABLE {} (id PRIMARY KEY, {})
CREATE TABLE {} (id TEXT COLLATE NOCASE PRIMARY KEY, {})
CREATE TABLE {} (id, {}, PRIMARY KEY (id, c0 DESC))
CREATE TABLE {} (id, {}, PRIMARY KEY (id)) WITHOUT ROWID
CREATE TABLE {} (id, {}, PRIMARY KEY (c0, id DESC)) WITHOUT ROWID
CREATE TABLE {} (id, {}, PRIMARY KEY (id COLLATE NOCASE, c1)) WITHOUT ROWID
CREATE TABLE {} (id ANY, c0 ANY UNIQUE, c1 TEXT, g TEXT AS (c0 || 'x')) STRICT
CREATE TABLE {} (id ANY PRIMARY KEY, c0 REAL, c1 ANY) STRICT, WITHOUT ROWID
""".strip().splitlines()
# {} is a table.
COLUMNS = """
c0 COLLATE NOCASE, c1
c0 REAL, c1 TEXT COLLATE NOCASE
c0 UNIQUE, c1 INTEGER, g AS (c0 || 'x')
c0 TEXT COLLATE NOCASE, c1 UNIQUE ON CONFLICT REPLACE
c0 TEXT COLLATE RTRIM, c1 CHECK (c1 <> 7), c2 DEFAULT 5
c0 NOT NULL ON CONFLICT REPLACE DEFAULT 'x', c1, g AS (typeof(c1)) STORED
c0 REFERENCES {}, c1 UNIQUE
c0 UNIQUE, c1 REFERENCES {} ON UPDATE CASCADE ON DELETE SET NULL
""".strip().splitlines()
EXTRAS = """
CREATE INDEX ix_{0} ON {0} (c0)

CREATE INDEX some_{0} ON {0} (c0) WHERE c1 > 0

CREATE UNIQUE INDEX all_{0} ON {0} (typeof(c0), c0, hex(c1))

CREATE TRIGGER up_{0} AFTER UPDATE ON camera BEGIN
  UPDATE OR IGNORE {0} SET c0 = new.resolution, c1 = new.id
    WHERE (SELECT count(*) FROM {0}) % 5 = new.id % 5;
  INSERT OR IGNORE INTO {0} (id, c0) VALUES (new.id, new.model);
END

CREATE TRIGGER del_{0} AFTER DELETE ON {0} BEGIN
  UPDATE camera SET update_time = old.c0 WHERE id = old.id + 1;
END

CREATE TRIGGER ins_{0} AFTER INSERT ON {0} BEGIN
  UPDATE camera SET channel = new.c1 WHERE id = new.id;
END
"""
# The largest integer is missing: after it, SQLite chooses rowids at random.
VALUES = """
NULL 1 1.0 0.1+0.2 1e300/7 5e-324 9e999 -9e999
9007199254740993 4611686018427387905
-9223372036854775808 -9223372036854775808.0
'' 'a' 'A' 'b' 'b'||char(32) '12' char(39,34,27)||'{i}' hex(zeroblob(1500))
x'' x'61' x'6100'
""".split()
# The bytes of texts. Some are neither UTF-8 nor UTF-16.
TEXTS = ["31003200", "61004200", "00d86100", "e0804100", "c328"]
VALUES += [f"CAST(x'{text}' AS TEXT)" for text in TEXTS]
INSERT = "INSERT INTO {t} (id, c0, c1) VALUES ({v}, {w}, {x})"
# Only types and bytes tell what the last four write from what was there.
WAYS = [INSERT, INSERT]
WAYS += """
DELETE FROM {t} WHERE chance(0.1)
UPDATE {t} SET {c} = {v} WHERE chance(0.15)
UPDATE {t} SET {c} = NULL WHERE chance(0.15)
UPDATE OR REPLACE {t} SET {c} = {v} WHERE chance(0.15)
UPDATE OR IGNORE {t} SET {c} = upper({c})
UPDATE OR IGNORE {t} SET {c} = lower({c})
UPDATE OR IGNORE {t} SET {c} = trim({c})
UPDATE OR IGNORE {t} SET {c} = {c} + 0.0
""".strip().splitlines()


class Rows:
    """The rows of the tables t_0, t_1 and t_2, as many as there are."""

    def __init__(self, seed):
        self.random = Random(seed)
        self.db = sqlite3.connect(SYSTEM, isolation_level=None)
        self.db.create_function("chance", 1, self.chance)

    def chance(self, probability):
        return self.random.random() < probability

    def run(self, sql, parameters=()):
        with suppress(sqlite3.Error):
            self.db.execute(sql, parameters)

    def value(self):
        small = str(self.random.randrange(30))
        return self.random.choice([small, self.random.choice(VALUES)])

    def exchange(self, table):
        """Two rows exchange a value that may be unique."""
        sql = f"SELECT c0 FROM {table} WHERE c0 NOT NULL ORDER BY chance(0.5)"
        with suppress(sqlite3.Error, ValueError):
            (first,), (second,) = self.db.execute(sql + " LIMIT 2").fetchall()
            for new, old in [(-99, first), (first, second), (second, -99)]:
                sql = f"UPDATE {table} SET c0 = ? WHERE c0 = ?"
                self.run(sql, [new, old])

    def change(self, count, ways=WAYS):
        """What a tool or a recorder does to the tables."""
        choice = self.random.choice
        tables = "SELECT name FROM sqlite_schema WHERE name GLOB 't_?'"
        tables = [name for name, in self.db.execute(tables)]
        self.db.execute(f"PRAGMA foreign_keys = {choice(['ON', 'OFF'])}")
        self.db.execute("BEGIN")
        for _ in range(count):
            table, column = choice(tables), choice(["id", "c0", "c1"])
            v, w, x = self.value(), self.value(), self.value()
            self.run(choice(ways).format(t=table, c=column, v=v, w=w, x=x))
            if self.chance(0.2):
                self.exchange(table)
        self.run("COMMIT")


def create(seed):
    """Puts the example on the disk, with more tables in its database."""
    choice = Random(seed).choice
    encoding = choice(["UTF-8", "UTF-8", "UTF-16le", "UTF-16be"])
    appliance.create(
        f"page_size = {choice([512, 4096, 65536])}",
        f"encoding = '{encoding}'",
        f"journal_mode = {choice(['delete', 'wal'])}",
    )
    rows = Rows(f"rows {seed}")
    tables = ["t_0", "t_1", "t_2"][: choice([1, 2, 3])]
    for table in tables:
        columns = choice(COLUMNS).format(choice(tables))
        rows.db.execute(choice(TABLES).format(table, columns))
        for extra in EXTRAS.split("\n\n"):
            if rows.chance(0.4):
                rows.db.execute(extra.format(table))
    rows.change(40, [INSERT])
    rows.db.close()


if __name__ == "__main__":
    Rows(sys.argv[1]).change(12)
