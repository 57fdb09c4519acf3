// Access control lists and ownership of container trees: the lists a
// standardized system container carries, what they let a member and a
// non-member of "systemusers" really do, plain ownership of bundle trees,
// links planted to hand outside files over, and a group that cannot be
// resolved.
#include <acl/libacl.h>
#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <sstream>
#include <string>
#include <vector>

#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "BTHMetadata.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using filemanager::UniqueAcl;
using test::LogCapture;
using test::ScratchDir;

[[maybe_unused]] const auto& kRoot = test::installScratchDeviceRoot();

constexpr uid_t kNobody = 65534;
// libacl's text of the lists, with numeric ids ("systemusers" is 510).
constexpr const char* kTopAccess = "user::rwx,group::r-x,group:510:-wx,mask::rwx,other::r-x";
constexpr const char* kItemAccess = "user::---,group::---,group:510:rwx,mask::rwx,other::---";
constexpr const char* kInherited = "user::rwx,group::---,group:510:rwx,mask::rwx,other::---";

BTHFileManager& manager() {
    return BTHFileManager::defaultManager();
}

// An item's ACL of `type` in libacl's text; "" for an empty default ACL.
std::string aclText(const stdfs::path& path, acl_type_t type) {
    UniqueAcl acl(::acl_get_file(path.c_str(), type));
    if (!acl) return std::string("unreadable: ") + strerror(errno);
    char* text = ::acl_to_any_text(acl.get(), nullptr, ',', TEXT_NUMERIC_IDS);
    std::string out = text ? text : "untextable";
    ::acl_free(text);
    return out;
}

struct stat lstatOf(const stdfs::path& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st;
}

void makeDir(const stdfs::path& path, mode_t mode, uid_t owner = 0) {
    ASSERT_TRUE(stdfs::create_directory(path)) << path;
    ASSERT_EQ(::chmod(path.c_str(), mode), 0);
    ASSERT_EQ(::chown(path.c_str(), owner, owner), 0);
}

void makeFile(const stdfs::path& path, mode_t mode, uid_t owner = 0) {
    test::writeFile(path, "contents of " + path.filename().string());
    ASSERT_EQ(::chmod(path.c_str(), mode), 0);
    ASSERT_EQ(::chown(path.c_str(), owner, owner), 0);
}

std::string describe(const BTHErrorRef& error) {
    return error ? error->description() : "no error";
}

class BTHFileManagerACL : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        UniqueAcl probe(::acl_from_text(kInherited));
        if (!probe || ::acl_set_file(dir_.path().c_str(), ACL_TYPE_DEFAULT, probe.get()) != 0)
            GTEST_SKIP() << "the scratch file system does not support ACLs";
        ASSERT_EQ(::acl_delete_def_file(dir_.path().c_str()), 0);
        // Other users must reach the containers.
        ASSERT_EQ(::chmod(dir_.path().c_str(), 0755), 0);
    }

    // A container as creation leaves it: a root-owned top (0755) holding the
    // metadata file and an app's directories and files.
    stdfs::path makeContainer(const std::string& name) {
        const stdfs::path top = dir_ / name;
        makeDir(top, 0755);
        makeFile(top / kBTHMetadataFileName, 0644);
        makeDir(top / "Library", 0755);
        makeDir(top / "Library/Preferences", 0700, 501);
        makeFile(top / "Library/Preferences/app.plist", 0600, 501);
        makeDir(top / "tmp", 01777);
        makeFile(top / "run.sh", 04755);
        return top;
    }

    ScratchDir dir_;
};

void expectSystemItems(const stdfs::path& top) {
    const struct {
        const char* path;
        bool isDir;
    } items[] = {{"Library", true},
                 {"Library/Preferences", true},
                 {"Library/Preferences/app.plist", false},
                 {"tmp", true},
                 {"run.sh", false}};
    for (const auto& item : items) {
        const stdfs::path path = top / item.path;
        const struct stat st = lstatOf(path);
        EXPECT_EQ(st.st_uid, kNobody) << path;
        EXPECT_EQ(st.st_gid, kNobody) << path;
        // Owner and others nothing, special bits cleared; the group bits
        // shown are the mask.
        EXPECT_EQ(st.st_mode & 07777, 0070u) << path;
        EXPECT_EQ(aclText(path, ACL_TYPE_ACCESS), kItemAccess) << path;
        if (item.isDir) {
            EXPECT_EQ(aclText(path, ACL_TYPE_DEFAULT), kInherited) << path;
        }
    }
}

