// Processing, group queries and bundle deletions from 16 threads over
// overlapping groups (each identifier changed by one thread, read by all):
// no data race (run under ThreadSanitizer), every group container left is
// referenced, and the mapping ends as a serial replay of the same operations
// leaves it.
#include <thread>

#include "BTHContainerCache.h"
#include "BTHGlobalConfiguration.h"
#include "BTHGroupManager.h"
#include "BTHLocks.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::dict;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

constexpr int kThreads = 16;
constexpr int kOperations = 24;
constexpr int kIdentifiersPerThread = 3;
constexpr int kGroups = 5;

enum class Kind { Process, ProcessChild, Query, DeleteBundle };

struct Operation {
    Kind kind;
    std::string identifier;
    std::vector<std::string> groups;
    std::string parent;
};

std::string identifierOf(int thread, int index) {
    return "sys.kelp.stress." + std::to_string(thread) + "." + std::to_string(index);
}

// The operations of `thread`, fixed by its number: it changes only its own
// identifiers, reads anybody's, and shares the groups with everybody.
std::vector<Operation> operationsOf(int thread) {
    std::vector<Operation> operations;
    for (int i = 0; i < kOperations; ++i) {
        const int own = (thread + i) % kIdentifiersPerThread;
        Operation op{static_cast<Kind>((thread + i) % 4), identifierOf(thread, own), {}, {}};
        for (int g = 0; g < 1 + (thread * 3 + i) % 3; ++g)
            op.groups.push_back("group.stress." + std::to_string((thread + i + g) % kGroups));
        if (op.kind == Kind::ProcessChild)
            op.parent = identifierOf(thread, (own + 1) % kIdentifiersPerThread);
        if (op.kind == Kind::Query) op.identifier = identifierOf((thread * 5 + i) % kThreads, own);
        operations.push_back(std::move(op));
    }
    return operations;
}

Value infoWith(const std::vector<std::string>& groups) {
    return dict({{kBTHEntitlementsKey,
                  dict({{kBTHApplicationGroupsEntitlement, BTHStringListValue(groups)}})}});
}

std::optional<Value> optionsOf(const Operation& op) {
    if (op.parent.empty()) return std::nullopt;
    return dict({{kBTHParentBundleIDOption, op.parent}});
}

Value serialized(BTHCodeSigningMapping& mapping) {
    Value all = Value::dictionary();
    for (const auto& [identifier, entry] : mapping.codeSigningMappingDict())
        all.set(identifier, entry->serialize());
    return all;
}

// Runs `op` against the daemon's shared store, as the requests would.
void perform(const Operation& op, BTHClientConnection& client) {
    BTHCodeSigningMapping& mapping = *BTHCodeSigningMapping::sharedInstance();
    const uid_t mobile = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
    uint64_t code = BTHErrorSuccess;
    switch (op.kind) {
        case Kind::Process:
        case Kind::ProcessChild:
            EXPECT_EQ(
                mapping.processCodeSigningInfo(infoWith(op.groups), op.identifier, optionsOf(op)),
                1u);
            break;
        case Kind::Query:
            EXPECT_TRUE(BTHGroupManager::defaultManager().groupContainerPathsForUser(
                mobile, client, op.identifier, &code));
            break;
        case Kind::DeleteBundle:
            // Deleting its bundle removes the identifier with its children.
            if (client.createOrLookupContainerForUser(kBTHBundleUserId, op.identifier, true,
                                                      BTHContainerClassBundleApplication, false,
                                                      true, &code))
                client.deleteContainerForUser(kBTHBundleUserId, op.identifier,
                                              BTHContainerClassBundleApplication, false, &code);
            EXPECT_EQ(code, 1u);
            break;
    }
}

// The same operation's effect on a mapping of its own, one at a time.
void replay(const Operation& op, BTHCodeSigningMapping& mapping) {
    if (op.kind == Kind::Process || op.kind == Kind::ProcessChild)
        mapping.processCodeSigningInfo(infoWith(op.groups), op.identifier, optionsOf(op));
    if (op.kind == Kind::DeleteBundle)
        mapping.removeCodeSigningDictionariesForIdentifierAndItsChildren(op.identifier);
}

TEST(BTHGroupConcurrencyTest, SixteenThreadsEndWhereASerialReplayEnds) {
    BERTH_REQUIRE_ROOT();
    stdfs::remove_all(BTHCodeSigningMapping::mappingFileURL());
    BTHCodeSigningMapping* shared = BTHCodeSigningMapping::sharedInstance();
    ASSERT_TRUE(shared);
    shared->setHooks(BTHMakeCodeSigningHooks(BTHGroupManager::defaultManager()));

    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([t] {
            BTHClientConnection client("sys.kelp.stress.caller", 0, true, std::nullopt);
            for (const Operation& op : operationsOf(t)) perform(op, client);
        });
    }
    for (std::thread& thread : threads) thread.join();
    const Value concurrent = serialized(*shared);

    // Every group container left is one that some entry references.
    const uid_t mobile = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
    const auto counts =
        BTHGroupManager::defaultManager().copyReferenceCountSetOfType(BTHGroupTypeApplication);
    ASSERT_TRUE(counts);
    auto left = BTHContainerCache::sharedInstance().allContainersForUser(
        mobile, BTHContainerClassSharedAppGroup, false, nullptr);
    ASSERT_TRUE(left);
    for (const BTHMetadataRef& group : *left)
        if (group->identifier().starts_with("group.stress.")) {
            EXPECT_TRUE(counts->contains(group->identifier())) << group->identifier();
        }

    stdfs::remove_all(BTHCodeSigningMapping::mappingFileURL());
    auto serial = BTHCodeSigningMapping::create();
    ASSERT_TRUE(serial);
    for (int t = 0; t < kThreads; ++t)
        for (const Operation& op : operationsOf(t)) replay(op, *serial);
    EXPECT_EQ(concurrent, serialized(*serial));
    EXPECT_GT(concurrent.size(), 0u);
}

}  // namespace
}  // namespace berth
