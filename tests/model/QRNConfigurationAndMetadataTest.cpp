#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/PropertyList.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>
#include <plist/plist.h>

#include <sys/stat.h>
#include <sys/xattr.h>

#include <fstream>
#include <iterator>

using namespace quarn;
using quarn::test::LogCapture;
using quarn::test::TempRoot;

namespace {

std::string protectionClassOf(const std::filesystem::path& p) {
    char buf[32] = {};
    ssize_t n = getxattr(p.c_str(), "trusted.quarn.protection_class", buf, sizeof(buf) - 1);
    return n < 0 ? std::string() : std::string(buf, static_cast<std::size_t>(n));
}

// A directory made by the configuration: mode 0755 and the owner given.
void expectDirectory(const std::filesystem::path& p, uid_t owner) {
    struct stat st {};
    ASSERT_EQ(lstat(p.c_str(), &st), 0) << p;
    EXPECT_TRUE(S_ISDIR(st.st_mode)) << p;
    EXPECT_EQ(st.st_mode & 07777, 0755u) << p;
    EXPECT_EQ(st.st_uid, owner) << p;
    EXPECT_EQ(st.st_gid, owner) << p;
}

std::vector<char> bytesOf(const std::filesystem::path& p) {
    std::ifstream in(p, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

class QRNMetadataTest : public quarn::test::TempRootTest {
protected:
    QRNGlobalConfiguration& config() { return QRNGlobalConfiguration::sharedInstance(); }
    QRNUserIdentityPtr mobile() { return QRNUserIdentitySharedCache::defaultUserIdentity(); }
    std::filesystem::path home() {
        return std::filesystem::canonical(root_ / "/private/var/mobile");
    }
    QRNUserIdentityPtr user(std::uint32_t uid) {
        return QRNUserIdentity::initWithUID(uid, uid, root_ / "/private/var/mobile", std::nullopt,
                                            kQRNPersonaTypePersonal, uid);
    }
    // A container directory of the class where the layout puts it.
    std::filesystem::path containerDir(const QRNUserIdentityPtr& u, std::uint64_t cls,
                                       const UUID& uuid) {
        auto dir = *config().containerDirectoryURLForUserIdentity(u, cls, false) / uuid.string();
        std::filesystem::create_directories(dir);
        return dir;
    }
    QRNMetadata record(const QRNUserIdentityPtr& u, std::uint64_t cls, const UUID& uuid,
                       const std::filesystem::path& dir, Value info = Value(),
                       std::optional<std::string> assets = std::nullopt) {
        auto identity = *QRNConcreteContainerIdentity::containerIdentityWithUUID(
            uuid, u, "com.example.app", cls);
        return QRNMetadata(identity, std::move(info), dir, std::move(assets));
    }
    // A valid file for `u`'s app data container, rewritten with `edit` applied.
    std::filesystem::path fileWith(const QRNUserIdentityPtr& u,
                                   const std::function<void(Value&)>& edit) {
        const UUID uuid = UUID::random();
        auto dir = containerDir(u, 2, uuid);
        Value dict = record(u, 2, uuid, dir).dictionary();
        edit(dict);
        auto url = dir / QRNMetadata::kFileName;
        EXPECT_TRUE(QRN_writeToURL(dict, url));
        return url;
    }
    std::uint64_t failureOf(const std::filesystem::path& url, const QRNUserIdentityPtr& u,
                            bool checkClassPath = true) {
        auto r = QRNMetadata::readAndValidateMetadataAtFileUrl(url, u, checkClassPath);
        EXPECT_FALSE(r);
        return r ? 0 : r.error();
    }
};

using QRNGlobalConfigurationTest = QRNMetadataTest;

} // namespace

TEST_F(QRNMetadataTest, RoundTripThroughABinaryPropertyList) {
    const UUID uuid = UUID::random();
    auto dir = containerDir(mobile(), 2, uuid);
    Value info = Value::dictionary();
    info.set("Key", "value");
    auto written = record(mobile(), 2, uuid, dir, info, "Assets");
    auto url = dir / QRNMetadata::kFileName;
    ASSERT_TRUE(written.writeMetadataToFileURL(url));

    // Any standard reader opens it: binary, one dictionary of the seven keys.
    auto bytes = bytesOf(url);
    plist_t node = nullptr;
    plist_from_bin(bytes.data(), static_cast<std::uint32_t>(bytes.size()), &node);
    ASSERT_NE(node, nullptr);
    EXPECT_EQ(plist_dict_get_size(node), 7u);
    plist_free(node);

    // Readable whatever the lock state; nothing left in staging.
    EXPECT_EQ(protectionClassOf(url), "4");
    EXPECT_TRUE(
        std::filesystem::is_empty(*config().stagingDirectoryURLForUserIdentity(mobile(), 2)));

    auto read = QRNMetadata::readAndValidateMetadataAtFileUrl(url, mobile(), true);
    ASSERT_TRUE(read);
    const QRNMetadata& m = **read;
    EXPECT_EQ(m.url(), dir);
    EXPECT_EQ(m.dictionary(), written.dictionary());
}

// The temporary file goes to the daemon's root-only scratch directory; a
// failed write or move reports code 34 and leaves the old file, and a
// container directory that became a link is never written through.
TEST_F(QRNMetadataTest, WriteFailuresKeepTheOldFile) {
    LogCapture log;
    const UUID uuid = UUID::random();
    auto dir = containerDir(mobile(), 7, uuid);
    auto url = dir / QRNMetadata::kFileName;
    ASSERT_TRUE(record(mobile(), 7, uuid, dir).writeMetadataToFileURL(url));
    const auto before = bytesOf(url);
    const auto scratch = config().scratchDirectory();
    EXPECT_EQ(std::filesystem::status(scratch).permissions(), std::filesystem::perms(0700));

    auto temporary = scratch / ("temp_metadata-" + uuid.string() + ".plist");
    std::filesystem::create_directories(temporary / "blocker");
    Value info = Value::dictionary();
    info.set("changed", true);
    const auto message = "Failed to write metadata dictionary to URL " + url.string() + " : ";
    auto failed = record(mobile(), 7, uuid, dir, info).writeMetadataToFileURL(url);
    ASSERT_FALSE(failed);
    EXPECT_TRUE(failed.error().isQRN(kQRNErrorWriteStateFileFailed));
    EXPECT_TRUE(log.contains(message)) << log.all();
    EXPECT_EQ(bytesOf(url), before);
    std::filesystem::remove_all(temporary);

    // The container directory swapped for a link to another container.
    const auto elsewhere = containerDir(mobile(), 7, UUID::random());
    ASSERT_TRUE(record(mobile(), 7, uuid, elsewhere)
                    .writeMetadataToFileURL(elsewhere / QRNMetadata::kFileName));
    const auto theirs = bytesOf(elsewhere / QRNMetadata::kFileName);
    std::filesystem::rename(dir, dir.string() + ".moved");
    std::filesystem::create_directory_symlink(elsewhere, dir);
    failed = record(mobile(), 7, uuid, dir, info).writeMetadataToFileURL(url);
    ASSERT_FALSE(failed);
    EXPECT_TRUE(failed.error().isQRN(kQRNErrorWriteStateFileFailed));
    EXPECT_TRUE(log.contains("Refusing " + dir.string() + ": a symbolic link")) << log.all();
    EXPECT_EQ(bytesOf(elsewhere / QRNMetadata::kFileName), theirs);
    EXPECT_FALSE(std::filesystem::exists(temporary));
}

// Each refused file gives its code and message; entries are checked in a
// fixed order; the legacy owner entry must match the expected user's owner.
// The reader looks at a few keys of the file's tree but refuses what a full
// conversion refuses (a keyed-archive UID under a key it never reads).
TEST_F(QRNMetadataTest, RefusedFilesGiveTheirCodeAndMessageOthersAreRead) {
    LogCapture log;
    auto other = user(600);
    const auto set = [](const char* key, Value v) { return [=](Value& d) { d.set(key, v); }; };
    const auto setIdentity = [](const char* key, Value v) {
        return [=](Value& d) {
            Value u = *d.get("QRNMetadataUserIdentity");
            u.set(key, v);
            d.set("QRNMetadataUserIdentity", u);
        };
    };
    struct Case {
        std::function<void(Value&)> edit;
        const char* message;
        QRNUserIdentityPtr expected = nullptr; // the default identity
    };
    const Case cases[] = {
        {set("QRNMetadataIdentifier", 5u), "Invalid metadata Identifier: 5 at "},
        {[](Value& d) { d.erase("QRNMetadataIdentifier"), d.set("QRNMetadataContentClass", 0u); },
         "Invalid metadata Identifier: (null) at "}, // checked before the class
        {[](Value& d) { d.erase("QRNMetadataUUID"); }, "Invalid metadata UUID String: (null) at "},
        {set("QRNMetadataUUID", "not-a-uuid"), "Invalid metadata UUID: not-a-uuid at "},
        {set("QRNMetadataContentClass", "2"), "Invalid metadata Class: "},
        {set("QRNMetadataContentClass", 0u), "Invalid metadata Content Class: 0 at "},
        {set("QRNMetadataContentClass", 14u), "Invalid metadata Content Class: 14 at "},
        {set("QRNMetadataContentClass", -2), "Invalid metadata Content Class: -2 at "},
        {set("QRNMetadataUserIdentity", "501"), "Invalid metadata User Identity: "},
        {setIdentity("version", "3"), "Could not create user identity from "},
        {setIdentity("type", 3u), ": 75"},
        {setIdentity("posixUID", 777u), "Incorrect User Identity: "},
        {set("QRNMetadataInfo", Value(Value::Array{"x"})), "Invalid metadata Info: "},
        {set("QRNMetadataUserManagedAssetsDirName", 1u),
         "Invalid metadata User Managed Dir Name String: 1 at "},
        {set("QRNMetadataPersona", 601u),
         "Incorrect UserId: 601, expecting: 600 for com.example.app at ", other},
        {set("QRNMetadataPersona", "600"), "", other}, // not a number
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.message);
        log.clear();
        const auto& u = c.expected ? c.expected : mobile();
        EXPECT_EQ(failureOf(fileWith(u, c.edit), u), kQRNErrorInvalidMetadata);
        EXPECT_TRUE(log.contains(c.message)) << log.all();
    }

    // What is no readable property-list dictionary gives code 12.
    auto url = fileWith(mobile(), [](Value&) {});
    auto node = propertyListFromValue(*QRN_dictionaryWithContentsOfURL(url));
    plist_dict_set_item(node->get(), "Other", plist_new_uid(1));
    char* uid = nullptr;
    std::uint32_t length = 0;
    plist_to_bin(node->get(), &uid, &length);
    const auto array = *binaryPropertyList(Value(Value::Array{"x"}));
    for (const std::string& bytes : {std::string(uid, length), std::string("bplist00 and then"),
                                     std::string(array.begin(), array.end())}) {
        std::ofstream(url, std::ios::binary | std::ios::trunc) << bytes;
        EXPECT_EQ(failureOf(url, mobile()), kQRNErrorReadPlistFailed);
    }
    plist_to_bin_free(uid);
    std::filesystem::remove(url);
    EXPECT_EQ(failureOf(url, mobile()), kQRNErrorReadPlistFailed);

    // A file without a stored identity belongs to whoever the caller expects;
    // the owner entry is not checked for the default identity; of a key given
    // twice the last value counts.
    auto read = QRNMetadata::readAndValidateMetadataAtFileUrl(
        fileWith(other, [](Value& d) { d.erase("QRNMetadataUserIdentity"); }), other, true);
    ASSERT_TRUE(read);
    EXPECT_EQ((*read)->containerIdentity()->userIdentity(), other);
    const auto persona = [&](Value v, const QRNUserIdentityPtr& u) {
        return QRNMetadata::readAndValidateMetadataAtFileUrl(
            fileWith(u, [&](Value& d) { d.set("QRNMetadataPersona", v); }), u, true);
    };
    EXPECT_TRUE(persona(600u, other));
    EXPECT_TRUE(persona(999u, mobile()));

    Value dict;
    url = fileWith(mobile(), [&](Value& d) { dict = d; });
    node = propertyListFromValue(dict);
    char* xml = nullptr;
    plist_to_xml(node->get(), &xml, &length);
    std::string text(xml, length);
    plist_to_xml_free(xml);
    text.insert(text.rfind("</dict>"),
                "<key>QRNMetadataIdentifier</key><string>com.example.later</string>");
    std::ofstream(url, std::ios::trunc) << text;
    read = QRNMetadata::readAndValidateMetadataAtFileUrl(url, mobile(), true);
    ASSERT_TRUE(read);
    EXPECT_EQ((*read)->identifier(), "com.example.later");
}

TEST_F(QRNMetadataTest, ClassPathMustMatchTheLayout) {
    const UUID uuid = UUID::random();
    // An app data container that sits in the app group directory.
    auto dir = containerDir(mobile(), 7, uuid);
    auto url = dir / QRNMetadata::kFileName;
    ASSERT_TRUE(record(mobile(), 2, uuid, dir).writeMetadataToFileURL(url));
    EXPECT_EQ(failureOf(url, mobile(), true), kQRNErrorInvalidMetadata);
    // Only the class-path check refuses it.
    EXPECT_TRUE(QRNMetadata::readAndValidateMetadataAtFileUrl(url, mobile(), false));

    // Transient containers sit in the class's transient directory; global
    // classes are checked against the shared containers directory.
    for (const auto& [cls, transient] : {std::pair<std::uint64_t, bool>{2, true}, {1, false}}) {
        const UUID id = UUID::random();
        const auto at =
            *config().containerDirectoryURLForUserIdentity(mobile(), cls, transient) / id.string();
        std::filesystem::create_directories(at);
        ASSERT_TRUE(
            record(mobile(), cls, id, at).writeMetadataToFileURL(at / QRNMetadata::kFileName));
        EXPECT_TRUE(QRNMetadata::readAndValidateMetadataAtFileUrl(at / QRNMetadata::kFileName,
                                                                  mobile(), true))
            << cls;
    }
}

// Where each directory is, its protection class, and that asking for it made
// it with mode 0755 and the right owner (-1: handed out but not made). One
// row per way a directory is made; bundles belong to the installer.
TEST_F(QRNGlobalConfigurationTest, DirectoriesPathsModesOwners) {
    auto& c = config();
    auto user = c.getPerUserConfigurationForUserIdentity(mobile());
    ASSERT_NE(user, nullptr);
    const auto cls = [&](std::uint64_t k, bool transient) {
        return c.containerDirectoryURLForUserIdentity(mobile(), k, transient).value_or("none");
    };
    const auto h = home(), lib = root_ / "/private/var/root/Library",
               caches = lib / "Caches/com.orvex.quarnd", ctr = root_ / "/private/var/containers";
    const std::tuple<std::filesystem::path, std::filesystem::path, int, const char*> dirs[] = {
        {c.sharedContainersDirectory(), ctr, 0, ""},
        {c.cachesDirectory(), caches, 0, "4"},
        {c.libraryDirectory(), lib / "Quarn", 0, "4"},
        {c.transientBundleDirectory(), ctr / "Temp", 33, ""},
        {c.stagingDirectory(), caches / "Staging", 0, ""},
        {c.replaceDirectory(), lib / "Quarn/Replace", 0, ""},
        {c.bundleDirectory(), ctr / "Bundle", 0, ""},
        {c.legacyTransientBundleDirectory(),
         root_ / "/private/var/installer/Library/Caches/com.orvex.quarnd", -1, ""},
        {user->libraryDirectory(), h / "Library/Quarn", 501, ""},
        {user->userBaseDirectory(), h / "Containers", 501, ""},
        {user->systemContainerBackupDirectory(), h / "Library/Backup/SystemContainers/Data", -1,
         ""},
        {cls(2, false), h / "Containers/Data/Application", 501, ""},
        {cls(7, true), h / "Containers/Temp/Shared/AppGroup", 501, ""},
        {cls(1, false), ctr / "Bundle/Application", 33, ""},
        {cls(8, true), ctr / "Temp/Bundle/Framework", 33, ""},
        {cls(12, false), ctr / "Data/System", 0, ""},
        {cls(13, true), caches / "Temp/Shared/SystemGroup", 0, ""},
    };
    for (const auto& [got, path, owner, protection] : dirs) {
        SCOPED_TRACE(path);
        EXPECT_EQ(got, path);
        EXPECT_EQ(protectionClassOf(path), protection);
        if (owner < 0) {
            EXPECT_FALSE(std::filesystem::exists(path));
        } else {
            expectDirectory(path, static_cast<uid_t>(owner));
        }
    }
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(mobile(), 0, false));
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(mobile(), 14, false));
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(nullptr, 2, false));
    // Each configuration answers only for its own kind of class.
    EXPECT_FALSE(c.globalContainerBaseURLWithContentClass(2, true));
    EXPECT_FALSE(user->containerDirectoryURLForContentClass(1, false));

    EXPECT_FALSE(c.stagingDirectoryURLForUserIdentity(nullptr, 2));
}

