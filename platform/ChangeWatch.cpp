#include "platform/ChangeWatch.h"

#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace berth {

namespace {

// What changes the names in a directory, or its owner and mode. Writes into
// its files are left out: in a busy directory on the way ("/tmp", say) they
// would be most of the events, and none of them is a change.
constexpr uint32_t kDirectoryMask =
    IN_ATTRIB | IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_MOVE_SELF | IN_DELETE_SELF;
// What changes a watched item itself: the above and its contents.
constexpr uint32_t kItemMask = kDirectoryMask | IN_MODIFY;
// What changes the names on the way to an item, and the item's own.
constexpr uint32_t kNamesMask =
    IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_MOVE_SELF | IN_DELETE_SELF;

// Reads of the queue per drain. A queue still not empty after them is taken
// for a change, so a flood of events costs the callers their stats but never
// holds them in the drain.
constexpr int kMaxReadsPerDrain = 4;

// Names noted across all watches; beyond it nothing more is watched, so a
// daemon that meets ever new files keeps bounded memory.
constexpr size_t kMaxNames = size_t{1} << 16;

}  // namespace

std::unique_ptr<ChangeWatch> ChangeWatch::make(std::string* why, Kind kind) {
    UniqueFd inotify(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!inotify) {
        if (why) *why = std::string("no inotify instance: ") + strerror(errno);
        return nullptr;
    }
    return std::make_unique<ChangeWatch>(Passkey{}, std::move(inotify), kind);
}

uint64_t ChangeWatch::now() {
    drain();
    return changes_.load();
}

bool ChangeWatch::watch(const std::filesystem::path& path, Ticket* ticket) {
    std::string item = path.lexically_normal().string();
    while (item.size() > 1 && item.back() == '/') item.pop_back();
    if (item.empty() || item.front() != '/') return false;
    if (ticket) ticket->names.clear();
    std::lock_guard lock(mutex_);
    if (!watchItem(item, {}, ticket)) return false;
    while (item != "/") {
        const size_t slash = item.rfind('/');
        const std::string name = item.substr(slash + 1);
        item = slash == 0 ? std::string("/") : item.substr(0, slash);
        if (!watchItem(item, name, ticket)) return false;
    }
    return true;
}

bool ChangeWatch::watchItem(const std::filesystem::path& path, const std::string& child,
                            Ticket* ticket) {
    // The item itself is watched as it is (a link as a link, as it was
    // recorded); a directory on the way is watched where it leads, since the
    // names below it are looked up there.
    uint32_t mask = child.empty() ? kItemMask | IN_DONT_FOLLOW : kDirectoryMask;
    if (kind_ == Kind::kNamesOnly) mask = kNamesMask | (mask & IN_DONT_FOLLOW);
    const int wd = ::inotify_add_watch(inotify_.get(), path.c_str(), mask);
    if (wd < 0) return false;
    if (ticket) {
        ticket->names.emplace_back(wd, std::string());
        if (!child.empty()) ticket->names.emplace_back(wd, child);
    }
    std::set<std::string>& names = names_[wd];
    if (child.empty() || names.count(child)) return true;
    if (nameCount_ >= kMaxNames) return false;
    names.insert(child);
    ++nameCount_;
    return true;
}

bool ChangeWatch::unchangedSince(uint64_t moment) {
    // Without taking the lock: nothing was counted since `moment`, nothing is
    // queued, and no thread began reading the queue meanwhile (it could hold
    // an event not yet counted). Any doubt: read the queue, as one thread at
    // a time does, and count.
    const uint64_t reading = reading_.load();
    if (changes_.load() != moment) return false;
    if (nothingQueuedSince(reading)) return true;
    drain();
    return changes_.load() == moment;
}

bool ChangeWatch::nothingQueuedSince(uint64_t reading) {
    int queued = 0;
    return (reading & 1) == 0 && ::ioctl(inotify_.get(), FIONREAD, &queued) == 0 && queued == 0 &&
           reading_.load() == reading;
}

bool ChangeWatch::unchangedSince(const Ticket& ticket, uint64_t moment) {
    if (unchangedSince(moment)) return true;
    // Something changed: whatever is queued now is counted before the names
    // are looked at (as in unchangedSince(moment), a reader mid-way is
    // waited for).
    if (!nothingQueuedSince(reading_.load())) drain();
    std::lock_guard lock(mutex_);
    if (everythingChangedAt_ > moment) return false;
    for (const auto& name : ticket.names) {
        const auto changed = changedAt_.find(name);
        if (changed != changedAt_.end() && changed->second > moment) return false;
    }
    return true;
}

void ChangeWatch::drain() {
    std::lock_guard lock(mutex_);
    reading_.fetch_add(1);
    // Only drain() adds to the count, under the lock: each change found here
    // is counted as the one after the count so far.
    const uint64_t before = changes_.load();
    uint64_t found = 0;
    alignas(inotify_event) char buffer[16 * 1024];
    for (int reads = 0;; ++reads) {
        if (reads == kMaxReadsPerDrain) {
            countChange(-1, {}, before + ++found);
            break;
        }
        const ssize_t count = ::read(inotify_.get(), buffer, sizeof buffer);
        if (count < 0 && errno == EINTR) continue;
        if (count <= 0) {
            // Anything but an empty queue leaves the queue unknown.
            if (count == 0 || errno != EAGAIN) countChange(-1, {}, before + ++found);
            break;
        }
        for (ssize_t at = 0; at < count;) {
            const auto* event = reinterpret_cast<const inotify_event*>(buffer + at);
            if (isChange(event->wd, event->mask, event->len ? event->name : nullptr,
                         before + found + 1))
                ++found;
            at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
        }
    }
    if (found) changes_.fetch_add(found);
    reading_.fetch_add(1);
}

void ChangeWatch::countChange(int wd, const std::string& name, uint64_t count) {
    if (wd < 0 || changedAt_.size() >= kMaxNames) {
        // Beyond the names remembered, everything counts as changed.
        changedAt_.clear();
        everythingChangedAt_ = count;
        return;
    }
    changedAt_[{wd, name}] = count;
}

bool ChangeWatch::isChange(int wd, uint32_t mask, const char* name, uint64_t count) {
    if (mask & IN_Q_OVERFLOW) {
        countChange(-1, {}, count);
        return true;
    }
    const auto watched = names_.find(wd);
    if (mask & IN_IGNORED) {
        // The item is gone (or its file system): so is the kernel's watch.
        if (watched != names_.end()) {
            nameCount_ -= watched->second.size();
            names_.erase(watched);
        }
        countChange(wd, {}, count);
        return true;
    }
    if (watched == names_.end()) return false;
    if (!name || !*name) {  // the item itself
        countChange(wd, {}, count);
        return true;
    }
    std::set<std::string>& names = watched->second;
    const auto found = names.find(name);
    if (found == names.end()) return false;
    countChange(wd, *found, count);
    if (mask & (IN_DELETE | IN_MOVED_FROM)) {
        // Whoever relied on the name watches it again before relying anew.
        names.erase(found);
        --nameCount_;
    }
    return true;
}

}  // namespace berth
