// Strings for paths: the check that keeps client-given relative paths inside
// the directory they are joined to, and the making of strings from the bytes
// the file system hands back.
//
// On Linux a file name is a sequence of bytes, not text. The daemon keeps
// path strings as those exact bytes (std::string is a byte string), so a name
// read from a directory, made into a string and turned back into a path
// always reaches the same item, whether or not its bytes are valid UTF-8. No
// byte is replaced, normalised or escaped. Code that puts such a string into
// a message or a property list must be prepared for bytes that are not UTF-8.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace berth {

// True when some "/"-separated component of `path` is exactly "..". Empty
// components ("a//b") and components that merely contain dots ("...",
// "..a") are not.
bool containsDotDotPathComponents(std::string_view path);

// The string of the NUL-terminated file-system bytes at `bytes`, byte for
// byte; nullopt for a null pointer.
std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes);

// The string of the `length` file-system bytes at `bytes`, byte for byte.
// A NUL byte cannot be part of a file-system path (the kernel would stop
// there and act on a different path than the string shows), so bytes that
// contain one yield nullopt, as does a null pointer with a non-zero length.
std::optional<std::string> stringWithFileSystemRepresentation(const char* bytes, size_t length);

}  // namespace berth
