// The two routines every state file of the daemon goes through (container
// metadata, the replace journal, the code-signing mapping, the migration
// status).
#pragma once

#include <cstdint>
#include <filesystem>
#include <optional>

#include "BTHError.h"
#include "core/Value.h"

namespace berth {

// Write options: the file is replaced atomically; protection class "none"
// (the file carries no protection class of its own).
// BTHWriteSyncLater, with BTHWriteAtomic: atomic, but the caller makes the
// file and its directory durable itself (a file inside a tree that is synced
// as a whole before anything can find it).
enum : uint32_t {
    BTHWriteAtomic = 1u << 0,
    BTHWriteSyncLater = 1u << 1,
    BTHWriteFileProtectionNone = 1u << 28,
};
inline constexpr uint32_t kBTHStateFileWriteOptions = BTHWriteAtomic | BTHWriteFileProtectionNone;

// Read options: the mutability wanted of the result. Every Value is a
// mutable copy, so the option is accepted and has no further effect.
enum : uint32_t {
    BTHReadImmutable = 0,
    BTHReadMutableContainers = 1,
    BTHReadMutableContainersAndLeaves = 2,
};

// Serialises `dictionary` as a binary property list and writes it to `url`.
// With BTHWriteAtomic the write is atomic and durable: a temporary file in the
// same directory, fsync, rename over `url`, fsync of the directory; a reader
// sees the old or the new file, and after a crash one of them is there whole.
// Neither the directory nor the file is reached through a symbolic link. On
// failure returns false and the serialiser's or writer's error (POSIX domain
// for system calls).
bool BTH_writeToURL(const Value& dictionary, const std::filesystem::path& url, uint32_t options,
                    BTHErrorRef* error);

// Reads the whole file at `url` (never through a symbolic link) and parses it
// as a binary or XML property list. Returns it only when its top level is a
// dictionary. A read failure returns the read's POSIX error; data that does
// not parse, is too large or too deep, or whose top level is not a dictionary
// returns the general-domain error 2048.
std::optional<Value> BTH_dictionaryWithContentsOfURL(const std::filesystem::path& url,
                                                     uint32_t options, BTHErrorRef* error);

// `value` as a file written by BTH_writeToURL gives it back: a date keeps only
// what the format's seconds since 2001 hold. A value that cannot be written
// is given back unchanged (its write fails anyway).
Value BTH_valueAsStored(const Value& value);

}  // namespace berth
