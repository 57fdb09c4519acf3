// Shared content, network extensions and user-managed assets (commands 26
// to 29) through the real daemon, with this program signed as a system
// service, the network-extension session daemon and an app: the answers of
// the entitlement and caller checks, and every client-chosen path that
// tries to leave its container refused with the outside left untouched.
#include <sys/stat.h>

#include "BTHCodeSigningMapping.h"
#include "DaemonSupport.h"
#include "core/BTHContainerClass.h"
#include "platform/SandboxMappingStore.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

constexpr const char* kGroup = "systemgroup.sys.kelp.content.test";
constexpr const char* kStage = "sys.kelp.private.Berth.stageSharedContent";
constexpr const char* kNetworkExtension = "sys.kelp.private.Berth.networkExtension";
constexpr const char* kAssets = "sys.kelp.private.Berth.userManagedAssets";
constexpr uint64_t kCaller = 1;  // "the caller's own user"

Value stage(const std::string& group, const std::string& source, const std::string& dest) {
    return dict({{"Command", uint64_t{26}},
                 {"Identifier", group},
                 {"SourcePath", source},
                 {"DestPath", dest}});
}

class DaemonSharedContentTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        ASSERT_NO_FATAL_FAILURE(start());
        outside_.emplace();
        fs::create_directories(outside_->path() / "inner");
        writeFile(outside_->path() / "secret", "outside");
        writeFile(outside_->path() / "inner" / "secret", "outside");
    }

    // The system-group container, as the entitled service sees it.
    fs::path signAsStager() {
        signSelf(
            "sys.kelp.content.stager",
            dict({{kStage, true}, {kBTHSystemGroupsEntitlement, BTHStringListValue({kGroup})}}));
        const Value reply = call(dict({{"Command", uint64_t{17}}, {"GroupIdentifier", kGroup}}));
        EXPECT_EQ(code(reply), 1u) << reply.description();
        return text(reply, "ReplyPath");
    }

    void expectOutsideUntouched(const std::string& what) {
        EXPECT_EQ(readFile(outside_->path() / "secret"), "outside") << what;
        EXPECT_EQ(readFile(outside_->path() / "inner" / "secret"), "outside") << what;
        EXPECT_EQ(lstatOf(outside_->path() / "secret").st_uid, 0u) << what;
        EXPECT_EQ(listing(outside_->path()), (std::vector<std::string>{"inner", "secret"})) << what;
    }

    std::optional<ScratchDir> outside_;
};

TEST_F(DaemonSharedContentTest, StagingMovesInsideTheEntitledGroupOnly) {
    const fs::path container = signAsStager();
    ASSERT_FALSE(container.empty());
    fs::create_directories(container / "incoming");
    writeFile(container / "incoming" / "report", "shared");

    const Value staged = call(stage(kGroup, "incoming/report", "report"));
    ASSERT_EQ(code(staged), 1u) << staged.description();
    EXPECT_EQ(text(staged, "ReplyPath"), (container / "report").string());
    EXPECT_EQ(readFile(container / "report"), "shared");
    EXPECT_EQ(lstatOf(container / "report").st_uid, kBTHNobodyUserId);
    EXPECT_FALSE(fs::exists(container / "incoming" / "report"));

    // A service with the command's entitlement but not the group's.
    signSelf("sys.kelp.content.other", dict({{kStage, true}}));
    EXPECT_EQ(code(call(stage(kGroup, "report", "again"))), uint64_t{BTHErrorNotEntitled});
    // Without the command's entitlement the request never reaches the check.
    signSelf("sys.kelp.content.stager",
             dict({{kBTHSystemGroupsEntitlement, BTHStringListValue({kGroup})}}));
    EXPECT_EQ(code(call(stage(kGroup, "report", "again"))), uint64_t{BTHErrorNotEntitled});
    EXPECT_TRUE(fs::exists(container / "report"));
}

TEST_F(DaemonSharedContentTest, StagingPathsThatLeaveTheContainerAreRefused) {
    const fs::path container = signAsStager();
    ASSERT_FALSE(container.empty());
    const fs::path out = outside_->path();
    fs::create_directories(container / "in");
    writeFile(container / "in" / "item", "inside");
    fs::create_symlink(out, container / "in" / "exit");
    fs::create_symlink("in/exit", container / "hop");  // relative, then absolute
    fs::create_symlink("../../../../../../../../..", container / "climb");
    fs::create_symlink("/proc/self/root" + out.string(), container / "magic");

    const struct {
        const char* source;
        const char* dest;
        uint64_t code;
        const char* log;
    } cases[] = {
        {"in/exit/secret", "taken", BTHErrorInvalidPath, "Invalid source URL"},
        {"hop/inner/secret", "taken", BTHErrorInvalidPath, "Invalid source URL"},
        {"climb/secret", "taken", BTHErrorInvalidPath, "Invalid source URL"},
        {"magic/secret", "taken", BTHErrorInvalidPath, "Invalid source URL"},
        {"in/item", "in/exit/planted", BTHErrorInvalidPath, "Invalid dest URL"},
        {"in/item", "hop/planted", BTHErrorInvalidPath, "Invalid dest URL"},
        {"../secret", "taken", BTHErrorInvalidParameter, "Paths can't contain dots"},
        {"in/item", "in/../../planted", BTHErrorInvalidParameter, "Paths can't contain dots"},
        {"-rf", "taken", BTHErrorACLFailed, "Failed to standardize ACLs"},  // missing
    };
    for (const auto& c : cases) {
        const Value reply = call(stage(kGroup, c.source, c.dest));
        EXPECT_EQ(code(reply), c.code) << c.source << " -> " << c.dest;
        EXPECT_EQ(reply.find("ReplyPath"), nullptr) << c.source;
        EXPECT_NE(daemonLog().find(c.log), std::string::npos) << c.log;
        expectOutsideUntouched(c.source);
    }
    EXPECT_EQ(readFile(container / "in" / "item"), "inside");
    EXPECT_FALSE(fs::exists(container / "taken"));
}

