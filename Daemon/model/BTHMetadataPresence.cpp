#include "BTHMetadataPresence.h"

#include <optional>

#include "BTHFileManager.h"
#include "BTHLog.h"

namespace berth {

BTHMetadataPresence::BTHMetadataPresence() {
    BTH_FUNCTION("-[BTHMetadataPresence init]");
    std::string why;
    watch_ = ChangeWatch::make(&why, ChangeWatch::Kind::kNamesOnly);
    if (!watch_) BTHLogError("Metadata files are checked on disk on every look-up: %s", why);
}

bool BTHMetadataPresence::itemExists(const std::filesystem::path& metadataFile) {
    BTHFileManager& files = BTHFileManager::defaultManager();
    if (!watch_) return files.itemExistsAtURL(metadataFile);
    std::optional<Found> found;
    {
        std::lock_guard lock(mutex_);
        if (auto at = found_.find(metadataFile.native()); at != found_.end()) found = at->second;
    }
    if (found && watch_->unchangedSince(found->moment)) return true;

    const auto now = std::chrono::steady_clock::now();
    const bool rewatch = !found || now - found->watchedAt >= kRewatchInterval;
    // The moment comes first: a change after it is either seen by the disk
    // check below or counted by the watch.
    const uint64_t moment = watch_->now();
    const bool watched = rewatch && watch_->watch(metadataFile);
    if (!files.itemExistsAtURL(metadataFile)) return false;
    if (watched) {
        std::lock_guard lock(mutex_);
        if (found_.size() >= kMaxFound) found_.clear();
        found_[metadataFile.native()] = {moment, now};
    }
    return true;
}

void BTHMetadataPresence::reset() {
    std::lock_guard lock(mutex_);
    found_.clear();
}

}  // namespace berth
