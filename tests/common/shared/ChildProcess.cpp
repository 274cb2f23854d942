#include "ChildProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fmt/format.h>
#include <utility>

extern char** environ;

namespace quarn::test {

namespace {

// A child must not take over a socket or a notification channel that a
// service manager handed to the test.
bool inheritedFromTest(const char* entry) {
    for (const char* name : {"LISTEN_FDS=", "LISTEN_PID=", "LISTEN_FDNAMES=", "NOTIFY_SOCKET="}) {
        if (std::strncmp(entry, name, std::strlen(name)) == 0) {
            return false;
        }
    }
    return true;
}

std::vector<std::string> environmentFor(const ChildProcess::Launch& launch) {
    std::vector<std::string> environment;
    for (char** entry = environ; *entry; ++entry) {
        if (inheritedFromTest(*entry)) {
            environment.emplace_back(*entry);
        }
    }
    environment.insert(environment.end(), launch.environment.begin(), launch.environment.end());
    return environment;
}

std::vector<char*> pointersTo(std::vector<std::string>& strings) {
    std::vector<char*> pointers;
    for (std::string& string : strings) {
        pointers.push_back(string.data());
    }
    pointers.push_back(nullptr);
    return pointers;
}

int pollFor(int fd, std::chrono::milliseconds limit) {
    pollfd entry{fd, POLLIN, 0};
    int ready;
    do {
        ready = ::poll(&entry, 1, static_cast<int>(limit.count()));
    } while (ready < 0 && errno == EINTR);
    return ready;
}

struct FileActions {
    posix_spawn_file_actions_t actions;
    FileActions() { posix_spawn_file_actions_init(&actions); }
    ~FileActions() { posix_spawn_file_actions_destroy(&actions); }
};

} // namespace

bool ChildProcess::Exit::exitedWith(int code) const {
    return WIFEXITED(status) && WEXITSTATUS(status) == code;
}

std::string ChildProcess::Exit::description() const {
    if (WIFEXITED(status)) {
        return fmt::format("exit status {}", WEXITSTATUS(status));
    }
    if (WIFSIGNALED(status)) {
        return fmt::format("killed by signal {} ({})", WTERMSIG(status),
                           ::strsignal(WTERMSIG(status)));
    }
    return fmt::format("wait status {:#x}", status);
}

Result<ChildProcess> ChildProcess::spawn(const Launch& launch) {
    FileActions files;
    posix_spawn_file_actions_addopen(&files.actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(
        &files.actions, 1, launch.stdoutFile.empty() ? "/dev/null" : launch.stdoutFile.c_str(),
        O_WRONLY | O_CREAT | O_APPEND, 0644);
    if (!launch.stderrFile.empty()) {
        posix_spawn_file_actions_addopen(&files.actions, 2, launch.stderrFile.c_str(),
                                         O_WRONLY | O_CREAT | O_APPEND, 0644);
    }
    std::vector<std::string> arguments{launch.program.string()};
    arguments.insert(arguments.end(), launch.arguments.begin(), launch.arguments.end());
    std::vector<std::string> environment = environmentFor(launch);
    pid_t pid = -1;
    const int err = ::posix_spawn(&pid, launch.program.c_str(), &files.actions, nullptr,
                                  pointersTo(arguments).data(), pointersTo(environment).data());
    if (err != 0) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "cannot spawn {}: {}", launch.program.string(),
                                              std::strerror(err)));
    }
    auto pidfd = std::make_unique<Descriptor>(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    if (!pidfd->valid()) {
        const int openErr = errno;
        ::kill(pid, SIGKILL);
        ::waitpid(pid, nullptr, 0);
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(openErr, "pidfd_open: {}", std::strerror(openErr)));
    }
    return ChildProcess(pid, std::move(pidfd));
}

ChildProcess::ChildProcess(ChildProcess&& other) noexcept
    : pid_(std::exchange(other.pid_, -1)), pidfd_(std::move(other.pidfd_)), exit_(other.exit_) {}

ChildProcess::~ChildProcess() {
    if (pid_ > 0 && !exit_) {
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
    }
}

bool ChildProcess::isRunning() const {
    return pid_ > 0 && !exit_ && pollFor(pidfd_->get(), std::chrono::milliseconds(0)) == 0;
}

std::optional<ChildProcess::Exit> ChildProcess::waitFor(std::chrono::milliseconds limit) {
    if (!exit_ && pid_ > 0 && pollFor(pidfd_->get(), limit) > 0) {
        int status = 0;
        if (::waitpid(pid_, &status, 0) == pid_) {
            exit_ = Exit{status};
        }
    }
    return exit_;
}

void ChildProcess::signal(int signo) const {
    if (pid_ > 0 && !exit_) {
        ::kill(pid_, signo);
    }
}

} // namespace quarn::test