// A directory that cannot be made is reported and its URL handed out anyway.
// Migration files are asked about only directly inside the library directory.
TEST_F(QRNGlobalConfigurationTest, CreationFailuresMigrationFilesAndInternalImage) {
    LogCapture log;
    root_.writeFile("/private/var/containers", "not a directory");
    root_.writeFile("/private/var/mobile/Containers", "not a directory");
    auto& c = config();
    EXPECT_EQ(c.sharedContainersDirectory(), root_ / "/private/var/containers");
    EXPECT_TRUE(log.contains("Failed to create shared container dir at \"" +
                             (root_ / "/private/var/containers").string() + "\": "))
        << log.all();
    auto dir = c.containerDirectoryURLForUserIdentity(mobile(), 2, false);
    EXPECT_EQ(*dir, home() / "Containers/Data/Application");
    EXPECT_TRUE(log.contains("Failed to create user base dir at \""));
    EXPECT_TRUE(log.contains("Failed to create container dir at \"" + dir->string() + "\": "));

    EXPECT_FALSE(c.migrationFileExistsWithName("Migrated"));
    std::ofstream(c.libraryDirectory() / "Migrated") << "x";
    EXPECT_TRUE(c.migrationFileExistsWithName("Migrated"));
    EXPECT_FALSE(c.migrationFileExistsWithName(".."));
    EXPECT_FALSE(c.migrationFileExistsWithName("../Quarn/Migrated"));
    EXPECT_FALSE(c.migrationFileExistsWithName(""));

    root_.writeFile("/etc/os-release", "ID=orvex\nVARIANT_ID=internal\n");
    EXPECT_TRUE(c.isInternalImage());
    root_.writeFile("/etc/os-release", "ID=orvex\n");
    EXPECT_TRUE(c.isInternalImage()); // computed once
    c.setIsInternalImage(false);
    EXPECT_FALSE(c.isInternalImage());
}

TEST(QRNGlobalConfigurationMobile, MobileIdsAreReadOrZeroWithoutTheAccount) {
    LogCapture log;
    for (bool withMobileUser : {true, false}) {
        SCOPED_TRACE(withMobileUser);
        TempRoot root(TempRoot::Options{.withMobileUser = withMobileUser});
        auto& c = QRNGlobalConfiguration::sharedInstance();
        EXPECT_EQ(c.currentMobileUserId(), withMobileUser ? 501u : 0u);
        EXPECT_EQ(c.currentMobileGroupId(), withMobileUser ? 501u : 0u);
        EXPECT_TRUE(log.contains(withMobileUser ? "Current mobile user ID is 501, group ID is 501"
                                                : "Failed to get mobile uid. This is bad"));
        // Role uids never get an identity, so the default falls back to 501.
        auto def = QRNUserIdentitySharedCache::defaultUserIdentity();
        ASSERT_NE(def, nullptr);
        EXPECT_EQ(def->posixUID(), 501u);
    }
}
