// The object made by the test provider library, shared with the suite that
// loads it.
#ifndef FSCANNER_TESTS_HELPERS_TEST_PROVIDER_H
#define FSCANNER_TESTS_HELPERS_TEST_PROVIDER_H

#include <string>

class FsConfig;

struct TestProvider {
    static constexpr unsigned int kMagic = 0x50524f56u;  // "PROV"
    unsigned int magic;
    // The configuration the factory was called with.
    const FsConfig* config;
    // getString("provider", "marker", "none") of that configuration, or
    // "null" when none was given.
    std::string marker;
};

#endif
