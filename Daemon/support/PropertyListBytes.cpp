#include "Daemon/support/PropertyListBytes.h"

#include <algorithm>
#include <cstring>
#include <string_view>
#include <vector>

namespace quarn {

namespace {

constexpr std::string_view kBinaryMagic = "bplist00";
constexpr std::size_t kTrailerSize = 32;

std::uint64_t readBigEndian(const std::uint8_t* p, std::size_t n) {
    std::uint64_t v = 0;
    for (std::size_t i = 0; i < n; ++i) {
        v = (v << 8) | p[i];
    }
    return v;
}

// The trailer of a binary list, checked so that every offset-table read is
// inside the data.
struct Trailer {
    std::size_t offsetSize;
    std::size_t refSize;
    std::uint64_t objectCount;
    std::uint64_t topObject;
    std::uint64_t tableOffset; // the object area is [8, tableOffset)
};

std::optional<Trailer> readTrailer(std::span<const std::uint8_t> b) {
    if (b.size() < kBinaryMagic.size() + 1 + kTrailerSize) {
        return std::nullopt;
    }
    const std::uint8_t* t = b.data() + b.size() - kTrailerSize;
    Trailer tr{t[6], t[7], readBigEndian(t + 8, 8), readBigEndian(t + 16, 8),
               readBigEndian(t + 24, 8)};
    std::uint64_t objectsEnd = b.size() - kTrailerSize;
    if (tr.offsetSize < 1 || tr.offsetSize > 8 || tr.refSize < 1 || tr.refSize > 8 ||
        tr.objectCount == 0 || tr.topObject >= tr.objectCount ||
        tr.tableOffset <= kBinaryMagic.size() || tr.tableOffset > objectsEnd ||
        tr.objectCount > (objectsEnd - tr.tableOffset) / tr.offsetSize) {
        return std::nullopt;
    }
    return tr;
}

class BinaryScan {
public:
    BinaryScan(std::span<const std::uint8_t> b, const Trailer& t) : b_(b), t_(t) {}

    std::optional<std::uint64_t> offsetOf(std::uint64_t object) const {
        std::uint64_t o =
            readBigEndian(b_.data() + t_.tableOffset + object * t_.offsetSize, t_.offsetSize);
        if (o < kBinaryMagic.size() || o >= t_.tableOffset) {
            return std::nullopt;
        }
        return o;
    }

    // The references an object holds: where they start and how many.
    struct Refs {
        std::uint64_t at = 0;
        std::uint64_t count = 0;
    };
    std::optional<Refs> refsOf(std::uint64_t object) const {
        auto offset = offsetOf(object);
        if (!offset) {
            return std::nullopt;
        }
        std::uint8_t marker = b_[*offset];
        unsigned type = marker >> 4;
        if (type != 0xA && type != 0xC && type != 0xD) {
            return Refs{};
        }
        std::uint64_t p = *offset + 1;
        std::uint64_t count = marker & 0xF;
        if (count == 0xF) { // the count follows as an integer object
            if (p >= t_.tableOffset || (b_[p] >> 4) != 0x1 || (b_[p] & 0xF) > 3) {
                return std::nullopt;
            }
            std::uint64_t n = 1u << (b_[p] & 0xF);
            if (p + 1 + n > t_.tableOffset) {
                return std::nullopt;
            }
            count = readBigEndian(b_.data() + p + 1, n);
            p += 1 + n;
        }
        std::uint64_t perEntry = type == 0xD ? 2 : 1; // dictionaries: keys, then values
        if (count > (t_.tableOffset - p) / t_.refSize / perEntry) {
            return std::nullopt;
        }
        return Refs{p, count * perEntry};
    }

