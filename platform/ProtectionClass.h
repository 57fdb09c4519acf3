// The file-protection class store. An item's class is a signed 32-bit number
// kept in its extended attribute "trusted.berth.protection_class"; an item
// without one has the class of its nearest ancestor directory that has one,
// else 0. So a directory's class reaches everything later created beneath it
// that does not get a class of its own.
//
// Class 1 is the class whose contents are out of reach while the device is
// locked: getting or setting the class of an item whose class is 1 fails
// with EPERM then, and the callers retry after the next unlock.
//
// Both operations act on an open descriptor (the caller opened the item
// without following a link). They return 0 or an error number.
#pragma once

#include <cstdint>
#include <functional>

namespace berth::protection {

inline constexpr const char* kAttributeName = "trusted.berth.protection_class";
inline constexpr int32_t kClassUnreadableWhileLocked = 1;

// Whether the device is locked now; the key bag's answer unless a caller (a
// test) gives its own.
using LockQuery = std::function<bool()>;

// The class of the open item `fd` (own or inherited).
int getClass(int fd, int32_t* protectionClass, const LockQuery& isLocked = {});

// Gives the open item `fd` its own class.
int setClass(int fd, int32_t protectionClass, const LockQuery& isLocked = {});

}  // namespace berth::protection
