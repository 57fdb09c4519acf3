// The sandbox service's per-user container mapping: for each user, item type
// and identifier, the path of the container the sandbox launcher must give a
// process of that identifier. The daemon records a container here when it
// creates, moves or removes it; launchers read it without asking the daemon.
//
// Layout under the device root's runtime directory:
//
//   run/berthd/sandbox/<uid>/<item type>/<encoded identifier>  -> symbolic link to the path
//
// One link per entry, replaced atomically (a new link renamed over the old
// one), so a reader sees the old path or the new one, never a torn record,
// and a change costs the same however many entries exist. The identifier is
// encoded so that it is always one plain file name: "%", "/" and NUL become
// "%25", "%2F" and "%00", and a leading "." becomes "%2E". Distinct
// identifiers never share a name (every "%" of a name starts an escape, so a
// name decodes to exactly one identifier), and no name is ".", ".." or
// begins with ".": the names beginning with "." are the store's own
// temporary links. The empty identifier has no entry (EINVAL), nor has one
// whose name would exceed NAME_MAX (ENAMETOOLONG).
//
// The store's directories are made on the first set, mode 0755, and are
// never reached through a symbolic link: each is opened relative to the one
// above it without following links, and a link found in their place fails
// the call.
//
// Item types: 1 data containers, 2 application groups, 4 system containers,
// 8 system group containers. Safe from any thread.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>

namespace berth {

class SandboxMappingStore {
  public:
    // The store under the device root's runtime directory.
    static SandboxMappingStore& shared();

    explicit SandboxMappingStore(std::filesystem::path directory);

    // Sets (with a path) or removes (without) the entry. Returns 0, or the
    // error number of the failure. Removing an absent entry succeeds.
    int setUserStateItem(uid_t user, uint64_t itemType, const std::string& identifier,
                         const std::optional<std::string>& path);

    // The recorded path, or none (also when the entry cannot be read).
    std::optional<std::string> lookup(uid_t user, uint64_t itemType,
                                      const std::string& identifier) const;

    static std::string encodeIdentifier(const std::string& identifier);

    const std::filesystem::path& directory() const { return directory_; }

  private:
    std::filesystem::path directory_;
};

}  // namespace berth
