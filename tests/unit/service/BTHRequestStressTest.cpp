// The request path under load: 64 clients, each on its own connection to a
// real relay listener whose events go to the daemon's request processing,
// wired as the daemon wires its request socket. For a while they mix
// look-ups and creations (of a few identifiers every client shares, so that
// they contend on the same identifier locks, and of identifiers of their
// own), listings, deletions, the commands that reply later from other
// queues, requests the daemon must refuse, and pipelined batches.
//
// Afterwards, per connection: every request got exactly one reply; the
// replies of the commands that reply at once came in the order of their
// requests; every code is one the command can give for what the client knew
// (never a refusal of the entitled caller); and every connection ended
// cleanly. Then the containers the listing and the disk show are exactly the
// shared identifiers and the clients' own that were created and not deleted,
// and no staged container is left behind.
//
// BERTH_STRESS_SECONDS sets how long the clients run (default 60).
#include <cstdio>
#include <random>

#include "BTHCommandTable.h"
#include "BTHGlobalConfiguration.h"
#include "BTHMetadata.h"
#include "BTHRelayRequest.h"
#include "RelayTestServer.h"
#include "ScratchDeviceRoot.h"
#include "core/BTHContainerClass.h"
#include "core/Commands.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

constexpr uid_t kMobile = 501;
constexpr uint64_t kClass = BTHContainerClassDataApplication;
constexpr int kClients = 64;
constexpr int kSharedIdentifiers = 4;
constexpr int kOwnIdentifiers = 3;
constexpr size_t kFaultsKept = 10;  // per client: the first ones tell the story

std::chrono::seconds stressDuration() {
    const char* text = std::getenv("BERTH_STRESS_SECONDS");
    const int seconds = text ? std::atoi(text) : 0;
    return std::chrono::seconds(seconds > 0 ? seconds : 60);
}

std::string sharedIdentifier(int n) {
    return "sys.kelp.stress.shared." + std::to_string(n);
}

std::string ownIdentifier(int client, int n) {
    return "sys.kelp.stress.client" + std::to_string(client) + "." + std::to_string(n);
}

// Every peer is the same signed client, entitled to the ordinary commands.
class SignedClients final : public CodeSigningService {
  public:
    std::optional<PeerIdentity> identify(pid_t, int, std::string*) override { return identity(); }
    std::optional<PeerIdentity> identifyLaunched(pid_t, int, uid_t, std::string*) override {
        return identity();
    }
    std::optional<ExecutableId> executableOf(pid_t, int, std::string*) override {
        return kExecutable;
    }

  private:
    static constexpr ExecutableId kExecutable{1, 1};
    static PeerIdentity identity() {
        return {"sys.kelp.stress.client", test::dict({{kBTHEntitlementAllowed, true}}), kExecutable,
                "/usr/libexec/stress-client"};
    }
};

Value request(uint64_t command, Value::Dictionary keys = {}) {
    keys.emplace("Command", command);
    return Value(std::move(keys));
}

Value containerRequest(uint64_t command, const std::string& identifier,
                       Value::Dictionary more = {}) {
    more.emplace("ContainerClass", kClass);
    more.emplace("UserID", uint64_t{kMobile});
    more.emplace("Identifier", identifier);
    return request(command, std::move(more));
}

// The identifiers of a listing reply, or none when it has no such array.
std::optional<std::vector<std::string>> listedIdentifiers(const Value& reply) {
    const Value* ids = reply.find("ReplyIdsArray");
    if (!ids || !ids->arrayValue()) return std::nullopt;
    std::vector<std::string> names;
    for (const Value& id : *ids->arrayValue()) names.push_back(id.string() ? *id.string() : "?");
    return names;
}

// One client's connection, requests and what it knows of its own
// identifiers, which no other client touches.
class StressClient {
  public:
    StressClient(int index, UniqueFd fd)
        : index_(index), fd_(std::move(fd)), reader_(fd_.get()), random_(index) {}

