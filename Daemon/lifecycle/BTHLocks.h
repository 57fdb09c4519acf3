// Identifier locks: one reader/writer lock per identifier (the container
// operations lock a container's upper-case UUID string) and one lock over all
// identifiers, taken by every operation that creates, enumerates, replaces or
// removes containers or touches state shared by many of them.
//
//   an identifier, reading   waits while all identifiers are held for writing,
//                            then while a writer holds that identifier
//   an identifier, writing   waits while all identifiers are held in any mode,
//                            then while anyone holds that identifier
//   all, reading             waits while any identifier writer has entered
//                            (holding or waiting) or all are held for writing
//   all, writing             waits while any identifier acquisition has
//                            entered or all are held in any mode
//
// Waiters have no turn. The functions never fail and never time out. They
// are not reentrant and not tied to a thread: whoever took a lock releases it
// exactly once, from any thread. Several identifiers given at once are taken
// in ascending order and released in descending order, each once, so callers
// that lock sets of identifiers cannot deadlock on each other.
//
// A broken invariant (releasing what is not held, a count going below 0)
// stops the process with an assertion failure naming the condition.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "core/Value.h"

namespace berth {

void _lock_identifier(const std::string& identifier, bool forWriting);
void _lock_identifier(const std::vector<std::string>& identifiers, bool forWriting);
// A string or an array of strings; anything else (an array holding anything
// but strings included) logs "Unknown parameter type!" and ends the process.
void _lock_identifier(const Value& identifiers, bool forWriting);

void unlock_identifier(const std::string& identifier);
void unlock_identifier(const std::vector<std::string>& identifiers);
void unlock_identifier(const Value& identifiers);

// A literal names one identifier (it would otherwise convert as readily to a
// Value as to a string).
inline void _lock_identifier(const char* identifier, bool forWriting) {
    _lock_identifier(std::string(identifier), forWriting);
}
inline void unlock_identifier(const char* identifier) {
    unlock_identifier(std::string(identifier));
}

void _lock_all_identifiers(bool forWriting);
void unlock_all_identifiers();

// Holds one identifier lock (or none, when `engaged` is false) for a scope.
class BTHIdentifierLockGuard {
  public:
    BTHIdentifierLockGuard(std::string identifier, bool forWriting, bool engaged = true);
    ~BTHIdentifierLockGuard();
    BTHIdentifierLockGuard(const BTHIdentifierLockGuard&) = delete;
    BTHIdentifierLockGuard& operator=(const BTHIdentifierLockGuard&) = delete;

  private:
    std::string identifier_;
    bool engaged_;
};

// Holds the all-identifiers lock (or nothing, when `engaged` is false) for a
// scope.
class BTHAllIdentifiersLockGuard {
  public:
    explicit BTHAllIdentifiersLockGuard(bool forWriting, bool engaged = true);
    ~BTHAllIdentifiersLockGuard();
    BTHAllIdentifiersLockGuard(const BTHAllIdentifiersLockGuard&) = delete;
    BTHAllIdentifiersLockGuard& operator=(const BTHAllIdentifiersLockGuard&) = delete;

  private:
    bool engaged_;
};

// The bookkeeping at one moment, for tests and diagnostics.
struct BTHLocksSnapshot {
    int32_t identifierReaderCount = 0;
    int32_t identifierWriterCount = 0;
    int32_t allReaderWriterState = 0;  // 0 free, -1 one writer, n > 0 readers
    struct Record {
        std::string identifier;
        uint64_t useCount = 0;
        int32_t lockState = 0;  // 0 free, -1 writer, n > 0 readers
    };
    std::vector<Record> records;  // in identifier order
};
BTHLocksSnapshot BTHLocksSnapshotForTesting();

}  // namespace berth
