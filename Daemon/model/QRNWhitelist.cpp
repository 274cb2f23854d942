#include "Daemon/model/QRNWhitelist.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/Value.h"

#include <utility>

namespace quarn {

namespace {

using Dictionary = Value::Dictionary;
using Array = Value::Array;

// Well-known containers are named by their identifiers.
constexpr const char* kSystemContainers[] = {"com.orvex.devicesettings", "com.orvex.accountsd"};
constexpr const char* kSystemGroupContainers[] = {
    "systemgroup.com.orvex.deviceprofiles", "systemgroup.com.orvex.netconfig",
    "systemgroup.com.orvex.pairing",        "systemgroup.com.orvex.credentials",
    "systemgroup.com.orvex.diagnostics",    "systemgroup.com.orvex.mediaindex",
    "systemgroup.com.orvex.installation",   "systemgroup.com.orvex.telemetry"};

// Class number -> identifiers any client may look up.
Value openLookupTable() {
    return Value(Dictionary{{"13", Array{"systemgroup.com.orvex.diagnostics"}}});
}

// Code-signing identifier -> class number -> identifiers; none means all.
Value lookupExceptionTable() {
    const Value all;
    return Value(Dictionary{
        {"com.orvex.backupd", all},
        {"com.orvex.settings", Dictionary{{"2", all}, {"7", all}}},
        {"com.orvex.diagnosticsd", Dictionary{{"12", all}, {"13", all}}},
        {"com.orvex.searchd", Dictionary{{"2", Array{"com.orvex.notes", "com.orvex.mail"}}}},
        {"com.orvex.mediasyncd", Dictionary{{"2", all}}},
        {"com.orvex.accountsd", Dictionary{{"12", Array{"com.orvex.accountsd"}}}},
        {"com.orvex.homescreen", Dictionary{{"10", all}}},
        {"com.orvex.filesd",
         Dictionary{{"7", all}, {"13", Array{"systemgroup.com.orvex.mediaindex"}}}},
        {"com.orvex.pairingd", Dictionary{{"13", Array{"systemgroup.com.orvex.pairing"}}}},
    });
}

template <std::size_t N>
std::map<std::string, std::string, std::less<>> named(const char* const (&ids)[N]) {
    std::map<std::string, std::string, std::less<>> table;
    for (const char* id : ids) {
        table.emplace(id, id);
    }
    return table;
}

} // namespace

QRNWhitelist::QRNWhitelist()
    : systemWhitelist_(named(kSystemContainers)),
      systemGroupWhitelist_(named(kSystemGroupContainers)),
      openLookupSets_(nodeFromTable(openLookupTable())),
      lookupExceptions_(nodeFromTable(lookupExceptionTable())) {}

QRNWhitelist::~QRNWhitelist() = default;

QRNWhitelist& QRNWhitelist::sharedWhitelist() {
    return QRNDaemonContext::current().instance<QRNWhitelist>();
}

std::unique_ptr<QRNWhitelist::Node> QRNWhitelist::nodeFromTable(const Value& table) {
    auto root = std::make_unique<Node>();
    std::vector<std::pair<const Value*, Node*>> pending{{&table, root.get()}};
    while (!pending.empty()) {
        auto [value, node] = pending.back();
        pending.pop_back();
        if (const auto* dictionary = value->asDictionary()) {
            node->kind = Node::Kind::Map;
            for (const auto& [key, member] : *dictionary) {
                auto child = std::make_unique<Node>();
                pending.emplace_back(&member, child.get());
                node->children.emplace(key, std::move(child));
            }
        } else if (value->isNone()) {
            node->kind = Node::Kind::Everything;
        } else {
            // An array's strings; any other value is a set that holds nothing.
            node->kind = Node::Kind::Set;
            if (const auto* array = value->asArray()) {
                for (const auto& element : *array) {
                    if (const auto* string = element.asString()) {
                        node->members.insert(*string);
                    }
                }
            }
        }
    }
    return root;
}

const QRNWhitelist::Node* QRNWhitelist::Node::child(std::string_view key) const {
    auto it = children.find(key);
    return it == children.end() ? nullptr : it->second.get();
}

bool QRNWhitelist::Node::contains(std::string_view member) const {
    return kind == Kind::Set && members.find(member) != members.end();
}

std::optional<std::string> QRNWhitelist::entryIn(const WellknownTable& table,
                                                 std::string_view identifier) {
    auto it = table.find(identifier);
    if (it == table.end()) {
        return std::nullopt;
    }
    return it->second;
}

std::vector<std::string> QRNWhitelist::keysOf(const WellknownTable& table) {
    std::vector<std::string> keys;
    keys.reserve(table.size());
    for (const auto& entry : table) {
        keys.push_back(entry.first);
    }
    return keys;
}

std::optional<std::string>
QRNWhitelist::wellknownSystemContainerForId(std::string_view identifier) const {
    return entryIn(systemWhitelist_, identifier);
}

bool QRNWhitelist::systemContainerIdIsWellknown(std::string_view identifier) const {
    return systemWhitelist_.find(identifier) != systemWhitelist_.end();
}

std::vector<std::string> QRNWhitelist::wellknownSystemContainers() const {
    return keysOf(systemWhitelist_);
}

std::optional<std::string>
QRNWhitelist::wellknownSystemGroupContainerForId(std::string_view identifier) const {
    return entryIn(systemGroupWhitelist_, identifier);
}

bool QRNWhitelist::systemGroupContainerIdIsWellknown(std::string_view identifier) const {
    return systemGroupWhitelist_.find(identifier) != systemGroupWhitelist_.end();
}

std::vector<std::string> QRNWhitelist::wellknownSystemGroupContainers() const {
    return keysOf(systemGroupWhitelist_);
}

bool QRNWhitelist::containerIdIsWellknown(std::string_view identifier,
                                          std::uint64_t containerClass) const {
    return wellknownContainerForId(identifier, containerClass).has_value();
}

std::optional<std::string>
QRNWhitelist::wellknownContainerForId(std::string_view identifier,
                                      std::uint64_t containerClass) const {
    switch (containerClass) {
    case kQRNContainerClassSystemData:
        return wellknownSystemContainerForId(identifier);
    case kQRNContainerClassSystemGroup:
        return wellknownSystemGroupContainerForId(identifier);
    default:
        return std::nullopt;
    }
}

bool QRNWhitelist::isLookupWhitelistedFromCodeSignIdentifier(
    std::string_view codeSignIdentifier, std::uint64_t forContainerClass,
    std::string_view containerIdentifier) const {
    if (forContainerClass >= kQRNContainerClassMax) {
        return false;
    }
    const std::string classKey = std::to_string(forContainerClass);
    if (const Node* open = openLookupSets_->child(classKey);
        open != nullptr && open->contains(containerIdentifier)) {
        return true;
    }
    const Node* client = lookupExceptions_->child(codeSignIdentifier);
    if (client == nullptr) {
        return false;
    }
    if (client->kind == Node::Kind::Everything) {
        return true;
    }
    const Node* perClass = client->child(classKey);
    if (perClass == nullptr) {
        return false;
    }
    return perClass->kind == Node::Kind::Everything || perClass->contains(containerIdentifier);
}

} // namespace quarn
