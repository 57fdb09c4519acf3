// Tells with one cheap call that none of a set of files and directories has
// changed since a moment, so that a decision resting on them need not be
// re-checked item by item.
//
// Each watched item is watched by the kernel (inotify) together with its name
// in every directory above it up to "/": a write, truncation, chmod, chown or
// link-count change of the item, a rename or removal of it or of any
// directory on the way, or another item put in its place shows up as an
// event. Events for other names in those directories are not changes, and
// writes into other files there are not even asked for. A queue that holds
// more events than a few reads take counts as a change, so that a flood of
// events in a busy directory costs the callers their own checks and never
// keeps them reading.
//
// The kernel queues an event before the system call that caused it returns,
// so a change completed before unchangedSince() is asked is seen by it: either
// still queued (the call reads the queue) or already read by another thread
// (a reader announces itself before it reads; see the implementation). A
// queue that overflowed counts as a change of everything.
//
// Not seen, and so to be checked otherwise by whoever relies on the watch:
// writes through a shared memory mapping, and anything about a process (what
// it runs, which group it is in). Watches are never given up while the item
// exists; the kernel drops them when it goes.
#pragma once

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/UniqueFd.h"

namespace berth {

class ChangeWatch {
    struct Passkey {};

  public:
    // What counts as a change of an item: everything above, or only what
    // changes the names on its way (a removal, rename or replacement of it
    // or of a directory above it), for callers that rely on an item being
    // there and not on what it holds, so that writes and chmods do not cost
    // them their checks.
    enum class Kind { kContentsAndNames, kNamesOnly };

    // A watch with an inotify instance of its own; null, with the reason,
    // when the kernel gives none (then nothing can be watched).
    static std::unique_ptr<ChangeWatch> make(std::string* why = nullptr,
                                             Kind kind = Kind::kContentsAndNames);
    ChangeWatch(Passkey, UniqueFd inotify, Kind kind) : inotify_(std::move(inotify)), kind_(kind) {}
    ChangeWatch(const ChangeWatch&) = delete;
    ChangeWatch& operator=(const ChangeWatch&) = delete;

    // The moment to compare with later. Take it before the checks that the
    // watch is to stand for: a change after it is then either seen by those
    // checks or by unchangedSince().
    uint64_t now();

    // What one watch() call watches: the item and each directory above it,
    // with the name looked up in each. Lets a caller ask about its own path
    // only (see unchangedSince below).
    struct Ticket {
        std::vector<std::pair<int, std::string>> names;  // (kernel watch, name or "")
    };

    // Watches the item at the absolute `path` (a last link is watched itself,
    // not followed) and its name in each directory above it; `ticket`, when
    // given, receives what was watched. False when any of it cannot be
    // watched (a component is missing, the kernel's limit of watches is
    // reached): a decision resting on `path` must not rely on the watch then.
    bool watch(const std::filesystem::path& path, Ticket* ticket = nullptr);

    // True when no watched item changed since `moment`; false when one did,
    // or may have.
    bool unchangedSince(uint64_t moment);
    // True when nothing that `ticket` names changed since `moment` (taken
    // before the watch() that gave the ticket, or later), whatever else did;
    // false when it did, or may have (an overflowed or flooded queue, or
    // more changed names than are remembered, count for every ticket).
    bool unchangedSince(const Ticket& ticket, uint64_t moment);

  private:
    // Reads every queued event, counting the changes among them.
    void drain();
    // True when the queue is empty and no thread began reading it since
    // reading_ was `reading` (so every change before the call is counted).
    bool nothingQueuedSince(uint64_t reading);
    // Whether an event is a change of something watched; forgets names and
    // watches that the event shows are gone. Called with mutex_ held.
    // A change is noted as `count`, the count it makes.
    bool isChange(int wd, uint32_t mask, const char* name, uint64_t count);
    // Notes a change counted as `count`: of the name `name` in watch `wd`
    // ("" for the watched item or directory itself), or with `wd` < 0 of
    // everything. Called with mutex_ held.
    void countChange(int wd, const std::string& name, uint64_t count);
    // Adds (or finds) the kernel's watch of `path` and, when `child` is not
    // empty, takes note of that name in it; both go to `ticket` when given. Called with mutex_
    // held.
    bool watchItem(const std::filesystem::path& path, const std::string& child, Ticket* ticket);

    const UniqueFd inotify_;
    const Kind kind_;
    // Changes seen so far; a moment is a value of it.
    std::atomic<uint64_t> changes_{0};
    // Odd while a thread reads the queue: announced before the read, so a
    // caller that found the queue empty can tell that events may have been
    // taken from under it.
    std::atomic<uint64_t> reading_{0};

    std::mutex mutex_;  // one reader of the queue at a time; guards names_
    // Per kernel watch, the names in it that matter (empty for a watch of an
    // item itself only).
    std::map<int, std::set<std::string>> names_;
    size_t nameCount_ = 0;
    // The count at the last change of each (watch, name) that changed, and
    // the count at the last change of everything (before which no ticket
    // holds). Guarded by mutex_.
    std::map<std::pair<int, std::string>, uint64_t> changedAt_;
    uint64_t everythingChangedAt_ = 0;
};

}  // namespace berth
