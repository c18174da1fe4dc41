// Where the base name of a path begins, for the library itself; not installed.
#pragma once

#include <cstddef>
#include <string_view>

// The offset after the last '/' or '\' of Path, 0 when it has neither.
inline size_t BaseNameOffset(std::string_view Path) {
  return Path.find_last_of("/\\") + 1;  // npos + 1 is 0
}
