// Disk usage and protection-class changes through the real daemon's socket
// and through berthctl: what is counted, what is kept for bundle containers,
// which items a change re-classes, and the single reply of a change that
// waits for the device to be unlocked.
#include <sys/stat.h>
#include <sys/xattr.h>

#include <future>
#include <unordered_set>

#include "DaemonSupport.h"
#include "core/ValueJson.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/ProtectionClass.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

constexpr const char* kSelf = "sys.kelp.usage.tester";
constexpr const char* kAllowed = "sys.kelp.private.Berth.allowed";
constexpr const char* kClassKey = "sys.kelp.Lading.ContentProtectionClass";
constexpr const char* kStaticUsageKey = "sys.kelp.Lading.StaticDiskUsage";
const fs::path kBerthctl = BERTHCTL_BINARY_PATH;

// How often the daemon's log (of this whole program) holds `line`.
size_t logCount(const std::string& line) {
    const std::string log = daemonLog();
    size_t count = 0;
    for (size_t at = log.find(line); at != std::string::npos; at = log.find(line, at + 1)) ++count;
    return count;
}

// Waits until the daemon has deferred one more change to class `target`.
bool deferredOnceMore(size_t before, int target) {
    const std::string line =
        "Retrying container protection update to " + std::to_string(target) + " on next unlock";
    return eventually([&] { return logCount(line) > before; }, std::chrono::seconds(20));
}

uint64_t usageOf(const Value& reply) {
    const Value* usage = reply.find("ReplyDiskUsage");
    return usage ? usage->uint64Value().value_or(~uint64_t{0}) : ~uint64_t{0};
}

// Bytes allocated to the files of a tree, each inode once: what the daemon
// must answer, worked out here independently.
uint64_t filesAllocated(const fs::path& root) {
    std::unordered_set<ino_t> seen;
    uint64_t total = 0;
    for (const auto& entry : fs::recursive_directory_iterator(root)) {
        const struct stat st = lstatOf(entry.path());
        if (S_ISDIR(st.st_mode) || !seen.insert(st.st_ino).second) continue;
        total += static_cast<uint64_t>(st.st_blocks) * 512;
    }
    return total;
}

// The class an item carries itself (none when it inherits).
std::optional<int32_t> ownClass(const fs::path& path) {
    unsigned char bytes[4];
    if (::lgetxattr(path.c_str(), protection::kAttributeName, bytes, 4) != 4) return std::nullopt;
    return static_cast<int32_t>(bytes[0] | bytes[1] << 8 | bytes[2] << 16 | bytes[3] << 24);
}

void giveClass(const fs::path& path, int32_t value) {
    const unsigned char bytes[4] = {static_cast<unsigned char>(value), 0, 0, 0};
    ASSERT_EQ(::lsetxattr(path.c_str(), protection::kAttributeName, bytes, 4, 0), 0) << path;
}

class UsageDaemonTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        signSelf(kSelf, dict({{kAllowed, true}}));
        std::string why;
        ASSERT_EQ(CodeSigningRegistry().sign(kBerthctl, "sys.kelp.berthctl",
                                             dict({{kAllowed, true}}), &why),
                  0)
            << why;
        setLocked(false);
        ASSERT_NO_FATAL_FAILURE(start());
    }
    void TearDown() override {
        setLocked(false);
        DaemonFixture::TearDown();
    }

    void setLocked(bool locked) {
        const Outcome outcome = run(kBerthctl, {locked ? "lock" : "unlock"});
        EXPECT_EQ(outcome.status, 0) << outcome.err;
    }

    Value made(uint64_t containerClass, uint64_t user, const std::string& identifier) {
        const Value reply = call(create(containerClass, user, identifier));
        EXPECT_EQ(code(reply), 1u) << reply.description();
        return reply;
    }

    Value protect(const std::string& identifier, int64_t protectionClass, bool thirdParty = false,
                  bool retryIfLocked = false) {
        Value message = request(21, 2, 1, identifier);
        message.set("DataProtectionClass", protectionClass);
        message.set("IsThirdParty", thirdParty);
        message.set("RetryIfLocked", retryIfLocked);
        return call(message);
    }

    std::optional<Value> infoValue(const Value& container, const char* key) {
        Value message = about(6, 2, 1, container);
        message.set("Key", key);
        const Value reply = call(message);
        const Value* value = reply.find("ReplyInfoValue");
        return value ? std::optional<Value>(*value) : std::nullopt;
    }
};

