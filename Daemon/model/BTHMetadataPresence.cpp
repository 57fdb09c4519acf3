#include "BTHMetadataPresence.h"

#include <optional>

#include "BTHFileManager.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

BTHMetadataPresence::BTHMetadataPresence() {
    BTH_FUNCTION("-[BTHMetadataPresence init]");
    std::string why;
    watch_ = ChangeWatch::make(&why, ChangeWatch::Kind::kNamesOnly);
    if (!watch_) BTHLogError("Metadata files are checked on disk on every look-up: %s", why);
}

bool BTHMetadataPresence::metadataFileExists(const std::filesystem::path& container) {
    BTHFileManager& files = BTHFileManager::defaultManager();
    if (!watch_) return files.itemExistsAtURL(container / kBTHMetadataFileName);
    // The common answer needs only the moment; the ticket (a name for each
    // directory up to the root) is copied only when something changed.
    std::optional<uint64_t> foundAt;
    {
        std::lock_guard lock(mutex_);
        if (auto at = found_.find(container.native()); at != found_.end())
            foundAt = at->second.moment;
    }
    if (foundAt && watch_->unchangedSince(*foundAt)) return true;
    std::optional<Found> found;
    {
        std::lock_guard lock(mutex_);
        if (auto at = found_.find(container.native()); at != found_.end()) found = at->second;
    }

    // The moment comes first: a change after it is either seen by the check
    // below (of the file's own names, or of the disk) or counted by the watch.
    const uint64_t moment = watch_->now();
    const std::filesystem::path metadataFile = container / kBTHMetadataFileName;
    if (found && watch_->unchangedSince(found->ticket, found->moment)) {
        // Something else changed: the file's names did not, so it is still
        // there, and is now known so as of `moment`.
        remember(container, {std::move(found->ticket), moment, found->watchedAt});
        return true;
    }
    const auto now = std::chrono::steady_clock::now();
    const bool rewatch = !found || now - found->watchedAt >= kRewatchInterval;
    ChangeWatch::Ticket ticket;
    const bool watched = rewatch && watch_->watch(metadataFile, &ticket);
    if (!files.itemExistsAtURL(metadataFile)) return false;
    if (watched) remember(container, {std::move(ticket), moment, now});
    return true;
}

void BTHMetadataPresence::remember(const std::filesystem::path& container, Found found) {
    std::lock_guard lock(mutex_);
    if (found_.size() >= kMaxFound) found_.clear();
    found_[container.native()] = std::move(found);
}

void BTHMetadataPresence::reset() {
    std::lock_guard lock(mutex_);
    found_.clear();
}

}  // namespace berth
