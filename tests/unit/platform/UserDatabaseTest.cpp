#include "platform/UserDatabase.h"

#include "ScratchDeviceRoot.h"
#include "TestSupport.h"

namespace berth {
namespace {

const std::filesystem::path& root() {
    static const std::filesystem::path& path = test::installScratchDeviceRoot();
    return path;
}
// Before any test reads the databases: the device root is read once.
const bool kRootInstalled = !root().empty();

TEST(UserDatabaseTest, ReadsTheDeviceRootsDatabasesAndResolvesHomes) {
    auto mobile = UserDatabase::userByName("mobile");
    ASSERT_TRUE(mobile);
    EXPECT_EQ(mobile->uid, 501u);
    EXPECT_EQ(mobile->home, root() / "private/var/mobile");
    auto byId = UserDatabase::userById(33);
    ASSERT_TRUE(byId);
    EXPECT_EQ(byId->name, "_bundles");
    EXPECT_EQ(UserDatabase::groupIdByName("systemusers"), 510u);
    EXPECT_FALSE(UserDatabase::groupIdByName("nobody-here"));
    EXPECT_FALSE(UserDatabase::userById(4242));
}

TEST(UserDatabaseTest, MalformedLinesAreSkipped) {
    const auto passwd = root() / "etc/passwd";
    const std::string original = test::readFile(passwd);
    test::writeFile(passwd,
                    "# comment\n"
                    "broken\n"
                    "short:x:600\n"
                    "badid:x:60x:600::/h:/bin/sh\n"
                    ":x:601:601::/h:/bin/sh\n"
                    "mobile:x:501:501::/private/var/mobile:/bin/sh\n" +
                        original);
    EXPECT_FALSE(UserDatabase::userByName("broken"));
    EXPECT_FALSE(UserDatabase::userByName("short"));
    EXPECT_FALSE(UserDatabase::userByName("badid"));
    EXPECT_FALSE(UserDatabase::userById(601));
    auto mobile = UserDatabase::userById(501);
    ASSERT_TRUE(mobile);
    EXPECT_EQ(mobile->name, "mobile");
    test::writeFile(passwd, original);
}

}  // namespace
}  // namespace berth
