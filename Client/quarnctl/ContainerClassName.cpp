#include "Client/quarnctl/ContainerClassName.h"

#include "Daemon/model/QRNContainerClass.h"

#include <fmt/format.h>

#include <algorithm>
#include <cctype>
#include <charconv>

namespace quarn::ctl {

namespace {

bool equalIgnoringCase(std::string_view a, std::string_view b) {
    return std::ranges::equal(a, b, [](char x, char y) {
        return std::tolower(static_cast<unsigned char>(x)) ==
               std::tolower(static_cast<unsigned char>(y));
    });
}

} // namespace

std::optional<std::uint64_t> ContainerClassName::parse(std::string_view text) {
    std::uint64_t number = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (ec == std::errc() && end == text.data() + text.size()) {
        return QRNContainerClass::isValid(number) ? std::optional(number) : std::nullopt;
    }
    for (std::uint64_t cls = kQRNContainerClassAppBundle; cls < kQRNContainerClassMax; ++cls) {
        if (equalIgnoringCase(text, QRNContainerClass::shortName(cls))) {
            return cls;
        }
    }
    return std::nullopt;
}

std::string ContainerClassName::allNames() {
    std::string names;
    for (std::uint64_t cls = kQRNContainerClassAppBundle; cls < kQRNContainerClassMax; ++cls) {
        names += fmt::format("{}{}", names.empty() ? "" : ", ", QRNContainerClass::shortName(cls));
    }
    return names;
}

} // namespace quarn::ctl
