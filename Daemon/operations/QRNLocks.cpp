#include "Daemon/operations/QRNLocks.h"

#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/Signpost.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <shared_mutex>

namespace quarn {

namespace {

// The module name that assertion reports carry; readers of those reports
// know it by this name, wherever the file sits.
constexpr const char* kSourceName = "Daemon/QRNLocks";

[[noreturn]] void assertionFailed(const char* function, int line, const char* condition) {
    std::string report = fmt::format("Assertion failed: ({}), function {}, file {}, line {}.",
                                     condition, function, kSourceName, line);
    QRN_LOG_FAULT(LogCategory::Locking, "{}", report);
    Log::logger(LogCategory::Locking).flush();
    std::fprintf(stderr, "%s\n", report.c_str());
    std::abort();
}

[[noreturn]] void unknownParameterType(const Value& identifier) {
    QRN_LOG_FAULT(LogCategory::Locking, "Unknown parameter type!");
    Log::logger(LogCategory::Locking).flush();
    std::fprintf(stderr, "Unknown parameter type! (%s)\n", identifier.kindName());
    std::abort();
}

const char* modeName(bool writing) {
    return writing ? "writing" : "reading";
}

// The identifier argument of a wait signpost; only built when it is logged.
std::string waitDetail(const Value& identifier) {
    if (!Log::isEnabled(spdlog::level::debug)) {
        return {};
    }
    const auto* one = identifier.asString();
    return fmt::format(" uuid={} ", one ? *one : identifier.description());
}

} // namespace

// `condition` is evaluated exactly once, also for its side effects.
#define QRN_LOCKS_ASSERT(condition, text)                                                          \
    do {                                                                                           \
        if (!(condition)) {                                                                        \
            assertionFailed(__func__, __LINE__, text);                                             \
        }                                                                                          \
    } while (0)

struct QRNLocks::LockRecord {
    std::shared_mutex lock;
    std::uint64_t users = 1; // guarded by QRNLocks::mutex_
    // Mirrors `lock` (0 free, -1 writer, n readers) to check the bookkeeping.
    std::atomic<std::int32_t> lockState{0};
    // One interval per hold; guarded by QRNLocks::mutex_.
    std::vector<Signpost> heldSignposts;
};

QRNLocks::QRNLocks() = default;
QRNLocks::~QRNLocks() = default;

QRNLocks& QRNLocks::shared() {
    return QRNDaemonContext::current().instance<QRNLocks>();
}

void QRNLocks::read_lock_identifier(const Value& identifier) {
    Signpost waiting(LogCategory::Locking, "WaitingForReadLockWithIdentifier",
                     waitDetail(identifier));
    _lock_identifier(identifier, false);
}

void QRNLocks::write_lock_identifier(const Value& identifier) {
    Signpost waiting(LogCategory::Locking, "WaitingForWriteLockWithIdentifier",
                     waitDetail(identifier));
    _lock_identifier(identifier, true);
}

void QRNLocks::read_lock_all_identifiers() {
    Signpost waiting(LogCategory::Locking, "WaitingForGlobalReadLock");
    _lock_all_identifiers(false);
}

void QRNLocks::write_lock_all_identifiers() {
    Signpost waiting(LogCategory::Locking, "WaitingForGlobalWriteLock");
    _lock_all_identifiers(true);
}

std::vector<std::string> QRNLocks::sortedIdentifiers(const Value& identifier) {
    if (const auto* one = identifier.asString()) {
        return {*one};
    }
    const auto* array = identifier.asArray();
    if (array == nullptr) {
        unknownParameterType(identifier);
    }
    std::vector<std::string> identifiers;
    identifiers.reserve(array->size());
    for (const auto& element : *array) {
        // Checked before anything is locked, so a bad array leaves nothing half-held.
        const auto* string = element.asString();
        if (string == nullptr) {
            unknownParameterType(element);
        }
        identifiers.push_back(*string);
    }
    std::sort(identifiers.begin(), identifiers.end());
    identifiers.erase(std::unique(identifiers.begin(), identifiers.end()), identifiers.end());
    return identifiers;
}

void QRNLocks::_lock_identifier(const Value& identifier, bool writing) {
    for (const auto& one : sortedIdentifiers(identifier)) {
        take_one_lock(one, writing);
    }
}

void QRNLocks::unlock_identifier(const Value& identifier) {
    auto identifiers = sortedIdentifiers(identifier);
    for (auto it = identifiers.rbegin(); it != identifiers.rend(); ++it) {
        unlock_one_lock(*it);
    }
}

void QRNLocks::_lock_wait(Guard& guard, std::condition_variable& condition) {
    ++conditionWaiters_;
    condition.wait(guard.lock());
    --conditionWaiters_;
}

bool QRNLocks::_lock_allQuiet() const {
    return identifierWriterCount_ == 0 && identifierReaderCount_ == 0 && allReaderWriterState_ == 0;
}

QRNLocks::LockRecord& QRNLocks::_lock_enterRecord(const std::string& identifier) {
    if (!identifierToLockMap_) {
        identifierToLockMap_ = std::make_unique<LockMap>();
    }
    auto [it, inserted] = identifierToLockMap_->try_emplace(identifier);
    if (inserted) {
        it->second = std::make_unique<LockRecord>();
    } else {
        ++it->second->users;
    }
    return *it->second;
}

void QRNLocks::take_one_lock(const std::string& identifier, bool writing) {
    LockRecord* record = nullptr;
    {
        Guard guard(mutex_);
        if (writing) {
            while (allReaderWriterState_ != 0) {
                _lock_wait(guard, globalFree_);
            }
            ++identifierWriterCount_;
        } else {
            while (allReaderWriterState_ == -1) {
                _lock_wait(guard, noGlobalWriter_);
            }
            ++identifierReaderCount_;
        }
        // The record cannot go away below: this call is one of its users.
        record = &_lock_enterRecord(identifier);
    }
    QRN_LOG_DEBUG(LogCategory::Locking, "Waiting to lock {} for {}", identifier, modeName(writing));
    if (writing) {
        record->lock.lock();
        std::int32_t expected = 0;
        QRN_LOCKS_ASSERT(record->lockState.compare_exchange_strong(expected, -1),
                         "atomic_compare_exchange_strong(&lockPtr->lockState, &expected, -1)");
    } else {
        record->lock.lock_shared();
        QRN_LOCKS_ASSERT(record->lockState.fetch_add(1) >= 0,
                         "atomic_fetch_add(&lockPtr->lockState, 1) >= 0");
    }
    {
        Guard guard(mutex_);
        record->heldSignposts.emplace_back(
            LogCategory::Locking, writing ? "WriteLockWithIdentifier" : "ReadLockWithIdentifier");
    }
    QRN_LOG_DEBUG(LogCategory::Locking, "Got lock on identifier {}", identifier);
}

void QRNLocks::unlock_one_lock(const std::string& identifier) {
    Guard guard(mutex_);
    QRN_LOCKS_ASSERT(identifierToLockMap_ != nullptr, "gQRNLocks.identifierToLockMap");
    auto found = identifierToLockMap_->find(identifier);
    QRN_LOCKS_ASSERT(found != identifierToLockMap_->end(), "lockPtr");
    LockRecord& record = *found->second;
    const std::int32_t state = record.lockState.load();
    QRN_LOCKS_ASSERT(state != 0, "atomic_load(&lockPtr->lockState) != 0");
    const bool writeHold = state == -1;
    if (!record.heldSignposts.empty()) {
        record.heldSignposts.pop_back(); // ends the hold's interval
    }
    if (!writeHold) {
        QRN_LOCKS_ASSERT(record.lockState.fetch_sub(1) > 0,
                         "atomic_fetch_sub(&lockPtr->lockState, 1) > 0");
        QRN_LOCKS_ASSERT(allReaderWriterState_ >= 0, "gQRNLocks.allReaderWriterState >= 0");
        QRN_LOCKS_ASSERT(identifierReaderCount_ > 0, "gQRNLocks.identifierReaderCount > 0");
        --identifierReaderCount_;
        if (_lock_allQuiet()) {
            allQuiet_.notify_one();
        }
    } else {
        std::int32_t expected = -1;
        QRN_LOCKS_ASSERT(record.lockState.compare_exchange_strong(expected, 0),
                         "atomic_compare_exchange_strong(&lockPtr->lockState, &expected, 0)");
        QRN_LOCKS_ASSERT(allReaderWriterState_ == 0, "gQRNLocks.allReaderWriterState == 0");
        QRN_LOCKS_ASSERT(identifierWriterCount_ > 0, "gQRNLocks.identifierWriterCount > 0");
        --identifierWriterCount_;
        if (_lock_allQuiet()) {
            allQuiet_.notify_one();
        }
        if (identifierWriterCount_ == 0 && allReaderWriterState_ != -1) {
            noIdentifierWriter_.notify_all();
        }
    }
    --record.users;
    if (writeHold) {
        record.lock.unlock();
    } else {
        record.lock.unlock_shared();
    }
    QRN_LOG_DEBUG(LogCategory::Locking, "Unlocked identifier {}", identifier);
    if (record.users == 0) {
        QRN_LOG_DEBUG(LogCategory::Locking, "Destroying lock for identifier {}", identifier);
        QRN_LOCKS_ASSERT(0 == record.lockState.load(), "0 == atomic_load(&lockPtr->lockState)");
        identifierToLockMap_->erase(found);
    }
}

void QRNLocks::_lock_all_identifiers(bool writing) {
    QRN_LOG_DEBUG(LogCategory::Locking, "Waiting to lock all identifiers for {}",
                  modeName(writing));
    Guard guard(mutex_);
    if (writing) {
        while (!_lock_allQuiet()) {
            _lock_wait(guard, allQuiet_);
        }
        allReaderWriterState_ = -1;
        globalSignposts_.emplace_back(LogCategory::Locking, "GlobalWriteLock");
    } else {
        while (identifierWriterCount_ > 0 || allReaderWriterState_ == -1) {
            _lock_wait(guard, noIdentifierWriter_);
        }
        ++allReaderWriterState_;
        globalSignposts_.emplace_back(LogCategory::Locking, "GlobalReadLock");
    }
    QRN_LOG_DEBUG(LogCategory::Locking, "Locked all identifiers for {}", modeName(writing));
}

void QRNLocks::unlock_all_identifiers() {
    {
        Guard guard(mutex_);
        if (!globalSignposts_.empty()) {
            globalSignposts_.pop_back(); // ends the hold's interval
        }
        if (allReaderWriterState_ != -1) {
            QRN_LOCKS_ASSERT(allReaderWriterState_ > 0, "gQRNLocks.allReaderWriterState > 0");
            --allReaderWriterState_;
            if (allReaderWriterState_ == 0) {
                globalFree_.notify_all();
            }
            if (_lock_allQuiet()) {
                allQuiet_.notify_one();
            }
        } else {
            allReaderWriterState_ = 0;
            allQuiet_.notify_one();
            noIdentifierWriter_.notify_all();
            globalFree_.notify_all();
            noGlobalWriter_.notify_all();
        }
    }
    QRN_LOG_DEBUG(LogCategory::Locking, "Unlocked all identifiers");
}

QRNLocks::Snapshot QRNLocks::snapshot() const {
    Guard guard(mutex_);
    Snapshot out;
    out.allReaderWriterState = allReaderWriterState_;
    out.identifierReaderCount = identifierReaderCount_;
    out.identifierWriterCount = identifierWriterCount_;
    out.conditionWaiters = conditionWaiters_;
    if (identifierToLockMap_) {
        for (const auto& [identifier, record] : *identifierToLockMap_) {
            out.records[identifier] = RecordState{record->users, record->lockState.load()};
        }
    }
    return out;
}

std::size_t QRNLocks::lockRecordCount() const {
    Guard guard(mutex_);
    return identifierToLockMap_ ? identifierToLockMap_->size() : 0;
}

void read_lock_identifier(const Value& identifier) {
    QRNLocks::shared().read_lock_identifier(identifier);
}

void write_lock_identifier(const Value& identifier) {
    QRNLocks::shared().write_lock_identifier(identifier);
}

void unlock_identifier(const Value& identifier) {
    QRNLocks::shared().unlock_identifier(identifier);
}

void read_lock_all_identifiers() {
    QRNLocks::shared().read_lock_all_identifiers();
}

void write_lock_all_identifiers() {
    QRNLocks::shared().write_lock_all_identifiers();
}

void unlock_all_identifiers() {
    QRNLocks::shared().unlock_all_identifiers();
}

} // namespace quarn
