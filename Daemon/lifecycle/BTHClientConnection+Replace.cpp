// Replace: one container takes the place of another. The old container's
// directory goes aside into the staging directory, the new one moves to the
// destination, and the cache and the sandbox mapping follow. A journal
// written (durably) before the first move lets the next start finish or undo
// a replace that a crash interrupted:
//
//   state               old container   new container   journal
//   1 validated         old place       new place       none
//   2 journal written   old place       new place       present   -> journal to death row
//   3 old in staging    staging         new place       present   -> staging back to old place
//   4 new moved in      staging         destination     present   -> journal to death row
//   5 cleaned up        death row       destination     death row
//
// A replace that fails after moving the old container aside puts it back
// before it cleans up, so a failed replace never loses the old data.
#include <fcntl.h>
#include <unistd.h>

#include "BTHClientConnection.h"
#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHFaultInjection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "BTHPropertyListFile.h"
#include "core/BTHContainerClass.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

constexpr const char* kReplaceFunction =
    "-[BTHClientConnection "
    "replaceContainer:withContainer:userIdOld:userIdNew:identifierOld:identifierNew:"
    "containerClassOld:containerClassNew:preserveOldUUID:startDeletionThread:withError:]";

constexpr const char* kOldURLKey = "BTHReplaceOperationOldURL";
constexpr const char* kNewURLKey = "BTHReplaceOperationNewURL";
constexpr const char* kStagingURLKey = "BTHReplaceOperationStagingURL";
constexpr const char* kDestURLKey = "BTHReplaceOperationDestURL";

// Makes the directory entries of `path`'s parent durable.
void syncParentDirectory(const std::filesystem::path& path) {
    const UniqueFd parent = fs::openNoFollow(path.parent_path(), O_RDONLY | O_DIRECTORY);
    if (parent) ::fsync(parent.get());
}

// A rename survives a crash only once both directories it touched are
// synced.
bool moveDurably(const std::filesystem::path& from, const std::filesystem::path& to,
                 BTHErrorRef* error) {
    if (!BTHFileManager::defaultManager().moveItemAtURL(from, to, error)) return false;
    syncParentDirectory(from);
    if (from.parent_path() != to.parent_path()) syncParentDirectory(to);
    return true;
}

bool itemExists(const std::filesystem::path& path) {
    return BTHFileManager::defaultManager().itemExistsAtURL(path);
}

}  // namespace

bool BTHClientConnection::_writeToDiskReplaceAt(const std::filesystem::path& journal,
                                                const std::filesystem::path& oldURL,
                                                const std::filesystem::path& newURL,
                                                const std::filesystem::path& stagingURL,
                                                const std::filesystem::path& destinationURL,
                                                BTHErrorRef* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection "
        "_writeToDiskReplaceAt:old:withNew:usingStaging:toDestination:error:]");
    if (oldURL.empty() || newURL.empty() || stagingURL.empty() || destinationURL.empty()) {
        BTHSetError(error, BTHMakeError(BTHErrorReplaceInfoInvalid, nullptr,
                                        "Invalid Replace File Info: old: %@, new: %@, staging: "
                                        "%@, dest: %@",
                                        oldURL, newURL, stagingURL, destinationURL));
        return false;
    }
    Value journalDictionary = Value::dictionary();
    journalDictionary.set(kOldURLKey, oldURL.string());
    journalDictionary.set(kNewURLKey, newURL.string());
    journalDictionary.set(kStagingURLKey, stagingURL.string());
    journalDictionary.set(kDestURLKey, destinationURL.string());
    BTHErrorRef writeError;
    if (!BTH_writeToURL(journalDictionary, journal, kBTHStateFileWriteOptions, &writeError)) {
        BTHSetError(error, BTHMakeError(BTHErrorWriteFailed, writeError,
                                        "Failed to write replace dictionary to URL %@", journal));
        return false;
    }
    // The replace directory itself may be new.
    syncParentDirectory(journal.parent_path());
    return true;
}

