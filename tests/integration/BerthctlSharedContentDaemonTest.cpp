// berthctl's stage-shared, net-extension and assets subcommands against the
// real daemon: what they print, and the daemon's refusals as exit status 1
// with the code's name.
#include "DaemonSupport.h"
#include "core/ValueJson.h"
#include "platform/CodeSigningRegistry.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

constexpr const char* kAllowed = "sys.kelp.private.Berth.allowed";
const fs::path kBerthctl = BERTHCTL_BINARY_PATH;

class BerthctlSharedContentDaemonTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        signSelf("sys.kelp.content.tester", dict({{kAllowed, true}}));
        std::string why;
        ASSERT_EQ(CodeSigningRegistry().sign(kBerthctl, "sys.kelp.berthctl",
                                             dict({{kAllowed, true}}), &why),
                  0)
            << why;
        ASSERT_NO_FATAL_FAILURE(start());
    }
};

TEST_F(BerthctlSharedContentDaemonTest, AssetsPathIsKeptAndRefusalsNameTheirCode) {
    const std::string app = "sys.kelp.content.ctl";
    ASSERT_EQ(code(call(create(2, 1, app))), 1u);
    const Outcome first = run(kBerthctl, {"--json", "assets", "path", app});
    ASSERT_EQ(first.status, 0) << first.err;
    const std::optional<Value> printed = valueFromJson(first.out);
    ASSERT_TRUE(printed && printed->find("path")) << first.out;
    const fs::path assets = *printed->find("path")->string();
    EXPECT_TRUE(fs::is_directory(assets));
    const Outcome again = run(kBerthctl, {"assets", "path", app});
    EXPECT_EQ(again.out, assets.string() + "\n");

    writeFile(assets / "old.bin", "asset");
    const Outcome removed = run(kBerthctl, {"assets", "delete", app, "old.bin"});
    EXPECT_EQ(removed.status, 0) << removed.err;
    EXPECT_FALSE(fs::exists(assets / "old.bin"));

    const struct {
        std::vector<std::string> args;
        const char* error;
    } refused[] = {
        {{"assets", "delete", app, "../Preferences"}, "BTHErrorInvalidParameter (38)"},
        {{"assets", "path", "sys.kelp.content.none"}, "BTHErrorInvalidArgument (11)"},
        // berthctl is not the network-extension session daemon.
        {{"net-extension", "sys.kelp.content.vpn"}, "BTHErrorInvalidCommand (49)"},
        // Nor is it entitled to any system group.
        {{"stage-shared", "systemgroup.sys.kelp.content", "a", "b"}, "BTHErrorNotEntitled (55)"},
    };
    for (const auto& c : refused) {
        const Outcome outcome = run(kBerthctl, c.args);
        EXPECT_EQ(outcome.status, 1) << c.error;
        EXPECT_NE(outcome.err.find(c.error), std::string::npos) << outcome.err;
        EXPECT_TRUE(outcome.out.empty()) << outcome.out;
    }
}

}  // namespace
}  // namespace berth
