#include "platform/NamedSemaphore.h"

#include <fcntl.h>
#include <semaphore.h>

#include <cinttypes>
#include <cstdio>

#include "platform/DeviceRoot.h"

namespace berth {

namespace {

// FNV-1a: stable across runs and builds, which std::hash is not.
uint64_t stableHash(std::string_view text) {
    uint64_t h = 14695981039346656037ULL;
    for (unsigned char c : text) {
        h ^= c;
        h *= 1099511628211ULL;
    }
    return h;
}

}  // namespace

std::string NamedSemaphore::systemName(std::string_view name) {
    std::string full = "/" + std::string(name);
    if (!DeviceRoot::isHost()) {
        char suffix[32];
        snprintf(suffix, sizeof suffix, ".%016" PRIx64, stableHash(DeviceRoot::path().string()));
        full += suffix;
    }
    return full;
}

bool NamedSemaphore::exists(std::string_view name) {
    sem_t* sem = sem_open(systemName(name).c_str(), 0);
    if (sem == SEM_FAILED) return false;
    sem_close(sem);
    return true;
}

bool NamedSemaphore::create(std::string_view name, unsigned mode) {
    sem_t* sem = sem_open(systemName(name).c_str(), O_CREAT, static_cast<mode_t>(mode), 0u);
    if (sem == SEM_FAILED) return false;
    sem_close(sem);
    return true;
}

bool NamedSemaphore::remove(std::string_view name) {
    return sem_unlink(systemName(name).c_str()) == 0;
}

}  // namespace berth