std::optional<BTHReplaceJournal> BTHClientConnection::_readAndValidateReplaceFileAtUrl(
    const std::filesystem::path& journal, BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHClientConnection _readAndValidateReplaceFileAtUrl:error:]");
    BTHErrorRef readError;
    const std::optional<Value> dictionary =
        BTH_dictionaryWithContentsOfURL(journal, BTHReadImmutable, &readError);
    if (!dictionary) {
        BTHSetError(error, BTHMakeError(BTHErrorReplaceJournalFailed, readError,
                                        "Failed to read replace file at URL %@", journal));
        return std::nullopt;
    }
    const Value* values[] = {dictionary->find(kOldURLKey), dictionary->find(kNewURLKey),
                             dictionary->find(kStagingURLKey), dictionary->find(kDestURLKey)};
    for (const Value* value : values) {
        if (!value || !value->string() || value->string()->empty()) {
            auto shown = [](const Value* v) { return v ? FormatArg(*v) : FormatArg(nullptr); };
            BTHSetError(
                error, BTHMakeError(BTHErrorReplaceJournalFailed, nullptr,
                                    "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@",
                                    shown(values[0]), shown(values[1]), shown(values[2]),
                                    shown(values[3])));
            return std::nullopt;
        }
    }
    return BTHReplaceJournal{*values[0]->string(), *values[1]->string(), *values[2]->string(),
                             *values[3]->string()};
}

bool BTHClientConnection::_recoverFromReplaceOperationsWithError(BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHClientConnection _recoverFromReplaceOperationsWithError:]");
    const std::filesystem::path replaceDirectory =
        BTHGlobalConfiguration::sharedInstance().replaceDirectory();
    BTHErrorRef listError;
    const auto journals =
        BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(replaceDirectory, &listError);
    if (!journals) {
        if (listError && listError->isPOSIXError(ENOENT)) return true;
        BTHLogError("Failed to get items at replace URL%@ : %@", replaceDirectory, listError);
        BTHSetError(error, listError);
        return false;
    }
    for (const BTHFileURL& journalURL : *journals) {
        const std::optional<BTHReplaceJournal> journal =
            _readAndValidateReplaceFileAtUrl(journalURL.path, nullptr);
        if (journal) {
            BTHLogDebug("Doing a replace of %@ with info: %@", journalURL.path,
                        journal->description());
            if (!itemExists(journal->oldURL) && !itemExists(journal->destinationURL)) {
                BTHLogDebug("Recovering from failed replace by moving: %@ to %@",
                            journal->stagingURL, journal->oldURL);
                BTHErrorRef moveError;
                if (!moveDurably(journal->stagingURL, journal->oldURL, &moveError)) {
                    BTHSetError(error, BTHMakeError(BTHErrorReplaceJournalFailed, moveError,
                                                    "Failed to recover replace move: %@ to %@",
                                                    journal->stagingURL, journal->oldURL));
                    return false;
                }
            }
        }
        BTHErrorRef deathRowError;
        if (!_moveItemAtURLToDeathRow(journalURL.path, false, false, &deathRowError)) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorCleanupFailed, deathRowError,
                                     "Failed to remove replace file at %@", journalURL.path));
            return false;
        }
    }
    return true;
}

std::string BTHReplaceJournal::description() const {
    return format("{%@ = %@; %@ = %@; %@ = %@; %@ = %@}", kOldURLKey, oldURL, kNewURLKey, newURL,
                  kStagingURLKey, stagingURL, kDestURLKey, destinationURL);
}

namespace {

// One replace under the all-identifiers lock: the on-disk state it has
// reached and what its clean-up must do.
class Replace {
  public:
    Replace(BTHClientConnection& client, const BTHReplaceRequest& request)
        : client_(client), request_(request) {}

