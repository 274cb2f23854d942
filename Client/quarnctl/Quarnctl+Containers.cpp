// Subcommands on one container or one class: create, lookup, list, delete,
// metadata, usage, info get and info set.

#include "Client/quarnctl/ContainerClassName.h"
#include "Client/quarnctl/JsonConvention.h"
#include "Client/quarnctl/Quarnctl.h"

namespace quarn::ctl {

Quarnctl::TextPrinter Quarnctl::silent() {
    return [](const Value& reply, ReplyPrinter&) { return QRNClientReplies::status(reply); };
}

void Quarnctl::addCreateAndLookupCommands() {
    for (bool create : {true, false}) {
        auto* command =
            create ? app_.add_subcommand("create", "Create a container, or find the one there is")
                   : app_.add_subcommand("lookup", "Find a container; never creates one");
        auto& args = containerArgs(command, false, true);
        args.identifierOption =
            addIdentifier(command, args.identifier, "Identifier (default: quarnctl's own)");
        command->callback([this, &args, create] {
            action_ = [this, &args, create] {
                auto ref = args.ref();
                return exchange(QRNClientRequests::createOrLookup(
                                    ref.identifier, ref.containerClass, create, args.transient),
                                printing(QRNClientReplies::container,
                                         [](ReplyPrinter& p, const auto& r) { p.container(r); }));
            };
        });
    }
}

void Quarnctl::addListAndDeleteCommands() {
    auto* list = app_.add_subcommand("list", "List the containers of a class");
    auto& listArgs = containerArgs(list, false, true);
    list->callback([this, &listArgs] {
        action_ = [this, &listArgs] {
            return exchange(QRNClientRequests::containersOfClass(listArgs.ref().containerClass,
                                                                 listArgs.transient),
                            printing(QRNClientReplies::containerList,
                                     [](ReplyPrinter& p, const auto& r) { p.containerList(r); }));
        };
    });

    auto* remove = app_.add_subcommand("delete", "Delete a container (through death row)");
    auto& removeArgs = containerArgs(remove, false, true);
    removeArgs.identifierOption = addIdentifier(remove, removeArgs.identifier, "Identifier");
    remove->callback([this, &removeArgs] {
        action_ = [this, &removeArgs] {
            auto ref = removeArgs.ref();
            return exchange(QRNClientRequests::deleteContainer(ref.identifier, ref.containerClass,
                                                               removeArgs.transient),
                            silent());
        };
    });
}

void Quarnctl::addMetadataAndUsageCommands() {
    auto* metadata =
        app_.add_subcommand("metadata", "Path, transient flag and info of a container");
    auto& metadataArgs = containerArgs(metadata, true, false);
    metadataArgs.identifierOption = addIdentifier(metadata, metadataArgs.identifier, "Identifier");
    auto& withInfo = flags_.emplace_back(false);
    metadata->add_flag("--info", withInfo, "Include the info dictionary");
    metadata->callback([this, &metadataArgs, &withInfo] {
        action_ = [this, &metadataArgs, &withInfo] {
            return exchange(QRNClientRequests::metadata(metadataArgs.ref(), withInfo),
                            printing(QRNClientReplies::metadata,
                                     [](ReplyPrinter& p, const auto& r) { p.metadata(r); }));
        };
    });

    auto* usage = app_.add_subcommand("usage", "Disk usage of a container in bytes");
    auto& usageArgs = containerArgs(usage, true, false);
    usageArgs.identifierOption = addIdentifier(usage, usageArgs.identifier, "Identifier");
    usage->callback([this, &usageArgs] {
        action_ = [this, &usageArgs] {
            return exchange(QRNClientRequests::diskUsage(usageArgs.ref()),
                            printing(QRNClientReplies::diskUsage, [](ReplyPrinter& p, auto bytes) {
                                p.line(std::to_string(bytes));
                            }));
        };
    });
}

void Quarnctl::addInfoCommands() {
    auto* info = app_.add_subcommand("info", "Get or set a value of a container's info dictionary");
    info->require_subcommand(1);

    auto* get = info->add_subcommand("get", "Print one info value");
    auto& getArgs = containerArgs(get, true, false);
    auto& getKey = strings_.emplace_back();
    getArgs.identifierOption = addIdentifier(get, getArgs.identifier, "Identifier")->required();
    get->add_option("key", getKey, "Key")->required();
    get->callback([this, &getArgs, &getKey] {
        action_ = [this, &getArgs, &getKey] {
            return exchange(QRNClientRequests::infoValue(getArgs.ref(), getKey),
                            printing(QRNClientReplies::infoValue,
                                     [](ReplyPrinter& p, const Value& v) { p.value(v); }));
        };
    });

    auto* set = info->add_subcommand("set", "Set one info value (a string unless --json-value)");
    auto& setArgs = containerArgs(set, true, false);
    auto& setKey = strings_.emplace_back();
    auto& setValue = strings_.emplace_back();
    setArgs.identifierOption = addIdentifier(set, setArgs.identifier, "Identifier")->required();
    set->add_option("key", setKey, "Key")->required();
    set->add_option("value", setValue, "Value")->required();
    auto& valueIsJson = flags_.emplace_back(false);
    set->add_flag("--json-value", valueIsJson, "Read the value as JSON");
    set->callback([this, &setArgs, &setKey, &setValue, &valueIsJson] {
        action_ = [this, &setArgs, &setKey, &setValue, &valueIsJson]() -> int {
            Value value(setValue);
            if (valueIsJson) {
                auto parsed = JsonConvention::parse(setValue);
                if (!parsed) {
                    err_ << "quarnctl: " << parsed.error().message << '\n';
                    return kUsage;
                }
                value = std::move(*parsed);
            }
            return exchange(QRNClientRequests::setInfoValue(setArgs.ref(), setKey, value),
                            silent());
        };
    });
}

} // namespace quarn::ctl
