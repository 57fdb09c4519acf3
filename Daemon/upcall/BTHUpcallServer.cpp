#include "BTHUpcallServer.h"

#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "BTHLog.h"
#include "BTHUpcallDemux.h"
#include "platform/UpcallTransport.h"

namespace berth {

namespace {

// Room for a request and then some, so that an oversized message is seen as
// such rather than cut to size.
constexpr size_t kReceiveBufferSize = 256;

// The audit trailer the kernel interface appends: type 0, its size, and the
// sender's audit token. A sender running as root plays the kernel (process
// id 0); any other sender is named by its real process id.
void appendTrailer(BTHUpcallRequestMessage& request, const struct ucred& sender) {
    uint8_t* m = request.bytes.data();
    BTHUpcallSetField(m, upcall::kTrailerType, 0);
    BTHUpcallSetField(m, upcall::kTrailerSize, kBTHUpcallTrailerSize);
    BTHUpcallSetField(m, upcall::kAuditToken, sender.uid);
    BTHUpcallSetField(m, upcall::kAuditTokenEffectiveUser, sender.uid);
    BTHUpcallSetField(m, upcall::kAuditToken + 8, sender.gid);
    BTHUpcallSetField(m, upcall::kAuditToken + 12, sender.uid);
    BTHUpcallSetField(m, upcall::kAuditToken + 16, sender.gid);
    BTHUpcallSetField(m, upcall::kAuditTokenProcessId,
                      sender.uid == 0 ? 0u : static_cast<uint32_t>(sender.pid));
}

}  // namespace

std::vector<uint8_t> BTHUpcallErrorReply(const uint8_t* request, size_t size, int32_t code) {
    std::vector<uint8_t> reply(kBTHUpcallErrorReplySize, 0);
    if (size < 24) return reply;
    uint8_t* r = reply.data();
    BTHUpcallSetField(r, upcall::kBits,
                      BTHUpcallField(request, upcall::kBits) & kBTHUpcallReplyPortDispositionMask &
                          ~kBTHUpcallComplexBit);
    BTHUpcallSetField(r, upcall::kSize, kBTHUpcallErrorReplySize);
    BTHUpcallSetField(r, upcall::kRemotePort, BTHUpcallField(request, upcall::kRemotePort));
    BTHUpcallSetField(r, upcall::kId,
                      BTHUpcallField(request, upcall::kId) + kBTHUpcallReplyIdOffset);
    std::memcpy(r + upcall::kErrorDataRecord, kBTHUpcallNativeDataRecord.data(),
                kBTHUpcallNativeDataRecord.size());
    BTHUpcallSetField(r, upcall::kErrorReturnCode, static_cast<uint32_t>(code));
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
    UniqueFd attached;
    const ssize_t n = BTHUpcallReceive(fd, buffer, sizeof buffer, &attached, MSG_DONTWAIT);
    if (n < 0 && (errno == EAGAIN || errno == EINTR)) return;
    if (n <= 0) {
        close(fd);
        return;
    }
    if (static_cast<size_t>(n) < 24) {
        BTHLogError("Upcall message of %zd bytes is too short to answer", n);
        return;
    }
    struct ucred sender {};
    socklen_t length = sizeof sender;
    if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &sender, &length) != 0) {
        BTHLogError("Failed to read the upcall sender's credentials: %s", strerror(errno));
        close(fd);
        return;
    }

    // As the kernel does: the header's size is what arrived, then the trailer.
    BTHUpcallRequestMessage request;
    std::memcpy(request.bytes.data(), buffer, std::min<size_t>(n, kBTHUpcallRequestSize));
    BTHUpcallSetField(request.bytes.data(), upcall::kSize, static_cast<uint32_t>(n));
    appendTrailer(request, sender);
    if (attached) {
        int error = 0;
        request.data = OutOfLineMemory::adopt(
            std::move(attached), BTHUpcallField(request.bytes.data(), upcall::kDataSize), &error);
        if (!request.data) BTHLogError("Upcall request memory cannot be read: %s", strerror(error));
    }

    BTHUpcallReplyMessage reply;
    demux_server(request, reply);
    std::vector<uint8_t> unhandled;
    const uint8_t* bytes = reply.bytes.data();
    size_t size = reply.size;
    if (size == 0) {
        unhandled = BTHUpcallErrorReply(buffer, static_cast<size_t>(n), kBTHUpcallBadMessageId);
        bytes = unhandled.data();
        size = unhandled.size();
    }
    if (int error = BTHUpcallSend(fd, bytes, size, reply.data ? reply.data.get() : -1))
        BTHLogError("Failed to send the upcall reply: %s", strerror(error));
}

void BTHUpcallServer::close(int fd) {
    auto it = clients_.find(fd);
    if (it == clients_.end()) return;
    runLoop_.unwatch(it->second.second);
    clients_.erase(it);
}

}  // namespace berth
