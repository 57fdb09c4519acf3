// Removing containers through the real daemon's socket: staging, deleting,
// wiping and regenerating containers, and emptying death row, with what each
// leaves on the scratch device root. Includes a removal raced by a client
// that swaps a directory of the doomed container for a link to the outside,
// and trees deeper than a process can hold descriptors for.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <thread>

#include "DaemonSupport.h"
#include "libberth/BerthConnection.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/NamedSemaphore.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace fs = std::filesystem;

using test::about;
using test::code;
using test::create;
using test::listing;
using test::request;
using test::text;

const fs::path& root() {
    return test::deviceRoot();
}
const bool kRootInstalled = !root().empty();

constexpr const char* kSelf = "sys.kelp.removal.tester";
constexpr const char* kAllowed = "sys.kelp.private.Berth.allowed";
constexpr const char* kOtherIdLookup = "sys.kelp.private.Berth.otherIdLookup";
constexpr const char* kWipeContainer = "sys.kelp.private.Berth.wipeContainer";
using test::kDataClassDirectory;
const fs::path kCachesDirectory = "private/var/root/Library/Caches/sys.kelp.berthd";

fs::path deathRow() {
    return root() / kCachesDirectory / "Dead";
}
fs::path deviceTmp() {
    return root() / "tmp";
}

Value lookUp(uint64_t containerClass, uint64_t user, const std::string& identifier) {
    return create(containerClass, user, identifier, false, false);
}

struct Staged {
    std::vector<Value> users, uuids, identifiers, classes;
};

Value stage(const Staged& s) {
    Value m = Value::dictionary();
    m.set("Command", uint64_t{3});
    m.set("UserIDsArray", Value(s.users));
    m.set("UUIDsArray", Value(s.uuids));
    m.set("IdentifiersArray", Value(s.identifiers));
    m.set("ContainerClassesArray", Value(s.classes));
    return m;
}

fs::path pathOf(const Value& reply) {
    return text(reply, "ReplyPath");
}

// Every item under `top`, relative, sorted; directories end in "/".
std::vector<std::string> tree(const fs::path& top) {
    std::vector<std::string> items;
    std::error_code ec;
    for (auto it = fs::recursive_directory_iterator(top, ec);
         !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
        std::string name = fs::relative(it->path(), top).string();
        if (it->is_directory(ec) && !it->is_symlink(ec)) name += "/";
        items.push_back(name);
    }
    std::sort(items.begin(), items.end());
    return items;
}

bool contains(const std::vector<std::string>& names, const std::string& name) {
    return std::find(names.begin(), names.end(), name) != names.end();
}

// Removes `path` however deep and whatever flags it carries.
void scrub(const fs::path& path) {
    std::system(
        ("chattr -R -ia '" + path.string() + "' 2>/dev/null; rm -rf '" + path.string() + "'")
            .c_str());
}

bool setAppendOnly(const fs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    int flags = 0;
    if (!fd || ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) return false;
    flags |= FS_APPEND_FL;
    return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) == 0;
}

// `count` small files in `directory`, which is made if needed.
void fill(const fs::path& directory, int count) {
    fs::create_directories(directory);
    for (int i = 0; i < count; ++i)
        test::writeFile(directory / ("f" + std::to_string(i)), "contents " + std::to_string(i));
}

class DaemonRemovalTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        ASSERT_TRUE(kRootInstalled);
        signSelf({{kAllowed, true}});
    }

    void TearDown() override {
        daemon_.reset();
        NamedSemaphore::remove("berthd.fb_check");
        scrub(deviceTmp());
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

    // Starts a fresh daemon; with `descriptorLimit`, under that soft limit
    // of open descriptors.
    void start(std::optional<rlim_t> descriptorLimit = std::nullopt) {
        daemon_.reset();
        rlimit saved{};
        ::getrlimit(RLIMIT_NOFILE, &saved);
        if (descriptorLimit) {
            rlimit lowered = saved;
            lowered.rlim_cur = *descriptorLimit;
            ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &lowered), 0);
        }
        daemon_.emplace(root());  // inherits the limit
        ::setrlimit(RLIMIT_NOFILE, &saved);
        ASSERT_TRUE(daemon_->waitUntilServing()) << daemon_->standardError();
        connection_ = BerthConnection::connect(daemon_->requestSocket());
        ASSERT_TRUE(connection_);
        // The start-up emptying of death row runs in the background; the
        // queue is serial, so once this answers it is over and cannot meet
        // what a test puts on death row.
        emptyDeathRow();
    }

    Value call(const Value& message) {
        BerthError error;
        std::optional<Value> reply =
            connection_->request(message, std::chrono::seconds(60), &error);
        EXPECT_TRUE(reply) << error.message;
        return reply ? *reply : Value::dictionary();
    }

    uint64_t emptyDeathRow() { return code(call(request(4, 0, 0))); }

    // Creates a container and checks that it was made.
    Value made(uint64_t containerClass, uint64_t user, const std::string& identifier,
               bool transient = false) {
        const Value reply = call(create(containerClass, user, identifier, transient));
        EXPECT_EQ(code(reply), 1u) << identifier << " " << reply.description();
        return reply;
    }

    std::optional<test::DaemonProcess> daemon_;
    std::unique_ptr<BerthConnection> connection_;
};

TEST_F(DaemonRemovalTest, EmptyingDeathRowMovesWhatItCannotRemoveToTmp) {
    ASSERT_NO_FATAL_FAILURE(start());
    scrub(deviceTmp());
    // An immutable file is no obstacle: its flag is cleared. Nothing can be
    // unlinked from an append-only directory, whose flag stays.
    const fs::path fixable = deathRow() / "temp.fixable/sub";
    fill(fixable, 1);
    ASSERT_TRUE(test::setImmutable(fixable / "f0", true));
    const fs::path blocked = deathRow() / "temp.blocked/appended";
    fill(blocked, 1);
    ASSERT_TRUE(setAppendOnly(blocked));

    // Nowhere to move it: the item stays and the emptying fails with 17.
    EXPECT_EQ(emptyDeathRow(), 17u);
    EXPECT_EQ(listing(deathRow()), std::vector<std::string>{"temp.blocked"});

    // With the device's /tmp present the item leaves death row for it, and
    // so does an item holding a file in an immutable directory.
    fs::create_directories(deviceTmp());
    const fs::path locked = deathRow() / "temp.locked/locked";
    fill(locked, 1);
    ASSERT_TRUE(test::setImmutable(locked, true));
    EXPECT_EQ(emptyDeathRow(), 1u);
    EXPECT_TRUE(listing(deathRow()).empty());
    EXPECT_EQ(test::readFile(deviceTmp() / "temp.blocked/appended/f0"), "contents 0");
    EXPECT_EQ(test::readFile(deviceTmp() / "temp.locked/locked/f0"), "contents 0");

    // No death-row directory at all: nothing to do, and it is made again.
    fs::remove_all(deathRow());
    EXPECT_EQ(emptyDeathRow(), 1u);
    EXPECT_TRUE(fs::is_directory(deathRow()));
}