    void run(std::chrono::steady_clock::time_point deadline) {
        const bool pipelines = index_ % 4 == 0;
        while (std::chrono::steady_clock::now() < deadline && !broken_) {
            const int batch = pipelines ? 2 + static_cast<int>(random_() % 7) : 1;
            for (int i = 0; i < batch; ++i) send(pick(pipelines));
            while (!pending_.empty() && !broken_) receive();
        }
        finish();
    }

    const std::vector<std::string>& faults() const { return faults_; }
    const std::set<std::string>& liveOwn() const { return live_; }
    const std::set<std::string>& sharedCreated() const { return sharedCreated_; }
    uint64_t replies() const { return answered_.size(); }

  private:
    enum class Effect { None, Creates, Deletes, Lists };
    struct Pending {
        uint64_t command;
        std::set<uint64_t> codes;  // what the command can give here
        std::string identifier;
        Effect effect;
    };
    static Pending expect(uint64_t command, std::set<uint64_t> codes, std::string identifier = {},
                          Effect effect = Effect::None) {
        return {command, std::move(codes), std::move(identifier), effect};
    }

    void fault(const std::string& what) {
        if (faults_.size() < kFaultsKept) faults_.push_back(what);
    }

    // A request of the mix, and the replies it can have once the requests
    // sent before it are processed. A pipelining client asks about its own
    // identifiers' protection never: its next requests may delete them
    // before the change, which goes on elsewhere, is done.
    std::pair<Value, Pending> pick(bool pipelines) {
        const std::string shared =
            sharedIdentifier(static_cast<int>(random_() % kSharedIdentifiers));
        const std::string own =
            ownIdentifier(index_, static_cast<int>(random_() % kOwnIdentifiers));
        const uint64_t existing = planned_.count(own) ? BTHErrorSuccess : BTHErrorNotFound;
        switch (random_() % 14) {
            case 0:
            case 1:
                return {containerRequest(0, shared, {{"CreateIfNecessary", true}}),
                        expect(0, {BTHErrorSuccess}, shared, Effect::Creates)};
            case 2:
            case 3:
                return {containerRequest(0, shared, {{"CreateIfNecessary", false}}),
                        expect(0, {BTHErrorSuccess, BTHErrorNotFound}, shared)};
            case 4:
            case 5:
                planned_.insert(own);
                return {containerRequest(0, own, {{"CreateIfNecessary", true}}),
                        expect(0, {BTHErrorSuccess}, own, Effect::Creates)};
            case 6:
                return {containerRequest(0, own), expect(0, {existing}, own)};
            case 7:
            case 8:
                planned_.erase(own);
                return {containerRequest(10, own), expect(10, {existing}, own, Effect::Deletes)};
            case 9:
                return {request(1, {{"ContainerClass", kClass}, {"UserID", uint64_t{kMobile}}}),
                        expect(1, {BTHErrorSuccess}, {}, Effect::Lists)};
            case 10:
                return {request(4), expect(4, {BTHErrorSuccess})};
            case 11:
                if (pipelines)
                    return {containerRequest(21, shared, {{"DataProtectionClass", 3}}),
                            expect(21, {BTHErrorSuccess, BTHErrorNotFound}, shared)};
                return {containerRequest(21, own, {{"DataProtectionClass", 3}}),
                        expect(21, {existing}, own)};
            case 12:
                return {request(kBTHCommandCount),
                        expect(kBTHCommandCount, {BTHErrorInvalidCommand})};
            default:
                // No class and no user: not a valid target.
                return {request(0, {{"Identifier", own}}),
                        expect(0, {BTHErrorInvalidParameter}, own)};
        }
    }

    void send(std::pair<Value, Pending> next) {
        const uint64_t id = nextId_++;
        if (!test::writeAll(fd_.get(),
                            test::frameBytes(relay::FrameKind::Request, id, next.first))) {
            fault("send failed: " + std::string(strerror(errno)));
            broken_ = true;
            return;
        }
        pending_.emplace(id, std::move(next.second));
    }

