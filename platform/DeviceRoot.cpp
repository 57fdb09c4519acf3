#include "platform/DeviceRoot.h"

#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>

namespace berth {

namespace {

std::filesystem::path normalizedRoot() {
    const char* env = std::getenv("BERTH_ROOT");
    std::filesystem::path root = env && *env ? env : "/";
    root = std::filesystem::absolute(root).lexically_normal();
    std::string text = root.string();
    while (text.size() > 1 && text.back() == '/') text.pop_back();
    return text;
}

}  // namespace

const std::filesystem::path& DeviceRoot::path() {
    static const std::filesystem::path root = normalizedRoot();
    return root;
}

namespace {

std::atomic<int> keptDescriptor{-1};

}  // namespace

bool DeviceRoot::keepOpen() {
    if (keptDescriptor.load(std::memory_order_acquire) >= 0) return true;
    const int fd = ::open(path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return false;
    int expected = -1;
    if (!keptDescriptor.compare_exchange_strong(expected, fd, std::memory_order_acq_rel))
        ::close(fd);  // another thread kept its own first
    return true;
}

int DeviceRoot::descriptor() {
    return keptDescriptor.load(std::memory_order_acquire);
}

std::filesystem::path DeviceRoot::resolve(std::string_view absolute) {
    std::string relative(absolute);
    while (!relative.empty() && relative.front() == '/') relative.erase(relative.begin());
    while (!relative.empty() && relative.back() == '/') relative.pop_back();
    if (relative.empty()) return path();
    return isHost() ? std::filesystem::path("/" + relative) : path() / relative;
}

}  // namespace berth
