// What was set in a file reads back, other lines stay, and to do it again changes nothing more.
// An assertion that fails ends the fuzzer, which then keeps the input.

#include <fuzzer/FuzzedDataProvider.h>

#include <cassert>

#include "rig.h"
#include "zamoc.h"

static constexpr const char* NAME = "/var/file";
static ZAMOCPatience gPatience;

static void FuzzCapabilityFile(const std::string& strText, const std::string& strVal) {
  WriteFile(NAME, strText);
  ZAMOCFile Old(NAME, &gPatience);
  Old.Remove("k");
  assert(Old.Save() == 0);
  assert(ZAMOCFile(NAME, &gPatience).Get("k").empty());
  std::string strExpected = ReadFile(NAME);
  strExpected += strExpected.empty() || strExpected.back() == '\n' ? "" : "\n";
  strExpected += "k=" + strVal + "\n";
  for (int Time = 0; Time < 2; ++Time) {
    ZAMOCFile File(NAME, &gPatience);
    File.Set("k", strVal, "%s=%s\n");
    assert(File.Save() == 0);
    assert(ReadFile(NAME) == strExpected);
  }
  assert(ZAMOCFile(NAME, &gPatience).Get("k") == strVal);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  FuzzedDataProvider Input(pData, Size);
  std::string strVal = Input.ConsumeRandomLengthString(9);
  const std::string strExcluded(" \t\r\n\"\0", 6);
  strVal.resize(std::min(strVal.size(), strVal.find_first_of(strExcluded)));
  const std::string strText = Input.ConsumeRemainingBytesAsString();
  FuzzCapabilityFile(strText, strVal);
  return 0;
}
