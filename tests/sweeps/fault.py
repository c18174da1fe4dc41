"""Lets each system call fail with each error that it can have, and each allocation of short runs.

What lasts in reality (a full disk, one that cannot be written, no descriptors left) lasts from the
failed call on: its error has a plus. The tool must neither crash nor hang. When it ends with 0,
everything is done but what it may ignore, which is listed. When it ends with 255, actions are
missing, whole or from one of their transactions on, and the log says so.
"""

import re
import signal
import subprocess
from pathlib import Path

import appliance
from appliance import TARGET, Wrong

ERRORS = [  # the first that matches
    (r"open.*(O_CREAT|O_RDWR)", "EIO EINTR ENOMEM EMFILE+ ENOSPC+ EROFS+"),
    (r"open", "EIO EINTR ENOMEM EMFILE+"),
    (r"p?read(64)?\(", "EIO EINTR"),
    (r"p?write", "EIO EINTR ENOSPC+"),
    (r"f(data)?sync", "EIO EINTR ENOSPC EROFS"),
    (r"rename|unlink", "EIO ENOMEM ENOSPC+ EROFS+"),
    (r"flock|fcntl.*(RD|WR)LCK", "EIO EINTR EAGAIN ENOMEM"),
    (r"fchown|fchmod|ftruncate", "EIO EINTR EROFS"),
    (r"mmap", "EAGAIN ENOMEM"),
    (r"[a-z]*stat|readlink|getdents", "EIO ENOMEM"),
]
ABOUT = [("lock", "flock|.*WRLCK"), ("log", ".*camveld.log"), ("caps", ".*KICap|readlink")]
SHORT_RUNS = [("2427",), ("--updateCap", str(TARGET / appliance.CAPS))]
PRELOADED = "build/release/failing_malloc.so"


def about(line):
    return next((what for what, pattern in ABOUT if re.match(pattern, line)), "rows")


class Sweep:
    def __init__(self, target):
        self.appliance = target
        target.learn_failures()
        source = Path(__file__).parent / "failing_malloc.cpp"
        subprocess.run(["c++", "-shared", "-fPIC", source, "-o", PRELOADED], check=True)

    def cases(self):
        started = False
        for call in self.appliance.calls:
            started = started or "camveld.log" in call.line  # the loader's calls come before
            errors = next((errors for what, errors in ERRORS if re.match(what, call.line)), "")
            for error in errors.split() if started else ():
                what = about(call.line)
                yield f"{call.name} {call.number} {error} {what}", what == "caps"
        for kind, arguments in enumerate(SHORT_RUNS):
            for number in range(1, self.allocations(kind) + 1):
                yield f"allocation {kind} {number}", False

    def check(self, case):
        if case.startswith("allocation"):
            return self.check_allocation(case)
        name, number, error, what = case.split()
        lasts = "+" if error.endswith("+") else ""
        status, left = self.appliance.disturbed(
            (name, number + lasts), "error=" + error.rstrip("+")
        )
        injected = "INJECTED" in Path("/var/trace").read_text()
        log = appliance.LOG.read_text() if appliance.LOG.exists() else ""
        now = self.appliance.check(left, temporary=False)
        if not injected:
            # How often a capability file is looked at depends on how long ago it was replaced.
            self.ignore("the call did not come", what == "caps" and status == 0)
        elif what == "lock" and error == "EAGAIN" and status != 0:
            raise Wrong("does not wait for a lock")
        if status == 0:
            self.check_success(what, lasts, now, left, log)
        elif status != 255:
            raise Wrong(f"ended with {status}")
        elif (
            not lasts and now != self.appliance.steps[-1] and not re.search(r"error\.$", log, re.M)
        ):
            raise Wrong("actions are missing, and the log does not say so")

    def check_success(self, what, lasts, now, left, log):
        if now != self.appliance.steps[-1]:
            raise Wrong("ended with 0 and other rows")
        files = appliance.capability_files
        if files(left) != files(self.appliance.end):
            self.ignore("a capability file or directory cannot be used", what == "caps" or lasts)
        if "version: 0\n" not in log:
            self.ignore("a log line cannot be written", what == "log")

    def ignore(self, failure, may):
        if not may:
            raise Wrong(f"ended with 0, but {failure}")
        self.appliance.notes.append(f"ignored: {failure}")

    def allocations(self, kind):
        """How many a short run has."""
        self.write_before(kind)
        command = [*self.failing(0), appliance.TOOL, *SHORT_RUNS[kind]]
        return int(subprocess.run(command, check=True, capture_output=True, text=True).stderr)

    def write_before(self, kind):
        """Writes the disk that a short run goes on from: it may leave what a run from 0 may."""
        target = self.appliance
        caps = appliance.capability_files(target.start)
        appliance.write_disk({**target.end, **caps} if kind else target.before_last(3))

    def failing(self, number):
        return ["env", f"LD_PRELOAD={PRELOADED}", f"FAILING_ALLOCATION={number}"]

    def check_allocation(self, case):
        _, kind, number = case.split()
        self.write_before(int(kind))
        status = appliance.run(*SHORT_RUNS[int(kind)], under=self.failing(number))
        if status not in (0, 255, -signal.SIGABRT):
            raise Wrong(f"ended with {status}")
        self.appliance.notes.append(f"a failed allocation, and status {status}")
        self.appliance.check(appliance.read_disk())
