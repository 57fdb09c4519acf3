// Access control lists and ownership of container trees: the lists a
// standardized tree carries, what they let a member and a non-member of
// "systemusers" really do, plain ownership, planted links, and a group that
// cannot be resolved.
#include <acl/libacl.h>
#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <sys/acl.h>

#include <sstream>

#include "BTHFileManager+Internal.h"
#include "BTHMetadata.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using filemanager::UniqueAcl;
using namespace test;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

constexpr uid_t kNobody = 65534;
// libacl's text of the lists, with numeric ids ("systemusers" is 510).
constexpr const char* kTopAccess = "user::rwx,group::r-x,group:510:-wx,mask::rwx,other::r-x";
constexpr const char* kItemAccess = "user::---,group::---,group:510:rwx,mask::rwx,other::---";
constexpr const char* kInherited = "user::rwx,group::---,group:510:rwx,mask::rwx,other::---";

// An item's ACL of `type` in libacl's text.
std::string aclText(const stdfs::path& path, acl_type_t type) {
    UniqueAcl acl(::acl_get_file(path.c_str(), type));
    if (!acl) return std::string("unreadable: ") + strerror(errno);
    char* text = ::acl_to_any_text(acl.get(), nullptr, ',', TEXT_NUMERIC_IDS);
    std::string out = text ? text : "untextable";
    ::acl_free(text);
    return out;
}

void makeItem(const stdfs::path& path, bool isDir, mode_t mode, uid_t owner = 0) {
    if (isDir)
        stdfs::create_directory(path);
    else
        writeFile(path, "contents");
    ASSERT_EQ(::chmod(path.c_str(), mode), 0) << path;
    ASSERT_EQ(::chown(path.c_str(), owner, owner), 0) << path;
}

std::string describe(const BTHErrorRef& error) {
    return error ? error->description() : "no error";
}

// The items of a container below its top, as creation leaves them.
const struct {
    const char* path;
    bool isDir;
    mode_t mode;
    uid_t owner;
} kContainerItems[] = {{kBTHMetadataFileName, false, 0644, 0},
                       {"Library", true, 0755, 0},
                       {"Library/Preferences", true, 0700, 501},
                       {"Library/Preferences/app.plist", false, 0600, 501},
                       {"tmp", true, 01777, 0},
                       {"run.sh", false, 04755, 0}};

class BTHFileManagerACL : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        UniqueAcl probe(::acl_from_text(kInherited));
        if (!probe || ::acl_set_file(dir_.path().c_str(), ACL_TYPE_DEFAULT, probe.get()) != 0)
            GTEST_SKIP() << "the scratch file system does not support ACLs";
        ASSERT_EQ(::acl_delete_def_file(dir_.path().c_str()), 0);
        ASSERT_EQ(::chmod(dir_.path().c_str(), 0755), 0);  // other users reach the containers
    }

    // A root-owned top (0755) holding the container's items.
    stdfs::path makeContainer(const std::string& name) {
        const stdfs::path top = dir_ / name;
        makeItem(top, true, 0755);
        for (const auto& item : kContainerItems)
            makeItem(top / item.path, item.isDir, item.mode, item.owner);
        return top;
    }

    ScratchDir dir_;
};

// Owner and others nothing (set-id and sticky bits cleared), the group bits
// shown being the mask; the metadata file as it was.
void expectStandardizedItem(const stdfs::path& path, bool isDir) {
    const struct stat st = lstatOf(path);
    EXPECT_EQ(st.st_uid, kNobody) << path;
    EXPECT_EQ(st.st_gid, kNobody) << path;
    EXPECT_EQ(st.st_mode & 07777, 0070u) << path;
    EXPECT_EQ(aclText(path, ACL_TYPE_ACCESS), kItemAccess) << path;
    if (isDir) {
        EXPECT_EQ(aclText(path, ACL_TYPE_DEFAULT), kInherited) << path;
    }
}

