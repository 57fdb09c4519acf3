// A device without a "mobile" account: the global configuration is a
// per-process singleton, so this case has its own test program.

#include "BTHGlobalConfiguration.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"

namespace berth {
namespace {

TEST(BTHNoMobileUserTest, CurrentMobileUserIsZeroAndTheLackIsLogged) {
    test::installScratchDeviceRoot({.withMobileUser = false});
    test::LogCapture log;
    EXPECT_EQ(BTHGlobalConfiguration::sharedInstance().currentMobileUserId(), 0u);
    EXPECT_TRUE(log.contains(3, "Failed to get mobile uid. This is bad"));
    std::vector<uid_t> visited;
    BTHGlobalConfiguration::sharedInstance().enumerateUsers([&](uid_t u) { visited.push_back(u); });
    EXPECT_EQ(visited, std::vector<uid_t>{0});
}

}  // namespace
}  // namespace berth
