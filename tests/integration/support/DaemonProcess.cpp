#include "DaemonProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>

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
    : root_(std::move(root)) {
    environment["BERTH_ROOT"] = root_.string();
    std::vector<std::string> entries;
    for (char** e = environ; *e; ++e)
        if (std::strncmp(*e, "BERTH_", 6) != 0) entries.emplace_back(*e);
    for (const auto& [k, v] : environment) entries.push_back(k + "=" + v);
    std::vector<char*> envp;
    for (auto& e : entries) envp.push_back(e.data());
    envp.push_back(nullptr);
    const std::string program = binary().string();
    const std::string stderrPath = (root_ / "berthd.stderr").string();

    pid_ = ::fork();
    if (pid_ == 0) {
        int err = ::open(stderrPath.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
        if (err >= 0) ::dup2(err, STDERR_FILENO);
        char* argv[] = {const_cast<char*>(program.c_str()), nullptr};
        ::execve(program.c_str(), argv, envp.data());
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
