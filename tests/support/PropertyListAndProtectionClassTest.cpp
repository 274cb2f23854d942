#include "Daemon/support/Descriptor.h"
#include "Daemon/support/PropertyList.h"
#include "Daemon/support/ProtectionClassAttribute.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <deque>
#include <filesystem>
#include <fstream>
#include <limits>
#include <optional>
#include <random>

using namespace quarn;
namespace fs = std::filesystem;
using P = ProtectionClassAttribute;

namespace {

using Bytes = std::vector<std::uint8_t>;
constexpr std::int64_t k2001 = 978307200LL * 1000000; // microseconds from 1970 to 2001

Bytes bytesOf(std::string_view text) {
    return Bytes(text.begin(), text.end());
}

// A binary list from encoded objects, with two-byte offsets and references,
// for shapes no writer produces.
Bytes binaryFrom(const std::vector<Bytes>& objects) {
    Bytes b = bytesOf("bplist00"), table;
    for (const auto& o : objects) {
        table.insert(table.end(), {static_cast<std::uint8_t>(b.size() >> 8),
                                   static_cast<std::uint8_t>(b.size())});
        b.insert(b.end(), o.begin(), o.end());
    }
    Bytes trailer(32, 0);
    trailer[6] = trailer[7] = 2; // offset and reference sizes; the top object is 0
    for (int i = 0; i < 8; ++i) {
        trailer[15 - i] = static_cast<std::uint8_t>(objects.size() >> (8 * i));
        trailer[31 - i] = static_cast<std::uint8_t>(b.size() >> (8 * i));
    }
    b.insert(b.end(), table.begin(), table.end());
    b.insert(b.end(), trailer.begin(), trailer.end());
    return b;
}

Bytes arrayOf(std::vector<std::uint16_t> refs) {
    Bytes o = {static_cast<std::uint8_t>(0xA0 | refs.size())};
    for (auto r : refs)
        o.insert(o.end(), {static_cast<std::uint8_t>(r >> 8), static_cast<std::uint8_t>(r)});
    return o;
}

// Levels of arrays, each referring `fanOut` times to the next, down to an integer.
Bytes nested(std::uint16_t levels, std::size_t fanOut = 1) {
    std::vector<Bytes> objects;
    for (std::uint16_t i = 1; i < levels; ++i)
        objects.push_back(arrayOf(std::vector<std::uint16_t>(fanOut, i)));
    objects.push_back({0x10, 0x05});
    return binaryFrom(objects);
}

} // namespace

