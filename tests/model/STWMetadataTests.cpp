#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWPropertyList.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

namespace {

class STWMetadataTest : public ::testing::Test {
protected:
    void SetUp() override {
        STWTestRoot::shared();
        mobile = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersona();
        classDirectory = *STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(mobile, 2, false);
        uuid = STWUUID::random();
        container = classDirectory / uuid.string();
        std::filesystem::create_directories(container);
    }
    void TearDown() override { STWFileManager::defaultManager()->removeItemAtURL(container); }

    STWMetadata make(STWContainerClass c = 2) {
        auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(uuid, mobile, "com.example.app", c, nullptr);
        return STWMetadata(identity, STWValue::Dictionary{{"com.vorlane.Setwright.ContentProtectionClass", STWValue(3)}},
                           container, std::nullopt);
    }
    // The daemon's files are immutable; a test changes them as root would.
    void unflag(const std::filesystem::path& file) {
        ASSERT_TRUE(STWFileManager::defaultManager()->setUserImmutableOfItemAtURL(file, false, nullptr));
    }
    STWValue::Dictionary stored() {
        return *STW_dictionaryWithContentsOfURL(container / STWMetadata::fileName, STWReadDefault, nullptr);
    }
    // Rewrites the file with one key changed (or removed, for a null value) and reads it back.
    std::string readError(const std::string& key, const STWValue& value, bool checkClassPath = true,
                          const STWUserIdentityRef& expected = nullptr) {
        STWValue::Dictionary d = stored();
        if (value.isNull())
            d.erase(key);
        else
            d[key] = value;
        unflag(container / STWMetadata::fileName);
        EXPECT_TRUE(STW_writeToURL(d, container / STWMetadata::fileName, STWWriteAtomic, nullptr));
        STWErrorRef error;
        EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(container, expected ? expected : mobile, checkClassPath, &error));
        if (!error)
            return "(no error)";
        EXPECT_EQ(error->code(), 29) << error->message();
        return error->message();
    }

    STWUserIdentityRef mobile;
    std::filesystem::path classDirectory, container;
    STWUUID uuid;
};

TEST_F(STWMetadataTest, RoundTripsAndRewritesLeaveOneFileAndNoTemporary) {
    STWMetadata metadata = make();
    STWErrorRef error;
    ASSERT_TRUE(metadata.writeMetadataToDiskWithError(&error));
    ASSERT_TRUE(metadata.writeMetadataToDiskWithError(&error));
    auto back = STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, &error);
    ASSERT_TRUE(back) << error->description();
    EXPECT_TRUE(back->containerIdentity()->isEqual(*metadata.containerIdentity()));
    EXPECT_EQ(back->info(), metadata.info());
    EXPECT_EQ(back->url(), container);
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(container), std::filesystem::directory_iterator()), 1);
    auto staging = STWGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(mobile, 2);
    EXPECT_TRUE(std::filesystem::is_empty(staging));
    STWValue::Dictionary d = stored();
    EXPECT_EQ(*STWDictionaryString(d, "STWMetadataVersion"), "2");
    EXPECT_EQ(*STWDictionaryString(d, "STWMetadataUUID"), uuid.string());
    EXPECT_TRUE(STWDictionaryDictionary(d, "STWMetadataUserIdentity"));
}

