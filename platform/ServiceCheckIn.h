// Bootstrap check-in: claiming a named endpoint of the daemon.
//
// Each endpoint is a Unix socket in the runtime directory,
// <root>/run/berthd/<name>, next to a lock file <name>.lock. Claiming an
// endpoint takes an exclusive flock on the lock file and keeps it for as long
// as the returned object lives (the daemon keeps it for the life of the
// process; the kernel drops it when the process dies, however it dies). So:
//
//   - a second daemon on the same device root fails to check in and touches
//     nothing: neither the socket file nor the first daemon's listener;
//   - a socket file left behind by a killed instance is stale by definition
//     once its lock is free, and is unlinked and bound afresh.
//
// When the service manager passed a listening socket named after the
// endpoint (socket activation), the claim takes that socket instead of
// binding one; the lock is taken all the same.
//
// The runtime directory is created (mode 0755) when missing; no component of
// its path below the device root may be a symbolic link, and the socket is
// created and chmod'ed relative to the directory descriptor, so nobody can
// redirect the bind elsewhere.
#pragma once

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>

#include "platform/UniqueFd.h"

namespace berth {

class ServiceCheckIn {
  public:
    // <root>/run/berthd
    static std::filesystem::path runtimeDirectory();

    // Claims the endpoint `name` in `directory` (default: runtimeDirectory())
    // as a listening socket of `socketType` (SOCK_STREAM or SOCK_SEQPACKET)
    // with file mode `mode`. On failure: nullopt, an errno value in `error`
    // (EADDRINUSE when another process holds the endpoint) and the reason in
    // `why`.
    static std::optional<ServiceCheckIn> claim(const std::string& name, int socketType, mode_t mode,
                                               int* error = nullptr, std::string* why = nullptr,
                                               const std::filesystem::path& directory = {});

    ServiceCheckIn(ServiceCheckIn&&) noexcept = default;
    ServiceCheckIn& operator=(ServiceCheckIn&&) noexcept = default;

    // The listening socket (non-blocking, close-on-exec).
    int socket() const { return socket_.get(); }
    // Hands the listening socket over; the claim (the lock) stays with this
    // object.
    UniqueFd takeSocket() { return std::move(socket_); }
    const std::filesystem::path& path() const { return path_; }

  private:
    ServiceCheckIn(UniqueFd lock, UniqueFd socket, std::filesystem::path path)
        : lock_(std::move(lock)), socket_(std::move(socket)), path_(std::move(path)) {}

    UniqueFd lock_;
    UniqueFd socket_;
    std::filesystem::path path_;
};

}  // namespace berth
