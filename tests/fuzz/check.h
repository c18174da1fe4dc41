// What the fuzzers share.
#pragma once

#include <fuzzer/FuzzedDataProvider.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

using namespace std::string_literals;

// Ends the fuzzer, which then keeps the input, unless the property holds.
#define CHECK(Property)                                                      \
  do {                                                                       \
    if (!(Property)) {                                                       \
      fprintf(stderr, "%s:%d: not so: %s\n", __FILE__, __LINE__, #Property); \
      abort();                                                               \
    }                                                                        \
  } while (0)

// In the private /var.
constexpr const char* FILE_NAME = "/var/file";

inline void WriteFile(const std::string& strText) {
  std::ofstream(FILE_NAME, std::ios::binary) << strText;
}

inline std::string ReadFile() {
  std::ifstream File(FILE_NAME, std::ios::binary);
  return {std::istreambuf_iterator<char>(File), {}};
}
