#include "BTHLocks.h"

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdlib>
#include <functional>
#include <memory>
#include <mutex>
#include <string_view>
#include <unordered_map>

#include "BTHLog.h"
#include "core/Format.h"
#include "platform/ThreadPool.h"

namespace berth {

namespace {

// A broken invariant is a programming error in a caller (releasing what it
// does not hold) or in this module; going on would corrupt the bookkeeping
// that keeps every container operation apart, so the process stops. Unlike
// assert(), the check stays in release builds.
[[noreturn]] void invariantViolated(std::string_view condition) {
    abortWithMessage(format("BTHLocks invariant violated: %s", condition));
}

#define BTH_LOCKS_CHECK(condition, description)      \
    do {                                             \
        if (!(condition)) [[unlikely]]               \
            ::berth::invariantViolated(description); \
    } while (0)

const char* modeName(bool forWriting) {
    return forWriting ? "writing" : "reading";
}

// The reader/writer lock of one identifier. Unlike a pthread rwlock it is not
// tied to the thread that took it: a holder may hand its lock to another
// thread to release (the C library would take a write lock released by
// another thread for a read unlock). Readers enter while no writer holds it,
// as with the system rwlock's default attributes.
class IdentifierRWLock {
  public:
    void lockForReading() {
        std::unique_lock lock(mutex_);
        writerGone_.wait(lock, [this] { return !writer_; });
        ++readers_;
    }

    void lockForWriting() {
        std::unique_lock lock(mutex_);
        free_.wait(lock, [this] { return !writer_ && readers_ == 0; });
        writer_ = true;
    }

    // Releases the one writer, or one of the readers.
    void unlock() {
        std::lock_guard lock(mutex_);
        if (writer_) {
            writer_ = false;
            writerGone_.notify_all();
            free_.notify_one();
        } else if (--readers_ == 0) {
            free_.notify_one();
        }
    }

  private:
    std::mutex mutex_;
    std::condition_variable writerGone_;  // readers wait here
    std::condition_variable free_;        // writers wait here
    bool writer_ = false;
    uint32_t readers_ = 0;
};

// One identifier in use: alive from its first acquisition to the release
// that brings useCount to 0.
struct BTHIdentifierLock {
    IdentifierRWLock rwlock;
    uint64_t useCount = 1;  // holders and waiters; changed only under the mutex
    // Mirror of rwlock: 0 free, -1 writer, n > 0 readers.
    std::atomic<int32_t> lockState{0};
};

// Identifiers hash and compare as plain byte strings.
using IdentifierMap = std::unordered_map<std::string, BTHIdentifierLock>;

// Storage for an object that is made on demand and never destroyed, so that
// threads still holding locks while the process exits never meet a dead map.
template <typename T>
class NeverDestroyed {
  public:
    T* construct() { return std::construct_at(reinterpret_cast<T*>(storage_)); }

