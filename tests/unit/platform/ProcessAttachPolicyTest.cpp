// The kernel's attach restriction as the daemon reads it at start.
#include "platform/ProcessAttachPolicy.h"

#include "TestSupport.h"

namespace berth {
namespace {

TEST(ProcessAttachPolicyTest, OnlyALevelOfOneOrMoreRestrictsAndAnythingUnreadableDoesNot) {
    const struct {
        std::optional<std::string> file;
        std::optional<int> level;
        bool restricted;
    } cases[] = {
        {"0\n", 0, false},
        {"1\n", 1, true},
        {"3", 3, true},
        {"-1\n", std::nullopt, false},
        {"x\n", std::nullopt, false},
        {std::nullopt, std::nullopt, false},
    };
    for (const auto& c : cases) {
        test::ScratchDir proc;
        if (c.file) {
            std::filesystem::create_directories(proc / "sys/kernel/yama");
            test::writeFile(proc / "sys/kernel/yama/ptrace_scope", *c.file);
        }
        const std::optional<int> level = processAttachRestriction(proc.path());
        EXPECT_EQ(level, c.level) << c.file.value_or("(none)");
        EXPECT_EQ(processAttachRestricted(level), c.restricted) << c.file.value_or("(none)");
    }
}

}  // namespace
}  // namespace berth