TEST_F(BTHFileManagerACL, TreesGetTheListsAndASystemContainerTopKeepsModeAndOwner) {
    for (const bool isSystemContainer : {true, false}) {
        SCOPED_TRACE(isSystemContainer ? "system container" : "plain tree");
        const stdfs::path top = makeContainer(isSystemContainer ? "system" : "plain");
        // Twice: the second run must find the owning group's rights of the
        // top in its ACL, not in the mode bits that now show the mask.
        for (int run = 0; run < 2; ++run) {
            BTHErrorRef error;
            ASSERT_TRUE(manager().standardizeACLsAtURL(top, isSystemContainer, &error))
                << describe(error);
            if (isSystemContainer) {
                const struct stat st = lstatOf(top);
                EXPECT_EQ(st.st_uid, 0u);
                EXPECT_EQ(st.st_mode & 07777, 0775u);
                EXPECT_EQ(aclText(top, ACL_TYPE_ACCESS), kTopAccess);
                EXPECT_EQ(aclText(top, ACL_TYPE_DEFAULT), kInherited);
            } else {
                expectStandardizedItem(top, true);
            }
            for (const auto& item : kContainerItems) {
                if (item.path == std::string(kBTHMetadataFileName)) continue;
                expectStandardizedItem(top / item.path, item.isDir);
            }
            const stdfs::path metadata = top / kBTHMetadataFileName;
            EXPECT_EQ(lstatOf(metadata).st_mode & 07777, 0644u);
            EXPECT_EQ(lstatOf(metadata).st_uid, 0u);
            EXPECT_EQ(::acl_extended_file(metadata.c_str()), 0);
        }
    }
    const stdfs::path fresh = dir_ / "fresh";
    makeItem(fresh, true, 0755);
    BTHErrorRef error;
    ASSERT_TRUE(manager().setTopLevelSystemContainerACLAtURL(fresh, &error)) << describe(error);
    EXPECT_EQ(aclText(fresh, ACL_TYPE_ACCESS), kTopAccess);
    EXPECT_EQ(aclText(fresh, ACL_TYPE_DEFAULT), kInherited);
}

TEST_F(BTHFileManagerACL, AllSystemContainersOfADirectory) {
    BTHErrorRef error;
    EXPECT_TRUE(manager().standardizeAllSystemContainerACLsAtURL(dir_ / "missing", &error));
    EXPECT_FALSE(error);
    const stdfs::path systemDir = dir_ / "System";
    makeItem(systemDir, true, 0755);
    makeItem(systemDir / "A", true, 0755);
    makeItem(systemDir / "B", true, 0755);
    makeItem(systemDir / "B/file", false, 0644);
    LogCapture log;
    ASSERT_TRUE(manager().standardizeAllSystemContainerACLsAtURL(systemDir, &error))
        << describe(error);
    EXPECT_TRUE(log.contains(5, "Potential containers requiring ACL migration"));
    EXPECT_EQ(aclText(systemDir / "A", ACL_TYPE_ACCESS), kTopAccess);
    EXPECT_EQ(aclText(systemDir / "B", ACL_TYPE_ACCESS), kTopAccess);
    expectStandardizedItem(systemDir / "B/file", false);
}

TEST_F(BTHFileManagerACL, OwnershipOfABundleTree) {
    const struct {
        const char* path;
        bool isDir;
        mode_t before, after;
    } items[] = {{"", true, 0700, 0755},
                 {"App.app", true, 0700, 0755},
                 {"App.app/Resources", true, 0711, 0755},
                 {"App.app/script", false, 0700, 0755},
                 {"App.app/Resources/data", false, 0600, 0644},
                 {"App.app/Resources/setuid", false, 04750, 0755}};
    const stdfs::path top = dir_ / "bundle";
    for (const auto& item : items) makeItem(top / item.path, item.isDir, item.before, 33);
    makeItem(top / kBTHMetadataFileName, false, 0600);
    stdfs::create_symlink("Resources/data", top / "App.app/link");

    BTHErrorRef error;
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(top, 501, 501, &error)) << describe(error);
    for (const auto& item : items) {
        const struct stat st = lstatOf(top / item.path);
        EXPECT_EQ(st.st_mode & 07777, item.after) << item.path;
        EXPECT_EQ(st.st_uid, 501u) << item.path;
        EXPECT_EQ(st.st_gid, 501u) << item.path;
    }
    EXPECT_EQ(lstatOf(top / "App.app/link").st_uid, 501u);
    EXPECT_EQ(lstatOf(top / kBTHMetadataFileName).st_uid, 0u);
    EXPECT_EQ(lstatOf(top / kBTHMetadataFileName).st_mode & 07777, 0600u);

    EXPECT_FALSE(manager().standardizeOwnershipAtURL(dir_ / "missing", 501, 501, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPOSIXError(ENOENT));
    EXPECT_EQ(error->localizedDescription(),
              "Could not stat " + (dir_ / "missing").string() + ": " + strerror(ENOENT));
}

