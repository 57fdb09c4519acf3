#include "platform/UpcallTransport.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "core/UpcallWire.h"
#include "platform/ServiceCheckIn.h"

namespace berth {

namespace {

constexpr int kRequiredSeals = F_SEAL_WRITE | F_SEAL_SHRINK | F_SEAL_GROW;

bool writeAll(int fd, const uint8_t* data, size_t size) {
    while (size > 0) {
        const ssize_t n = ::write(fd, data, size);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

}  // namespace

std::optional<OutOfLineMemory> OutOfLineMemory::adopt(UniqueFd fd, size_t size, int* error) {
    const int seals = ::fcntl(fd.get(), F_GET_SEALS);
    if (seals < 0 || (seals & kRequiredSeals) != kRequiredSeals) {
        *error = EBADF;
        return std::nullopt;
    }
    struct stat st;
    if (::fstat(fd.get(), &st) != 0) {
        *error = errno;
        return std::nullopt;
    }
    if (st.st_size < 0 || static_cast<uint64_t>(st.st_size) < size) {
        *error = EMSGSIZE;
        return std::nullopt;
    }
    if (size == 0) return OutOfLineMemory(nullptr, 0);
    void* data = ::mmap(nullptr, size, PROT_READ, MAP_SHARED, fd.get(), 0);
    if (data == MAP_FAILED) {
        *error = errno;
        return std::nullopt;
    }
    return OutOfLineMemory(static_cast<uint8_t*>(data), size);
}

OutOfLineMemory::OutOfLineMemory(OutOfLineMemory&& other) noexcept
    : data_(std::exchange(other.data_, nullptr)), size_(std::exchange(other.size_, 0)) {}

OutOfLineMemory& OutOfLineMemory::operator=(OutOfLineMemory&& other) noexcept {
    if (this != &other) {
        release();
        data_ = std::exchange(other.data_, nullptr);
        size_ = std::exchange(other.size_, 0);
    }
    return *this;
}

OutOfLineMemory::~OutOfLineMemory() {
    release();
}

void OutOfLineMemory::release() {
    if (data_) ::munmap(data_, size_);
    data_ = nullptr;
    size_ = 0;
}

UniqueFd BTHMakeSealedMemory(const void* data, size_t size, int* error) {
    UniqueFd fd(::memfd_create("berth-upcall", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    if (!fd || !writeAll(fd.get(), static_cast<const uint8_t*>(data), size) ||
        ::fcntl(fd.get(), F_ADD_SEALS, kRequiredSeals | F_SEAL_SEAL) != 0) {
        *error = errno ? errno : EIO;
        return UniqueFd();
    }
    return fd;
}

int BTHUpcallSend(int socket, const uint8_t* bytes, size_t size, int attachedFd) {
    struct iovec iov {
        const_cast<uint8_t*>(bytes), size
    };
    struct msghdr message {};
    message.msg_iov = &iov;
    message.msg_iovlen = 1;
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    if (attachedFd >= 0) {
        message.msg_control = control;
        message.msg_controllen = sizeof control;
        struct cmsghdr* c = CMSG_FIRSTHDR(&message);
        c->cmsg_level = SOL_SOCKET;
        c->cmsg_type = SCM_RIGHTS;
        c->cmsg_len = CMSG_LEN(sizeof(int));
        std::memcpy(CMSG_DATA(c), &attachedFd, sizeof attachedFd);
    }
    ssize_t n;
    do {
        n = ::sendmsg(socket, &message, MSG_NOSIGNAL);
    } while (n < 0 && errno == EINTR);
    if (n < 0) return errno;
    return static_cast<size_t>(n) == size ? 0 : EMSGSIZE;
}

ssize_t BTHUpcallReceive(int socket, uint8_t* buffer, size_t size, UniqueFd* attached, int flags) {
    alignas(struct cmsghdr) char control[CMSG_SPACE(sizeof(int) * 4)];
    struct iovec iov {
        buffer, size
    };
    struct msghdr message {};
    message.msg_iov = &iov;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    const ssize_t n = ::recvmsg(socket, &message, flags | MSG_CMSG_CLOEXEC);
    const int saved = errno;
    if (n >= 0) {
        for (struct cmsghdr* c = CMSG_FIRSTHDR(&message); c; c = CMSG_NXTHDR(&message, c)) {
            if (c->cmsg_level != SOL_SOCKET || c->cmsg_type != SCM_RIGHTS) continue;
            const size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
            for (size_t i = 0; i < count; ++i) {
                int passed;
                std::memcpy(&passed, CMSG_DATA(c) + i * sizeof(int), sizeof passed);
                if (attached && !*attached)
                    attached->reset(passed);
                else
                    ::close(passed);
            }
        }
    }
    errno = saved;
    return n;
}

std::optional<BTHUpcallClient> BTHUpcallClient::connect(int* error) {
    return connect(ServiceCheckIn::runtimeDirectory() / "sys.kelp.berthd.upcall", error);
}

std::optional<BTHUpcallClient> BTHUpcallClient::connect(const std::filesystem::path& socketPath,
                                                        int* error) {
    UniqueFd fd(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    struct sockaddr_un address {};
    address.sun_family = AF_UNIX;
    if (socketPath.native().size() >= sizeof address.sun_path) {
        *error = ENAMETOOLONG;
        return std::nullopt;
    }
    std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
    if (!fd ||
        ::connect(fd.get(), reinterpret_cast<struct sockaddr*>(&address), sizeof address) != 0) {
        *error = errno;
        return std::nullopt;
    }
    return BTHUpcallClient(std::move(fd));
}

std::optional<BTHUpcallAnswer> BTHUpcallClient::call(const std::vector<uint8_t>& requestData,
                                                     int* error, uint32_t messageId) {
    UniqueFd memory = BTHMakeSealedMemory(requestData.data(), requestData.size(), error);
    if (!memory) return std::nullopt;
    const auto request = BTHUpcallMakeRequest(/*remotePort=*/1,
                                              static_cast<uint32_t>(requestData.size()), messageId);
    return callRaw(std::vector<uint8_t>(request.begin(), request.end()), memory.get(), error);
}

std::optional<BTHUpcallAnswer> BTHUpcallClient::callRaw(const std::vector<uint8_t>& message,
                                                        int attachedFd, int* error) {
    if (int sent = BTHUpcallSend(socket_.get(), message.data(), message.size(), attachedFd)) {
        *error = sent;
        return std::nullopt;
    }
    uint8_t buffer[128];
    UniqueFd attached;
    ssize_t n;
    do {
        n = BTHUpcallReceive(socket_.get(), buffer, sizeof buffer, &attached);
    } while (n < 0 && errno == EINTR);
    if (n <= 0) {
        *error = n == 0 ? ECONNRESET : errno;
        return std::nullopt;
    }
    BTHUpcallAnswer answer;
    answer.message.assign(buffer, buffer + n);
    if (static_cast<size_t>(n) == kBTHUpcallErrorReplySize) {
        answer.returnCode = static_cast<int32_t>(BTHUpcallField(buffer, upcall::kErrorReturnCode));
        return answer;
    }
    if (static_cast<size_t>(n) != kBTHUpcallSuccessReplySize || !attached) {
        *error = EPROTO;
        return std::nullopt;
    }
    const size_t size = BTHUpcallField(buffer, upcall::kBodySize);
    std::optional<OutOfLineMemory> data = OutOfLineMemory::adopt(std::move(attached), size, error);
    if (!data) return std::nullopt;
    answer.replyData.assign(data->data(), data->data() + data->size());
    return answer;
}

}  // namespace berth
