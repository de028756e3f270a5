#include "support/toolrun.h"

#include <fcntl.h>
#include <grp.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>

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

std::string ToolRun::errLine(const std::string& prefix) const {
    std::istringstream in(err);
    std::string line;
    while (std::getline(in, line)) {
        if (line.compare(0, prefix.size(), prefix) == 0) return line;
    }
    return "";
}

ToolChild::ToolChild(const TempDir& dir, const std::vector<std::string>& args, const ToolOptions& options) {
    static int serial = 0;
    outName_ = dir.file("tool-stdout." + std::to_string(serial));
    errName_ = dir.file("tool-stderr." + std::to_string(serial));
    ++serial;
    pid_t pid = fork();
    if (pid == 0) {
        int out = open(outName_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int err = open(errName_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int in = open("/dev/null", O_RDONLY);
        dup2(in, 0);
        dup2(out, 1);
        dup2(err, 2);
        setenv("HOME", dir.file("home").c_str(), 1);
        setenv("XDG_CACHE_HOME", dir.file("xdg").c_str(), 1);
        unsetenv("FSCANNER_TRACE_LEVEL");
        unsetenv("FSCANNER_TRACE_FILE");
        unsetenv("FSCANNER_CONFIG");
        for (const std::string& e : options.env) {
            size_t eq = e.find('=');
            if (eq == std::string::npos)
                unsetenv(e.c_str());
            else
                setenv(e.substr(0, eq).c_str(), e.substr(eq + 1).c_str(), 1);
        }
        if (!options.cwd.empty() && chdir(options.cwd.c_str()) != 0) _exit(99);
        if (options.runAs >= 0) {
            gid_t gid = static_cast<gid_t>(options.runAs);
            uid_t uid = static_cast<uid_t>(options.runAs);
            (void)setgroups(0, nullptr);  // keeps no group of the caller where allowed
            if (setgid(gid) != 0 || setuid(uid) != 0) _exit(100);
        }
        if (options.alarmSeconds > 0) {
            signal(SIGALRM, SIG_DFL);
            alarm(options.alarmSeconds);  // kept across the exec
        }
        std::vector<std::string> argv{std::string(FSCANNER_TEST_BINARY_DIR) + "/fsquery"};
        argv.insert(argv.end(), args.begin(), args.end());
        execBuildProgram(argv);
        _exit(98);
    }
    pid_ = pid;
}

ToolChild::~ToolChild() {
    if (pid_ > 0 && !done_) {
        kill(static_cast<pid_t>(pid_), SIGKILL);
        waitpid(static_cast<pid_t>(pid_), nullptr, 0);
        unlink(outName_.c_str());
        unlink(errName_.c_str());
    }
}

bool ToolChild::poll() {
    if (done_) return true;
    if (pid_ <= 0) return false;
    int status = 0;
    if (waitpid(static_cast<pid_t>(pid_), &status, WNOHANG) != static_cast<pid_t>(pid_)) return false;
    collect(status);
    return true;
}

ToolRun ToolChild::wait() {
    if (!done_ && pid_ > 0) {
        int status = 0;
        while (waitpid(static_cast<pid_t>(pid_), &status, 0) < 0 && errno == EINTR) {
        }
        collect(status);
    }
    return result_;
}

void ToolChild::collect(int status) {
    done_ = true;
    result_.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    result_.out = readFile(outName_);
    result_.err = readFile(errName_);
    unlink(outName_.c_str());
    unlink(errName_.c_str());
}

ToolRun runTool(const TempDir& dir, const std::vector<std::string>& args, const ToolOptions& options) {
    ToolChild child(dir, args, options);
    return child.wait();
}

ToolRun runTool(const TempDir& dir, const std::vector<std::string>& args, const std::vector<std::string>& env,
                const std::string& cwd) {
    ToolOptions options;
    options.env = env;
    options.cwd = cwd;
    return runTool(dir, args, options);
}

}  // namespace testsupport