    void receive() {
        std::optional<relay::Frame> frame = reader_.next();
        if (!frame) {
            fault("connection broke with " + std::to_string(pending_.size()) +
                  " requests unanswered");
            broken_ = true;
            return;
        }
        const uint64_t id = frame->messageId;
        auto found = pending_.find(id);
        if (frame->kind != relay::FrameKind::Reply || found == pending_.end()) {
            fault((answered_.count(id) ? "second reply to " : "unasked frame ") +
                  std::to_string(id));
            return;
        }
        Pending request = std::move(found->second);
        pending_.erase(found);
        answered_.insert(id);
        check(id, request, frame->body);
    }

    void check(uint64_t id, const Pending& request, const Value& reply) {
        const std::string what =
            "request " + std::to_string(id) + " (command " + std::to_string(request.command) + ")";
        if (request.command < kBTHCommandCount && BTHCommands()[request.command].repliesAtOnce) {
            if (id < lastAtOnce_) fault(what + " answered after " + std::to_string(lastAtOnce_));
            lastAtOnce_ = std::max(lastAtOnce_, id);
        }
        const Value* codeValue = reply.find("ReplyError");
        const uint64_t code = codeValue ? codeValue->uint64Value().value_or(0) : 0;
        if (!request.codes.count(code)) {
            fault(what + " " + request.identifier + " replied " + std::to_string(code));
            return;
        }
        if (code != BTHErrorSuccess) return;
        if (request.effect == Effect::Creates) {
            (request.identifier.rfind("sys.kelp.stress.shared.", 0) == 0 ? sharedCreated_ : live_)
                .insert(request.identifier);
        } else if (request.effect == Effect::Deletes) {
            live_.erase(request.identifier);
        } else if (request.effect == Effect::Lists) {
            checkListing(what, reply);
        }
    }

    // A listing answered after this client's earlier requests were
    // processed: its own identifiers are there exactly while they exist.
    void checkListing(const std::string& what, const Value& reply) {
        const auto listed = listedIdentifiers(reply);
        if (!listed) return fault(what + " listed no identifiers");
        const std::multiset<std::string> names(listed->begin(), listed->end());
        for (int n = 0; n < kOwnIdentifiers; ++n) {
            const std::string own = ownIdentifier(index_, n);
            if (names.count(own) != live_.count(own))
                fault(what + " listed " + own + " " + std::to_string(names.count(own)) + " times");
        }
        for (const std::string& name : names)
            if (names.count(name) > 1) return fault(what + " listed " + name + " twice");
    }

    // Nothing more may arrive, and the daemon ends the connection when the
    // client stops sending.
    void finish() {
        ::shutdown(fd_.get(), SHUT_WR);
        while (std::optional<relay::Frame> extra = reader_.next())
            fault("frame " + std::to_string(extra->messageId) + " after the last reply");
        if (!test::readsEndOfStream(fd_.get())) fault("connection did not end cleanly");
    }

    const int index_;
    UniqueFd fd_;
    test::FrameReader reader_;
    std::minstd_rand random_;
    uint64_t nextId_ = 1;
    uint64_t lastAtOnce_ = 0;
    bool broken_ = false;
    std::map<uint64_t, Pending> pending_;
    std::set<uint64_t> answered_;
    std::set<std::string> live_;     // own identifiers that exist, as the replies tell
    std::set<std::string> planned_;  // ... once the requests sent so far are processed
    std::set<std::string> sharedCreated_;
    std::vector<std::string> faults_;
};

// The identifiers of the containers of the class on disk, one entry each.
std::multiset<std::string> identifiersOnDisk() {
    std::multiset<std::string> found;
    const stdfs::path directory =
        *BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(kMobile, kClass,
                                                                               false);
    for (const auto& entry : stdfs::directory_iterator(directory)) {
        BTHMetadataRef record =
            BTHMetadata::readAndValidateMetadataAtUrl(entry.path(), kMobile, true, nullptr);
        found.insert(record ? record->identifier() : "unreadable " + entry.path().string());
    }
    return found;
}

