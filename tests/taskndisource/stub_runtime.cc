// A stand-in runtime library for the factory tests: it exports only the
// library calls, so the first finder call is the first missing symbol.
#define STUB_EXPORT extern "C" __attribute__((visibility("default")))

STUB_EXPORT bool NDIlib_initialize(void) { return true; }
STUB_EXPORT void NDIlib_destroy(void) {}
STUB_EXPORT const char* NDIlib_version(void) { return "stub 1.0"; }
STUB_EXPORT bool NDIlib_is_supported_CPU(void) { return true; }
