#include "platform/SyncTogether.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <optional>

#if BERTH_HAVE_LIBURING
#include <liburing.h>
#endif

namespace berth {

namespace {

int syncOneByOne(std::span<const int> fds) {
    int first = 0;
    for (const int fd : fds)
        if (::fsync(fd) != 0 && first == 0) first = errno;
    return first;
}

#if BERTH_HAVE_LIBURING
// One ring per thread, made on first use and kept: the syncs of one call are
// all answered before it returns, so the ring is empty between calls.
class SyncRing {
  public:
    static constexpr unsigned kDepth = 8;

    SyncRing() { ready_ = ::io_uring_queue_init(kDepth, &ring_, 0) == 0; }
    ~SyncRing() {
        if (ready_) ::io_uring_queue_exit(&ring_);
    }
    SyncRing(const SyncRing&) = delete;
    SyncRing& operator=(const SyncRing&) = delete;

    // nullopt when the ring cannot take the batch (the caller syncs one by
    // one); a ring that failed part-way is given up for good, after every
    // sync it took has been answered.
    std::optional<int> sync(std::span<const int> fds) {
        if (!ready_ || fds.size() > kDepth) return std::nullopt;
        for (const int fd : fds) {
            io_uring_sqe* sqe = ::io_uring_get_sqe(&ring_);
            if (!sqe) return std::nullopt;  // never: the ring is empty between calls
            ::io_uring_prep_fsync(sqe, fd, 0);
            // An fsync always blocks: straight to a worker, so they run side by side.
            sqe->flags |= IOSQE_ASYNC;
        }
        int submitted;
        do submitted = ::io_uring_submit(&ring_);
        while (submitted == -EINTR);
        int first = 0;
        for (int seen = 0; seen < std::max(submitted, 0); ++seen) {
            io_uring_cqe* cqe = nullptr;
            int err;
            do err = ::io_uring_wait_cqe(&ring_, &cqe);
            while (err == -EINTR);
            if (err < 0) {
                ready_ = false;
                return std::nullopt;
            }
            if (cqe->res < 0 && first == 0) first = -cqe->res;
            ::io_uring_cqe_seen(&ring_, cqe);
        }
        if (submitted != static_cast<int>(fds.size())) {
            ready_ = false;
            if (submitted <= 0) return std::nullopt;
            // What the ring did not take is synced the plain way.
            const int rest = syncOneByOne(fds.subspan(static_cast<size_t>(submitted)));
            return first != 0 ? first : rest;
        }
        return first;
    }

  private:
    io_uring ring_{};
    bool ready_ = false;
};
#endif

}  // namespace

int syncTogether(std::span<const int> fds) {
#if BERTH_HAVE_LIBURING
    if (fds.size() > 1) {
        thread_local SyncRing ring;
        if (const std::optional<int> result = ring.sync(fds)) return *result;
    }
#endif
    return syncOneByOne(fds);
}

}  // namespace berth
