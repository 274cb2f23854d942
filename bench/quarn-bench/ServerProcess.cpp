#include "ServerProcess.h"

#include "Fail.h"
#include "FrameClient.h"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <mutex>
#include <set>
#include <sstream>
#include <thread>

namespace quarn::loadbench {

namespace {

// Servers not yet ended; guarded by liveMutex. Read at exit.
std::mutex liveMutex;
std::set<ServerProcess*> live;

void stopLiveServers() {
    std::set<ServerProcess*> left;
    {
        std::lock_guard guard(liveMutex);
        left.swap(live);
    }
    for (ServerProcess* server : left) {
        server->stop(std::chrono::seconds(5));
    }
}

void track(ServerProcess* server) {
    static const bool registered = [] { return std::atexit(stopLiveServers) == 0; }();
    (void)registered;
    std::lock_guard guard(liveMutex);
    live.insert(server);
}

void untrack(ServerProcess* server) {
    std::lock_guard guard(liveMutex);
    live.erase(server);
}

} // namespace

ServerProcess::ServerProcess(const std::filesystem::path& program,
                             const std::vector<std::string>& arguments,
                             const std::filesystem::path& output) {
    test::ChildProcess::Launch launch;
    launch.program = program;
    launch.arguments = arguments;
    launch.stdoutFile = output;
    launch.stderrFile = output;
    auto spawned = test::ChildProcess::spawn(launch);
    if (!spawned) {
        fail("cannot start {}: {}", program.string(), spawned.error().message);
    }
    process_.emplace(std::move(*spawned));
    track(this);
}

ServerProcess::~ServerProcess() {
    stop();
    untrack(this);
}

bool ServerProcess::waitForSocket(const std::filesystem::path& socket,
                                  std::chrono::seconds timeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline && process_->isRunning()) {
        if (FrameClient::canConnect(socket)) {
            return true;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

long ServerProcess::residentKiB() const {
    std::ifstream status("/proc/" + std::to_string(pid()) + "/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind("VmRSS:", 0) == 0) {
            return std::stol(line.substr(6));
        }
    }
    fail("no VmRSS for pid {}", pid());
}

double ServerProcess::cpuSeconds() const {
    std::ifstream stat("/proc/" + std::to_string(pid()) + "/stat");
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

int ServerProcess::stop(std::chrono::seconds grace) {
    process_->signal(SIGTERM);
    auto exit = process_->waitFor(grace);
    if (!exit) {
        process_->signal(SIGKILL);
        exit = process_->waitFor(std::chrono::seconds(60));
    }
    const int status = exit ? exit->status : 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

} // namespace quarn::loadbench
