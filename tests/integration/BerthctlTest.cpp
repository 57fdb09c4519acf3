// berthctl against a real daemon on a scratch device root, run as a child
// process the way an administrator or a script runs it: what it prints, the
// exit status, and what it changes on the device root.
#include <sys/socket.h>

#include <fstream>

#include "DaemonSupport.h"
#include "core/ValueJson.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/LockStateNotification.h"
#include "platform/ServiceCheckIn.h"

namespace berth {
namespace {

using test::Outcome;
using test::run;

const std::filesystem::path& root() {
    return test::deviceRoot();
}

const std::filesystem::path kBerthctl = BERTHCTL_BINARY_PATH;
constexpr uid_t kNobody = 65534;

Outcome berthctl(const std::vector<std::string>& args, std::optional<uid_t> user = std::nullopt) {
    return run(kBerthctl, args, user);
}

// The "ReplyError" of a reply printed by `send`; 0 when there is none.
uint64_t printedReplyError(const Outcome& sent) {
    std::string why;
    std::optional<Value> reply = valueFromJson(sent.out, &why);
    EXPECT_TRUE(reply) << why << "\n" << sent.out << sent.err;
    return reply ? test::code(*reply) : 0;
}

std::string trimmed(std::string text) {
    while (!text.empty() && std::isspace(static_cast<unsigned char>(text.back()))) text.pop_back();
    return text;
}

class BerthctlTest : public test::DaemonFixture {};

TEST_F(BerthctlTest, SendPrintsTheReplyAndExitsByItsCode) {
    ASSERT_NO_FATAL_FAILURE(start());

    const Outcome invalid = berthctl({"send", R"({"Command": 30})"});
    EXPECT_EQ(invalid.status, 1) << invalid.err;
    EXPECT_EQ(trimmed(invalid.err), "error: BTHErrorInvalidCommand (49)");
    EXPECT_EQ(printedReplyError(invalid), 49u);

    // --json prints the same reply on a single line, for scripts.
    const Outcome compact = berthctl({"--json", "send", R"({"Command": {"uint64": 30}})"});
    EXPECT_EQ(compact.status, 1);
    EXPECT_EQ(std::count(compact.out.begin(), compact.out.end(), '\n'), 1) << compact.out;
    EXPECT_EQ(printedReplyError(compact), 49u);

    // A request that is not a dictionary never reaches the daemon.
    const Outcome notARequest = berthctl({"send", "[30]"});
    EXPECT_EQ(notARequest.status, 64);
    EXPECT_TRUE(notARequest.out.empty());
}

TEST_F(BerthctlTest, EntitlementsFollowTheSignatureOfTheRunningProgram) {
    ASSERT_NO_FATAL_FAILURE(start());
    // An identical copy elsewhere is another program as far as the registry
    // is concerned: it stays unsigned.
    test::ScratchDir dir;
    ::chmod(dir.path().c_str(), 0755);
    const auto unsignedCopy = dir / "berthctl";
    std::filesystem::copy_file(kBerthctl, unsignedCopy);

    const Outcome signedNow =
        berthctl({"sign", kBerthctl.string(), "sys.kelp.berthctl.test", "--entitlements",
                  R"({"sys.kelp.private.Berth.allowed": true})"});
    ASSERT_EQ(signedNow.status, 0) << signedNow.err;
    const auto entry = CodeSigningRegistry().entryFor(std::filesystem::canonical(kBerthctl));
    ASSERT_TRUE(entry);
    EXPECT_EQ(entry->identifier, "sys.kelp.berthctl.test");
    EXPECT_EQ(*entry->entitlements.find("sys.kelp.private.Berth.allowed"), Value(true));

    const Outcome refused = run(unsignedCopy, {"send", R"({"Command": 1})"});
    EXPECT_EQ(refused.status, 1);
    EXPECT_EQ(trimmed(refused.err), "error: BTHErrorNotEntitled (55)");
    EXPECT_EQ(printedReplyError(refused), 55u);

    const Outcome admitted = berthctl({"send", R"({"Command": 1})"});
    EXPECT_NE(printedReplyError(admitted), 55u) << admitted.err;
    EXPECT_NE(admitted.status, 2) << admitted.err;

    // The same signed program run by another user than root is nobody: what
    // such a process runs says nothing about who speaks.
    for (std::filesystem::path dir = daemon_->requestSocket().parent_path();
         dir != root().parent_path(); dir = dir.parent_path())
        std::filesystem::permissions(dir, std::filesystem::perms::others_exec,
                                     std::filesystem::perm_options::add);
    const Outcome asUser = berthctl({"send", R"({"Command": 1})"}, 501);
    EXPECT_EQ(printedReplyError(asUser), 55u) << asUser.err;

    // Without its entry the same program is a stranger again.
    const Outcome removed = berthctl({"sign", "--remove", kBerthctl.string()});
    ASSERT_EQ(removed.status, 0) << removed.err;
    EXPECT_FALSE(CodeSigningRegistry().entryFor(std::filesystem::canonical(kBerthctl)));
    EXPECT_EQ(printedReplyError(berthctl({"send", R"({"Command": 1})"})), 55u);
}

// The entitlement rules through the real daemon: clients registered under
// different identities, each a copy of berthctl signed with its own set.
TEST_F(BerthctlTest, EntitlementMatrixThroughTheDaemon) {
    ASSERT_NO_FATAL_FAILURE(start());
    test::ScratchDir dir;
    ::chmod(dir.path().c_str(), 0755);
    const Value wipeList(Value::Array{Value("sys.kelp.plugin")});
    struct Client {
        const char* name;
        Value entitlements;
        // Expected reply errors of commands 0, 1, 11 and 24, sent without
        // keys: 55 when refused; otherwise what the handler answers (38 for
        // a request naming no valid user, 18 for a wipe naming no identifier,
        // 1 for a data migration that ran).
        uint64_t expected[4];
    };
    const Client clients[] = {
        {"none", Value::dictionary(), {38, 55, 55, 55}},
        {"allowed", test::dict({{"sys.kelp.private.Berth.allowed", true}}), {38, 38, 18, 1}},
        {"lookup", test::dict({{"sys.kelp.private.Berth.otherIdLookup", true}}), {38, 55, 55, 55}},
        {"wiper",
         test::dict({{"sys.kelp.private.Berth.wipeContainer", wipeList}}),
         {38, 55, 18, 55}},
        {"wipeflag",
         test::dict({{"sys.kelp.private.Berth.wipeContainer", true}}),
         {38, 55, 55, 55}},
        {"migrator",
         test::dict({{"sys.kelp.private.Berth.dataMigration", true}}),
         {38, 55, 55, 1}},
    };
    const uint64_t commands[] = {0, 1, 11, 24};
    for (const Client& client : clients) {
        const auto program = dir / client.name;
        std::filesystem::copy_file(kBerthctl, program);
        std::string why;
        ASSERT_EQ(CodeSigningRegistry().sign(program, std::string("sys.kelp.") + client.name,
                                             client.entitlements, &why),
                  0)
            << why;
        for (size_t i = 0; i < 4; ++i) {
            const std::string request = "{\"Command\": " + std::to_string(commands[i]) + "}";
            EXPECT_EQ(printedReplyError(run(program, {"send", request})), client.expected[i])
                << client.name << " command " << commands[i];
        }
    }

    // A signed program changed after signing no longer matches its digest:
    // it has no identity, so only the open commands answer.
    const auto changed = dir / "allowed";
    { std::ofstream(changed, std::ofstream::app) << "tampered"; }
    EXPECT_EQ(printedReplyError(run(changed, {"send", R"({"Command": 1})"})), 55u);
    EXPECT_EQ(printedReplyError(run(changed, {"send", R"({"Command": 0})"})), 38u);
}

TEST_F(BerthctlTest, DaemonThatCannotBeAskedIsExitStatusTwo) {
    test::ScratchDir dir;
    const Outcome absent = berthctl({"send", "--socket", (dir / "none").string(), "{}"});
    EXPECT_EQ(absent.status, 2);
    EXPECT_NE(absent.err.find("not running"), std::string::npos) << absent.err;

    // A socket that takes the request but never answers.
    auto silentSocket =
        ServiceCheckIn::claim("silent", SOCK_STREAM, 0666, nullptr, nullptr, dir.path());
    ASSERT_TRUE(silentSocket);
    const Outcome silent = berthctl({"send", "--socket", silentSocket->path().string(), "--timeout",
                                     "0.3", R"({"Command": 1})"});
    EXPECT_EQ(silent.status, 2);
    EXPECT_TRUE(silent.out.empty());
    EXPECT_FALSE(silent.err.empty());
}

TEST_F(BerthctlTest, LockAndUnlockWriteTheKeyBagState) {
    const auto stateFile = root() / "run/berthd/lockstate";
    ASSERT_EQ(berthctl({"lock"}).status, 0);
    EXPECT_EQ(trimmed(test::readFile(stateFile)), "1");
    EXPECT_EQ(LockStateNotification::lockState(), 1);
    ASSERT_EQ(berthctl({"unlock"}).status, 0);
    EXPECT_EQ(trimmed(test::readFile(stateFile)), "0");
    EXPECT_EQ(LockStateNotification::lockState(), 0);
}

TEST_F(BerthctlTest, OnlyRootChangesTheSigningRegistry) {
    const auto canonical = std::filesystem::canonical(kBerthctl);
    const Outcome asNobody =
        berthctl({"sign", kBerthctl.string(), "sys.kelp.intruder", "--entitlements",
                  R"({"sys.kelp.private.Berth.allowed": true})"},
                 kNobody);
    EXPECT_EQ(asNobody.status, 1) << asNobody.err;
    EXPECT_NE(asNobody.err.find("root"), std::string::npos) << asNobody.err;
    EXPECT_FALSE(CodeSigningRegistry().entryFor(canonical));

    // Nor may another user remove what root signed.
    ASSERT_EQ(berthctl({"sign", kBerthctl.string(), "sys.kelp.berthctl.test"}).status, 0);
    EXPECT_EQ(berthctl({"sign", "--remove", kBerthctl.string()}, kNobody).status, 1);
    EXPECT_TRUE(CodeSigningRegistry().entryFor(canonical));
    ASSERT_EQ(berthctl({"sign", "--remove", kBerthctl.string()}).status, 0);
}

TEST_F(BerthctlTest, SignBindsAUnitByName) {
    const Outcome signedUnit =
        berthctl({"sign", "--unit", "lanternd.service", "sys.kelp.lanternd", "--entitlements",
                  R"({"sys.kelp.private.Berth.allowed": true})"});
    ASSERT_EQ(signedUnit.status, 0) << signedUnit.err;
    EXPECT_EQ(signedUnit.out,
              "signed unit lanternd.service\n"
              "    identifier    sys.kelp.lanternd\n"
              "    entitlements  {\"sys.kelp.private.Berth.allowed\":true}\n");
    const auto entry = CodeSigningRegistry().entryForUnit("lanternd.service");
    ASSERT_TRUE(entry);
    EXPECT_EQ(entry->identifier, "sys.kelp.lanternd");

    const Outcome listed = berthctl({"--json", "sign", "--list"});
    EXPECT_NE(listed.out.find(R"("unit":"lanternd.service")"), std::string::npos) << listed.out;

    EXPECT_EQ(berthctl({"sign", "--unit", "lanternd.slice", "sys.kelp.x"}).status, 1);
    EXPECT_EQ(berthctl({"sign", "--unit", "lanternd.service"}).status, 64);
    EXPECT_EQ(berthctl({"sign", "--unit", "a.service", "/bin/true", "sys.kelp.x"}).status, 64);
    EXPECT_EQ(berthctl({"sign", "--list", "--unit", "a.service"}).status, 64);
    EXPECT_EQ(berthctl({"sign", "--unit", "a.service", "sys.kelp.x"}, kNobody).status, 1);
    EXPECT_FALSE(CodeSigningRegistry().entryForUnit("a.service"));

    EXPECT_EQ(berthctl({"sign", "--remove", "--unit", "lanternd.service"}, kNobody).status, 1);
    const Outcome removed = berthctl({"sign", "--remove", "--unit", "lanternd.service"});
    EXPECT_EQ(removed.status, 0) << removed.err;
    EXPECT_EQ(removed.out, "removed the signature of the unit lanternd.service\n");
    EXPECT_FALSE(CodeSigningRegistry().entryForUnit("lanternd.service"));
}

TEST_F(BerthctlTest, CommandsListsEveryCommandWithItsEntitlement) {
    const Outcome listed = berthctl({"--json", "commands"});
    ASSERT_EQ(listed.status, 0);
    std::optional<Value> rows = valueFromJson(listed.out);
    ASSERT_TRUE(rows && rows->isArray()) << listed.out;
    ASSERT_EQ(rows->size(), 30u);
    const Value::Array& table = *rows->arrayValue();
    for (size_t i = 0; i < table.size(); ++i)
        EXPECT_EQ(*table[i].find("command"), Value(uint64_t{i}));
    EXPECT_EQ(*table[24].find("entitlement"), Value("sys.kelp.private.Berth.dataMigration"));
    EXPECT_EQ(*table[4].find("repliesAtOnce"), Value(false));
}

}  // namespace
}  // namespace berth
