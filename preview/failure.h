// Why no preview can be made.
#pragma once

#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <string>

// Ends the preview with status 2; what() is the one line that the user reads.
class Failure : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// A failure of a system call: strWhat names the file and the step, the reason comes from errno.
inline Failure SystemFailure(const std::string& strWhat) {
  const int Errno = errno;
  return Failure(strWhat + ": " + strerror(Errno));
}