TEST_F(UsageDaemonTest, CountsEachFileOnceAndFollowsNoLinkAtTheRoot) {
    const Value container = made(2, 1, "sys.kelp.usage.links");
    const fs::path path = text(container, "ReplyPath");
    writeFile(path / "Documents/page", std::string(8192, 'p'));
    const uint64_t before = usageOf(call(about(23, 2, 1, container)));
    EXPECT_EQ(before, filesAllocated(path));
    fs::create_hard_link(path / "Documents/page", path / "Library/again");
    fs::create_hard_link(path / "Documents/page", path / "tmp/and-again");
    const Value reply = call(about(23, 2, 1, container));
    EXPECT_EQ(code(reply), 1u);
    EXPECT_EQ(usageOf(reply), before);

    // The container's directory swapped for a link to where it went: nothing
    // is read through the link (not even the metadata file that would prove
    // the container is there, so the container counts as missing).
    fs::rename(path, path.string() + ".moved");
    fs::create_directory_symlink(path.string() + ".moved", path);
    const Value linked = call(about(23, 2, 1, container));
    EXPECT_EQ(code(linked), 21u);
    EXPECT_EQ(usageOf(linked), 0u);
    fs::remove(path);
    fs::rename(path.string() + ".moved", path);
}

TEST_F(UsageDaemonTest, KeepsABundleContainersUsageButMeasuresDataEveryTime) {
    const Value bundle = made(1, 33, "sys.kelp.usage.bundle");
    const fs::path bundlePath = text(bundle, "ReplyPath");
    writeFile(bundlePath / "binary", std::string(20000, 'b'));
    const uint64_t first = usageOf(call(about(23, 1, 33, bundle)));
    EXPECT_EQ(first, filesAllocated(bundlePath));
    // Grown behind the daemon's back: the kept number is answered, no walk.
    writeFile(bundlePath / "more", std::string(50000, 'm'));
    const Value again = call(about(23, 1, 33, bundle));
    EXPECT_EQ(code(again), 1u);
    EXPECT_EQ(usageOf(again), first);
    Value get = about(6, 1, 33, bundle);
    get.set("Key", kStaticUsageKey);
    const Value stored = call(get);
    ASSERT_NE(stored.find("ReplyInfoValue"), nullptr) << stored.description();
    EXPECT_EQ(stored.find("ReplyInfoValue")->uint64Value(), first);

    const Value data = made(2, 1, "sys.kelp.usage.data");
    const fs::path dataPath = text(data, "ReplyPath");
    const uint64_t empty = usageOf(call(about(23, 2, 1, data)));
    writeFile(dataPath / "Documents/new", std::string(50000, 'n'));
    EXPECT_EQ(usageOf(call(about(23, 2, 1, data))), filesAllocated(dataPath));
    EXPECT_GT(filesAllocated(dataPath), empty);
    EXPECT_FALSE(infoValue(data, kStaticUsageKey));
}

TEST_F(UsageDaemonTest, RefusesBadClassesAndUnknownContainersWithUsageZero) {
    const Value data = made(2, 1, "sys.kelp.usage.refusals");
    for (uint64_t badClass : {uint64_t{0}, uint64_t{14}}) {
        const Value reply = call(about(23, badClass, 1, data));
        EXPECT_EQ(code(reply), 11u) << badClass;
        EXPECT_EQ(usageOf(reply), 0u);
    }
    Value unknown = about(23, 2, 1, data);
    unknown.set("UUID", Uuid::random());
    const Value reply = call(unknown);
    EXPECT_EQ(code(reply), 21u);
    EXPECT_EQ(usageOf(reply), 0u);
    // A user not valid for the class: 38 and no usage at all.
    const Value badUser = call(about(23, 1, 501, data));
    EXPECT_EQ(code(badUser), 38u);
    EXPECT_EQ(badUser.find("ReplyDiskUsage"), nullptr);
}

