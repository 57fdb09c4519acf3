// Access control lists and ownership of container trees.
//
// System containers are shared by system processes of different users
// through the group "systemusers". Their lists are POSIX ACLs here: what a
// list grants an item itself is the item's access ACL (completed with the
// owner, owning-group and other entries of the item, and a mask), and what
// everything created below a directory inherits is the directory's default
// ACL. The mask is the group bits of the mode, so an item's mode is set first
// and its ACL after: a chmod after the ACL would cut the group off.
//
// The trees belong to apps. Every item is reopened relative to its parent
// without following a link, checked to be the item the walk saw, and changed
// only through that descriptor: the owner with fchownat on the descriptor
// itself, the mode and ACL through /proc/self/fd/<n>, which reaches exactly
// the inode the descriptor holds. A link never gets a mode or an ACL (its
// /proc entry would lead on to its target), only its own owner. A
// non-directory with more than one hard link is left alone: it may be a file
// from outside the container, and changing it would hand that file over.
#include <acl/libacl.h>
#include <fcntl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <optional>
#include <string>
#include <utility>

#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "core/BTHContainerClass.h"
#include "platform/SafeFs.h"
#include "platform/UserDatabase.h"

namespace berth {

using filemanager::errorText;
using filemanager::UniqueAcl;

namespace {

constexpr const char* kSystemUsersGroupName = "systemusers";
// The owner -2:-2 of system container items: the user "nobody" and the group
// "nogroup".
constexpr uid_t kSystemItemOwner = 65534;
constexpr gid_t kSystemItemGroup = 65534;

constexpr acl_perm_t kAllPerms = ACL_READ | ACL_WRITE | ACL_EXECUTE;
// The top directory's own entry: entries may be created (write and search),
// not listed.
constexpr acl_perm_t kTopLevelOwnPerms = ACL_WRITE | ACL_EXECUTE;

constexpr const char* kCreateACEName =
    "-[BTHFileManager _CreateSystemUserACEInACL:withPermissions:andFlags:withError:]";
constexpr const char* kCopyACLName =
    "-[BTHFileManager _CopySystemContainerACLWithNumACEs:isDir:inheritOnly:withError:]";
constexpr const char* kStandardizeACLsName =
    "-[BTHFileManager standardizeACLsAtURL:isSystemContainer:error:]";
constexpr const char* kStandardizeOwnershipName =
    "-[BTHFileManager standardizeOwnershipAtURL:toUID:GID:error:]";

// ---- Building lists ----

// Mode bits (rwx as 4, 2, 1) as ACL permissions, and back.
acl_perm_t permsOfBits(unsigned bits) {
    return ((bits & 4) ? ACL_READ : 0) | ((bits & 2) ? ACL_WRITE : 0) |
           ((bits & 1) ? ACL_EXECUTE : 0);
}

unsigned bitsOfPermset(acl_permset_t permset) {
    return (::acl_get_perm(permset, ACL_READ) == 1 ? 4u : 0u) |
           (::acl_get_perm(permset, ACL_WRITE) == 1 ? 2u : 0u) |
           (::acl_get_perm(permset, ACL_EXECUTE) == 1 ? 1u : 0u);
}

// The step of adding an entry that failed; errno tells why.
enum class EntryStep { Done, Create, GetPermset, AddPerm, SetPermset, SetTag, SetQualifier };

// Appends an entry of `tag` granting `perms`, naming the group `qualifier`
// for a named group entry.
EntryStep appendEntry(acl_t* acl, acl_tag_t tag, const gid_t* qualifier, acl_perm_t perms) {
    acl_entry_t entry;
    if (::acl_create_entry(acl, &entry) != 0) return EntryStep::Create;
    acl_permset_t permset;
    if (::acl_get_permset(entry, &permset) != 0) return EntryStep::GetPermset;
    if (::acl_clear_perms(permset) != 0) return EntryStep::AddPerm;
    for (const acl_perm_t perm :
         {acl_perm_t{ACL_READ}, acl_perm_t{ACL_WRITE}, acl_perm_t{ACL_EXECUTE}})
        if ((perms & perm) && ::acl_add_perm(permset, perm) != 0) return EntryStep::AddPerm;
    if (::acl_set_permset(entry, permset) != 0) return EntryStep::SetPermset;
    if (::acl_set_tag_type(entry, tag) != 0) return EntryStep::SetTag;
    if (qualifier && ::acl_set_qualifier(entry, qualifier) != 0) return EntryStep::SetQualifier;
    return EntryStep::Done;
}

// Stores `made` and leaves `errnum` in errno for the caller's own message.
bool failWith(BTHErrorRef* error, BTHErrorRef made, int errnum) {
    BTHSetError(error, std::move(made));
    errno = errnum;
    return false;
}

// Adds an entry (see appendEntry); a failure is 63 naming the failed call.
bool addEntry(acl_t* acl, acl_tag_t tag, const gid_t* qualifier, acl_perm_t perms,
              BTHErrorRef* error) {
    BTH_FUNCTION(kCreateACEName);
    const EntryStep step = appendEntry(acl, tag, qualifier, perms);
    if (step == EntryStep::Done) return true;
    const int errnum = errno;
    const std::string text = errorText(errnum);
    BTHErrorRef made;
    switch (step) {
        case EntryStep::Create:
            made = BTHMakeError(BTHErrorACLFailed, nullptr, "acl_create_entry() failed: %s", text);
            break;
        case EntryStep::GetPermset:
            made = BTHMakeError(BTHErrorACLFailed, nullptr, "acl_get_permset() failed: %s", text);
            break;
        case EntryStep::AddPerm:
            made = BTHMakeError(BTHErrorACLFailed, nullptr,
                                "acl_add_perm() failed to set perms %x: %s", perms, text);
            break;
        case EntryStep::SetPermset:
            made = BTHMakeError(BTHErrorACLFailed, nullptr, "acl_set_permset() failed: %s", text);
            break;
        case EntryStep::SetTag:
            made = BTHMakeError(BTHErrorACLFailed, nullptr, "acl_set_tag_type() failed: %s", text);
            break;
        case EntryStep::SetQualifier:
        case EntryStep::Done:
            made = BTHMakeError(BTHErrorACLFailed, nullptr, "acl_set_qualifier() failed: %s", text);
            break;
    }
    return failWith(error, std::move(made), errnum);
}

// Adds the entry of the group "systemusers" granting `perms`; 63 when the
// group cannot be resolved.
bool createSystemUserACE(acl_t* acl, acl_perm_t perms, BTHErrorRef* error) {
    BTH_FUNCTION(kCreateACEName);
    const std::optional<gid_t> gid = UserDatabase::groupIdByName(kSystemUsersGroupName);
    if (!gid) {
        return failWith(error,
                        BTHMakeError(BTHErrorACLFailed, nullptr,
                                     "mbr_identifier_to_uuid() failed: %s", errorText(ENOENT)),
                        ENOENT);
    }
    return addEntry(acl, ACL_GROUP, &*gid, perms, error);
}

UniqueAcl initACL(int capacity, BTHErrorRef* error) {
    BTH_FUNCTION(kCopyACLName);
    UniqueAcl acl(::acl_init(capacity));
    if (!acl) {
        const int errnum = errno;
        failWith(
            error,
            BTHMakeError(BTHErrorACLFailed, nullptr, "acl_init() failed: %s", errorText(errnum)),
            errnum);
    }
    return acl;
}

// One list of system containers: what it grants the item itself (to be
// completed per item with the owner, owning-group and other entries) and,
// for directories, what everything created below inherits.
struct SystemContainerACL {
    UniqueAcl own;
    UniqueAcl inheritable;  // none for files
};

// The group's entry with `perms`, and a mask that lets it through.
bool copyOwnPart(acl_perm_t perms, UniqueAcl* out, BTHErrorRef* error) {
    UniqueAcl acl = initACL(2, error);
    if (!acl || !createSystemUserACE(acl.address(), perms, error) ||
        !addEntry(acl.address(), ACL_MASK, nullptr, kAllPerms, error))
        return false;
    *out = std::move(acl);
    return true;
}

// What everything created below a system container directory inherits: the
// group gets everything, the owning group and others nothing. The creator
// keeps what its creation mode gives it: the owner of an item is judged by
// the owner entry alone, so an empty one would lock the creator out of what
// it just made.
bool copyInheritablePart(UniqueAcl* out, BTHErrorRef* error) {
    UniqueAcl acl = initACL(5, error);
    if (!acl || !addEntry(acl.address(), ACL_USER_OBJ, nullptr, kAllPerms, error) ||
        !addEntry(acl.address(), ACL_GROUP_OBJ, nullptr, 0, error) ||
        !createSystemUserACE(acl.address(), kAllPerms, error) ||
        !addEntry(acl.address(), ACL_MASK, nullptr, kAllPerms, error) ||
        !addEntry(acl.address(), ACL_OTHER, nullptr, 0, error))
        return false;
    *out = std::move(acl);
    return true;
}

// The directory list (the group gets everything, here and below), its
// inherit-only form (below only), or the file list (everything, here).
bool copySystemContainerACL(bool isDir, bool inheritOnly, SystemContainerACL* out,
                            BTHErrorRef* error) {
    SystemContainerACL list;
    if (isDir && !copyInheritablePart(&list.inheritable, error)) return false;
    if (!(isDir && inheritOnly) && !copyOwnPart(kAllPerms, &list.own, error)) return false;
    *out = std::move(list);
    return true;
}

// The top directory's list: everything below, entry creation here.
bool copyTopLevelSystemContainerACL(SystemContainerACL* out, BTHErrorRef* error) {
    SystemContainerACL list;
    if (!copySystemContainerACL(true, true, &list, error) ||
        !copyOwnPart(kTopLevelOwnPerms, &list.own, error))
        return false;
    *out = std::move(list);
    return true;
}

struct SystemContainerACLs {
    SystemContainerACL topLevel, directory, file;
};

bool copySystemContainerACLs(SystemContainerACLs* out, BTHErrorRef* error) {
    return copyTopLevelSystemContainerACL(&out->topLevel, error) &&
           copySystemContainerACL(true, false, &out->directory, error) &&
           copySystemContainerACL(false, false, &out->file, error);
}

// ---- Applying lists ----

// What an item grants its owner, its owning group and others (rwx bits).
struct BasePermissions {
    unsigned owner = 0, group = 0, other = 0;
};

BasePermissions basePermissionsOfMode(mode_t mode) {
    return {(mode >> 6) & 7u, (mode >> 3) & 7u, mode & 7u};
}

// What the item at `procPath` grants now: its mode's owner and other bits,
// and its ACL's owning-group entry when it has one (its mode's group bits are
// then the mask), so setting a list twice keeps what the owning group had.
BasePermissions currentBasePermissions(const std::string& procPath, mode_t mode) {
    BasePermissions base = basePermissionsOfMode(mode);
    UniqueAcl acl(::acl_get_file(procPath.c_str(), ACL_TYPE_ACCESS));
    if (!acl) return base;
    acl_entry_t entry;
    for (int which = ACL_FIRST_ENTRY; ::acl_get_entry(acl.get(), which, &entry) == 1;
         which = ACL_NEXT_ENTRY) {
        acl_tag_t tag;
        acl_permset_t permset;
        if (::acl_get_tag_type(entry, &tag) == 0 && tag == ACL_GROUP_OBJ &&
            ::acl_get_permset(entry, &permset) == 0)
            base.group = bitsOfPermset(permset);
    }
    return base;
}

// Gives the item at `procPath` the list, with `base` for its owner, owning
// group and others, replacing its ACLs. 0 or the error number.
int setSystemContainerACL(const std::string& procPath, const SystemContainerACL& list,
                          const BasePermissions& base) {
    UniqueAcl access(::acl_dup(list.own.get()));
    if (!access) return errno;
    const std::pair<acl_tag_t, unsigned> entries[] = {
        {ACL_USER_OBJ, base.owner}, {ACL_GROUP_OBJ, base.group}, {ACL_OTHER, base.other}};
    for (const auto& [tag, bits] : entries)
        if (appendEntry(access.address(), tag, nullptr, permsOfBits(bits)) != EntryStep::Done)
            return errno;
    if (::acl_set_file(procPath.c_str(), ACL_TYPE_ACCESS, access.get()) != 0) return errno;
    if (list.inheritable &&
        ::acl_set_file(procPath.c_str(), ACL_TYPE_DEFAULT, list.inheritable.get()) != 0)
        return errno;
    return 0;
}

// ---- Walking ----

std::string procPathOf(int fd) {
    return "/proc/self/fd/" + std::to_string(fd);
}

bool holdsMetadataFile(const std::filesystem::path& path) {
    return path.string().find(kBTHMetadataFileName) != std::string::npos;
}

// Whether a walk entry is an item to change: each directory once (on its
// first visit), nothing that carries the metadata file's name, nothing on
// another file system than the root's.
bool isItemToChange(const BTHWalkEntry& entry, std::optional<dev_t>* rootDevice) {
    using Kind = BTHWalkEntry::Kind;
    if (entry.level == 0 && !*rootDevice) *rootDevice = entry.st.st_dev;
    if (entry.kind == Kind::DirectoryPost || entry.kind == Kind::Unreadable ||
        entry.kind == Kind::DirectoryCycle)
        return false;
    return !holdsMetadataFile(entry.path) && entry.st.st_dev == **rootDevice;
}

// The item of a walk entry, reopened (O_PATH) relative to its parent without
// following a link. Invalid, errno set, unless it is still the item the
// walk's lstat described (ESTALE for another item); `st` is its fresh status.
UniqueFd openWalkItem(const BTHWalkEntry& entry, struct stat* st) {
    UniqueFd fd = fs::openAtNoFollow(entry.parentFd, entry.name.c_str(), O_PATH);
    if (!fd || ::fstat(fd.get(), st) != 0) return {};
    if (!fs::sameItem(*st, entry.st) || (st->st_mode & S_IFMT) != (entry.st.st_mode & S_IFMT)) {
        errno = ESTALE;
        return {};
    }
    return fd;
}

// Opens the item to change and checks that it may be changed: false (logged)
// when it cannot be opened or is a non-directory with other hard links.
UniqueFd openItemToChange(const char* bthFunctionName, const BTHWalkEntry& entry, struct stat* st) {
    UniqueFd fd = openWalkItem(entry, st);
    if (!fd) {
        BTHLogError("Could not stat %s: %s", entry.path, errorText(errno));
        return {};
    }
    if (!S_ISDIR(st->st_mode) && st->st_nlink > 1) {
        BTHLogError(
            "Leaving %s unchanged: it has %lu hard links, so it may be a file from "
            "outside the container",
            entry.path, static_cast<unsigned long>(st->st_nlink));
        return {};
    }
    return fd;
}

void chownItem(const char* bthFunctionName, int fd, const std::filesystem::path& path, uid_t uid,
               gid_t gid) {
    if (::fchownat(fd, "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW) != 0)
        BTHLogError("Could not chown %s: %s", path, errorText(errno));
}

void chmodItem(const char* bthFunctionName, int fd, const std::filesystem::path& path,
               mode_t mode) {
    if (::chmod(procPathOf(fd).c_str(), mode) != 0)
        BTHLogError("Could not chmod %s: %s", path, errorText(errno));
}

// One item of a tree standardized to the system container lists. The top of
// a system container keeps its mode and owner; everything else gets mode 0,
// the owner -2:-2 and the directory or file list.
void standardizeItemACL(const BTHWalkEntry& entry, bool isSystemContainer,
                        const SystemContainerACLs& lists) {
    BTH_FUNCTION(kStandardizeACLsName);
    struct stat st;
    UniqueFd fd = openItemToChange(bthFunctionName, entry, &st);
    if (!fd) return;
    const bool isTop = isSystemContainer && entry.level == 0;
    const bool isDir = S_ISDIR(st.st_mode);
    if (S_ISLNK(st.st_mode)) {
        if (!isTop)
            chownItem(bthFunctionName, fd.get(), entry.path, kSystemItemOwner, kSystemItemGroup);
        return;
    }
    const std::string procPath = procPathOf(fd.get());
    if (isTop) {
        const BasePermissions base = currentBasePermissions(procPath, st.st_mode);
        if (int err = setSystemContainerACL(procPath, isDir ? lists.topLevel : lists.file, base))
            BTHLogError(isDir ? "Failed to set top level ACL on dir %s: %s"
                              : "Failed to set ACL on dir %s: %s",
                        entry.path, errorText(err));
        return;
    }
    chownItem(bthFunctionName, fd.get(), entry.path, kSystemItemOwner, kSystemItemGroup);
    chmodItem(bthFunctionName, fd.get(), entry.path, 0);
    if (int err = setSystemContainerACL(procPath, isDir ? lists.directory : lists.file,
                                        basePermissionsOfMode(0)))
        BTHLogError("Failed to set ACL on dir %s: %s", entry.path, errorText(err));
}

// One item of a tree standardized to plain ownership: owner uid:gid, mode
// 0755 for directories and anything executable, 0644 for the rest; a link
// gets only its own owner.
void standardizeItemOwnership(const BTHWalkEntry& entry, uid_t uid, gid_t gid) {
    BTH_FUNCTION(kStandardizeOwnershipName);
    struct stat st;
    UniqueFd fd = openItemToChange(bthFunctionName, entry, &st);
    if (!fd) return;
    if (st.st_uid != uid || st.st_gid != gid)
        chownItem(bthFunctionName, fd.get(), entry.path, uid, gid);
    if (S_ISLNK(st.st_mode)) return;
    const bool executable = S_ISDIR(st.st_mode) || (st.st_mode & 0111);
    chmodItem(bthFunctionName, fd.get(), entry.path, executable ? 0755 : 0644);
}

// The root of a tree as an item to change, for handling it again after the
// walk.
BTHWalkEntry rootEntry(const std::filesystem::path& root, int parentFd, std::string name,
                       const struct stat& st) {
    BTHWalkEntry entry;
    entry.path = root;
    entry.st = st;
    entry.parentFd = parentFd;
    entry.name = std::move(name);
    return entry;
}

}  // namespace

bool BTHFileManager::setTopLevelSystemContainerACLAtURL(const std::filesystem::path& url,
                                                        BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager setTopLevelSystemContainerACLAtURL:error:]");
    SystemContainerACL list;
    BTHErrorRef buildError;
    int errnum = 0;
    if (!copyTopLevelSystemContainerACL(&list, &buildError)) {
        errnum = errno;
    } else {
        // The directory itself, never a link's target.
        UniqueFd fd = fs::openNoFollow(url, O_PATH | O_DIRECTORY);
        struct stat st;
        if (!fd || ::fstat(fd.get(), &st) != 0) {
            errnum = errno;
        } else {
            const std::string procPath = procPathOf(fd.get());
            errnum =
                setSystemContainerACL(procPath, list, currentBasePermissions(procPath, st.st_mode));
        }
    }
    if (errnum == 0) return true;
    BTHSetError(error, BTHMakeError(BTHErrorACLFailed, buildError, "Failed to set ACL on %@: %s",
                                    url, errorText(errnum)));
    return false;
}

bool BTHFileManager::standardizeACLsAtURL(const std::filesystem::path& url, bool isSystemContainer,
                                          BTHErrorRef* error) {
    SystemContainerACLs lists;
    if (!copySystemContainerACLs(&lists, error)) return false;
    std::optional<dev_t> rootDevice;
    return traverseDirectory(url, error, [&](const BTHWalkEntry& entry, BTHErrorRef*) {
        if (isItemToChange(entry, &rootDevice)) standardizeItemACL(entry, isSystemContainer, lists);
        return true;
    });
}

bool BTHFileManager::standardizeACLsForSystemContainerAtURL(const std::filesystem::path& url,
                                                            BTHErrorRef* error) {
    return standardizeACLsAtURL(url, true, error);
}

bool BTHFileManager::standardizeAllSystemContainerACLsAtURL(const std::filesystem::path& directory,
                                                            BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHFileManager standardizeAllSystemContainerACLsAtURL:error:]");
    BTHErrorRef listError;
    const auto items = urlsForItemsInDirectoryAtURL(directory, &listError);
    if (!items) {
        if (listError && listError->isPOSIXError(ENOENT)) return true;
        BTHLogError("Failed to get items at URL%@ : %@", directory, listError);
        BTHSetError(error, std::move(listError));
        return false;
    }
    if (items->empty()) return true;
    Value described = Value::array();
    for (const BTHFileURL& item : *items) described.push(Value(item.path.string()));
    BTHLogNotice("Potential containers requiring ACL migration: %@", described);

