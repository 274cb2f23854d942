// Subcommands on group and system containers, and the persona list.

#include "Client/quarnctl/Quarnctl.h"

namespace quarn::ctl {

namespace {

std::optional<std::string> given(const CLI::Option* option, const std::string& value) {
    return option->count() > 0 ? std::optional(value) : std::nullopt;
}

} // namespace

void Quarnctl::addGroupCommands() {
    auto* groups = app_.add_subcommand("groups", "App group containers of an owner");
    auto& owner = strings_.emplace_back();
    auto* ownerOption = addIdentifier(groups, owner, "Owner identifier (default: quarnctl's own)");
    auto& system = flags_.emplace_back(false);
    auto& identifiers = flags_.emplace_back(false);
    groups->add_flag("--system", system, "System group containers instead")
        ->excludes(groups->add_flag("--identifiers", identifiers, "Only the group identifiers"));
    groups->callback([this, &owner, ownerOption, &system, &identifiers] {
        action_ = [this, &owner, ownerOption, &system, &identifiers] {
            auto who = given(ownerOption, owner);
            if (identifiers) {
                return exchange(QRNClientRequests::groupIdentifiers(who),
                                printing(
                                    [](const Value& reply) {
                                        return QRNClientReplies::strings(
                                            reply, "ReplyGroupIdentifiersArray");
                                    },
                                    [](ReplyPrinter& p, const auto& r) { p.lines(r); }));
            }
            return exchange(system ? QRNClientRequests::systemGroupContainers(who)
                                   : QRNClientRequests::groupContainers(who),
                            printing(QRNClientReplies::groupContainers,
                                     [](ReplyPrinter& p, const auto& r) { p.groupContainers(r); }));
        };
    });
}

void Quarnctl::addPathCommands() {
    auto* systemPath = app_.add_subcommand("system-path", "Path of a system container");
    auto& systemId = strings_.emplace_back();
    auto* systemIdOption =
        addIdentifier(systemPath, systemId, "Identifier (default: quarnctl's own)");
    systemPath->callback([this, &systemId, systemIdOption] {
        action_ = [this, &systemId, systemIdOption] {
            return exchange(QRNClientRequests::systemContainerPath(given(systemIdOption, systemId)),
                            printing(QRNClientReplies::path,
                                     [](ReplyPrinter& p, const auto& r) { p.line(r); }));
        };
    });

    auto* groupPath = app_.add_subcommand("system-group-path", "Path of a system group container");
    auto& groupId = strings_.emplace_back();
    groupPath->add_option("group", groupId, "System group identifier")->required();
    groupPath->callback([this, &groupId] {
        action_ = [this, &groupId] {
            return exchange(QRNClientRequests::systemGroupContainerPath(groupId),
                            printing(QRNClientReplies::path,
                                     [](ReplyPrinter& p, const auto& r) { p.line(r); }));
        };
    });

    auto* personas = app_.add_subcommand("personas", "Persona strings quarnctl may reach");
    personas->callback([this] {
        action_ = [this] {
            return exchange(QRNClientRequests::personaUniqueStrings(),
                            printing(
                                [](const Value& reply) {
                                    return QRNClientReplies::strings(
                                        reply, "ReplyPersonaUniqueStringsArray");
                                },
                                [](ReplyPrinter& p, const auto& r) { p.lines(r); }));
        };
    });
}

} // namespace quarn::ctl
