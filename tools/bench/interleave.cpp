// interleave ROUNDS [-- PREPARATION COMMAND [ARG...]]...
//
// Runs the commands in turn, ROUNDS times over (A B C A B C ...), so that whatever else the machine
// does in the meantime falls on all of them. Each run follows its preparation, a text for the shell
// (or none: ""), which is not timed. Prints a line for each command: the medians of its wall time
// in microseconds and of its peak memory in KiB. Ends with 1 and a message as soon as anything
// fails.
//
// The kernel counts this program's own memory to a command's until that is executed, so it stays
// small: far below what starting any of the commands takes.
#include <spawn.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <vector>

namespace {

struct COMMAND {
  const char* szPreparation;
  char** argv;  // up to a null
  std::vector<int64_t> WallUsec;
  std::vector<int64_t> MaxRssKib;
};

[[noreturn]] void Fail(const char* szWhat, const char* szWhich) {
  fprintf(stderr, "interleave: %s: %s\n", szWhat, szWhich);
  exit(EXIT_FAILURE);
}

// Cuts the arguments at each "--".
std::vector<COMMAND> ParseCommands(char** argv) {
  std::vector<COMMAND> Commands;
  while (*argv != nullptr) {
    *argv++ = nullptr;  // the end of the command before
    if (argv[0] == nullptr || argv[1] == nullptr) {
      Fail("no preparation and command", "--");
    }
    Commands.push_back({argv[0], argv + 1, {}, {}});
    while (*argv != nullptr && strcmp(*argv, "--") != 0) {
      ++argv;
    }
  }
  return Commands;
}

void Prepare(const COMMAND& Command) {
  if (Command.szPreparation[0] != '\0' && system(Command.szPreparation) != 0) {
    Fail("a preparation failed", Command.szPreparation);
  }
}

// Output goes to a file: some programs do less when it is /dev/null.
void Run(COMMAND* pCommand, const posix_spawn_file_actions_t* pActions) {
  const auto Start = std::chrono::steady_clock::now();
  pid_t Pid = 0;
  if (posix_spawnp(&Pid, pCommand->argv[0], pActions, nullptr, pCommand->argv, environ) != 0) {
    Fail("a command cannot be run", pCommand->argv[0]);
  }
  int Status = 0;
  rusage Usage;
  if (wait4(Pid, &Status, 0, &Usage) != Pid || Status != 0) {
    Fail("a command failed", pCommand->argv[0]);
  }
  const auto Wall = std::chrono::steady_clock::now() - Start;
  pCommand->WallUsec.push_back(std::chrono::duration_cast<std::chrono::microseconds>(Wall).count());
  pCommand->MaxRssKib.push_back(Usage.ru_maxrss);
}

long long Median(std::vector<int64_t> Values) {
  const auto Middle = Values.begin() + static_cast<std::ptrdiff_t>(Values.size() / 2);
  std::nth_element(Values.begin(), Middle, Values.end());
  return *Middle;
}

}  // namespace

int main(int argc, char* argv[]) {
  const long Rounds = argc > 2 ? strtol(argv[1], nullptr, 10) : 0;
  if (Rounds <= 0 || strcmp(argv[2], "--") != 0) {
    Fail("usage", "interleave ROUNDS [-- PREPARATION COMMAND [ARG...]]...");
  }
  std::vector<COMMAND> Commands = ParseCommands(argv + 2);
  const int Output = memfd_create("output", 0);
  posix_spawn_file_actions_t Actions;
  posix_spawn_file_actions_init(&Actions);
  posix_spawn_file_actions_adddup2(&Actions, Output, STDOUT_FILENO);
  for (long Round = 0; Round < Rounds; ++Round) {
    for (COMMAND& Command : Commands) {
      Prepare(Command);
      if (ftruncate(Output, 0) != 0 || lseek(Output, 0, SEEK_SET) != 0) {
        Fail("the output's file cannot be emptied", "memfd");
      }
      Run(&Command, &Actions);
    }
  }
  for (const COMMAND& Command : Commands) {
    printf("%lld %lld\n", Median(Command.WallUsec), Median(Command.MaxRssKib));
  }
  return EXIT_SUCCESS;
}