    // Steps 4 to 10; on failure `error` holds why.
    bool run(BTHErrorRef* error) {
        if (!findContainers(error)) return false;
        if (!chooseDestination(error)) return false;
        if (oldRecord_ ? !moveOldAside(error) : !checkNoPermanentContainer(error)) return false;
        return moveNewIn(error);
    }

    // Puts the old container back if the replace stopped with it aside and
    // the new one not in its place; then sends staging and journal to death
    // row.
    void cleanUp(BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        restoreOldContainer(error);
        if (!journalURL_) return;
        BTHErrorRef deathRowError;
        if (!client_._moveItemAtURLToDeathRow(*stagingURL_, true, false, &deathRowError)) {
            BTHSetError(error, BTHMakeError(BTHErrorCleanupFailed, deathRowError,
                                            "Failed to remove staging dir: %@", *stagingURL_));
        }
        if (!client_._moveItemAtURLToDeathRow(*journalURL_, false, request_.startDeletionThread,
                                              &deathRowError)) {
            BTHSetError(error, BTHMakeError(BTHErrorCleanupFailed, deathRowError,
                                            "Failed to remove replace file: %@", *journalURL_));
        }
    }

  private:
    BTHMetadataRef find(uid_t userId, uint64_t containerClass, const std::string& identifier,
                        const Uuid& uuid, BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        BTHMetadataRef record = BTHContainerCache::sharedInstance().containerForUser(
            userId, containerClass, identifier, uuid.string());
        if (!record) {
            BTHSetError(error, BTHMakeError(BTHErrorNotFound, nullptr,
                                            "No Container with userId: %u UUID: %@, identifier: "
                                            "%@, Class: %ld",
                                            userId, uuid.string(), identifier, containerClass));
        }
        return record;
    }

