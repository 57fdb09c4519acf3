// An old device brought up to date: a device root laid out as an older build
// left it is started as after a reboot into a new build, then asked for the
// data migration. Every moved file and every look-up is checked through the
// socket; a second start changes nothing; a daemon killed at any migration
// step and started again ends where the uninterrupted run ends.
#include <sys/stat.h>

#include <fstream>
#include <regex>

#include "BTHPropertyListFile.h"
#include "DaemonSupport.h"
#include "core/BTHContainerClass.h"
#include "core/Commands.h"
#include "core/Uuid.h"
#include "platform/NamedSemaphore.h"

namespace berth::test {
namespace {

namespace fs = std::filesystem;

constexpr const char* kSelf = "sys.kelp.migration.tester";
const fs::path kLibrary = "private/var/root/Library/Berth";
const fs::path kMobile = "private/var/mobile";
const fs::path kSystemClass = "private/var/containers/Data/System";
const fs::path kBundles = "private/var/containers/Bundle";
const fs::path kOldBundles = "private/var/mobile/Containers/Bundle";

void writeOsRelease(const std::string& build) {
    writeFile(deviceRoot() / "etc/os-release",
              "NAME=\"Berth OS\"\nBUILD_ID=" + build + "\nRELEASE_TYPE=User\n");
}

void rebootDevice() {
    NamedSemaphore::remove("berthd.fb_check");
}

// Copies `from` to `to` keeping owners, modes, links and access lists.
void copyTree(const fs::path& from, const fs::path& to) {
    fs::remove_all(to);
    fs::create_directories(to.parent_path());
    const Outcome copied = run("/bin/cp", {"-a", from.string(), to.string()});
    ASSERT_EQ(copied.status, 0) << copied.err;
}

// One line per item below the device root's "private": path, kind, mode,
// owner and contents, with what legitimately differs between two runs left
// out: UUIDs (directory names and metadata), times in state files, the
// daemon's own log, and the background directories that only ever empty.
std::vector<std::string> snapshot() {
    static const std::regex uuid(
        "[0-9A-Fa-f]{8}-[0-9A-Fa-f]{4}-[0-9A-Fa-f]{4}-[0-9A-Fa-f]{4}-[0-9A-Fa-f]{12}");
    const fs::path top = deviceRoot() / "private";
    std::vector<std::string> lines;
    for (auto it = fs::recursive_directory_iterator(top); it != fs::recursive_directory_iterator();
         ++it) {
        const fs::path relative = fs::relative(it->path(), deviceRoot());
        const std::string name = relative.string();
        if (name.find("Library/Logs/Berth") != std::string::npos ||
            name.find("Caches/sys.kelp.berthd/Dead") != std::string::npos) {
            it.disable_recursion_pending();
            continue;
        }
        const struct stat st = lstatOf(it->path());
        std::string line = std::regex_replace(name, uuid, "<uuid>") + " " +
                           std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" +
                           std::to_string(st.st_gid);
        if (S_ISREG(st.st_mode)) {
            std::optional<Value> plist = BTH_dictionaryWithContentsOfURL(it->path(), 0, nullptr);
            if (plist && it->path().filename() == "bth_migration_status.plist") {
                for (const auto& [key, value] : *plist->dictionaryValue()) line += " " + key;
            } else if (plist) {
                line += " " + std::regex_replace(plist->description(), uuid, "<uuid>");
            } else {
                line += " " + readFile(it->path());
            }
        }
        lines.push_back(std::move(line));
    }
    std::sort(lines.begin(), lines.end());
    return lines;
}

class DaemonMigrationTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        signSelf(kSelf, dict({{kBTHEntitlementAllowed, true}}));
        writeDeviceProperties(dict({}));
        ASSERT_NO_FATAL_FAILURE(layOutOldDevice());
    }

    void TearDown() override {
        DaemonFixture::TearDown();
        fs::remove_all(template_);
    }

    Value setInfo(uint64_t containerClass, uint64_t user, const Value& container, const char* key,
                  const Value& value) {
        Value set = about(5, containerClass, user, container);
        set.set("Key", key);
        set.set("Value", value);
        return call(set);
    }

