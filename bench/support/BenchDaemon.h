// What the benchmarks that measure a real berthd share: a scratch device root
// with the device's accounts and this program signed into its registry, the
// daemon started on it, and a synchronous client of its request socket.
// Failures throw std::runtime_error with the reason.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "core/Value.h"
#include "platform/UniqueFd.h"

namespace berth::bench {

// Writes the accounts, groups and homes of a device root at `root` and signs
// this program into the root's registry as `identifier` with `entitlements`.
void prepareBenchRoot(const std::filesystem::path& root, const std::string& identifier,
                      const Value& entitlements);

// Command 0 for the container of `identifier` in `containerClass` of user
// 501 (not transient); `create` makes it when it is missing.
Value lookupRequest(uint64_t containerClass, const std::string& identifier, bool create);

// Makes a scratch directory named after `name`, points BERTH_ROOT at its
// "root" (the daemon modules a benchmark uses read it once: call this before
// any of them runs) and runs `body` with that root. A failure is printed and
// leaves the root in place for a look; success removes it. The exit status.
int runOnScratchRoot(const char* name,
                     const std::function<void(const std::filesystem::path&)>& body);

// One connection speaking the relay synchronously: a request, then its
// reply. A reply slower than `patience` counts as a broken connection.
class BenchClient {
  public:
    explicit BenchClient(const std::filesystem::path& socketPath,
                         std::chrono::seconds patience = std::chrono::seconds(30));
    bool connected() const { return fd_.get() >= 0; }

    // The reply; nullopt when the exchange failed.
    std::optional<Value> exchange(const Value& request);
    // The reply's "ReplyError"; 0 when the exchange failed.
    uint64_t call(const Value& request);

  private:
    bool readExactly(uint8_t* into, size_t size);
    bool readFrame();

    UniqueFd fd_;
    uint64_t nextId_ = 1;
    std::vector<uint8_t> frame_, reply_;
};

// A berthd serving `root`, its output in <root>/berthd.output; returns once
// it accepts requests. Killed, with its socket and the root's first-boot
// marker removed, when the object goes.
class BenchDaemon {
  public:
    BenchDaemon(const std::filesystem::path& binary, const std::filesystem::path& root);
    ~BenchDaemon();
    BenchDaemon(const BenchDaemon&) = delete;
    BenchDaemon& operator=(const BenchDaemon&) = delete;

    const std::filesystem::path& socket() const { return socket_; }
    pid_t pid() const { return pid_; }

  private:
    void stop();

    std::filesystem::path socket_;
    pid_t pid_ = -1;
};

}  // namespace berth::bench
