#include "platform/LockStateNotification.h"

#include <fcntl.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>

#include "core/Uuid.h"
#include "platform/DeviceRoot.h"
#include "platform/SafeFs.h"

namespace berth {

namespace {

constexpr const char* kStateFileName = "lockstate";

std::filesystem::path runtimeDirectory() {
    return DeviceRoot::resolve("/run/berthd");
}

}  // namespace

std::filesystem::path LockStateNotification::stateFile() {
    return runtimeDirectory() / kStateFileName;
}

int LockStateNotification::lockState() {
    UniqueFd fd = fs::openNoFollow(stateFile(), O_RDONLY | O_NONBLOCK);
    if (!fd) return 0;
    char buffer[32];
    ssize_t n = ::read(fd.get(), buffer, sizeof buffer - 1);
    if (n <= 0) return 0;
    std::string_view text(buffer, static_cast<size_t>(n));
    while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.remove_suffix(1);
    int state = 0;
    auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), state);
    if (ec != std::errc() || end != text.data() + text.size()) return 0;
    return state;
}

bool LockStateNotification::setLockState(int state, std::string* why) {
    std::error_code ec;
    std::filesystem::create_directories(runtimeDirectory(), ec);
    UniqueFd dir = fs::openNoFollow(runtimeDirectory(), O_RDONLY | O_DIRECTORY);
    const std::string temp = std::string(".") + kStateFileName + "." + Uuid::random().string();
    UniqueFd file =
        dir ? fs::openAtNoFollow(dir.get(), temp.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644)
            : UniqueFd();
    const std::string text = std::to_string(state) + "\n";
    bool ok = file &&
              ::write(file.get(), text.data(), text.size()) == static_cast<ssize_t>(text.size()) &&
              ::fsync(file.get()) == 0 &&
              ::renameat(dir.get(), temp.c_str(), dir.get(), kStateFileName) == 0;
    if (!ok) {
        if (why) *why = strerror(errno);
        if (dir) ::unlinkat(dir.get(), temp.c_str(), 0);
    }
    return ok;
}

bool LockStateNotification::registerForChanges() {
    std::error_code ec;
    std::filesystem::create_directories(runtimeDirectory(), ec);
    fd_.reset(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!fd_) return false;
    if (::inotify_add_watch(fd_.get(), runtimeDirectory().c_str(),
                            IN_CLOSE_WRITE | IN_MOVED_TO | IN_DELETE | IN_CREATE | IN_DONT_FOLLOW |
                                IN_ONLYDIR) < 0) {
        fd_.reset();
        return false;
    }
    return true;
}

bool LockStateNotification::drain() {
    alignas(struct inotify_event) char buffer[4096];
    bool changed = false;
    while (true) {
        ssize_t n = ::read(fd_.get(), buffer, sizeof buffer);
        if (n <= 0) return changed;
        for (char* p = buffer; p < buffer + n;) {
            auto* event = reinterpret_cast<struct inotify_event*>(p);
            if (event->len && std::strcmp(event->name, kStateFileName) == 0) changed = true;
            p += sizeof(struct inotify_event) + event->len;
        }
    }
}

}  // namespace berth
