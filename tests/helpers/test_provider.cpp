// A provider library for the loader tests.  Its factory records what it was
// given so that the suite can check the call.
#include "helpers/test_provider.h"

#include "fscanner/fs/fs_loader.h"

extern "C" __attribute__((visibility("default"))) void* createProvider(const FsConfig* config) {
    TestProvider* provider = new TestProvider;
    provider->magic = TestProvider::kMagic;
    provider->config = config;
    provider->marker = config != nullptr ? config->getString("provider", "marker", "none") : "null";
    return provider;
}
