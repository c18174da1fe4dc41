// Cleans up after a preview, however it ends.
#pragma once

#include <functional>
#include <string>

// Runs Work in a child process and returns its status. Gives Work the name of a new directory below
// TMPDIR or /tmp. Removes the directory once the child and all its descendants have ended, even
// after a crash. A signal that would end this process first ends the child. Throws Failure.
int RunSupervised(const std::function<int(const std::string& strWorkDir)>& Work);