  private:
    alignas(T) unsigned char storage_[sizeof(T)] = {};
};

// The process-wide lock record. Every field is constant-initialised before
// any code runs and none has a destructor, so the locks work from static
// initialisers on and until the process is gone.
struct BTHLocksRecord {
    pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
    pthread_cond_t allWriterCondition = PTHREAD_COND_INITIALIZER;
    pthread_cond_t allReaderCondition = PTHREAD_COND_INITIALIZER;
    pthread_cond_t identifierWriterCondition = PTHREAD_COND_INITIALIZER;
    pthread_cond_t identifierReaderCondition = PTHREAD_COND_INITIALIZER;
    // Null until the first identifier lock is taken; then kept for good.
    IdentifierMap* identifierToLockMap = nullptr;
    int32_t identifierReaderCount = 0;
    int32_t identifierWriterCount = 0;
    int32_t allReaderWriterState = 0;  // 0 free, -1 one writer, n > 0 readers
};

constinit BTHLocksRecord gBTHLocks;
constinit NeverDestroyed<IdentifierMap> gIdentifierMapStorage;

// Holds gBTHLocks.mutex for a scope.
class MutexHolder {
  public:
    MutexHolder() { pthread_mutex_lock(&gBTHLocks.mutex); }
    ~MutexHolder() { pthread_mutex_unlock(&gBTHLocks.mutex); }
    MutexHolder(const MutexHolder&) = delete;
    MutexHolder& operator=(const MutexHolder&) = delete;
};

void waitOn(pthread_cond_t& condition) {
    pthread_cond_wait(&condition, &gBTHLocks.mutex);
}

// Counts the acquisition in and finds or makes its record; the mutex is held.
BTHIdentifierLock& enterIdentifier(const std::string& identifier, bool forWriting) {
    if (forWriting) {
        while (gBTHLocks.allReaderWriterState != 0) waitOn(gBTHLocks.identifierWriterCondition);
        ++gBTHLocks.identifierWriterCount;
    } else {
        while (gBTHLocks.allReaderWriterState == -1) waitOn(gBTHLocks.identifierReaderCondition);
        ++gBTHLocks.identifierReaderCount;
    }
    if (!gBTHLocks.identifierToLockMap)
        gBTHLocks.identifierToLockMap = gIdentifierMapStorage.construct();
    auto [it, created] = gBTHLocks.identifierToLockMap->try_emplace(identifier);
    if (!created) ++it->second.useCount;
    return it->second;
}

void take_one_lock(const std::string& identifier, bool forWriting) {
    BTH_FUNCTION("take_one_lock");
    BTHIdentifierLock* record;
    {
        MutexHolder holder;
        record = &enterIdentifier(identifier, forWriting);
    }
    // The record lives while this acquisition is counted in its useCount, so
    // the possibly long wait happens without the mutex.
    BTHLogDebug("Waiting to lock %@ for %s", identifier, modeName(forWriting));
    if (forWriting) {
        record->rwlock.lockForWriting();
        int32_t expected = 0;
        BTH_LOCKS_CHECK(record->lockState.compare_exchange_strong(expected, -1),
                        "lockState == 0 when taking an identifier for writing");
    } else {
        record->rwlock.lockForReading();
        BTH_LOCKS_CHECK(record->lockState.fetch_add(1) + 1 > 0,
                        "lockState > 0 after taking an identifier for reading");
    }
    BTHLogDebug("Got lock on identifier %@", identifier);
}

// Drops a writer from the counts and wakes what it held off; the mutex is held.
void leaveAsWriter(BTHIdentifierLock& record) {
    int32_t expected = -1;
    BTH_LOCKS_CHECK(record.lockState.compare_exchange_strong(expected, 0),
                    "lockState == -1 when releasing a writer");
    BTH_LOCKS_CHECK(gBTHLocks.allReaderWriterState == 0,
                    "allReaderWriterState == 0 when releasing an identifier writer");
    BTH_LOCKS_CHECK(gBTHLocks.identifierWriterCount > 0,
                    "identifierWriterCount > 0 when releasing an identifier writer");
    --gBTHLocks.identifierWriterCount;
    if (gBTHLocks.identifierReaderCount == 0 && gBTHLocks.identifierWriterCount == 0)
        pthread_cond_signal(&gBTHLocks.allWriterCondition);
    if (gBTHLocks.identifierWriterCount == 0 && gBTHLocks.allReaderWriterState != -1)
        pthread_cond_broadcast(&gBTHLocks.allReaderCondition);
}

// Drops a reader from the counts and wakes what it held off; the mutex is held.
void leaveAsReader(BTHIdentifierLock& record) {
    BTH_LOCKS_CHECK(record.lockState.fetch_sub(1) - 1 >= 0,
                    "lockState >= 0 after releasing a reader");
    BTH_LOCKS_CHECK(gBTHLocks.allReaderWriterState >= 0,
                    "allReaderWriterState >= 0 when releasing an identifier reader");
    BTH_LOCKS_CHECK(gBTHLocks.identifierReaderCount > 0,
                    "identifierReaderCount > 0 when releasing an identifier reader");
    --gBTHLocks.identifierReaderCount;
    if (gBTHLocks.allReaderWriterState == 0 && gBTHLocks.identifierReaderCount == 0 &&
        gBTHLocks.identifierWriterCount == 0)
        pthread_cond_signal(&gBTHLocks.allWriterCondition);
}

void unlock_one_lock(const std::string& identifier) {
    BTH_FUNCTION("unlock_one_lock");
    MutexHolder holder;
    IdentifierMap* map = gBTHLocks.identifierToLockMap;
    BTH_LOCKS_CHECK(map != nullptr, "identifierToLockMap exists when releasing an identifier");
    auto it = map->find(identifier);
    BTH_LOCKS_CHECK(it != map->end(),
                    "identifierToLockMap holds a record for an identifier being released");
    BTHIdentifierLock& record = it->second;
    int32_t state = record.lockState.load();
    BTH_LOCKS_CHECK(state != 0, "lockState != 0 when releasing an identifier");

    if (state == -1)
        leaveAsWriter(record);
    else
        leaveAsReader(record);
    --record.useCount;
    record.rwlock.unlock();
    BTHLogDebug("Unlocked identifier %@", identifier);

    if (record.useCount == 0) {
        BTHLogDebug("Destroying lock for identifier %@", identifier);
        BTH_LOCKS_CHECK(record.lockState.load() == 0,
                        "lockState == 0 when destroying an identifier's lock");
        map->erase(it);
    }
}

// The distinct identifiers of `identifiers`, ascending byte-wise or, with
// `descending`, the other way round. The caller's array is left alone.
std::vector<std::string> distinctInOrder(const std::vector<std::string>& identifiers,
                                         bool descending) {
    std::vector<std::string> sorted = identifiers;
    if (descending)
        std::sort(sorted.begin(), sorted.end(), std::greater<>());
    else
        std::sort(sorted.begin(), sorted.end());
    sorted.erase(std::unique(sorted.begin(), sorted.end()), sorted.end());
    return sorted;
}

// The identifiers of a Value that is not a string: an array whose elements
// are all strings. Anything else is a caller's programming error that ends
// the process with "Unknown parameter type!" logged under `function`.
std::vector<std::string> identifiersOfArray(const Value& identifiers, const char* function) {
    if (const Value::Array* array = identifiers.arrayValue()) {
        std::vector<std::string> names;
        names.reserve(array->size());
        for (const Value& element : *array) {
            const std::string* name = element.string();
            if (!name) break;
            names.push_back(*name);
        }
        if (names.size() == array->size()) return names;
    }
    const char* bthFunctionName = function;
    BTHLogError("Unknown parameter type!");
    std::abort();
}

}  // namespace

void _lock_identifier(const std::string& identifier, bool forWriting) {
    take_one_lock(identifier, forWriting);
}

void _lock_identifier(const std::vector<std::string>& identifiers, bool forWriting) {
    for (const std::string& identifier : distinctInOrder(identifiers, false))
        take_one_lock(identifier, forWriting);
}

void _lock_identifier(const Value& identifiers, bool forWriting) {
    if (identifiers.isString())
        _lock_identifier(*identifiers.string(), forWriting);
    else
        _lock_identifier(identifiersOfArray(identifiers, "_lock_identifier"), forWriting);
}

void unlock_identifier(const std::string& identifier) {
    unlock_one_lock(identifier);
}

void unlock_identifier(const std::vector<std::string>& identifiers) {
    for (const std::string& identifier : distinctInOrder(identifiers, true))
        unlock_one_lock(identifier);
}

void unlock_identifier(const Value& identifiers) {
    if (identifiers.isString())
        unlock_identifier(*identifiers.string());
    else
        unlock_identifier(identifiersOfArray(identifiers, "unlock_identifier"));
}

void _lock_all_identifiers(bool forWriting) {
    BTH_FUNCTION("_lock_all_identifiers");
    BTHLogDebug("Waiting to lock all identifiers for %s", modeName(forWriting));
    MutexHolder holder;
    if (forWriting) {
        while (gBTHLocks.identifierReaderCount != 0 || gBTHLocks.identifierWriterCount != 0 ||
               gBTHLocks.allReaderWriterState != 0)
            waitOn(gBTHLocks.allWriterCondition);
        gBTHLocks.allReaderWriterState = -1;
    } else {
        while (gBTHLocks.identifierWriterCount != 0 || gBTHLocks.allReaderWriterState == -1)
            waitOn(gBTHLocks.allReaderCondition);
        ++gBTHLocks.allReaderWriterState;
    }
    BTHLogDebug("Locked all identifiers for %s", modeName(forWriting));
}

void unlock_all_identifiers() {
    BTH_FUNCTION("unlock_all_identifiers");
    {
        MutexHolder holder;
        if (gBTHLocks.allReaderWriterState == -1) {
            // Everyone held off by the writer competes again under the rules.
            gBTHLocks.allReaderWriterState = 0;
            pthread_cond_signal(&gBTHLocks.allWriterCondition);
            pthread_cond_broadcast(&gBTHLocks.allReaderCondition);
            pthread_cond_broadcast(&gBTHLocks.identifierWriterCondition);
            pthread_cond_broadcast(&gBTHLocks.identifierReaderCondition);
        } else {
            BTH_LOCKS_CHECK(gBTHLocks.allReaderWriterState > 0,
                            "allReaderWriterState > 0 when releasing all identifiers");
            --gBTHLocks.allReaderWriterState;
            if (gBTHLocks.allReaderWriterState == 0) {
                pthread_cond_broadcast(&gBTHLocks.identifierWriterCondition);
                if (gBTHLocks.identifierReaderCount == 0 && gBTHLocks.identifierWriterCount == 0)
                    pthread_cond_signal(&gBTHLocks.allWriterCondition);
            }
        }
    }
    BTHLogDebug("Unlocked all identifiers");
}

BTHIdentifierLockGuard::BTHIdentifierLockGuard(std::string identifier, bool forWriting,
                                               bool engaged)
    : identifier_(std::move(identifier)), engaged_(engaged) {
    if (engaged_) _lock_identifier(identifier_, forWriting);
}

BTHIdentifierLockGuard::~BTHIdentifierLockGuard() {
    if (engaged_) unlock_identifier(identifier_);
}

BTHAllIdentifiersLockGuard::BTHAllIdentifiersLockGuard(bool forWriting, bool engaged)
    : engaged_(engaged) {
    if (engaged_) _lock_all_identifiers(forWriting);
}

BTHAllIdentifiersLockGuard::~BTHAllIdentifiersLockGuard() {
    if (engaged_) unlock_all_identifiers();
}

BTHLocksSnapshot BTHLocksSnapshotForTesting() {
    BTHLocksSnapshot snapshot;
    MutexHolder holder;
    snapshot.identifierReaderCount = gBTHLocks.identifierReaderCount;
    snapshot.identifierWriterCount = gBTHLocks.identifierWriterCount;
    snapshot.allReaderWriterState = gBTHLocks.allReaderWriterState;
    if (const IdentifierMap* map = gBTHLocks.identifierToLockMap) {
        for (const auto& [identifier, record] : *map)
            snapshot.records.push_back({identifier, record.useCount, record.lockState.load()});
    }
    std::sort(snapshot.records.begin(), snapshot.records.end(),
              [](const auto& a, const auto& b) { return a.identifier < b.identifier; });
    return snapshot;
}

}  // namespace berth
