#include "Daemon/operations/QRNOperationGuard.h"

#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/support/Log.h"

#include <cstdlib>
#include <typeinfo>

namespace quarn {

void QRNOperationGuard::reportException(const std::exception& exception) {
    QRN_ERROR(kQRNErrorException, "Got exception: {} : {}", typeid(exception).name(),
              exception.what());
    if (QRNGlobalConfiguration::sharedInstance().isInternalImage()) {
        QRN_LOG_FAULT(LogCategory::Unspecified, "** INTERNAL ERROR: Uncaught Exception **\n{} : {}",
                      typeid(exception).name(), exception.what());
        std::abort();
    }
}

} // namespace quarn