TEST(PropertyList, EveryTypeRoundTripsThroughTheBinaryFormAndIsReadFromXML) {
    UUID uuid = UUID::random();
    Value v = Value::Dictionary{
        {"unsigned", Value::Array{0u, 255u, 65536u, 1ull << 32, UINT64_MAX / 2 + 1, UINT64_MAX}},
        {"signed", Value::Array{-1, -300, std::numeric_limits<std::int64_t>::min()}},
        {"real", Value::Array{0.5, -1e300, 0.0}},
        {"bool", Value::Array{true, false}},
        {"string", Value::Array{"", "h\xC3\xA9llo", std::string(5000, 'x')}},
        {"data", Value::Array{Value::Data{0, 1, 0, 255}, Value::Data{}}},
        {"date", Value::Array{Date{k2001}, Date{k2001 - 250000}, Date{k2001 + 1},
                              Date{631152000LL * 1000000 + 123456}, Date{-631152000LL * 1000000},
                              Date::now()}},
        {"nested",
         Value::Dictionary{{"empty array", Value::array()},
                           {"empty dictionary", Value::dictionary()},
                           {"deeper", Value::Array{Value::Array{Value::Dictionary{{"k", 1u}}}}}}},
        {"", "empty key"},
        {"uuid", uuid},
    };
    Value expected = v;
    expected.set("uuid", uuid.string()); // no property-list type: its canonical string
    auto bytes = binaryPropertyList(v);
    ASSERT_TRUE(bytes) << bytes.error().message;
    Value back = valueFromPropertyListBytes(*bytes).value_or(Value());
    // Integers compare by value: signedness must survive, not just the bits.
    EXPECT_EQ(back, expected) << back.description();

    // Other readers take an 8-byte integer as signed and a 16-byte one as
    // unsigned: check the encoding itself (the object after the header).
    Bytes minusOne = {0x13}, max = {0x14, 0, 0, 0, 0, 0, 0, 0, 0};
    minusOne.resize(9, 0xFF);
    max.resize(17, 0xFF);
    for (const auto& [value, encoded] :
         {std::pair{Value(-1), minusOne}, {Value(UINT64_MAX), max}}) {
        auto bytes = *binaryPropertyList(value);
        EXPECT_EQ(Bytes(bytes.begin() + 8, bytes.begin() + 8 + encoded.size()), encoded);
    }

    // XML is read too.
    auto xml = valueFromPropertyListBytes(bytesOf(R"(<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist PUBLIC "-//Apple//DTD PLIST 1.0//EN" "http://www.apple.com/DTDs/PropertyList-1.0.dtd">
<plist version="1.0"><dict><key>negative</key><integer>-3</integer>
  <key>big</key><integer>18446744073709551615</integer><key>real</key><real>2.5</real>
  <key>yes</key><true/><key>text</key><string>a &amp; b</string><key>data</key><data>AAEC</data>
  <key>date</key><date>2000-06-01T12:00:00Z</date>
  <!-- <array> in a comment is not an element -->
  <key>list</key><array><integer>1</integer><dict/></array></dict></plist>)"));
    ASSERT_TRUE(xml) << xml.error().message;
    Value::Dictionary fromXML = {{"negative", -3},
                                 {"big", UINT64_MAX},
                                 {"real", 2.5},
                                 {"yes", true},
                                 {"text", "a & b"},
                                 {"data", Value::Data{0, 1, 2}},
                                 {"date", Date{959860800LL * 1000000}},
                                 {"list", Value::Array{1u, Value::dictionary()}}};
    EXPECT_EQ(*xml, Value(fromXML));
}

TEST(PropertyList, RefusesValuesWithoutAFormAndBytesThatAreCorruptOrHostile) {
    Value deep = 1u;
    for (int i = 0; i < 300; ++i)
        deep = Value::Array{deep};
    for (const Value& bad : {Value(), Value(std::string("a\0b", 3)),
                             Value(Value::Dictionary{{std::string("k\0", 2), 1u}}),
                             Value(Date{k2001 - 70LL * 365 * 86400 * 1000000}),
                             Value(Date{k2001 + 70LL * 365 * 86400 * 1000000}),
                             Value(Date{std::numeric_limits<std::int64_t>::min()}), deep}) {
        auto r = binaryPropertyList(Value::Array{bad});
        EXPECT_TRUE(!r && r.error().domain == Error::Domain::General &&
                    r.error().code == kGeneralErrorPropertyListWriteInvalid)
            << bad.description();
    }

    // Truncated or corrupt bytes give errors, not crashes.
    auto good = *binaryPropertyList(Value::Dictionary{
        {"a", Value::Array{1u, "two", 3.0, Date{k2001}}}, {"b", Value::Data{1, 2, 3}}});
    for (std::size_t n = 0; n < good.size(); ++n)
        EXPECT_FALSE(valueFromPropertyListBytes(std::span(good.data(), n))) << n;
    // Random corruption of binary and XML lists: any outcome but a crash.
    auto xml = bytesOf("<plist><dict><key>a</key><array><integer>1</integer>"
                       "<string>x</string><date>2001-01-01T00:00:00Z</date><data>AA==</data>"
                       "</array></dict></plist>");
    std::mt19937 random(1234);
    for (const Bytes& base : {good, xml})
        for (int i = 0; i < 3000; ++i) {
            Bytes b = base;
            for (int j = 0; j < 1 + static_cast<int>(random() % 4); ++j)
                b[random() % b.size()] = static_cast<std::uint8_t>(random());
            (void)valueFromPropertyListBytes(b);
        }

    // Hostile bytes are refused with the reason.
    EXPECT_TRUE(valueFromPropertyListBytes(nested(100)));
    std::string deepXML = "<plist>";
    for (int i = 0; i < 100000; ++i)
        deepXML += "<array>";
    const std::pair<Bytes, const char*> refusals[] = {
        {bytesOf(deepXML), "nested too deeply"},
        {nested(5000), "nested too deeply"},
        {nested(41, 2), "too many objects"}, // 2^40 nodes once expanded
        {binaryFrom({arrayOf({0})}), "cycle"},
        {binaryFrom({arrayOf({7})}), "outside"},
        // A keyed-archive UID means nothing outside its archive.
        {binaryFrom({arrayOf({1}), {0x80, 0x01}}), "Unsupported property-list node type"},
        {bytesOf(""), "no data"},
        {bytesOf("bplist00"), "correct format"},
        {bytesOf("<plist>"), "correct format"},
        {bytesOf("not a plist at all"), "correct format"},
        {bytesOf("<plist><"), "correct format"},
    };
    for (const auto& [bytes, message] : refusals) {
        auto r = valueFromPropertyListBytes(bytes);
        ASSERT_FALSE(r) << message;
        EXPECT_EQ(r.error().code, kGeneralErrorPropertyListReadCorrupt);
        EXPECT_NE(r.error().message.find(message), std::string::npos) << r.error().message;
    }
}

namespace {

// A scratch directory, and the descriptors a test opened in it.
class FileTest : public quarn::test::TempRootTest {
protected:
    void SetUp() override { fs::create_directory(dir_); }
    int open(const fs::path& p, int flags = O_RDWR | O_CREAT) {
        int fd = fds_.emplace_back(::open(p.c_str(), flags | O_CLOEXEC, 0600)).get();
        EXPECT_GE(fd, 0) << p;
        return fd;
    }
    // The class, or minus the error.
    static int classOf(int fd) {
        auto r = P::getProtectionClass(fd);
        return r ? *r : -r.error();
    }
    auto entryCount() const { return std::ranges::distance(fs::directory_iterator(dir_)); }
    static std::string contents(const fs::path& p) {
        std::ifstream in(p);
        return {std::istreambuf_iterator<char>(in), {}};
    }
    static void write(const fs::path& p, std::string_view s) { std::ofstream(p) << s; }

    const fs::path dir_ = root_ / "/scratch";
    std::deque<Descriptor> fds_;
    Value dict_ = Value::Dictionary{{"QRNMetadataVersion", "2"}, {"Class", 2u}};
};

} // namespace

TEST_F(FileTest, PropertyListWritesReplaceTheFileOrLeaveItAloneAndNothingBehind) {
    // Each over an older, longer file (in place: truncated); a class only when asked.
    const std::tuple<const char*, WriteOptions, int> writes[] = {
        {"atomic", {.atomic = true, .lowestProtection = true, .fsync = true}, P::kLowestClass},
        {"inPlace", {.lowestProtection = true}, P::kLowestClass},
        {"plain", {}, P::kNoClass}};
    for (const auto& [name, options, protectionClass] : writes) {
        SCOPED_TRACE(name);
        write(dir_ / name, std::string(10000, 'x'));
        ASSERT_TRUE(QRN_writeToURL(dict_, dir_ / name, options));
        EXPECT_EQ(contents(dir_ / name).substr(0, 8), "bplist00");
        EXPECT_EQ(classOf(open(dir_ / name, O_RDONLY)), protectionClass);
        EXPECT_EQ(QRN_dictionaryWithContentsOfURL(dir_ / name).value_or(Value()), dict_);
    }
    EXPECT_EQ(entryCount(), 3) << "a staging file was left";

    // Failed writes leave the old file alone.
    fs::path file = dir_ / "keep.plist";
    write(file, "old");
    Value unwritable = Value::Dictionary{{"bad", std::string("a\0b", 3)}};
    for (bool atomic : {false, true}) {
        auto r = QRN_writeToURL(unwritable, file, {.atomic = atomic});
        ASSERT_FALSE(r);
        EXPECT_EQ(r.error().code, kGeneralErrorPropertyListWriteInvalid);
        EXPECT_FALSE(QRN_writeToURL(Value::Array{1u}, file, {.atomic = atomic}));
        EXPECT_EQ(contents(file), "old");
        // A missing directory is a POSIX error either way.
        auto missing = QRN_writeToURL(dict_, dir_ / "nowhere" / "f.plist", {.atomic = atomic});
        ASSERT_FALSE(missing);
        EXPECT_TRUE(missing.error().isPOSIX(ENOENT)) << missing.error().message;
    }
    // The rename fails onto a directory: the temporary file goes away.
    fs::create_directories(dir_ / "occupied" / "child");
    auto r = QRN_writeToURL(dict_, dir_ / "occupied", {.atomic = true});
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error().domain, Error::Domain::POSIX);
    EXPECT_EQ(entryCount(), 5) << "a staging file was left";
}