TEST_F(STWMetadataTest, EachKindOfInvalidFileIsRejectedWithItsMessage) {
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataContentClass", STWValue(0)).find("Invalid metadata Content Class: 0 at"), std::string::npos);
    EXPECT_NE(readError("STWMetadataContentClass", STWValue(14)).find("Invalid metadata Content Class: 14 at"), std::string::npos);
    EXPECT_NE(readError("STWMetadataContentClass", STWValue("2")).find("Invalid metadata Class: 2 at"), std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataIdentifier", STWValue(5)).find("Invalid metadata Identifier: 5 at"), std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataUUID", STWValue("not-a-uuid")).find("Invalid metadata UUID: not-a-uuid at"), std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataPersona", STWValue(502)).find("Incorrect UserId: 502, expecting: 501 for com.example.app at"),
              std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    auto other = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersonaWithUID(502, 502);
    std::string wrongUser = readError("STWMetadataPersona", STWValue(), true, other);
    EXPECT_NE(wrongUser.find("Incorrect User Identity:"), std::string::npos) << wrongUser;
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataInfo", STWValue("text")).find("Invalid metadata Info: text at"), std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataUserManagedAssetsDirName", STWValue(STWValue::Array{}))
                  .find("Invalid metadata User Managed Dir Name String: () at"),
              std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataIdentifier", STWValue()).find("Invalid metadata Identifier: (null) at"),
              std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    EXPECT_NE(readError("STWMetadataUUID", STWValue(5)).find("Invalid metadata UUID String: 5 at"), std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    STWValue::Dictionary badIdentity{{"posixUID", STWValue(501)}, {"posixGID", STWValue(501)}, {"type", STWValue(7)},
                                     {"version", STWValue("2")}};
    EXPECT_NE(readError("STWMetadataUserIdentity", STWValue(badIdentity)).find("Invalid metadata User Identity:"),
              std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    // A legacy owner of 501 read for user 502: the recorded id decides, whatever identity is stored.
    auto user502 = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersonaWithUID(502, 502);
    EXPECT_NE(readError("STWMetadataPersona", STWValue(501), true, user502).find("Incorrect UserId: 501, expecting: 502"),
              std::string::npos);
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    // Class 4 stored in a Data/Application directory.
    EXPECT_NE(readError("STWMetadataContentClass", STWValue(4)).find("Invalid metadata-URLs should match:"), std::string::npos);
    STWErrorRef error;
    EXPECT_TRUE(STWMetadata::readAndValidateMetadataAtUrl(container, mobile, false, &error)); // no class-path check

    unflag(container / STWMetadata::fileName);
    std::filesystem::remove(container / STWMetadata::fileName);
    error.reset();
    EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 12);
}

TEST_F(STWMetadataTest, LegacyAndGlobalFilesFindTheirUserIdentity) {
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    // Legacy file: only the POSIX user id is recorded; no comparison with the expected identity.
    STWValue::Dictionary d = stored();
    d.erase("STWMetadataUserIdentity");
    d["STWMetadataPersona"] = STWValue(501);
    unflag(container / STWMetadata::fileName);
    ASSERT_TRUE(STW_writeToURL(d, container / STWMetadata::fileName, STWWriteAtomic, nullptr));
    STWErrorRef error;
    auto legacy = STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, &error);
    ASSERT_TRUE(legacy);
    EXPECT_EQ(legacy->userIdentity()->posixUID(), 501u);

    // A system container needs no user identity: the default one is used whatever is expected.
    auto systemDirectory = *STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(mobile, 12, false);
    auto systemContainer = systemDirectory / uuid.string();
    std::filesystem::create_directories(systemContainer);
    auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(uuid, mobile, "com.vorlane.system", 12, nullptr);
    ASSERT_TRUE(STWMetadata(identity, std::nullopt, systemContainer, std::nullopt).writeMetadataToDiskWithError(&error));
    EXPECT_FALSE(STWDictionaryFind(*STW_dictionaryWithContentsOfURL(systemContainer / STWMetadata::fileName, 0, nullptr),
                                   "STWMetadataUserIdentity"));
    auto other = STWUserIdentitySharedCache::sharedInstance()->userIdentityForPersonalPersonaWithUID(502, 502);
    auto system = STWMetadata::readAndValidateMetadataAtUrl(systemContainer, other, true, &error);
    ASSERT_TRUE(system);
    EXPECT_EQ(*system->userIdentity(), *STWUserIdentityCache::defaultUserIdentity());
    STWFileManager::defaultManager()->removeItemAtURL(systemContainer);
}

TEST_F(STWMetadataTest, AFailedWriteKeepsThePreviousFile) {
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    // The final name is taken by a directory: the move fails, the old file's bytes stay.
    std::filesystem::path target = container / "blocked";
    std::filesystem::create_directories(target / "inside");
    STWErrorRef error;
    EXPECT_FALSE(make().writeMetadataToFileURL(target, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 34);
    EXPECT_NE(error->message().find("Failed to move metadata from staging:"), std::string::npos);
    EXPECT_TRUE(STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, nullptr));
}

