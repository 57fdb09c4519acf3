// A reply to a create is durable: every container whose creation was answered
// is there after the daemon dies right after the reply, with concurrent
// creations in flight, and starts again.
//
// Two ways to die, and what each can prove:
//   - SIGKILL alone. The page cache survives a killed process, so this proves
//     that the reply comes after the rename into place and after the cache
//     update a restart rebuilds from disk, and that a kill in the middle of
//     concurrent creations leaves nothing the next start cannot clean up. It
//     cannot tell a synced container from one that is only in memory.
//   - A power cut: the device root is an ext4 file system on a loop device,
//     mounted with a 60-second journal commit interval, and right after the
//     reply the test shuts the file system down without flushing its journal
//     (what the file system's own shutdown request does for crash testing),
//     then kills the daemon. Only what an fsync committed before the cut is
//     there after remounting, so a container whose class directory was not
//     synced after its rename is lost. Checked by hand: with the wait for the class directory's
//     sync removed from creation, this test failed in 3 runs of 3 ("... is gone"). It needs loop
//     devices and ext4; without them it is skipped. What it cannot prove: a disk that lies about
//     its cache flush, and orderings that ext4's journal hides. One journal commit carries every
//     change made before it, so a missing sync of the staged tree is covered
//     by the class directory's sync after the rename, and an unsynced
//     container made just before another request's fsync survives by luck;
//     only the last replies before each cut have no later fsync to lean on.
#include <fcntl.h>
#include <linux/ioctl.h>
#include <sched.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/mount.h>

#include <chrono>
#include <thread>

#include "BTHPropertyListFile.h"
#include "DaemonSupport.h"
#include "core/BTHContainerClass.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

constexpr const char* kSelf = "sys.kelp.durable.tester";
constexpr uint64_t kDataClass = 2;
constexpr uint64_t kMobile = 501;
constexpr int kClients = 8;
constexpr int kRounds = 3;
constexpr size_t kRepliesBeforeCut = 24;

// The file system's shutdown request ('X', 125): flag 2 stops it at once
// without writing out its journal, as a power cut would.
constexpr unsigned long kShutdownRequest = _IOR('X', 125, uint32_t);
constexpr uint32_t kShutdownWithoutJournalFlush = 2;

struct Replied {
    std::string identifier;
    Value uuid;
    std::string path;
};

// The device root on a file system of its own that the test can cut power
// to: an ext4 image holding a copy of the scratch root, mounted over it in
// this program's private mount namespace.
class PowerCutVolume {
  public:
    PowerCutVolume() : image_(scratch_ / "device.ext4") {}
    ~PowerCutVolume() {
        if (mounted_) ::umount2(deviceRoot().c_str(), MNT_DETACH);
    }

    // Empty when mounted, else why not. Needs a private mount namespace.
    std::string mount() {
        const char* mkfs =
            fs::exists("/sbin/mkfs.ext4") ? "/sbin/mkfs.ext4" : "/usr/sbin/mkfs.ext4";
        Outcome made =
            run(mkfs, {"-q", "-F", "-d", deviceRoot().string(), image_.string(), "128M"});
        if (made.status != 0) return "mkfs.ext4 failed: " + made.err;
        return attach();
    }

