// The process that cleans up behind a preview, however it ends.
#pragma once

#include <functional>
#include <string>

// Runs Work in a child process, with the name of a new directory that is Work's own, and returns
// the child's status. Removes the directory when the child and everything it started have ended:
// by themselves, by a crash, or by a signal that this process receives and then dies of. The
// directory is below TMPDIR or /tmp. Throws Failure.
int RunSupervised(const std::function<int(const std::string& strWorkDir)>& Work);
