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
        viaVar = STWTestRoot::shared().resolve("/var") /
                 scratch().lexically_relative(STWTestRoot::shared().resolve("/private/var"));
        base = scratch() / "base";
        fs::create_directories(base / "sub/deeper");
        fs::create_directories(scratch() / "basement");
        fs::create_directories(scratch() / "outside");
        writeFile(base / "file", "f");
        writeFile(scratch() / "basement/x", "x");
        writeFile(scratch() / "outside/secret", "s");
    }

    fs::path base, viaVar;
};

TEST_F(RealPath, OnlyPathsThatStayBeneathTheBaseAreAccepted) {
    fs::create_symlink(base / "file", base / "absolute-inside");
    fs::create_symlink(scratch() / "outside/secret", base / "absolute-outside");
    fs::create_symlink("a/../../x", base / "climb");
    fs::create_symlink("../../outside/secret", base / "sub/climb-two");
    fs::create_symlink("..", base / "to-parent");
    fs::create_symlink("../file", base / "sub/up-one");
    fs::create_symlink("deeper/../../file", base / "sub/wander");
    fs::create_symlink("deeper/not-yet", base / "sub/dangling");
    fs::create_directory_symlink(scratch() / "outside", base / "door");
    // A relative link that only looks harmless once readlink has gone through the door.
    fs::create_symlink("secret", scratch() / "outside/innocent");
    fs::create_directory_symlink("sub", base / "alias");
    const fs::path baseViaVar = viaVar / "base";
    ASSERT_TRUE(fs::exists(baseViaVar / "file"));

    struct Case {
        fs::path path, against;
        std::optional<fs::path> expected;
    } cases[] = {
        // Children, the base itself and items that do not exist yet.
        {base / "file", base, base / "file"},
        {base, base, base},
        {base / "sub/new-file", base, base / "sub/new-file"},
        {base / "sub/new-dir/new-file", base, base / "sub/new-dir/new-file"},
        {base / "sub/", base, base / "sub"},
        // '..' is refused even where it stays inside; a lookalike sibling passes the string
        // prefix test and is caught by the component comparison.
        {base / "sub/../file", base, std::nullopt},
        {base / "sub/../../outside/secret", base, std::nullopt},
        {scratch() / "outside/secret", base, std::nullopt},
        {scratch() / "basement/x", base, std::nullopt},
        {scratch() / "basement", base, std::nullopt},
        {"", base, std::nullopt},
        {base / "file", "", std::nullopt},
        {scratch() / "no-base/file", scratch() / "no-base", std::nullopt},
        // Absolute links are refused wherever they point; relative ones may not climb out.
        {base / "absolute-inside", base, std::nullopt},
        {base / "absolute-outside", base, std::nullopt},
        {base / "climb", base, std::nullopt},
        {base / "sub/climb-two", base, std::nullopt},
        {base / "to-parent", base, std::nullopt},
        {base / "sub/up-one", base, base / "file"},
        {base / "sub/wander", base, base / "file"},
        {base / "sub/dangling", base, base / "sub/dangling"},
        // Links higher up the path are resolved and compared.
        {base / "door/secret", base, std::nullopt},
        {base / "door/not-yet", base, std::nullopt},
        {base / "door/innocent", base, std::nullopt},
        {base / "alias/deeper", base, base / "sub/deeper"},
        {base / "alias/new-dir/new-file", base, base / "sub/new-dir/new-file"},
        // ROOT/private/var and ROOT/var are the same place on both sides.
        {baseViaVar / "file", base, base / "file"},
        {base / "file", baseViaVar, base / "file"},
        {baseViaVar / "sub/new", baseViaVar, base / "sub/new"},
        {viaVar / "basement/x", base, std::nullopt},
        {viaVar / "base/../outside/secret", base, std::nullopt},
    };
    for (const Case& c : cases)
        EXPECT_EQ(fm()->realPathForURL(c.path, c.against), c.expected) << c.path << " against " << c.against;
}

} // namespace