TEST_F(UsageDaemonTest, BerthctlPrintsTheUsage) {
    const Value data = made(2, 1, "sys.kelp.usage.ctl");
    const fs::path path = text(data, "ReplyPath");
    writeFile(path / "Documents/x", std::string(10000, 'x'));
    const Outcome outcome = run(kBerthctl, {"--json", "usage", "--class", "Data/Application",
                                            "--identifier", "sys.kelp.usage.ctl"});
    ASSERT_EQ(outcome.status, 0) << outcome.err;
    const std::optional<Value> printed = valueFromJson(outcome.out);
    ASSERT_TRUE(printed) << outcome.out;
    EXPECT_EQ(printed->find("bytes")->uint64Value(), filesAllocated(path));
    const Outcome missing =
        run(kBerthctl, {"usage", "--class", "2", "--identifier", "sys.kelp.none"});
    EXPECT_EQ(missing.status, 1);
    EXPECT_NE(missing.err.find("BTHErrorNotFound (21)"), std::string::npos) << missing.err;
}

TEST_F(UsageDaemonTest, RefusesClassTwoAndStrongClassesForThirdParties) {
    const Value data = made(2, 1, "sys.kelp.protect.refusals");
    const fs::path path = text(data, "ReplyPath");
    EXPECT_EQ(code(protect("sys.kelp.protect.refusals", 2)), 38u);
    EXPECT_EQ(code(protect("sys.kelp.protect.refusals", 4, true)), 38u);
    EXPECT_NE(daemonLog().find("Data protection class 4 is invalid for 2nd and 3rd party apps"),
              std::string::npos);
    EXPECT_FALSE(ownClass(path / "Documents"));
    EXPECT_FALSE(infoValue(data, kClassKey));
    EXPECT_EQ(code(protect("sys.kelp.protect.none", 3)), 21u);
    Value wrongClass = request(21, 1, 33, "sys.kelp.protect.refusals");
    EXPECT_EQ(code(call(wrongClass)), 11u);
    // A user not valid for the class is answered at once by the intake.
    EXPECT_EQ(code(call(request(21, 1, 501, "sys.kelp.protect.refusals"))), 38u);
    // The class already held: success, and no file is touched.
    EXPECT_EQ(code(protect("sys.kelp.protect.refusals", 0)), 1u);
    EXPECT_FALSE(ownClass(path / "Documents"));

    // Without any user-data item there is nothing to change, and the class
    // is still recorded.
    for (const char* item : {"Documents", "Library", "tmp"}) fs::remove_all(path / item);
    EXPECT_EQ(code(protect("sys.kelp.protect.refusals", 3)), 1u);
    EXPECT_EQ(infoValue(data, kClassKey), Value(int64_t{3}));
}

// Lowering re-classes directories and files but spares files of class 2 and
// files already stronger; raising re-classes directories only.
TEST_F(UsageDaemonTest, LoweringAndRaisingReclassTheRightItems) {
    const Value data = made(2, 1, "sys.kelp.protect.levels");
    const fs::path path = text(data, "ReplyPath");
    fs::create_directories(path / "Documents/sub");
    writeFile(path / "Documents/plain", "p");      // inherits
    writeFile(path / "Documents/sub/kept2", "k");  // class 2
    writeFile(path / "Documents/stronger", "s");   // class 0
    writeFile(path / "Library/weaker", "w");       // class 4
    giveClass(path / "Documents", 3);              // what the recorded class 3 gave them
    giveClass(path / "Library", 3);
    giveClass(path / "Documents/sub/kept2", 2);
    giveClass(path / "Documents/stronger", 0);
    giveClass(path / "Library/weaker", 4);
    Value set = about(5, 2, 1, data);
    set.set("Key", kClassKey);
    set.set("Value", int64_t{3});
    ASSERT_EQ(code(call(set)), 1u);

    ASSERT_EQ(code(protect("sys.kelp.protect.levels", 1)), 1u);
    for (const char* dir : {"Documents", "Documents/sub", "Library", "tmp"})
        EXPECT_EQ(ownClass(path / dir), 1) << dir;
    EXPECT_EQ(ownClass(path / "Documents/plain"), 1);
    EXPECT_EQ(ownClass(path / "Library/weaker"), 1);
    EXPECT_EQ(ownClass(path / "Documents/sub/kept2"), 2);
    EXPECT_EQ(ownClass(path / "Documents/stronger"), 0);
    EXPECT_FALSE(ownClass(path / ".sys.kelp.berth.metadata.plist"));
    EXPECT_EQ(infoValue(data, kClassKey), Value(int64_t{1}));

    giveClass(path / "Documents/plain", 2);
    writeFile(path / "Documents/fresh", "f");  // inherits 1 until the directory changes
    ASSERT_EQ(code(protect("sys.kelp.protect.levels", 3)), 1u);
    for (const char* dir : {"Documents", "Documents/sub", "Library", "tmp"})
        EXPECT_EQ(ownClass(path / dir), 3) << dir;
    EXPECT_EQ(ownClass(path / "Library/weaker"), 1);
    EXPECT_FALSE(ownClass(path / "Documents/fresh"));
    EXPECT_EQ(infoValue(data, kClassKey), Value(int64_t{3}));
}