    // Steps 4 to 7.
    bool findContainers(BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        if (request_.oldUUID) {
            oldRecord_ = find(request_.oldUserId, request_.oldClass,
                              request_.oldIdentifier.value_or(""), *request_.oldUUID, error);
            if (!oldRecord_) return false;
            oldURL_ = oldRecord_->url();
            oldTransient_ = oldRecord_->transient();
        }
        newRecord_ = find(request_.newUserId, request_.newClass,
                          request_.newIdentifier.value_or(""), *request_.newUUID, error);
        if (!newRecord_) return false;
        newURL_ = newRecord_->url();
        newTransient_ = newRecord_->transient();
        if (oldRecord_ && oldURL_ == newURL_) {
            BTHSetError(error, BTHMakeError(BTHErrorReplaceSameContainer, nullptr,
                                            "Can't replace the same container at %@", oldURL_));
            return false;
        }
        if (!Uuid::parse(newURL_.filename().string())) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorInvalidPath, nullptr,
                                     "Invalid URL (last path component not UUID): %@", newURL_));
            return false;
        }
        return true;
    }

    // Step 8.
    bool chooseDestination(BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        if (request_.preserveOldUUID) {
            destination_ = oldURL_;
            return true;
        }
        const auto parent = BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
            request_.newUserId, request_.newClass, oldTransient_);
        destination_ = (parent ? *parent : std::filesystem::path()) / newURL_.filename();
        if (!parent || itemExists(destination_)) {
            BTHSetError(error, BTHMakeError(BTHErrorAlreadyExists, nullptr,
                                            "Container already exists at %@", destination_));
            return false;
        }
        return true;
    }

    // Step 9 with an old container.
    bool moveOldAside(BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        BTHGlobalConfiguration& configuration = BTHGlobalConfiguration::sharedInstance();
        const std::string name = Uuid::random().string();
        journalURL_ = configuration.replaceDirectory() / (name + ".plist");
        stagingURL_ = configuration.stagingDirectory() / name;
        BTHErrorRef stepError;
        if (!client_._writeToDiskReplaceAt(*journalURL_, oldURL_, newURL_, *stagingURL_,
                                           destination_, &stepError)) {
            BTHLogError("Failed to write replace file: %@", stepError);
            BTHSetError(error, stepError);
            return false;
        }
        BTHCrashPoint("replace.journal-written");
        if (!moveDurably(oldURL_, *stagingURL_, &stepError)) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorMoveToStagingFailed, stepError,
                                     "Failed to move old %@ to staging %@", oldURL_, *stagingURL_));
            return false;
        }
        oldAside_ = true;
        BTHCrashPoint("replace.old-staged");
        if (!BTHContainerCache::sharedInstance().removeContainerForUser(
                request_.oldUserId, request_.oldClass, oldRecord_->identifier(), oldTransient_,
                &stepError)) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorCacheRemoveFailed, stepError,
                                     "Failed to remove from cache id: %@, class: %ld, "
                                     "transient: %d",
                                     oldRecord_->identifier(), request_.oldClass, oldTransient_));
            return false;
        }
        oldUncached_ = true;
        if (BTHContainerClassIsBundle(request_.oldClass)) {
            BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
            if (mapping && !mapping->invalidateCodeSigningInfoForIdentifierAndItsChildren(
                               oldRecord_->identifier(), &stepError)) {
                BTHLogError("Failed to invalidate code signing info for %@",
                            oldRecord_->identifier());
                BTHSetError(error, stepError);
                return false;
            }
        }
        return true;
    }

    // Step 9 without an old container: a new container may not take the
    // place of an existing permanent one.
    bool checkNoPermanentContainer(BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        BTHErrorRef cacheError;
        const BTHMetadataRef existing = BTHContainerCache::sharedInstance().containerForUser(
            request_.newUserId, newRecord_->containerClass(), newRecord_->identifier(), false,
            &cacheError);
        if (existing) {
            BTHSetError(
                error, BTHMakeError(BTHErrorAlreadyExists, nullptr,
                                    "Container with identifier: %@, class: %ld, "
                                    "transient: %d already exists",
                                    newRecord_->identifier(), newRecord_->containerClass(), false));
            return false;
        }
        if (cacheError && !cacheError->isBTHError(BTHErrorNotFound)) {
            BTHSetError(error, cacheError);
            return false;
        }
        return true;
    }

    // Step 10.
    bool moveNewIn(BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        BTHContainerCache& cache = BTHContainerCache::sharedInstance();
        BTHErrorRef stepError;
        if (!moveDurably(newURL_, destination_, &stepError)) {
            BTHSetError(error, BTHMakeError(BTHErrorReplaceFailed, stepError,
                                            "Failed to replace: %@ with: %@ at: %@", oldURL_,
                                            newURL_, destination_));
            return false;
        }
        newMovedIn_ = true;
        BTHCrashPoint("replace.new-moved");
        if (!cache.removeContainerForUser(request_.newUserId, request_.newClass,
                                          newRecord_->identifier(), newTransient_, &stepError)) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorCacheRemoveFailed, stepError,
                                     "Failed to remove from cache id: %@, class: %ld, "
                                     "transient: %d",
                                     newRecord_->identifier(), request_.newClass, newTransient_));
            return false;
        }
        if (!client_._setSandboxContainerMappingForUser(
                request_.newUserId, newRecord_->identifier(), request_.newClass, destination_)) {
            BTHLogError("Failed to set container mapping in replace operation of %@, %llu",
                        newRecord_->identifier(), request_.newClass);
        }
        if (request_.preserveOldUUID) {
            // The new contents keep the old identity, on disk too, so the
            // container is found under its UUID after the next start.
            newRecord_->setUuid(*request_.oldUUID);
            newRecord_->setUrl(destination_);
            if (!newRecord_->writeMetadataToDisk(&stepError)) {
                BTHLogError("Failed to keep UUID %@ in the metadata at %@: %@", *request_.oldUUID,
                            destination_, stepError);
            }
        }
        if (!cache.addContainerMetadata(newRecord_, request_.newUserId, destination_, oldTransient_,
                                        &stepError)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheAddFailed, stepError,
                                            "Failed to add to cache: %@, url: %@, transient: %d",
                                            newRecord_, destination_, oldTransient_));
            return false;
        }
        return true;
    }

    // The old container is aside and the new one did not take its place:
    // it goes back where it was, and back into the cache.
    void restoreOldContainer(BTHErrorRef* error) {
        BTH_FUNCTION(kReplaceFunction);
        if (!oldAside_ || newMovedIn_ || itemExists(oldURL_)) return;
        BTHLogDebug("Recovering from failed replace by moving: %@ to %@", *stagingURL_, oldURL_);
        BTHErrorRef moveError;
        if (!moveDurably(*stagingURL_, oldURL_, &moveError)) {
            BTHSetError(error, BTHMakeError(BTHErrorReplaceJournalFailed, moveError,
                                            "Failed to recover replace move: %@ to %@",
                                            *stagingURL_, oldURL_));
            return;
        }
        oldAside_ = false;
        if (oldUncached_) {
            BTHContainerCache::sharedInstance().addContainerMetadata(
                oldRecord_, request_.oldUserId, oldURL_, oldTransient_, nullptr);
        }
    }

    BTHClientConnection& client_;
    const BTHReplaceRequest& request_;
    BTHMetadataRef oldRecord_;
    BTHMetadataRef newRecord_;
    std::filesystem::path oldURL_;
    std::filesystem::path newURL_;
    std::filesystem::path destination_;
    bool oldTransient_ = false;
    bool newTransient_ = false;
    std::optional<std::filesystem::path> journalURL_;
    std::optional<std::filesystem::path> stagingURL_;
    bool oldAside_ = false;
    bool oldUncached_ = false;
    bool newMovedIn_ = false;
};

