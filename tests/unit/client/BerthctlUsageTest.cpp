// The disk-usage and protection commands on the client side, without a
// daemon: the exact requests sent, what is made of the replies, and the
// command lines refused before anything is sent.
#include <gtest/gtest.h>

#include <sstream>

#include "ExitStatus.h"
#include "UsageCommands.h"
#include "libberth/BerthUsage.h"

namespace berth {
namespace {

const Uuid kUuid = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");

ContainerSelector dataContainer() {
    ContainerSelector selector;
    selector.containerClass = 2;
    selector.identifier = "com.example.notes";
    selector.uuid = kUuid;
    return selector;
}

// The daemon reads "DataProtectionClass" as a signed number and every other
// number with its unsigned getter, so the kinds must be exact.
TEST(BerthUsageRequests, CarryEachKeyWithTheKindTheDaemonReads) {
    const Value usage = makeDiskUsageRequest(dataContainer());
    EXPECT_EQ(usage.find("Command")->kind(), Value::Kind::UInt64);
    EXPECT_EQ(usage.find("Command")->uint64Value(), 23u);
    EXPECT_EQ(usage.find("ContainerClass")->kind(), Value::Kind::UInt64);
    EXPECT_EQ(usage.find("UserID")->uint64Value(), 1u);
    EXPECT_EQ(*usage.find("UUID"), Value(kUuid));
    EXPECT_EQ(*usage.find("Identifier"), Value("com.example.notes"));

    const Value protect = makeSetDataProtectionRequest(dataContainer(), -1, true, false);
    EXPECT_EQ(protect.find("Command")->uint64Value(), 21u);
    EXPECT_EQ(protect.find("DataProtectionClass")->kind(), Value::Kind::Int64);
    EXPECT_EQ(protect.find("DataProtectionClass")->int64Value(), -1);
    EXPECT_EQ(*protect.find("IsThirdParty"), Value(true));
    EXPECT_EQ(*protect.find("RetryIfLocked"), Value(false));
    EXPECT_EQ(protect.find("UUID"), nullptr);  // the daemon finds the container by identifier
}

TEST(BerthUsageReplies, DecodeTheUsageOrSayWhatIsWrong) {
    struct Case {
        const char* name;
        Value reply;
        std::optional<uint64_t> usage;
        uint64_t code;  // of the reply error, 0 for a malformed reply
    };
    auto reply = [](Value error, std::optional<Value> usage) {
        Value r = Value::dictionary();
        r.set("ReplyError", std::move(error));
        if (usage) r.set("ReplyDiskUsage", std::move(*usage));
        return r;
    };
    const Case cases[] = {
        {"success", reply(uint64_t{1}, Value(uint64_t{4096})), 4096, 0},
        {"refused with usage 0", reply(uint64_t{21}, Value(uint64_t{0})), std::nullopt, 21},
        {"success without usage", reply(uint64_t{1}, std::nullopt), std::nullopt, 0},
        {"signed usage", reply(uint64_t{1}, Value(int64_t{4096})), std::nullopt, 0},
        {"no code", Value::dictionary(), std::nullopt, 0},
    };
    for (const Case& c : cases) {
        ContainerError error;
        EXPECT_EQ(decodeDiskUsageReply(c.reply, &error), c.usage) << c.name;
        if (!c.usage) {
            EXPECT_EQ(error.code, c.code) << c.name;
            if (c.code == 0) {
                EXPECT_EQ(error.transport.code, BerthError::Code::ProtocolError) << c.name;
            }
        }
    }
}

TEST(BerthctlUsage, RefusesBadCommandLinesBeforeConnecting) {
    struct Case {
        const char* name;
        ctl::UsageOptions options;
        const char* message;
    };
    ctl::UsageOptions badClass;
    badClass.containerClass = "14";
    ctl::UsageOptions uuidAlone;
    uuidAlone.containerClass = "2";
    uuidAlone.uuid = kUuid.string();
    ctl::UsageOptions badUuid = uuidAlone;
    badUuid.identifier = "com.example.notes";
    badUuid.uuid = "not-a-uuid";
    const Case cases[] = {
        {"class 14", badClass, "14"},
        {"UUID without identifier", uuidAlone, "--uuid needs --identifier too"},
        {"malformed UUID", badUuid, "is not a UUID"},
    };
    for (Case c : cases) {
        c.options.socket = "/nonexistent/socket";  // never reached
        std::ostringstream out, err;
        EXPECT_EQ(ctl::runUsageCommand(c.options, out, err), ctl::kExitUsage) << c.name;
        EXPECT_NE(err.str().find(c.message), std::string::npos) << c.name << ": " << err.str();
        EXPECT_TRUE(out.str().empty()) << c.name;
    }
    ctl::UsageOptions unreachable;
    unreachable.containerClass = "Data/Application";
    unreachable.socket = "/nonexistent/socket";
    std::ostringstream out, err;
    EXPECT_EQ(ctl::runUsageCommand(unreachable, out, err), ctl::kExitTransport);
}

}  // namespace
}  // namespace berth