// The Value reader and the tree reader refuse the same files with the same
// error, and read the others to the same dictionary.
TEST_F(FileTest, PropertyListReadingReportsWhatIsWrong) {
    ASSERT_TRUE(QRN_writeToURL(dict_, dir_ / "real"));
    fs::create_symlink(dir_ / "real", dir_ / "link");
    ASSERT_EQ(mkfifo((dir_ / "fifo").c_str(), 0600), 0); // must not block
    write(dir_ / "huge", "");                            // refused by size, before anything is read
    fs::resize_file(dir_ / "huge", kMaxPropertyListFileSize + 1);
    // A keyed-archive UID nested in an array of the dictionary {"A": [UID 1]}.
    Bytes uid = binaryFrom({{0xD1, 0, 1, 0, 2}, {0x51, 'A'}, arrayOf({3}), {0x80, 0x01}});
    using enum Error::Domain;
    constexpr auto kCorrupt = kGeneralErrorPropertyListReadCorrupt;
    using File = std::tuple<const char*, std::optional<std::string>, Error::Domain, std::int64_t>;
    const File files[] = {
        {"missing", {}, POSIX, ENOENT},
        {".", {}, POSIX, EISDIR},
        {"link", {}, POSIX, ELOOP},
        {"fifo", {}, POSIX, EINVAL},
        {"huge", {}, POSIX, EFBIG},
        {"array", "<plist><array><integer>1</integer></array></plist>", General,
         kGeneralErrorFileReadCorrupt},
        {"empty", "", General, kCorrupt},
        {"garbage", "garbage", General, kCorrupt},
        {"junk", "bplist00garbage", General, kCorrupt},
        {"uid", std::string(uid.begin(), uid.end()), General, kCorrupt},
        {"real", {}, General, 0}, // code 0: read
        {"dated", "<plist><dict><key>When</key><date>2020-01-01T00:00:00Z</date></dict></plist>",
         General, 0},
    };
    for (const auto& [name, text, domain, code] : files) {
        SCOPED_TRACE(name);
        if (text)
            write(dir_ / name, *text);
        auto value = QRN_dictionaryWithContentsOfURL(dir_ / name);
        auto tree = QRN_dictionaryNodeWithContentsOfFile((dir_ / name).native());
        ASSERT_EQ(bool(value), bool(tree));
        if (value) {
            EXPECT_EQ(code, 0);
            EXPECT_TRUE(checkPropertyList(tree->get()));
            EXPECT_EQ(valueFromPropertyList(tree->get()).value_or(Value()), *value);
            continue;
        }
        EXPECT_TRUE(value.error().domain == domain && value.error().code == code)
            << value.error().message;
        EXPECT_TRUE(tree.error().domain == domain && tree.error().code == code);
        EXPECT_EQ(tree.error().message, value.error().message);
    }
}

