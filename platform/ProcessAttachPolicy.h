// Whether processes of one user can attach to (trace, read and write the
// memory of) each other. A launched app runs as the same user as every other
// program of that user; only the kernel's attach restriction keeps those
// programs from injecting code into the app and speaking with its identity.
#pragma once

#include <filesystem>
#include <optional>

namespace berth {

// The kernel's attach restriction level: 0 lets any process attach to
// another of its user, 1 only to its descendants, 2 only with the
// capability, 3 never. Nullopt when the kernel has no such restriction (or
// it cannot be read): the same as 0.
std::optional<int> processAttachRestriction(const std::filesystem::path& procRoot = "/proc");

// Whether the restriction keeps a process of an app's user from attaching
// to the launched app.
inline bool processAttachRestricted(const std::optional<int>& level) {
    return level && *level >= 1;
}

}  // namespace berth
