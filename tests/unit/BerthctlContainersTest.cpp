// The container commands on the client side, without a daemon: what the
// command line accepts, the exact requests sent, and what is made of the
// replies, including failures and replies that lack what they must carry.
#include <gtest/gtest.h>

#include <functional>
#include <sstream>

#include "ContainerCommands.h"
#include "ExitStatus.h"
#include "TestSupport.h"
#include "libberth/BerthContainers.h"

namespace berth {
namespace {

const Uuid kUuid = *Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
const Uuid kOtherUuid = *Uuid::parse("00000000-0000-4000-8000-000000000001");

Value dictionaryOf(std::initializer_list<std::pair<const char*, Value>> members) {
    Value result = Value::dictionary();
    for (const auto& [key, value] : members) result.set(key, value);
    return result;
}

Value success(std::initializer_list<std::pair<const char*, Value>> members = {}) {
    Value reply = dictionaryOf(members);
    reply.set("ReplyError", uint64_t{1});
    return reply;
}

// Value equality lets an int64 stand for a uint64; the daemon reads every
// number with its uint64 getter, so the kind must be exact.
void expectUnsignedNumbers(const Value& request) {
    for (const auto& [key, value] : *request.dictionaryValue()) {
        if (value.isInteger()) {
            EXPECT_EQ(value.kind(), Value::Kind::UInt64) << key;
        }
    }
}

TEST(BerthctlContainersTest, ContainerClassesByNumberOrName) {
    const std::pair<const char*, uint64_t> accepted[] = {
        {"1", 1},
        {"2", 2},
        {"13", 13},
        {"Data/Application", 2},
        {"data/application", 2},
        {"Shared/SystemGroup", 13},
        {"BUNDLE/FRAMEWORK", 8},
    };
    for (const auto& [text, expected] : accepted) {
        std::string why;
        EXPECT_EQ(ctl::parseContainerClass(text, &why), expected) << text << ": " << why;
    }
    for (const char* text : {"0", "14", "Undefined", "MAX", "", "2x", "-1", "+2", " 2", "Data",
                             "Data/Application/", "18446744073709551618"}) {
        std::string why;
        EXPECT_FALSE(ctl::parseContainerClass(text, &why)) << text;
        EXPECT_NE(why.find("container class"), std::string::npos) << text;
    }
}

TEST(BerthctlContainersTest, RequestsCarryExactKeysAndKinds) {
    ContainerSelector selector;
    selector.containerClass = 2;
    selector.userId = 501;
    selector.identifier = "com.example.notes";
    selector.uuid = kUuid;
    selector.transient = true;
    ContainerSelector bare;  // no identifier, no UUID: those keys stay out
    bare.containerClass = 7;

    const Value scalar("text");
    const std::pair<Value, Value> cases[] = {
        {makeCreateOrLookupRequest(selector, true),
         dictionaryOf({{"Command", uint64_t{0}},
                       {"ContainerClass", uint64_t{2}},
                       {"UserID", uint64_t{501}},
                       {"Identifier", "com.example.notes"},
                       {"CreateIfNecessary", true},
                       {"Transient", true}})},
        {makeCreateOrLookupRequest(bare, false), dictionaryOf({{"Command", uint64_t{0}},
                                                               {"ContainerClass", uint64_t{7}},
                                                               {"UserID", uint64_t{1}},
                                                               {"CreateIfNecessary", false},
                                                               {"Transient", false}})},
        {makeListRequest(selector), dictionaryOf({{"Command", uint64_t{1}},
                                                  {"ContainerClass", uint64_t{2}},
                                                  {"UserID", uint64_t{501}},
                                                  {"Transient", true}})},
        {makeSetInfoValueRequest(selector, "k", scalar),
         dictionaryOf({{"Command", uint64_t{5}},
                       {"ContainerClass", uint64_t{2}},
                       {"UserID", uint64_t{501}},
                       {"Identifier", "com.example.notes"},
                       {"UUID", kUuid},
                       {"Key", "k"},
                       {"Value", scalar}})},
        {makeSetInfoValueRequest(bare, "k", std::nullopt),
         dictionaryOf({{"Command", uint64_t{5}},
                       {"ContainerClass", uint64_t{7}},
                       {"UserID", uint64_t{1}},
                       {"Key", "k"}})},
        {makeGetInfoValueRequest(selector, "k"), dictionaryOf({{"Command", uint64_t{6}},
                                                               {"ContainerClass", uint64_t{2}},
                                                               {"UserID", uint64_t{501}},
                                                               {"Identifier", "com.example.notes"},
                                                               {"UUID", kUuid},
                                                               {"Key", "k"}})},
        {makeMetadataRequest(selector, true), dictionaryOf({{"Command", uint64_t{7}},
                                                            {"ContainerClass", uint64_t{2}},
                                                            {"UserID", uint64_t{501}},
                                                            {"Identifier", "com.example.notes"},
                                                            {"UUID", kUuid},
                                                            {"InfoDictRequested", true}})},
        {makeRecreateDefaultStructureRequest(selector, 22),
         dictionaryOf({{"Command", uint64_t{22}},
                       {"ContainerClass", uint64_t{2}},
                       {"UserID", uint64_t{501}},
                       {"Identifier", "com.example.notes"},
                       {"UUID", kUuid}})},
    };
    for (const auto& [request, expected] : cases) {
        EXPECT_EQ(request, expected) << request.description();
        expectUnsignedNumbers(request);
    }
}

TEST(BerthctlContainersTest, SuccessfulRepliesDecode) {
    ContainerError error;
    const auto location = decodeCreateOrLookupReply(success({{"ReplyPath", "/c/X"},
                                                             {"ReplyUUID", kUuid},
                                                             {"ReplyExisted", true},
                                                             {"ReplyIdentifier", "com.x"}}),
                                                    &error);
    ASSERT_TRUE(location) << error.describe();
    EXPECT_EQ(location->path, "/c/X");
    EXPECT_EQ(location->uuid, kUuid);
    EXPECT_TRUE(location->existed);
    EXPECT_EQ(location->identifier, "com.x");

    Value ids = Value::array(), uuids = Value::array();
    ids.push("a"), ids.push("b"), uuids.push(kUuid), uuids.push(kOtherUuid);
    const auto listing =
        decodeListReply(success({{"ReplyIdsArray", ids}, {"ReplyUUIDsArray", uuids}}), &error);
    ASSERT_TRUE(listing) << error.describe();
    EXPECT_EQ(*listing, (std::vector<ContainerListEntry>{{"a", kUuid}, {"b", kOtherUuid}}));
    // Nothing to list: the daemon leaves both arrays out.
    EXPECT_EQ(decodeListReply(success(), &error), std::vector<ContainerListEntry>{});

    // Any kind of value comes back as it was stored, a false one included.
    for (const Value& stored : {Value("v"), Value(false), dictionaryOf({{"n", int64_t{-3}}})})
        EXPECT_EQ(decodeGetInfoValueReply(success({{"ReplyInfoValue", stored}}), &error), stored);

    const Value info = dictionaryOf({{"k", "v"}});
    const auto withInfo = decodeMetadataReply(
        success({{"ReplyPath", "/c/X"}, {"ReplyTransient", false}, {"ReplyInfoDictionary", info}}),
        &error);
    ASSERT_TRUE(withInfo) << error.describe();
    EXPECT_EQ(withInfo->info, info);
    const auto withoutInfo =
        decodeMetadataReply(success({{"ReplyPath", "/c/X"}, {"ReplyTransient", true}}), &error);
    ASSERT_TRUE(withoutInfo);
    EXPECT_TRUE(withoutInfo->transient);
    EXPECT_FALSE(withoutInfo->info);
}

TEST(BerthctlContainersTest, FailedRepliesCarryTheCodeItsNameAndText) {
    Value refused = Value::dictionary();
    refused.set("ReplyError", uint64_t{21});
    ContainerError error;
    EXPECT_FALSE(decodeCreateOrLookupReply(refused, &error));
    EXPECT_EQ(error.code, 21u);
    EXPECT_EQ(error.name, "BTHErrorNotFound");
    EXPECT_EQ(error.describe(), "BTHErrorNotFound (21): no such container");
    EXPECT_FALSE(error.transport);

    // A failure wins over whatever else the reply holds, for every decoder.
    refused.set("ReplyError", uint64_t{24});
    refused.set("ReplyInfoValue", "stale");
    EXPECT_FALSE(decodeGetInfoValueReply(refused, &error));
    EXPECT_EQ(error.code, 24u);
    refused.set("ReplyError", int64_t{55});  // the same number as the other integer kind
    EXPECT_FALSE(decodeReplyStatus(refused, &error));
    EXPECT_EQ(error.name, "BTHErrorNotEntitled");

    // A number the table does not use still reports its number.
    refused.set("ReplyError", uint64_t{70});
    EXPECT_FALSE(decodeListReply(refused, &error));
    EXPECT_TRUE(error.name.empty());
    EXPECT_EQ(error.describe().rfind("code 70: ", 0), 0u) << error.describe();
}

TEST(BerthctlContainersTest, MalformedRepliesAreProtocolErrors) {
    Value ids = Value::array(), uuids = Value::array(), notUuids = Value::array();
    ids.push("a"), uuids.push(kUuid), notUuids.push(kUuid.string());
    const Value location = success({{"ReplyPath", "/c/X"},
                                    {"ReplyUUID", kUuid},
                                    {"ReplyExisted", false},
                                    {"ReplyIdentifier", "com.x"}});
    std::vector<std::pair<const char*, std::function<bool(ContainerError*)>>> cases;
    for (const char* key : {"ReplyPath", "ReplyUUID", "ReplyExisted", "ReplyIdentifier"}) {
        Value without = location;
        without.erase(key);
        cases.emplace_back(key, [without](ContainerError* e) {
            return decodeCreateOrLookupReply(without, e).has_value();
        });
    }
    Value uuidAsText = location;
    uuidAsText.set("ReplyUUID", kUuid.string());
    cases.emplace_back("ReplyUUID", [uuidAsText](ContainerError* e) {
        return decodeCreateOrLookupReply(uuidAsText, e).has_value();
    });
    cases.emplace_back("ReplyError", [](ContainerError* e) {
        return decodeReplyStatus(dictionaryOf({{"ReplyPath", "/c/X"}}), e);
    });
    cases.emplace_back("ReplyError", [](ContainerError* e) {
        return decodeReplyStatus(dictionaryOf({{"ReplyError", int64_t{-1}}}), e);
    });
    cases.emplace_back("ReplyError", [](ContainerError* e) {
        return decodeReplyStatus(Value("not a dictionary"), e);
    });
    cases.emplace_back("ReplyUUIDsArray", [ids](ContainerError* e) {
        return decodeListReply(success({{"ReplyIdsArray", ids}}), e).has_value();
    });
    cases.emplace_back("ReplyUUIDsArray", [ids](ContainerError* e) {
        Value two = ids;
        two.push("b");
        return decodeListReply(success({{"ReplyIdsArray", two}, {"ReplyUUIDsArray", ids}}), e)
            .has_value();
    });
    cases.emplace_back("listing", [ids, notUuids](ContainerError* e) {
        return decodeListReply(success({{"ReplyIdsArray", ids}, {"ReplyUUIDsArray", notUuids}}), e)
            .has_value();
    });
    cases.emplace_back("ReplyInfoValue", [](ContainerError* e) {
        return decodeGetInfoValueReply(success(), e).has_value();
    });
    cases.emplace_back("ReplyTransient", [](ContainerError* e) {
        return decodeMetadataReply(success({{"ReplyPath", "/c/X"}}), e).has_value();
    });
    cases.emplace_back("ReplyInfoDictionary", [](ContainerError* e) {
        return decodeMetadataReply(success({{"ReplyPath", "/c/X"},
                                            {"ReplyTransient", false},
                                            {"ReplyInfoDictionary", "k=v"}}),
                                   e)
            .has_value();
    });

    for (const auto& [named, decode] : cases) {
        ContainerError error;
        EXPECT_FALSE(decode(&error)) << named;
        EXPECT_EQ(error.code, 0u) << named;
        EXPECT_EQ(error.transport.code, BerthError::Code::ProtocolError) << named;
        EXPECT_NE(error.describe().find(named), std::string::npos) << error.describe();
    }
}

TEST(BerthctlContainersTest, CommandLineMistakesNeverReachTheDaemon) {
    test::ScratchDir dir;
    ctl::ContainerOptions good;
    good.containerClass = "Data/Application";
    good.socket = dir / "nobody-listens";
    good.action = ctl::ContainerAction::InfoSet;
    good.identifier = "com.example.notes";
    good.uuid = kUuid.string();
    good.key = "k";
    good.value = R"({"uuid": "1b4e28ba-2fa1-11d2-883f-0016d3cca427"})";

    struct Case {
        void (*spoil)(ctl::ContainerOptions&);
        int status;
        const char* reason;
    };
    const Case cases[] = {
        {[](ctl::ContainerOptions& o) { o.containerClass = "14"; }, ctl::kExitUsage,
         "container class"},
        {[](ctl::ContainerOptions& o) { o.uuid = "1B4E28BA2FA111D2883F0016D3CCA427"; },
         ctl::kExitUsage, "not a UUID"},
        {[](ctl::ContainerOptions& o) { o.value = "{\"uuid\": 5}"; }, ctl::kExitUsage,
         "typed JSON"},
        {[](ctl::ContainerOptions& o) { o.identifier.reset(); }, ctl::kExitUsage, "--identifier"},
        // Well-formed, so it is sent, and fails for want of a daemon.
        {[](ctl::ContainerOptions&) {}, ctl::kExitTransport, "not running"},
    };
    for (const Case& c : cases) {
        ctl::ContainerOptions options = good;
        c.spoil(options);
        std::ostringstream out, err;
        EXPECT_EQ(ctl::runContainerCommand(options, out, err), c.status) << err.str();
        EXPECT_TRUE(out.str().empty());
        EXPECT_EQ(err.str().rfind("error: ", 0), 0u) << err.str();
        EXPECT_NE(err.str().find(c.reason), std::string::npos) << err.str();
    }
}

}  // namespace
}  // namespace berth