TEST_F(FileTest, ProtectionClassRoundTripsOnlyOnFilesAndDirectoriesInTheRightNamespace) {
    ASSERT_EQ(geteuid(), 0u) << "these tests run as root";
    fs::create_directory(dir_ / "d");
    for (int fd : {open(dir_ / "f"), open(dir_ / "d", O_RDONLY | O_DIRECTORY)}) {
        EXPECT_EQ(classOf(fd), P::kNoClass);
        for (int cls : {3, 14}) {
            ASSERT_TRUE(P::setProtectionClass(fd, cls));
            EXPECT_EQ(classOf(fd), cls);
        }
    }
    // Other tools read the stored form: the decimal text under that name.
    char text[8] = {};
    ASSERT_EQ(getxattr((dir_ / "f").c_str(), "trusted.quarn.protection_class", text, sizeof text),
              2);
    EXPECT_STREQ(text, "14");
    // Unprivileged processes use the user namespace.
    ASSERT_EQ(seteuid(65534), 0);
    std::string name = P::attributeName();
    ASSERT_EQ(seteuid(0), 0);
    EXPECT_EQ(name, "user.quarn.protection_class");

    // Items that cannot hold a class, bad classes and corrupt stored values are refused.
    open(dir_ / "target");
    fs::create_symlink(dir_ / "target", dir_ / "link");
    ASSERT_EQ(mkfifo((dir_ / "fifo").c_str(), 0600), 0);
    for (int fd : {open(dir_ / "link", O_PATH | O_NOFOLLOW),
                   open(dir_ / "fifo", O_RDWR | O_NONBLOCK), open("/dev/null", O_RDWR), -1}) {
        EXPECT_EQ(classOf(fd), -EBADF);
        auto set = P::setProtectionClass(fd, 4);
        EXPECT_EQ(set ? 0 : set.error(), EBADF);
    }
    // The link's target was left alone.
    int fd = open(dir_ / "target", O_RDONLY);
    EXPECT_EQ(classOf(fd), P::kNoClass);
    auto negative = P::setProtectionClass(fd, -1);
    EXPECT_EQ(negative ? 0 : negative.error(), EINVAL);
    for (std::string stored : {"", "abc", "-1", "3x", " 3", "99999999999999999999999"}) {
        ASSERT_EQ(fsetxattr(fd, P::attributeName(), stored.data(), stored.size(), 0), 0);
        EXPECT_EQ(classOf(fd), -EINVAL) << "stored \"" << stored << "\"";
    }
}

TEST(PropertyListPaths, DotDotOnlyAsAWholeComponent) {
    for (auto p : {"..", "../a", "/a/../b", "a/..", "a//../b", "/.."})
        EXPECT_TRUE(containsDotDotPathComponents(p)) << p;
    for (auto p : {"", ".", "/", "a..b", "...", "a/.../b", "..a", "a..", "/a/b/", "./a"})
        EXPECT_FALSE(containsDotDotPathComponents(p)) << p;
}