TEST_F(DaemonRemovalTest, StagingMovesOnlyTheNamedContainersToDeathRow) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value a = made(2, 501, "sys.kelp.stage.a");
    const Value b = made(2, 501, "sys.kelp.stage.b");
    const Value uuidA = *a.find("ReplyUUID");
    const Value uuidB = *b.find("ReplyUUID");
    const Value idA = "sys.kelp.stage.a";
    const Value idB = "sys.kelp.stage.b";
    const Value u = uint64_t{501};
    const Value c = uint64_t{2};

    const struct {
        const char* what;
        Staged request;
        uint64_t expected;
    } untouched[] = {
        {"unknown UUID", {{u}, {Value(Uuid::random())}, {idA}, {c}}, 1},
        {"UUID of another identifier", {{u}, {uuidA}, {idB}, {c}}, 1},
        {"UUID under another class", {{u}, {uuidA}, {idA}, {Value(uint64_t{4})}}, 1},
        {"invalid class", {{Value(uint64_t{1})}, {uuidA}, {idA}, {Value(uint64_t{14})}}, 1},
        {"more UUIDs than classes", {{u, u}, {uuidA, uuidB}, {idA, idB}, {c}}, 11},
        {"more classes than UUIDs", {{u, u}, {uuidA}, {idA, idB}, {c, c}}, 11},
        {"more identifiers", {{u}, {uuidA}, {idA, idB}, {c}}, 11},
        {"more users than classes", {{u, u, u}, {uuidA, uuidB}, {idA, idB}, {c, c}}, 11},
        {"fewer users", {{u}, {uuidA, uuidB}, {idA, idB}, {c, c}}, 11},
    };
    for (const auto& row : untouched) {
        EXPECT_EQ(code(call(stage(row.request))), row.expected) << row.what;
        EXPECT_TRUE(fs::is_directory(pathOf(a))) << row.what;
        EXPECT_EQ(pathOf(call(lookUp(2, 501, "sys.kelp.stage.a"))), pathOf(a)) << row.what;
    }
    Value noIdentifiers = stage({{u}, {uuidA}, {}, {c}});
    noIdentifiers.erase("IdentifiersArray");
    EXPECT_EQ(code(call(noIdentifiers)), 11u);
    EXPECT_TRUE(listing(deathRow()).empty());

    // Both at once: out of their class directory, onto death row under their
    // own names, out of the cache; then destroyed by the emptying.
    ASSERT_EQ(code(call(stage({{u, u}, {uuidA, uuidB}, {idA, idB}, {c, c}}))), 1u);
    const auto staged = listing(deathRow());
    for (const Value* container : {&a, &b}) {
        EXPECT_FALSE(fs::exists(pathOf(*container)));
        EXPECT_TRUE(contains(staged, pathOf(*container).filename()));
        EXPECT_EQ(code(call(lookUp(2, 501, text(*container, "ReplyIdentifier")))), 21u);
    }
    EXPECT_EQ(staged.size(), 2u);
    EXPECT_EQ(emptyDeathRow(), 1u);
    EXPECT_TRUE(listing(deathRow()).empty());
}

TEST_F(DaemonRemovalTest, DeleteStagesOneContainer) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value kept = made(2, 501, "sys.kelp.delete.kept");
    const Value doomed = made(2, 501, "sys.kelp.delete.app");
    test::writeFile(pathOf(doomed) / "Documents/note", "gone soon");
    const Value remove = request(10, 2, 501, "sys.kelp.delete.app");
    ASSERT_EQ(code(call(remove)), 1u);
    EXPECT_FALSE(fs::exists(pathOf(doomed)));
    EXPECT_EQ(listing(deathRow()), std::vector<std::string>{pathOf(doomed).filename()});
    EXPECT_EQ(code(call(lookUp(2, 501, "sys.kelp.delete.app"))), 21u);
    EXPECT_EQ(code(call(about(7, 2, 501, doomed))), 21u);
    EXPECT_EQ(emptyDeathRow(), 1u);
    EXPECT_TRUE(listing(deathRow()).empty());
    // Nothing left to delete.
    EXPECT_EQ(code(call(remove)), 21u);
    EXPECT_EQ(pathOf(call(lookUp(2, 501, "sys.kelp.delete.kept"))), pathOf(kept));
    const auto classDirectory = listing(root() / kDataClassDirectory);
    EXPECT_TRUE(contains(classDirectory, pathOf(kept).filename()));
    EXPECT_FALSE(contains(classDirectory, pathOf(doomed).filename()));

    // A transient container never survives a look-up, this one included: it
    // goes to death row and the deletion finds nothing left to delete.
    const Value transient = made(2, 501, "sys.kelp.delete.transient", true);
    Value removeTransient = request(10, 2, 501, "sys.kelp.delete.transient");
    removeTransient.set("Transient", true);
    EXPECT_EQ(code(call(removeTransient)), 21u);
    EXPECT_FALSE(fs::exists(pathOf(transient)));
    EXPECT_EQ(emptyDeathRow(), 1u);
    EXPECT_TRUE(listing(deathRow()).empty());
}