// What a process may do in a standardized system container, one bit each.
enum Ability : int {
    CreateAtTop = 1 << 0,
    ListTop = 1 << 1,
    ListBelow = 1 << 2,
    ReadAndWriteBelow = 1 << 3,
    CreateBelow = 1 << 4,
    WorkInOwnSubdirectory = 1 << 5,  // mkdir, then create, write and read in it
    UseFirstMembersWork = 1 << 6,    // write and read what the first member made
    kAllAbilities = (1 << 7) - 1,
};

bool canList(const std::string& path) {
    DIR* dir = ::opendir(path.c_str());
    const bool ok = dir && ::readdir(dir) != nullptr;
    if (dir) ::closedir(dir);
    return ok;
}

bool canWriteAndRead(const std::string& path, int extraFlags = 0) {
    const int fd = ::open(path.c_str(), O_RDWR | O_APPEND | extraFlags, 0666);
    char buffer[8];
    const bool ok = fd >= 0 && ::write(fd, "data", 4) == 4 && ::pread(fd, buffer, 8, 0) > 0;
    if (fd >= 0) ::close(fd);
    return ok;
}

// The abilities of a child that becomes `uid` with only the supplementary
// `groups`; -1 when it could not become that user (it aborts).
int abilitiesOf(uid_t uid, const std::vector<gid_t>& groups, const stdfs::path& top) {
    const std::string me = std::to_string(uid), library = (top / "Library").string();
    const std::string ownDir = library + "/dir-" + me;
    const int status = inChild([&] {
        if (::setgroups(groups.size(), groups.data()) != 0 || ::setgid(uid) != 0 ||
            ::setuid(uid) != 0)
            ::abort();
        int abilities = 0;
        const int created = ::open((top / me).c_str(), O_CREAT | O_EXCL | O_WRONLY, 0666);
        if (created >= 0 && ::close(created) == 0) abilities |= CreateAtTop;
        if (canList(top.string())) abilities |= ListTop;
        if (canList(library)) abilities |= ListBelow;
        if (canWriteAndRead(library + "/Preferences/app.plist")) abilities |= ReadAndWriteBelow;
        if (canWriteAndRead(library + "/" + me, O_CREAT | O_EXCL)) abilities |= CreateBelow;
        if (::mkdir(ownDir.c_str(), 0777) == 0 && canWriteAndRead(ownDir + "/file", O_CREAT))
            abilities |= WorkInOwnSubdirectory;
        if (canWriteAndRead(library + "/dir-499/file")) abilities |= UseFirstMembersWork;
        return abilities;
    });
    return status > kAllAbilities ? -1 : status;
}

TEST_F(BTHFileManagerACL, MembersOfTheGroupHaveAccessAndOthersNone) {
    const stdfs::path top = makeContainer("access");
    BTHErrorRef error;
    ASSERT_TRUE(manager().standardizeACLsForSystemContainerAtURL(top, &error)) << describe(error);
    const struct {
        const char* who;
        uid_t uid;
        std::vector<gid_t> groups;
        int expected, checked;
    } rows[] = {
        // In this order: the second member uses what the first one made.
        {"member _system", 499, {510}, kAllAbilities & ~ListTop, kAllAbilities},
        {"another member", 501, {510}, kAllAbilities & ~ListTop, kAllAbilities},
        // The top is 0755, as a new one is: anyone may list it.
        {"non-member", 502, {}, 0, kAllAbilities & ~ListTop},
    };
    for (const auto& row : rows) {
        const int abilities = abilitiesOf(row.uid, row.groups, top);
        ASSERT_GE(abilities, 0) << row.who << " could not be become";
        EXPECT_EQ(abilities & row.checked, row.expected) << row.who;
    }
}

