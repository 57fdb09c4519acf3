// BTHFileManager: the daemon's single gateway to the file system for whole
// items. It removes trees (clearing the immutable flag where that blocks
// removal), creates directories with a mode, an owner and a protection class,
// copies and moves trees, makes unique temporary directories, walks trees,
// lists directories and tests for existence.
//
// The trees it works in belong to apps that may swap any component for a
// symbolic link at any moment. Every operation works through directory file
// descriptors, acts on the descriptor it checked and never follows a link;
// a swap mid-operation can make it fail, never redirect it outside the tree.
//
// Failures are POSIX-domain errors carrying the error number; none of them
// logs by itself unless stated. Stateless; safe from any thread.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "BTHError.h"
#include "platform/TreeWalk.h"
#include "platform/UniqueFd.h"

namespace berth {

// A path plus the flag telling whether it names a directory.
struct BTHFileURL {
    std::filesystem::path path;
    bool isDirectory = false;

    friend bool operator==(const BTHFileURL&, const BTHFileURL&) = default;
    std::string description() const { return path.string() + (isDirectory ? "/" : ""); }
};

// What the tree walk hands its callback for each item: its path, level,
// kind (pre- and post-order directory, cycle, unreadable directory with its
// error number, file, link, other), lstat information, and the directory
// descriptor holding it plus its name there (and, for a directory that was
// entered, its own descriptor), so callbacks act on the item without
// resolving its path again.
using BTHWalkEntry = fs::WalkEntry;

class BTHFileManager {
  public:
    static BTHFileManager& defaultManager();

    // Removes a file, link or directory tree. A missing item anywhere is not
    // a failure. Items that cannot be removed are passed over; an immutable
    // item has its flag cleared and is unlinked (logged at notice level).
    // Fails with the first error number recorded ("removefile of %@ failed:
    // %s"); a vanished item recorded first hides later errors. Directories
    // on another file system are not entered (EXDEV).
    bool removeItemAtURL(const std::filesystem::path& url, BTHErrorRef* error);

    // Creates the directory (and with `intermediates` its missing parents)
    // with `mode` (less the process's umask), each component made relative
    // to its parent's descriptor; no existing component may be a link
    // (ELOOP). An existing item at the path is accepted and keeps its mode.
    // Then, unless `protectionClass` is -1, sets the class of the opened
    // directory, and unless `owner` is 0, chowns it to owner:owner (result
    // ignored).
    bool createDirectoryAtURL(const std::filesystem::path& url, bool intermediates, mode_t mode,
                              uid_t owner, int32_t protectionClass, BTHErrorRef* error);
    bool createDirectoryAtURL(const std::filesystem::path& url, bool intermediates, mode_t mode,
                              uid_t owner, BTHErrorRef* error);
    bool createDirectoryAtURLWithClass(const std::filesystem::path& url, bool intermediates,
                                       mode_t mode, int32_t protectionClass, BTHErrorRef* error);
    bool createDirectoryAtURL(const std::filesystem::path& url, bool intermediates, mode_t mode,
                              BTHErrorRef* error);

    // Copies a tree keeping data, mode, owner, times, extended attributes
    // (ACLs included), flags and links (copied as links). Stops at the first
    // item that fails; a destination the copy created is then removed. The
    // IfExists form succeeds without doing anything for a missing source.
    bool copyItemAtURL(const std::filesystem::path& source, const std::filesystem::path& dest,
                       BTHErrorRef* error);
    bool copyItemIfExistsAtURL(const std::filesystem::path& source,
                               const std::filesystem::path& dest, BTHErrorRef* error);

    // Renames; across file systems copies, then removes the source (a source
    // that cannot be removed is logged and the move still succeeds).
    bool moveItemAtURL(const std::filesystem::path& source, const std::filesystem::path& dest,
                       BTHErrorRef* error);
    bool moveItemIfExistsAtURL(const std::filesystem::path& source,
                               const std::filesystem::path& dest, BTHErrorRef* error);

    // Creates "<prefix>XXXXXX" (six random letters and digits, mode 0700) in
    // `parent` and returns it as a directory URL. Clears `*error` first.
    std::optional<BTHFileURL> createTemporaryDirectoryInDirectoryURL(
        const std::filesystem::path& parent, const std::string& prefix, BTHErrorRef* error);
    std::optional<BTHFileURL> createTemporaryDirectoryInDirectoryURL(
        const std::filesystem::path& parent, BTHErrorRef* error);

