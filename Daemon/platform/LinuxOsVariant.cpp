#include "Daemon/platform/LinuxOsVariant.h"

#include "Daemon/platform/ConfigFile.h"
#include "Daemon/support/Log.h"

#include <cstring>

namespace quarn {

namespace {

bool isKeyStart(char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || c == '_';
}

bool isValidKey(std::string_view key) {
    if (key.empty() || !isKeyStart(key.front())) {
        return false;
    }
    for (char c : key) {
        if (!isKeyStart(c) && !(c >= '0' && c <= '9')) {
            return false;
        }
    }
    return true;
}

// Inside double quotes only these lose their backslash, as in the shell.
bool isDoubleQuoteEscape(char c) {
    return c == '"' || c == '\\' || c == '$' || c == '`';
}

// `text` starts after the opening quote. Returns the value and what follows
// the closing quote, or nullopt when the quote is never closed.
std::optional<std::pair<std::string, std::string_view>> unquote(std::string_view text, char quote) {
    std::string value;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char c = text[i];
        if (c == quote) {
            return std::pair{std::move(value), text.substr(i + 1)};
        }
        if (c == '\\' && quote == '"' && i + 1 < text.size()) {
            const char next = text[++i];
            if (!isDoubleQuoteEscape(next)) {
                value += '\\';
            }
            value += next;
            continue;
        }
        value += c;
    }
    return std::nullopt;
}

std::string unescapeBare(std::string_view text) {
    std::string value;
    for (std::size_t i = 0; i < text.size(); ++i) {
        char c = text[i];
        if (c == '\\') {
            if (i + 1 == text.size()) {
                break; // a trailing backslash escapes nothing
            }
            c = text[++i];
        }
        value += c;
    }
    return value;
}

// The value part of an assignment, already trimmed.
std::optional<std::string> parseValue(std::string_view text) {
    if (text.empty() || (text.front() != '"' && text.front() != '\'')) {
        return unescapeBare(text);
    }
    auto quoted = unquote(text.substr(1), text.front());
    // Joined quoted pieces ("a"'b') are not supported: such a line is malformed.
    if (!quoted || !ConfigFile::trimmed(quoted->second).empty()) {
        return std::nullopt;
    }
    return std::move(quoted->first);
}

void parseLine(std::string_view line, LinuxOsVariant::Fields& fields) {
    line = ConfigFile::trimmed(line);
    const auto equals = line.find('=');
    if (line.empty() || line.front() == '#' || equals == std::string_view::npos) {
        return;
    }
    const auto key = ConfigFile::trimmed(line.substr(0, equals));
    if (!isValidKey(key)) {
        return;
    }
    if (auto value = parseValue(ConfigFile::trimmed(line.substr(equals + 1)))) {
        fields.insert_or_assign(std::string(key), std::move(*value));
    }
}

} // namespace

LinuxOsVariant::LinuxOsVariant(Paths paths) : paths_(std::move(paths)) {}

LinuxOsVariant::Fields LinuxOsVariant::parseOsRelease(std::string_view contents) {
    Fields fields;
    while (!contents.empty()) {
        const auto newline = contents.find('\n');
        parseLine(contents.substr(0, newline), fields);
        if (newline == std::string_view::npos) {
            break;
        }
        contents.remove_prefix(newline + 1);
    }
    return fields;
}

LinuxOsVariant::Fields LinuxOsVariant::readFields() const {
    // Read every time: the answer follows the file, and callers that want
    // it fixed for the process keep their own copy.
    for (const char* candidate : {"/etc/os-release", "/usr/lib/os-release"}) {
        const auto path = paths_.resolve(candidate);
        auto contents = ConfigFile::read(path);
        if (contents) {
            return parseOsRelease(*contents);
        }
        if (contents.error() != ENOENT) {
            // Only an absent file gives way to the vendor's; a broken one is no answer.
            QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to read {}: {}", path.string(),
                          std::strerror(contents.error()));
            break;
        }
    }
    return {};
}

bool LinuxOsVariant::hasInternalContent(std::string_view) const {
    const auto fields = readFields();
    const auto variant = fields.find("VARIANT_ID");
    return variant != fields.end() && variant->second == "internal";
}

Value LinuxOsVariant::versionDictionary() const {
    static constexpr std::pair<const char*, const char*> kKeys[] = {
        {"BuildID", "BUILD_ID"}, {"VersionID", "VERSION_ID"}, {"VariantID", "VARIANT_ID"}};
    const auto fields = readFields();
    Value dictionary = Value::dictionary();
    for (const auto& [key, field] : kKeys) {
        if (auto it = fields.find(field); it != fields.end()) {
            dictionary.set(key, it->second);
        }
    }
    return dictionary;
}

std::optional<std::string> LinuxOsVariant::buildVersion() const {
    const auto fields = readFields();
    if (auto it = fields.find("BUILD_ID"); it != fields.end()) {
        return it->second;
    }
    return std::nullopt;
}

} // namespace quarn
