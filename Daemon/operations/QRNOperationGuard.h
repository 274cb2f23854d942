#pragma once
// Turns a std::exception escaping a container operation into error 40
// ("Got exception: ..."). On an internal build the process is then stopped
// on purpose, so that the exception is seen rather than papered over.

#include "Daemon/support/QRNError.h"

#include <exception>
#include <type_traits>

namespace quarn {

class QRNOperationGuard {
public:
    template <class F> static auto run(F&& operation) -> std::invoke_result_t<F&> {
        try {
            return operation();
        } catch (const std::exception& exception) {
            reportException(exception);
            return QRN_CODE(kQRNErrorException);
        }
    }

    // Logs the exception (and stops the process on internal builds).
    static void reportException(const std::exception& exception);
};

} // namespace quarn
