// What a tree occupies on disk, and the log listing of what is left in a
// directory.
//
// The measurement walks breadth first and reads each directory in bulk. The
// tree belongs to an app that may swap any directory for a link while it is
// measured, so the root is opened without following a link anywhere below
// the device root, and every directory beneath it is opened relative to the
// root's descriptor with the kernel refusing any link on the way and any
// step outside the root: a swap makes that directory unreadable (logged, left
// out), never counts or opens anything outside the tree.
#include <fcntl.h>
#include <fts.h>
#include <linux/openat2.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <deque>
#include <unordered_set>

#include "BTHFileManager+Internal.h"
#include "BTHFileManager.h"
#include "BTHLog.h"
#include "platform/BulkDirectoryRead.h"
#include "platform/SafeFs.h"

namespace berth {

using filemanager::errorText;

namespace {

// A file's identity for counting hard links once.
struct FileId {
    dev_t device;
    uint64_t inode;
    bool operator==(const FileId&) const = default;
};

struct FileIdHash {
    size_t operator()(const FileId& id) const {
        return std::hash<uint64_t>()(id.inode) ^ (std::hash<uint64_t>()(id.device) << 1);
    }
};

// Opens the directory `relative` (empty: the root itself) beneath `rootFd`;
// no component may be a link, and no step may leave the root.
UniqueFd openBeneath(int rootFd, const std::string& relative) {
    if (relative.empty())
        return UniqueFd(::openat(rootFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    struct open_how how {};
    how.flags = O_RDONLY | O_NOFOLLOW | O_DIRECTORY | O_CLOEXEC;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
    return UniqueFd(
        static_cast<int>(::syscall(SYS_openat2, rootFd, relative.c_str(), &how, sizeof how)));
}

// One measurement: the work list of directories still to read (paths
// relative to the root), the total, and the files with several links
// already counted.
class DiskUsageWalk {
  public:
    explicit DiskUsageWalk(const std::filesystem::path& root) : root_(root) {}

    uint64_t run();

  private:
    std::filesystem::path pathOf(const std::string& relative) const {
        return relative.empty() ? root_ : root_ / relative;
    }
    void readDirectory(int dirFd, const std::string& relative);
    void take(const fs::BulkEntry& entry, uint64_t entryNumber, const std::string& relative);

    std::filesystem::path root_;
    std::deque<std::string> work_;
    uint64_t total_ = 0;
    std::unordered_set<FileId, FileIdHash> counted_;
    fs::BulkDirectoryReader reader_;
    std::vector<fs::BulkEntry> batch_;
};

uint64_t DiskUsageWalk::run() {
    BTH_FUNCTION("-[BTHFileManager diskUsageForURL:]");
    UniqueFd rootFd = fs::openNoFollow(root_, O_RDONLY | O_DIRECTORY);
    if (!rootFd) {
        BTHLogError("Failed to open directory %@ : %s", root_, errorText(errno));
        return 0;
    }
    readDirectory(rootFd.get(), std::string());
    while (!work_.empty()) {
        const std::string relative = std::move(work_.front());
        work_.pop_front();
        UniqueFd dirFd = openBeneath(rootFd.get(), relative);
        if (!dirFd) {
            BTHLogError("Failed to open directory %@ : %s", pathOf(relative), errorText(errno));
            continue;
        }
        readDirectory(dirFd.get(), relative);
    }
    return total_;
}

void DiskUsageWalk::readDirectory(int dirFd, const std::string& relative) {
    BTH_FUNCTION("-[BTHFileManager diskUsageForURL:]");
    uint64_t entryNumber = 0;
    for (;;) {
        const int n = reader_.read(dirFd, &batch_);
        if (n == 0) return;
        if (n < 0) {
            BTHLogError("getattrlistbulk on entry %llu in %@ returned error %s", entryNumber,
                        pathOf(relative), errorText(errno));
            return;
        }
        for (const fs::BulkEntry& entry : batch_) take(entry, entryNumber++, relative);
    }
}

void DiskUsageWalk::take(const fs::BulkEntry& entry, uint64_t entryNumber,
                         const std::string& relative) {
    BTH_FUNCTION("-[BTHFileManager diskUsageForURL:]");
    using Entry = fs::BulkEntry;
    if (entry.has(Entry::kError) && entry.error != 0) {
        BTHLogError("Got error %s while processing entry %llu in %@", errorText(entry.error),
                    entryNumber, pathOf(relative));
        return;
    }
    if (entry.has(Entry::kType) && entry.type == Entry::Type::Directory) {
        // A directory's own blocks are not the app's data: only its contents
        // count.
        if (entry.has(Entry::kEntryCount) && entry.entryCount == 0) {
            BTHLogDebug("skipping empty directory at %@/%s", pathOf(relative),
                        std::string(entry.name));
            return;
        }
        if (!entry.has(Entry::kName)) {
            BTHLogError(
                "Failed to get name for directory item %llu in %@; not counting its "
                "children",
                entryNumber, pathOf(relative));
            return;
        }
        std::string child = relative;
        if (!child.empty()) child += '/';
        child.append(entry.name);
        work_.push_back(std::move(child));
        return;
    }
    const uint64_t size = entry.has(Entry::kAllocSize) ? entry.allocSize : 0;
    if (entry.has(Entry::kLinkCount) && entry.linkCount == 1) {
        total_ += size;
        return;
    }
    const FileId id{entry.device, entry.fileId};
    if (!counted_.insert(id).second) {
        BTHLogDebug("Skipping hardlinked file at %@/%s", pathOf(relative), std::string(entry.name));
        return;
    }
    total_ += size;
}

}  // namespace

uint64_t BTHFileManager::diskUsageForURL(const std::filesystem::path& url) {
    BTH_FUNCTION("-[BTHFileManager diskUsageForURL:]");
    if (url.empty()) {
        BTHLogError("Failed to get path to url %@", url);
        return 0;
    }
    return DiskUsageWalk(url).run();
}

void BTHFileManager::printDirectoryStructureAtURL(const std::filesystem::path& url) {
    BTH_FUNCTION("-[BTHFileManager printDirectoryStructureAtURL:]");
    // Only the names are read and logged: following a link here could list
    // another tree but never change it, and the walk follows none anyway.
    std::string path = url.string();
    char* paths[] = {path.data(), nullptr};
    FTS* fts = ::fts_open(paths, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr);
    if (!fts) {
        BTHLogError("fts_open failed for %@ : %s", url, errorText(errno));
        return;
    }
    while (FTSENT* entry = ::fts_read(fts)) {
        switch (entry->fts_info) {
            case FTS_D:
            case FTS_F:
            case FTS_SL:
            case FTS_SLNONE:
            case FTS_DEFAULT:
                BTHLogError("\tOrphaned File: %s", entry->fts_path);
                break;
            case FTS_DP:
                break;
            default:
                BTHLogError("FTS returned error for %s : %s", entry->fts_path,
                            errorText(entry->fts_errno));
        }
    }
    ::fts_close(fts);
}

}  // namespace berth
