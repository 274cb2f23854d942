#include "Client/quarnctl/ReplyPrinter.h"

#include "Client/quarnctl/JsonConvention.h"

#include <algorithm>
#include <iomanip>

namespace quarn::ctl {

namespace {

const char* yesNo(bool flag) {
    return flag ? "yes" : "no";
}

} // namespace

void ReplyPrinter::fields(const Fields& fields) {
    std::size_t width = 0;
    for (const auto& [name, text] : fields) {
        width = std::max(width, name.size());
    }
    for (const auto& [name, text] : fields) {
        out_ << std::left << std::setw(static_cast<int>(width + 2)) << name << text << '\n';
    }
}

void ReplyPrinter::table(const std::map<std::string, std::string>& rows) {
    Fields fields(rows.begin(), rows.end());
    this->fields(fields);
}

void ReplyPrinter::container(const QRNContainerReply& reply) {
    Fields out = {{"path", reply.path},
                  {"uuid", reply.uuid.string()},
                  {"identifier", reply.identifier},
                  {"existed", yesNo(reply.existed)}};
    if (reply.personaUniqueString) {
        out.emplace_back("persona", *reply.personaUniqueString);
    }
    if (reply.sandboxToken) {
        out.emplace_back("sandbox token", *reply.sandboxToken);
    }
    fields(out);
}

void ReplyPrinter::containerList(const QRNContainerList& list) {
    for (std::size_t i = 0; i < list.identifiers.size(); ++i) {
        out_ << list.uuids[i].string() << "  " << list.identifiers[i] << '\n';
    }
    if (!list.personaUniqueStrings.empty()) {
        out_ << "personas:";
        for (const auto& persona : list.personaUniqueStrings) {
            out_ << ' ' << persona;
        }
        out_ << '\n';
    }
}

void ReplyPrinter::metadata(const QRNMetadataReply& reply) {
    Fields out = {{"path", reply.path}, {"transient", yesNo(reply.transient)}};
    if (reply.personaUniqueString) {
        out.emplace_back("persona", *reply.personaUniqueString);
    }
    if (reply.sandboxToken) {
        out.emplace_back("sandbox token", *reply.sandboxToken);
    }
    if (reply.infoDictionary) {
        out.emplace_back("info", JsonConvention::print(*reply.infoDictionary, -1));
    }
    fields(out);
}

void ReplyPrinter::groupContainers(const QRNGroupContainers& groups) {
    table(groups.paths);
    if (!groups.sandboxTokens.empty()) {
        out_ << "sandbox tokens:\n";
        table(groups.sandboxTokens);
    }
    if (!groups.personaUniqueStrings.empty()) {
        out_ << "personas:\n";
        table(groups.personaUniqueStrings);
    }
}

void ReplyPrinter::value(const Value& value) {
    if (const auto* text = value.asString()) {
        out_ << *text << '\n';
    } else {
        out_ << JsonConvention::print(value) << '\n';
    }
}

void ReplyPrinter::lines(const std::vector<std::string>& lines) {
    for (const auto& text : lines) {
        out_ << text << '\n';
    }
}

void ReplyPrinter::line(const std::string& text) {
    out_ << text << '\n';
}

} // namespace quarn::ctl