TEST_F(DaemonSharedContentTest, NetworkExtensionsOnlyForTheSessionDaemonAndDataClasses) {
    const auto setExtension = [&](uint64_t containerClass) {
        return code(call(dict({{"Command", uint64_t{27}},
                               {"Identifier", "sys.kelp.content.vpn"},
                               {"ContainerClass", containerClass}})));
    };
    signSelf("sys.kelp.tunnelsessiond", dict({{kNetworkExtension, true}}));
    EXPECT_EQ(setExtension(4), uint64_t{BTHErrorInvalidArgument});
    ASSERT_EQ(setExtension(6), 1u);
    const std::optional<std::string> recorded =
        SandboxMappingStore::shared().lookup(501, 1, "sys.kelp.tunnelagentd");
    ASSERT_TRUE(recorded);
    EXPECT_NE(recorded->find("Data/VPNPlugin/"), std::string::npos) << *recorded;
    EXPECT_TRUE(fs::is_directory(*recorded));

    // Entitled to the command, but not the session daemon.
    signSelf("sys.kelp.content.impostor", dict({{kNetworkExtension, true}}));
    EXPECT_EQ(setExtension(6), uint64_t{BTHErrorInvalidCommand});
    EXPECT_NE(daemonLog().find("Only tunnelsessiond can make this call"), std::string::npos);
}

TEST_F(DaemonSharedContentTest, AssetsDirectoryIsKeptAndDeletionStaysInside) {
    const std::string app = "sys.kelp.content.app";
    signSelf(app, dict({{kAssets, true}}));
    const Value container = call(create(2, kCaller, app));
    ASSERT_EQ(code(container), 1u) << container.description();
    const auto assetsPath = [&] {
        return call(
            dict({{"Command", uint64_t{28}}, {"Identifier", app}, {"UserID", uint64_t{502}}}));
    };
    const auto remove = [&](const std::string& path) {
        return code(
            call(dict({{"Command", uint64_t{29}}, {"Identifier", app}, {"SourcePath", path}})));
    };

    const Value first = assetsPath();
    ASSERT_EQ(code(first), 1u) << first.description();
    const fs::path assets = text(first, "ReplyPath");
    EXPECT_EQ(assets.parent_path(), fs::path(text(container, "ReplyPath")) / "Library");
    EXPECT_EQ(text(assetsPath(), "ReplyPath"), assets.string());
    EXPECT_EQ(lstatOf(assets).st_uid, 501u);  // "UserID" is ignored

    fs::create_directories(assets / "old");
    writeFile(assets / "old" / "a.bin", "asset");
    fs::create_symlink(outside_->path(), assets / "exit");
    fs::create_symlink("exit", assets / "hop");
    const struct {
        const char* path;
        uint64_t code;
    } refused[] = {
        {"../../Library", BTHErrorInvalidParameter}, {"old/../..", BTHErrorInvalidParameter},
        {"exit/secret", BTHErrorInvalidPath},        {"hop/inner/secret", BTHErrorInvalidPath},
        {"exit/inner", BTHErrorInvalidPath},         {"", BTHErrorInvalidPath},
    };
    for (const auto& c : refused) {
        EXPECT_EQ(remove(c.path), c.code) << c.path;
        expectOutsideUntouched(c.path);
    }
    EXPECT_TRUE(fs::is_directory(assets));
    EXPECT_EQ(remove("old/a.bin"), 1u);
    EXPECT_FALSE(fs::exists(assets / "old" / "a.bin"));

    // The directory removed: the same request fails and makes no new one.
    fs::remove_all(assets);
    const Value gone = assetsPath();
    EXPECT_EQ(code(gone), uint64_t{BTHErrorInvalidArgument});
    EXPECT_EQ(gone.find("ReplyPath"), nullptr);
    EXPECT_NE(daemonLog().find("User Managed Assets path does not exist: " + assets.string()),
              std::string::npos);
    for (const std::string& name : listing(assets.parent_path()))
        EXPECT_NE(name.rfind("sys.kelp.UserManagedAssets.", 0), 0u) << name;
}

}  // namespace
}  // namespace berth
