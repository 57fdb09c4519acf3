#include "platform/ProcessAttachPolicy.h"

#include <fstream>

namespace berth {

std::optional<int> processAttachRestriction(const std::filesystem::path& procRoot) {
    std::ifstream file(procRoot / "sys/kernel/yama/ptrace_scope");
    int level = -1;
    if (!(file >> level) || level < 0) return std::nullopt;
    return level;
}

}  // namespace berth