    // The device as an older build leaves it. Made once per test with an
    // older daemon's own requests, then rearranged where the older build
    // kept things elsewhere; kept in `template_` so that every run starts
    // from the same bytes.
    void layOutOldDevice() {
        writeOsRelease("OLD1");
        ASSERT_NO_FATAL_FAILURE(start());
        const Value app = call(create(2, 501, "legacy.app"));
        ASSERT_EQ(code(setInfo(2, 501, app, "sys.kelp.Lading.GroupContainerIDs",
                               Value(Value::Array{Value("group.legacy")}))),
                  1u);
        const Value bundle = call(create(1, 33, "legacy.bundle"));
        ASSERT_EQ(code(setInfo(1, 33, bundle, "sys.kelp.Lading.CachedCodeSigningInfo",
                               dict({{"Entitlements", dict({{"cached.right", true}})}}))),
                  1u);
        bundlePath_ = text(bundle, "ReplyPath");
        const Value lantern = call(create(12, 499, "sys.kelp.lanternd"));
        ASSERT_EQ(code(lantern), 1u);
        daemon_->stop(SIGKILL);

        const fs::path root = deviceRoot();
        // The well-known system container under a UUID name.
        fs::rename(root / kSystemClass / "sys.kelp.lanternd",
                   root / kSystemClass / Uuid::random().string());
        // The bundle containers at their old place.
        fs::create_directories(root / kOldBundles.parent_path());
        fs::rename(root / kBundles, root / kOldBundles);
        // Old per-user library and log, older markers, the legacy file.
        fs::create_directories(root / kMobile / "Library/Berth/cache");
        fs::create_directories(root / kMobile / "Library/Logs/Berth");
        writeFile(root / kMobile / "Library/Logs/Berth/berthd.log.0", "old log 0");
        writeFile(root / kMobile / "Library/Logs/Berth/berthd.log.3", "too old");
        fs::remove(root / kLibrary / "bth_migration_status.plist");
        ASSERT_TRUE(BTH_writeToURL(dict({}), root / kLibrary / "bth_acl2_migration_complete.plist",
                                   0, nullptr));
        ASSERT_TRUE(BTH_writeToURL(dict({{"legacy.file.app", dict({{"legacy.right", true}})},
                                         {"sys.kelp.Berth.EntitlementsRegisteredByCaller",
                                          dict({{"legacy.file.app", true}})}}),
                                   root / kLibrary / "bth_entitlements.plist", 0, nullptr));
        // Prepared system containers, one of them with a link to refuse.
        const fs::path backup = root / kMobile / "Library/Backup/SystemContainers";
        fs::create_directories(backup / "Data/sys.kelp.quarryd");
        writeFile(backup / "Data/sys.kelp.quarryd/restored", "from backup");
        fs::create_symlink("/etc/shadow", backup / "Data/sys.kelp.quarryd/escape");
        fs::create_directories(backup / "Shared/systemgroup.sys.kelp.tidewater");
        writeFile(backup / "Shared/systemgroup.sys.kelp.tidewater/tide", "high");
        // Data no container owns.
        fs::create_directories(root / kDataClassDirectory / "stray");
        writeOsRelease("NEW2");
        ASSERT_NO_FATAL_FAILURE(copyTree(root / "private", template_ / "private"));
    }

    void restoreOldDevice() {
        ASSERT_NO_FATAL_FAILURE(copyTree(template_ / "private", deviceRoot() / "private"));
        rebootDevice();
    }

    // The first start of the new build, then the data migration.
    void upgrade(const std::string& startFault = "", const std::string& migrationFault = "") {
        if (!startFault.empty()) {
            DaemonProcess crashed(deviceRoot(), {{"BERTH_TEST_FAULTS", startFault}});
            EXPECT_EQ(crashed.waitForExit(), 128 + SIGKILL) << startFault;
        }
        ASSERT_NO_FATAL_FAILURE(start());
        if (!migrationFault.empty()) {
            connection_.reset();
            daemon_.reset();
            ASSERT_NO_FATAL_FAILURE(start({{"BERTH_TEST_FAULTS", migrationFault}}));
            BerthError lost;
            EXPECT_FALSE(connection_->request(dict({{"Command", uint64_t{24}}}),
                                              std::chrono::seconds(20), &lost));
            EXPECT_EQ(daemon_->waitForExit(), 128 + SIGKILL) << migrationFault;
            ASSERT_NO_FATAL_FAILURE(start());
        }
        ASSERT_EQ(code(call(dict({{"Command", uint64_t{24}}}))), 1u);
        ASSERT_TRUE(deathRowEmpties());
    }

    const fs::path template_ =
        fs::path("/tmp") / ("berth-old-device-" + std::to_string(::getpid()));
    fs::path bundlePath_;
};