    // Walks the tree at `root` without following links or crossing into
    // other file systems, pre- and post-order, in directory order. The
    // callback answers whether to go on; false ends the walk with failure and
    // the error the callback left in its slot. An item that cannot be
    // lstat'ed (a missing root, an entry that vanished) ends the walk with
    // "Error for path %s: %s"; an unreadable directory is delivered instead.
    using WalkCallback = std::function<bool(const BTHWalkEntry& entry, BTHErrorRef* error)>;
    bool traverseDirectory(const std::filesystem::path& root, BTHErrorRef* error,
                           const WalkCallback& callback);

    // The items of a directory in directory order, names beginning with "."
    // skipped, directories flagged (a link is never flagged, whatever it
    // points to). A missing directory fails with ENOENT without a log line.
    std::optional<std::vector<BTHFileURL>> urlsForItemsInDirectoryAtURL(
        const std::filesystem::path& directory, BTHErrorRef* error);

    // lstat-based (a dangling link exists); a link in an earlier component
    // is not followed (ELOOP). Not complements: when existence cannot be
    // determined both answer false and log why.
    bool itemExistsAtURL(const std::filesystem::path& url);
    bool itemDoesNotExistAtURL(const std::filesystem::path& url);

    // Contained paths (BTHFileManager+ContainedPath.cpp). A client may name
    // an item inside one of its containers by a path of its choosing; before
    // the daemon acts on it, the path must be proven to stay inside the
    // container once every link in it is resolved. A leading "/private" is
    // transparent (it is where "/var" really lives). Every refusal is a null
    // result with one error-level line; none makes an error object.

    // The real path of `suspicious` when it lies at or below `base` (or is
    // `base`), else null. Refused: either path missing, a path that is not
    // textually below the base, a ".." component, an absolute link, a link
    // whose text climbs above the directory it is in more than the base
    // allows, and any real path (of a link too) whose components leave the
    // base's. A suspicious path that does not exist yet is resolved through
    // its longest existing prefix; the base must exist.
    std::optional<std::filesystem::path> realPathForURL(
        const std::optional<std::filesystem::path>& suspicious,
        const std::optional<std::filesystem::path>& base);

    // The item at `suspicious`, proven inside `base` as above, opened for the
    // caller to act on without resolving a path again: the descriptor of its
    // parent directory (O_PATH), reached beneath the base's descriptor with
    // no link followed, and its name there. A link swapped into the path
    // after the check makes the open fail instead of leading elsewhere.
    // Null on failure with errno set: EXDEV when the item is not contained
    // (logged as above), else the error of the open that failed.
    struct ContainedItem {
        UniqueFd parent;
        std::string name;
        std::filesystem::path realPath;
    };
    std::optional<ContainedItem> openContainedItem(const std::filesystem::path& suspicious,
                                                   const std::filesystem::path& base);

    // The entry `suspicious` names, itself: like openContainedItem, but its
    // last component is not resolved, so a link there is the entry (as
    // rename(2) or unlink(2) of the path would take it). Its directory, with
    // every link before it resolved, is proven inside `base` too and opened
    // beneath the base's descriptor; `realPath` is that directory's real
    // path with the entry's name. The base itself is not an entry (EXDEV).
    std::optional<ContainedItem> openContainedEntry(const std::filesystem::path& suspicious,
                                                    const std::filesystem::path& base);
    // Renames `source` to `dest`, each reached through its directory's
    // descriptor, so the move happens where the checks were made. The same
    // file system is needed (EXDEV otherwise); a POSIX error on failure.
    bool moveContainedItem(const ContainedItem& source, const ContainedItem& dest,
                           BTHErrorRef* error);

    // The real path of `url` (realpath(3)); when `allowNonExistentPathComponents`
    // and a component is missing, that of its longest existing prefix with
    // the rest appended. Null on failure, logged ("Failed to realpath %s : %s
    // at %s").
    std::optional<std::filesystem::path> _realPathForURL(const std::filesystem::path& url,
                                                         bool allowNonExistentPathComponents);
    // The real path of the longest existing proper prefix of `path` (the
    // whole path first, the root alone never) with the missing components
    // appended; null when no prefix exists and resolves.
    std::optional<std::filesystem::path> _realPathWhatExistsInPath(const std::string& path);
    // Whether the depth of `path` (".." -1, a name +1, "", "." and "/" 0),
    // starting at `startingDepth`, never falls below it; the final depth in
    // `endingDepth`. False for a null path.
    static bool _validateSymlink(const std::string* path, int32_t startingDepth,
                                 int32_t* endingDepth);

