#include "DaemonProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <sstream>

#include "TestSupport.h"

namespace berth::test {

namespace {

std::optional<int> decodeStatus(int status) {
    if (WIFEXITED(status)) return WEXITSTATUS(status);
    if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
    return std::nullopt;
}

bool accepts(const std::filesystem::path& socketPath) {
    return connectUnix(socketPath).valid();
}

}  // namespace

std::filesystem::path DaemonProcess::binary() {
    return BERTHD_BINARY_PATH;
}

DaemonProcess::DaemonProcess(std::filesystem::path root,
                             std::map<std::string, std::string> environment)
    : DaemonProcess(std::move(root), DaemonLaunch{std::move(environment), {}, {}}) {}

namespace {

// In the child: the passed sockets at descriptors 3, 4, ... (moved out of
// the way first, so that a source already at 3 or 4 is not overwritten).
void placePassedSockets(const std::vector<std::pair<std::string, int>>& sockets) {
    std::vector<int> moved;
    for (const auto& socket : sockets) moved.push_back(::fcntl(socket.second, F_DUPFD, 100));
    for (size_t i = 0; i < moved.size(); ++i) ::dup2(moved[i], 3 + static_cast<int>(i));
}

}  // namespace

DaemonProcess::DaemonProcess(std::filesystem::path root, DaemonLaunch launch)
    : root_(std::move(root)) {
    launch.environment["BERTH_ROOT"] = root_.string();
    std::vector<std::string> entries;
    for (char** e = environ; *e; ++e)
        if (std::strncmp(*e, "BERTH_", 6) != 0 && std::strncmp(*e, "LISTEN_", 7) != 0 &&
            std::strncmp(*e, "NOTIFY_SOCKET=", 14) != 0)
            entries.emplace_back(*e);
    for (const auto& [k, v] : launch.environment) entries.push_back(k + "=" + v);
    if (!launch.passedSockets.empty()) {
        std::string names;
        for (const auto& socket : launch.passedSockets)
            names += (names.empty() ? "" : ":") + socket.first;
        entries.push_back("LISTEN_FDS=" + std::to_string(launch.passedSockets.size()));
        entries.push_back("LISTEN_FDNAMES=" + names);
        entries.push_back("LISTEN_PID=" + std::string(16, '\0'));  // filled in by the child
    }
    std::vector<char*> envp;
    for (auto& e : entries) envp.push_back(e.data());
    envp.push_back(nullptr);
    std::vector<std::string> arguments = launch.launcher;
    arguments.push_back(binary().string());
    std::vector<char*> argv;
    for (auto& a : arguments) argv.push_back(a.data());
    argv.push_back(nullptr);
    const std::string stderrPath = (root_ / "berthd.stderr").string();

    pid_ = ::fork();
    if (pid_ == 0) {
        int err = ::open(stderrPath.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
        if (err >= 0) ::dup2(err, STDERR_FILENO);
        if (!launch.passedSockets.empty()) {
            placePassedSockets(launch.passedSockets);
            std::snprintf(entries.back().data(), entries.back().size() + 1, "LISTEN_PID=%d",
                          ::getpid());
        }
        ::execvpe(argv[0], argv.data(), envp.data());
        _exit(127);
    }
}

DaemonProcess::~DaemonProcess() {
    if (pid_ > 0 && !status_) stop(SIGKILL);
}

std::filesystem::path DaemonProcess::requestSocket() const {
    return root_ / "run/berthd/sys.kelp.berthd";
}

bool DaemonProcess::waitUntilServing(std::chrono::milliseconds patience) {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    while (std::chrono::steady_clock::now() < deadline) {
        if (waitForExit(std::chrono::milliseconds(0))) return false;
        if (accepts(requestSocket())) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return false;
}

std::optional<int> DaemonProcess::waitForExit(std::chrono::milliseconds patience) {
    if (status_) return status_;
    const auto deadline = std::chrono::steady_clock::now() + patience;
    do {
        int status = 0;
        pid_t done = ::waitpid(pid_, &status, WNOHANG);
        if (done == pid_) {
            status_ = decodeStatus(status);
            return status_;
        }
        if (done < 0) return std::nullopt;
        if (patience.count() > 0) std::this_thread::sleep_for(std::chrono::milliseconds(10));
    } while (std::chrono::steady_clock::now() < deadline);
    return std::nullopt;
}

std::optional<int> DaemonProcess::stop(int signal) {
    if (status_) return status_;
    ::kill(pid_, signal);
    return waitForExit();
}

std::string DaemonProcess::standardError() const {
    std::ifstream in(root_ / "berthd.stderr");
    std::ostringstream s;
    s << in.rdbuf();
    return s.str();
}

}  // namespace berth::test
