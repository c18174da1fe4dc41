"""The GoogleTest programs, with a test for each of their cases."""

from conftest import SOURCE, Appliance, complain, run
from pytest import skip

# What GoogleTest prints beside failures.
FRAME = "[", "Note: ", "Running main"


def pytest_generate_tests(metafunc):
    build = SOURCE / metafunc.config.getoption("build")
    unit_tests = []
    for path in sorted(build.glob("tests/unit/*_test")):
        program = Appliance(build).command(path)
        suite = ""
        for line in run(*program, "--gtest_list_tests").stdout.splitlines():
            if not line.startswith(" "):
                suite = line
            else:
                unit_tests.append((program, suite + line.strip()))
    names = [f"{program[-1].name}-{case}" for program, case in unit_tests]
    metafunc.parametrize("program, case", unit_tests, ids=names)


def test_unit(program, case):
    private_var = SOURCE / "tools/private-var"
    ended = run(private_var, *program, f"--gtest_filter={case}")
    lines = ended.stdout.splitlines()
    said = [line for line in lines if line and not line.startswith(FRAME)]
    if ended.returncode != 0:
        complain(f"{case} ends with {ended.returncode}", said)
    if any(line.endswith(": Skipped") for line in said):
        skip(said[1])
