#pragma once
// Features from "<config>/features/<domain>.plist": a dictionary of feature
// name -> {"Enabled": bool}. A missing or malformed file, an unknown
// feature or an "Enabled" that is no boolean all mean off.

#include "Daemon/platform/Features.h"
#include "Daemon/platform/Paths.h"

namespace quarn {

class LinuxFeatures final : public Features {
public:
    explicit LinuxFeatures(Paths paths);

    bool isEnabled(std::string_view domain, std::string_view feature) const override;

private:
    Paths paths_;
};

} // namespace quarn
