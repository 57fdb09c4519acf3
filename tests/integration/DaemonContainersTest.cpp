// The container commands through the real daemon's socket: creating, finding,
// listing and annotating containers of every kind, with what each leaves on
// the scratch device root.
#include <acl/libacl.h>
#include <sys/acl.h>

#include "BTHCodeSigningMapping.h"
#include "BTHMetadata.h"
#include "BTHPropertyListFile.h"
#include "DaemonSupport.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

const fs::path& root() {
    return deviceRoot();
}

constexpr const char* kSelf = "sys.kelp.containers.tester";
constexpr const char* kAllowed = "sys.kelp.private.Berth.allowed";

class DaemonContainersTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (!IsSkipped() && !HasFatalFailure()) signSelf(kSelf, dict({{kAllowed, true}}));
    }
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
        const struct stat st = lstatOf(path / sub);
        EXPECT_EQ(st.st_mode & 07777, 0755u) << sub;
        EXPECT_EQ(st.st_uid, 501u) << sub;
    }
    const struct stat before = lstatOf(BTHMetadata::metadataFileURL(path));
    EXPECT_TRUE(listing(root() / kStagingDirectory).empty());

    const Value found = call(create(2, 501, "sys.kelp.create.app"));
    ASSERT_EQ(code(found), 1u);
    EXPECT_EQ(*found.find("ReplyExisted"), Value(true));
    EXPECT_EQ(text(found, "ReplyPath"), path.string());
    EXPECT_EQ(*found.find("ReplyUUID"), *made.find("ReplyUUID"));
    const struct stat after = lstatOf(BTHMetadata::metadataFileURL(path));
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
    EXPECT_EQ(code(call(create(1, 501, kSelf))), 38u);   // bundle class, mobile user
    const Value refused = call(create(12, 501, kSelf));  // system class, mobile user
    EXPECT_EQ(code(refused), 38u);
    EXPECT_EQ(refused.find("ReplyPath"), nullptr);
    // Invalid classes for the caller's own user reach the operation: 11.
    EXPECT_EQ(code(call(create(0, 1, kSelf))), 11u);
    EXPECT_EQ(code(call(create(14, 1, kSelf))), 11u);
    const Value bundle = call(create(1, 33, "sys.kelp.bundle"));
    ASSERT_EQ(code(bundle), 1u);
    EXPECT_EQ(lstatOf(text(bundle, "ReplyPath")).st_uid, 33u);
    EXPECT_EQ(listing(text(bundle, "ReplyPath")), std::vector<std::string>{kBTHMetadataFileName});
}

TEST_F(DaemonContainersTest, SystemContainersNeedTheirEntitlement) {
    // No ".allowed" (which implies looking up others): command 0 is open.
    signSelf(kSelf, Value::dictionary());
    ASSERT_NO_FATAL_FAILURE(start());
    // Without looking up others, only a system container the code-signing
    // store grants to the caller itself.
    EXPECT_EQ(code(call(create(12, 499, kSelf))), 55u);
    EXPECT_EQ(code(call(create(12, 499, "sys.kelp.someone.else"))), 55u);

    daemon_.reset();
    const Value entry =
        dict({{"CodeSigningInfo", dict({{"sys.kelp.Berth.Entitlements",
                                         dict({{kBTHSystemContainerEntitlement, true}})}})}});
    const fs::path library = root() / "private/var/root/Library/Berth";
    fs::create_directories(library);
    BTHErrorRef error;
    ASSERT_TRUE(BTH_writeToURL(dict({{kSelf, entry}}), library / kBTHCodeSigningMappingFileName,
                               kBTHStateFileWriteOptions, &error))
        << error->description();
    ASSERT_NO_FATAL_FAILURE(start());
    const Value own = call(create(12, 499, kSelf));
    ASSERT_EQ(code(own), 1u) << own.description();
    EXPECT_EQ(code(call(create(12, 499, "sys.kelp.someone.else"))), 55u);

    // The top directory stays root's; its contents belong to nobody and are
    // reached through the "systemusers" access entries.
    const fs::path path = text(own, "ReplyPath");
    EXPECT_EQ(lstatOf(path).st_uid, 0u);
    const struct stat caches = lstatOf(path / "Library/Caches");
    EXPECT_EQ(caches.st_uid, 65534u);
    EXPECT_EQ(caches.st_mode & 0707, 0u);
    acl_t top = acl_get_file(path.c_str(), ACL_TYPE_DEFAULT);
    ASSERT_NE(top, nullptr);
    EXPECT_GT(acl_entries(top), 0);
    acl_free(top);
    fs::remove(library / kBTHCodeSigningMappingFileName);
}