std::multiset<std::string> listedOnce(test::RelayTestServer& server) {
    UniqueFd fd = server.connectRaw();
    test::writeAll(
        fd.get(),
        test::frameBytes(relay::FrameKind::Request, 1,
                         request(1, {{"ContainerClass", kClass}, {"UserID", uint64_t{kMobile}}})));
    const auto frames = test::readFrames(fd.get(), 1);
    if (frames.empty()) return {"no reply"};
    const auto listed = listedIdentifiers(frames[0].body);
    if (!listed) return {"no listing"};
    return {listed->begin(), listed->end()};
}

// What `found` holds beyond `expected`, and what it lacks, for a readable
// failure; empty when they agree.
std::string difference(const std::multiset<std::string>& found,
                       const std::multiset<std::string>& expected) {
    std::vector<std::string> extra, missing;
    std::set_difference(found.begin(), found.end(), expected.begin(), expected.end(),
                        std::back_inserter(extra));
    std::set_difference(expected.begin(), expected.end(), found.begin(), found.end(),
                        std::back_inserter(missing));
    std::string text;
    for (const std::string& name : extra) text += " +" + name;
    for (const std::string& name : missing) text += " -" + name;
    return text;
}

TEST(BTHRequestStressTest, ManyClientsMixingCommandsGetOneFittingReplyEach) {
    BERTH_REQUIRE_ROOT();
    test::RelayTestServer server(
        test::RelayTestServer::ProcessEvents{[](const RelayEvent& e) { BTHProcessRelayEvent(e); }},
        std::make_shared<SignedClients>());
    std::vector<std::unique_ptr<StressClient>> clients;
    for (int i = 0; i < kClients; ++i)
        clients.push_back(std::make_unique<StressClient>(i, server.connectRaw()));

    const auto deadline = std::chrono::steady_clock::now() + stressDuration();
    std::vector<std::thread> threads;
    for (auto& client : clients)
        threads.emplace_back([&client, deadline] { client->run(deadline); });
    for (std::thread& thread : threads) thread.join();

    std::multiset<std::string> expected;
    uint64_t replies = 0;
    for (int i = 0; i < kClients; ++i) {
        for (const std::string& fault : clients[i]->faults())
            ADD_FAILURE() << "client " << i << ": " << fault;
        EXPECT_GT(clients[i]->replies(), 0u) << "client " << i << " made no progress";
        replies += clients[i]->replies();
        expected.insert(clients[i]->liveOwn().begin(), clients[i]->liveOwn().end());
    }
    std::set<std::string> shared;
    for (const auto& client : clients)
        shared.insert(client->sharedCreated().begin(), client->sharedCreated().end());
    expected.insert(shared.begin(), shared.end());
    std::printf("%llu replies to %d clients; %zu containers remain\n",
                static_cast<unsigned long long>(replies), kClients, expected.size());

    EXPECT_TRUE(server.waitFor([&] { return server.invalidated() == size_t{kClients}; }))
        << server.invalidated() << " of " << kClients << " connections ended";
    EXPECT_TRUE(server.waitFor([&] { return server.listener().connectionCount() == 0; }));
    EXPECT_EQ(shared.size(), size_t{kSharedIdentifiers});
    EXPECT_EQ(difference(listedOnce(server), expected), "") << "listing";
    EXPECT_EQ(difference(identifiersOnDisk(), expected), "") << "on disk";
    // The losers of creation races staged containers of their own; none
    // stays behind.
    EXPECT_EQ(test::namesIn(BTHGlobalConfiguration::sharedInstance().stagingDirectory()),
              std::set<std::string>{});
    test::waitForDeathRowQueue();
}

}  // namespace
}  // namespace berth
