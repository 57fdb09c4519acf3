// Making changes to a directory's entries durable, shared among concurrent
// callers (group commit).
//
// A new entry (a rename into place) survives a power loss only once its
// directory has been synced, and one sync covers every change made before it
// started. So a caller notes its change, then waits for a sync that started
// after the note: if one is already running it waits for the next, which the
// first waiter to find none running starts for everybody waiting. Under load
// many changes share one sync; alone, a change costs one sync as before.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "BTHError.h"

namespace berth {

class BTHDirectorySync {
  public:
    // Makes every change of `directory` durable; the first sync of a
    // directory (`first`) also makes the directory's own entry durable. 0 or
    // an error number.
    using SyncFunction = std::function<int(const std::filesystem::path& directory, bool first)>;

    // The daemon's instance: fsync of the directory, and on its first sync in
    // this process also of each of its ancestors, so that a class directory
    // made a moment ago cannot vanish with the container in it.
    static BTHDirectorySync& sharedInstance();

    explicit BTHDirectorySync(SyncFunction sync);
    BTHDirectorySync(const BTHDirectorySync&) = delete;
    BTHDirectorySync& operator=(const BTHDirectorySync&) = delete;

    // Notes a change just made to the entries of `directory`; its number is
    // what to wait for.
    uint64_t noteChange(const std::filesystem::path& directory);

    // The number of the last change noted for `directory` (0: none): what a
    // caller that saw the directory's current entries waits for.
    uint64_t lastChange(const std::filesystem::path& directory);

    // Returns true once every change of `directory` up to `change` is
    // durable (at once when it already is). False, with a POSIX-domain error,
    // when the sync that was to cover `change` failed; a later call starts a
    // new one.
    bool waitUntilDurable(const std::filesystem::path& directory, uint64_t change,
                          BTHErrorRef* error);

    // fsync of the directory at `path`, opened without following links; an
    // error number on failure.
    static int syncDirectory(const std::filesystem::path& path);

  private:
    struct Directory {
        std::mutex mutex;
        std::condition_variable synced;
        uint64_t noted = 0;    // changes noted so far
        uint64_t durable = 0;  // every change up to this one is durable
        bool syncing = false;
        bool everSynced = false;
        uint64_t failures = 0;       // syncs that failed
        uint64_t failedCovered = 0;  // what the last failed sync was to cover
        int failure = 0;             // and its error number
    };

    // The record of `directory`, made on first use; every spelling of a
    // directory (doubled slashes, "." and ".." components, a slash at the
    // end) shares one.
    Directory& directoryAt(const std::filesystem::path& directory);
    // Runs one sync of `directory` on the caller's thread; `lock` is held
    // on entry and on return.
    void runSync(const std::filesystem::path& path, Directory& directory,
                 std::unique_lock<std::mutex>& lock);

    const SyncFunction sync_;
    std::mutex mutex_;  // guards directories_ (not the records in it)
    std::map<std::string, std::unique_ptr<Directory>, std::less<>> directories_;
};

}  // namespace berth
