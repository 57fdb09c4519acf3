// The container commands on the client side, without a daemon: what the
// command line accepts, the exact requests sent, and what is made of the
// replies, including failures and replies that lack what they must carry.
// The built berthctl also runs against a scripted stand-in for the daemon,
// which shows the requests a command line turns into.
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdlib>
#include <functional>
#include <map>
#include <mutex>
#include <sstream>

#include "ContainerCommands.h"
#include "ExitStatus.h"
#include "RelayTestServer.h"
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
// number, in arrays too, with its uint64 getter, so the kind must be exact.
void expectUnsignedNumbers(const Value& request) {
    for (const auto& [key, value] : *request.dictionaryValue()) {
        if (value.isInteger()) {
            EXPECT_EQ(value.kind(), Value::Kind::UInt64) << key;
        }
        if (value.isArray()) {
            for (const Value& entry : *value.arrayValue())
                if (entry.isInteger()) {
                    EXPECT_EQ(entry.kind(), Value::Kind::UInt64) << key;
                }
        }
    }
}

Value arrayOf(std::initializer_list<Value> entries) {
    Value result = Value::array();
    for (const Value& entry : entries) result.push(entry);
    return result;
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
    ContainerSelector old = selector;
    old.uuid = kOtherUuid;
    old.identifier = "com.example.old";

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
        {makeReplaceRequest(old, selector), dictionaryOf({{"Command", uint64_t{2}},
                                                          {"OldContainerClass", uint64_t{2}},
                                                          {"OldContainerUserID", uint64_t{501}},
                                                          {"OldIdentifier", "com.example.old"},
                                                          {"OldContainerUUID", kOtherUuid},
                                                          {"NewContainerClass", uint64_t{2}},
                                                          {"NewContainerUserID", uint64_t{501}},
                                                          {"NewIdentifier", "com.example.notes"},
                                                          {"NewContainerUUID", kUuid}})},
        // No old container: none of its keys, not even empty ones.
        {makeReplaceRequest(std::nullopt, bare),
         dictionaryOf({{"Command", uint64_t{2}},
                       {"NewContainerClass", uint64_t{7}},
                       {"NewContainerUserID", uint64_t{1}}})},
        // Index-aligned, a missing identifier or UUID held by a null.
        {makeStageForDeleteRequest({selector, bare}),
         dictionaryOf({{"Command", uint64_t{3}},
                       {"ContainerClassesArray", arrayOf({uint64_t{2}, uint64_t{7}})},
                       {"UUIDsArray", arrayOf({kUuid, Value()})},
                       {"UserIDsArray", arrayOf({uint64_t{501}, uint64_t{1}})},
                       {"IdentifiersArray", arrayOf({"com.example.notes", Value()})}})},
        {makeEmptyDeathRowRequest(), dictionaryOf({{"Command", uint64_t{4}}})},
        {makeRegenerateDirectoryUUIDRequest(selector),
         dictionaryOf({{"Command", uint64_t{9}},
                       {"ContainerClass", uint64_t{2}},
                       {"UserID", uint64_t{501}},
                       {"Identifier", "com.example.notes"},
                       {"UUID", kUuid}})},
        {makeDeleteRequest(selector), dictionaryOf({{"Command", uint64_t{10}},
                                                    {"ContainerClass", uint64_t{2}},
                                                    {"UserID", uint64_t{501}},
                                                    {"Identifier", "com.example.notes"},
                                                    {"Transient", true}})},
        // Class 4 is the command's own: the selector's class is not sent.
        {makeWipePluginDataRequest(selector), dictionaryOf({{"Command", uint64_t{11}},
                                                            {"UserID", uint64_t{501}},
                                                            {"Identifier", "com.example.notes"}})},
        {makeWipeDataRequest(selector), dictionaryOf({{"Command", uint64_t{12}},
                                                      {"ContainerClass", uint64_t{2}},
                                                      {"UserID", uint64_t{501}},
                                                      {"Identifier", "com.example.notes"}})},
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

// A stand-in for the daemon: records each request and answers look-ups
// (command 0) of the identifiers it knows; every other command gets the
// answer set last as its "ReplyError".
class ScriptedDaemon {
  public:
    explicit ScriptedDaemon(std::map<std::string, Uuid> known = {}) : known_(std::move(known)) {}

    const std::filesystem::path& socket() const { return server_.path(); }
    std::vector<Value> requests() {
        std::lock_guard lock(mutex_);
        return requests_;
    }
    // Forgets the requests so far and answers `code` from now on.
    void answerWith(uint64_t code) {
        std::lock_guard lock(mutex_);
        requests_.clear();
        answer_ = code;
    }

  private:
    void reply(const Value& request, Value& reply) {
        std::lock_guard lock(mutex_);
        requests_.push_back(request);
        const Value* command = request.find("Command");
        if (command && command->uint64Value() == uint64_t{kBerthCommandCreateOrLookup}) {
            const Value* identifier = request.find("Identifier");
            const auto found = identifier ? known_.find(*identifier->string()) : known_.end();
            if (found == known_.end()) {
                reply.set("ReplyError", uint64_t{21});
                return;
            }
            reply.set("ReplyError", uint64_t{1});
            reply.set("ReplyPath", "/c/" + found->second.string());
            reply.set("ReplyUUID", found->second);
            reply.set("ReplyExisted", true);
            reply.set("ReplyIdentifier", found->first);
            return;
        }
        reply.set("ReplyError", answer_);
    }

    const std::map<std::string, Uuid> known_;
    std::mutex mutex_;
    uint64_t answer_ = 1;
    std::vector<Value> requests_;
    test::RelayTestServer server_{
        [this](const RelayEvent& event, RelayReply& out) { reply(event.message(), out.body()); }};
};

struct Outcome {
    int status = -1;
    std::string out;
    std::string err;
};

// Runs the built berthctl with `args` (none holding a quote) and collects
// what it printed.
Outcome runBerthctl(const std::vector<std::string>& args) {
    test::ScratchDir outputs;
    std::string command = BERTHCTL_BINARY_PATH;
    for (const std::string& arg : args) command += " '" + arg + "'";
    command += " >" + (outputs / "out").string() + " 2>" + (outputs / "err").string();
    const int status = std::system(command.c_str());
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, test::readFile(outputs / "out"),
            test::readFile(outputs / "err")};
}

