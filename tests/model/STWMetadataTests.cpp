#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWPropertyList.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace fs = std::filesystem;

namespace {

class STWMetadataTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWTestRoot::shared();
        mobile = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
        other = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersonaWithUID(502, 502);
        classDirectory = directoryOfClass(2);
        uuid = STWUUID::random();
        container = classDirectory / uuid.string();
        file = container / STWMetadata::fileName;
        fs::create_directories(container);
    }
    void TearDown() override { STWFileManager::defaultManager()->removeItemAtURL(container); }

    fs::path directoryOfClass(STWContainerClass c) {
        return *STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(mobile, c,
                                                                                               false);
    }
    STWMetadata make(STWContainerClass c = 2, const fs::path& at = {}) {
        auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(
            uuid, mobile, "com.example.app", c, nullptr);
        return STWMetadata(identity,
                           STWValue::Dictionary{{STWMetadata::contentProtectionClassInfoKey, STWValue(3)}},
                           at.empty() ? container : at, std::nullopt);
    }
    std::shared_ptr<STWMetadata> read(STWErrorRef* error, const STWUserIdentityRef& expected = nullptr) {
        return STWMetadata::readAndValidateMetadataAtUrl(container, expected ? expected : mobile, true,
                                                         error);
    }
    // The daemon's files are immutable; a test changes them as root would.
    void unflag(const fs::path& path) {
        ASSERT_TRUE(STWFileManager::defaultManager()->setUserImmutableOfItemAtURL(path, false, nullptr));
    }
    STWValue::Dictionary stored() { return *STW_dictionaryWithContentsOfURL(file, STWReadDefault, nullptr); }

    STWUserIdentityRef mobile, other;
    fs::path classDirectory, container, file;
    STWUUID uuid;
};

