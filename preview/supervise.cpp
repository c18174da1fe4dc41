#include "supervise.h"

#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "failure.h"

namespace {

// Blocks and returns SIGCHLD and the signals that would end this process.
sigset_t BlockSignals() {
  sigset_t Signals;
  sigemptyset(&Signals);
  for (const int Signal : {SIGINT, SIGTERM, SIGHUP, SIGQUIT}) {
    struct sigaction Action;
    if (sigaction(Signal, nullptr, &Action) == 0 && Action.sa_handler != SIG_IGN) {
      sigaddset(&Signals, Signal);
    }
  }
  signal(SIGCHLD, SIG_DFL);
  sigaddset(&Signals, SIGCHLD);
  sigprocmask(SIG_BLOCK, &Signals, nullptr);
  return Signals;
}

std::string MakeWorkDir() {
  const char* szTmpDir = getenv("TMPDIR");
  const std::string strTmpDir = szTmpDir == nullptr || *szTmpDir == '\0' ? "/tmp" : szTmpDir;
  std::string strDir =
      std::filesystem::absolute(strTmpDir + "/tessel-preview.XXXXXX").lexically_normal().string();
  if (mkdtemp(strDir.data()) == nullptr) {
    throw SystemFailure("cannot make a directory in " + strTmpDir);
  }
  return strDir;
}

// Waits for the child to end. Kills it if a signal arrives. Returns that signal, or 0.
int WaitForChild(pid_t Child, const sigset_t& Signals, int* pStatus) {
  int Caught = 0;
  while (waitpid(Child, pStatus, WNOHANG) != Child) {
    int Signal = 0;
    sigwait(&Signals, &Signal);
    if (Signal != SIGCHLD) {
      Caught = Signal;
      kill(Child, SIGKILL);
    }
  }
  // Descendants of the child die with it and become children of this process. Some emulators do
  // not hand them over.
  while (wait(nullptr) != -1 || errno == EINTR) {
  }
  return Caught;
}

}  // namespace

int RunSupervised(const std::function<int(const std::string& strWorkDir)>& Work) {
  sigset_t Before;
  sigprocmask(SIG_SETMASK, nullptr, &Before);
  const sigset_t Signals = BlockSignals();
  prctl(PR_SET_CHILD_SUBREAPER, 1);
  const std::string strDir = MakeWorkDir();
  const pid_t Child = fork();
  if (Child == 0) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    sigprocmask(SIG_SETMASK, &Before, nullptr);
    exit(Work(strDir));
  }
  const int Errno = errno;
  int Status = 0;
  int Signal = Child == -1 ? 0 : WaitForChild(Child, Signals, &Status);
  std::error_code Ignored;
  std::filesystem::remove_all(strDir, Ignored);
  if (Child == -1) {
    throw Failure(std::string("cannot start a process: ") + strerror(Errno));
  }
  if (Signal == 0 && WIFSIGNALED(Status)) {
    Signal = WTERMSIG(Status);
  }
  sigprocmask(SIG_SETMASK, &Before, nullptr);
  if (Signal != 0) {
    raise(Signal);
  }
  return WIFEXITED(Status) ? WEXITSTATUS(Status) : 2;
}