TEST_F(DaemonContainersTest, WellKnownSystemContainersLiveUnderTheirNames) {
    signSelf(kSelf, dict({{kAllowed, true}, {"sys.kelp.private.Berth.otherIdLookup", true}}));
    ASSERT_NO_FATAL_FAILURE(start());
    for (const auto& [containerClass, identifier] :
         {std::pair{12, "sys.kelp.lanternd"}, {13, "systemgroup.sys.kelp.tidewater"}}) {
        const Value made = call(create(containerClass, 499, identifier));
        ASSERT_EQ(code(made), 1u) << made.description();
        EXPECT_EQ(fs::path(text(made, "ReplyPath")).filename(), identifier);
        EXPECT_TRUE(fs::is_directory(fs::path(text(made, "ReplyPath")) / "Library/Caches"));
    }
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

    const Value value = dict({{"nested", Value::array()}});
    auto keyed = [&](uint64_t command, std::optional<Value> v = std::nullopt) {
        Value m = about(command, 2, 501, made);
        m.set("Key", "k");
        if (v) m.set("Value", *v);
        return m;
    };
    ASSERT_EQ(code(call(keyed(5, value))), 1u);
    const Value read = call(keyed(6));
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
    ASSERT_EQ(code(call(keyed(5))), 1u);
    EXPECT_EQ(code(call(keyed(6))), 24u);
    // No key: 38. Another container's UUID: 21.
    EXPECT_EQ(code(call(about(6, 2, 501, made))), 38u);
    Value wrong = keyed(6);
    wrong.set("UUID", Uuid::random());
    EXPECT_EQ(code(call(wrong)), 21u);
}

TEST_F(DaemonContainersTest, RecreateDefaultStructureKeepsContents) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value made = call(create(2, 501, "sys.kelp.recreate.app"));
    ASSERT_EQ(code(made), 1u);
    const fs::path path = text(made, "ReplyPath");
    writeFile(path / "Documents/kept", "data");
    for (uint64_t command : {8, 22}) {
        fs::remove_all(path / "tmp");
        ASSERT_EQ(code(call(about(command, 2, 501, made))), 1u) << command;
        EXPECT_TRUE(fs::is_directory(path / "tmp")) << command;
        EXPECT_EQ(readFile(path / "Documents/kept"), "data");
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
    std::map<std::string, Value> uuids;
    for (const char* id : {"sys.kelp.list.c", "sys.kelp.list.a", "sys.kelp.list.b"}) {
        const Value made = call(create(2, 502, id));
        ASSERT_EQ(code(made), 1u);
        uuids[id] = *made.find("ReplyUUID");
    }
    const Value listed = call(request(1, 2, 502));
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
    const Value after = call(request(1, 2, 502));
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
    EXPECT_EQ(listing(root() / kDataClassDirectory).size(), before.size() + 1);
    EXPECT_TRUE(listing(root() / kStagingDirectory).empty());
}

TEST_F(DaemonContainersTest, ConcurrentRequestsForOneIdentifierMakeOneContainer) {
    ASSERT_NO_FATAL_FAILURE(start());
    std::vector<std::optional<Value>> replies(8);
    std::vector<std::thread> threads;
    for (auto& reply : replies)
        threads.emplace_back([&] {
            if (auto connection = BerthConnection::connect(daemon_->requestSocket()))
                reply = connection->request(create(2, 501, "sys.kelp.contended"),
                                            std::chrono::seconds(20));
        });
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
