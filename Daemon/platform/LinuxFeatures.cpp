#include "Daemon/platform/LinuxFeatures.h"

#include "Daemon/support/Log.h"
#include "Daemon/support/PropertyList.h"

#include <sys/stat.h>

namespace quarn {

namespace {

// The domain becomes a file name: one plain component, neither hidden nor "..".
bool isSafeDomain(std::string_view domain) {
    return !domain.empty() && domain.front() != '.' &&
           domain.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

} // namespace

LinuxFeatures::LinuxFeatures(Paths paths) : paths_(std::move(paths)) {}

bool LinuxFeatures::isEnabled(std::string_view domain, std::string_view feature) const {
    if (!isSafeDomain(domain)) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Invalid feature domain \"{}\"", domain);
        return false;
    }
    const auto path = paths_.configDirectory() / "features" / (std::string(domain) + ".plist");
    // Most domains have no file; do not report that as a failed read each time.
    struct stat st {};
    if (::stat(path.c_str(), &st) != 0) {
        return false;
    }
    // Read every time, so a switch flipped on a running system takes effect.
    auto plist = QRN_dictionaryWithContentsOfURL(path);
    if (!plist) {
        return false;
    }
    const Value* entry = plist->get(feature);
    const Value* enabled = entry ? entry->get("Enabled") : nullptr;
    return enabled && enabled->asBool().value_or(false);
}

} // namespace quarn
