#include "platform/BulkDirectoryRead.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#if BERTH_HAVE_LIBURING
#include <liburing.h>
#endif

namespace berth::fs {

namespace {

// The record getdents64 writes; glibc declares no such type.
struct LinuxDirent64 {
    ino64_t d_ino;
    off64_t d_off;
    unsigned short d_reclen;
    unsigned char d_type;
    char d_name[];
};

constexpr unsigned kStatxMask = STATX_TYPE | STATX_NLINK | STATX_INO | STATX_BLOCKS;
// The cached attributes are good enough: nothing is gained by asking a
// network file system to revalidate every entry of a measurement.
constexpr int kStatxFlags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_STATX_DONT_SYNC;

bool isDotEntry(const char* name) {
    return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

BulkEntry::Type typeOfDirent(unsigned char type) {
    switch (type) {
        case DT_DIR:
            return BulkEntry::Type::Directory;
        case DT_REG:
            return BulkEntry::Type::File;
        case DT_LNK:
            return BulkEntry::Type::Symlink;
        default:
            return BulkEntry::Type::Other;
    }
}

BulkEntry::Type typeOfMode(mode_t mode) {
    if (S_ISDIR(mode)) return BulkEntry::Type::Directory;
    if (S_ISREG(mode)) return BulkEntry::Type::File;
    if (S_ISLNK(mode)) return BulkEntry::Type::Symlink;
    return BulkEntry::Type::Other;
}

// Fills the attributes of one entry from its statx answer.
void takeStatx(const struct statx& sx, BulkEntry* entry) {
    if (sx.stx_mask & STATX_TYPE) {
        entry->type = typeOfMode(sx.stx_mode);
        entry->returned |= BulkEntry::kType;
    }
    if (sx.stx_mask & STATX_INO) {
        entry->fileId = sx.stx_ino;
        entry->device = makedev(sx.stx_dev_major, sx.stx_dev_minor);
        entry->returned |= BulkEntry::kFileId;
    }
    if (entry->type == BulkEntry::Type::Directory) return;
    if (sx.stx_mask & STATX_NLINK) {
        entry->linkCount = sx.stx_nlink;
        entry->returned |= BulkEntry::kLinkCount;
    }
    if (sx.stx_mask & STATX_BLOCKS) {
        entry->allocSize = sx.stx_blocks * 512;
        entry->returned |= BulkEntry::kAllocSize;
    }
}

}  // namespace

// Where io_uring is available, the attributes of a whole batch are asked
// for in one submission: the kernel fetches them in parallel on its own
// workers while this thread waits once. Otherwise one statx per entry.
struct BulkDirectoryReader::Attributes {
#if !BERTH_HAVE_LIBURING
    explicit Attributes(bool) {}
#else
    static constexpr unsigned kDepth = 256;
    io_uring ring{};
    bool ready = false;
    bool failed = false;  // set up, then failed
    std::vector<struct statx> answers = std::vector<struct statx>(kDepth);

    explicit Attributes(bool batched) {
        ready = batched && ::io_uring_queue_init(kDepth, &ring, 0) == 0;
    }
    ~Attributes() {
        if (ready || failed) ::io_uring_queue_exit(&ring);
    }

