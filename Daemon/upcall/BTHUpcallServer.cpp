#include "BTHUpcallServer.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "BTHLog.h"

namespace berth {

namespace {

constexpr uint32_t kComplexBit = 0x80000000u;
constexpr uint32_t kReplyPortDispositionMask = 0x1f;
// Native data representation: integers little-endian, the rest zero.
constexpr uint8_t kNativeDataRecord[8] = {0, 0, 0, 0, 1, 0, 0, 0};
// Room for the request and a pack buffer descriptor that rides along.
constexpr size_t kReceiveBufferSize = 256;

uint32_t field(const uint8_t* message, size_t offset) {
    uint32_t value;
    std::memcpy(&value, message + offset, sizeof value);
    return value;
}

void putField(std::vector<uint8_t>& message, size_t offset, uint32_t value) {
    std::memcpy(message.data() + offset, &value, sizeof value);
}

// Receives one message; descriptors passed with it are closed at once (none
// is needed to give an error reply). -1 on end of stream or error.
ssize_t receive(int fd, uint8_t* buffer, size_t size) {
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * 4)];
    struct iovec iov {
        buffer, size
    };
    struct msghdr message {};
    message.msg_iov = &iov;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    ssize_t n = ::recvmsg(fd, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    for (struct cmsghdr* c = CMSG_FIRSTHDR(&message); c; c = CMSG_NXTHDR(&message, c)) {
        if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
        size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
        for (size_t i = 0; i < count; ++i) {
            int passed;
            std::memcpy(&passed, CMSG_DATA(c) + i * sizeof(int), sizeof passed);
            ::close(passed);
        }
    }
    return n;
}

}  // namespace

std::vector<uint8_t> BTHUpcallErrorReply(const uint8_t* request, size_t size, int32_t code) {
    std::vector<uint8_t> reply(kBTHUpcallErrorReplySize, 0);
    if (size < 24) return reply;
    putField(reply, 0, field(request, 0) & kReplyPortDispositionMask & ~kComplexBit);
    putField(reply, 4, kBTHUpcallErrorReplySize);
    putField(reply, 8, field(request, 8));
    putField(reply, 20, field(request, 20) + kBTHUpcallReplyIdOffset);
    std::memcpy(reply.data() + 24, kNativeDataRecord, sizeof kNativeDataRecord);
    putField(reply, 32, static_cast<uint32_t>(code));
    return reply;
}

std::unique_ptr<BTHUpcallServer> BTHUpcallServer::start(RunLoop& runLoop) {
    BTH_FUNCTION("BTHKernServerStart");
    int error = 0;
    std::string why;
    std::optional<ServiceCheckIn> checkIn =
        ServiceCheckIn::claim("sys.kelp.berthd.upcall", SOCK_SEQPACKET, 0600, &error, &why);
    if (!checkIn) {
        BTHLogError("bootstrap_check_in: %s", why.empty() ? strerror(error) : why.c_str());
        return nullptr;
    }
    auto server =
        std::make_unique<BTHUpcallServer>(BTHUpcallServer::Passkey{}, runLoop, std::move(*checkIn));
    BTHUpcallServer* raw = server.get();
    server->listenerWatch_ =
        runLoop.watchReadable(server->checkIn_.socket(), [raw] { raw->accept(); });
    if (!server->listenerWatch_) {
        BTHLogError("dispatch_source_create failed");
        return nullptr;
    }
    return server;
}

BTHUpcallServer::BTHUpcallServer(BTHUpcallServer::Passkey, RunLoop& runLoop, ServiceCheckIn checkIn)
    : runLoop_(runLoop), checkIn_(std::move(checkIn)) {}

BTHUpcallServer::~BTHUpcallServer() {
    if (listenerWatch_) runLoop_.unwatch(listenerWatch_);
    for (auto& [fd, client] : clients_) runLoop_.unwatch(client.second);
}

void BTHUpcallServer::accept() {
    BTH_FUNCTION("BTHKernServerStart");
    UniqueFd client(::accept4(checkIn_.socket(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (!client) return;
    const int fd = client.get();
    RunLoop::WatchId watch = runLoop_.watchReadable(fd, [this, fd] { serve(fd); });
    if (!watch) {
        BTHLogError("Failed to watch an upcall connection: %s", strerror(errno));
        return;
    }
    clients_.emplace(fd, std::make_pair(std::move(client), watch));
}

void BTHUpcallServer::serve(int fd) {
    BTH_FUNCTION("demux_server");
    uint8_t buffer[kReceiveBufferSize];
    ssize_t n = receive(fd, buffer, sizeof buffer);
    if (n < 0 && (errno == EAGAIN || errno == EINTR)) return;
    if (n <= 0) {
        close(fd);
        return;
    }
    if (static_cast<size_t>(n) < 24) {
        BTHLogError("Upcall message of %zd bytes is too short to answer", n);
        return;
    }
    const uint32_t id = field(buffer, 20);
    const int32_t code = id == kBTHUpcallRequestId ? kBTHUpcallCannotServe : kBTHUpcallBadMessageId;
    BTHLogDebug("berth server returns: %d", code);
    std::vector<uint8_t> reply = BTHUpcallErrorReply(buffer, static_cast<size_t>(n), code);
    if (::send(fd, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL) < 0)
        BTHLogError("Failed to send the upcall reply: %s", strerror(errno));
}

void BTHUpcallServer::close(int fd) {
    auto it = clients_.find(fd);
    if (it == clients_.end()) return;
    runLoop_.unwatch(it->second.second);
    clients_.erase(it);
}

}  // namespace berth
