#include "BTHRequestIntake.h"

#include <algorithm>
#include <vector>

#include "BTHCodeSigningEntry.h"
#include "BTHCodeSigningMapping.h"
#include "BTHCommandTable.h"
#include "BTHError.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"

namespace berth {
namespace {

const bool kRoot = !test::installScratchDeviceRoot().empty();
using test::dict;

class FakeRequest final : public BTHRequest {
  public:
    FakeRequest(Value message, BTHPeerIdentity peer)
        : message_(std::move(message)), peer_(std::move(peer)) {}
    const Value& message() const override { return message_; }
    Value& reply() override { return reply_; }
    const BTHPeerIdentity& peer() const override { return peer_; }
    void sendReply() override { ++sent; }

    std::atomic<int> sent = 0;

  private:
    Value message_;
    Value reply_ = Value::dictionary();
    BTHPeerIdentity peer_;
};

BTHPeerIdentity peerWith(std::optional<Value> entitlements, uid_t uid = 501) {
    BTHPeerIdentity peer;
    peer.pid = 4242;
    peer.effectiveUserId = uid;
    peer.signingIdentifier = "sys.kelp.tester";
    peer.entitlements = std::move(entitlements);
    return peer;
}

// The reply error of `command` sent by `peer`, and how many replies went out.
std::pair<uint64_t, int> run(const Value& message, const BTHPeerIdentity& peer) {
    auto request = std::make_shared<FakeRequest>(message, peer);
    BTHProcessRequest(request);
    const Value* error = request->reply().find("ReplyError");
    return {error ? *error->uint64Value() : 0, request->sent};
}

Value command(uint64_t n) {
    return dict({{"Command", n}});
}

// Commands that pass the entitlement check reach their handler; refused ones
// get 55. Sent without keys, a handler that validates the user answers 38
// and staging nothing succeeds. Of the group and code-signing commands, the caller's own system
// container and a missing system group are not its (55), it has no system
// groups (1, none), processing needs an identifier (18), getting finds
// nothing (21) and invalidating succeeds. A caller that may look up others
// gets any system container. Shared content, network extensions and assets
// (26 to 29) need an identifier (11).
uint64_t reachedHandler(uint64_t command, bool mayLookUpOthers = false) {
    if (command >= 26 && command <= 29) return BTHErrorInvalidArgument;
    // 24 migrates nothing on an empty root; 25 does nothing on a build that
    // is not internal.
    if (command == 3 || command == 16 || command == 20 || command == 24 || command == 25)
        return BTHErrorSuccess;
    if (command == 15) return mayLookUpOthers ? BTHErrorSuccess : BTHErrorNotEntitled;
    if (command == 17) return BTHErrorNotEntitled;
    if (command == 18) return BTHErrorIdentifierMissing;
    if (command == 19) return BTHErrorNotFound;
    for (uint64_t validating : {0, 1, 2, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 21, 22, 23})
        if (command == validating) return BTHErrorInvalidParameter;
    return BTHErrorInvalidCommand;
}

TEST(BTHRequestIntakeTest, CallerWithoutEntitlementsReachesOnlyOpenCommands) {
    test::LogCapture log;
    const auto peer = peerWith(std::nullopt);
    for (uint64_t c = 0; c < kBTHCommandCount; ++c) {
        bool open = c == 0 || c == 13 || c == 15 || c == 16 || c == 17;
        EXPECT_EQ(run(command(c), peer).first,
                  open ? reachedHandler(c) : uint64_t{BTHErrorNotEntitled})
            << c;
    }
    EXPECT_TRUE(log.contains(3,
                             "connection attempt from pid 4242 (sys.kelp.tester) missing "
                             "required entitlement: sys.kelp.private.Berth.allowed"));
}

TEST(BTHRequestIntakeTest, AllowedPassesEveryCommandAndOtherIdLookupOnlyTheOpenOnes) {
    const auto allowed = peerWith(dict({{kBTHEntitlementAllowed, true}}));
    for (uint64_t c = 0; c < kBTHCommandCount; ++c) {
        if (c == 4) continue;  // replies later, from its completion (below)
        EXPECT_EQ(run(command(c), allowed).first, reachedHandler(c, true)) << c;
    }

    const auto lookupOnly = peerWith(dict({{kBTHEntitlementOtherIdLookup, true}}));
    EXPECT_EQ(run(command(0), lookupOnly).first, reachedHandler(0));
    EXPECT_EQ(run(command(1), lookupOnly).first, BTHErrorNotEntitled);
    EXPECT_EQ(run(command(24), lookupOnly).first, BTHErrorNotEntitled);

    auto client = checkEntitlementsAndInitClientObject(lookupOnly, kBTHEntitlementNone);
    ASSERT_TRUE(client);
    EXPECT_TRUE(client->allowOtherIdLookup());
    client = checkEntitlementsAndInitClientObject(peerWith(std::nullopt), kBTHEntitlementNone);
    ASSERT_TRUE(client);
    EXPECT_FALSE(client->allowOtherIdLookup());
    EXPECT_EQ(client->clientUserId(), 501u);
    EXPECT_EQ(client->clientBundleIdentifier(), "sys.kelp.tester");
}

TEST(BTHRequestIntakeTest, SpecificEntitlementsAndTheWipeList) {
    const auto migrator = peerWith(dict({{kBTHEntitlementDataMigration, true}}));
    EXPECT_EQ(run(command(24), migrator).first, reachedHandler(24));
    EXPECT_EQ(run(command(26), migrator).first, BTHErrorNotEntitled);
    const auto falseValue = peerWith(dict({{kBTHEntitlementDataMigration, false}}));
    EXPECT_EQ(run(command(24), falseValue).first, BTHErrorNotEntitled);

    // Each of the content entitlements opens its own commands only.
    const struct {
        const char* entitlement;
        std::vector<uint64_t> opens;
    } contentCases[] = {
        {kBTHEntitlementStageSharedContent, {26}},
        {kBTHEntitlementNetworkExtension, {27}},
        {kBTHEntitlementUserManagedAssets, {28, 29}},
    };
    for (const auto& entry : contentCases) {
        const auto peer = peerWith(dict({{entry.entitlement, true}}));
        for (uint64_t c = 26; c <= 29; ++c) {
            const bool opens =
                std::find(entry.opens.begin(), entry.opens.end(), c) != entry.opens.end();
            EXPECT_EQ(run(command(c), peer).first,
                      opens ? reachedHandler(c) : uint64_t{BTHErrorNotEntitled})
                << entry.entitlement << " " << c;
        }
    }

    test::LogCapture log;
    Value ids = Value::array();
    ids.push("sys.kelp.plugin.a");
    ids.push(7);  // not a string: not an identifier
    auto wiper = peerWith(dict({{kBTHEntitlementWipeContainer, ids}}));
    auto client = checkEntitlementsAndInitClientObject(wiper, kBTHEntitlementWipeContainer);
    ASSERT_TRUE(client);
    EXPECT_EQ(client->entitledWipeIdentifiers(), std::vector<std::string>{"sys.kelp.plugin.a"});
    EXPECT_FALSE(client->allowOtherIdLookup());

    auto notArray = peerWith(dict({{kBTHEntitlementWipeContainer, true}}));
    EXPECT_FALSE(checkEntitlementsAndInitClientObject(notArray, kBTHEntitlementWipeContainer));
    EXPECT_TRUE(log.contains(3, "No entitled containers to wipe"));

    // ".allowed" passes the wipe command too, with no wipe identifiers.
    auto allowedOnly = peerWith(dict({{kBTHEntitlementAllowed, true}}));
    client = checkEntitlementsAndInitClientObject(allowedOnly, kBTHEntitlementWipeContainer);
    ASSERT_TRUE(client);
    EXPECT_FALSE(client->entitledWipeIdentifiers());
}

// A signed caller's own entitlements are registered on its first request and
// follow it while they are its own; the installer's information, once there,
// is never overwritten by them.
TEST(BTHRequestIntakeTest, ACallersOwnEntitlementsStandUntilTheInstallerReportsSome) {
    if (!kRoot) GTEST_SKIP() << "needs root";
    BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
    ASSERT_TRUE(mapping);
    const std::string identifier = "sys.kelp.tester.own-entitlements";
    auto entitlementsAfterRequestWith = [&](uint64_t version) -> std::optional<Value> {
        BTHPeerIdentity peer = peerWith(dict({{"sys.kelp.tester.version", version}}));
        peer.signingIdentifier = identifier;
        EXPECT_TRUE(checkEntitlementsAndInitClientObject(peer, kBTHEntitlementNone));
        const std::optional<Value> info = mapping->getCodeSigningInfoForIdentifier(identifier);
        const Value* entitlements = info ? info->find(kBTHEntitlementsKey) : nullptr;
        return entitlements ? std::optional<Value>(*entitlements) : std::nullopt;
    };
    EXPECT_EQ(entitlementsAfterRequestWith(1), dict({{"sys.kelp.tester.version", uint64_t{1}}}));
    EXPECT_EQ(entitlementsAfterRequestWith(1), dict({{"sys.kelp.tester.version", uint64_t{1}}}));
    EXPECT_EQ(entitlementsAfterRequestWith(2), dict({{"sys.kelp.tester.version", uint64_t{2}}}));

    Value installed = Value::dictionary();
    installed.set(kBTHEntitlementsKey, dict({{"sys.kelp.tester.installed", true}}));
    ASSERT_EQ(mapping->processCodeSigningInfo(installed, identifier, std::nullopt),
              BTHErrorSuccess);
    EXPECT_EQ(entitlementsAfterRequestWith(3), dict({{"sys.kelp.tester.installed", true}}));
}

TEST(BTHRequestIntakeTest, CommandNumberChecks) {
    test::LogCapture log;
    const auto peer = peerWith(dict({{kBTHEntitlementAllowed, true}}));
    EXPECT_EQ(run(command(30), peer), std::make_pair(uint64_t{BTHErrorInvalidCommand}, 1));
    EXPECT_EQ(run(command((uint64_t{1} << 32) + 1), peer).first, BTHErrorInvalidCommand);
    EXPECT_EQ(run(command(UINT64_MAX), peer).first, BTHErrorInvalidCommand);
    EXPECT_TRUE(log.contains(3, "Invalid command index: 30"));
    EXPECT_TRUE(log.contains(3, "Invalid command index: -1"));
    // No "Command" at all reads as command 0, open to every caller.
    EXPECT_EQ(run(Value::dictionary(), peerWith(std::nullopt)).first, reachedHandler(0));
}

TEST(BTHRequestIntakeTest, RequestsFromAProcessNoLongerBoundAreRefused) {
    auto peer = peerWith(dict({{kBTHEntitlementAllowed, true}}));
    peer.processStillBound = false;
    EXPECT_EQ(run(command(0), peer), std::make_pair(uint64_t{BTHErrorNotEntitled}, 1));
}

TEST(BTHRequestIntakeTest, AsynchronousCommandsReplyOnceFromWhicheverSideFinishes) {
    // Command 4 replies from its completion, once death row is empty; a
    // failed user check replies at once.
    const auto peer = peerWith(dict({{kBTHEntitlementAllowed, true}}));
    auto emptying = std::make_shared<FakeRequest>(command(4), peer);
    BTHProcessRequest(emptying);
    for (int i = 0; i < 500 && emptying->sent == 0; ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(emptying->sent, 1);
    EXPECT_EQ(*emptying->reply().find("ReplyError"), Value(uint64_t{BTHErrorSuccess}));
    auto request = std::make_shared<FakeRequest>(command(21), peer);
    BTHSendAsynchronousReply(request, 61);
    EXPECT_EQ(request->sent, 1);
    EXPECT_EQ(*request->reply().find("ReplyError"), Value(61));
}

TEST(BTHRequestIntakeTest, ValidateUserIdForEveryClassFamilyAndClient) {
    test::LogCapture log;
    // Bundle classes take only 33 and system classes only 499, whoever asks;
    // a mobile client names only itself; for a system client 1 is the current
    // mobile user, and others are valid only for per-user classes.
    const struct {
        uint32_t user;
        uint64_t containerClass;
        uint32_t client;
        uint32_t effective;  // 0: refused
    } cases[] = {{33, 1, 0, 33},      {0, 1, 0, 0},   {1, 1, 0, 0},     {501, 1, 0, 0},
                 {499, 13, 501, 499}, {1, 12, 0, 0},  {1, 2, 501, 501}, {501, 7, 501, 501},
                 {502, 2, 501, 0},    {0, 2, 501, 0}, {1, 2, 0, 501},   {502, 11, 0, 502},
                 {502, 0, 0, 0},      {502, 14, 0, 0}};
    for (const auto& c : cases) {
        uint32_t effective = 0;
        uint64_t error = 1;
        EXPECT_EQ(validateUserId(c.user, c.containerClass, c.client, &effective, &error),
                  c.effective != 0)
            << c.user << " class " << c.containerClass << " from " << c.client;
        EXPECT_EQ(c.effective ? effective : error,
                  c.effective ? c.effective : uint64_t{BTHErrorInvalidParameter});
    }
    EXPECT_TRUE(log.contains(3, "Invalid userId 501 for class 1 from client 0"));
    EXPECT_FALSE(validateUserId(1, 12, 0, nullptr, nullptr));
    // Without an error location nothing is logged.
    size_t before = log.lines().size();
    EXPECT_FALSE(validateUserId(7, 1, 0, nullptr, nullptr));
    EXPECT_EQ(log.lines().size(), before);
}

}  // namespace
}  // namespace berth
