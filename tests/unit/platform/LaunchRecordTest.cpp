// The launch records: what berth-launch writes and the daemon believes,
// and everything a record must be for the daemon to believe it.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "platform/DeviceRoot.h"
#include "platform/LaunchRecord.h"

namespace berth {
namespace {

namespace fs = std::filesystem;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

const std::string kLaunch = "00112233445566778899aabbccddeeff";

LaunchRecord sample() {
    LaunchRecord record{"com.example.app",
                        "/Applications/App/app",
                        {},
                        501,
                        "berthd.launch/com.example.app/" + kLaunch,
                        0xFFFF'FFFF'FFFF'FFF0ull};
    record.digest.fill(0xA5);
    return record;
}

class LaunchRecordTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        fs::remove_all(records_.directory());
    }
    fs::path fileOf(const std::string& launch) const {
        return records_.directory() / (launch + ".plist");
    }

    LaunchRecords records_;
};

TEST_F(LaunchRecordTest, ARecordReadsBackAsWrittenAndGoes) {
    EXPECT_EQ(records_.directory(), DeviceRoot::resolve("/run/berthd/launches"));
    std::string why;
    EXPECT_FALSE(records_.read(kLaunch, &why));
    EXPECT_NE(why.find("no launch record for " + kLaunch), std::string::npos) << why;

    ASSERT_EQ(records_.write(kLaunch, sample(), &why), 0) << why;
    EXPECT_EQ(records_.read(kLaunch, &why), sample()) << why;
    EXPECT_EQ(test::lstatOf(fileOf(kLaunch)).st_mode & 07777, 0644u);
    EXPECT_EQ(records_.launches(), std::vector<std::string>{kLaunch});

    EXPECT_EQ(records_.remove(kLaunch), 0);
    EXPECT_EQ(records_.remove(kLaunch), ENOENT);
    EXPECT_TRUE(records_.launches().empty());
}

TEST_F(LaunchRecordTest, OnlyRootWritesAndOnlyWholeRecordsUnderLaunchNames) {
    EXPECT_EQ(test::inChild([] { return LaunchRecords().write(kLaunch, sample()); }, 501), EPERM);
    std::string why;
    for (const std::string& bad :
         std::vector<std::string>{"", "../x", kLaunch + "0", "00112233445566778899AABBCCDDEEFF"}) {
        EXPECT_EQ(records_.write(bad, sample(), &why), EINVAL) << bad;
        EXPECT_FALSE(records_.read(bad, &why)) << bad;
    }
    LaunchRecord incomplete = sample();
    incomplete.cgroup.clear();
    EXPECT_EQ(records_.write(kLaunch, incomplete, &why), EINVAL);
    incomplete = sample();
    incomplete.executablePath = "relative/app";
    EXPECT_EQ(records_.write(kLaunch, incomplete, &why), EINVAL);
    EXPECT_FALSE(fs::exists(fileOf(kLaunch)));
}

TEST_F(LaunchRecordTest, ARecordAnotherUserCouldHaveWrittenIsIgnored) {
    std::string why;
    ASSERT_EQ(records_.write(kLaunch, sample(), &why), 0) << why;
    const fs::path file = fileOf(kLaunch);
    const fs::path directory = records_.directory();
    struct Case {
        const char* what;
        std::function<void()> breakIt;
        std::function<void()> repair;
        const char* why;
    };
    const std::vector<Case> cases = {
        {"file of another owner", [&] { ASSERT_EQ(::chown(file.c_str(), 501, 501), 0); },
         [&] { ASSERT_EQ(::chown(file.c_str(), 0, 0), 0); }, "is not root's alone"},
        {"file writable by others", [&] { ASSERT_EQ(::chmod(file.c_str(), 0666), 0); },
         [&] { ASSERT_EQ(::chmod(file.c_str(), 0644), 0); }, "is not root's alone"},
        {"directory writable by the group", [&] { ASSERT_EQ(::chmod(directory.c_str(), 0775), 0); },
         [&] { ASSERT_EQ(::chmod(directory.c_str(), 0755), 0); }, "is not root's alone"},
        {"directory of another owner",
         [&] { ASSERT_EQ(::chown(directory.parent_path().c_str(), 501, 501), 0); },
         [&] { ASSERT_EQ(::chown(directory.parent_path().c_str(), 0, 0), 0); },
         "is not root's alone"},
        {"a link to a record",
         [&] {
             fs::rename(file, directory / "elsewhere");
             fs::create_symlink(directory / "elsewhere", file);
         },
         [&] {
             fs::remove(file);
             fs::rename(directory / "elsewhere", file);
         },
         "is a symbolic link"},
        {"not a property list", [&] { test::writeFile(file, "garbage"); },
         [&] { ASSERT_EQ(records_.write(kLaunch, sample()), 0); }, "is ignored"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        c.breakIt();
        why.clear();
        EXPECT_FALSE(records_.read(kLaunch, &why));
        EXPECT_NE(why.find(c.why), std::string::npos) << why;
        c.repair();
        EXPECT_EQ(records_.read(kLaunch, &why), sample()) << why;
    }
}

}  // namespace
}  // namespace berth