TEST_F(STWMetadataTest, ReadingAcceptsXMLButNeverFollowsALinkOrAcceptsAnotherRoot) {
    STWMetadata metadata = make();
    ASSERT_TRUE(metadata.writeMetadataToDiskWithError(nullptr));
    std::filesystem::path file = container / STWMetadata::fileName;
    STWValue::Dictionary d = stored();
    unflag(file);
    ASSERT_EQ(STWWriteFileAtomically(file, STWPropertyList::serializeXML(STWValue(d)), 0644, false), 0);
    STWErrorRef error;
    auto back = STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, &error);
    ASSERT_TRUE(back) << error->description();
    EXPECT_TRUE(back->containerIdentity()->isEqual(*metadata.containerIdentity()));

    // The container's owner could point the file anywhere; a link is not a metadata file.
    std::filesystem::path elsewhere = classDirectory / ("elsewhere-" + uuid.string());
    ASSERT_EQ(STWWriteFileAtomically(elsewhere, STWPropertyList::serializeBinary(STWValue(d)), 0644, false), 0);
    std::filesystem::remove(file);
    std::filesystem::create_symlink(elsewhere, file);
    error.reset();
    EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 12);
    std::filesystem::remove(elsewhere);

    std::filesystem::remove(file);
    ASSERT_EQ(STWWriteFileAtomically(file, STWPropertyList::serializeBinary(STWValue(STWValue::Array{STWValue(d)})),
                                     0644, false),
              0);
    error.reset();
    EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 12);
}

TEST_F(STWMetadataTest, WithoutAnExpectedIdentityOnlyGlobalContainersRead) {
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    STWErrorRef error;
    EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(container, nullptr, true, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 29);

    ASSERT_TRUE(make(1).writeMetadataToDiskWithError(nullptr));
    // A bundle container needs no user identity; its class directory is elsewhere, so skip that check.
    auto bundle = STWMetadata::readAndValidateMetadataAtUrl(container, nullptr, false, &error);
    ASSERT_TRUE(bundle) << error->description();
    EXPECT_EQ(*bundle->userIdentity(), *STWUserIdentityCache::defaultUserIdentity());
}

TEST_F(STWMetadataTest, AWriteIsOnDiskBeforeItIsAcknowledgedAndStaysTheDaemons) {
    std::vector<std::string> synced;
    std::mutex mutex;
    STWFileManager::setSyncObserverForTesting([&](const std::string& path) {
        std::lock_guard guard(mutex);
        synced.push_back(path);
    });
    bool written = make().writeMetadataToDiskWithError(nullptr);
    STWFileManager::setSyncObserverForTesting(nullptr);
    ASSERT_TRUE(written);
    // The bytes under their temporary name beside the file, then the directory that now
    // holds the final name.
    auto bytes = std::find_if(synced.begin(), synced.end(), [&](const std::string& path) {
        return path.rfind((container / ".temp.").string(), 0) == 0;
    });
    auto rename = std::find(synced.begin(), synced.end(), container.string());
    EXPECT_NE(bytes, synced.end());
    EXPECT_NE(rename, synced.end());
    EXPECT_LT(bytes, rename);

    // Written by root, readable by all, and owned by nobody else: a copy that someone else
    // owns is no metadata.
    std::filesystem::path file = container / STWMetadata::fileName;
    struct stat st;
    ASSERT_EQ(stat(file.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0644u);
    EXPECT_EQ(st.st_uid, 0u);
    EXPECT_NE(unlink(file.c_str()), 0) << "the file is immutable";
    unflag(file);
    ASSERT_EQ(chown(file.c_str(), 501, 501), 0);
    STWErrorRef error;
    EXPECT_FALSE(STWMetadata::readAndValidateMetadataAtUrl(container, mobile, true, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), 29);
}

TEST_F(STWMetadataTest, TheClassDirectoryIsCheckedOnThePathAsGiven) {
    ASSERT_TRUE(make().writeMetadataToDiskWithError(nullptr));
    STWErrorRef error;
    // A trailing separator or a doubled one names the same directory.
    auto slash = STWMetadata::readAndValidateMetadataAtUrl(container.string() + "/", mobile, true, &error);
    ASSERT_TRUE(slash) << error->description();
    EXPECT_EQ(slash->url(), container);
    std::filesystem::path doubled = classDirectory.parent_path().string() + "//Application/" + uuid.string();
    ASSERT_TRUE(STWMetadata::readAndValidateMetadataAtUrl(doubled, mobile, true, &error)) << error->description();
    ASSERT_TRUE(STWMetadata::readAndValidateMetadataAtFileUrl(container / STWMetadata::fileName, mobile, true, &error));

    // One level short ("Containers/Application/UUID") or one level too deep is not the class directory.
    for (const std::filesystem::path& misplaced :
         {classDirectory.parent_path().parent_path() / "Application" / uuid.string(),
          classDirectory / "Nested" / uuid.string()}) {
        std::filesystem::create_directories(misplaced);
        std::filesystem::copy_file(container / STWMetadata::fileName, misplaced / STWMetadata::fileName);
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
