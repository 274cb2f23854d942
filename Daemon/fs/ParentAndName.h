#pragma once
// A path split into the directory that holds it and its own name, so the
// item can be reached by descriptor (openat(parent) + name) without the last
// component ever being followed.

#include <filesystem>
#include <optional>
#include <string>

namespace quarn {

struct ParentAndName {
    std::filesystem::path parent;
    std::string name;

    // Nothing for paths without a real last name ("", "/", ".", "a/..").
    static std::optional<ParentAndName> of(const std::filesystem::path& path) {
        std::string text = path.string();
        while (text.size() > 1 && text.back() == '/') {
            text.pop_back(); // "dir/" names "dir"
        }
        std::filesystem::path trimmed(text);
        std::string name = trimmed.filename().string();
        if (name.empty() || name == "." || name == ".." || name == "/") {
            return std::nullopt;
        }
        std::filesystem::path parent = trimmed.parent_path();
        if (parent.empty()) {
            parent = ".";
        }
        return ParentAndName{std::move(parent), std::move(name)};
    }
};

} // namespace quarn
