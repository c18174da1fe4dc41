"""Says what was measured, in docs/performance.*, or counted."""

import json
import os
import re

from matplotlib import pyplot

from .table import ROWS, SIZES
from .workloads import ROOT, count

DOCS = ROOT / "docs"
# Pictures are the same whoever makes them, and when.
METADATA = dict.fromkeys(["Creator", "Date", "Format", "Type"])


def plot_upgrades(found):
    figure, axes = pyplot.subplots(figsize=(7, 4.5), layout="tight")
    for way in "ours", "one sqlite3", "script":
        walls = [found[f"upgrade of {n} cameras"][way]["wall"] for n in SIZES]
        label = way.replace("ours", "tesselupgrader")
        axes.loglog(list(SIZES), walls, marker="o", label=label)
    axes.set(xlabel="cameras, of which 30 % change", ylabel="seconds")
    axes.legend()
    figure.savefig(DOCS / "performance-upgrade.svg", metadata=METADATA)


def plot_calls(ratios):
    figure, axes = pyplot.subplots(figsize=(7, 2.5), layout="tight")
    axes.barh(list(ratios), list(ratios.values()))
    axes.axvline(1, color="black")
    axes.invert_yaxis()
    axes.set(xlabel="time of the library's call / time of the other")
    figure.savefig(DOCS / "performance-calls.svg", metadata=METADATA)


def write(found):
    """Writes the figures, and the ratios that the table has goals for."""
    cpu = re.search(r"model name\s*: (.*)", open("/proc/cpuinfo").read())[1]
    table = f"Measured on {os.cpu_count()} cores ({cpu}).\n\n"
    table += "| What | Figure | Beside | Ratio | Goal | |\n"
    table += "| --- | --- | --- | --: | --: | --- |"
    calls = {}
    for row in filter(lambda row: row.peer, ROWS):
        ways = found[row.workload]
        ratio = ways["ours"][row.figure] / ways[row.peer][row.figure]
        verdict = "met" if ratio <= row.goal else "missed"
        if row.instructions:
            calls[f"{row.workload} / {row.peer}"] = ratio
        what = " | ".join(row[:3])
        table += f"\n| {what} | {ratio:.3f} | {row.goal} | {verdict} |"
    page = DOCS / "performance.md"
    measured = re.compile("(?s)(?<=## Measured\n\n).*?(?=\n\n## )")
    page.write_text(measured.sub(lambda _: table, page.read_text()))
    (DOCS / "performance.json").write_text(json.dumps(found, indent=1) + "\n")
    plot_upgrades(found)
    plot_calls(calls)


def check():
    """Prints what is counted. Returns whether all is as the table says."""
    good = True
    for row in filter(lambda row: row.instructions, ROWS):
        calls, instructions = count(row.workload)
        counted = f"calls={calls.total()}, instructions={instructions}"
        print(f"{row.workload}: {counted}")
        deviation = instructions / row.instructions - 1
        if calls.total() != row.calls or abs(deviation) > 0.05:
            expected = f"calls={row.calls}, instructions={row.instructions}"
            print(f"  but tools/bench/table.py says {expected}: {dict(calls)}")
            good = False
    return good
