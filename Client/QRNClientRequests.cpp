#include "Client/QRNClientRequests.h"

namespace quarn {

Value QRNClientRequests::command(QRNClientCommand number) {
    Value request = Value::dictionary();
    request.set("Command", static_cast<std::uint64_t>(number));
    return request;
}

Value QRNClientRequests::withIdentifier(QRNClientCommand number,
                                        const std::optional<std::string>& identifier) {
    Value request = command(number);
    if (identifier) {
        request.set("Identifier", *identifier);
    }
    return request;
}

Value QRNClientRequests::withContainer(QRNClientCommand number, const QRNContainerRef& container) {
    Value request = withIdentifier(number, container.identifier);
    request.set("ContainerClass", container.containerClass);
    if (container.uuid) {
        request.set("UUID", *container.uuid);
    }
    return request;
}

Value QRNClientRequests::createOrLookup(const std::optional<std::string>& identifier,
                                        std::uint64_t containerClass, bool createIfNecessary,
                                        bool transient) {
    Value request = withIdentifier(QRNClientCommand::CreateOrLookup, identifier);
    request.set("ContainerClass", containerClass);
    request.set("CreateIfNecessary", createIfNecessary);
    request.set("Transient", transient);
    return request;
}

Value QRNClientRequests::containersOfClass(std::uint64_t containerClass, bool transient) {
    Value request = command(QRNClientCommand::ContainersOfClass);
    request.set("ContainerClass", containerClass);
    request.set("Transient", transient);
    return request;
}

Value QRNClientRequests::stageForDelete(std::span<const QRNStagedContainer> containers) {
    Value classes = Value::array(), uuids = Value::array(), identifiers = Value::array(),
          personas = Value::array();
    for (const auto& container : containers) {
        classes.append(container.containerClass);
        uuids.append(container.uuid);
        identifiers.append(container.identifier);
        personas.append(container.personaUniqueString);
    }
    Value request = command(QRNClientCommand::StageForDelete);
    request.set("ContainerClassesArray", std::move(classes));
    request.set("UUIDsArray", std::move(uuids));
    request.set("IdentifiersArray", std::move(identifiers));
    request.set("PersonaUniqueStringsArray", std::move(personas));
    return request;
}

Value QRNClientRequests::deleteContainersOnDeathRow() {
    return command(QRNClientCommand::DeleteContainersOnDeathRow);
}

Value QRNClientRequests::setInfoValue(const QRNContainerRef& container, const std::string& key,
                                      Value value) {
    Value request = withContainer(QRNClientCommand::SetInfoValue, container);
    request.set("Key", key);
    request.set("Value", std::move(value));
    return request;
}

Value QRNClientRequests::infoValue(const QRNContainerRef& container, const std::string& key) {
    Value request = withContainer(QRNClientCommand::GetInfoValue, container);
    request.set("Key", key);
    return request;
}

Value QRNClientRequests::metadata(const QRNContainerRef& container, bool infoDictRequested) {
    Value request = withContainer(QRNClientCommand::Metadata, container);
    request.set("InfoDictRequested", infoDictRequested);
    return request;
}

Value QRNClientRequests::recreateDefaultStructure(const QRNContainerRef& container,
                                                  QRNClientCommand number) {
    return withContainer(number, container);
}

Value QRNClientRequests::regenerateDirectoryUUID(const QRNContainerRef& container) {
    return withContainer(QRNClientCommand::RegenerateDirectoryUUID, container);
}

Value QRNClientRequests::deleteContainer(const std::optional<std::string>& identifier,
                                         std::uint64_t containerClass, bool transient) {
    Value request = withIdentifier(QRNClientCommand::DeleteContainer, identifier);
    request.set("ContainerClass", containerClass);
    request.set("Transient", transient);
    return request;
}

Value QRNClientRequests::groupContainers(const std::optional<std::string>& owner) {
    return withIdentifier(QRNClientCommand::GroupContainers, owner);
}

Value QRNClientRequests::groupIdentifiers(const std::optional<std::string>& owner) {
    return withIdentifier(QRNClientCommand::GroupIdentifiers, owner);
}

Value QRNClientRequests::systemContainerPath(const std::optional<std::string>& identifier) {
    return withIdentifier(QRNClientCommand::SystemContainerPath, identifier);
}

Value QRNClientRequests::systemGroupContainers(const std::optional<std::string>& owner) {
    return withIdentifier(QRNClientCommand::SystemGroupContainers, owner);
}

Value QRNClientRequests::systemGroupContainerPath(const std::string& groupIdentifier) {
    Value request = command(QRNClientCommand::SystemGroupContainerPath);
    request.set("GroupIdentifier", groupIdentifier);
    return request;
}

Value QRNClientRequests::diskUsage(const QRNContainerRef& container) {
    return withContainer(QRNClientCommand::DiskUsage, container);
}

Value QRNClientRequests::retired() {
    return command(QRNClientCommand::Retired);
}

Value QRNClientRequests::personaUniqueStrings() {
    return command(QRNClientCommand::PersonaUniqueStrings);
}

} // namespace quarn
