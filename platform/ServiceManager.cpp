#include "platform/ServiceManager.h"

#include <systemd/sd-daemon.h>

#include <cstdlib>
#include <map>
#include <mutex>

namespace berth {

namespace {

// The passed sockets not yet taken, by name. Collected once; taking one
// removes it, so each socket has exactly one owner.
class ActivatedSockets {
  public:
    ActivatedSockets() {
        char** names = nullptr;
        const int count = sd_listen_fds_with_names(/*unset_environment=*/1, &names);
        for (int i = 0; i < count; ++i) {
            const std::string name = names && names[i] ? names[i] : "unknown";
            byName_[name] = UniqueFd(SD_LISTEN_FDS_START + i);
        }
        if (names) {
            for (int i = 0; i < count; ++i) std::free(names[i]);
            std::free(names);
        }
    }

    UniqueFd take(const std::string& name) {
        std::lock_guard lock(mutex_);
        auto it = byName_.find(name);
        if (it == byName_.end()) return UniqueFd();
        UniqueFd fd = std::move(it->second);
        byName_.erase(it);
        return fd;
    }

  private:
    std::mutex mutex_;
    std::map<std::string, UniqueFd> byName_;
};

}  // namespace

void ServiceManager::notifyReady() {
    sd_notify(0, "READY=1");
}

void ServiceManager::notifyStatus(const std::string& text) {
    sd_notifyf(0, "STATUS=%s", text.c_str());
}

void ServiceManager::notifyStopping() {
    sd_notify(0, "STOPPING=1");
}

UniqueFd ServiceManager::takeActivatedSocket(const std::string& name) {
    static ActivatedSockets sockets;
    return sockets.take(name);
}

bool ServiceManager::loggingToJournal() {
    return std::getenv("JOURNAL_STREAM") != nullptr || std::getenv("INVOCATION_ID") != nullptr;
}

}  // namespace berth