TEST_F(DaemonRemovalTest, WipeKeepsTheIdentityAndStartsTheContentsAfresh) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value reference = made(2, 501, "sys.kelp.wipe.reference");
    const Value before = made(2, 501, "sys.kelp.wipe.app");
    const fs::path path = pathOf(before);
    test::writeFile(path / "Documents/old", "old");
    fill(path / "Extra/nested", 3);
    fs::remove_all(path / "Library/Preferences");

    ASSERT_EQ(code(call(request(12, 2, 501, "sys.kelp.wipe.app"))), 1u);
    // The contents are those of a new container; the old ones are destroyed.
    EXPECT_EQ(tree(path), tree(pathOf(reference)));
    for (int pass = 0; pass < 2; ++pass) {
        SCOPED_TRACE(pass == 0 ? "after the wipe" : "after a restart");
        if (pass == 1) {
            ASSERT_NO_FATAL_FAILURE(start());
        }
        const Value after = call(lookUp(2, 501, "sys.kelp.wipe.app"));
        ASSERT_EQ(code(after), 1u);
        EXPECT_EQ(*after.find("ReplyUUID"), *before.find("ReplyUUID"));
        EXPECT_EQ(pathOf(after), path);
        const Value metadata = call(about(7, 2, 501, before));
        ASSERT_EQ(code(metadata), 1u);
        EXPECT_EQ(pathOf(metadata), path);
        EXPECT_EQ(*metadata.find("ReplyTransient"), Value(false));
    }
    EXPECT_EQ(emptyDeathRow(), 1u);
    EXPECT_TRUE(listing(deathRow()).empty());
    EXPECT_TRUE(listing(root() / kCachesDirectory / "Staging").empty());
    EXPECT_TRUE(listing(root() / kCachesDirectory / "Temp").empty());

    // Not a data class, no such container, no identifier.
    const Value system = made(12, 499, "sys.kelp.wipe.system");
    test::writeFile(pathOf(system) / "kept", "kept");
    EXPECT_EQ(code(call(request(12, 12, 499, "sys.kelp.wipe.system"))), 11u);
    EXPECT_EQ(code(call(request(12, 1, 33, "sys.kelp.wipe.bundle"))), 11u);
    EXPECT_EQ(test::readFile(pathOf(system) / "kept"), "kept");
    EXPECT_EQ(code(call(request(12, 2, 501, "sys.kelp.wipe.absent"))), 21u);
    EXPECT_EQ(code(call(request(12, 2, 501))), 18u);
}

TEST_F(DaemonRemovalTest, PluginWipeNeedsTheIdentifierInTheWipeEntitlement) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value mine = made(4, 501, "sys.kelp.plugin.mine");
    const Value theirs = made(4, 501, "sys.kelp.plugin.theirs");
    EXPECT_EQ(pathOf(mine).parent_path().filename(), "SprocketPlugin");
    for (const Value* container : {&mine, &theirs})
        test::writeFile(pathOf(*container) / "Documents/data", "data");
    Value list = Value::array();
    list.push("sys.kelp.plugin.mine");

    const struct {
        const char* what;
        std::vector<std::pair<const char*, Value>> entitlements;
        uint64_t command;
        const char* identifier;
        uint64_t expected;
    } refused[] = {
        {"identifier not listed", {{kWipeContainer, list}}, 11, "sys.kelp.plugin.theirs", 55},
        // Command 11 never looks beyond the list, whoever asks.
        {"listed, with other look-ups",
         {{kWipeContainer, list}, {kOtherIdLookup, true}},
         11,
         "sys.kelp.plugin.theirs",
         55},
        {"\".allowed\" without a list", {{kAllowed, true}}, 11, "sys.kelp.plugin.mine", 55},
        {"no entitlements", {}, 11, "sys.kelp.plugin.mine", 55},
        {"list not an array",
         {{kWipeContainer, "sys.kelp.plugin.mine"}},
         11,
         "sys.kelp.plugin.mine",
         55},
        // Command 12 needs ".allowed" whatever the list says.
        {"command 12", {{kWipeContainer, list}}, 12, "sys.kelp.plugin.mine", 55},
    };
    for (const auto& row : refused) {
        ASSERT_NO_FATAL_FAILURE(signSelf(row.entitlements));
        EXPECT_EQ(code(call(request(row.command, 4, 501, row.identifier))), row.expected)
            << row.what;
        for (const Value* container : {&mine, &theirs})
            EXPECT_EQ(test::readFile(pathOf(*container) / "Documents/data"), "data") << row.what;
    }

    ASSERT_NO_FATAL_FAILURE(signSelf({{kWipeContainer, list}}));
    ASSERT_EQ(code(call(request(11, 4, 501, "sys.kelp.plugin.mine"))), 1u);
    EXPECT_FALSE(fs::exists(pathOf(mine) / "Documents/data"));
    EXPECT_TRUE(fs::is_directory(pathOf(mine) / "Documents"));
    EXPECT_EQ(test::readFile(pathOf(theirs) / "Documents/data"), "data");

    ASSERT_NO_FATAL_FAILURE(signSelf({{kAllowed, true}}));
    const Value after = call(lookUp(4, 501, "sys.kelp.plugin.mine"));
    EXPECT_EQ(*after.find("ReplyUUID"), *mine.find("ReplyUUID"));
    EXPECT_EQ(pathOf(after), pathOf(mine));
}

