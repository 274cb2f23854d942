#include "ChildProcess.h"

#include "Fail.h"
#include "FrameClient.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <iterator>
#include <mutex>
#include <set>
#include <sstream>
#include <thread>

extern char** environ;

namespace quarn::loadbench {

namespace {

// Children not yet reaped; guarded by liveMutex. Read at exit.
std::mutex liveMutex;
std::set<ChildProcess*> live;

void stopLiveChildren() {
    std::set<ChildProcess*> left;
    {
        std::lock_guard guard(liveMutex);
        left.swap(live);
    }
    for (ChildProcess* child : left) {
        child->stop(std::chrono::seconds(5));
    }
}

void track(ChildProcess* child) {
    static const bool registered = [] { return std::atexit(stopLiveChildren) == 0; }();
    (void)registered;
    std::lock_guard guard(liveMutex);
    live.insert(child);
}

void untrack(ChildProcess* child) {
    std::lock_guard guard(liveMutex);
    live.erase(child);
}

} // namespace

ChildProcess::ChildProcess(const std::filesystem::path& program,
                           const std::vector<std::string>& arguments,
                           const std::filesystem::path& output) {
    std::vector<std::string> storage{program.string()};
    storage.insert(storage.end(), arguments.begin(), arguments.end());
    std::vector<char*> argv;
    for (auto& argument : storage) {
        argv.push_back(argument.data());
    }
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, output.c_str(),
                                     O_WRONLY | O_CREAT | O_APPEND, 0644);
    posix_spawn_file_actions_adddup2(&actions, STDOUT_FILENO, STDERR_FILENO);
    int err = posix_spawn(&pid_, program.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (err != 0) {
        fail("cannot start {}: {}", program.string(), std::strerror(err));
    }
    track(this);
}

ChildProcess::~ChildProcess() {
    if (!reaped_) {
        stop();
    }
    untrack(this);
}

bool ChildProcess::running() {
    if (!reaped_ && ::waitpid(pid_, &status_, WNOHANG) == pid_) {
        reaped_ = true;
    }
    return !reaped_;
}

bool ChildProcess::waitForSocket(const std::filesystem::path& socket,
                                 std::chrono::seconds timeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
        if (!running()) {
            return false;
        }
        if (FrameClient::canConnect(socket)) {
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

long ChildProcess::residentKiB() const {
    std::ifstream status("/proc/" + std::to_string(pid_) + "/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind("VmRSS:", 0) == 0) {
            return std::stol(line.substr(6));
        }
    }
    fail("no VmRSS for pid {}", pid_);
}

double ChildProcess::cpuSeconds() const {
    std::ifstream stat("/proc/" + std::to_string(pid_) + "/stat");
    std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
    // Fields after the command name, which may hold blanks: state is field 3,
    // utime 14 and stime 15.
    std::istringstream fields(text.substr(text.rfind(')') + 1));
    std::string field;
    double ticks = 0;
    for (int index = 3; index <= 15 && fields >> field; ++index) {
        if (index >= 14) {
            ticks += std::stod(field);
        }
    }
    return ticks / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

int ChildProcess::stop(std::chrono::seconds grace) {
    if (running()) {
        ::kill(pid_, SIGTERM);
        const auto deadline = std::chrono::steady_clock::now() + grace;
        while (running() && std::chrono::steady_clock::now() < deadline) {
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
        if (running()) {
            ::kill(pid_, SIGKILL);
            ::waitpid(pid_, &status_, 0);
            reaped_ = true;
        }
    }
    return WIFEXITED(status_) ? WEXITSTATUS(status_) : 128 + WTERMSIG(status_);
}

} // namespace quarn::loadbench
