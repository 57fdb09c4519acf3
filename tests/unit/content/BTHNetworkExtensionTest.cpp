// Network extensions on a scratch root: who may ask (by signing identifier,
// the test tool only on internal builds), which classes, and what the
// sandbox mapping records for the agent.
#include "BTHNetworkExtension.h"

#include "BTHGlobalConfiguration.h"
#include "BTHPropertyListFile.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceRoot.h"
#include "platform/SandboxMappingStore.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

void setInternalBuild(bool internal) {
    test::writeDeviceProperties(dict({{"InternalBuild", internal}}));
}

class BTHNetworkExtensionTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        setInternalBuild(false);
        mobile_ = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
    }
    void TearDown() override { setInternalBuild(false); }

    uint64_t set(const std::optional<std::string>& caller, const std::string& identifier,
                 uint64_t containerClass) {
        BTHClientConnection client(caller, 0, false, std::nullopt);
        uint64_t code = BTHErrorSuccess;
        setNetworkExtensionForUser(client, mobile_, identifier, containerClass, &code);
        return code;
    }

    // What the sandbox mapping holds for the agent (item type 1: a data
    // container of the user).
    std::optional<std::string> agentMapping() {
        return SandboxMappingStore::shared().lookup(mobile_, 1, kBTHNetworkExtensionAgent);
    }

    uid_t mobile_ = 0;
};

TEST_F(BTHNetworkExtensionTest, OnlyTheSessionDaemonMayAskAndOnlyForDataClasses) {
    test::LogCapture log;
    const struct {
        std::optional<std::string> caller;
        uint64_t containerClass;
        uint64_t code;
    } cases[] = {
        {kBTHNetworkExtensionCaller, BTHContainerClassDataSprocketPlugin, BTHErrorInvalidArgument},
        {kBTHNetworkExtensionCaller, BTHContainerClassBundleVPNPlugin, BTHErrorInvalidArgument},
        {kBTHNetworkExtensionCaller, 99, BTHErrorInvalidArgument},
        // A process that merely calls itself the session daemon has another
        // signing identifier, or none.
        {"tunnelsessiond", BTHContainerClassDataVPNPlugin, BTHErrorInvalidCommand},
        {"sys.kelp.tunnelsessiond.helper", BTHContainerClassDataVPNPlugin, BTHErrorInvalidCommand},
        {std::nullopt, BTHContainerClassDataVPNPlugin, BTHErrorInvalidCommand},
        {kBTHNetworkExtensionTestCaller, BTHContainerClassDataVPNPlugin, BTHErrorInvalidCommand},
    };
    for (const auto& entry : cases) {
        EXPECT_EQ(set(entry.caller, "sys.kelp.vpn.refused", entry.containerClass), entry.code)
            << entry.caller.value_or("(none)") << " " << entry.containerClass;
    }
    EXPECT_TRUE(log.contains(3,
                             "Can't set network extension on container of type: 4, identifier: "
                             "sys.kelp.vpn.refused"));
    EXPECT_TRUE(log.contains(3, "Only tunnelsessiond can make this call"));
    EXPECT_FALSE(agentMapping());

    BTHClientConnection client(std::string(kBTHNetworkExtensionCaller), 0, false, std::nullopt);
    uint64_t code = BTHErrorSuccess;
    setNetworkExtensionForUser(client, mobile_, std::nullopt, BTHContainerClassDataVPNPlugin,
                               &code);
    EXPECT_EQ(code, uint64_t{BTHErrorInvalidArgument});
}

TEST_F(BTHNetworkExtensionTest, TheContainerIsMadeAndRecordedForTheAgent) {
    for (const uint64_t containerClass :
         {uint64_t{BTHContainerClassDataVPNPlugin}, uint64_t{BTHContainerClassDataApplication}}) {
        const std::string identifier = "sys.kelp.vpn." + std::to_string(containerClass);
        ASSERT_EQ(set(kBTHNetworkExtensionCaller, identifier, containerClass), 1u);
        uint64_t code = BTHErrorSuccess;
        const BTHMetadataRef container =
            BTHClientConnection::sharedClientConnection()->createOrLookupContainerForUser(
                mobile_, identifier, false, containerClass, false, true, &code);
        ASSERT_TRUE(container) << code;
        EXPECT_EQ(agentMapping(), container->url().string());
        // Asking again finds the same container.
        ASSERT_EQ(set(kBTHNetworkExtensionCaller, identifier, containerClass), 1u);
        EXPECT_EQ(agentMapping(), container->url().string());
    }
}

TEST_F(BTHNetworkExtensionTest, TheTestToolActsAsTheSessionDaemonOnInternalBuildsOnly) {
    setInternalBuild(true);
    EXPECT_EQ(
        set(kBTHNetworkExtensionTestCaller, "sys.kelp.vpn.test", BTHContainerClassDataVPNPlugin),
        1u);
    setInternalBuild(false);
    EXPECT_EQ(
        set(kBTHNetworkExtensionTestCaller, "sys.kelp.vpn.test", BTHContainerClassDataVPNPlugin),
        uint64_t{BTHErrorInvalidCommand});
}

}  // namespace
}  // namespace berth
