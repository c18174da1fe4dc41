// The error that ends a program of the preview and its way back.
#pragma once

#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <string>

// main() prints what() in one line and ends with status 2.
class Failure : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// Describes a failed system call. strWhat names the file and the step; errno gives the reason.
inline Failure SystemFailure(const std::string& strWhat) {
  const int Errno = errno;
  return Failure(strWhat + ": " + strerror(Errno));
}
