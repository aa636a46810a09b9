// Linked into the programs where addresses are checked.

// The leak check of GCC 12 takes the thread-local variables of a library that is loaded later for
// memory of its own, and crashes on it.
extern "C" __attribute__((visibility("default"))) const char* __asan_default_options() {
    return "intercept_tls_get_addr=0";
}
