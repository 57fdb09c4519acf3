// A real berthd started on a scratch device root, for integration tests that
// drive it through its sockets.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace berth::test {

// How a daemon is started beyond its device root.
struct DaemonLaunch {
    std::map<std::string, std::string> environment{};
    // Listening sockets handed over as the service manager does: from
    // descriptor 3 on, with LISTEN_PID, LISTEN_FDS and LISTEN_FDNAMES.
    std::vector<std::pair<std::string, int>> passedSockets{};
    // A program that starts the daemon for us; the daemon's path is
    // appended to these arguments.
    std::vector<std::string> launcher{};
};

class DaemonProcess {
  public:
    // Starts the daemon binary on `root` with extra environment variables;
    // its standard error goes to <root>/berthd.stderr.
    DaemonProcess(std::filesystem::path root, std::map<std::string, std::string> environment = {});
    DaemonProcess(std::filesystem::path root, DaemonLaunch launch);
    ~DaemonProcess();  // kills it if still running
    DaemonProcess(const DaemonProcess&) = delete;
    DaemonProcess& operator=(const DaemonProcess&) = delete;

    pid_t pid() const { return pid_; }
    const std::filesystem::path& root() const { return root_; }
    std::filesystem::path requestSocket() const;

    // Waits until the request socket accepts connections; false if the
    // daemon exits first or the wait runs out.
    bool waitUntilServing(std::chrono::milliseconds patience = std::chrono::seconds(20));

    // Waits for the daemon to exit and returns its exit status (or 128 +
    // signal), nullopt if it is still running after `patience`.
    std::optional<int> waitForExit(std::chrono::milliseconds patience = std::chrono::seconds(20));

    // Sends `signal` and waits for the exit.
    std::optional<int> stop(int signal);

    std::string standardError() const;

    // The path of the berthd binary built with the tests.
    static std::filesystem::path binary();

  private:
    std::filesystem::path root_;
    pid_t pid_ = -1;
    std::optional<int> status_;
};

}  // namespace berth::test