TEST_F(DaemonRemovalTest, RegenerationRenamesTheDirectoryOnly) {
    ASSERT_NO_FATAL_FAILURE(start());
    const Value before = made(2, 501, "sys.kelp.regenerate.app");
    const fs::path oldPath = pathOf(before);
    test::writeFile(oldPath / "Documents/kept", "kept");
    const auto contents = tree(oldPath);

    ASSERT_EQ(code(call(about(9, 2, 501, before))), 1u);
    const Value after = call(lookUp(2, 501, "sys.kelp.regenerate.app"));
    ASSERT_EQ(code(after), 1u);
    const fs::path newPath = pathOf(after);
    EXPECT_EQ(*after.find("ReplyUUID"), *before.find("ReplyUUID"));
    EXPECT_NE(newPath, oldPath);
    EXPECT_EQ(newPath.parent_path(), oldPath.parent_path());
    EXPECT_TRUE(Uuid::parse(newPath.filename().string()));
    EXPECT_FALSE(fs::exists(oldPath));
    EXPECT_EQ(tree(newPath), contents);
    EXPECT_EQ(pathOf(call(about(7, 2, 501, before))), newPath);

    // Another UUID: not found, nothing moves.
    Value wrong = about(9, 2, 501, before);
    wrong.set("UUID", Uuid::random());
    EXPECT_EQ(code(call(wrong)), 21u);
    EXPECT_TRUE(fs::is_directory(newPath));

    // A well-known system container lives under its fixed name and keeps it.
    const Value system = made(12, 499, "sys.kelp.lanternd");
    ASSERT_EQ(pathOf(system).filename(), "sys.kelp.lanternd");
    EXPECT_EQ(code(call(about(9, 12, 499, system))), 11u);
    EXPECT_TRUE(fs::is_directory(pathOf(system)));
    EXPECT_EQ(pathOf(call(lookUp(12, 499, "sys.kelp.lanternd"))), pathOf(system));
}

// Swaps <documents>/deep with a link to `outside`, over and over, through a
// descriptor of the documents directory, so that it follows that directory
// wherever the daemon moves the container. When the removal has taken one of
// the two names away, a new link takes its place.
class LinkSwapper {
  public:
    LinkSwapper(const fs::path& documents, const fs::path& outside)
        : dir_(::open(documents.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)),
          target_(outside.string()) {
        if (::symlinkat(target_.c_str(), dir_.get(), "deep.link") != 0) return;
        thread_ = std::thread([this] { run(); });
    }
    ~LinkSwapper() { stop(); }

    bool running() const { return thread_.joinable(); }
    // Stops and returns how many swaps were made.
    size_t stop() {
        stop_ = true;
        if (thread_.joinable()) thread_.join();
        return swaps_;
    }

  private:
    void run() {
        while (!stop_) {
            if (::renameat2(dir_.get(), "deep", dir_.get(), "deep.link", RENAME_EXCHANGE) == 0) {
                ++swaps_;
                continue;
            }
            ::symlinkat(target_.c_str(), dir_.get(), "deep");
            ::symlinkat(target_.c_str(), dir_.get(), "deep.link");
        }
    }

