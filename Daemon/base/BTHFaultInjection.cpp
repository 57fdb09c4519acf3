#include "BTHFaultInjection.h"

#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <mutex>
#include <set>
#include <string>

namespace berth {

namespace {

struct ArmedPoints {
    std::atomic<bool> any{false};
    std::mutex mutex;
    std::set<std::string, std::less<>> names;
};

ArmedPoints& armed() {
    static ArmedPoints points;
    return points;
}

}  // namespace

void BTHFaultInjectionArm(std::string_view names) {
    ArmedPoints& points = armed();
    std::lock_guard lock(points.mutex);
    points.names.clear();
    while (!names.empty()) {
        const size_t comma = names.find(',');
        const std::string_view name = names.substr(0, comma);
        if (!name.empty()) points.names.emplace(name);
        names = comma == std::string_view::npos ? std::string_view() : names.substr(comma + 1);
    }
    points.any.store(!points.names.empty(), std::memory_order_release);
}

void BTHFaultInjectionLoadFromEnvironment() {
    const char* names = std::getenv(kBTHFaultEnvironmentVariable);
    BTHFaultInjectionArm(names ? names : "");
}

bool BTHFaultActive(std::string_view point) {
    ArmedPoints& points = armed();
    if (!points.any.load(std::memory_order_acquire)) return false;
    std::lock_guard lock(points.mutex);
    return points.names.find(point) != points.names.end();
}

void BTHCrashPoint(std::string_view point) {
    if (BTHFaultActive(point)) ::kill(::getpid(), SIGKILL);
}

}  // namespace berth
