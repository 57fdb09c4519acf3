// What berthctl makes of the request it is given and the reply it gets back:
// which requests it refuses to send, the error line, and the exit status
// that scripts depend on.
#include <gtest/gtest.h>

#include "ExitStatus.h"
#include "ReplyReport.h"

namespace berth::ctl {
namespace {

Value replyWith(Value code) {
    Value reply = Value::dictionary();
    reply.set("ReplyError", std::move(code));
    return reply;
}

TEST(BerthctlReplyTest, RequestMustBeATypedDictionary) {
    std::string why;
    std::optional<Value> request = parseRequest(R"({"Command": 7, "UUID": {"uuid":
        "1b4e28ba-2fa1-11d2-883f-0016d3cca427"}, "UserID": {"uint64": 501}})",
                                                &why);
    ASSERT_TRUE(request) << why;
    EXPECT_EQ(request->find("Command")->kind(), Value::Kind::UInt64);
    EXPECT_EQ(request->find("UUID")->kind(), Value::Kind::Uuid);
    EXPECT_EQ(*request->find("UserID"), Value(uint64_t{501}));

    for (const char* text : {"[]", "30", "\"Command\"", "null", "{\"Command\": 1"}) {
        why.clear();
        EXPECT_FALSE(parseRequest(text, &why)) << text;
        EXPECT_FALSE(why.empty()) << text;
    }
    // A malformed typed member is reported, never sent as a dictionary.
    EXPECT_FALSE(parseRequest(R"({"UUID": {"uuid": "not-a-uuid"}})", &why));
    EXPECT_NE(why.find("/UUID"), std::string::npos) << why;
}

TEST(BerthctlReplyTest, ErrorLineNamesCodesOfTheTableOnly) {
    EXPECT_EQ(errorLine(55), "error: BTHErrorNotEntitled (55)");
    EXPECT_EQ(errorLine(49), "error: BTHErrorInvalidCommand (49)");
    EXPECT_EQ(errorLine(64), "error: BTHErrorStageSharedContentFailed (64)");
    // Gaps of the table and numbers beyond it have no name.
    EXPECT_EQ(errorLine(2), "error: code 2");
    EXPECT_EQ(errorLine(65), "error: code 65");
    // A sign-extended negative errno as the daemon would carry it.
    EXPECT_EQ(errorLine(static_cast<uint64_t>(int64_t{-2})), "error: code 18446744073709551614");
    EXPECT_EQ(errorLine((uint64_t{1} << 32) | 55), "error: code 4294967351");
}

TEST(BerthctlReplyTest, ExitStatusFollowsReplyError) {
    EXPECT_EQ(judgeReply(replyWith(uint64_t{1})).exitStatus, kExitSuccess);
    EXPECT_TRUE(judgeReply(replyWith(uint64_t{1})).errorLine.empty());
    // An int64 1 is the same number; the kind written does not matter.
    EXPECT_EQ(judgeReply(replyWith(int64_t{1})).exitStatus, kExitSuccess);

    const ReplyVerdict refused = judgeReply(replyWith(uint64_t{55}));
    EXPECT_EQ(refused.exitStatus, kExitFailure);
    EXPECT_EQ(refused.errorLine, "error: BTHErrorNotEntitled (55)");
    EXPECT_EQ(judgeReply(replyWith(uint64_t{0})).exitStatus, kExitFailure);

    // Not a reply of this daemon: no code, a code of another kind, a
    // negative number, or no dictionary at all.
    Value noCode = Value::dictionary();
    noCode.set("ReplyPath", "/private/var/mobile");
    for (const Value& reply : {noCode, replyWith("1"), replyWith(true), replyWith(1.0),
                               replyWith(int64_t{-1}), Value(Value::array())}) {
        const ReplyVerdict verdict = judgeReply(reply);
        EXPECT_EQ(verdict.exitStatus, kExitTransport) << reply.description();
        EXPECT_NE(verdict.errorLine.find("ReplyError"), std::string::npos);
    }
}

}  // namespace
}  // namespace berth::ctl
