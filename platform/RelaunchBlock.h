// Relaunch blocks: the record that an application is held terminated and
// must not be started, kept as one file per application identifier in
//
//   <root>/run/berthd/terminated/<identifier>     (holds the reason's name)
//
// The termination service writes and removes them; berth-launch reads them
// before it starts anything and refuses a held application. The daemon
// clears the directory at start-up: the holds belong to the daemon process
// that took them, so a daemon that died cannot leave an application blocked.
#pragma once

#include <filesystem>
#include <optional>
#include <string>

namespace berth {

class RelaunchBlocks {
  public:
    // <root>/run/berthd/terminated
    static std::filesystem::path defaultDirectory();

    explicit RelaunchBlocks(std::filesystem::path directory = defaultDirectory())
        : directory_(std::move(directory)) {}

    const std::filesystem::path& directory() const { return directory_; }

    // Blocks `identifier`, recording `reason`; the file appears whole (written
    // aside, then renamed into place). 0 or an errno.
    int set(const std::string& identifier, const std::string& reason) const;

    // Lifts the block of `identifier`; 0 also when there was none.
    int clear(const std::string& identifier) const;

    // Lifts every block. 0, or the first errno met.
    int clearAll() const;

    // The reason when `identifier` is blocked, nullopt when it is not. Any
    // item of that name counts as a block, so what cannot be read refuses
    // rather than permits.
    std::optional<std::string> reasonFor(const std::string& identifier) const;

  private:
    std::filesystem::path directory_;
};

}  // namespace berth
