#include "BenchDaemon.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <stdexcept>
#include <thread>
#include <utility>

#include "core/RelayCodec.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/NamedSemaphore.h"

namespace berth::bench {

namespace fs = std::filesystem;

void prepareBenchRoot(const fs::path& root, const std::string& identifier,
                      const Value& entitlements) {
    fs::create_directories(root / "etc");
    std::ofstream(root / "etc/passwd") << "root:x:0:0::/private/var/root:/bin/sh\n"
                                          "_bundles:x:33:33::/private/var/ladingd:/bin/false\n"
                                          "_system:x:499:499::/private/var/empty:/bin/false\n"
                                          "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    std::ofstream(root / "etc/group") << "root:x:0:\n_bundles:x:33:\n_system:x:499:\n"
                                         "systemusers:x:510:_system\nmobile:x:501:\n";
    std::ofstream(root / "etc/os-release") << "VERSION_ID=0.1\nBUILD_ID=bench-1\n";
    for (const auto& [home, owner] : {std::pair<const char*, uid_t>{"private/var/root", 0},
                                      {"private/var/ladingd", 33},
                                      {"private/var/empty", 499},
                                      {"private/var/mobile", 501}}) {
        fs::create_directories(root / home);
        if (::chown((root / home).c_str(), owner, owner) != 0)
            throw std::runtime_error("chown " + std::string(home));
    }
    std::string why;
    if (CodeSigningRegistry().sign(fs::read_symlink("/proc/self/exe"), identifier, entitlements,
                                   &why) != 0)
        throw std::runtime_error("sign: " + why);
}

Value lookupRequest(uint64_t containerClass, const std::string& identifier, bool create) {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{0});
    request.set("ContainerClass", containerClass);
    request.set("UserID", uint64_t{501});
    request.set("Identifier", identifier);
    request.set("CreateIfNecessary", create);
    request.set("Transient", false);
    return request;
}

BenchClient::BenchClient(const fs::path& socketPath, std::chrono::seconds patience) {
    fd_.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
    const timeval wait{static_cast<time_t>(patience.count()), 0};
    if (::setsockopt(fd_.get(), SOL_SOCKET, SO_RCVTIMEO, &wait, sizeof wait) != 0 ||
        ::connect(fd_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        fd_.reset();
}

std::optional<Value> BenchClient::exchange(const Value& request) {
    frame_.clear();
    if (!relay::encodeFrame({relay::FrameKind::Request, nextId_++, request}, frame_) ||
        ::send(fd_.get(), frame_.data(), frame_.size(), MSG_NOSIGNAL) !=
            static_cast<ssize_t>(frame_.size()) ||
        !readFrame())
        return std::nullopt;
    Value reply;
    if (!relay::decodeValue(
            {reply_.data() + relay::kHeaderSize, reply_.size() - relay::kHeaderSize}, reply))
        return std::nullopt;
    return reply;
}

uint64_t BenchClient::call(const Value& request) {
    const std::optional<Value> reply = exchange(request);
    const Value* code = reply ? reply->find("ReplyError") : nullptr;
    return code ? code->uint64Value().value_or(0) : 0;
}

bool BenchClient::readExactly(uint8_t* into, size_t size) {
    for (size_t done = 0; done < size;) {
        const ssize_t got = ::read(fd_.get(), into + done, size - done);
        if (got <= 0) return false;
        done += static_cast<size_t>(got);
    }
    return true;
}

bool BenchClient::readFrame() {
    reply_.resize(relay::kHeaderSize);
    if (!readExactly(reply_.data(), relay::kHeaderSize)) return false;
    uint32_t length = 0;
    for (int i = 0; i < 4; ++i) length |= uint32_t(reply_[12 + i]) << (8 * i);
    reply_.resize(relay::kHeaderSize + length);
    return readExactly(reply_.data() + relay::kHeaderSize, length);
}

BenchDaemon::BenchDaemon(const fs::path& binary, const fs::path& root)
    : socket_(root / "run/berthd/sys.kelp.berthd") {
    const fs::path output = root / "berthd.output";
    pid_ = ::fork();
    if (pid_ == 0) {
        const int fd = ::open(output.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
        ::dup2(fd, STDOUT_FILENO);
        ::dup2(fd, STDERR_FILENO);
        ::execl(binary.c_str(), binary.c_str(), nullptr);
        _exit(127);
    }
    for (int i = 0; i < 1000; ++i) {
        if (BenchClient(socket_).connected()) return;
        if (::waitpid(pid_, nullptr, WNOHANG) == pid_)
            throw std::runtime_error("berthd ended; see " + output.string());
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    stop();
    throw std::runtime_error("berthd did not start serving; see " + output.string());
}

BenchDaemon::~BenchDaemon() {
    stop();
}

void BenchDaemon::stop() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
    pid_ = -1;
    std::error_code ignored;
    fs::remove(socket_, ignored);               // the next start must not find it early
    NamedSemaphore::remove("berthd.fb_check");  // the scratch root's marker
}

int runOnScratchRoot(const char* name,
                     const std::function<void(const std::filesystem::path&)>& body) {
    std::string scratch = std::string("/tmp/") + name + ".XXXXXX";
    if (!::mkdtemp(scratch.data())) {
        std::perror("mkdtemp");
        return 1;
    }
    const std::filesystem::path root = std::filesystem::path(scratch) / "root";
    ::setenv("BERTH_ROOT", root.c_str(), 1);
    int status = 0;
    try {
        body(root);
    } catch (const std::exception& e) {
        std::fprintf(stderr, "%s: %s (the device root stays at %s)\n", name, e.what(),
                     root.c_str());
        status = 1;
    }
    NamedSemaphore::remove("berthd.fb_check");  // the scratch root's first-boot marker
    std::error_code ignored;
    if (status == 0) std::filesystem::remove_all(scratch, ignored);
    return status;
}

}  // namespace berth::bench
