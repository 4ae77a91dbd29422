// What the race detector leaves out in cloudsyncd. It is linked in, as jobs get no environment but their own.
//
// When a server stands still, the engine's library says goodbye on an encrypted connection, an alert of two
// bytes, on a thread of its own, into the buffer from which another thread's write went out before. What
// orders the two is the library's matter. Nothing is said of it: tests look for any report in the logs.
extern "C" const char* __tsan_default_suppressions() { return "race:libssl.so\n"; }
extern "C" const char* __tsan_default_options() { return "print_suppressions=0"; }