    // Access control lists and ownership (BTHFileManager+ACL.cpp). System
    // containers are shared by system processes of different users through
    // the group "systemusers". Standardized, an item below a system
    // container's top has the owner -2:-2 (user and group 65534), nothing for
    // its owner and others, and ACL entries granting the group read, write
    // and execute; a directory passes the group's entries on to everything
    // created in it. The top keeps its mode and owner; the group may create
    // entries in it but not list it. The metadata file is never touched.
    //
    // Trees are walked without following links or entering other file
    // systems; each item is changed only through a descriptor checked to be
    // the item the walk saw; a link gets at most its own owner; a
    // non-directory with more than one hard link is left alone (logged), so a
    // planted link cannot hand an outside file over. A failure on one item is
    // logged and the walk goes on; only a failed walk fails the operation.
    // When "systemusers" cannot be resolved, every ACL operation fails with
    // 63 (BTHErrorACLFailed, "mbr_identifier_to_uuid() failed: %s") before
    // changing anything.

    // Gives the directory at `url` (never a link's target) the top-level
    // list, keeping its mode and owner. Fails with 63 "Failed to set ACL on
    // %@: %s", the cause beneath.
    bool setTopLevelSystemContainerACLAtURL(const std::filesystem::path& url, BTHErrorRef* error);
    // The tree at `url`; its root is a system container's top when
    // `isSystemContainer`, else treated like any directory below.
    bool standardizeACLsAtURL(const std::filesystem::path& url, bool isSystemContainer,
                              BTHErrorRef* error);
    bool standardizeACLsForSystemContainerAtURL(const std::filesystem::path& url,
                                                BTHErrorRef* error);
    // Every system container in `directory`; a missing directory succeeds;
    // fails with the last container's error after trying them all.
    bool standardizeAllSystemContainerACLsAtURL(const std::filesystem::path& directory,
                                                BTHErrorRef* error);
    // Bundle containers: owner uid:gid, mode 0755 for directories and
    // executables, 0644 for everything else (same link rules as above), then
    // the root once more; fails when the root cannot be looked at ("Could
    // not stat %s: %s").
    bool standardizeOwnershipAtURL(const std::filesystem::path& url, uid_t uid, gid_t gid,
                                   BTHErrorRef* error);

    // ----- Disk usage and protection classes (BTHDiskUsage.cpp,
    // BTHFileManager+Protection.cpp)

    // The bytes allocated to the files of the tree at `url` (allocation, not
    // length; directories' own blocks left out; a file with several links
    // counted once per call, wherever its links are). Breadth first; no link
    // is followed, the root included (a link there gives 0); a directory
    // swapped for a link mid-walk is left out. Never fails: what cannot be
    // read is logged and left out, so the result is a lower bound.
    uint64_t diskUsageForURL(const std::filesystem::path& url);

    // Logs (error level) every item left in the tree at `url`, one line
    // each; changes nothing.
    void printDirectoryStructureAtURL(const std::filesystem::path& url);

    // The protection class of the item at `url` (own or inherited), read
    // through a descriptor opened without following a link. Fails with the
    // open's error ("Failed to open %s : %s"; a link gives ELOOP) or the
    // class store's ("Failed to getclass of file %s: %s"; EPERM for an item
    // of class 1 while the device is locked).
    bool dataProtectionClassOfItemAtURL(const std::filesystem::path& url, int32_t* protectionClass,
                                        BTHErrorRef* error);
    // Gives the item at `url` the class, unless `predicate` (given the
    // current class) answers false, which succeeds without a change.
    using ProtectionPredicate = std::function<bool(int32_t currentClass)>;
    bool setDataProtectionClassOfItemAtURL(const std::filesystem::path& url,
                                           int32_t protectionClass,
                                           const ProtectionPredicate& predicate,
                                           BTHErrorRef* error);

  private:
    BTHFileManager() = default;
    bool copyItem(const std::filesystem::path& source, const std::filesystem::path& dest,
                  bool failIfSrcMissing, BTHErrorRef* error);
    bool moveItem(const std::filesystem::path& source, const std::filesystem::path& dest,
                  bool failIfSrcMissing, BTHErrorRef* error);
};

}  // namespace berth
