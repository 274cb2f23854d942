#pragma once
// Identifier locks: every container operation serialises through here.
//
// Two levels: a reader/writer lock per container identifier, made on demand
// and destroyed with its last user, so unrelated containers are worked on in
// parallel; and a global reader/writer lock over all identifiers for the
// operations that must see or change everything.
//
// Compatibility (rows: held; columns: wanted):
//                        id read   id write   global read   global write
//   id read (other id)   yes       yes        yes           waits
//   id write (other id)  yes       yes        waits         waits
//   global read          yes       waits      yes           waits
//   global write         waits     waits      waits         waits
// An identifier writer counts from the moment it asks, so a pending one
// already holds back new global readers.
//
// Identifier arguments are a string or an array of strings; anything else
// stops the process. Arrays are locked in ascending order (each distinct
// identifier once), which keeps multi-identifier lockers from deadlocking.
// An identifier hold is released by the thread that took it; the global lock
// is plain bookkeeping and may be released by any thread.
// Broken bookkeeping (unlocking what is not held) stops the process.

#include "Daemon/support/Signpost.h"
#include "Daemon/support/Value.h"

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

// Clang's thread-safety analysis; nothing on other compilers.
#ifndef QRN_GUARDED_BY
#if defined(__clang__)
#define QRN_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define QRN_THREAD_ANNOTATION(x)
#endif
#define QRN_CAPABILITY(x) QRN_THREAD_ANNOTATION(capability(x))
#define QRN_SCOPED_CAPABILITY QRN_THREAD_ANNOTATION(scoped_lockable)
#define QRN_GUARDED_BY(x) QRN_THREAD_ANNOTATION(guarded_by(x))
#define QRN_REQUIRES(...) QRN_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define QRN_EXCLUDES(...) QRN_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
#define QRN_ACQUIRE(...) QRN_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define QRN_RELEASE(...) QRN_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#endif

namespace quarn {

class QRNLocks {
public:
    QRNLocks();
    ~QRNLocks();
    QRNLocks(const QRNLocks&) = delete;
    QRNLocks& operator=(const QRNLocks&) = delete;

    // The current daemon context's instance.
    static QRNLocks& shared();

    void read_lock_identifier(const Value& identifier) QRN_EXCLUDES(mutex_);
    void write_lock_identifier(const Value& identifier) QRN_EXCLUDES(mutex_);
    // Releases whatever is held on each identifier.
    void unlock_identifier(const Value& identifier) QRN_EXCLUDES(mutex_);
    void read_lock_all_identifiers() QRN_EXCLUDES(mutex_);
    void write_lock_all_identifiers() QRN_EXCLUDES(mutex_);
    // Releases the global lock, read or write, whichever is held.
    void unlock_all_identifiers() QRN_EXCLUDES(mutex_);

    // Bookkeeping as it stands, for tests and diagnostics.
    struct RecordState {
        std::uint64_t users = 0;    // holders and waiters
        std::int32_t lockState = 0; // 0 free, -1 writer, n readers
    };
    struct Snapshot {
        std::int32_t allReaderWriterState = 0;
        std::uint32_t identifierReaderCount = 0;
        std::uint32_t identifierWriterCount = 0;
        std::uint64_t conditionWaiters = 0; // threads waiting for the global conditions
        std::map<std::string, RecordState> records;
    };
    Snapshot snapshot() const QRN_EXCLUDES(mutex_);
    std::size_t lockRecordCount() const QRN_EXCLUDES(mutex_);

private:
    // std::mutex made visible to the analysis.
    class QRN_CAPABILITY("mutex") Mutex {
    public:
        std::mutex& native() { return native_; }

    private:
        std::mutex native_;
    };
    // Holds the mutex for a scope; condition waits go through it.
    class QRN_SCOPED_CAPABILITY Guard {
    public:
        explicit Guard(Mutex& mutex) QRN_ACQUIRE(mutex) : lock_(mutex.native()) {}
        ~Guard() QRN_RELEASE() {}
        std::unique_lock<std::mutex>& lock() { return lock_; }

    private:
        std::unique_lock<std::mutex> lock_;
    };
    struct LockRecord;
    using LockMap = std::unordered_map<std::string, std::unique_ptr<LockRecord>>;

    void _lock_identifier(const Value& identifier, bool writing) QRN_EXCLUDES(mutex_);
    void take_one_lock(const std::string& identifier, bool writing) QRN_EXCLUDES(mutex_);
    void unlock_one_lock(const std::string& identifier) QRN_EXCLUDES(mutex_);
    void _lock_all_identifiers(bool writing) QRN_EXCLUDES(mutex_);

    LockRecord& _lock_enterRecord(const std::string& identifier) QRN_REQUIRES(mutex_);
    void _lock_wait(Guard& guard, std::condition_variable& condition) QRN_REQUIRES(mutex_);
    bool _lock_allQuiet() const QRN_REQUIRES(mutex_);

    // The distinct identifiers of a string or an array of strings, ascending;
    // stops the process on any other type.
    static std::vector<std::string> sortedIdentifiers(const Value& identifier);

    // Guards every field below and each record's users count. Never held
    // while waiting for an identifier's reader/writer lock.
    mutable Mutex mutex_;
    // Made on first use; a record lives while it has users.
    std::unique_ptr<LockMap> identifierToLockMap_ QRN_GUARDED_BY(mutex_);
    // 0 free, n > 0 global readers, -1 the global writer.
    std::int32_t allReaderWriterState_ QRN_GUARDED_BY(mutex_) = 0;
    // Identifier locks wanted or held.
    std::uint32_t identifierReaderCount_ QRN_GUARDED_BY(mutex_) = 0;
    std::uint32_t identifierWriterCount_ QRN_GUARDED_BY(mutex_) = 0;
    std::uint64_t conditionWaiters_ QRN_GUARDED_BY(mutex_) = 0;
    // One interval per global hold.
    std::vector<Signpost> globalSignposts_ QRN_GUARDED_BY(mutex_);
    std::condition_variable allQuiet_;           // a global writer waits for it
    std::condition_variable noIdentifierWriter_; // global readers wait for it
    std::condition_variable globalFree_;         // identifier writers wait for it
    std::condition_variable noGlobalWriter_;     // identifier readers wait for it
};

// The module's interface, on the current context's instance.
void read_lock_identifier(const Value& identifier);
void write_lock_identifier(const Value& identifier);
void unlock_identifier(const Value& identifier);
void read_lock_all_identifiers();
void write_lock_all_identifiers();
void unlock_all_identifiers();

} // namespace quarn
