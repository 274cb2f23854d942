#pragma once
// Container classes on the command line: a number 1..13 or the short name of
// the class table ("appData", "systemGroup", ...), in any letter case.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace quarn::ctl {

class ContainerClassName {
public:
    static std::optional<std::uint64_t> parse(std::string_view text);
    // "app, appData, ..." for help texts and refusals.
    static std::string allNames();
};

} // namespace quarn::ctl
