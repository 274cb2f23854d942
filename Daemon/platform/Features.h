#pragma once
// Feature switches by domain and feature name (for example "fast_container_sizing"
// of "quarnd").

#include <string_view>

namespace quarn {

class Features {
public:
    virtual ~Features() = default;
    // Off unless explicitly switched on.
    virtual bool isEnabled(std::string_view domain, std::string_view feature) const = 0;
};

} // namespace quarn
