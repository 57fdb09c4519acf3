#include "BTHDirectorySync.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string_view>

#include "platform/SafeFs.h"

namespace berth {

namespace {

// The directory and, on its first sync, every directory above it up to the
// file system's root: each entry on the way must be durable for the
// directory to be found again.
int syncWithAncestors(const std::filesystem::path& directory, bool first) {
    if (const int err = BTHDirectorySync::syncDirectory(directory)) return err;
    if (!first) return 0;
    for (std::filesystem::path above = directory.parent_path();; above = above.parent_path()) {
        if (const int err = BTHDirectorySync::syncDirectory(above)) return err;
        if (above == above.root_path() || above.empty()) return 0;
    }
}

}  // namespace

BTHDirectorySync& BTHDirectorySync::sharedInstance() {
    static BTHDirectorySync instance(syncWithAncestors);
    return instance;
}

BTHDirectorySync::BTHDirectorySync(SyncFunction sync) : sync_(std::move(sync)) {}

int BTHDirectorySync::syncDirectory(const std::filesystem::path& path) {
    UniqueFd fd = fs::openNoFollow(path, O_RDONLY | O_DIRECTORY);
    if (!fd) return errno;
    return ::fsync(fd.get()) == 0 ? 0 : errno;
}

namespace {

// Whether the absolute `path` reads the same once lexically normal: no
// empty, "." or ".." component, no slash at the end.
bool isLexicallyNormal(std::string_view path) {
    if (path.size() < 2 || path.front() != '/') return false;
    for (size_t start = 1; start <= path.size();) {
        const size_t end = std::min(path.find('/', start), path.size());
        const std::string_view part = path.substr(start, end - start);
        if (part.empty() || part == "." || part == "..") return false;
        start = end + 1;
    }
    return true;
}

}  // namespace

BTHDirectorySync::Directory& BTHDirectorySync::directoryAt(const std::filesystem::path& directory) {
    // Looked up on every look-up of a container (creation's check of the
    // class directory): a path that is already normal is found as it is.
    std::string normalized;
    std::string_view key = directory.native();
    if (!isLexicallyNormal(key)) {
        normalized = directory.lexically_normal().string();
        // A slash at the end names the same directory.
        while (normalized.size() > 1 && normalized.back() == '/') normalized.pop_back();
        key = normalized;
    }
    std::lock_guard<std::mutex> lock(mutex_);
    auto found = directories_.find(key);
    if (found == directories_.end())
        found = directories_.emplace(std::string(key), std::make_unique<Directory>()).first;
    return *found->second;
}

uint64_t BTHDirectorySync::noteChange(const std::filesystem::path& directory) {
    Directory& record = directoryAt(directory);
    std::lock_guard<std::mutex> lock(record.mutex);
    return ++record.noted;
}

uint64_t BTHDirectorySync::lastChange(const std::filesystem::path& directory) {
    Directory& record = directoryAt(directory);
    std::lock_guard<std::mutex> lock(record.mutex);
    return record.noted;
}

void BTHDirectorySync::runSync(const std::filesystem::path& path, Directory& directory,
                               std::unique_lock<std::mutex>& lock) {
    directory.syncing = true;
    // Every change noted by now was made before the sync starts.
    const uint64_t covers = directory.noted;
    const bool first = !directory.everSynced;
    lock.unlock();
    const int err = sync_(path, first);
    lock.lock();
    directory.syncing = false;
    if (err == 0) {
        directory.durable = std::max(directory.durable, covers);
        directory.everSynced = true;
    } else {
        ++directory.failures;
        directory.failedCovered = covers;
        directory.failure = err;
    }
    directory.synced.notify_all();
}

bool BTHDirectorySync::waitUntilDurable(const std::filesystem::path& path, uint64_t change,
                                        BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHDirectorySync waitUntilDurable:change:error:]");
    Directory& directory = directoryAt(path);
    std::unique_lock<std::mutex> lock(directory.mutex);
    const uint64_t failuresBefore = directory.failures;
    while (directory.durable < change) {
        // A sync that was to cover this change failed after the call began.
        if (directory.failures != failuresBefore && directory.failedCovered >= change) {
            BTHSetError(error, BTHMakePOSIXError(directory.failure, "fsync of %s failed: %s", path,
                                                 strerror(directory.failure)));
            return false;
        }
        if (directory.syncing)
            directory.synced.wait(lock);
        else
            runSync(path, directory, lock);
    }
    return true;
}

}  // namespace berth
