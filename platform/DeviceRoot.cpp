#include "platform/DeviceRoot.h"

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

std::filesystem::path DeviceRoot::resolve(std::string_view absolute) {
    std::string relative(absolute);
    while (!relative.empty() && relative.front() == '/') relative.erase(relative.begin());
    while (!relative.empty() && relative.back() == '/') relative.pop_back();
    if (relative.empty()) return path();
    return isHost() ? std::filesystem::path("/" + relative) : path() / relative;
}

}  // namespace berth
