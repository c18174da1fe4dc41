"""docs/migrations.md names every action of the tool, at its threshold and in its place."""

import re
import shlex
import subprocess

import pytest
from conftest import SOURCE

ROW = re.compile(r"^\| (\d+) \| `(\w+)` \|", re.M)


@pytest.mark.parametrize("below", [1, 0])
def test_the_page_lists_what_the_tool_runs(appliance, below):
    if appliance.sanitizers or appliance.emulator:
        pytest.skip("the page is compared with the release build, which is fast")
    page = (SOURCE / "docs/migrations.md").read_text()
    cameras, files = (ROW.findall(part) for part in page.split("## Capability files"))
    tool = appliance.directory / "tool"
    tool.write_text(f'#!/bin/sh\nexec {shlex.join(appliance.command("tesselupgrader"))} "$@"\n')
    tool.chmod(0o755)

    def listed(version):
        command = appliance.command("tessel-preview", "--tool", tool, "--list", version)
        return subprocess.run(command, capture_output=True, text=True, check=True).stdout

    def expected(version):
        lines = [name for threshold, name in cameras if int(threshold) > version]
        number = sum(int(threshold) > version for threshold, _ in files)
        if number > 0:
            lines.append(f"{number} capability-file actions, which log no names")
        return "".join(line + "\n" for line in lines)

    for version in sorted({int(threshold) - below for threshold, _ in cameras + files}):
        assert listed(version) == expected(version), f"an upgrade from {version}"
