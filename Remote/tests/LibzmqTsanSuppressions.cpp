// Linked into the remote suites' programs in ThreadSanitizer builds only.
// libzmq is not instrumented: the lock-free pipes between its threads and
// ours synchronise through atomics ThreadSanitizer cannot see, so every
// message handed across is reported as a race. Races whose stack passes
// through libzmq are left out; ours, outside it, are still reported.
// Visible, or the sanitizer runtime (a shared library) cannot find it.
extern "C" __attribute__((visibility("default"))) const char* __tsan_default_suppressions() {
  return "race:libzmq.so\n";
}