void expectUntouchedMetadata(const stdfs::path& top) {
    const stdfs::path metadata = top / kBTHMetadataFileName;
    const struct stat st = lstatOf(metadata);
    EXPECT_EQ(st.st_uid, 0u);
    EXPECT_EQ(st.st_mode & 07777, 0644u);
    EXPECT_EQ(aclText(metadata, ACL_TYPE_ACCESS), "user::rw-,group::r--,other::r--");
}

TEST_F(BTHFileManagerACL, SystemContainerTopKeepsModeAndOwnerAndItemsGetTheLists) {
    const stdfs::path top = makeContainer("system");
    // Twice: the second run must find what the owning group had in the
    // top's ACL, not in the mode bits that now show the mask.
    for (int run = 0; run < 2; ++run) {
        BTHErrorRef error;
        ASSERT_TRUE(manager().standardizeACLsForSystemContainerAtURL(top, &error))
            << describe(error);
        const struct stat st = lstatOf(top);
        EXPECT_EQ(st.st_uid, 0u);
        EXPECT_EQ(st.st_gid, 0u);
        EXPECT_EQ(st.st_mode & 07777, 0775u);
        EXPECT_EQ(aclText(top, ACL_TYPE_ACCESS), kTopAccess);
        EXPECT_EQ(aclText(top, ACL_TYPE_DEFAULT), kInherited);
        expectSystemItems(top);
        expectUntouchedMetadata(top);
    }

    // The top-level list alone, on a new container's top.
    const stdfs::path fresh = dir_ / "fresh";
    makeDir(fresh, 0755);
    BTHErrorRef error;
    ASSERT_TRUE(manager().setTopLevelSystemContainerACLAtURL(fresh, &error)) << describe(error);
    EXPECT_EQ(aclText(fresh, ACL_TYPE_ACCESS), kTopAccess);
    EXPECT_EQ(aclText(fresh, ACL_TYPE_DEFAULT), kInherited);
}

TEST_F(BTHFileManagerACL, WithoutSystemContainerTheRootIsLikeAnyDirectory) {
    const stdfs::path top = makeContainer("shared");
    BTHErrorRef error;
    ASSERT_TRUE(manager().standardizeACLsAtURL(top, false, &error)) << describe(error);
    const struct stat st = lstatOf(top);
    EXPECT_EQ(st.st_uid, kNobody);
    EXPECT_EQ(st.st_mode & 07777, 0070u);
    EXPECT_EQ(aclText(top, ACL_TYPE_ACCESS), kItemAccess);
    EXPECT_EQ(aclText(top, ACL_TYPE_DEFAULT), kInherited);
    expectSystemItems(top);
    expectUntouchedMetadata(top);
}

TEST_F(BTHFileManagerACL, AllSystemContainersOfADirectory) {
    BTHErrorRef error;
    EXPECT_TRUE(manager().standardizeAllSystemContainerACLsAtURL(dir_ / "missing", &error));
    EXPECT_FALSE(error);

    const stdfs::path systemDir = dir_ / "Data/System";
    stdfs::create_directories(systemDir);
    {
        LogCapture log;
        EXPECT_TRUE(manager().standardizeAllSystemContainerACLsAtURL(systemDir, &error));
        EXPECT_FALSE(log.contains(5, "Potential containers requiring ACL migration"));
    }
    makeDir(systemDir / "A", 0755);
    makeDir(systemDir / "B", 0755);
    makeFile(systemDir / "B/file", 0644);
    LogCapture log;
    ASSERT_TRUE(manager().standardizeAllSystemContainerACLsAtURL(systemDir, &error))
        << describe(error);
    EXPECT_TRUE(log.contains(5, "Potential containers requiring ACL migration"));
    for (const char* name : {"A", "B"})
        EXPECT_EQ(aclText(systemDir / name, ACL_TYPE_ACCESS), kTopAccess) << name;
    EXPECT_EQ(aclText(systemDir / "B/file", ACL_TYPE_ACCESS), kItemAccess);
}

