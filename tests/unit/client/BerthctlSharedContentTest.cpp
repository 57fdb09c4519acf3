// The shared-content, network-extension and assets commands on the client
// side, without a daemon: the exact requests sent, the replies read, and the
// command lines refused before anything is sent.
#include <gtest/gtest.h>

#include <sstream>

#include "ExitStatus.h"
#include "SharedContentCommands.h"
#include "libberth/BerthGroups.h"
#include "libberth/BerthSharedContent.h"

namespace berth {
namespace {

// The daemon reads numbers with its unsigned getter and paths as strings;
// commands 27 to 29 carry no "UserID" (they act for the mobile user).
TEST(BerthSharedContentRequests, CarryEachKeyWithTheKindTheDaemonReads) {
    const struct {
        const char* name;
        Value request;
        uint64_t command;
        std::vector<std::pair<const char*, Value>> keys;
    } cases[] = {
        {"stage",
         makeStageSharedContentRequest("systemgroup.a", "in/x", "out/x"),
         26,
         {{"Identifier", Value("systemgroup.a")},
          {"SourcePath", Value("in/x")},
          {"DestPath", Value("out/x")}}},
        {"net extension",
         makeSetNetworkExtensionRequest("com.example.vpn", 6),
         27,
         {{"Identifier", Value("com.example.vpn")}, {"ContainerClass", Value(uint64_t{6})}}},
        {"assets path",
         makeUserManagedAssetsPathRequest("com.example.notes"),
         28,
         {{"Identifier", Value("com.example.notes")}}},
        {"assets delete",
         makeDeleteUserManagedAssetRequest("com.example.notes", "old/a.bin"),
         29,
         {{"Identifier", Value("com.example.notes")}, {"SourcePath", Value("old/a.bin")}}},
    };
    for (const auto& c : cases) {
        ASSERT_TRUE(c.request.find("Command")) << c.name;
        EXPECT_EQ(*c.request.find("Command"), Value(c.command)) << c.name;
        for (const auto& [key, value] : c.keys) {
            ASSERT_TRUE(c.request.find(key)) << c.name << " " << key;
            EXPECT_EQ(*c.request.find(key), value) << c.name << " " << key;
        }
        EXPECT_EQ(c.request.find("UserID"), nullptr) << c.name;
        EXPECT_EQ(c.request.dictionaryValue()->size(), c.keys.size() + 1) << c.name;
    }
}

TEST(BerthSharedContentReplies, APathOrTheReplysError) {
    Value staged = Value::dictionary();
    staged.set("ReplyError", uint64_t{1});
    staged.set("ReplyPath", "/c/out/x");
    ContainerError error;
    EXPECT_EQ(decodePathReply(staged, &error), std::filesystem::path("/c/out/x"));
    Value refused = Value::dictionary();
    refused.set("ReplyError", uint64_t{10});
    EXPECT_FALSE(decodePathReply(refused, &error));
    EXPECT_EQ(error.code, 10u);
    EXPECT_EQ(error.name, "BTHErrorInvalidPath");
}

TEST(BerthctlSharedContent, RefusesBadClassesBeforeConnecting) {
    for (const char* bad : {"14", "Data/Nothing", ""}) {
        ctl::SharedContentOptions options;
        options.action = ctl::SharedContentAction::NetExtension;
        options.identifier = "com.example.vpn";
        options.containerClass = bad;
        options.socket = "/nonexistent/socket";  // never reached
        std::ostringstream out, err;
        EXPECT_EQ(ctl::runSharedContentCommand(options, out, err), ctl::kExitUsage) << bad;
        EXPECT_TRUE(out.str().empty()) << bad;
    }
    ctl::SharedContentOptions unreachable;
    unreachable.action = ctl::SharedContentAction::AssetsPath;
    unreachable.identifier = "com.example.notes";
    unreachable.socket = "/nonexistent/socket";
    std::ostringstream out, err;
    EXPECT_EQ(ctl::runSharedContentCommand(unreachable, out, err), ctl::kExitTransport);
    EXPECT_NE(err.str().find("error: "), std::string::npos);
}

}  // namespace
}  // namespace berth
