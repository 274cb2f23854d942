#pragma once
// The text form of replies: aligned "field  value" lines for one container,
// one line per item for lists, values in the JSON convention when they are
// not plain text.

#include "Client/QRNClientReplies.h"

#include <map>
#include <ostream>
#include <string>
#include <utility>
#include <vector>

namespace quarn::ctl {

class ReplyPrinter {
public:
    explicit ReplyPrinter(std::ostream& out) : out_(out) {}

    void container(const QRNContainerReply& reply);
    void containerList(const QRNContainerList& list);
    void metadata(const QRNMetadataReply& reply);
    void groupContainers(const QRNGroupContainers& groups);
    // Strings as they are; anything else in the JSON convention.
    void value(const Value& value);
    void lines(const std::vector<std::string>& lines);
    void line(const std::string& text);

private:
    using Fields = std::vector<std::pair<std::string, std::string>>;
    void fields(const Fields& fields);
    void table(const std::map<std::string, std::string>& rows);

    std::ostream& out_;
};

} // namespace quarn::ctl
