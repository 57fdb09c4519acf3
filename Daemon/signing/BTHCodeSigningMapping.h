// BTHCodeSigningMapping: the code-signing store, identifier -> entry, kept in
// memory and in "bth_code_signing_info.plist" in the daemon's library
// directory (a binary property list, rewritten whole and atomically after
// every change, readable while the device is locked).
//
// Every read and change of the mapping runs on the serial queue
// "sys.kelp.Berth.EntitlementQueue" (the callers submit synchronously), or
// under the all-identifiers lock held for writing. The store itself has no
// lock.
//
// Processing, queries, removal and invalidation are the modules
// BTHCodeSigningMapping+Processing.cpp, +Queries.cpp and +Removal.cpp; what a
// change implies above the store (the all-identifiers lock, system
// containers, group containers) reaches it through BTHCodeSigningHooks.
//
// A missing file is an empty store (created on the first change). A file
// that cannot be read or is not a dictionary leaves the process without a
// store: sharedInstance() is then null for the life of the process and the
// file is left as it is.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "BTHCodeSigningEntry.h"
#include "BTHError.h"
#include "core/Uuid.h"
#include "platform/WorkQueue.h"

namespace berth {

inline constexpr const char* kBTHCodeSigningMappingFileName = "bth_code_signing_info.plist";
inline constexpr const char* kBTHSystemContainerEntitlement = "sys.kelp.security.system-container";

inline constexpr const char* kBTHApplicationGroupsEntitlement =
    "sys.kelp.security.application-groups";
inline constexpr const char* kBTHSystemGroupsEntitlement = "sys.kelp.security.system-groups";
inline constexpr const char* kBTHSystemGroupContainersEntitlement =
    "sys.kelp.security.system-group-containers";
inline constexpr const char* kBTHSystemGroupPrefix = "systemgroup.";
inline constexpr const char* kBTHCachedCodeSigningInfoKey = "sys.kelp.Lading.CachedCodeSigningInfo";

// Options of processing.
inline constexpr const char* kBTHDataContainerClassOption = "sys.kelp.Berth.DataContainerClass";
inline constexpr const char* kBTHParentBundleIDOption = "sys.kelp.Berth.ParentBundleID";
inline constexpr const char* kBTHPlaceholderOption = "sys.kelp.Berth.PlaceholderEntitlements";
inline constexpr const char* kBTHRegByCallerOption = "RegByCaller";

// The two kinds of group container: application groups (class 7, the
// current mobile user) and system groups (class 13, user 499).
enum BTHGroupType : int64_t {
    BTHGroupTypeApplication = 0,
    BTHGroupTypeSystem = 1,
};

// What processing needs from the layers above the store, connected at
// start-up. Unset, the store works alone: it takes no identifier lock,
// re-counts no group and stages no system container (unit tests).
struct BTHCodeSigningHooks {
    // Runs `work` holding the all-identifiers lock for writing.
    std::function<void(const std::function<void()>& work)> withAllIdentifiersLocked;
    // Stages one container for deletion without identifier locking; the
    // staging's code (1 on success).
    std::function<uint64_t(uid_t user, const Uuid& uuid, const std::string& identifier,
                           uint64_t containerClass)>
        stageForDelete;
    // The group manager's reaction to a change of an identifier's groups,
    // told while the mapping still holds the old entry.
    std::function<void(std::optional<std::vector<std::string>> oldIds,
                       const std::optional<std::vector<std::string>>& newIds, BTHGroupType type)>
        groupContainerIdsChanged;
};

// An identifier list as log lines show it.
Value BTHStringListValue(const std::vector<std::string>& list);

// The groups that `entitlements` give under `key`, or under `fallBackKey`
// (when given) if those are none or empty: a list of strings or a single
// string, duplicates dropped. Values of other kinds, lists holding anything
// but strings and lists longer than any real item has are ignored, and so is
// every identifier that is empty or could be read as a path ("/", ".", "..",
// control characters); each with an error line.
std::optional<std::vector<std::string>> BTHGroupListOfEntitlements(const std::string& identifier,
                                                                   const Value* entitlements,
                                                                   const char* key,
                                                                   const char* fallBackKey);

class BTHCodeSigningMapping {
  public:
    using Mapping = std::map<std::string, BTHCodeSigningEntryRef>;

    // Made once, thread-safely; null when the file could not be read.
    static BTHCodeSigningMapping* sharedInstance();

    // Loads the mapping from the file; null (logged) when it cannot.
    static std::unique_ptr<BTHCodeSigningMapping> create();

    const std::shared_ptr<WorkQueue>& codeSignQueue() const { return codeSignQueue_; }

    // Accessors of the whole mapping (on the queue or under the lock).
    Mapping& codeSigningMappingDict() { return codeSigningMappingDict_; }
    void setCodeSigningMappingDict(Mapping mapping) {
        codeSigningMappingDict_ = std::move(mapping);
    }