TEST_F(DaemonMigrationTest, AnOldDeviceEndsInPlaceAndASecondStartChangesNothing) {
    ASSERT_NO_FATAL_FAILURE(restoreOldDevice());
    ASSERT_NO_FATAL_FAILURE(upgrade());
    const fs::path root = deviceRoot();

    // Build upgrade: the well-known container at its fixed name, found there.
    const Value lantern = call(create(12, 499, "sys.kelp.lanternd"));
    EXPECT_EQ(text(lantern, "ReplyPath"), (root / kSystemClass / "sys.kelp.lanternd").string());
    EXPECT_EQ(listing(root / kSystemClass),
              (std::vector<std::string>{"sys.kelp.lanternd", "sys.kelp.quarryd"}));
    // The bundle containers in the system area, owned by the installer.
    EXPECT_FALSE(fs::exists(root / kOldBundles));
    const Value bundle = call(create(1, 33, "legacy.bundle", false, false));
    EXPECT_EQ(code(bundle), 1u);
    EXPECT_EQ(text(bundle, "ReplyPath"), bundlePath_.string());
    EXPECT_EQ(lstatOf(bundlePath_).st_uid, 33u);
    // Log files one number up in the daemon's log directory; the too old gone.
    EXPECT_EQ(readFile(root / "private/var/root/Library/Logs/Berth/berthd.log.1"), "old log 0");
    EXPECT_FALSE(fs::exists(root / kMobile / "Library/Logs/Berth"));
    EXPECT_FALSE(fs::exists(root / kMobile / "Library/Berth"));
    // Installed system containers; the link refused; the backup gone.
    EXPECT_EQ(readFile(root / kSystemClass / "sys.kelp.quarryd/restored"), "from backup");
    EXPECT_FALSE(fs::exists(fs::symlink_status(root / kSystemClass / "sys.kelp.quarryd/escape")));
    EXPECT_EQ(readFile(root / "private/var/containers/Shared/SystemGroup/"
                              "systemgroup.sys.kelp.tidewater/tide"),
              "high");
    EXPECT_FALSE(fs::exists(root / kMobile / "Library/Backup/SystemContainers"));
    EXPECT_FALSE(fs::exists(root / kDataClassDirectory / "stray"));

    // Data migration: the older code-signing records are in the store.
    const Value legacyFile =
        call(dict({{"Command", uint64_t{19}}, {"Identifier", "legacy.file.app"}}));
    EXPECT_EQ(code(legacyFile), 1u);
    const Value cached = call(dict({{"Command", uint64_t{19}}, {"Identifier", "legacy.bundle"}}));
    ASSERT_EQ(code(cached), 1u);
    EXPECT_TRUE(cached.find("ReplyInfoDictionary"));
    // The group list made an invalid entry, which queries do not show.
    EXPECT_EQ(code(call(dict({{"Command", uint64_t{19}}, {"Identifier", "legacy.app"}}))), 21u);
    EXPECT_FALSE(fs::exists(root / kLibrary / "bth_entitlements.plist"));
    EXPECT_FALSE(fs::exists(root / kLibrary / "bth_acl2_migration_complete.plist"));
    const auto status =
        BTH_dictionaryWithContentsOfURL(root / kLibrary / "bth_migration_status.plist", 0, nullptr);
    ASSERT_TRUE(status);
    for (const char* key : {"ACLMigration", "BundleMigration", "GroupIdMigration",
                            "CodeSigningMigration", "LastBuildInfo"})
        EXPECT_TRUE(status->find(key)) << key;

    // A reboot into the same build, and the same migration asked again.
    const std::vector<std::string> before = snapshot();
    connection_.reset();
    daemon_.reset();
    rebootDevice();
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_EQ(code(call(dict({{"Command", uint64_t{24}}}))), 1u);
    ASSERT_TRUE(deathRowEmpties());
    EXPECT_EQ(snapshot(), before);
}

// Every step of the migration, killed there and started again, ends where
// the uninterrupted run ends.
TEST_F(DaemonMigrationTest, AKillAtAnyStepEndsWhereTheUninterruptedRunEnds) {
    ASSERT_NO_FATAL_FAILURE(restoreOldDevice());
    ASSERT_NO_FATAL_FAILURE(upgrade());
    const std::vector<std::string> expected = snapshot();
    connection_.reset();
    daemon_.reset();

    const std::pair<const char*, const char*> kills[] = {
        {"migration.after-user-directories", ""},
        {"migration.after-bundle-move", ""},
        {"migration.whitelist.after-move", ""},
        {"first-boot.after-build-upgrade-migration", ""},
        {"first-boot.after-regenerate", ""},
        {"install.after-inprogress", ""},
        {"install.after-item", ""},
        {"", "migration.data.after-acl"},
        {"", "migration.data.after-ownership"},
    };
    for (const auto& [startFault, migrationFault] : kills) {
        SCOPED_TRACE(std::string(startFault) + migrationFault);
        ASSERT_NO_FATAL_FAILURE(restoreOldDevice());
        ASSERT_NO_FATAL_FAILURE(upgrade(startFault, migrationFault));
        EXPECT_EQ(snapshot(), expected);
        connection_.reset();
        daemon_.reset();
    }
}

TEST_F(DaemonMigrationTest, DamagedStateIsLoggedAndTheDaemonServes) {
    ASSERT_NO_FATAL_FAILURE(restoreOldDevice());
    const fs::path root = deviceRoot();
    writeFile(root / kLibrary / "bth_migration_status.plist", "not a dictionary");
    writeFile(root / kLibrary / "bth_entitlements.plist", "\x01\x02 not a property list");
    ASSERT_NO_FATAL_FAILURE(start());
    ASSERT_EQ(code(call(dict({{"Command", uint64_t{24}}}))), 1u);
    const std::string log = daemonLog();
    EXPECT_NE(log.find("Migration status cannot be read"), std::string::npos);
    EXPECT_NE(log.find("but we unexpectedly cant read it"), std::string::npos);
    EXPECT_TRUE(fs::exists(root / kLibrary / "bth_entitlements.plist"));
    // The migration itself still ran, and requests are served.
    EXPECT_EQ(text(call(create(12, 499, "sys.kelp.lanternd")), "ReplyPath"),
              (root / kSystemClass / "sys.kelp.lanternd").string());
    EXPECT_EQ(code(call(create(2, 501, "after.damage"))), 1u);
}

}  // namespace
}  // namespace berth::test