// A change that meets a locked device waits for the next unlock; the one
// reply comes after it, and berthctl protect --wait returns only then.
TEST_F(UsageDaemonTest, ALockedDeviceDefersTheChangeUntilUnlock) {
    const Value data = made(2, 1, "sys.kelp.protect.locked");
    const fs::path path = text(data, "ReplyPath");
    writeFile(path / "Documents/secret", "s");
    giveClass(path / "Documents", 1);
    setLocked(true);

    EXPECT_EQ(code(protect("sys.kelp.protect.locked", 3)), 61u);  // no retry asked
    const size_t deferred = logCount("Retrying container protection update to 3 on next unlock");
    auto waiting = std::async(std::launch::async, [] {
        return run(kBerthctl, {"protect", "--class", "2", "--identifier", "sys.kelp.protect.locked",
                               "--wait", "3"});
    });
    ASSERT_TRUE(deferredOnceMore(deferred, 3));
    EXPECT_EQ(waiting.wait_for(std::chrono::milliseconds(500)), std::future_status::timeout);
    EXPECT_EQ(ownClass(path / "Documents"), 1);

    setLocked(false);
    ASSERT_EQ(waiting.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    const Outcome outcome = waiting.get();
    EXPECT_EQ(outcome.status, 0) << outcome.err;
    EXPECT_EQ(ownClass(path / "Documents"), 3);
    EXPECT_EQ(infoValue(data, kClassKey), Value(int64_t{3}));
}

// The container moved (a new directory name, as an update gives it) while
// the change waited: the re-run refuses to touch it and nothing is recorded.
TEST_F(UsageDaemonTest, AContainerMovedBeforeTheDeferredRunFailsWithInvalidPath) {
    const Value data = made(2, 1, "sys.kelp.protect.moved");
    const fs::path path = text(data, "ReplyPath");
    giveClass(path / "Documents", 1);
    setLocked(true);
    const size_t deferred = logCount("Retrying container protection update to 3 on next unlock");
    auto waiting = std::async(std::launch::async, [&] {
        Value message = request(21, 2, 1, "sys.kelp.protect.moved");
        message.set("DataProtectionClass", int64_t{3});
        message.set("RetryIfLocked", true);
        auto own = BerthConnection::connect(daemon_->requestSocket());
        BerthError error;
        return own ? own->request(message, std::chrono::seconds(30), &error) : std::nullopt;
    });
    ASSERT_TRUE(deferredOnceMore(deferred, 3));
    ASSERT_EQ(code(call(about(9, 2, 1, data))), 1u);  // a new directory name
    setLocked(false);
    ASSERT_EQ(waiting.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    const std::optional<Value> reply = waiting.get();
    ASSERT_TRUE(reply);
    EXPECT_EQ(code(*reply), 10u);
    EXPECT_FALSE(infoValue(data, kClassKey));
}

}  // namespace
}  // namespace berth
