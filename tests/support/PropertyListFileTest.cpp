#include "Daemon/support/PropertyList.h"
#include "Daemon/support/ProtectionClassAttribute.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <set>

using namespace quarn;
namespace fs = std::filesystem;

namespace {

class PropertyListFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string tmpl = (fs::temp_directory_path() / "quarn-plist.XXXXXX").string();
        ASSERT_NE(mkdtemp(tmpl.data()), nullptr);
        dir_ = tmpl;
    }
    void TearDown() override { fs::remove_all(dir_); }

    std::set<std::string> entries() const {
        std::set<std::string> names;
        for (const auto& e : fs::directory_iterator(dir_)) {
            names.insert(e.path().filename().string());
        }
        return names;
    }
    std::string contents(const fs::path& p) const {
        std::ifstream in(p, std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
    // Reads the file both ways: the same refusal (true), or the same dictionary.
    bool refusedBoth(const std::string& name) const;
    void write(const fs::path& p, std::string_view text) const {
        std::ofstream(p, std::ios::binary) << text;
    }
    static int protectionClassOf(const fs::path& p) {
        int fd = open(p.c_str(), O_RDONLY | O_CLOEXEC);
        int cls = ProtectionClassAttribute::getProtectionClass(fd).value_or(-1);
        close(fd);
        return cls;
    }

    fs::path dir_;
    Value dict_ = Value::Dictionary{{"QRNMetadataVersion", "2"}, {"Class", 2u}};
};

} // namespace

TEST_F(PropertyListFileTest, WritesReplaceTheFileAndLeaveNothingBehind) {
    // Each over an older, longer file (in place: truncated); a class only when asked.
    using P = ProtectionClassAttribute;
    const std::tuple<const char*, WriteOptions, int> writes[] = {
        {"atomic", {.atomic = true, .lowestProtection = true, .fsync = true}, P::kLowestClass},
        {"inPlace", {.lowestProtection = true}, P::kLowestClass},
        {"plain", {}, P::kNoClass}};
    for (const auto& [name, options, protectionClass] : writes) {
        SCOPED_TRACE(name);
        write(dir_ / name, std::string(10000, 'x'));
        ASSERT_TRUE(QRN_writeToURL(dict_, dir_ / name, options));
        EXPECT_EQ(contents(dir_ / name).substr(0, 8), "bplist00");
        EXPECT_EQ(protectionClassOf(dir_ / name), protectionClass);
        EXPECT_EQ(QRN_dictionaryWithContentsOfURL(dir_ / name).value_or(Value()), dict_);
    }
    EXPECT_EQ(entries(), (std::set<std::string>{"atomic", "inPlace", "plain"}));
}

TEST_F(PropertyListFileTest, FailedWritesLeaveTheOldFileAlone) {
    fs::path file = dir_ / "keep.plist";
    write(file, "old");
    Value unwritable = Value::Dictionary{{"bad", std::string("a\0b", 3)}};
    for (bool atomic : {false, true}) {
        auto r = QRN_writeToURL(unwritable, file, {.atomic = atomic});
        ASSERT_FALSE(r);
        EXPECT_EQ(r.error().code, kGeneralErrorPropertyListWriteInvalid);
        auto notDictionary = QRN_writeToURL(Value::Array{1u}, file, {.atomic = atomic});
        ASSERT_FALSE(notDictionary);
        EXPECT_EQ(contents(file), "old");
    }
    // The rename fails onto a directory: the temporary file goes away.
    fs::create_directories(dir_ / "occupied" / "child");
    auto r = QRN_writeToURL(dict_, dir_ / "occupied", {.atomic = true});
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error().domain, Error::Domain::POSIX);
    EXPECT_EQ(entries(), (std::set<std::string>{"keep.plist", "occupied"}));
    // A missing directory is a POSIX error either way.
    for (bool atomic : {false, true}) {
        auto missing = QRN_writeToURL(dict_, dir_ / "nowhere" / "f.plist", {.atomic = atomic});
        ASSERT_FALSE(missing);
        EXPECT_TRUE(missing.error().isPOSIX(ENOENT)) << missing.error().message;
    }
}

