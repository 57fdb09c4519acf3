#include "BTHWhitelist.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <future>
#include <vector>

namespace berth {
namespace {

std::vector<std::string> sorted(std::vector<std::string> names) {
    std::sort(names.begin(), names.end());
    return names;
}

TEST(BTHWhitelistTest, SharedTablesAnswerOnlyForTheirOwnClass) {
    const BTHWhitelist& whitelist = BTHWhitelist::sharedWhitelist();
    EXPECT_EQ(sorted(whitelist.wellknownSystemContainers()),
              (std::vector<std::string>{"sys.kelp.lanternd", "sys.kelp.quarryd"}));
    EXPECT_EQ(sorted(whitelist.wellknownSystemGroupContainers()),
              (std::vector<std::string>{
                  "systemgroup.sys.kelp.beacon.managed", "systemgroup.sys.kelp.kestrel.store",
                  "systemgroup.sys.kelp.marlin.tally", "systemgroup.sys.kelp.quarryresources",
                  "systemgroup.sys.kelp.tidewater"}));

    struct Case {
        std::string identifier;
        uint64_t containerClass;
        bool wellknown;
    };
    const std::vector<Case> cases = {
        {"sys.kelp.quarryd", 12, true},
        {"sys.kelp.quarryd", 13, false},
        {"sys.kelp.quarryd", 2, false},
        {"systemgroup.sys.kelp.tidewater", 13, true},
        {"systemgroup.sys.kelp.tidewater", 12, false},
        {"systemgroup.sys.kelp.tidewater", 7, false},
        {"sys.kelp.Quarryd", 12, false},  // identifiers match exactly
        {"sys.kelp.unknown", 12, false},
        {"sys.kelp.unknown", 13, false},
        {"", 12, false},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.identifier + " class " + std::to_string(c.containerClass));
        EXPECT_EQ(whitelist.containerIdIsWellknown(c.identifier, c.containerClass), c.wellknown);
        std::optional<std::string> name =
            whitelist.wellknownContainerForId(c.identifier, c.containerClass);
        EXPECT_EQ(name.has_value(), c.wellknown);
        if (name) {
            EXPECT_EQ(*name, c.identifier);
        }
    }
    // No class at all makes an unknown identifier well known.
    for (uint64_t containerClass = 0; containerClass <= 14; ++containerClass)
        EXPECT_FALSE(whitelist.wellknownContainerForId("sys.kelp.unknown", containerClass));

    // Concurrent first calls all see the one instance.
    std::vector<std::future<const BTHWhitelist*>> calls;
    for (int i = 0; i < 4; ++i)
        calls.push_back(
            std::async(std::launch::async, [] { return &BTHWhitelist::sharedWhitelist(); }));
    for (auto& call : calls) EXPECT_EQ(call.get(), &whitelist);
}

TEST(BTHWhitelistTest, AnswersAreTheMappedNamesOfWhateverTablesItHolds) {
    BTHWhitelist whitelist({{"sys.kelp.alpha", "Alpha"}}, {{"systemgroup.beta", "Beta"}});
    EXPECT_EQ(whitelist.wellknownSystemContainerForId("sys.kelp.alpha"), "Alpha");
    EXPECT_EQ(whitelist.wellknownContainerForId("sys.kelp.alpha", 12), "Alpha");
    EXPECT_EQ(whitelist.wellknownSystemGroupContainerForId("systemgroup.beta"), "Beta");
    EXPECT_EQ(whitelist.wellknownContainerForId("systemgroup.beta", 13), "Beta");
    EXPECT_FALSE(whitelist.systemGroupContainerIdIsWellknown("sys.kelp.alpha"));
    EXPECT_FALSE(whitelist.systemContainerIdIsWellknown("sys.kelp.lanternd"));

    whitelist.setSystemWhitelist({{"sys.kelp.gamma", "Gamma"}});
    whitelist.setSystemGroupWhitelist({});
    EXPECT_TRUE(whitelist.systemContainerIdIsWellknown("sys.kelp.gamma"));
    EXPECT_FALSE(whitelist.systemContainerIdIsWellknown("sys.kelp.alpha"));
    EXPECT_EQ(whitelist.wellknownSystemContainers(), std::vector<std::string>{"sys.kelp.gamma"});
    EXPECT_TRUE(whitelist.wellknownSystemGroupContainers().empty());
    EXPECT_FALSE(whitelist.containerIdIsWellknown("systemgroup.beta", 13));
}

}  // namespace
}  // namespace berth
