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
};

// Runs "fsquery args...".  env entries "NAME=value" are set in the child,
// "NAME" alone removes the variable; a non-empty cwd is the child's working
// directory (exit 99 when it cannot be entered, 98 when the tool cannot start).
ToolRun runTool(const TempDir& dir, const std::vector<std::string>& args,
                const std::vector<std::string>& env = {}, const std::string& cwd = "");

}  // namespace testsupport

#endif
