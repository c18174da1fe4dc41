// Reads decimal numbers. For the library itself and the programs built with it; not installed.
#pragma once

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <limits>

// The decimal number at the start of szText, as strtol reads it, or 0 if there is none. A number
// outside the 32-bit range gives the nearest limit of that range, whatever the size of long.
inline int32_t StrToInt32(const char* szText) {
  constexpr long MIN = std::numeric_limits<int32_t>::min();
  constexpr long MAX = std::numeric_limits<int32_t>::max();
  return static_cast<int32_t>(std::clamp(strtol(szText, nullptr, 10), MIN, MAX));
}
