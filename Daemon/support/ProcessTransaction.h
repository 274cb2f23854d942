#pragma once
// A count of background work that must finish before a clean exit. Each
// ProcessTransaction holds the count up from construction until it ends
// (destruction, `end()`); on SIGTERM the daemon waits, bounded, for the count
// to drain.

#include <chrono>
#include <cstddef>
#include <string>

namespace quarn {

class ProcessTransaction {
public:
    // The name only shows in debug logging.
    explicit ProcessTransaction(std::string name = {});
    ~ProcessTransaction() { end(); }
    ProcessTransaction(ProcessTransaction&& other) noexcept;
    ProcessTransaction& operator=(ProcessTransaction&& other) noexcept;
    ProcessTransaction(const ProcessTransaction&) = delete;
    ProcessTransaction& operator=(const ProcessTransaction&) = delete;

    const std::string& name() const { return name_; }
    bool isActive() const { return active_; }
    // Ends the transaction early; later calls (and destruction) do nothing.
    void end();

    // Transactions open in the process.
    static std::size_t count();
    // Waits until no transaction is open or the timeout passes; answers
    // whether the count drained.
    static bool waitForDrain(std::chrono::milliseconds timeout);

private:
    std::string name_;
    bool active_ = true;
};

} // namespace quarn
