// calls --benchmark_OPTION... | calls NAME TIMES
//
// Times the library's calls, CALL/ours, beside what their callers would otherwise use, CALL/PEER.
// The second form makes one call so many times. scripts/bench makes the files, in a private /var.

#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <glib.h>
#include <openssl/evp.h>
#include <sys/file.h>
#include <unistd.h>

#include "fileutils.h"
#include "kidebuglog.h"
#include "strtoint32.h"
#include "utils.h"

namespace {

constexpr const char* KEY_FILE = "/var/settings.ini";
constexpr const char* LAST_KEY = "camera1999";
constexpr int TEXT_LEN = 4096;
const std::string TEXT(TEXT_LEN, 'x');

void WriteWithLibrary() {
  KiPrintf(KI_LOG, "utils", "error", "dir/fileutils.cpp", 123, "GetKeyVals",
           "Failed to open file [%s] with errno [%d]\n", "/var/packages/Camveld/etc/f", 2);
}

void WriteWithSystemCalls() {
  const int Fd =
      open("/var/log/camveld/camveld.log", O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
  flock(Fd, LOCK_EX | LOCK_NB);
  g_assert(write(Fd, TEXT.data(), 135) > 0);  // as long as the line of KiPrintf
  flock(Fd, LOCK_UN);
  close(Fd);
}

void EncodeWithOpenSsl() {
  unsigned char rgOut[TEXT_LEN * 4 / 3 + 4];
  EVP_EncodeBlock(rgOut, reinterpret_cast<const unsigned char*>(TEXT.data()), TEXT_LEN);
}

void SetWithLibrary() { g_assert(KiFileSetVals("/var/settings", {{LAST_KEY, "new"}}, false) == 0); }

void SetWithKeyFile() {
  GKeyFile* pFile = g_key_file_new();
  g_assert(g_key_file_load_from_file(pFile, KEY_FILE, G_KEY_FILE_NONE, nullptr));
  g_key_file_set_string(pFile, "settings", LAST_KEY, "new");
  g_assert(g_key_file_save_to_file(pFile, KEY_FILE, nullptr));
  g_key_file_unref(pFile);
}

const std::pair<const char*, void (*)()> rgCall[] = {
    {"KiPrintf/ours", WriteWithLibrary},
    {"KiPrintf/system calls", WriteWithSystemCalls},
    {"HttpBase64Encode/ours", [] { free(HttpBase64Encode(TEXT.c_str())); }},
    {"HttpBase64Encode/OpenSSL", EncodeWithOpenSsl},
    {"KiFileSetVals/ours", SetWithLibrary},
    {"KiFileSetVals/GKeyFile", SetWithKeyFile},
};

}  // namespace

int main(int argc, char** argv) {
  for (const auto& [szName, Call] : rgCall) {
    if (argc == 3 && std::string(argv[1]) == szName) {
      for (int Times = StrToInt32(argv[2]); Times > 0; --Times) {
        Call();
      }
      return 0;
    }
    benchmark::RegisterBenchmark(szName, [Call = Call](benchmark::State& State) {
      for ([[maybe_unused]] auto _ : State) {
        Call();
      }
    });
  }
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  return argc == 1 ? 0 : 1;  // 1: an argument that it does not know is left
}
