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
// A missing file is an empty store (created on the first change). A file
// that cannot be read or is not a dictionary leaves the process without a
// store: sharedInstance() is then null for the life of the process and the
// file is left as it is.
#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "BTHCodeSigningEntry.h"
#include "BTHError.h"
#include "platform/WorkQueue.h"

namespace berth {

inline constexpr const char* kBTHCodeSigningMappingFileName = "bth_code_signing_info.plist";
inline constexpr const char* kBTHSystemContainerEntitlement = "sys.kelp.security.system-container";

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

    // Queries (each runs on the queue). The truth value of
    // "sys.kelp.security.system-container" in the identifier's entitlements;
    // the stored data container class (0 without an entry); whether the
    // stored entry was registered by the caller.
    bool identifierHasSystemContainer(const std::string& identifier);
    uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
    bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);

    static std::filesystem::path mappingFileURL();

    // Removal and invalidation for the container operations that delete or
    // replace bundle containers (BTHCodeSigningMapping+Removal.cpp). Both run
    // on the queue and take no lock: their callers already hold the
    // all-identifiers lock.
    //
    // Drops the entries of the identifier's children, then its own; failures
    // are logged. (The re-counting of the identifier's groups that a removal
    // implies comes with the group containers.)
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier);
    // Marks the identifier's entry and its children's entries invalid and
    // rewrites the file (even when nothing was found); false with error 59
    // when the write fails.
    bool invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                              BTHErrorRef* error);

  private:
    // Only create() can name it, so only create() constructs.
    struct Passkey {};

  public:
    BTHCodeSigningMapping(Passkey, Mapping mapping);

  private:
    static std::optional<Mapping> readCodeSigningMappingFromDisk();

    // The stored entry of `identifier`, or null. Callers are on the queue.
    const BTHCodeSigningEntry* storedEntry(const std::string& identifier) const;

    // Runs `work` on the queue and waits for it; inline when the caller is
    // already running on the queue (waiting there could never end).
    template <class F>
    auto onCodeSignQueue(F&& work) {
        if (codeSignQueue_->isCurrent()) return work();
        return codeSignQueue_->sync(std::forward<F>(work));
    }

    std::shared_ptr<WorkQueue> codeSignQueue_;
    Mapping codeSigningMappingDict_;
};

}  // namespace berth
