// The torture's checker on roots laid out by hand: it must see every kind of damage it
// exists for, and accept (and learn from) what an unanswered request may have left.
#include "reliability/torture/STWTortureChecker.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <plist/plist.h>

namespace fs = std::filesystem;

namespace {

struct Root {
    Root() {
        char templ[] = "/tmp/stowly-checker-XXXXXX";
        path = mkdtemp(templ);
    }
    ~Root() { fs::remove_all(path); }

    // A container directory with a metadata file as the daemon writes it; its directory is
    // named by the container's UUID unless told otherwise. A per-user one lies in `home` and
    // records `persona`.
    std::string container(uint64_t containerClass, const std::string& identifier, const std::string& uuid,
                          int64_t info = -1, std::string directoryName = {}, int64_t protection = -1,
                          const std::string& persona = {}, const std::string& home = STWTortureChecker::mobileHome) {
        fs::path directory = path / STWTortureChecker::classDirectory(containerClass, home) /
                             (directoryName.empty() ? uuid : directoryName);
        fs::create_directories(directory);
        plist_t dict = plist_new_dict();
        plist_dict_set_item(dict, "STWMetadataIdentifier", plist_new_string(identifier.c_str()));
        plist_dict_set_item(dict, "STWMetadataUUID", plist_new_string(uuid.c_str()));
        plist_dict_set_item(dict, "STWMetadataContentClass", plist_new_uint(containerClass));
        if (!persona.empty()) {
            plist_t user = plist_new_dict();
            plist_dict_set_item(user, "personaUniqueString", plist_new_string(persona.c_str()));
            plist_dict_set_item(dict, "STWMetadataUserIdentity", user);
        }
        if (info >= 0 || protection >= 0) {
            plist_t infoDict = plist_new_dict();
            if (info >= 0)
                plist_dict_set_item(infoDict, STWTortureChecker::infoKey, plist_new_uint(info));
            if (protection >= 0)
                plist_dict_set_item(infoDict, "com.vorlane.Setwright.ContentProtectionClass",
                                    plist_new_uint(protection));
            plist_dict_set_item(dict, "STWMetadataInfo", infoDict);
        }
        char* xml = nullptr;
        uint32_t length = 0;
        plist_to_xml(dict, &xml, &length);
        std::ofstream(directory / ".com.vorlane.stowly.metadata.plist") << std::string(xml, length);
        plist_to_xml_free(xml);
        plist_free(dict);
        return directory;
    }
    fs::path path;
};

const std::string enterpriseHome = "private/var/enterprise/e", enterprise = "ENTERPRISE";
const std::string A = "11111111-1111-1111-1111-111111111111", B = "22222222-2222-2222-2222-222222222222",
                  C = "33333333-3333-3333-3333-333333333333";

bool mentions(const std::vector<std::string>& violations, const std::string& text) {
    for (const auto& v : violations)
        if (v.find(text) != std::string::npos)
            return true;
    return false;
}

} // namespace

// Whole containers that match what was acknowledged pass; what an unanswered request may
// have left passes too, and becomes what the record knows.
TEST(STWTortureChecker, AcceptsWhatTheRepliesAllowAndLearnsTheRest) {
    Root root;
    std::string data = root.container(2, "com.example.data", A, 7, "99999999-9999-9999-9999-999999999999");
    root.container(12, "com.example.system", B);
    root.container(7, "group.example", C);
    STWTortureModel model;
    model.containers[{2, "com.example.data"}] = STWTortureExpectation::present(A, data);
    model.containers[{2, "com.example.data"}].info = {7};
    model.containers[{12, "com.example.system"}] = STWTortureExpectation::unknown();
    model.containers[{1, "com.example.gone"}] = STWTortureExpectation::unknown();
    model.owners["com.example.data"].groups = {"group.example"};
    // A protection change refused after its walk began: the data may differ from the record.
    const std::string D = "88888888-8888-8888-8888-888888888888";
    model.containers[{2, "com.example.partial"}] =
        STWTortureExpectation::present(D, root.container(2, "com.example.partial", D, -1, {}, 3));
    model.containers[{2, "com.example.partial"}].protectionMayBePartial = true;
    // A deletion that answered success under faults, of a container the log names as stuck.
    const std::string E = "aaaaaaaa-aaaa-aaaa-aaaa-aaaaaaaaaaaa";
    auto& stuck = model.containers[{2, "com.example.stuck"}] =
        STWTortureExpectation::present(E, root.container(2, "com.example.stuck", E));
    stuck.mayBeAbsent = stuck.deletionAnswered = true;

    // An enterprise thread's data in its persona's home, a personal one's in the mobile home.
    const std::string F = "bbbbbbbb-bbbb-bbbb-bbbb-bbbbbbbbbbbb";
    STWTortureModel work;
    work.persona = enterprise;
    work.containers[{2, "com.example.work"}] = STWTortureExpectation::present(
        F, root.container(2, "com.example.work", F, -1, {}, -1, enterprise, enterpriseHome));
    model.containers[{2, "com.example.home"}] = STWTortureExpectation::unknown();
    root.container(2, "com.example.home", "cccccccc-cccc-cccc-cccc-cccccccccccc", -1, {}, -1, "PERSONAL");

    STWTortureChecker checker(root.path);
    checker.undeletable = {stuck.path};
    checker.enterpriseHomes[enterpriseHome] = enterprise;
    EXPECT_EQ(checker.check({&model, &work}, std::chrono::milliseconds(0)), std::vector<std::string>());
    EXPECT_TRUE(model.containers.at({12, "com.example.system"}).definitelyPresent());
    EXPECT_EQ(model.containers.at({12, "com.example.system"}).uuid(), B);
    EXPECT_TRUE(model.containers.at({1, "com.example.gone"}).definitelyAbsent());
}

