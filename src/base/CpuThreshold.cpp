#include "base/CpuThreshold.h"

#include <cerrno>
#include <cstdio>
#include <ctime>
#include <mutex>

namespace {

// A measuring window restarts after this much wall time, so that a long idle
// stretch earlier in the query does not grant a later burst of full speed.
const double kWindowSeconds = 2.0;

struct State {
    std::mutex lock;
    bool active = false;
    long run = 0;
    long sleep = 0;
    double windowWall = 0;
    double windowCpu = 0;
    unsigned long long iterations = 0;
    double sleptSeconds = 0;
};

State& state() {
    static State s;
    return s;
}

double clockSeconds(clockid_t id) {
    timespec ts{};
    clock_gettime(id, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

}  // namespace

void CpuThreshold::Initialize(const char* threshold) {
    State& s = state();
    std::lock_guard<std::mutex> g(s.lock);
    s.active = false;
    s.run = 0;
    s.sleep = 0;
    s.iterations = 0;
    s.sleptSeconds = 0;
    if (threshold == nullptr) return;
    int a = 0, b = 0;
    long run = 0, sleep = 0;
    if (std::sscanf(threshold, "%d:%d:%ld:%ld", &a, &b, &run, &sleep) != 4) return;
    if (run <= 0 || sleep <= 0) return;
    s.active = true;
    s.run = run;
    s.sleep = sleep;
    s.windowWall = clockSeconds(CLOCK_MONOTONIC);
    s.windowCpu = clockSeconds(CLOCK_PROCESS_CPUTIME_ID);
}

void CpuThreshold::doIteration() {
    State& s = state();
    std::lock_guard<std::mutex> g(s.lock);
    ++s.iterations;
    if (!s.active) return;
    double wall = clockSeconds(CLOCK_MONOTONIC) - s.windowWall;
    double cpu = clockSeconds(CLOCK_PROCESS_CPUTIME_ID) - s.windowCpu;
    // Wall time the CPU used so far must span to stay within the share.
    double needed = cpu * static_cast<double>(s.run + s.sleep) / static_cast<double>(s.run);
    if (needed > wall) {
        double pause = needed - wall;
        timespec ts{};
        ts.tv_sec = static_cast<time_t>(pause);
        ts.tv_nsec = static_cast<long>((pause - static_cast<double>(ts.tv_sec)) * 1e9);
        while (nanosleep(&ts, &ts) == -1 && errno == EINTR) {
        }
        s.sleptSeconds += pause;
        wall = needed;
    }
    if (wall >= kWindowSeconds) {
        s.windowWall = clockSeconds(CLOCK_MONOTONIC);
        s.windowCpu = clockSeconds(CLOCK_PROCESS_CPUTIME_ID);
    }
}

bool CpuThreshold::isActive() {
    State& s = state();
    std::lock_guard<std::mutex> g(s.lock);
    return s.active;
}

long CpuThreshold::runMilliseconds() {
    State& s = state();
    std::lock_guard<std::mutex> g(s.lock);
    return s.run;
}

long CpuThreshold::sleepMilliseconds() {
    State& s = state();
    std::lock_guard<std::mutex> g(s.lock);
    return s.sleep;
}

unsigned long long CpuThreshold::iterations() {
    State& s = state();
    std::lock_guard<std::mutex> g(s.lock);
    return s.iterations;
}

unsigned long long CpuThreshold::sleptMilliseconds() {
    State& s = state();
    std::lock_guard<std::mutex> g(s.lock);
    return static_cast<unsigned long long>(s.sleptSeconds * 1000.0);
}
