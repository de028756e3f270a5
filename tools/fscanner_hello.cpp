// A small host program that shows the library is alive: it reads the
// configuration, traces through the library's handle and throttles a short
// loop.  It stands in for the main job until the query tool exists.
#include <cstdio>

#include "base/CpuThreshold.h"
#include "base/KelCfg.h"
#include "base/QvLogWrapper.h"

int main() {
    String home = KelCfg::getKey("fscanner.home");
    std::printf("fscanner: configuration %s\n",
                KelCfg::getError().length() == 0 ? "loaded" : static_cast<const char*>(KelCfg::getError()));
    std::printf("fscanner: fscanner.home = '%s'\n", static_cast<const char*>(home));
    CpuThreshold::Initialize("0:0:50:50");
    for (int i = 0; i < 100; ++i) CpuThreshold::doIteration();
    std::printf("fscanner: throttle ran %llu iterations\n", CpuThreshold::iterations());
    getQvLogFs()->traceMIN(__LINE__, __FILE__, __func__, "IMPORTANT: fscanner_hello - done");
    return 0;
}
