#include "tests/filesystem/STWFileSystemTestSupport.h"
#include "tests/support/STWTestRoot.h"

#include <unistd.h>

namespace fs = std::filesystem;
using namespace stwtest;

namespace {

// Paths as the daemon sees them: ROOT/private/var/..., with ROOT/var leading to
// ROOT/private/var as on the platform the layout comes from.
class RealPath : public FileSystemTest {
protected:
    void SetUp() override {
        FileSystemTest::SetUp();
        fs::path var = STWTestRoot::shared().resolve("/var");
        std::error_code ec;
        if (!fs::is_symlink(fs::symlink_status(var, ec)))
            fs::create_directory_symlink("private/var", var);
        // scratch() is ROOT/private/var/tests/t.XXXXXX
        viaVar = STWTestRoot::shared().resolve("/var") / scratch().lexically_relative(
                                                              STWTestRoot::shared().resolve("/private/var"));
        base = scratch() / "base";
        fs::create_directories(base / "sub/deeper");
        fs::create_directories(scratch() / "basement");
        fs::create_directories(scratch() / "outside");
        writeFile(base / "file", "f");
        writeFile(scratch() / "basement/x", "x");
        writeFile(scratch() / "outside/secret", "s");
    }

    std::optional<fs::path> check(const fs::path& path, const fs::path& against) {
        return fm()->realPathForURL(path, against);
    }
    std::optional<fs::path> check(const fs::path& path) { return check(path, base); }

    fs::path base, viaVar;
};

TEST_F(RealPath, AcceptsChildrenTheBaseAndNotYetExistingItems) {
    EXPECT_EQ(check(base / "file"), base / "file");
    EXPECT_EQ(check(base), base);
    EXPECT_EQ(check(base / "sub/new-file"), base / "sub/new-file");
    EXPECT_EQ(check(base / "sub/new-dir/new-file"), base / "sub/new-dir/new-file");
    EXPECT_EQ(check(base / "sub/"), base / "sub");
}

TEST_F(RealPath, RejectsDotDotPrefixMismatchesAndLookalikeSiblings) {
    EXPECT_FALSE(check(base / "sub/../file")) << "'..' is refused even where it stays inside";
    EXPECT_FALSE(check(base / "sub/../../outside/secret"));
    EXPECT_FALSE(check(scratch() / "outside/secret"));
    // Passes the string-prefix test, caught by the component comparison.
    EXPECT_FALSE(check(scratch() / "basement/x"));
    EXPECT_FALSE(check(scratch() / "basement"));
    EXPECT_FALSE(check("", base));
    EXPECT_FALSE(check(base / "file", ""));
}

TEST_F(RealPath, RejectsAbsoluteLinksAndRelativeLinksThatClimbOut) {
    fs::create_symlink(base / "file", base / "absolute-inside");
    fs::create_symlink(scratch() / "outside/secret", base / "absolute-outside");
    fs::create_symlink("a/../../x", base / "climb");
    fs::create_symlink("../../outside/secret", base / "sub/climb-two");
    fs::create_symlink("..", base / "to-parent");
    EXPECT_FALSE(check(base / "absolute-inside")) << "absolute links are refused wherever they point";
    EXPECT_FALSE(check(base / "absolute-outside"));
    EXPECT_FALSE(check(base / "climb"));
    EXPECT_FALSE(check(base / "sub/climb-two"));
    EXPECT_FALSE(check(base / "to-parent"));
}

TEST_F(RealPath, AcceptsRelativeLinksThatStayInside) {
    fs::create_symlink("../file", base / "sub/up-one");
    fs::create_symlink("deeper/../../file", base / "sub/wander");
    fs::create_symlink("deeper/not-yet", base / "sub/dangling");
    EXPECT_EQ(check(base / "sub/up-one"), base / "file");
    EXPECT_EQ(check(base / "sub/wander"), base / "file");
    EXPECT_EQ(check(base / "sub/dangling"), base / "sub/dangling");
}

TEST_F(RealPath, LinksHigherUpThePathAreResolvedAndCompared) {
    fs::create_directory_symlink(scratch() / "outside", base / "door");
    EXPECT_FALSE(check(base / "door/secret"));
    EXPECT_FALSE(check(base / "door/not-yet"));
    // A relative link that only looks harmless once readlink has gone through the door.
    fs::create_symlink("secret", scratch() / "outside/innocent");
    EXPECT_FALSE(check(base / "door/innocent"));
    // A link higher up that stays inside is fine.
    fs::create_directory_symlink("sub", base / "alias");
    EXPECT_EQ(check(base / "alias/deeper"), base / "sub/deeper");
}

TEST_F(RealPath, PrivateVarAndVarAreTheSamePlaceOnBothSides) {
    fs::path baseViaVar = viaVar / "base";
    ASSERT_TRUE(fs::exists(baseViaVar / "file"));
    EXPECT_EQ(check(baseViaVar / "file", base), base / "file");
    EXPECT_EQ(check(base / "file", baseViaVar), base / "file");
    EXPECT_EQ(check(baseViaVar / "sub/new", baseViaVar), base / "sub/new");
    EXPECT_FALSE(check(viaVar / "basement/x", base));
    EXPECT_FALSE(check(viaVar / "base/../outside/secret", base));
}

TEST_F(RealPath, PartsThatExistAreResolvedAndTheRestAppended) {
    fs::create_directory_symlink("sub", base / "alias");
    EXPECT_EQ(fm()->_realPathWhatExistsInPath((base / "alias/a/b").native()), base / "sub/a/b");
    EXPECT_FALSE(fm()->_realPathWhatExistsInPath("/no-such-top-level-dir-for-stowly/x"));
    EXPECT_FALSE(fm()->_realPathWhatExistsInPath("/"));
    EXPECT_FALSE(fm()->_realPathForURL(base / "a/b", false));
    EXPECT_EQ(fm()->_realPathForURL(base / "a/b", true), base / "a/b");
}

TEST(ValidateSymlink, MeasuresDepthLexically) {
    struct Case {
        const char* path;
        int32_t start;
        bool ok;
        int32_t end;
    } cases[] = {
        {"/a/b/c", 0, true, 3},     {"", 2, true, 2},          {"./a//b/.", 1, true, 3},
        {"/a/../../x", 1, false, 0},  {"/d/a/../../x", 1, true, 2}, {"a/../..", 0, false, 0},
        {"/..", 4, false, 0},        {"x/..", 4, true, 4},
    };
    for (const Case& c : cases) {
        int32_t end = -100;
        EXPECT_EQ(STWFileManager::_validateSymlink(c.path, c.start, &end), c.ok) << c.path;
        if (c.ok) {
            EXPECT_EQ(end, c.end) << c.path;
        }
    }
}

} // namespace
