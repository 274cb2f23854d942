#pragma once
// The global identifier lock, for reading or writing, held for one scope.

#include "Daemon/operations/QRNLocks.h"

namespace quarn {

class QRNGlobalIdentifierLock {
public:
    enum class Mode { Read, Write };

    explicit QRNGlobalIdentifierLock(Mode mode) {
        if (mode == Mode::Write) {
            write_lock_all_identifiers();
        } else {
            read_lock_all_identifiers();
        }
    }
    ~QRNGlobalIdentifierLock() { unlock_all_identifiers(); }
    QRNGlobalIdentifierLock(const QRNGlobalIdentifierLock&) = delete;
    QRNGlobalIdentifierLock& operator=(const QRNGlobalIdentifierLock&) = delete;
};

} // namespace quarn
