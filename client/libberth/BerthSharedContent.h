// Typed calls of berthd's shared-content, network-extension and
// user-managed-assets commands.
//
//   berth::BerthSharedContent content(*connection);
//   berth::ContainerError failure;
//   // Hand a prepared item over inside a system-group container.
//   auto staged = content.stageSharedContent("systemgroup.com.example.shared",
//                                            "incoming/report", "published/report", &failure);
//   auto assets = content.userManagedAssetsPath("com.example.notes", &failure);
//   content.deleteUserManagedAsset("com.example.notes", "downloads/old.bin", &failure);
//
//   command  call                    entitlement ("sys.kelp.private.Berth." ...)
//   26       stageSharedContent      .stageSharedContent, and the system group
//                                    in the caller's code-signing entitlements
//   27       setNetworkExtension     .networkExtension, and the caller must be
//                                    the network-extension session daemon
//   28       userManagedAssetsPath   .userManagedAssets
//   29       deleteUserManagedAsset  .userManagedAssets
//
// Paths are relative to the container (26) or to the assets directory (29);
// a ".." component is refused (BTHErrorInvalidParameter, 38) and so is a
// path that leads outside through a link (BTHErrorInvalidPath, 10).
// Commands 27 to 29 act for the device's current mobile user.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>

#include "libberth/BerthContainers.h"

namespace berth {

enum BerthSharedContentCommand : uint64_t {
    kBerthCommandStageSharedContent = 26,
    kBerthCommandSetNetworkExtension = 27,
    kBerthCommandUserManagedAssetsPath = 28,
    kBerthCommandDeleteUserManagedAsset = 29,
};

Value makeStageSharedContentRequest(const std::string& systemGroup, const std::string& sourcePath,
                                    const std::string& destPath);
Value makeSetNetworkExtensionRequest(const std::string& identifier, uint64_t containerClass);
Value makeUserManagedAssetsPathRequest(const std::string& identifier);
// The asset's path goes as "SourcePath".
Value makeDeleteUserManagedAssetRequest(const std::string& identifier,
                                        const std::string& relativePath);

class BerthSharedContent {
  public:
    explicit BerthSharedContent(BerthConnection& connection,
                                std::chrono::milliseconds timeout = std::chrono::seconds(30))
        : connection_(connection), timeout_(timeout) {}

    // Command 26: the staged item's new path.
    std::optional<std::filesystem::path> stageSharedContent(const std::string& systemGroup,
                                                            const std::string& sourcePath,
                                                            const std::string& destPath,
                                                            ContainerError* error = nullptr);
    // Command 27: the container of `identifier` (class 2 or 6) for the
    // network-extension agent.
    bool setNetworkExtension(const std::string& identifier, uint64_t containerClass,
                             ContainerError* error = nullptr);
    // Command 28: the app's assets directory, made on first use.
    std::optional<std::filesystem::path> userManagedAssetsPath(const std::string& identifier,
                                                               ContainerError* error = nullptr);
    // Command 29: moves one item of the assets directory to death row.
    bool deleteUserManagedAsset(const std::string& identifier, const std::string& relativePath,
                                ContainerError* error = nullptr);

  private:
    std::optional<Value> exchange(const Value& request, ContainerError* error);

    BerthConnection& connection_;
    std::chrono::milliseconds timeout_;
};

}  // namespace berth
