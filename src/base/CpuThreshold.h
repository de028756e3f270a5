// CPU throttle of the host's base library.
//
// Initialize takes the text "%d:%d:%ld:%ld"; the third number is the run time
// and the fourth the sleep time, both in milliseconds.  From then on each
// doIteration() compares the CPU time the process has used since the start of
// the current measuring window with the wall time that has passed, and sleeps
// until the process has used no more than run/(run+sleep) of one CPU.  A null
// text, fewer than four numbers, a run time or sleep time of 0 or below, means
// no throttling: doIteration() then returns at once.
//
// State is process-wide; Initialize and doIteration are meant to be called
// from the one thread that runs a query.  They are guarded by a mutex so that
// a stray call from another thread is harmless.
#ifndef FSCANNER_BASE_CPUTHRESHOLD_H
#define FSCANNER_BASE_CPUTHRESHOLD_H

class CpuThreshold {
public:
    // Scans call doIteration() once per this many files.
    static constexpr int CPU_THROTTLE_NO_OF_SCANNED_FILES_FACTOR = 64;
    // Loops over long lists call doIteration() once per this many turns.
    static constexpr int CPU_THROTTLE_ITERATION_FACTOR_NORMAL = 100;
    // Loops over short lists call doIteration() once per this many turns.
    static constexpr int CPU_THROTTLE_ITERATION_FACTOR_SMALL = 10;

    static void Initialize(const char* threshold);
    static void doIteration();

    // True when the last Initialize set a limit.
    static bool isActive();
    // Run and sleep milliseconds of the last Initialize (0 and 0 when off).
    static long runMilliseconds();
    static long sleepMilliseconds();
    // Number of doIteration calls since the last Initialize, and the total
    // number of milliseconds they slept.  For tests and statistics.
    static unsigned long long iterations();
    static unsigned long long sleptMilliseconds();
};

#endif
