// Preloaded into a program: lets allocation number FAILING_ALLOCATION fail, or says at the end how
// many there were.

#include <atomic>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <cstdlib>

static const char* const gszFailing = getenv("FAILING_ALLOCATION");
static const long gFailing = gszFailing == nullptr ? 0 : strtol(gszFailing, nullptr, 10);
static std::atomic<long> gCount;

extern "C" void* __libc_realloc(void* pOld, size_t Size);

extern "C" void* realloc(void* pOld, size_t Size) {
  const bool blFails = ++gCount == gFailing;
  errno = blFails ? ENOMEM : errno;
  return blFails ? nullptr : __libc_realloc(pOld, Size);
}

extern "C" void* malloc(size_t Size) { return realloc(nullptr, Size); }

__attribute__((destructor)) static void Tell() { fprintf(stderr, "%ld\n", gCount.load()); }
