#include "support/toolrun.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <sstream>

namespace testsupport {

std::vector<std::string> ToolRun::lines() const {
    std::vector<std::string> result;
    std::istringstream in(out);
    std::string line;
    while (std::getline(in, line)) result.push_back(line);
    return result;
}

std::set<std::string> ToolRun::lineSet() const {
    std::vector<std::string> l = lines();
    return std::set<std::string>(l.begin(), l.end());
}

std::vector<std::string> ToolRun::sortedLines() const {
    std::vector<std::string> l = lines();
    std::sort(l.begin(), l.end());
    return l;
}

ToolRun runTool(const TempDir& dir, const std::vector<std::string>& args,
                const std::vector<std::string>& env, const std::string& cwd) {
    static int serial = 0;
    std::string outName = dir.file("tool-stdout." + std::to_string(serial));
    std::string errName = dir.file("tool-stderr." + std::to_string(serial));
    ++serial;
    pid_t pid = fork();
    if (pid == 0) {
        int out = open(outName.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int err = open(errName.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int in = open("/dev/null", O_RDONLY);
        dup2(in, 0);
        dup2(out, 1);
        dup2(err, 2);
        setenv("HOME", dir.file("home").c_str(), 1);
        setenv("XDG_CACHE_HOME", dir.file("xdg").c_str(), 1);
        unsetenv("FSCANNER_TRACE_LEVEL");
        unsetenv("FSCANNER_TRACE_FILE");
        unsetenv("FSCANNER_CONFIG");
        for (const std::string& e : env) {
            size_t eq = e.find('=');
            if (eq == std::string::npos)
                unsetenv(e.c_str());
            else
                setenv(e.substr(0, eq).c_str(), e.substr(eq + 1).c_str(), 1);
        }
        if (!cwd.empty() && chdir(cwd.c_str()) != 0) _exit(99);
        std::vector<std::string> argv{std::string(FSCANNER_TEST_BINARY_DIR) + "/fsquery"};
        argv.insert(argv.end(), args.begin(), args.end());
        execBuildProgram(argv);
        _exit(98);
    }
    ToolRun run;
    int status = 0;
    waitpid(pid, &status, 0);
    run.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    run.out = readFile(outName);
    run.err = readFile(errName);
    unlink(outName.c_str());
    unlink(errName.c_str());
    return run;
}

}  // namespace testsupport
