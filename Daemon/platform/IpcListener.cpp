#include "Daemon/platform/IpcListener.h"

#include "Daemon/platform/IpcAcceptor.h"
#include "Daemon/platform/UnixSocketFile.h"
#include "Daemon/support/Log.h"

#include <asio/executor_work_guard.hpp>

#include <algorithm>
#include <exception>
#include <mutex>
#include <thread>
#include <vector>

namespace quarn {

namespace {

void runContext(asio::io_context& io) {
    for (;;) {
        try {
            io.run();
            return;
        } catch (const std::exception& e) {
            QRN_LOG_FAULT(LogCategory::Vell, "A request service thread caught: {}", e.what());
        }
    }
}

} // namespace

struct IpcListener::Impl {
    explicit Impl(Options o) : options(std::move(o)) {}

    const Options options;
    // The pool threads hold the core too, so that it is never destroyed
    // from inside its own run().
    const std::shared_ptr<IpcServiceCore> core = std::make_shared<IpcServiceCore>(
        std::max<std::size_t>(1, options.workerThreads),
        IpcConnectionSlots::Quota{options.maxConnections, options.maxConnectionsPerUID,
                                  options.rootReservedConnections},
        options.memoryTrimInterval);

    std::mutex mutex; // guards the fields below: start and stop may come from any thread
    std::shared_ptr<IpcAcceptor> acceptor;
    std::vector<asio::executor_work_guard<asio::io_context::executor_type>> workGuards;
    std::vector<std::thread> threads;
    bool started = false;
    bool stopped = false;

    Result<int> listeningSocket() const;
};

Result<int> IpcListener::Impl::listeningSocket() const {
    if (options.inheritedFd < 0) {
        return UnixSocketFile::listen(options.socketPath);
    }
    if (!UnixSocketFile::isListeningStream(options.inheritedFd)) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(
            ENOTSOCK, "Descriptor {} is no listening Unix stream socket", options.inheritedFd));
    }
    return options.inheritedFd;
}

IpcListener::IpcListener(Options options) : impl_(std::make_unique<Impl>(std::move(options))) {}

IpcListener::~IpcListener() {
    stop();
}

Status IpcListener::start(ConnectionHandler onConnection) {
    std::lock_guard lock(impl_->mutex);
    if (impl_->started || impl_->stopped) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidArgument, "The listener was started"));
    }
    auto fd = impl_->listeningSocket();
    if (!fd) {
        return QRN_UNEXPECTED(fd.error());
    }
    auto acceptor =
        std::make_shared<IpcAcceptor>(impl_->core, impl_->options, std::move(onConnection));
    if (auto adopted = acceptor->adopt(*fd); !adopted) {
        return adopted;
    }
    impl_->acceptor = std::move(acceptor);
    for (std::size_t i = 0; i < impl_->core->contextCount(); ++i) {
        impl_->workGuards.emplace_back(impl_->core->io(i).get_executor());
        impl_->threads.emplace_back([core = impl_->core, i] { runContext(core->io(i)); });
    }
    impl_->started = true;
    impl_->acceptor->start();
    return {};
}

void IpcListener::stopAccepting() {
    std::shared_ptr<IpcAcceptor> acceptor;
    {
        std::lock_guard lock(impl_->mutex);
        acceptor = impl_->acceptor;
    }
    if (acceptor) {
        acceptor->close();
    }
}

void IpcListener::stop() {
    std::vector<std::thread> threads;
    {
        std::lock_guard lock(impl_->mutex);
        if (impl_->stopped) {
            return;
        }
        impl_->stopped = true;
        if (!impl_->started) {
            return;
        }
        impl_->acceptor->close();
        // From here on work from outside is refused, so the pool runs dry
        // once every connection has ended.
        impl_->core->closeGate();
        for (const auto& connection : impl_->core->connections()) {
            connection->shutDown();
        }
        impl_->workGuards.clear();
        threads = std::move(impl_->threads);
    }
    const bool onPool = impl_->core->runningOnPool();
    for (auto& thread : threads) {
        // A pool thread cannot join itself; the threads hold what they use.
        if (onPool) {
            thread.detach();
        } else {
            thread.join();
        }
    }
}

int IpcListener::socketFromSystemd(std::string_view name) {
    return UnixSocketFile::fromSystemd(name);
}

} // namespace quarn