    // Fetches the attributes of `entries` at `pending` (at most kDepth).
    // False when the ring failed; every request it took has then been
    // answered (the kernel writes nothing later) and the ring is not used
    // again.
    bool fetch(int dirFd, std::vector<BulkEntry>& entries, const std::vector<size_t>& pending,
               size_t first, size_t count) {
        for (size_t i = 0; i < count; ++i) {
            io_uring_sqe* sqe = ::io_uring_get_sqe(&ring);
            if (!sqe) return false;  // never: the ring is empty between batches
            BulkEntry& entry = entries[pending[first + i]];
            ::io_uring_prep_statx(sqe, dirFd, entry.name.data(), kStatxFlags, kStatxMask,
                                  &answers[i]);
            ::io_uring_sqe_set_data64(sqe, i);
            // The kernel never answers a statx without blocking: skip the
            // attempt and hand it to a worker at once.
            sqe->flags |= IOSQE_ASYNC;
        }
        int submitted;
        do submitted = ::io_uring_submit(&ring);
        while (submitted == -EINTR);
        bool complete = submitted == static_cast<int>(count);
        for (int seen = 0; seen < std::max(submitted, 0); ++seen) {
            io_uring_cqe* cqe = nullptr;
            int err;
            do err = ::io_uring_wait_cqe(&ring, &cqe);
            while (err == -EINTR);
            if (err != 0) std::abort();  // requests in flight could write later: unrecoverable
            const size_t i = ::io_uring_cqe_get_data64(cqe);
            BulkEntry& entry = entries[pending[first + i]];
            if (cqe->res < 0) {
                entry.error = -cqe->res;
                entry.returned |= BulkEntry::kError;
            } else {
                takeStatx(answers[i], &entry);
            }
            ::io_uring_cqe_seen(&ring, cqe);
        }
        return complete;
    }
#endif
};

BulkDirectoryReader::BulkDirectoryReader(bool batched)
    : buffer_(std::make_unique<unsigned char[]>(kBufferSize)),
      attributes_(std::make_unique<Attributes>(batched)) {}

BulkDirectoryReader::~BulkDirectoryReader() = default;

int BulkDirectoryReader::read(int dirFd, std::vector<BulkEntry>* entries) {
    entries->clear();
    for (;;) {
        const long n = ::syscall(SYS_getdents64, dirFd, buffer_.get(), kBufferSize);
        if (n <= 0) return static_cast<int>(n);
        int consumed = 0;
        for (long offset = 0; offset < n;) {
            const auto* raw = reinterpret_cast<const LinuxDirent64*>(buffer_.get() + offset);
            offset += raw->d_reclen;
            ++consumed;
            if (isDotEntry(raw->d_name)) continue;
            BulkEntry entry;
            entry.name = std::string_view(raw->d_name);
            entry.returned = BulkEntry::kName;
            if (raw->d_type != DT_UNKNOWN) {
                entry.type = typeOfDirent(raw->d_type);
                entry.returned |= BulkEntry::kType;
            }
            if (entry.type == BulkEntry::Type::Directory) {
                // What a directory needs (its file id) came with the entry.
                entry.fileId = raw->d_ino;
                entry.returned |= BulkEntry::kFileId;
            }
            entries->push_back(entry);
        }
        if (entries->empty()) continue;
        fetchAttributes(dirFd, entries);
        return consumed;
    }
}

void BulkDirectoryReader::fetchAttributes(int dirFd, std::vector<BulkEntry>* entries) {
#if BERTH_HAVE_LIBURING
    if (attributes_->ready) {
        pending_.clear();
        for (size_t i = 0; i < entries->size(); ++i) {
            const BulkEntry& entry = (*entries)[i];
            if (!(entry.has(BulkEntry::kType) && entry.type == BulkEntry::Type::Directory))
                pending_.push_back(i);
        }
        bool fetched = true;
        for (size_t first = 0; fetched && first < pending_.size(); first += Attributes::kDepth)
            fetched =
                attributes_->fetch(dirFd, *entries, pending_, first,
                                   std::min<size_t>(Attributes::kDepth, pending_.size() - first));
        if (fetched) return;
        // A ring that failed is not trusted again (it is closed when the
        // reader goes); this batch is fetched one entry at a time.
        attributes_->ready = false;
        attributes_->failed = true;
        for (size_t i : pending_) (*entries)[i].returned &= BulkEntry::kName | BulkEntry::kType;
    }
#endif
    for (BulkEntry& entry : *entries) {
        if (entry.has(BulkEntry::kType) && entry.type == BulkEntry::Type::Directory) continue;
        // The name is NUL-terminated in the buffer: getdents64 writes it so.
        struct statx sx;
        if (::statx(dirFd, entry.name.data(), kStatxFlags, kStatxMask, &sx) != 0) {
            entry.error = errno;
            entry.returned |= BulkEntry::kError;
            continue;
        }
        takeStatx(sx, &entry);
    }
}

}  // namespace berth::fs
