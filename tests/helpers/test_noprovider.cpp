// A loadable library without the provider factory, for the loader tests.
extern "C" __attribute__((visibility("default"))) int notAProvider() { return 42; }