TEST_F(STWMetadataTest, AWriteIsOnDiskBeforeItIsAcknowledgedAndLeavesOneFileOfTheDaemons) {
    std::vector<std::string> synced;
    std::mutex mutex;
    STWFileManager::setSyncObserverForTesting([&](const std::string& path) {
        std::lock_guard guard(mutex);
        synced.push_back(path);
    });
    STWMetadata metadata = make();
    STWErrorRef error;
    bool written =
        metadata.writeMetadataToDiskWithError(&error) && metadata.writeMetadataToDiskWithError(&error);
    STWFileManager::setSyncObserverForTesting(nullptr);
    ASSERT_TRUE(written) << error->description();
    // The bytes under their temporary name beside the file, then the directory that now
    // holds the final name.
    auto bytes = std::find_if(synced.begin(), synced.end(), [&](const std::string& path) {
        return path.rfind((container / ".temp.").string(), 0) == 0;
    });
    auto rename = std::find(synced.begin(), synced.end(), container.string());
    EXPECT_NE(bytes, synced.end());
    EXPECT_NE(rename, synced.end());
    EXPECT_LT(bytes, rename);

    auto back = read(&error);
    ASSERT_TRUE(back) << error->description();
    EXPECT_TRUE(back->containerIdentity()->isEqual(*metadata.containerIdentity()));
    EXPECT_EQ(back->info(), metadata.info());
    EXPECT_EQ(back->url(), container);
    EXPECT_EQ(std::distance(fs::directory_iterator(container), fs::directory_iterator()), 1);
    EXPECT_TRUE(fs::is_empty(
        STWGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(mobile, 2)));
    STWValue::Dictionary d = stored();
    EXPECT_EQ(*STWDictionaryString(d, "STWMetadataVersion"), "2");
    EXPECT_EQ(*STWDictionaryString(d, "STWMetadataUUID"), uuid.string());
    EXPECT_TRUE(STWDictionaryDictionary(d, "STWMetadataUserIdentity"));

    // Written by root, readable by all, immutable.
    struct stat st;
    ASSERT_EQ(stat(file.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0644u);
    EXPECT_EQ(st.st_uid, 0u);
    EXPECT_NE(unlink(file.c_str()), 0) << "the file is immutable";

    // The final name is taken by a directory: the move fails, the old file's bytes stay.
    fs::create_directories(container / "blocked/inside");
    EXPECT_FALSE(make().writeMetadataToFileURL(container / "blocked", &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 34);
    EXPECT_NE(error->message().find("Failed to move metadata from staging:"), std::string::npos);
    EXPECT_TRUE(read(nullptr));
}

TEST_F(STWMetadataTest, EachKindOfInvalidFileIsRejectedWithItsMessage) {
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    const STWValue::Dictionary original = stored();
    STWValue::Dictionary badIdentity{{"posixUID", STWValue(501)},
                                     {"posixGID", STWValue(501)},
                                     {"type", STWValue(7)},
                                     {"version", STWValue("2")}};
    const struct {
        const char* key;
        STWValue value; // null: the key is removed
        STWUserIdentityRef expected;
        const char* message;
    } cases[] = {
        {"STWMetadataContentClass", STWValue(0), nullptr, "Invalid metadata Content Class: 0 at"},
        {"STWMetadataContentClass", STWValue(14), nullptr, "Invalid metadata Content Class: 14 at"},
        {"STWMetadataContentClass", STWValue("2"), nullptr, "Invalid metadata Class: 2 at"},
        {"STWMetadataIdentifier", STWValue(5), nullptr, "Invalid metadata Identifier: 5 at"},
        {"STWMetadataIdentifier", STWValue(), nullptr, "Invalid metadata Identifier: (null) at"},
        {"STWMetadataUUID", STWValue("not-a-uuid"), nullptr, "Invalid metadata UUID: not-a-uuid at"},
        {"STWMetadataUUID", STWValue(5), nullptr, "Invalid metadata UUID String: 5 at"},
        {"STWMetadataPersona", STWValue(502), nullptr,
         "Incorrect UserId: 502, expecting: 501 for com.example.app at"},
        // A legacy owner of 501 read for user 502: the recorded id decides, whatever identity is stored.
        {"STWMetadataPersona", STWValue(501), other, "Incorrect UserId: 501, expecting: 502"},
        {"STWMetadataPersona", STWValue(), other, "Incorrect User Identity:"},
        {"STWMetadataUserIdentity", STWValue(badIdentity), nullptr, "Invalid metadata User Identity:"},
        {"STWMetadataInfo", STWValue("text"), nullptr, "Invalid metadata Info: text at"},
        {"STWMetadataUserManagedAssetsDirName", STWValue(STWValue::Array{}), nullptr,
         "Invalid metadata User Managed Dir Name String: () at"},
        // Class 4 stored in a Data/Application directory.
        {"STWMetadataContentClass", STWValue(4), nullptr, "Invalid metadata-URLs should match:"},
    };
    for (const auto& c : cases) {
        STWValue::Dictionary d = original;
        if (c.value.isNull())
            d.erase(c.key);
        else
            d[c.key] = c.value;
        unflag(file);
        ASSERT_TRUE(STW_writeToURL(d, file, STWWriteAtomic, nullptr));
        STWErrorRef error;
        EXPECT_FALSE(read(&error, c.expected)) << c.message;
        ASSERT_TRUE(error) << c.message;
        EXPECT_EQ(error->code(), 29) << error->message();
        EXPECT_NE(error->message().find(c.message), std::string::npos) << error->message();
    }
}

TEST_F(STWMetadataTest, OnlyARegularDictionaryFileOfTheDaemonsIsRead) {
    STWMetadata metadata = make();
    ASSERT_TRUE(metadata.writeMetadataToDiskWithError(nullptr));
    const STWValue::Dictionary d = stored();
    unflag(file);
    ASSERT_EQ(STWWriteFileAtomically(file, STWPropertyList::serializeXML(STWValue(d)), 0644, false), 0);
    STWErrorRef error;
    auto back = read(&error);
    ASSERT_TRUE(back) << error->description();
    EXPECT_TRUE(back->containerIdentity()->isEqual(*metadata.containerIdentity()));

    // The container's owner can put anything in the file's place.
    auto plant = [&](const fs::path& at, const STWValue& root) {
        fs::remove(at);
        ASSERT_EQ(STWWriteFileAtomically(at, STWPropertyList::serializeBinary(root), 0644, false), 0);
    };
    auto refused = [&](const char* what, int64_t code) {
        error.reset();
        EXPECT_FALSE(read(&error)) << what;
        EXPECT_EQ(error ? error->code() : 0, code) << what;
    };
    fs::path elsewhere = classDirectory / ("elsewhere-" + uuid.string());
    plant(elsewhere, STWValue(d));
    fs::remove(file);
    fs::create_symlink(elsewhere, file);
    refused("a link to a valid file", 12);
    plant(file, STWValue(STWValue::Array{STWValue(d)}));
    refused("an array", 12);
    // A copy owned by its copier is refused in the end-to-end tests of hostile apps.
    fs::remove(file);
    refused("no file", 12);
    fs::remove(elsewhere);
}

TEST_F(STWMetadataTest, WhichUserIdentityAFileGets) {
    // Without an expected identity no per-user container reads.
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    STWErrorRef error;
    EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(container, nullptr, true, &error));
    EXPECT_EQ(error ? error->code() : 0, 29);

    // Legacy file: only the POSIX user id is recorded; no comparison with the expected identity.
    STWValue::Dictionary d = stored();
    d.erase("STWMetadataUserIdentity");
    d["STWMetadataPersona"] = STWValue(501);
    unflag(file);
    ASSERT_TRUE(STW_writeToURL(d, file, STWWriteAtomic, nullptr));
    auto legacy = read(nullptr);
    ASSERT_TRUE(legacy);
    EXPECT_EQ(legacy->userIdentity()->posixUID(), 501u);

    // Bundle and system containers store no user identity and get the default one,
    // whatever is expected.
    for (STWContainerClass c : {1, 12}) {
        fs::path global = directoryOfClass(c) / uuid.string();
        fs::create_directories(global);
        ASSERT_TRUE(make(c, global).writeMetadataToDiskWithError(&error)) << error->description();
        EXPECT_FALSE(
            STWDictionaryFind(*STW_dictionaryWithContentsOfURL(global / STWMetadata::fileName, 0, nullptr),
                              "STWMetadataUserIdentity"));
        for (const STWUserIdentityRef& expected : {STWUserIdentityRef(), other}) {
            auto read = STWMetadata::readAndValidateMetadataAtUrl(global, expected, true, &error);
            ASSERT_TRUE(read) << c << ": " << error->description();
            EXPECT_EQ(*read->userIdentity(), *STWUserIdentityCache::defaultUserIdentity());
        }
        STWFileManager::defaultManager()->removeItemAtURL(global);
    }
}

TEST_F(STWMetadataTest, TheClassDirectoryIsCheckedOnThePathAsGiven) {
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    STWErrorRef error;
    // A trailing separator or a doubled one names the same directory.
    auto slash = STWMetadata::readAndValidateMetadataAtUrl(container.string() + "/", mobile, true, &error);
    ASSERT_TRUE(slash) << error->description();
    EXPECT_EQ(slash->url(), container);
    fs::path doubled = classDirectory.parent_path().string() + "//Application/" + uuid.string();
    ASSERT_TRUE(STWMetadata::readAndValidateMetadataAtUrl(doubled, mobile, true, &error))
        << error->description();
    ASSERT_TRUE(STWMetadata::readAndValidateMetadataAtFileUrl(file, mobile, true, &error));

    // One level short ("Containers/Application/UUID") or one level too deep is not the class directory.
    for (const fs::path& misplaced :
         {classDirectory.parent_path().parent_path() / "Application" / uuid.string(),
          classDirectory / "Nested" / uuid.string()}) {
        fs::create_directories(misplaced);
        fs::copy_file(file, misplaced / STWMetadata::fileName);
        // A copy is the copier's; this one stands for one the daemon wrote.
        ASSERT_EQ(chown((misplaced / STWMetadata::fileName).c_str(), 0, 0), 0);
        error.reset();
        EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(misplaced, mobile, true, &error)) << misplaced;
        ASSERT_TRUE(error);
        EXPECT_NE(error->message().find("Invalid metadata-URLs should match:"), std::string::npos);
        EXPECT_TRUE(STWMetadata::readAndValidateMetadataAtUrl(misplaced, mobile, false, nullptr));
        STWFileManager::defaultManager()->removeItemAtURL(misplaced);
    }
}

} // namespace