TEST_F(BTHFileManagerACL, PlantedLinksDoNotHandOutsideItemsOver) {
    // Outside: a file a hard link is planted to, a file and a directory
    // symbolic links are planted to, and a file in that directory.
    const struct {
        stdfs::path path;
        bool isDir;
        mode_t mode;
    } outside[] = {{dir_ / "hard", false, 0600},
                   {dir_ / "file", false, 0640},
                   {dir_ / "dir", true, 0750},
                   {dir_ / "dir/inner", false, 0600}};
    for (const auto& item : outside) makeItem(item.path, item.isDir, item.mode);

    using Standardize = std::function<bool(const stdfs::path&, BTHErrorRef*)>;
    const struct {
        const char* kind;
        uid_t linkOwner;
        Standardize standardize;
    } kinds[] = {
        {"system container", kNobody,
         [](auto& top, auto* e) { return manager().standardizeACLsAtURL(top, true, e); }},
        {"plain tree", kNobody,
         [](auto& top, auto* e) { return manager().standardizeACLsAtURL(top, false, e); }},
        {"ownership", 501,
         [](auto& top, auto* e) { return manager().standardizeOwnershipAtURL(top, 501, 501, e); }},
    };
    for (const auto& kind : kinds) {
        SCOPED_TRACE(kind.kind);
        const stdfs::path top = makeContainer(std::string("attacked ") + kind.kind);
        ASSERT_EQ(::link((dir_ / "hard").c_str(), (top / "Library/hard").c_str()), 0);
        stdfs::create_directory_symlink(dir_ / "dir", top / "Library/dirlink");
        stdfs::create_symlink(dir_ / "file", top / "filelink");

        LogCapture log;
        BTHErrorRef error;
        EXPECT_TRUE(kind.standardize(top, &error)) << describe(error);
        for (const auto& item : outside) {
            const struct stat st = lstatOf(item.path);
            EXPECT_EQ(st.st_uid, 0u) << item.path;
            EXPECT_EQ(st.st_mode & 07777, item.mode) << item.path;
            EXPECT_EQ(::acl_extended_file(item.path.c_str()), 0) << item.path;
        }
        EXPECT_TRUE(log.contains(3, (top / "Library/hard").string() + " unchanged"));
        EXPECT_EQ(lstatOf(top / "Library/dirlink").st_uid, kind.linkOwner);
        EXPECT_EQ(lstatOf(top / "filelink").st_uid, kind.linkOwner);
        ASSERT_EQ(::unlink((top / "Library/hard").c_str()), 0);
    }
}

// Takes "systemusers" out of the device's group file while it lives.
class WithoutSystemUsersGroup {
  public:
    WithoutSystemUsersGroup() : path_(kRoot / "etc/group"), saved_(readFile(path_)) {
        std::string kept, line;
        std::istringstream in(saved_);
        while (std::getline(in, line))
            if (line.rfind("systemusers:", 0) != 0) kept += line + "\n";
        writeFile(path_, kept);
    }
    ~WithoutSystemUsersGroup() { writeFile(path_, saved_); }

  private:
    stdfs::path path_;
    std::string saved_;
};

TEST_F(BTHFileManagerACL, AnUnresolvableGroupFailsEveryACLOperationAndChangesNothing) {
    makeItem(dir_ / "System", true, 0755);
    const stdfs::path top = makeContainer("System/container");
    const std::string unresolved =
        std::string("mbr_identifier_to_uuid() failed: ") + strerror(ENOENT);
    const WithoutSystemUsersGroup withoutGroup;
    const std::function<bool(BTHErrorRef*)> operations[] = {
        [&](auto* e) { return manager().standardizeACLsAtURL(top, false, e); },
        [&](auto* e) { return manager().standardizeACLsForSystemContainerAtURL(top, e); },
        [&](auto* e) {
            return manager().standardizeAllSystemContainerACLsAtURL(dir_ / "System", e);
        },
        [&](auto* e) { return manager().setTopLevelSystemContainerACLAtURL(top, e); },
    };
    for (size_t i = 0; i < std::size(operations); ++i) {
        SCOPED_TRACE("operation " + std::to_string(i));
        LogCapture log;
        BTHErrorRef error;
        EXPECT_FALSE(operations[i](&error));
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->isBTHError(BTHErrorACLFailed)) << describe(error);
        EXPECT_TRUE(log.contains(3, unresolved));
        // Setting the top-level list says where, with the cause beneath.
        const BTHErrorRef& cause = error->underlyingError() ? error->underlyingError() : error;
        EXPECT_EQ(cause->localizedDescription(), unresolved);
    }
    EXPECT_EQ(::acl_extended_file(top.c_str()), 0);
    EXPECT_EQ(lstatOf(top / "Library/Preferences/app.plist").st_uid, 501u);
}

}  // namespace
}  // namespace berth
