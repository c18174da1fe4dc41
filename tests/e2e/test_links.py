"""What the documents and man pages name exists: files, paths of the appliance, options."""

import re
import subprocess

import pytest
from conftest import SOURCE

TRACKED = subprocess.check_output(["git", "ls-files"], cwd=SOURCE, text=True).split()
PAGES = [name for name in TRACKED if re.fullmatch(r"docs/\w[\w-]*\.8", name)]
DOCUMENTS = [name for name in TRACKED if name.endswith(".md")]
CODE = re.compile(r"(main|libkimodule|platform|preview|tools)/.*\.(cpp|h)|tools/private-\w+")
SOURCES = "".join((SOURCE / name).read_text() for name in TRACKED if CODE.fullmatch(name))


def text_of(name):
    return (SOURCE / name).read_text().replace("\\-", "-").replace("\\&", "")


@pytest.mark.parametrize("document", DOCUMENTS)
def test_links_and_scripts_exist(document):
    text = text_of(document)
    names = [
        (SOURCE / document).parent / link for link in re.findall(r"\]\(([^):#]+)[^):]*\)", text)
    ]
    named = r"(?<![\w./-])(?:scripts|tools|examples|docs|tests|packaging)/[\w./-]*\w"
    names += [SOURCE / name for name in re.findall(named, text)]
    names = [name for name in names if name.parent.name != "KICapInfo"]  # a reader's new file
    missing = [name for name in names if not name.exists()]
    assert not missing


@pytest.mark.parametrize("name", DOCUMENTS + PAGES)
def test_paths_of_the_appliance_are_the_codes(name):
    paths = re.findall(r"(?<![\w\"./])/var/[\w./@-]*\w", text_of(name))
    known = re.findall(
        r"/var/[\w./@-]*\w", SOURCES + (SOURCE / "examples/installer-postinst").read_text()
    )
    wrong = [path for path in paths if not any(f"{one}/".startswith(f"{path}/") for one in known)]
    assert not wrong


@pytest.mark.parametrize("program", ["kidbglog", "tessel-preview"])
def test_page_and_help_name_the_same_options(appliance, program):
    helped = appliance.inside(*appliance.command(program, "--help")).stdout
    options = r"(?<!\w)--[a-z]+"
    in_page = set(re.findall(options, text_of(f"docs/{program}.8")))
    in_page -= {"--follow"}  # patch has it
    assert set(re.findall(options, helped)) <= in_page
    for option in in_page:
        refused = appliance.inside(*appliance.command(program, option)).stdout
        assert "unrecognized" not in refused and "invalid option" not in refused


@pytest.mark.parametrize("document", DOCUMENTS)
def test_documented_options_of_the_preview_exist(appliance, document):
    helped = appliance.inside(*appliance.command("tessel-preview", "--help")).stdout
    for command in re.findall(r"tessel-preview +(--[^`\n]*)", text_of(document)):
        for option in re.findall(r"--[a-z]+", command.split("#")[0]):
            assert option in helped, command