    // Stages values[i] for identifiers[i], in order (a value without
    // code-signing information, or null, removes the identifier), and
    // rewrites the file once if anything changed. Errors: 60
    // (BTHErrorMappingInvalidInput) for arrays of different lengths (nothing
    // changes), 59 (BTHErrorMappingWriteFailed) when the write fails (the
    // in-memory change stays).
    BTHErrorRef setCodeSigningDictionaryValues(const std::vector<BTHCodeSigningEntryRef>& values,
                                               const std::vector<std::string>& identifiers);

    // Rewrites the whole file from the mapping; error 59 on failure (logged,
    // the in-memory mapping stays as it is).
    BTHErrorRef writeCodeSigningMappingToDisk();

    // Runs `work` with the mapping to itself: under the all-identifiers lock
    // held for writing (when connected) and on the code-signing queue, so
    // neither processing nor a query sees the mapping half changed. For
    // maintenance that edits codeSigningMappingDict() directly.
    void performExclusively(const std::function<void()>& work);

    // Connects the consequences that belong to the layers above the store
    // (start-up, before the first request; tests, before they process).
    void setHooks(BTHCodeSigningHooks hooks) { hooks_ = std::move(hooks); }

    // ----- Processing (BTHCodeSigningMapping+Processing.cpp)

    // Records `info` (a dictionary; none removes the identifier) for
    // `identifier` with the options "sys.kelp.Berth.DataContainerClass",
    // "sys.kelp.Berth.ParentBundleID", "sys.kelp.Berth.PlaceholderEntitlements"
    // and "RegByCaller". When the entry changes, the identifier's groups are
    // re-counted and a withdrawn system container is staged for deletion
    // before the mapping holds the new entry, and the file is rewritten
    // before this returns; the same information again changes and writes
    // nothing. Holds the all-identifiers lock for writing, then runs on the
    // queue. 1, 18 without identifier, 59 when the file cannot be written (the
    // change stays in memory), 40 on an exception (nothing written).
    uint64_t processCodeSigningInfo(const std::optional<Value>& info,
                                    const std::optional<std::string>& identifier,
                                    const std::optional<Value>& options);
    // A calling process's own entitlements, processed as
    // {"sys.kelp.Berth.Entitlements": entitlements} with {"RegByCaller": true}.
    uint64_t processCallerRegisteredEntitlements(const Value& entitlements,
                                                 const std::string& identifier);
    // Whether a caller's own entitlements would change nothing: the
    // identifier has code-signing information that the caller did not
    // register, or its caller-registered entitlements are these already. One
    // look at the mapping, made for every request of a signed caller; a yes
    // is remembered per identifier until the mapping next changes.
    bool callerEntitlementsNeedNoProcessing(const Value& entitlements,
                                            const std::string& identifier);

    // ----- Queries (BTHCodeSigningMapping+Queries.cpp), each on the queue

    // The code-signing information of a client's query: none for unknown,
    // placeholder and invalid entries. Holds the all-identifiers lock, since
    // an identifier known only from its bundle container's cached
    // information is moved into the mapping (and the file) first.
    std::optional<Value> getCodeSigningInfoForIdentifier(const std::string& identifier);
    // Whether the identifier has information (placeholder and invalid
    // entries included), after the same move.
    bool codeSigningInfoExistForIdentifier(const std::string& identifier);
    // The truth value of "sys.kelp.security.system-container" in the
    // identifier's entitlements; the stored data container class (0 without
    // an entry); whether the stored entry was registered by the caller.
    bool identifierHasSystemContainer(const std::string& identifier);
    uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
    bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
    // The groups of "sys.kelp.security.application-groups", without
    // duplicates; none when the entitlement is absent or unusable.
    std::optional<std::vector<std::string>> appGroupIdentifiersForIdentifier(
        const std::string& identifier);
    // The groups of "sys.kelp.security.system-groups", or of
    // "sys.kelp.security.system-group-containers" when the first gives none;
    // identifiers without the "systemgroup." prefix are dropped (logged).
    std::optional<std::vector<std::string>> systemGroupIdentifiersForIdentifier(
        const std::string& identifier);
    // Calls `block` for every identifier in the mapping with its groups under
    // `key` (or `fallBackKey` when those are none or empty), unfiltered. Runs
    // on the caller's thread: only for callers already on the queue or
    // holding the all-identifiers lock (the group manager's counting).
    void iterateGroupIdsWithKey(
        const char* key, const char* fallBackKey,
        const std::function<void(const std::string&,
                                 const std::optional<std::vector<std::string>>&)>& block);

    static std::filesystem::path mappingFileURL();

    // ----- Removal and invalidation (BTHCodeSigningMapping+Removal.cpp)

