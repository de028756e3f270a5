// Runs the fsquery tool of this build in a child process, as the end-to-end
// suites do: standard input from /dev/null, standard output and error
// collected, HOME and XDG_CACHE_HOME inside the test's directory, the
// library's trace and configuration variables removed.  The tool starts
// through execBuildProgram, so a 32-bit build runs it under its emulator.
#ifndef FSCANNER_TESTS_SUPPORT_TOOLRUN_H
#define FSCANNER_TESTS_SUPPORT_TOOLRUN_H

#include <set>
#include <string>
#include <vector>

#include "support/testsupport.h"

namespace testsupport {

struct ToolRun {
    int status = -1;  // exit code, or 128 + signal
    std::string out;
    std::string err;
    // The printed lines, in order.
    std::vector<std::string> lines() const;
    std::set<std::string> lineSet() const;
    // The printed lines sorted, for a comparison that ignores order.
    std::vector<std::string> sortedLines() const;
    // The first line of standard error that starts with prefix; empty if none.
    std::string errLine(const std::string& prefix) const;
};

// How a child runs the tool, besides its arguments.
struct ToolOptions {
    // "NAME=value" is set in the child, "NAME" alone removes the variable.
    std::vector<std::string> env;
    // The child's working directory when not empty (exit 99 when it cannot
    // be entered).
    std::string cwd;
    // An alarm set before the exec ends a run that blocks: status
    // 128 + SIGALRM.  0: none.
    unsigned int alarmSeconds = 0;
    // The child drops to this user and group id before the exec (exit 100
    // when it cannot); negative: it keeps the caller's.
    long runAs = -1;
};

// The tool running in a child process; killed and reaped if still running
// when the object goes.  Exit 98 when the tool cannot start.
class ToolChild {
public:
    ToolChild(const TempDir& dir, const std::vector<std::string>& args, const ToolOptions& options = {});
    ~ToolChild();
    ToolChild(const ToolChild&) = delete;
    ToolChild& operator=(const ToolChild&) = delete;

    bool started() const { return pid_ > 0; }
    // True once the child has ended; its run is then what wait() gives.
    bool poll();
    ToolRun wait();

private:
    void collect(int status);

    long pid_ = -1;
    bool done_ = false;
    std::string outName_;
    std::string errName_;
    ToolRun result_;
};

// Runs "fsquery args..." to its end.
ToolRun runTool(const TempDir& dir, const std::vector<std::string>& args, const ToolOptions& options);
// The same with only an environment and a working directory.
ToolRun runTool(const TempDir& dir, const std::vector<std::string>& args,
                const std::vector<std::string>& env = {}, const std::string& cwd = "");

}  // namespace testsupport

#endif