TEST_F(BTHFileManagerACL, OwnershipOfABundleTree) {
    const stdfs::path top = dir_ / "bundle";
    makeDir(top, 0700);
    makeFile(top / kBTHMetadataFileName, 0600);
    makeDir(top / "App.app", 0700);
    makeDir(top / "App.app/Resources", 0711, 33);
    makeFile(top / "App.app/script", 0700);
    makeFile(top / "App.app/Resources/data", 0600);
    makeFile(top / "App.app/Resources/setuid", 04750);
    stdfs::create_symlink("Resources/data", top / "App.app/link");

    BTHErrorRef error;
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(top, 501, 501, &error)) << describe(error);
    const struct {
        const char* path;
        mode_t mode;
    } expected[] = {{"", 0755},
                    {"App.app", 0755},
                    {"App.app/Resources", 0755},
                    {"App.app/script", 0755},
                    {"App.app/Resources/data", 0644},
                    {"App.app/Resources/setuid", 0755}};
    for (const auto& item : expected) {
        const struct stat st = lstatOf(top / item.path);
        EXPECT_EQ(st.st_mode & 07777, item.mode) << item.path;
        EXPECT_EQ(st.st_uid, 501u) << item.path;
        EXPECT_EQ(st.st_gid, 501u) << item.path;
    }
    const struct stat link = lstatOf(top / "App.app/link");
    EXPECT_TRUE(S_ISLNK(link.st_mode));
    EXPECT_EQ(link.st_uid, 501u);
    const struct stat metadata = lstatOf(top / kBTHMetadataFileName);
    EXPECT_EQ(metadata.st_uid, 0u);
    EXPECT_EQ(metadata.st_mode & 07777, 0600u);

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
    ReadBelow = 1 << 3,
    WriteBelow = 1 << 4,
    CreateBelow = 1 << 5,
    WorkInOwnSubdirectory = 1 << 6,  // mkdir, then create, write, read in it
    UseFirstMembersWork = 1 << 7,    // read and write what the first member made there
    kAllAbilities = (1 << 8) - 1,
};

bool canList(const std::string& path) {
    DIR* dir = ::opendir(path.c_str());
    if (!dir) return false;
    const bool ok = ::readdir(dir) != nullptr;
    ::closedir(dir);
    return ok;
}

bool canWriteAndRead(const std::string& path, int openFlags) {
    const int fd = ::open(path.c_str(), openFlags | O_RDWR, 0666);
    if (fd < 0) return false;
    char buffer[8] = {};
    const bool ok = ::write(fd, "data", 4) == 4 && ::pread(fd, buffer, sizeof buffer, 0) > 0;
    ::close(fd);
    return ok;
}

// In a child that becomes `uid` with only the supplementary `groups`: the
// abilities it has. -1 when the child could not become that user (it aborts).
int abilitiesOf(uid_t uid, const std::vector<gid_t>& groups, const stdfs::path& top) {
    const std::string me = std::to_string(uid);
    const std::string library = (top / "Library").string();
    const std::string prefs = (top / "Library/Preferences/app.plist").string();
    const std::string madeAtTop = (top / ("made-by-" + me)).string();
    const std::string madeBelow = library + "/made-by-" + me;
    const std::string ownDir = library + "/dir-" + me;
    const std::string ownFile = ownDir + "/file";
    const std::string firstMembersFile = library + "/dir-499/file";
    const pid_t pid = ::fork();
    if (pid == 0) {
        if (::setgroups(groups.size(), groups.data()) != 0 || ::setgid(uid) != 0 ||
            ::setuid(uid) != 0)
            ::abort();
        int abilities = 0;
        const int created = ::open(madeAtTop.c_str(), O_CREAT | O_EXCL | O_WRONLY, 0666);
        if (created >= 0) {
            abilities |= CreateAtTop;
            ::close(created);
        }
        if (canList(top.string())) abilities |= ListTop;
        if (canList(library)) abilities |= ListBelow;
        const int readable = ::open(prefs.c_str(), O_RDONLY);
        char buffer[8];
        if (readable >= 0 && ::read(readable, buffer, sizeof buffer) > 0) abilities |= ReadBelow;
        if (readable >= 0) ::close(readable);
        const int writable = ::open(prefs.c_str(), O_WRONLY | O_APPEND);
        if (writable >= 0 && ::write(writable, "more", 4) == 4) abilities |= WriteBelow;
        if (writable >= 0) ::close(writable);
        if (canWriteAndRead(madeBelow, O_CREAT | O_EXCL)) abilities |= CreateBelow;
        if (::mkdir(ownDir.c_str(), 0777) == 0 && canWriteAndRead(ownFile, O_CREAT | O_EXCL) &&
            canWriteAndRead(ownFile, 0))
            abilities |= WorkInOwnSubdirectory;
        if (canWriteAndRead(firstMembersFile, 0)) abilities |= UseFirstMembersWork;
        ::_exit(abilities);
    }
    int status = 0;
    if (pid < 0 || ::waitpid(pid, &status, 0) != pid || !WIFEXITED(status)) return -1;
    return WEXITSTATUS(status);
}

