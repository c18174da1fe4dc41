// Starts the test program again in private namespaces, where it runs its tests.

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>

int main(int argc, char** argv) {
  if (getenv("TESSEL_PRIVATE_VAR") == nullptr) {
    std::vector<char*> Args = {const_cast<char*>(PRIVATE_VAR), const_cast<char*>(EMULATOR)};
    if (Args.back()[0] == '\0') {
      Args.pop_back();
    }
    Args.insert(Args.end(), argv, argv + argc + 1);
    execv(PRIVATE_VAR, Args.data());
    perror(PRIVATE_VAR);
    return 1;
  }
  ::testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}