// Steps 1 and 2: what can be refused before anything is locked.
BTHErrorRef checkReplaceRequest(const BTHReplaceRequest& request) {
    BTH_FUNCTION(kReplaceFunction);
    if (!request.newUUID || !BTHContainerClassIsValid(request.newClass)) {
        return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                            "Can't act on an invalid object: new userId: %u, newUUID: %@, "
                            "Class: %ld",
                            request.newUserId, request.newUUID, request.newClass);
    }
    if (!request.oldUUID) {
        if (!request.preserveOldUUID) return nullptr;
        return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                            "Can't have a nil oldContainerUUID when preserving the UUID");
    }
    if (!BTHContainerClassIsValid(request.oldClass)) {
        return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                            "Can't act on an invalid object: old userId: %u, oldUUID: %@, "
                            "Class: %ld",
                            request.oldUserId, request.oldUUID, request.oldClass);
    }
    if (request.oldClass != request.newClass) {
        return BTHMakeError(BTHErrorReplaceClassMismatch, nullptr,
                            "Can't replace containers of different class types: %ld and %ld",
                            request.oldClass, request.newClass);
    }
    if (request.oldUserId != request.newUserId) {
        return BTHMakeError(BTHErrorReplaceUserMismatch, nullptr,
                            "Can't replace containers of different userIds: %u and %u",
                            request.oldUserId, request.newUserId);
    }
    return nullptr;
}

}  // namespace

void BTHClientConnection::replaceContainer(const BTHReplaceRequest& request, uint64_t* error) {
    BTH_FUNCTION(kReplaceFunction);
    std::optional<BTHAllIdentifiersLockGuard> lock;
    std::optional<Replace> replace;
    BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() {
        BTHErrorRef error = checkReplaceRequest(request);
        if (error) return error;
        lock.emplace(true);
        replace.emplace(*this, request);
        replace->run(&error);
        return error;
    });
    if (replace) replace->cleanUp(&failure);
    lock.reset();
    if (failure) BTHSetErrorCode(error, failure->code64());
}

}  // namespace berth
