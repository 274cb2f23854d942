#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/model/QRNContainerClass.h"

namespace quarn {

QRNClientConnection::IdentifierSet QRNClientConnection::_setOfStringsFromArray(const Value& array) {
    IdentifierSet strings;
    if (const Value::Array* elements = array.asArray()) {
        for (const Value& element : *elements) {
            if (const std::string* string = element.asString()) {
                strings.insert(*string);
            }
        }
    }
    return strings;
}

QRNClientConnection::IdentifierSetPtr
QRNClientConnection::_lookupForContainerClass(std::uint64_t containerClass) {
    if (!QRNContainerClass::isValid(containerClass) || !lookup_) {
        return nullptr;
    }
    const std::string_view shortName = QRNContainerClass::shortName(containerClass);
    std::lock_guard guard(lookupCacheMutex_);
    if (auto it = lookupCache_.find(shortName); it != lookupCache_.end()) {
        return it->second;
    }
    // Only an array grants anything; a value of another type grants nothing.
    const Value* granted = lookup_->get(shortName);
    auto identifiers = std::make_shared<const IdentifierSet>(
        granted ? _setOfStringsFromArray(*granted) : IdentifierSet{});
    lookupCache_.emplace(std::string(shortName), identifiers);
    return identifiers;
}

bool QRNClientConnection::isEntitledForLookupWithClass(std::uint64_t containerClass,
                                                       std::string_view identifier) {
    const IdentifierSetPtr identifiers = _lookupForContainerClass(containerClass);
    return identifiers && identifiers->contains(identifier);
}

} // namespace quarn
