// Preloaded: fails allocation number FAILING_ALLOCATION, and says at the end how many there were.

#include <cerrno>
#include <cstdio>
#include <cstdlib>

static const long gFailing = strtol(getenv("FAILING_ALLOCATION"), nullptr, 10);
static long gCount;

extern "C" void* __libc_realloc(void* pOld, size_t Size);

extern "C" void* realloc(void* pOld, size_t Size) {
  const bool blFails = ++gCount == gFailing;
  errno = blFails ? ENOMEM : errno;
  return blFails ? nullptr : __libc_realloc(pOld, Size);
}

extern "C" void* malloc(size_t Size) { return realloc(nullptr, Size); }

__attribute__((destructor)) static void Tell() { fprintf(stderr, "%ld\n", gCount); }
