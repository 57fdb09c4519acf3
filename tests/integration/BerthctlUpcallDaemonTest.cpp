// "berthctl upcall" against a real daemon: the answer printed for people and
// as JSON, and the exit statuses of a daemon that cannot be asked and of a
// sender that is not the kernel.
#include <gtest/gtest.h>

#include "DaemonSupport.h"
#include "core/ValueJson.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using test::deviceRoot;

const fs::path kBerthctl = BERTHCTL_BINARY_PATH;

class BerthctlUpcallDaemonTest : public test::DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (HasFatalFailure() || IsSkipped()) return;
        ASSERT_NO_FATAL_FAILURE(start());
    }
    static fs::path home() { return fs::canonical(deviceRoot() / "private/var/mobile"); }
};

TEST_F(BerthctlUpcallDaemonTest, PrintsHomeDataTmpAndSuccess) {
    const test::Outcome outcome =
        test::run(kBerthctl, {"upcall", "--identifier", "com.example.cli", "--persona", "501"});
    ASSERT_EQ(outcome.status, 0) << outcome.err;
    const fs::path classDirectory = home() / "Containers/Data/Application";
    std::istringstream lines(outcome.out);
    std::string line;
    std::vector<std::string> printed;
    while (std::getline(lines, line)) printed.push_back(line);
    ASSERT_EQ(printed.size(), 4u) << outcome.out;
    EXPECT_EQ(printed[0], "home: " + home().string());
    ASSERT_EQ(printed[1].rfind("data container: " + classDirectory.string() + "/", 0), 0u)
        << printed[1];
    const std::string data = printed[1].substr(std::string("data container: ").size());
    EXPECT_TRUE(fs::is_directory(data));
    EXPECT_EQ(printed[2], "tmp: " + data + "/tmp");
    EXPECT_EQ(printed[3], "success: 1");
}

TEST_F(BerthctlUpcallDaemonTest, JsonCarriesGroupsAndAPluginsClass) {
    const test::Outcome outcome =
        test::run(kBerthctl, {"--json", "upcall", "--identifier", "com.example.cli", "--persona",
                              "501", "--plugin", "--group", "group.one", "--group", "group.two"});
    ASSERT_EQ(outcome.status, 0) << outcome.err;
    std::string why;
    const std::optional<Value> printed = valueFromJson(outcome.out, &why);
    ASSERT_TRUE(printed) << why << outcome.out;
    EXPECT_EQ(*printed->find("success"), Value(true));
    EXPECT_EQ(fs::path(*printed->find("dataContainer")->string()).parent_path(),
              home() / "Containers/Data/SprocketPlugin");
    const Value* groups = printed->find("groups");
    ASSERT_TRUE(groups && groups->isDictionary()) << outcome.out;
    for (const char* group : {"group.one", "group.two"}) {
        const Value* path = groups->find(group);
        ASSERT_TRUE(path && path->string()) << group;
        EXPECT_EQ(fs::path(*path->string()).parent_path(), home() / "Containers/Shared/AppGroup");
    }
}

TEST_F(BerthctlUpcallDaemonTest, ExitStatusTellsRefusalFromAnUnreachableDaemon) {
    // The daemon answers only the kernel's part, which is root; another user
    // cannot even open the socket (mode 0600).
    const test::Outcome notRoot = test::run(
        kBerthctl, {"upcall", "--identifier", "com.example.cli", "--persona", "501"}, 501);
    EXPECT_EQ(notRoot.status, 2);
    EXPECT_NE(notRoot.err.find("cannot reach the daemon's upcall socket"), std::string::npos)
        << notRoot.err;

    const test::Outcome missing =
        test::run(kBerthctl, {"upcall", "--identifier", "com.example.cli", "--persona", "501",
                              "--socket", (deviceRoot() / "run/berthd/no-such-socket").string()});
    EXPECT_EQ(missing.status, 2);
    EXPECT_NE(missing.err.find("No such file or directory"), std::string::npos) << missing.err;

    const test::Outcome usage = test::run(kBerthctl, {"upcall", "--persona", "501"});
    EXPECT_EQ(usage.status, 64) << usage.err;
}

}  // namespace
}  // namespace berth
