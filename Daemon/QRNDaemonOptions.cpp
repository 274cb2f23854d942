#include "Daemon/QRNDaemonOptions.h"

#include <CLI/CLI.hpp>

#include <algorithm>
#include <sstream>

namespace quarn {

namespace {

constexpr const char* kVersion = "0.1.0";

std::string versionText() {
    return fmt::format("quarnd {} (built {} {})\n", kVersion, __DATE__, __TIME__);
}

} // namespace

std::optional<spdlog::level::level_enum> QRNDaemonOptions::levelNamed(const std::string& name) {
    if (name == "error" || name == "3") {
        return spdlog::level::err;
    }
    if (name == "notice" || name == "5") {
        return spdlog::level::info;
    }
    if (name == "debug" || name == "7") {
        return spdlog::level::debug;
    }
    return std::nullopt;
}

QRNDaemonOptions::Parsed QRNDaemonOptions::parse(int argc, const char* const* argv) {
    return parse(std::vector<std::string>(argv + std::min(argc, 1), argv + argc));
}

QRNDaemonOptions::Parsed QRNDaemonOptions::parse(const std::vector<std::string>& arguments) {
    Parsed parsed;
    CLI::App app("quarnd: the container manager daemon", "quarnd");
    std::string root = "/";
    std::string level = "notice";
    bool version = false;
    app.add_option("--root", root, "Root prefix below which every path is taken")
        ->check(CLI::ExistingDirectory);
    app.add_flag("--foreground", parsed.options.foreground, "Also log to stderr");
    app.add_option("--log-level", level, "error|notice|debug (or 3, 5, 7)")
        ->check([](const std::string& value) {
            return levelNamed(value) ? std::string() : "not one of error, notice, debug, 3, 5, 7";
        });
    app.add_flag("--version", version, "Print the version and exit");

    // CLI11 takes the arguments last first.
    std::vector<std::string> reversed(arguments.rbegin(), arguments.rend());
    try {
        app.parse(reversed);
    } catch (const CLI::ParseError& error) {
        std::ostringstream out;
        // Usage errors all end with 2, whatever kind of error the parser saw.
        parsed.exitStatus = app.exit(error, out, out) == 0 ? 0 : 2;
        parsed.output = out.str();
        return parsed;
    }
    if (version) {
        parsed.exitStatus = 0;
        parsed.output = versionText();
        return parsed;
    }
    std::filesystem::path normal = std::filesystem::absolute(root).lexically_normal();
    if (!normal.has_filename() && normal != normal.root_path()) {
        normal = normal.parent_path(); // no trailing separator
    }
    parsed.options.root = std::move(normal);
    parsed.options.logLevel = *levelNamed(level);
    return parsed;
}

} // namespace quarn
