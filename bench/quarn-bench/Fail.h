#pragma once
// The tool stops at the first thing that goes wrong: a figure measured on a
// half-working setup would be worse than none.

#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>
#include <utility>

namespace quarn::loadbench {

template <class... Args>
[[noreturn]] void fail(fmt::format_string<Args...> format, Args&&... args) {
    std::fprintf(stderr, "quarn-bench: %s\n",
                 fmt::format(format, std::forward<Args>(args)...).c_str());
    std::exit(1);
}

} // namespace quarn::loadbench
