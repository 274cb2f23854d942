#pragma once
// The platform's container library: which subdirectories a new container of
// each class gets, in creation order.

#include "Daemon/support/QRNError.h"

#include <cstdint>
#include <string>
#include <vector>

namespace quarn {

class ContainerLibrary {
public:
    virtual ~ContainerLibrary() = default;
    // Relative path names for the class, or a QRNErrorDomain code for a
    // class outside 1..13.
    virtual CodeResult<std::vector<std::string>>
    subdirectoryNamesForClass(std::uint64_t containerClass) const = 0;
};

class LinuxContainerLibrary final : public ContainerLibrary {
public:
    CodeResult<std::vector<std::string>>
    subdirectoryNamesForClass(std::uint64_t containerClass) const override;
};

} // namespace quarn