TEST(STWTortureChecker, ReportsEveryKindOfDamage) {
    Root root;
    root.container(2, "com.example.moved", B);                       // acknowledged as A
    root.container(2, "com.example.twice", A);
    root.container(2, "com.example.twice", C);                       // a second one
    root.container(2, "com.example.info", "44444444-4444-4444-4444-444444444444", 3);
    fs::create_directories(root.path / STWTortureChecker::classDirectory(12));
    fs::rename(root.container(2, "com.example.system", A, -1, "55555555-5555-5555-5555-555555555555"),
               root.path / STWTortureChecker::classDirectory(12) / "55555555-5555-5555-5555-555555555555");
    fs::create_directories(root.path / STWTortureChecker::classDirectory(2) / "66666666-6666-6666-6666-666666666666");
    root.container(7, "group.orphan", A);
    std::string deleted = root.container(1, "com.example.deleted", C);
    // A class recorded while the data still has another (no class at all, here).
    root.container(2, "com.example.protected", "77777777-7777-7777-7777-777777777777", -1, {}, 3);
    fs::create_directories(root.path / "private/var/root/Library/Stowly/Replace");
    std::ofstream(root.path / "private/var/root/Library/Stowly/Replace/journal") << "x";
    fs::create_directories(root.path / "private/var/root/Library/Caches/com.vorlane.stowlyd/Dead/temp.1");
    fs::create_directories(root.path / "run/stowly/sandbox/501/501/1");
    fs::create_symlink("/elsewhere", root.path / "run/stowly/sandbox/501/501/1/com.example.moved");

    STWTortureModel model;
    model.containers[{2, "com.example.moved"}] = STWTortureExpectation::present(A, "");
    model.containers[{2, "com.example.missing"}] = STWTortureExpectation::present(A, "");
    model.containers[{2, "com.example.info"}] = STWTortureExpectation::present("44444444-4444-4444-4444-444444444444", "");
    model.containers[{2, "com.example.info"}].info = {4};
    model.containers[{1, "com.example.deleted"}] = STWTortureExpectation::absent();
    // Its deletion answered success under faults, and the log names no failure at its path.
    std::string stuck = root.container(2, "com.example.stuck", "aaaaaaaa-aaaa-aaaa-aaaa-aaaaaaaaaaaa");
    auto& answered = model.containers[{2, "com.example.stuck"}] = STWTortureExpectation::unknown();
    answered.deletionAnswered = true;
    // A personal container in the enterprise home, an enterprise thread's in the mobile home.
    root.container(2, "com.example.lost", "dddddddd-dddd-dddd-dddd-dddddddddddd", -1, {}, -1, "PERSONAL",
                   enterpriseHome);
    STWTortureModel work;
    work.persona = enterprise;
    work.containers[{2, "com.example.work"}] = STWTortureExpectation::unknown();
    root.container(2, "com.example.work", "eeeeeeee-eeee-eeee-eeee-eeeeeeeeeeee", -1, {}, -1, "PERSONAL");

    STWTortureChecker checker(root.path);
    checker.enterpriseHomes[enterpriseHome] = enterprise;
    auto violations = checker.check({&model, &work}, std::chrono::milliseconds(0));
    EXPECT_TRUE(mentions(violations, "com.example.moved (class 2) has UUID " + B)) << violations.size();
    EXPECT_TRUE(mentions(violations, "com.example.missing (class 2) missing"));
    EXPECT_TRUE(mentions(violations, "two containers for com.example.twice"));
    EXPECT_TRUE(mentions(violations, "has info value 3"));
    EXPECT_TRUE(mentions(violations, "metadata says class 2"));
    EXPECT_TRUE(mentions(violations, "66666666-6666-6666-6666-666666666666: no readable metadata file"));
    EXPECT_TRUE(mentions(violations, "com.example.deleted (class 1) present at " + deleted));
    EXPECT_TRUE(mentions(violations, "com.example.stuck (class 2) present at " + stuck + ", its deletion answered"));
    EXPECT_TRUE(mentions(violations, "group container"));
    EXPECT_TRUE(mentions(violations, "replace journal left"));
    EXPECT_TRUE(mentions(violations, "death row entry left"));
    EXPECT_TRUE(mentions(violations, "records protection class 3, its Documents has class -1"));
    EXPECT_TRUE(mentions(violations, "com.example.lost (class 2) at " + (root.path / enterpriseHome).string()));
    EXPECT_TRUE(mentions(violations, "com.example.work (class 2) belongs to persona \"PERSONAL\""));
    auto mappings = checker.checkMappings({{2, "com.example.moved"}, {12, "com.example.system"}});
    EXPECT_TRUE(mentions(mappings, "points at /elsewhere"));
    EXPECT_EQ(violations.size(), 14u);
}
