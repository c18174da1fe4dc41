// Starts a test program again in private namespaces, but where it only lists its tests.

#include <gtest/gtest.h>
#include <unistd.h>

int main(int argc, char** argv) {
  std::vector<const char*> Args = {"sh", "-c", "exec \"$0\" " TESSEL_EMULATOR " \"$@\"",
                                   TESSEL_SOURCE_DIR "/tools/private-var"};
  Args.insert(Args.end(), argv, argv + argc + 1);  // before its own are taken out
  ::testing::InitGoogleTest(&argc, argv);
  if (::testing::GTEST_FLAG(list_tests) || getenv("TESSEL_PRIVATE_VAR") != nullptr) {
    return RUN_ALL_TESTS();
  }
  return execv("/bin/sh", const_cast<char**>(Args.data()));
}
