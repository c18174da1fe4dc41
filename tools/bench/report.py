"""Says what was measured or counted, in docs/performance.* or on the terminal."""

import json
import os
import re

from matplotlib import pyplot

from .table import ROWS, SIZES
from .workloads import ROOT, count

# Pictures are the same whoever makes them, and when.
METADATA = dict.fromkeys(["Creator", "Date", "Format", "Type"])
DOCS = ROOT / "docs"


def plot_upgrades(found):
    figure, axes = pyplot.subplots(figsize=(7, 4.5), layout="tight")
    for way in "ours", "one sqlite3", "script":
        walls = [found[f"upgrade of {size} cameras"][way]["wall"] for size in SIZES]
        axes.loglog(list(SIZES), walls, marker="o", label=way.replace("ours", "tesselupgrader"))
    axes.set(xlabel="cameras, of which 30 % change", ylabel="seconds")
    axes.legend()
    figure.savefig(DOCS / "performance-upgrade.svg", metadata=METADATA)


def plot_calls(ratios):
    figure, axes = pyplot.subplots(figsize=(7, 2.5), layout="tight")
    calls = {f"{row.workload} / {row.peer}": ratios[row] for row in ratios if row.instructions}
    axes.barh(list(calls), list(calls.values()))
    axes.axvline(1, color="black")
    axes.invert_yaxis()
    axes.set(xlabel="time of the library's call / time of the other")
    figure.savefig(DOCS / "performance-calls.svg", metadata=METADATA)


def write(found):
    """Writes the figures of each workload, and the ratios that the table has goals for."""
    processor = re.search(r"model name\s*: (.*)", open("/proc/cpuinfo").read())[1]
    table = f"Measured on {os.cpu_count()} cores ({processor}).\n\n"
    table += "| What | Figure | Beside | Ratio | Goal | |\n| --- | --- | --- | --: | --: | --- |"
    ratios = {}
    for row in filter(lambda row: row.peer, ROWS):
        ways = found[row.workload]
        ratios[row] = ways["ours"][row.figure] / ways[row.peer][row.figure]
        verdict = "met" if ratios[row] <= row.goal else "missed"
        table += f"\n| {' | '.join(row[:3])} | {ratios[row]:.3f} | {row.goal} | {verdict} |"
    print(table)

    page = DOCS / "performance.md"
    measured = re.compile("(?<=## Measured\n\n).*?(?=\n\n## )", re.DOTALL)
    page.write_text(measured.sub(lambda _: table, page.read_text()))
    (DOCS / "performance.json").write_text(json.dumps(found, indent=1) + "\n")
    plot_upgrades(found)
    plot_calls(ratios)


def check():
    """Prints what is counted. Returns whether all keep to their budgets."""
    all_good = True
    for row in filter(lambda row: row.instructions, ROWS):
        calls, instructions = count(row.workload)
        good = calls.total() <= row.calls and instructions <= row.instructions * 1.05
        verdict = "OK" if good else f"over the budget of {row}: {dict(calls)}"
        print(f"{row.workload}: {calls.total()} calls, {instructions} instructions: {verdict}")
        all_good = all_good and good
    return all_good
