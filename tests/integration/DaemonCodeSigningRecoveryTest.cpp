// Crash safety of code-signing processing: the daemon is killed before the
// group consequences, after them, and after the mapping was written; the next
// start must answer with exactly the old or exactly the new entries, parents
// and children linked both ways, and groups as those entries imply.
#include <signal.h>

#include "BTHCodeSigningMapping.h"
#include "BTHFaultInjection.h"
#include "BTHPropertyListFile.h"
#include "DaemonSupport.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

constexpr const char* kInstaller = "sys.kelp.csrecovery.installer";
constexpr const char* kParent = "sys.kelp.csrecovery.app";
constexpr const char* kChild = "sys.kelp.csrecovery.app.one";
constexpr const char* kNewChild = "sys.kelp.csrecovery.app.two";
using Strings = std::vector<std::string>;

Value withGroups(const Strings& groups) {
    return dict({{kBTHEntitlementsKey,
                  dict({{kBTHApplicationGroupsEntitlement, BTHStringListValue(groups)}})}});
}

struct Crash {
    const char* point;
    bool written;  // the mapping holds the new state
};

void PrintTo(const Crash& crash, std::ostream* os) {
    *os << crash.point;
}

class DaemonCodeSigningRecoveryTest : public DaemonFixture,
                                      public ::testing::WithParamInterface<Crash> {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        fs::remove(mappingFile());
        signSelf(kInstaller, dict({{"sys.kelp.private.Berth.allowed", true}}));
        ASSERT_NO_FATAL_FAILURE(start());
        ASSERT_EQ(code(call(process(kParent, withGroups({"G1", "G2"})))), 1u);
        ASSERT_EQ(code(call(process(kChild, withGroups({"G1"}), kParent))), 1u);
        groupPaths(kParent);  // the containers exist before the crash
    }

    static fs::path mappingFile() {
        return deviceRoot() / "private/var/root/Library/Berth" / kBTHCodeSigningMappingFileName;
    }

    static Value process(const std::string& identifier, const Value& info,
                         std::optional<std::string> parent = std::nullopt) {
        Value m = dict(
            {{"Command", uint64_t{18}}, {"Identifier", identifier}, {"CodeSigningInfo", info}});
        if (parent) m.set("OptionsDictionary", dict({{kBTHParentBundleIDOption, *parent}}));
        return m;
    }

    // Sends `message` to a daemon armed at the test's point, which dies on
    // the way, then starts it again unarmed.
    void crashWhile(const Value& message) {
        ASSERT_NO_FATAL_FAILURE(start({{kBTHFaultEnvironmentVariable, GetParam().point}}));
        BerthError error;
        const std::optional<Value> reply =
            connection_->request(message, std::chrono::seconds(20), &error);
        EXPECT_FALSE(reply) << reply->description();
        EXPECT_EQ(daemon_->waitForExit(), 128 + SIGKILL);
        ASSERT_NO_FATAL_FAILURE(start());
    }

    // The groups the daemon answers for `identifier`, checked against its
    // containers: each one a directory, and no others.
    Strings groupPaths(const std::string& identifier) {
        const Value reply = call(request(13, 0, 1, identifier));
        EXPECT_EQ(code(reply), 1u) << reply.description();
        Strings groups;
        for (const auto& [group, path] :
             *reply.find("ReplyGroupContainerDict")->dictionaryValue()) {
            EXPECT_TRUE(fs::is_directory(*path.string())) << group;
            groups.push_back(group);
        }
        return groups;
    }

    Value stored() {
        BTHErrorRef error;
        std::optional<Value> file = BTH_dictionaryWithContentsOfURL(mappingFile(), 0, &error);
        EXPECT_TRUE(file) << error;
        return file.value_or(Value::dictionary());
    }
};

TEST_P(DaemonCodeSigningRecoveryTest, EntriesAndTheirGroupsAreOldOrNewAfterAKill) {
    ASSERT_NO_FATAL_FAILURE(crashWhile(process(kParent, withGroups({"G1", "G3"}))));
    const Strings expected = GetParam().written ? Strings{"G1", "G3"} : Strings{"G1", "G2"};
    const Value got = call(dict({{"Command", uint64_t{19}}, {"Identifier", kParent}}));
    ASSERT_EQ(code(got), 1u);
    EXPECT_EQ(*got.find("ReplyInfoDictionary"), withGroups(expected));
    EXPECT_EQ(groupPaths(kParent), expected);
    EXPECT_EQ(groupPaths(kChild), Strings{"G1"});
    EXPECT_EQ(*stored().find(kParent)->find("ChildBundleIds"), BTHStringListValue({kChild}));
}

TEST_P(DaemonCodeSigningRecoveryTest, AChildAndItsParentsLinkAppearTogether) {
    ASSERT_NO_FATAL_FAILURE(crashWhile(process(kNewChild, withGroups({"G2"}), kParent)));
    const Value file = stored();
    EXPECT_EQ(file.find(kNewChild) != nullptr, GetParam().written);
    EXPECT_EQ(*file.find(kParent)->find("ChildBundleIds"),
              GetParam().written ? BTHStringListValue({kChild, kNewChild})
                                 : BTHStringListValue({kChild}));
    EXPECT_EQ(groupPaths(kNewChild), GetParam().written ? Strings{"G2"} : Strings{});
    // Reported again, it is linked exactly once.
    ASSERT_EQ(code(call(process(kNewChild, withGroups({"G2"}), kParent))), 1u);
    EXPECT_EQ(*stored().find(kParent)->find("ChildBundleIds"),
              BTHStringListValue({kChild, kNewChild}));
}

INSTANTIATE_TEST_SUITE_P(CrashPoints, DaemonCodeSigningRecoveryTest,
                         ::testing::Values(Crash{"codesign.before-groups", false},
                                           Crash{"codesign.after-groups", false},
                                           Crash{"codesign.after-write", true}),
                         [](const auto& info) {
                             std::string name = info.param.point + std::string("codesign.").size();
                             std::erase(name, '-');
                             return name;
                         });

}  // namespace
}  // namespace berth