    // Stops the file system as a power cut would: nothing written after the
    // last journal commit reaches the image.
    void cut() {
        UniqueFd root(::open(deviceRoot().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        uint32_t flags = kShutdownWithoutJournalFlush;
        ASSERT_EQ(::ioctl(root.get(), kShutdownRequest, &flags), 0) << strerror(errno);
    }

    // Unmounts the dead file system and mounts the image again, replaying
    // its journal as the next boot would.
    std::string remount() {
        // A dead daemon's ring of batched syncs is torn down by the kernel
        // after the process is gone, and holds the files it was syncing (so
        // the mount) until then: busy for a moment, not for good.
        for (int attempt = 0; ::umount2(deviceRoot().c_str(), 0) != 0; ++attempt) {
            if (errno != EBUSY || attempt == 100)
                return std::string("umount failed: ") + strerror(errno);
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
        }
        mounted_ = false;
        return attach();
    }

  private:
    std::string attach() {
        Outcome mounted =
            run("/bin/mount", {"-o", "loop,commit=60", image_.string(), deviceRoot().string()});
        if (mounted.status != 0) return "loop mount failed: " + mounted.err;
        mounted_ = true;
        return "";
    }

    ScratchDir scratch_;
    fs::path image_;
    bool mounted_ = false;
};

class DaemonDurableCreate : public DaemonFixture {
  protected:
    // The power-cut volume's mounts stay in this program: a private mount
    // namespace, made while the program has one thread.
    static void SetUpTestSuite() {
        if (::geteuid() != 0) return;
        if (::unshare(CLONE_NEWNS) != 0 ||
            ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
            namespaceError_ = strerror(errno);
        else
            privateNamespace_ = true;
    }

    static inline bool privateNamespace_ = false;
    static inline std::string namespaceError_;

    void SetUp() override {
        DaemonFixture::SetUp();
        if (!IsSkipped() && !HasFatalFailure())
            signSelf(kSelf, dict({{"sys.kelp.private.Berth.otherIdLookup", true}}));
    }

    // Creates containers from kClients connections at once until
    // kRepliesBeforeCut replies have come, then `die`s the daemon from the
    // thread of the last reply. The replies that came before.
    std::vector<Replied> createUntilDeath(const std::string& prefix, int round,
                                          const std::function<void()>& die) {
        std::mutex mutex;
        std::vector<Replied> replied;
        bool dead = false;
        std::vector<std::thread> clients;
        for (int c = 0; c < kClients; ++c) {
            clients.emplace_back([&, c] {
                std::unique_ptr<BerthConnection> connection =
                    BerthConnection::connect(daemon_->requestSocket());
                for (int n = 0; connection; ++n) {
                    const std::string identifier = prefix + std::to_string(round) + "." +
                                                   std::to_string(c) + "." + std::to_string(n);
                    std::optional<Value> reply = connection->request(
                        create(kDataClass, kMobile, identifier), std::chrono::seconds(20), nullptr);
                    std::lock_guard<std::mutex> lock(mutex);
                    if (!reply || dead) return;
                    EXPECT_EQ(code(*reply), 1u) << identifier;
                    replied.push_back(
                        {identifier, *reply->find("ReplyUUID"), text(*reply, "ReplyPath")});
                    if (replied.size() == kRepliesBeforeCut) {
                        die();
                        dead = true;
                    }
                }
            });
        }
        for (std::thread& client : clients) client.join();
        EXPECT_TRUE(dead) << "the daemon never answered " << kRepliesBeforeCut << " creates";
        return replied;
    }

    // Every container replied so far is found by a fresh daemon, unchanged,
    // and its metadata file names it.
    void expectAllThere(const std::vector<Replied>& replied) {
        for (const Replied& container : replied) {
            const Value reply = call(create(kDataClass, kMobile, container.identifier,
                                            /*transient=*/false, /*createIfNecessary=*/false));
            ASSERT_EQ(code(reply), 1u) << container.identifier << " is gone";
            EXPECT_EQ(text(reply, "ReplyPath"), container.path);
            EXPECT_EQ(*reply.find("ReplyUUID"), container.uuid);
            const Value* existed = reply.find("ReplyExisted");
            EXPECT_TRUE(existed && existed->boolValue() && *existed->boolValue());

            std::optional<Value> metadata = BTH_dictionaryWithContentsOfURL(
                fs::path(container.path) / kBTHMetadataFileName, 0, nullptr);
            ASSERT_TRUE(metadata) << container.path;
            for (const char* subdirectory : {"Documents", "Library/Caches", "tmp"})
                EXPECT_TRUE(fs::is_directory(fs::path(container.path) / subdirectory))
                    << container.path << " lost " << subdirectory;
            EXPECT_EQ(text(*metadata, "BTHMetadataIdentifier"), container.identifier);
            const Value* uuid = metadata->find("BTHMetadataUUID");
            ASSERT_TRUE(uuid && uuid->string() && container.uuid.uuid());
            EXPECT_EQ(Uuid::parse(*uuid->string()), *container.uuid.uuid());
        }
        // The creations cut short left nothing in staging after the start.
        EXPECT_TRUE(listing(deviceRoot() / kStagingDirectory).empty());
    }
};

TEST_F(DaemonDurableCreate, KillRightAfterCreateRepliesKeepsEveryRepliedContainer) {
    std::vector<Replied> all;
    for (int round = 0; round < kRounds; ++round) {
        start();
        if (HasFatalFailure()) return;
        const std::vector<Replied> replied = createUntilDeath(
            "sys.kelp.killed.", round, [&] { ASSERT_TRUE(daemon_->stop(SIGKILL)); });
        all.insert(all.end(), replied.begin(), replied.end());
        start();
        if (HasFatalFailure()) return;
        expectAllThere(all);
    }
}

TEST_F(DaemonDurableCreate, PowerCutRightAfterCreateRepliesKeepsEveryRepliedContainer) {
    if (!privateNamespace_) GTEST_SKIP() << "no private mount namespace: " << namespaceError_;
    PowerCutVolume volume;
    const std::string unavailable = volume.mount();
    if (!unavailable.empty()) GTEST_SKIP() << "no power-cut volume: " << unavailable;
    std::vector<Replied> all;
    for (int round = 0; round < kRounds; ++round) {
        start();
        if (HasFatalFailure()) return;
        const std::vector<Replied> replied = createUntilDeath("sys.kelp.cut.", round, [&] {
            volume.cut();
            ASSERT_TRUE(daemon_->stop(SIGKILL));
        });
        connection_.reset();  // nothing of the test may keep the volume busy
        all.insert(all.end(), replied.begin(), replied.end());
        ASSERT_EQ(volume.remount(), "");
        start();
        if (HasFatalFailure()) return;
        expectAllThere(all);
    }
}

}  // namespace
}  // namespace berth
