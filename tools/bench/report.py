"""Says what was measured or counted, in docs/performance.* or on the terminal."""

import json
import os
import re
import sqlite3
import sys

import matplotlib.pyplot

from .inputs import ROOT
from .table import ROWS
from .workloads import SIZES

DOCS = ROOT / "docs"


def measured_table(ratios):
    """Returns the table in Markdown, below what it was measured on."""
    model = re.search(r"^model name\s*: (.*)", open("/proc/cpuinfo").read(), re.M)[1]
    lines = [
        f"Measured on {os.cpu_count()} cores ({model}) with SQLite {sqlite3.sqlite_version}.\n",
        "| What | Figure | Beside | Ratio | Goal | |",
        "| --- | --- | --- | --: | --: | --- |",
    ]
    for row, ratio in ratios.items():
        verdict = "met" if ratio <= row.goal else "missed"
        lines.append(f"| {' | '.join(row[:3])} | {ratio:.3f} | {row.goal} | {verdict} |")
    return "\n".join(lines)


def save_plot(figure, name):
    figure.tight_layout()
    figure.savefig(DOCS / name, metadata={"Date": None})


def plot_upgrades(found):
    figure, axes = matplotlib.pyplot.subplots(figsize=(7, 4.5))
    for way in found["upgrade of 100 cameras"]:
        walls = [found[f"upgrade of {count} cameras"][way]["wall"] for count in SIZES]
        axes.loglog(list(SIZES), walls, marker="o", label=way.replace("ours", "tesselupgrader"))
    axes.set(xlabel="cameras, of which 30 % change", ylabel="seconds")
    axes.legend()
    save_plot(figure, "performance-upgrade.svg")


def plot_calls(ratios):
    figure, axes = matplotlib.pyplot.subplots(figsize=(7, 3.5))
    calls = {f"{row.workload} / {row.peer}": ratios[row] for row in ratios if row.budget}
    axes.barh(list(calls), list(calls.values()))
    axes.axvline(1, color="black")
    axes.invert_yaxis()
    axes.set(xlabel="time of the library's call / time of the other")
    save_plot(figure, "performance-calls.svg")


def write(found):
    ratios = {}
    for row in ROWS:
        if row.peer and row.workload in found:
            ways = found[row.workload]
            ratios[row] = ways["ours"][row.figure] / ways[row.peer][row.figure]
    table = measured_table(ratios)
    page = DOCS / "performance.md"
    section = re.compile(r"(?<=^## Measured\n\n).*?(?=\n\n## )", re.S | re.M)
    page.write_text(section.sub(lambda _: table, page.read_text()))
    (DOCS / "performance.json").write_text(json.dumps(found, indent=1) + "\n")
    plot_upgrades(found)
    plot_calls(ratios)
    print(table)


def check(costs):
    """Prints what is counted. Returns whether all keep to their budgets."""
    good = True
    for row, cost, calls in costs:
        print(f"{row.workload}: {cost}")
        room = row.budget._replace(instructions=row.budget.instructions * 1.05)
        if any(counted > allowed for counted, allowed in zip(cost, room)):
            print(f"bench: {row.workload}: over {row.budget}: {dict(calls)}", file=sys.stderr)
            good = False
    return good