    // Processes "no information" for each child of the identifier, then for
    // the identifier: their entries go, their groups are re-counted and a
    // system container is withdrawn. Takes no lock: its callers, the
    // container operations that delete bundle containers, hold theirs.
    // Failures are logged.
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier);
    // Marks the identifier's entry and its children's entries invalid and
    // rewrites the file (even when nothing was found); false with error 59
    // when the write fails. Takes no lock (called from replace).
    bool invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                              BTHErrorRef* error);
    // Marks invalid every entry not registered by a caller whose identifier
    // has no bundle container (classes 1, 3, 5 of user 33), and rewrites the
    // file. Holds the all-identifiers lock. 1, or the write error's code.
    uint64_t invalidateCodeSigningInfoForAppsWithoutBundleContainer();

  private:
    // Only create() can name it, so only create() constructs.
    struct Passkey {};

  public:
    BTHCodeSigningMapping(Passkey, Mapping mapping);

  private:
    static std::optional<Mapping> readCodeSigningMappingFromDisk();

    // The stored entry of `identifier`, or null. Callers are on the queue.
    const BTHCodeSigningEntry* storedEntry(const std::string& identifier) const;

    // The queue work of the operations above; they call each other only in
    // these forms, since they already run on the queue.
    std::optional<Value> onQueueCodeSigningInfoForIdentifier(const std::string& identifier,
                                                             bool externalRequest);
    const Value* onQueueEntitlementsForIdentifier(const std::string& identifier);
    std::optional<std::vector<std::string>> onQueueSystemGroupIdentifiers(
        const std::string& identifier);
    // Processing's new entry for `identifier`, and the parent's entry with
    // the identifier added to its children when that changes it.
    struct PreparedEntry {
        BTHCodeSigningEntryRef entry;
        bool changed = false;  // the entry differs from the stored one
        BTHCodeSigningEntryRef parent;
        std::string parentIdentifier;
    };
    PreparedEntry prepareEntry(const std::optional<Value>& info, const std::string& identifier,
                               const std::optional<Value>& options) const;
    bool isUnchanged(const std::optional<Value>& info, const std::optional<std::string>& identifier,
                     const std::optional<Value>& options) const;
    static bool acceptable(const std::optional<Value>& info, const std::optional<Value>& options);
    uint64_t onQueueProcessCodeSigningInfo(const std::optional<Value>& info,
                                           const std::optional<std::string>& identifier,
                                           const std::optional<Value>& options);
    void onQueueRemoveCodeSigningDictionariesForIdentifierAndItsChildren(
        const std::string& identifier);
    // Moves the information the installer cached in the identifier's bundle
    // container into the mapping; the new entry, or null.
    const BTHCodeSigningEntry* migrateCachedCodeSigningInfo(const std::string& identifier);
    // Steps of processing that follow from a change of entitlements.
    void withdrawSystemContainer(const std::string& identifier);
    void tellGroupManager(std::optional<std::vector<std::string>> oldGroups,
                          const std::optional<std::vector<std::string>>& newGroups,
                          BTHGroupType type);
    // Runs `work` under the all-identifiers lock (when connected), then on
    // the queue.
    template <class F>
    auto lockingAll(F&& work) {
        using Result = decltype(work());
        if (!hooks_.withAllIdentifiersLocked) return onCodeSignQueue(std::forward<F>(work));
        std::optional<Result> result;
        hooks_.withAllIdentifiersLocked([&] { result.emplace(onCodeSignQueue(work)); });
        return std::move(*result);
    }

    // Runs `work` on the queue and waits for it; inline when the caller is
    // already running on the queue (waiting there could never end).
    template <class F>
    auto onCodeSignQueue(F&& work) {
        if (codeSignQueue_->isCurrent()) return work();
        return codeSignQueue_->sync(std::forward<F>(work));
    }

    // Whether callerEntitlementsNeedNoProcessing() said so for these
    // entitlements of `identifier` at the current version of the mapping.
    bool knownToNeedNoProcessing(const std::string& identifier, const Value& entitlements);
    void rememberNeedsNoProcessing(const std::string& identifier, const Value& entitlements,
                                   uint64_t version);

    std::shared_ptr<WorkQueue> codeSignQueue_;
    Mapping codeSigningMappingDict_;
    BTHCodeSigningHooks hooks_;
    // Counts the changes of the mapping (each is written, or tried to be):
    // an answer about the mapping holds while the count stays.
    std::atomic<uint64_t> version_{0};
    // Callers' entitlements found to need no processing, with the version
    // they were found at: a signed caller's requests repeat the question.
    struct NoProcessingNeeded {
        Value entitlements;
        uint64_t version = 0;
    };
    std::mutex noProcessingMutex_;
    std::map<std::string, NoProcessingNeeded, std::less<>> noProcessingNeeded_;
};

}  // namespace berth
