// The running system's version, as the daemon's once-per-update work needs
// it: read from the device root's os-release file. "BuildVersion" is BUILD_ID
// (else VERSION_ID), "ReleaseType" is RELEASE_TYPE, "Version" is VERSION_ID
// and "Name" is NAME; keys whose field is missing are left out.
#pragma once

#include <optional>
#include <string>

#include "core/Value.h"

namespace berth {

inline constexpr const char* kSystemVersionBuildKey = "BuildVersion";
inline constexpr const char* kSystemVersionReleaseTypeKey = "ReleaseType";

// The system-version dictionary, read anew on every call; nullopt when the
// file cannot be read.
std::optional<Value> systemVersionDictionary();

// The fields of an os-release text: KEY=value lines, values optionally in
// single or double quotes (with backslash escapes inside double quotes),
// comments and malformed lines skipped.
Value systemVersionFromOsRelease(const std::string& text);

}  // namespace berth