TEST_F(BTHFileManagerACL, MembersOfTheGroupHaveAccessAndOthersNone) {
    const stdfs::path top = makeContainer("access");
    BTHErrorRef error;
    ASSERT_TRUE(manager().standardizeACLsForSystemContainerAtURL(top, &error)) << describe(error);

    const struct {
        const char* who;
        uid_t uid;
        std::vector<gid_t> groups;
        int expected;
        int checked;
    } rows[] = {
        // The first member works first: the second then uses what it made.
        {"member _system", 499, {510}, kAllAbilities & ~ListTop, kAllAbilities},
        {"another member", 501, {510}, kAllAbilities & ~ListTop, kAllAbilities},
        // The top is 0755: anyone may list it, as on a new container.
        {"non-member", 502, {}, 0, kAllAbilities & ~ListTop},
    };
    for (const auto& row : rows) {
        const int abilities = abilitiesOf(row.uid, row.groups, top);
        ASSERT_GE(abilities, 0) << row.who << " could not be become";
        EXPECT_EQ(abilities & row.checked, row.expected) << row.who;
    }
}

// The outside items that planted links point at, and their state before.
struct OutsideTargets {
    stdfs::path linkedFile, file, directory, inner;

    explicit OutsideTargets(const stdfs::path& dir)
        : linkedFile(dir / "outside/hard"),
          file(dir / "outside/file"),
          directory(dir / "outside/dir"),
          inner(dir / "outside/dir/inner") {
        makeDir(dir / "outside", 0755);
        makeFile(linkedFile, 0600);
        makeFile(file, 0640);
        makeDir(directory, 0750);
        makeFile(inner, 0600);
    }

    void expectUntouched() const {
        const struct {
            const stdfs::path* path;
            mode_t mode;
            const char* access;
        } items[] = {{&linkedFile, 0600, "user::rw-,group::---,other::---"},
                     {&file, 0640, "user::rw-,group::r--,other::---"},
                     {&directory, 0750, "user::rwx,group::r-x,other::---"},
                     {&inner, 0600, "user::rw-,group::---,other::---"}};
        for (const auto& item : items) {
            const struct stat st = lstatOf(*item.path);
            EXPECT_EQ(st.st_uid, 0u) << *item.path;
            EXPECT_EQ(st.st_gid, 0u) << *item.path;
            EXPECT_EQ(st.st_mode & 07777, item.mode) << *item.path;
            EXPECT_EQ(aclText(*item.path, ACL_TYPE_ACCESS), item.access) << *item.path;
        }
        EXPECT_EQ(aclText(directory, ACL_TYPE_DEFAULT), "");
    }
};