ContainerSelector container(uint64_t containerClass, uint64_t user, const char* identifier,
                            std::optional<Uuid> uuid = std::nullopt, bool transient = false) {
    ContainerSelector selector;
    selector.containerClass = containerClass;
    selector.userId = user;
    selector.identifier = identifier;
    selector.uuid = uuid;
    selector.transient = transient;
    return selector;
}

Value lookUp(const ContainerSelector& selector) {
    return makeCreateOrLookupRequest(selector, false);
}

TEST(BerthctlContainersTest, RemovalSubcommandsSendWhatTheirOptionsSay) {
    ScriptedDaemon daemon({{"com.old", kUuid}, {"com.new", kOtherUuid}});
    const std::string u = kUuid.string(), o = kOtherUuid.string();
    const ContainerSelector old = container(2, 1, "com.old", kUuid);
    const ContainerSelector replacement = container(2, 1, "com.new", kOtherUuid);
    struct Run {
        std::vector<std::string> args;
        std::vector<Value> requests;
        uint64_t answer;      // the daemon's answer to the last request
        std::string printed;  // standard output on success; else the start of standard error
    };
    const Run runs[] = {
        // Both containers are looked up, the old one first.
        {{"replace", "--class", "2", "--old-identifier", "com.old", "--new-identifier", "com.new"},
         {lookUp(container(2, 1, "com.old")), lookUp(container(2, 1, "com.new")),
          makeReplaceRequest(old, replacement)},
         1,
         "replaced com.old " + u + " with com.new " + o + "\n"},
        {{"--json", "replace", "--class", "Data/Application", "--user", "501", "--new-identifier",
          "com.new", "--new-uuid", o},
         {makeReplaceRequest(std::nullopt, container(2, 501, "com.new", kOtherUuid))},
         1,
         R"({"identifier":"com.new","uuid":")" + o + "\"}\n"},
        // The old side's own class and user.
        {{"replace", "--class", "2", "--new-identifier", "com.new", "--new-uuid", o,
          "--old-identifier", "com.old", "--old-uuid", u, "--old-class", "7", "--old-user", "501"},
         {makeReplaceRequest(container(7, 501, "com.old", kUuid), replacement)},
         23,
         "error: BTHErrorReplaceClassMismatch (23): "},
        // A colon in an identifier is kept when the UUID follows it.
        {{"stage-delete", "--container", "2:501:com.old", "--container",
          "Bundle/Application:33:com.a:b:" + o},
         {lookUp(container(2, 501, "com.old")),
          makeStageForDeleteRequest(
              {container(2, 501, "com.old", kUuid), container(1, 33, "com.a:b", kOtherUuid)})},
         1,
         "staged com.old " + u + " for deletion\nstaged com.a:b " + o + " for deletion\n"},
        // One unknown container and nothing is staged.
        {{"stage-delete", "--container", "2:1:com.old", "--container", "2:1:com.gone"},
         {lookUp(container(2, 1, "com.old")), lookUp(container(2, 1, "com.gone"))},
         21,
         "error: BTHErrorNotFound (21): "},
        {{"regenerate", "--class", "2", "--identifier", "com.old"},
         {lookUp(container(2, 1, "com.old")), makeRegenerateDirectoryUUIDRequest(old)},
         1,
         "gave a new directory name to com.old\n"},
        {{"delete", "--class", "2", "--identifier", "com.old", "--transient"},
         {makeDeleteRequest(container(2, 1, "com.old", {}, true))},
         1,
         "deleted com.old\n"},
        {{"wipe", "--plugin", "--identifier", "com.plugin", "--user", "501"},
         {makeWipePluginDataRequest(container(0, 501, "com.plugin"))},
         55,
         "error: BTHErrorNotEntitled (55): "},
    };
    for (const Run& run : runs) {
        std::vector<std::string> args = run.args;
        args.insert(args.end(), {"--socket", daemon.socket().string()});
        SCOPED_TRACE(::testing::PrintToString(args));
        daemon.answerWith(run.answer);
        const Outcome outcome = runBerthctl(args);
        const bool succeeds = run.answer == 1;
        EXPECT_EQ(outcome.status, succeeds ? ctl::kExitSuccess : ctl::kExitFailure) << outcome.err;
        EXPECT_EQ(succeeds ? outcome.out : outcome.err.substr(0, run.printed.size()), run.printed);
        const std::vector<Value> sent = daemon.requests();
        ASSERT_EQ(sent.size(), run.requests.size());
        for (size_t i = 0; i < sent.size(); ++i)
            EXPECT_EQ(sent[i], run.requests[i]) << sent[i].description();
    }

    // Command-line mistakes: nothing reaches the daemon.
    const std::pair<std::vector<std::string>, std::string> mistakes[] = {
        {{"wipe", "--identifier", "com.old"}, "error: give the container's --class, or --plugin"},
        {{"wipe", "--plugin", "--class", "4", "--identifier", "com.old"}, "--class excludes"},
        {{"stage-delete"}, "--container is required"},
        {{"stage-delete", "--container", "2:1"}, "error: \"2:1\" is no container"},
        {{"stage-delete", "--container", "2:1:com.old:x"}, "error: \"x\" is not a UUID"},
        {{"replace", "--class", "2", "--old-class", "7"}, "--old-class requires --old-identifier"},
        {{"replace", "--class", "2", "--new-uuid", u}, "error: --new-uuid needs --new-identifier"},
    };
    daemon.answerWith(1);
    for (auto [args, printed] : mistakes) {
        args.insert(args.end(), {"--socket", daemon.socket().string()});
        const Outcome outcome = runBerthctl(args);
        EXPECT_EQ(outcome.status, ctl::kExitUsage) << printed;
        EXPECT_EQ(outcome.err.rfind(printed, 0), 0u) << outcome.err;
    }
    EXPECT_TRUE(daemon.requests().empty());
}

TEST(BerthctlContainersTest, RequestsTheDaemonWouldMisreadAreNotSent) {
    ScriptedDaemon daemon;
    BerthError error;
    auto connection = BerthConnection::connect(daemon.socket(), &error);
    ASSERT_TRUE(connection) << error.message;
    BerthContainers containers(*connection);
    // An old container without a UUID would be read as none at all, and a
    // staged one without one skipped in silence.
    ContainerError replaceFailure, stageFailure;
    EXPECT_FALSE(containers.replace(container(2, 1, "com.old"),
                                    container(2, 1, "com.new", kOtherUuid), &replaceFailure));
    EXPECT_FALSE(containers.stageForDelete(
        {container(2, 1, "com.old", kUuid), container(2, 1, "com.new")}, &stageFailure));
    for (const ContainerError& failure : {replaceFailure, stageFailure})
        EXPECT_EQ(failure.transport.code, BerthError::Code::InvalidRequest) << failure.describe();
    EXPECT_TRUE(daemon.requests().empty());
}

}  // namespace
}  // namespace berth
