// What was set in a file reads back, other lines stay, and to do it again changes nothing more.
// An assertion that fails ends the fuzzer, which then keeps the input.

#include <fuzzer/FuzzedDataProvider.h>

#include <cassert>

#include "fileutils.h"
#include "rig.h"
#include "zamoc.h"

using namespace std::string_literals;
using KeyValMap = std::map<std::string, std::string>;

static constexpr const char* NAME = "/var/file";

static void SetCapability(const std::string& strVal) {
  const int Ret = ZAMOCFileSetKeyValue(NAME, "k", strVal.c_str(), "%s=%s\n");
  assert(Ret == 0);
}

static void FuzzCapabilityFile(const std::string& strText, const std::string& strVal) {
  char szVal[16];
  WriteFile(NAME, strText);
  const int Removed = ZAMOCFileRemoveKey(NAME, "k");
  std::string strOthers = ReadFile(NAME);
  assert(Removed == (strOthers == strText ? 0 : 1));
  SetCapability(strVal);
  strOthers += strOthers.empty() || strOthers.back() == '\n' ? "" : "\n";
  const std::string strOnce = ReadFile(NAME);
  assert(strOnce == strOthers + "k=" + strVal + "\n");
  ZAMOCFileGetKeyValue(NAME, "k", szVal, sizeof(szVal), 0);
  assert(szVal == strVal);
  SetCapability(strVal);
  assert(ReadFile(NAME) == strOnce);
}

static void FuzzKeyValueFile(const std::string& strText, const std::string& strVal) {
  KeyValMap Before;
  KeyValMap After;
  WriteFile(NAME, strText);
  KiFileGetAllKeyVals(NAME, Before);
  KiFileSetVal(NAME, "k", strVal.c_str(), true);
  KiFileGetAllKeyVals(NAME, After);
  Before["k"] = strVal;
  assert(After == Before);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t Size) {
  FuzzedDataProvider Input(pData, Size);
  std::string strVal = Input.ConsumeRandomLengthString(9);
  strVal.resize(std::min(strVal.size(), strVal.find_first_of(" \t\r\n\"\0"s)));
  const std::string strText = Input.ConsumeRemainingBytesAsString();
  FuzzCapabilityFile(strText, strVal);
  FuzzKeyValueFile(strText, strVal);
  return 0;
}
