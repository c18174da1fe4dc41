// Finds the base name in a path. For the library itself; not installed.
#pragma once

#include <cstddef>
#include <string_view>

// The offset after the last '/' or '\' of Path; 0 if it has neither.
inline size_t BaseNameOffset(std::string_view Path) {
  return Path.find_last_of("/\\") + 1;  // npos + 1 is 0
}