    BTHErrorRef lastFailure;
    bool failed = false;
    for (const BTHFileURL& item : *items) {
        BTHErrorRef itemError;
        if (standardizeACLsForSystemContainerAtURL(item.path, &itemError)) continue;
        BTHLogError("Failed to set system container ACL at %@: %@", item.path, itemError);
        lastFailure = std::move(itemError);
        failed = true;
    }
    if (failed) BTHSetError(error, std::move(lastFailure));
    return !failed;
}

bool BTHFileManager::standardizeOwnershipAtURL(const std::filesystem::path& url, uid_t uid,
                                               gid_t gid, BTHErrorRef* error) {
    BTH_FUNCTION(kStandardizeOwnershipName);
    std::optional<dev_t> rootDevice;
    const bool result = traverseDirectory(url, error, [&](const BTHWalkEntry& entry, BTHErrorRef*) {
        if (isItemToChange(entry, &rootDevice)) standardizeItemOwnership(entry, uid, gid);
        return true;
    });

    // The root once more, as it is now.
    std::string name;
    UniqueFd parent = fs::openParentNoFollow(url, &name);
    struct stat st;
    if (!parent || ::fstatat(parent.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
        const int errnum = errno;
        BTHSetError(error,
                    BTHMakePOSIXError(errnum, "Could not stat %s: %s", url, errorText(errnum)));
        return false;
    }
    if (!holdsMetadataFile(url))
        standardizeItemOwnership(rootEntry(url, parent.get(), name, st), uid, gid);
    return result;
}

}  // namespace berth
