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

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <optional>
#include <thread>
#include <unordered_set>
#include <vector>

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

// The longest piece of a relative path opened in one step; a deeper
// directory is reached piece by piece, each beneath the last.
constexpr size_t kPathPiece = 2048;

UniqueFd openPieceBeneath(int dirFd, const std::string& piece) {
    struct open_how how {};
    how.flags = O_RDONLY | O_NOFOLLOW | O_DIRECTORY | O_CLOEXEC;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;
    return UniqueFd(
        static_cast<int>(::syscall(SYS_openat2, dirFd, piece.c_str(), &how, sizeof how)));
}

// Opens the directory `relative` (empty: the root itself) beneath `rootFd`;
// no component may be a link, and no step may leave the root. Paths longer
// than the kernel takes in one call (an app may nest its directories deeper
// than any path allows) are opened in pieces.
UniqueFd openBeneath(int rootFd, const std::string& relative) {
    if (relative.empty())
        return UniqueFd(::openat(rootFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    UniqueFd dir;
    size_t start = 0;
    while (start < relative.size()) {
        size_t end = relative.size();
        if (end - start > kPathPiece) {
            end = relative.rfind('/', start + kPathPiece);
            if (end == std::string::npos || end <= start) {
                errno = ENAMETOOLONG;  // one name longer than a piece
                return UniqueFd();
            }
        }
        dir = openPieceBeneath(dir ? dir.get() : rootFd, relative.substr(start, end - start));
        if (!dir) return dir;
        start = end + 1;
    }
    return dir;
}

// One measurement: the work list of directories still to read (paths
// relative to the root, first in first out), the files with several links
// already counted, and the readers. Large trees are read by a few threads
// at once, each with its own reader and buffer, taking directories from the
// shared list; the total is the same whichever thread reads what.
class DiskUsageWalk {
  public:
    explicit DiskUsageWalk(const std::filesystem::path& root) : root_(root) {}

    uint64_t run();

  private:
    // What one thread reads with, and what it has counted.
    struct Reader {
        fs::BulkDirectoryReader bulk;
        std::vector<fs::BulkEntry> batch;
        std::vector<std::string> children;  // of the directory being read
        uint64_t total = 0;
    };

    std::filesystem::path pathOf(const std::string& relative) const {
        return relative.empty() ? root_ : root_ / relative;
    }
    void work(Reader& reader);
    std::optional<std::string> nextDirectory();
    void finishDirectory(Reader& reader);
    void readDirectory(Reader& reader, int dirFd, const std::string& relative);
    void take(Reader& reader, const fs::BulkEntry& entry, uint64_t entryNumber,
              const std::string& relative);

    // More threads than cores only wait; a few are enough to keep the file
    // system's caches busy.
    static constexpr unsigned kMaxReaders = 4;

    std::filesystem::path root_;
    UniqueFd rootFd_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<std::string> work_;
    size_t reading_ = 0;  // directories taken and not yet finished
    std::unordered_set<FileId, FileIdHash> counted_;
};

uint64_t DiskUsageWalk::run() {
    BTH_FUNCTION("-[BTHFileManager diskUsageForURL:]");
    rootFd_ = fs::openNoFollow(root_, O_RDONLY | O_DIRECTORY);
    if (!rootFd_) {
        BTHLogError("Failed to open directory %@ : %s", root_, errorText(errno));
        return 0;
    }
    Reader first;
    readDirectory(first, rootFd_.get(), std::string());
    finishDirectory(first);
    const unsigned cores = std::max(1u, std::thread::hardware_concurrency());
    // A root without subdirectories is done; otherwise the others read too.
    const size_t helpers = work_.empty() ? 0 : std::min(cores, kMaxReaders) - 1;
    std::vector<Reader> readers(helpers);
    std::vector<std::thread> threads;
    for (Reader& reader : readers) threads.emplace_back([this, &reader] { work(reader); });
    work(first);
    for (std::thread& thread : threads) thread.join();
    uint64_t total = first.total;
    for (const Reader& reader : readers) total += reader.total;
    return total;
}

void DiskUsageWalk::work(Reader& reader) {
    BTH_FUNCTION("-[BTHFileManager diskUsageForURL:]");
    while (std::optional<std::string> relative = nextDirectory()) {
        UniqueFd dirFd = openBeneath(rootFd_.get(), *relative);
        if (dirFd)
            readDirectory(reader, dirFd.get(), *relative);
        else
            BTHLogError("Failed to open directory %@ : %s", pathOf(*relative), errorText(errno));
        finishDirectory(reader);
    }
}

// The next directory to read; none once the list is empty and no directory
// being read can add to it.
std::optional<std::string> DiskUsageWalk::nextDirectory() {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [this] { return !work_.empty() || reading_ == 0; });
    if (work_.empty()) return std::nullopt;
    std::string relative = std::move(work_.front());
    work_.pop_front();
    ++reading_;
    return relative;
}

// Hands the children of the directory just read to the list.
void DiskUsageWalk::finishDirectory(Reader& reader) {
    {
        std::lock_guard lock(mutex_);
        for (std::string& child : reader.children) work_.push_back(std::move(child));
        if (reading_ > 0) --reading_;
    }
    reader.children.clear();
    changed_.notify_all();
}

void DiskUsageWalk::readDirectory(Reader& reader, int dirFd, const std::string& relative) {
    BTH_FUNCTION("-[BTHFileManager diskUsageForURL:]");
    uint64_t entryNumber = 0;
    for (;;) {
        const int n = reader.bulk.read(dirFd, &reader.batch);
        if (n == 0) return;
        if (n < 0) {
            BTHLogError("getattrlistbulk on entry %llu in %@ returned error %s", entryNumber,
                        pathOf(relative), errorText(errno));
            return;
        }
        for (const fs::BulkEntry& entry : reader.batch)
            take(reader, entry, entryNumber++, relative);
    }
}

void DiskUsageWalk::take(Reader& reader, const fs::BulkEntry& entry, uint64_t entryNumber,
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
        reader.children.push_back(std::move(child));
        return;
    }
    const uint64_t size = entry.has(Entry::kAllocSize) ? entry.allocSize : 0;
    if (entry.has(Entry::kLinkCount) && entry.linkCount == 1) {
        reader.total += size;
        return;
    }
    bool first;
    {
        std::lock_guard lock(mutex_);
        first = counted_.insert(FileId{entry.device, entry.fileId}).second;
    }
    if (!first) {
        BTHLogDebug("Skipping hardlinked file at %@/%s", pathOf(relative), std::string(entry.name));
        return;
    }
    reader.total += size;
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
