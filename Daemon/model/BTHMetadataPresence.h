// Whether containers' metadata files are still where the cache recorded
// them, answered for the common case - nothing on their way changed since a
// file was last found - by one call on a change watch instead of a walk of
// the file's path.
//
// A file found present is watched (ChangeWatch, names only: the file's name
// and the name of every directory above it), with the watch's moment taken
// before the disk check. Until the watch counts a change of one of those
// names, the file is still there: removing or renaming it or a directory on
// its way, or putting another item (a link) in the place of one, is such a
// change; changes of other files' names cost one look at the watch's notes.
// After a change of its own names (or an overflowed queue), or when nothing
// can be watched, a file is checked on the disk as
// BTHFileManager::itemExistsAtURL does (no link on the way followed), and
// watched again. Not seen by the watch: a file system mounted over a
// directory on the way, which only root can do.
//
// Re-watching walks every directory on the way. A file whose names changed
// is watched again at most once per kRewatchInterval, so that someone
// renaming its names in a loop costs the daemon no more than the disk checks
// it made before there was a watch.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>

#include "platform/ChangeWatch.h"

namespace berth {

class BTHMetadataPresence {
  public:
    BTHMetadataPresence();
    BTHMetadataPresence(const BTHMetadataPresence&) = delete;
    BTHMetadataPresence& operator=(const BTHMetadataPresence&) = delete;

    // Whether an item (a link counts as one) is at the metadata file of the
    // container at `container`, an absolute path, with no link on the way.
    // Safe from any thread.
    bool metadataFileExists(const std::filesystem::path& container);

    // Forgets every file found (the watch stays).
    void reset();

    static constexpr std::chrono::milliseconds kRewatchInterval{100};

  private:
    struct Found {
        ChangeWatch::Ticket ticket;  // the file's names, as watched
        uint64_t moment;             // the watch's, taken before the file was found
        std::chrono::steady_clock::time_point watchedAt;
    };
    void remember(const std::filesystem::path& container, Found found);
    // Files remembered at most; beyond it all are forgotten at once.
    static constexpr size_t kMaxFound = size_t{1} << 16;

    std::unique_ptr<ChangeWatch> watch_;  // null: every check goes to the disk
    std::mutex mutex_;                    // guards found_
    std::unordered_map<std::string, Found> found_;
};

}  // namespace berth
