// BTHContainerCache: every container the daemon knows, per (user, class) and
// separately for live and transient containers, as a map from identifier to
// the container's metadata record. A map is built from disk the first time
// its (user, class, transient) triple is asked for, by listing the class
// directory and validating every metadata file found; afterwards the
// lifecycle operations keep it current. Nothing is written to disk, and a map
// once built is never rebuilt or dropped (except by resetForTesting).
//
// A class map is keyed "<user>-<class name>" ("501-Data/Application"); in
// messages it is named by its class name followed by "(transient)" for
// transient maps ("Data/Application(transient)").
//
// One mutex guards all maps, including the lazy build (so a first look-up of
// a class blocks other cache users until the build ends); the existence
// checks of found entries run after it is released. Each operation is atomic;
// callers serialise changes to one identifier with the identifier locks.
//
// Records are shared: the cache hands out the objects it holds, so callers
// change an entry's fields only through the cache.
//
// Codes: 47 (BTHErrorCacheInvalidInput) bad arguments, including a class the
// user may not have (bundle classes belong to user 33, system classes to
// 499); 43 (BTHErrorCacheRebuildFailed) a class directory cannot be listed,
// with the listing error as underlying error; 21 (BTHErrorNotFound, not
// logged) absent identifiers; 44 (BTHErrorCacheInconsistent) an entry whose
// metadata file has gone. An exception inside an operation is reported under
// the exception rule (code 40, logged, the process ends on internal builds);
// the operation releases the lock, fails, and hands the code-40 error out
// like any other, since callers expect an error with every failure.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "BTHError.h"
#include "BTHMetadata.h"
#include "BTHMetadataPresence.h"

namespace berth {

using BTHMetadataRef = std::shared_ptr<BTHMetadata>;

class BTHContainerCache {
  public:
    static BTHContainerCache& sharedInstance();

    // The entry of `identifier`, checked against the disk after the lock is
    // released (its metadata file must still exist, else 44; the entry stays,
    // removing it is the caller's decision). After the map's first build a
    // look-up costs one map access and, while nothing on the file's way
    // changed, one call on a change watch (see BTHMetadataPresence).
    BTHMetadataRef containerForUser(uid_t userId, uint64_t containerClass,
                                    const std::string& identifier, bool transient,
                                    BTHErrorRef* error);

    // The live entry, else the transient one, whose UUID's upper-case string
    // equals `uuidString` exactly (so a lower-case string finds nothing); its
    // `transient` flag is set to the map it came from. Null otherwise.
    BTHMetadataRef containerForUser(uid_t userId, uint64_t containerClass,
                                    const std::string& identifier, const std::string& uuidString);

    // A copy of `record` as it is now, taken under the cache's lock: the
    // cache changes a few of a shared record's fields under that lock alone,
    // while the record's identifier is held only for reading.
    BTHMetadataRef snapshotOf(const BTHMetadata& record);

    // Every entry whose metadata file still exists (the others are logged
    // and left out; the call still succeeds). An empty map gives an empty
    // array.
    std::optional<std::vector<BTHMetadataRef>> allContainersForUser(uid_t userId,
                                                                    uint64_t containerClass,
                                                                    bool transient,
                                                                    BTHErrorRef* error);

    // The identifiers of the class map, without disk checks.
    std::optional<std::vector<std::string>> allContainerIdentifiersForUser(uid_t userId,
                                                                           uint64_t containerClass,
                                                                           bool transient,
                                                                           BTHErrorRef* error);

    // Sets the record's url to `url` (an absolute path) and stores it under
    // its identifier in the map of (userId, its class, transient), replacing
    // any entry; builds the map first if it did not exist yet, so a container
    // already on disk is held once, not twice.
    bool addContainerMetadata(const BTHMetadataRef& metadata, uid_t userId,
                              const std::filesystem::path& url, bool transient, BTHErrorRef* error);

    // Drops the identifier's entry (absent is not an error).
    bool removeContainerForUser(uid_t userId, uint64_t containerClass,
                                const std::string& identifier, bool transient, BTHErrorRef* error);

    // Forgets every class map, so the next use rebuilds from disk (tests and
    // benchmarks only).
    void resetForTesting();

  private:
    using ClassMap = std::map<std::string, BTHMetadataRef>;

    BTHContainerCache() = default;

    // The class map, built when absent. Fails with 47 when the class is not
    // one the user may have, else with the listing error of the class
    // directory (no map is stored then, so the next use tries again). Called
    // with cacheLock_ held.
    ClassMap* getCacheForUserId(uid_t userId, uint64_t containerClass, bool transient,
                                BTHErrorRef* error);

    // getCacheForUserId for a public operation named `function`: a listing
    // failure becomes 43 over the listing error; a 47 is handed on as it is.
    // Called with cacheLock_ held.
    ClassMap* classMapForOperation(const char* function, int line, uid_t userId,
                                   uint64_t containerClass, bool transient, BTHErrorRef* error);

    // A new class map read from the class directory: every item whose
    // metadata validates for the user and the directory, under its
    // identifier (a later duplicate replaces an earlier one). Null with the
    // listing error when the directory cannot be listed.
    static std::optional<ClassMap> buildClassMap(uid_t userId, uint64_t containerClass,
                                                 bool transient, BTHErrorRef* error);

    std::mutex cacheLock_;
    std::map<std::string, ClassMap> liveContainerCache_;
    std::map<std::string, ClassMap> transientContainerCache_;
    // The existence checks of entries found by look-ups (safe without
    // cacheLock_).
    BTHMetadataPresence presence_;
};

}  // namespace berth
