// berth-identity-client: a small client the identity tests start as other
// users, sign, launch, preload and exec. It runs its arguments as a script:
//
//   connect PATH   connects to the request socket PATH
//   ask            sends a request that needs "sys.kelp.private.Berth.allowed"
//                  and prints "served" or "refused" (error 55)
//   who            asks for the caller's own data container and prints
//                  "identifier ID", or "identifier none CODE" when the daemon
//                  knows no identifier for the caller
//   fork           forks; the parent waits for the child and exits with its
//                  status, the child goes on with the script
//   exec PROGRAM [ARGS...]
//                  execs PROGRAM with the rest of the line as its script,
//                  the connection passed on in BERTH_IDENTITY_FD
//
// Without "connect" it uses the connection in BERTH_IDENTITY_FD, else the
// daemon's socket at /run/berthd/sys.kelp.berthd (where a launched program
// finds it). Exits 0, or 2 when the daemon could not be reached or answered
// nothing.
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "core/RelayCodec.h"

namespace {

using berth::Value;
namespace relay = berth::relay;

constexpr const char* kDefaultSocket = "/run/berthd/sys.kelp.berthd";

int connectTo(const char* path) {
    const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);  // inherited across exec on purpose
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path, sizeof address.sun_path - 1);
    if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        std::fprintf(stderr, "cannot connect to %s: %s\n", path, std::strerror(errno));
        std::exit(2);
    }
    return fd;
}

// Sends `body` as request `id` and gives the reply's body.
Value call(int fd, uint64_t id, const Value& body) {
    std::vector<uint8_t> bytes;
    relay::encodeFrame({relay::FrameKind::Request, id, body}, bytes);
    for (size_t done = 0; done < bytes.size();) {
        const ssize_t n = ::send(fd, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) std::exit(2);
        done += static_cast<size_t>(n);
    }
    relay::FrameDecoder decoder;
    uint8_t chunk[4096];
    for (;;) {
        relay::Frame frame;
        const relay::FrameDecoder::Status status = decoder.next(frame);
        if (status == relay::FrameDecoder::Status::Frame) return frame.body;
        if (status == relay::FrameDecoder::Status::Error) std::exit(2);
        const ssize_t got = ::read(fd, chunk, sizeof chunk);
        if (got < 0 && errno == EINTR) continue;
        if (got <= 0) std::exit(2);
        decoder.feed({chunk, static_cast<size_t>(got)});
    }
}

uint64_t replyError(const Value& reply) {
    const Value* code = reply.find("ReplyError");
    return code ? code->uint64Value().value_or(0) : 0;
}

Value dictionary(std::initializer_list<std::pair<const char*, Value>> members) {
    Value value = Value::dictionary();
    for (const auto& [key, member] : members) value.set(key, member);
    return value;
}

}  // namespace

int main(int argc, char** argv) {
    int fd = -1;
    if (const char* inherited = std::getenv("BERTH_IDENTITY_FD")) fd = std::atoi(inherited);
    auto connection = [&] { return fd >= 0 ? fd : (fd = connectTo(kDefaultSocket)); };
    uint64_t nextId = 1;
    for (int at = 1; at < argc; ++at) {
        const std::string word = argv[at];
        if (word == "connect" && at + 1 < argc) {
            fd = connectTo(argv[++at]);
        } else if (word == "ask") {
            const Value reply = call(
                connection(), nextId++,
                dictionary({{"Command", uint64_t{19}}, {"Identifier", "sys.kelp.identity.probe"}}));
            std::printf("%s\n", replyError(reply) == 55 ? "refused" : "served");
        } else if (word == "who") {
            const Value reply = call(connection(), nextId++,
                                     dictionary({{"Command", uint64_t{0}},
                                                 {"ContainerClass", uint64_t{2}},
                                                 {"UserID", uint64_t{1}},
                                                 {"CreateIfNecessary", true}}));
            const Value* identifier = reply.find("ReplyIdentifier");
            if (identifier && identifier->string())
                std::printf("identifier %s\n", identifier->string()->c_str());
            else
                std::printf("identifier none %llu\n",
                            static_cast<unsigned long long>(replyError(reply)));
        } else if (word == "fork") {
            std::fflush(stdout);
            const pid_t child = ::fork();
            if (child < 0) return 2;
            if (child > 0) {
                int status = 0;
                ::waitpid(child, &status, 0);
                return WIFEXITED(status) ? WEXITSTATUS(status) : 2;
            }
        } else if (word == "exec" && at + 1 < argc) {
            std::fflush(stdout);
            ::setenv("BERTH_IDENTITY_FD", std::to_string(connection()).c_str(), 1);
            ::execv(argv[at + 1], argv + at + 1);
            std::fprintf(stderr, "cannot exec %s: %s\n", argv[at + 1], std::strerror(errno));
            return 2;
        } else {
            std::fprintf(stderr, "berth-identity-client: unknown step %s\n", word.c_str());
            return 64;
        }
        std::fflush(stdout);
    }
    return 0;
}