    UniqueFd dir_;
    std::string target_;
    std::atomic<bool> stop_{false};
    size_t swaps_ = 0;
    std::thread thread_;
};

TEST_F(DaemonRemovalTest, RemovalNeverFollowsALinkSwappedIn) {
    constexpr int kFiles = 1000;
    ASSERT_NO_FATAL_FAILURE(start());
    fs::create_directories(deviceTmp());
    // The outside directory holds files of the same names as the doomed
    // one: an unlink by path through the swapped name would take them.
    const fs::path outside = root() / "private/var/mobile/Outside";
    fill(outside, kFiles);
    test::writeFile(outside / "canary", "alive");
    const auto outsideBefore = tree(outside);

    for (const uint64_t command : {12, 10}) {
        for (int round = 0; round < 3; ++round) {
            SCOPED_TRACE("command " + std::to_string(command) + ", round " + std::to_string(round));
            const Value container = made(2, 501, "sys.kelp.race.app");
            const fs::path documents = pathOf(container) / "Documents";
            fill(documents / "deep", kFiles);
            test::writeFile(documents / "deep/canary", "doomed");

            LinkSwapper swapper(documents, outside);
            ASSERT_TRUE(swapper.running());
            EXPECT_EQ(code(call(request(command, 2, 501, "sys.kelp.race.app"))), 1u);
            // The emptying runs on one serial queue: once this answers, any
            // emptying the wipe started has finished too.
            EXPECT_EQ(emptyDeathRow(), 1u);
            EXPECT_GT(swapper.stop(), 0u);

            EXPECT_EQ(test::readFile(outside / "canary"), "alive");
            EXPECT_EQ(tree(outside), outsideBefore);
            // Whatever the swapper left behind goes with the next emptying.
            EXPECT_EQ(emptyDeathRow(), 1u);
            EXPECT_TRUE(listing(deathRow()).empty());
            if (command == 10) {
                EXPECT_FALSE(fs::exists(pathOf(container)));
            }
            scrub(deviceTmp());
            fs::create_directories(deviceTmp());
        }
    }
    EXPECT_EQ(code(call(request(10, 2, 501, "sys.kelp.race.app"))), 21u);
}

// A chain of `depth` directories named "d" under `top`, built through
// descriptors since its full path is far longer than PATH_MAX.
void buildChain(const fs::path& top, int depth) {
    UniqueFd dir(::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(dir);
    for (int level = 0; level < depth; ++level) {
        ASSERT_EQ(::mkdirat(dir.get(), "d", 0755), 0) << level;
        UniqueFd next(::openat(dir.get(), "d", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
        ASSERT_TRUE(next) << level;
        dir = std::move(next);
    }
    UniqueFd bottom(::openat(dir.get(), "bottom", O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
    ASSERT_TRUE(bottom);
}

TEST_F(DaemonRemovalTest, DeepTreesAreDestroyed) {
    constexpr int kDepth = 5000;
    // Under the daemon's own limits, and under a descriptor limit well below
    // the depth of the tree (the soft limit a service gets by default).
    for (const std::optional<rlim_t> limit :
         {std::optional<rlim_t>(), std::optional<rlim_t>(1024)}) {
        SCOPED_TRACE(limit ? "1024 descriptors" : "inherited descriptor limit");
        ASSERT_NO_FATAL_FAILURE(start(limit));
        scrub(deviceTmp());
        fs::create_directories(deviceTmp());
        const Value container = made(2, 501, "sys.kelp.deep.app");
        ASSERT_NO_FATAL_FAILURE(buildChain(pathOf(container) / "Documents", kDepth));

        ASSERT_EQ(code(call(request(10, 2, 501, "sys.kelp.deep.app"))), 1u);
        EXPECT_EQ(emptyDeathRow(), 1u);
        EXPECT_TRUE(listing(deathRow()).empty());
        EXPECT_FALSE(fs::exists(pathOf(container)));
        // Destroyed, not moved aside.
        EXPECT_EQ(listing(deviceTmp()), std::vector<std::string>{})
            << "the tree could not be removed and was moved to the device's /tmp";
        scrub(deviceTmp());
    }
}

}  // namespace
}  // namespace berth
