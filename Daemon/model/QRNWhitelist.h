#pragma once
// Well-known containers and lookup exceptions, both fixed platform tables
// built once.
//
// A few system containers (class 12) and system group containers (class 13)
// live under fixed directory names instead of UUIDs. A few platform clients
// may look up containers that their entitlements would not grant: per class
// an optional set of identifiers anyone may look up, and per code-signing
// identifier either every container, or per class every container or a set.

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class Value;

class QRNWhitelist {
public:
    QRNWhitelist();
    ~QRNWhitelist();
    QRNWhitelist(const QRNWhitelist&) = delete;
    QRNWhitelist& operator=(const QRNWhitelist&) = delete;

    // The current daemon context's instance.
    static QRNWhitelist& sharedWhitelist();

    // The directory name of a well-known system container, or none.
    std::optional<std::string> wellknownSystemContainerForId(std::string_view identifier) const;
    bool systemContainerIdIsWellknown(std::string_view identifier) const;
    std::vector<std::string> wellknownSystemContainers() const; // ascending

    std::optional<std::string>
    wellknownSystemGroupContainerForId(std::string_view identifier) const;
    bool systemGroupContainerIdIsWellknown(std::string_view identifier) const;
    std::vector<std::string> wellknownSystemGroupContainers() const; // ascending

    // Class 12 asks the system table, class 13 the system group table; no
    // other class has well-known containers.
    bool containerIdIsWellknown(std::string_view identifier, std::uint64_t containerClass) const;
    std::optional<std::string> wellknownContainerForId(std::string_view identifier,
                                                       std::uint64_t containerClass) const;

    // Whether the client signed as `codeSignIdentifier` may look up the
    // container (an empty identifier has no exceptions of its own).
    bool isLookupWhitelistedFromCodeSignIdentifier(std::string_view codeSignIdentifier,
                                                   std::uint64_t forContainerClass,
                                                   std::string_view containerIdentifier) const;

private:
    // One level of a lookup table with its arrays turned into sets.
    struct Node {
        enum class Kind { Everything, Set, Map };
        Kind kind = Kind::Everything; // the null marker
        std::set<std::string, std::less<>> members;
        std::map<std::string, std::unique_ptr<Node>, std::less<>> children;

        const Node* child(std::string_view key) const;
        bool contains(std::string_view member) const;
    };
    using WellknownTable = std::map<std::string, std::string, std::less<>>;

    // Dictionaries become maps, arrays sets of their strings, none the null
    // marker; walked with an explicit stack so depth costs no call stack.
    static std::unique_ptr<Node> nodeFromTable(const Value& table);
    static std::optional<std::string> entryIn(const WellknownTable& table,
                                              std::string_view identifier);
    static std::vector<std::string> keysOf(const WellknownTable& table);

    WellknownTable systemWhitelist_;
    WellknownTable systemGroupWhitelist_;
    std::unique_ptr<Node> openLookupSets_; // class number -> identifiers anyone may look up
    std::unique_ptr<Node> lookupExceptions_;
};

} // namespace quarn
