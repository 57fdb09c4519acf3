// The container commands through the real daemon's socket: creating, finding,
// listing and annotating containers of every kind, with what each leaves on
// the scratch device root.
#include <gtest/gtest.h>
#include <signal.h>
#include <acl/libacl.h>
#include <sys/acl.h>
#include <sys/stat.h>

#include <chrono>
#include <set>
#include <thread>

#include "BTHCodeSigningMapping.h"
#include "BTHMetadata.h"
#include "BTHPropertyListFile.h"
#include "DaemonProcess.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "client/libberth/BerthConnection.h"
#include "core/ErrorCodes.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/NamedSemaphore.h"

namespace berth {
namespace {

namespace fs = std::filesystem;

const fs::path& root() {
    static const fs::path& path = test::installScratchDeviceRoot();
    return path;
}
const bool kRootInstalled = !root().empty();

constexpr const char* kSelf = "sys.kelp.containers.tester";
const fs::path kDataClassDirectory = "private/var/mobile/Containers/Data/Application";
const fs::path kStagingDirectory = "private/var/root/Library/Caches/sys.kelp.berthd/Staging";
const fs::path kDeathRowDirectory = "private/var/root/Library/Caches/sys.kelp.berthd/Dead";

Value request(uint64_t command, uint64_t containerClass, uint64_t user,
              std::optional<std::string> identifier = std::nullopt) {
    Value m = Value::dictionary();
    m.set("Command", command);
    m.set("ContainerClass", containerClass);
    m.set("UserID", user);
    if (identifier) m.set("Identifier", *identifier);
    return m;
}

Value create(uint64_t containerClass, uint64_t user, const std::string& identifier,
             bool transient = false, bool createIfNecessary = true) {
    Value m = request(0, containerClass, user, identifier);
    m.set("CreateIfNecessary", createIfNecessary);
    m.set("Transient", transient);
    return m;
}

// A request about one container found by an earlier reply.
Value about(uint64_t command, uint64_t containerClass, uint64_t user, const Value& created) {
    Value m = request(command, containerClass, user, *created.find("ReplyIdentifier")->string());
    m.set("UUID", *created.find("ReplyUUID"));
    return m;
}

uint64_t code(const Value& reply) {
    const Value* value = reply.find("ReplyError");
    return value ? value->uint64Value().value_or(0) : 0;
}

std::string text(const Value& reply, const char* key) {
    const Value* value = reply.find(key);
    return value && value->string() ? *value->string() : std::string();
}

// Names in a directory, sorted.
std::vector<std::string> listing(const fs::path& directory) {
    std::vector<std::string> names;
    std::error_code ignored;
    for (const auto& entry : fs::directory_iterator(directory, ignored))
        names.push_back(entry.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
}

// Waits (bounded) for the background emptying of death row.
bool deathRowEmpties() {
    for (int i = 0; i < 200; ++i) {
        if (listing(root() / kDeathRowDirectory).empty()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return false;
}

class DaemonContainersTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        ASSERT_TRUE(kRootInstalled);
        signSelf({{"sys.kelp.private.Berth.allowed", true}});
    }

    void TearDown() override {
        daemon_.reset();
        NamedSemaphore::remove("berthd.fb_check");
    }

    // Registers this test program under kSelf with `entitlements`; the daemon
    // reads the registry on every request.
    static void signSelf(std::vector<std::pair<const char*, Value>> entitlements) {
        Value dictionary = Value::dictionary();
        for (auto& [key, value] : entitlements) dictionary.set(key, value);
        std::string why;
        ASSERT_EQ(
            CodeSigningRegistry().sign(fs::read_symlink("/proc/self/exe"), kSelf, dictionary, &why),
            0)
            << why;
    }

    void start(std::map<std::string, std::string> environment = {}) {
        daemon_.reset();
        daemon_.emplace(root(), std::move(environment));
        ASSERT_TRUE(daemon_->waitUntilServing()) << daemon_->standardError();
        connection_ = BerthConnection::connect(daemon_->requestSocket());
        ASSERT_TRUE(connection_);
    }

    Value call(const Value& message) {
        BerthError error;
        std::optional<Value> reply =
            connection_->request(message, std::chrono::seconds(20), &error);
        EXPECT_TRUE(reply) << error.message;
        return reply ? *reply : Value::dictionary();
    }

    std::optional<test::DaemonProcess> daemon_;
    std::unique_ptr<BerthConnection> connection_;
};

TEST_F(DaemonContainersTest, CreateThenLookUpChangesNothing) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value made = call(create(2, 501, "sys.kelp.create.app"));
    ASSERT_EQ(code(made), 1u) << made.description();
    EXPECT_EQ(*made.find("ReplyExisted"), Value(false));
    EXPECT_EQ(text(made, "ReplyIdentifier"), "sys.kelp.create.app");
    const fs::path path = text(made, "ReplyPath");
    EXPECT_EQ(path.parent_path(), root() / kDataClassDirectory);
    // The directory is named by its own UUID, not by the container's.
    EXPECT_NE(path.filename().string(), made.find("ReplyUUID")->uuid()->string());

    for (const char* sub :
         {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"}) {
        struct stat st {};
        ASSERT_EQ(::lstat((path / sub).c_str(), &st), 0) << sub;
        EXPECT_EQ(st.st_mode & 07777, 0755u) << sub;
        EXPECT_EQ(st.st_uid, 501u) << sub;
    }
    struct stat before {};
    ASSERT_EQ(::lstat(BTHMetadata::metadataFileURL(path).c_str(), &before), 0);
    EXPECT_TRUE(listing(root() / kStagingDirectory).empty());

    const Value found = call(create(2, 501, "sys.kelp.create.app"));
    ASSERT_EQ(code(found), 1u);
    EXPECT_EQ(*found.find("ReplyExisted"), Value(true));
    EXPECT_EQ(text(found, "ReplyPath"), path.string());
    EXPECT_EQ(*found.find("ReplyUUID"), *made.find("ReplyUUID"));
    struct stat after {};
    ASSERT_EQ(::lstat(BTHMetadata::metadataFileURL(path).c_str(), &after), 0);
    EXPECT_EQ(after.st_ino, before.st_ino);
    EXPECT_EQ(after.st_mtim.tv_nsec, before.st_mtim.tv_nsec);

    // Not there and not to be made: 21.
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.absent", false, false))), 21u);
    // No identifier: the caller's own container.
    Value own = request(0, 2, 501);
    own.set("CreateIfNecessary", true);
    EXPECT_EQ(text(call(own), "ReplyIdentifier"), kSelf);
}

TEST_F(DaemonContainersTest, TransientContainersAreNeverReused) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value first = call(create(2, 501, "sys.kelp.transient", true));
    ASSERT_EQ(code(first), 1u);
    const Value second = call(create(2, 501, "sys.kelp.transient", true));
    ASSERT_EQ(code(second), 1u);
    EXPECT_EQ(*second.find("ReplyExisted"), Value(false));
    EXPECT_NE(text(second, "ReplyPath"), text(first, "ReplyPath"));
    EXPECT_NE(*second.find("ReplyUUID"), *first.find("ReplyUUID"));
    EXPECT_FALSE(fs::exists(text(first, "ReplyPath")));
    EXPECT_TRUE(fs::is_directory(text(second, "ReplyPath")));
    EXPECT_TRUE(deathRowEmpties());
    // A look-up that does not create retires the transient container too,
    // and leaves nothing behind that later requests would trip over.
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.transient", true, false))), 21u);
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.transient", true, false))), 21u);
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.transient", true))), 1u);
    // Transient containers live apart from permanent ones.
    EXPECT_NE(fs::path(text(second, "ReplyPath")).parent_path(), root() / kDataClassDirectory);
}

TEST_F(DaemonContainersTest, UsersAndClassesAreChecked) {
    ASSERT_NO_FATAL_FAILURE(start());
    EXPECT_EQ(code(call(create(12, 501, kSelf))), 38u);  // system class, mobile user
    EXPECT_EQ(code(call(create(1, 501, kSelf))), 38u);   // bundle class, mobile user
    const Value refused = call(create(12, 501, kSelf));
    EXPECT_EQ(refused.find("ReplyPath"), nullptr);
    // Invalid classes for the caller's own user reach the operation: 11.
    EXPECT_EQ(code(call(create(0, 1, kSelf))), 11u);
    EXPECT_EQ(code(call(create(14, 1, kSelf))), 11u);
    const Value bundle = call(create(1, 33, "sys.kelp.bundle"));
    ASSERT_EQ(code(bundle), 1u);
    struct stat st {};
    ASSERT_EQ(::lstat(text(bundle, "ReplyPath").c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, 33u);
    EXPECT_EQ(listing(text(bundle, "ReplyPath")), std::vector<std::string>{kBTHMetadataFileName});
}

TEST_F(DaemonContainersTest, SystemContainersNeedTheirEntitlement) {
    // No ".allowed" (which implies looking up others): command 0 is open.
    signSelf({});
    ASSERT_NO_FATAL_FAILURE(start());
    // Without looking up others, only a system container the code-signing
    // store grants to the caller itself.
    EXPECT_EQ(code(call(create(12, 499, kSelf))), 55u);
    EXPECT_EQ(code(call(create(12, 499, "sys.kelp.someone.else"))), 55u);

    daemon_.reset();
    Value entitlements = Value::dictionary();
    entitlements.set(kBTHSystemContainerEntitlement, true);
    Value info = Value::dictionary();
    info.set("sys.kelp.Berth.Entitlements", entitlements);
    Value entry = Value::dictionary();
    entry.set("CodeSigningInfo", info);
    Value mapping = Value::dictionary();
    mapping.set(kSelf, entry);
    const fs::path library = root() / "private/var/root/Library/Berth";
    fs::create_directories(library);
    BTHErrorRef error;
    ASSERT_TRUE(BTH_writeToURL(mapping, library / kBTHCodeSigningMappingFileName,
                               kBTHStateFileWriteOptions, &error))
        << error->description();
    ASSERT_NO_FATAL_FAILURE(start());
    const Value own = call(create(12, 499, kSelf));
    ASSERT_EQ(code(own), 1u) << own.description();
    EXPECT_EQ(code(call(create(12, 499, "sys.kelp.someone.else"))), 55u);

    // The top directory stays root's; its contents belong to nobody and are
    // reached through the "systemusers" access entries.
    const fs::path path = text(own, "ReplyPath");
    struct stat st {};
    ASSERT_EQ(::lstat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, 0u);
    ASSERT_EQ(::lstat((path / "Library/Caches").c_str(), &st), 0);
    EXPECT_EQ(st.st_uid, 65534u);
    EXPECT_EQ(st.st_mode & 0707, 0u);
    acl_t top = acl_get_file(path.c_str(), ACL_TYPE_DEFAULT);
    ASSERT_NE(top, nullptr);
    EXPECT_GT(acl_entries(top), 0);
    acl_free(top);
    fs::remove(library / kBTHCodeSigningMappingFileName);
}

TEST_F(DaemonContainersTest, WellKnownSystemContainersLiveUnderTheirNames) {
    signSelf(
        {{"sys.kelp.private.Berth.allowed", true}, {"sys.kelp.private.Berth.otherIdLookup", true}});
    ASSERT_NO_FATAL_FAILURE(start());
    const Value system = call(create(12, 499, "sys.kelp.lanternd"));
    ASSERT_EQ(code(system), 1u) << system.description();
    EXPECT_EQ(fs::path(text(system, "ReplyPath")).filename(), "sys.kelp.lanternd");
    const Value group = call(create(13, 499, "systemgroup.sys.kelp.tidewater"));
    ASSERT_EQ(code(group), 1u);
    EXPECT_EQ(fs::path(text(group, "ReplyPath")).filename(), "systemgroup.sys.kelp.tidewater");
    EXPECT_TRUE(fs::is_directory(fs::path(text(group, "ReplyPath")) / "Library/Caches"));
    const Value other = call(create(12, 499, "sys.kelp.not.wellknown"));
    ASSERT_EQ(code(other), 1u);
    EXPECT_TRUE(Uuid::parse(fs::path(text(other, "ReplyPath")).filename().string()));
}

TEST_F(DaemonContainersTest, InfoValuesAndMetadata) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value made = call(create(2, 501, "sys.kelp.info.app"));
    ASSERT_EQ(code(made), 1u);

    Value bare = about(7, 2, 501, made);
    bare.set("InfoDictRequested", true);
    const Value plain = call(bare);
    ASSERT_EQ(code(plain), 1u);
    EXPECT_EQ(text(plain, "ReplyPath"), text(made, "ReplyPath"));
    EXPECT_EQ(*plain.find("ReplyTransient"), Value(false));
    EXPECT_EQ(plain.find("ReplyInfoDictionary"), nullptr);

    Value value = Value::dictionary();
    value.set("nested", Value::array());
    Value set = about(5, 2, 501, made);
    set.set("Key", "k");
    set.set("Value", value);
    ASSERT_EQ(code(call(set)), 1u);
    Value get = about(6, 2, 501, made);
    get.set("Key", "k");
    const Value read = call(get);
    ASSERT_EQ(code(read), 1u);
    EXPECT_EQ(*read.find("ReplyInfoValue"), value);
    const Value withInfo = call(bare);
    ASSERT_NE(withInfo.find("ReplyInfoDictionary"), nullptr);
    EXPECT_EQ(*withInfo.find("ReplyInfoDictionary")->find("k"), value);
    // The value is in the file too.
    auto onDisk =
        BTHMetadata::readAndValidateMetadataAtUrl(text(made, "ReplyPath"), 501, true, nullptr);
    ASSERT_TRUE(onDisk && onDisk->info());
    EXPECT_EQ(*onDisk->info()->find("k"), value);

    // No value removes the key; reading it then is a quiet 24.
    Value remove = about(5, 2, 501, made);
    remove.set("Key", "k");
    ASSERT_EQ(code(call(remove)), 1u);
    EXPECT_EQ(code(call(get)), 24u);
    // No key: 38. Another container's UUID: 21.
    EXPECT_EQ(code(call(about(6, 2, 501, made))), 38u);
    Value wrong = get;
    wrong.set("UUID", Uuid::random());
    EXPECT_EQ(code(call(wrong)), 21u);
}

TEST_F(DaemonContainersTest, RecreateDefaultStructureKeepsContents) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value made = call(create(2, 501, "sys.kelp.recreate.app"));
    ASSERT_EQ(code(made), 1u);
    const fs::path path = text(made, "ReplyPath");
    test::writeFile(path / "Documents/kept", "data");
    for (uint64_t command : {8, 22}) {
        fs::remove_all(path / "tmp");
        ASSERT_EQ(code(call(about(command, 2, 501, made))), 1u) << command;
        EXPECT_TRUE(fs::is_directory(path / "tmp")) << command;
        EXPECT_EQ(test::readFile(path / "Documents/kept"), "data");
    }
}

TEST_F(DaemonContainersTest, ListingAndTheCacheAgainstTheDisk) {
    // Two directories claiming one identifier, written before the daemon
    // starts: the class map holds one of them.
    const fs::path classDirectory = root() / "private/var/other/Containers/Data/Application";
    for (int i = 0; i < 2; ++i) {
        const fs::path dir = classDirectory / Uuid::random().string();
        fs::create_directories(dir);
        BTHMetadata record(502, Uuid::random(), 2, "sys.kelp.dup", std::nullopt, dir, std::nullopt);
        ASSERT_TRUE(record.writeMetadataToDisk(nullptr));
    }
    ASSERT_NO_FATAL_FAILURE(start());
    std::vector<std::string> identifiers = {"sys.kelp.list.c", "sys.kelp.list.a",
                                            "sys.kelp.list.b"};
    std::map<std::string, Value> uuids;
    for (const auto& id : identifiers) {
        const Value made = call(create(2, 502, id));
        ASSERT_EQ(code(made), 1u);
        uuids[id] = *made.find("ReplyUUID");
    }
    Value list = request(1, 2, 502);
    const Value listed = call(list);
    ASSERT_EQ(code(listed), 1u);
    const auto* ids = listed.find("ReplyIdsArray")->arrayValue();
    const auto* listedUuids = listed.find("ReplyUUIDsArray")->arrayValue();
    ASSERT_TRUE(ids && listedUuids);
    ASSERT_EQ(ids->size(), 4u);
    ASSERT_EQ(listedUuids->size(), 4u);
    std::vector<std::string> names;
    for (size_t i = 0; i < ids->size(); ++i) {
        names.push_back(*(*ids)[i].string());
        if (uuids.count(names.back())) {
            EXPECT_EQ((*listedUuids)[i], uuids[names.back()]);
        }
    }
    EXPECT_EQ(names, (std::vector<std::string>{"sys.kelp.dup", "sys.kelp.list.a", "sys.kelp.list.b",
                                               "sys.kelp.list.c"}));

    // A metadata file removed behind the daemon: its look-up reports the
    // inconsistency and the listing leaves it out.
    const Value b = call(create(2, 502, "sys.kelp.list.b"));
    fs::remove(BTHMetadata::metadataFileURL(text(b, "ReplyPath")));
    EXPECT_EQ(code(call(create(2, 502, "sys.kelp.list.b", false, false))), 44u);
    const Value after = call(list);
    ASSERT_EQ(code(after), 1u);
    EXPECT_EQ(after.find("ReplyIdsArray")->size(), 3u);
    EXPECT_EQ(code(call(request(1, 0, 1))), 11u);
}

TEST_F(DaemonContainersTest, FailuresLeaveNoHalfBuiltContainer) {
    // The metadata file cannot be written: nothing appears in the class
    // directory and the staging directory goes to death row.
    ASSERT_NO_FATAL_FAILURE(start({{"BERTH_TEST_FAULTS", "metadata.write"}}));
    const auto before = listing(root() / kDataClassDirectory);
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.unwritable"))), 34u);
    EXPECT_EQ(listing(root() / kDataClassDirectory), before);
    EXPECT_TRUE(listing(root() / kStagingDirectory).empty());
    EXPECT_TRUE(deathRowEmpties());

    // The cache refuses the new container: the call fails but the live
    // directory stays where it was moved.
    ASSERT_NO_FATAL_FAILURE(start({{"BERTH_TEST_FAULTS", "create.cache-add"}}));
    EXPECT_EQ(code(call(create(2, 501, "sys.kelp.uncached"))), 45u);
    const auto now = listing(root() / kDataClassDirectory);
    EXPECT_EQ(now.size(), before.size() + 1);
    EXPECT_TRUE(listing(root() / kStagingDirectory).empty());
}

TEST_F(DaemonContainersTest, ConcurrentRequestsForOneIdentifierMakeOneContainer) {
    ASSERT_NO_FATAL_FAILURE(start());
    constexpr int kClients = 8;
    std::vector<std::optional<Value>> replies(kClients);
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back([&, i] {
            auto connection = BerthConnection::connect(daemon_->requestSocket());
            if (connection)
                replies[i] = connection->request(create(2, 501, "sys.kelp.contended"),
                                                 std::chrono::seconds(20));
        });
    }
    for (auto& thread : threads) thread.join();
    int made = 0;
    std::set<std::string> paths;
    for (const auto& reply : replies) {
        ASSERT_TRUE(reply);
        ASSERT_EQ(code(*reply), 1u);
        made += *reply->find("ReplyExisted") == Value(false);
        paths.insert(text(*reply, "ReplyPath"));
    }
    EXPECT_EQ(made, 1);
    EXPECT_EQ(paths.size(), 1u);
}

}  // namespace
}  // namespace berth