TEST_F(BTHFileManagerACL, PlantedLinksDoNotHandOutsideItemsOver) {
    const OutsideTargets outside(dir_.path());
    const struct {
        const char* kind;
        uid_t linkOwner;
        std::function<bool(const stdfs::path&, BTHErrorRef*)> standardize;
    } kinds[] = {
        {"system container", kNobody,
         [](const stdfs::path& top, BTHErrorRef* error) {
             return manager().standardizeACLsForSystemContainerAtURL(top, error);
         }},
        {"plain tree", kNobody,
         [](const stdfs::path& top, BTHErrorRef* error) {
             return manager().standardizeACLsAtURL(top, false, error);
         }},
        {"ownership", 501,
         [](const stdfs::path& top, BTHErrorRef* error) {
             return manager().standardizeOwnershipAtURL(top, 501, 501, error);
         }},
    };
    int index = 0;
    for (const auto& kind : kinds) {
        const stdfs::path top = makeContainer("attacked" + std::to_string(index++));
        ASSERT_EQ(::link(outside.linkedFile.c_str(), (top / "Library/hard").c_str()), 0);
        stdfs::create_directory_symlink(outside.directory, top / "Library/dirlink");
        stdfs::create_symlink(outside.file, top / "filelink");

        LogCapture log;
        BTHErrorRef error;
        EXPECT_TRUE(kind.standardize(top, &error)) << kind.kind << ": " << describe(error);
        outside.expectUntouched();
        EXPECT_TRUE(log.contains(3, (top / "Library/hard").string() + " unchanged")) << kind.kind;
        for (const char* name : {"Library/dirlink", "filelink"}) {
            const struct stat link = lstatOf(top / name);
            EXPECT_TRUE(S_ISLNK(link.st_mode)) << kind.kind << " " << name;
            EXPECT_EQ(link.st_uid, kind.linkOwner) << kind.kind << " " << name;
        }
        ASSERT_EQ(::unlink((top / "Library/hard").c_str()), 0);
    }
}

// Takes "systemusers" out of the device's group file while it lives.
class WithoutSystemUsersGroup {
  public:
    WithoutSystemUsersGroup() : path_(kRoot / "etc/group"), saved_(test::readFile(path_)) {
        std::string kept, line;
        std::istringstream in(saved_);
        while (std::getline(in, line))
            if (line.rfind("systemusers:", 0) != 0) kept += line + "\n";
        test::writeFile(path_, kept);
    }
    ~WithoutSystemUsersGroup() { test::writeFile(path_, saved_); }

  private:
    stdfs::path path_;
    std::string saved_;
};

TEST_F(BTHFileManagerACL, AnUnresolvableGroupFailsEveryACLOperationAndChangesNothing) {
    const stdfs::path systemDir = dir_ / "System";
    makeDir(systemDir, 0755);
    const stdfs::path top = makeContainer("System/container");
    const std::string unresolved =
        std::string("mbr_identifier_to_uuid() failed: ") + strerror(ENOENT);
    const WithoutSystemUsersGroup withoutGroup;

    const struct {
        const char* operation;
        std::function<bool(BTHErrorRef*)> run;
    } operations[] = {
        {"standardizeACLsAtURL",
         [&](BTHErrorRef* e) { return manager().standardizeACLsAtURL(top, false, e); }},
        {"standardizeACLsForSystemContainerAtURL",
         [&](BTHErrorRef* e) { return manager().standardizeACLsForSystemContainerAtURL(top, e); }},
        {"standardizeAllSystemContainerACLsAtURL",
         [&](BTHErrorRef* e) {
             return manager().standardizeAllSystemContainerACLsAtURL(systemDir, e);
         }},
        {"setTopLevelSystemContainerACLAtURL",
         [&](BTHErrorRef* e) { return manager().setTopLevelSystemContainerACLAtURL(top, e); }},
    };
    for (const auto& operation : operations) {
        LogCapture log;
        BTHErrorRef error;
        EXPECT_FALSE(operation.run(&error)) << operation.operation;
        ASSERT_TRUE(error) << operation.operation;
        EXPECT_TRUE(error->isBTHError(BTHErrorACLFailed)) << describe(error);
        EXPECT_TRUE(log.contains(3, unresolved)) << operation.operation;
        // Setting the top-level list reports where, with the cause beneath.
        const BTHErrorRef& cause = error->underlyingError() ? error->underlyingError() : error;
        EXPECT_EQ(cause->localizedDescription(), unresolved) << operation.operation;
    }
    EXPECT_EQ(aclText(top, ACL_TYPE_ACCESS), "user::rwx,group::r-x,other::r-x");
    EXPECT_EQ(aclText(top, ACL_TYPE_DEFAULT), "");
    const struct stat st = lstatOf(top / "Library/Preferences/app.plist");
    EXPECT_EQ(st.st_uid, 501u);
    EXPECT_EQ(st.st_mode & 07777, 0600u);
}

}  // namespace
}  // namespace berth