TEST_F(PropertyListFileTest, ReadingReportsWhatIsWrong) {
    auto codeOf = [](const Result<Value>& r) {
        return r ? std::make_pair(Error::Domain::QRN, std::int64_t(0))
                 : std::make_pair(r.error().domain, r.error().code);
    };
    using P = std::pair<Error::Domain, std::int64_t>;
    EXPECT_EQ(codeOf(QRN_dictionaryWithContentsOfURL(dir_ / "missing")),
              P(Error::Domain::POSIX, ENOENT));
    EXPECT_EQ(codeOf(QRN_dictionaryWithContentsOfURL(dir_)), P(Error::Domain::POSIX, EISDIR));

    ASSERT_TRUE(QRN_writeToURL(dict_, dir_ / "real.plist"));
    fs::create_symlink(dir_ / "real.plist", dir_ / "link.plist");
    EXPECT_EQ(codeOf(QRN_dictionaryWithContentsOfURL(dir_ / "link.plist")),
              P(Error::Domain::POSIX, ELOOP));
    ASSERT_EQ(mkfifo((dir_ / "fifo").c_str(), 0600), 0); // must not block
    EXPECT_EQ(codeOf(QRN_dictionaryWithContentsOfURL(dir_ / "fifo")),
              P(Error::Domain::POSIX, EINVAL));

    write(dir_ / "huge.plist", ""); // refused by size, before anything is read
    fs::resize_file(dir_ / "huge.plist", kMaxPropertyListFileSize + 1);
    EXPECT_EQ(codeOf(QRN_dictionaryWithContentsOfURL(dir_ / "huge.plist")),
              P(Error::Domain::POSIX, EFBIG));

    write(dir_ / "array.plist", "<plist><array><integer>1</integer></array></plist>");
    EXPECT_EQ(codeOf(QRN_dictionaryWithContentsOfURL(dir_ / "array.plist")),
              P(Error::Domain::General, kGeneralErrorFileReadCorrupt));
    for (std::string_view junk : {"", "garbage", "bplist00garbage"}) {
        write(dir_ / "junk.plist", junk);
        EXPECT_EQ(codeOf(QRN_dictionaryWithContentsOfURL(dir_ / "junk.plist")),
                  P(Error::Domain::General, kGeneralErrorPropertyListReadCorrupt));
    }
    write(dir_ / "xml.plist", "<plist><dict><key>Class</key><integer>2</integer>"
                              "<key>QRNMetadataVersion</key><string>2</string></dict></plist>");
    EXPECT_EQ(QRN_dictionaryWithContentsOfURL(dir_ / "xml.plist").value_or(Value()), dict_);
}

// The tree reader refuses exactly what the Value reader refuses, with the
// same error, and hands back the dictionary's nodes otherwise.
TEST_F(PropertyListFileTest, TreeReadingRefusesWhatValueReadingRefuses) {
    struct File {
        const char* name;
        std::string text;
        bool refused;
    };
    const std::vector<File> files = {
        {"array", "<plist><array><integer>1</integer></array></plist>", true},
        {"junk", "bplist00garbage", true},
        {"good",
         "<plist><dict><key>Class</key><integer>2</integer><key>QRNMetadataVersion</key>"
         "<string>2</string><key>When</key><date>2020-01-01T00:00:00Z</date></dict></plist>",
         false},
    };
    for (const auto& file : files) {
        SCOPED_TRACE(file.name);
        write(dir_ / file.name, file.text);
        EXPECT_EQ(refusedBoth(file.name), file.refused);
    }
    // A keyed-archive UID nested in an array of the dictionary.
    PropertyListPtr uid(plist_new_dict());
    plist_t array = plist_new_array();
    plist_array_append_item(array, plist_new_uid(1));
    plist_dict_set_item(uid.get(), "A", array);
    char* bin = nullptr;
    std::uint32_t length = 0;
    plist_to_bin(uid.get(), &bin, &length);
    write(dir_ / "uid", std::string_view(bin, length));
    plist_to_bin_free(bin);
    EXPECT_TRUE(refusedBoth("uid"));
    auto missing = QRN_dictionaryNodeWithContentsOfFile((dir_ / "missing").native());
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
}

bool PropertyListFileTest::refusedBoth(const std::string& name) const {
    auto value = QRN_dictionaryWithContentsOfURL(dir_ / name);
    auto tree = QRN_dictionaryNodeWithContentsOfFile((dir_ / name).native());
    EXPECT_EQ(bool(value), bool(tree));
    if (!value || !tree) {
        EXPECT_TRUE(!value && !tree && tree.error().domain == value.error().domain &&
                    tree.error().code == value.error().code &&
                    tree.error().message == value.error().message);
        return !value && !tree;
    }
    EXPECT_TRUE(checkPropertyList(tree->get()));
    EXPECT_EQ(valueFromPropertyList(tree->get()).value_or(Value()), *value);
    return false;
}

TEST(PropertyListPaths, DotDotOnlyAsAWholeComponent) {
    for (auto p : {"..", "../a", "/a/../b", "a/..", "a//../b", "/.."}) {
        EXPECT_TRUE(containsDotDotPathComponents(p)) << p;
    }
    for (auto p : {"", ".", "/", "a..b", "...", "a/.../b", "..a", "a..", "/a/b/", "./a"}) {
        EXPECT_FALSE(containsDotDotPathComponents(p)) << p;
    }
}