    std::uint64_t ref(const Refs& r, std::uint64_t i) const {
        return readBigEndian(b_.data() + r.at + i * t_.refSize, t_.refSize);
    }

private:
    std::span<const std::uint8_t> b_;
    Trailer t_;
};

// Depth-first over the object graph from the top object, computing each
// object's expanded size once, so shared objects cost nothing extra here.
std::optional<std::string> binaryProblem(std::span<const std::uint8_t> b,
                                         const PropertyListLimits& limits) {
    auto trailer = readTrailer(b);
    if (!trailer) {
        return "binary property list with a malformed trailer";
    }
    if (trailer->objectCount > limits.maxObjects) {
        return "binary property list with too many objects";
    }
    BinaryScan scan(b, *trailer);
    enum : std::uint8_t { kUnseen, kOpen, kDone };
    std::vector<std::uint8_t> state(trailer->objectCount, kUnseen);
    std::vector<std::uint64_t> weight(trailer->objectCount, 0);
    struct Frame {
        std::uint64_t object;
        BinaryScan::Refs refs;
        std::uint64_t next = 0;
        std::uint64_t weight = 1;
    };
    std::vector<Frame> stack;
    auto push = [&](std::uint64_t object) -> bool {
        auto refs = scan.refsOf(object);
        if (!refs) {
            return false;
        }
        state[object] = kOpen;
        stack.push_back(Frame{object, *refs});
        return true;
    };
    if (!push(trailer->topObject)) {
        return "binary property list with an object outside the data";
    }
    while (!stack.empty()) {
        Frame& f = stack.back();
        if (f.next == f.refs.count) {
            std::uint64_t done = f.weight;
            state[f.object] = kDone;
            weight[f.object] = done;
            stack.pop_back();
            if (!stack.empty()) {
                stack.back().weight += done;
                if (stack.back().weight > limits.maxObjects) {
                    return "binary property list with too many objects once expanded";
                }
            }
            continue;
        }
        std::uint64_t child = scan.ref(f.refs, f.next++);
        if (child >= trailer->objectCount) {
            return "binary property list with a reference outside the object table";
        }
        if (state[child] == kOpen) {
            return "binary property list with a reference cycle";
        }
        if (state[child] == kDone) {
            f.weight += weight[child];
            if (f.weight > limits.maxObjects) {
                return "binary property list with too many objects once expanded";
            }
            continue;
        }
        if (stack.size() >= limits.maxDepth) {
            return "binary property list nested too deeply";
        }
        if (!push(child)) {
            return "binary property list with an object outside the data";
        }
    }
    return std::nullopt;
}

bool startsWith(std::string_view text, std::size_t at, std::string_view prefix) {
    return text.compare(at, prefix.size(), prefix) == 0;
}

// Skips past `terminator` from `at`; the end of the text when it is missing.
std::size_t skipPast(std::string_view text, std::size_t at, std::string_view terminator) {
    auto found = text.find(terminator, at);
    return found == std::string_view::npos ? text.size() : found + terminator.size();
}

// Counts container nesting and elements by tags. Comments, CDATA and
// declarations are skipped as the parser skips them.
std::optional<std::string> xmlProblem(std::string_view x, const PropertyListLimits& limits) {
    std::size_t depth = 0, elements = 0, i = 0;
    while ((i = x.find('<', i)) != std::string_view::npos) {
        if (startsWith(x, i, "<!--")) {
            i = skipPast(x, i + 4, "-->");
            continue;
        }
        if (startsWith(x, i, "<![CDATA[")) {
            i = skipPast(x, i + 9, "]]>");
            continue;
        }
        if (startsWith(x, i, "<?") || startsWith(x, i, "<!")) {
            i = skipPast(x, i + 2, ">");
            continue;
        }
        bool closing = startsWith(x, i, "</");
        std::size_t nameStart = i + (closing ? 2 : 1);
        std::size_t end = x.find('>', nameStart);
        if (end == std::string_view::npos) {
            break; // unterminated: the parser rejects it
        }
        std::string_view tag = x.substr(nameStart, end - nameStart);
        std::string_view name = tag.substr(0, tag.find_first_of(" \t\r\n/"));
        bool container = name == "array" || name == "dict";
        if (closing) {
            depth -= container && depth > 0;
        } else {
            if (++elements > limits.maxObjects) {
                return "XML property list with too many elements";
            }
            if (container && !tag.ends_with('/') && ++depth >= limits.maxDepth) {
                return "XML property list nested too deeply";
            }
        }
        i = end + 1;
    }
    return std::nullopt;
}

} // namespace

bool isBinaryPropertyList(std::span<const std::uint8_t> bytes) {
    return bytes.size() >= kBinaryMagic.size() &&
           std::memcmp(bytes.data(), kBinaryMagic.data(), kBinaryMagic.size()) == 0;
}

std::optional<std::string> propertyListBytesProblem(std::span<const std::uint8_t> bytes,
                                                    const PropertyListLimits& limits) {
    if (isBinaryPropertyList(bytes)) {
        return binaryProblem(bytes, limits);
    }
    std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
    return xmlProblem(text, limits);
}

namespace {

// The top object's marker byte and the bytes after it, up to the offset table.
std::optional<std::span<const std::uint8_t>> topObject(std::span<const std::uint8_t> bytes) {
    if (!isBinaryPropertyList(bytes)) {
        return std::nullopt;
    }
    auto trailer = readTrailer(bytes);
    if (!trailer) {
        return std::nullopt;
    }
    auto offset = BinaryScan(bytes, *trailer).offsetOf(trailer->topObject);
    if (!offset) {
        return std::nullopt;
    }
    return bytes.subspan(*offset, trailer->tableOffset - *offset);
}

} // namespace

bool binaryTopObjectIsWideInteger(std::span<const std::uint8_t> bytes) {
    auto top = topObject(bytes);
    return top && (*top)[0] == 0x14; // integer, 2^4 bytes
}

std::optional<double> binaryTopObjectDate(std::span<const std::uint8_t> bytes) {
    auto top = topObject(bytes);
    if (!top || top->size() < 9 || (*top)[0] != 0x33) { // date: an 8-byte big-endian double
        return std::nullopt;
    }
    std::uint64_t bits = readBigEndian(top->data() + 1, 8);
    double seconds;
    std::memcpy(&seconds, &bits, sizeof seconds);
    return seconds;
}

} // namespace quarn
