// What libm.a reports its errors to. It would be libc's own errno, but under a name that libc keeps
// for the libraries of its own version. Nobody reads this one: libm is here only because SQLite's
// archive has mathematical SQL functions, and SQLite looks at their results alone.
extern "C" {
__attribute__((visibility("hidden"))) thread_local int LibmErrno __asm__("errno");
}
