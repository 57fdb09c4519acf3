// Group, system container and code-signing commands through the real daemon,
// with this program signed under the identities of apps, a system service
// and an installer: shared groups kept until their last member drops them,
// system groups only for the entitled, processing that changes nothing
// writing nothing, and forged code-signing information.
#include <sys/stat.h>

#include "BTHCodeSigningMapping.h"
#include "DaemonSupport.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

constexpr const char* kAllowed = "sys.kelp.private.Berth.allowed";
constexpr const char* kInstaller = "sys.kelp.groups.installer";
constexpr uint64_t kCaller = 1;  // "the caller's own user"
const fs::path kAppGroupDirectory = "private/var/mobile/Containers/Shared/AppGroup";

Value entitledTo(const char* key, const std::vector<std::string>& groups) {
    return dict({{key, BTHStringListValue(groups)}});
}

Value groupPaths(std::optional<std::string> identifier = std::nullopt) {
    return request(13, 0, kCaller, std::move(identifier));
}

class DaemonGroupsTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        fs::remove(mappingFile());
        ASSERT_NO_FATAL_FAILURE(start());
    }

    static fs::path mappingFile() {
        return deviceRoot() / "private/var/root/Library/Berth" / kBTHCodeSigningMappingFileName;
    }

    // The group paths of the caller's own identifier, as `identifier` with
    // `entitlements`.
    std::map<std::string, std::string> groupsAs(const std::string& identifier,
                                                const Value& entitlements) {
        signSelf(identifier, entitlements);
        const Value reply = call(groupPaths());
        EXPECT_EQ(code(reply), 1u) << reply.description();
        std::map<std::string, std::string> paths;
        if (const Value* dictionary = reply.find("ReplyGroupContainerDict"))
            for (const auto& [group, path] : *dictionary->dictionaryValue())
                paths[group] = path.string() ? *path.string() : "";
        return paths;
    }

    // Command 18 from the installer.
    uint64_t process(const std::string& identifier, const Value& info,
                     std::optional<Value> options = std::nullopt) {
        signSelf(kInstaller, dict({{kAllowed, true}}));
        Value m = dict(
            {{"Command", uint64_t{18}}, {"Identifier", identifier}, {"CodeSigningInfo", info}});
        if (options) m.set("OptionsDictionary", *options);
        return code(call(m));
    }
};

TEST_F(DaemonGroupsTest, ASharedGroupStaysUntilItsLastMemberDropsIt) {
    const auto one = groupsAs("sys.kelp.groups.one", entitledTo(kBTHApplicationGroupsEntitlement,
                                                                {"group.shared", "group.solo"}));
    const auto two = groupsAs("sys.kelp.groups.two",
                              entitledTo(kBTHApplicationGroupsEntitlement, {"group.shared"}));
    ASSERT_EQ(one.size(), 2u);
    ASSERT_EQ(two.size(), 1u);
    EXPECT_EQ(one.at("group.shared"), two.at("group.shared"));
    EXPECT_EQ(fs::path(one.at("group.shared")).parent_path(), deviceRoot() / kAppGroupDirectory);

    // One member drops the shared group: it stays; its own group goes.
    EXPECT_TRUE(groupsAs("sys.kelp.groups.one", Value::dictionary()).empty());
    EXPECT_TRUE(fs::is_directory(one.at("group.shared")));
    EXPECT_FALSE(fs::exists(one.at("group.solo")));
    // The last one drops it: staged for deletion, gone once death row empties.
    EXPECT_TRUE(groupsAs("sys.kelp.groups.two", Value::dictionary()).empty());
    EXPECT_FALSE(fs::exists(one.at("group.shared")));
    EXPECT_FALSE(listing(deviceRoot() / kDeathRowDirectory).empty());
    signSelf(kInstaller, dict({{kAllowed, true}}));
    EXPECT_EQ(code(call(dict({{"Command", uint64_t{4}}}))), 1u);
    EXPECT_TRUE(deathRowEmpties());
    EXPECT_TRUE(daemonLog().find("Last reference to group container group.shared for") !=
                std::string::npos);

    // Command 14 answers the identifiers only, whatever the user.
    signSelf(kInstaller, dict({{kAllowed, true}}));
    ASSERT_EQ(process("sys.kelp.groups.three",
                      dict({{kBTHEntitlementsKey,
                             entitledTo(kBTHApplicationGroupsEntitlement, {"b", "a"})}})),
              1u);
    const Value identifiers = call(request(14, 0, kCaller, "sys.kelp.groups.three"));
    ASSERT_EQ(code(identifiers), 1u);
    EXPECT_EQ(*identifiers.find("ReplyGroupIdentifiersArray"), BTHStringListValue({"b", "a"}));
    EXPECT_EQ(code(call(request(14, 0, 502, "sys.kelp.groups.three"))), 1u);
}

TEST_F(DaemonGroupsTest, SystemGroupsAreOnlyForTheEntitledAndTheWellKnown) {
    signSelf("sys.kelp.groups.daemon",
             entitledTo(kBTHSystemGroupsEntitlement, {"systemgroup.sys.kelp.groups.test"}));
    Value ask =
        dict({{"Command", uint64_t{17}}, {"GroupIdentifier", "systemgroup.sys.kelp.groups.test"}});
    const Value entitled = call(ask);
    ASSERT_EQ(code(entitled), 1u) << entitled.description();
    const fs::path path = text(entitled, "ReplyPath");
    EXPECT_NE(path.string().find("/Shared/SystemGroup/"), std::string::npos);
    EXPECT_EQ(lstatOf(path).st_uid, 0u);
    const Value all = call(dict({{"Command", uint64_t{16}}}));
    EXPECT_EQ(text(*all.find("ReplyGroupContainerDict"), "systemgroup.sys.kelp.groups.test"),
              path.string());

    const struct {
        const char* group;
        uint64_t expected;
        bool logged;
    } cases[] = {
        {"systemgroup.sys.kelp.groups.other", 55, true},
        {"systemgroup.sys.kelp.tallylog", 55, false},
        {"systemgroup.sys.kelp.tidewater", 1, false},  // well known
    };
    for (const auto& c : cases) {
        ask.set("GroupIdentifier", c.group);
        const Value reply = call(ask);
        EXPECT_EQ(code(reply), c.expected) << c.group;
        if (c.expected == 1) {
            EXPECT_EQ(fs::path(text(reply, "ReplyPath")).filename(), c.group);
        }
        EXPECT_EQ(daemonLog().find(std::string("is not entitled for system group identifier: ") +
                                   c.group) != std::string::npos,
                  c.logged)
            << c.group;
    }
}

TEST_F(DaemonGroupsTest, SystemContainersForTheWellKnownTheEntitledAndNoOneElse) {
    signSelf("sys.kelp.groups.plain", Value::dictionary());
    const Value wellKnown = call(request(15, 0, 0, "sys.kelp.lanternd"));
    ASSERT_EQ(code(wellKnown), 1u) << wellKnown.description();
    EXPECT_EQ(fs::path(text(wellKnown, "ReplyPath")).filename(), "sys.kelp.lanternd");
    EXPECT_EQ(code(call(request(15, 0, 0, "sys.kelp.groups.someone"))), 55u);
    EXPECT_EQ(code(call(request(15, 0, 0))), 55u);

    // Its own entitlement grants the caller its system container; withdrawn,
    // the container is staged for deletion at the caller's next request.
    signSelf("sys.kelp.groups.plain", dict({{kBTHSystemContainerEntitlement, true}}));
    const Value own = call(request(15, 0, 0));
    ASSERT_EQ(code(own), 1u) << own.description();
    const fs::path path = text(own, "ReplyPath");
    EXPECT_TRUE(fs::is_directory(path));
    signSelf("sys.kelp.groups.plain", Value::dictionary());
    EXPECT_EQ(code(call(request(15, 0, 0))), 55u);
    EXPECT_FALSE(fs::exists(path));
}

TEST_F(DaemonGroupsTest, ProcessingTheSameInformationTwiceWritesNothing) {
    const Value info = dict(
        {{kBTHEntitlementsKey, entitledTo(kBTHApplicationGroupsEntitlement, {"group.installed"})},
         {"TeamIdentifier", "T1"}});
    const Value options = dict({{"sys.kelp.Berth.DataContainerClass", uint64_t{2}}});
    ASSERT_EQ(process("sys.kelp.groups.installed", info, options), 1u);
    const std::string bytes = readFile(mappingFile());
    const struct stat before = lstatOf(mappingFile());
    ASSERT_EQ(process("sys.kelp.groups.installed", info, options), 1u);
    const struct stat after = lstatOf(mappingFile());
    EXPECT_EQ(readFile(mappingFile()), bytes);
    EXPECT_EQ(after.st_ino, before.st_ino);
    EXPECT_EQ(after.st_mtim.tv_sec, before.st_mtim.tv_sec);
    EXPECT_EQ(after.st_mtim.tv_nsec, before.st_mtim.tv_nsec);

    Value get = dict({{"Command", uint64_t{19}}, {"Identifier", "sys.kelp.groups.installed"}});
    const Value got = call(get);
    ASSERT_EQ(code(got), 1u);
    EXPECT_EQ(*got.find("ReplyInfoDictionary"), info);
    get.set("Identifier", "sys.kelp.groups.unknown");
    const Value unknown = call(get);
    EXPECT_EQ(code(unknown), 21u);
    EXPECT_FALSE(unknown.find("ReplyInfoDictionary"));

    // Without a bundle container the entry is invalidated and hidden.
    EXPECT_EQ(code(call(dict({{"Command", uint64_t{20}}}))), 1u);
    get.set("Identifier", "sys.kelp.groups.installed");
    EXPECT_EQ(code(call(get)), 21u);
}

TEST_F(DaemonGroupsTest, ForgedCodeSigningInformationIsRefusedOrIgnored) {
    EXPECT_EQ(process("sys.kelp.groups.forged", Value("a string, not a dictionary")), 11u);
    EXPECT_EQ(process("sys.kelp.groups.forged", dict({}), Value(int64_t{5})), 11u);
    Value missing = dict({{"Command", uint64_t{18}}, {"CodeSigningInfo", dict({})}});
    EXPECT_EQ(code(call(missing)), 18u);

    Value many = Value::array();
    for (int i = 0; i < 10000; ++i) many.push("group.many." + std::to_string(i));
    // As deep as a message may nest (64 levels with the request's own four).
    Value deep = Value::dictionary();
    for (int i = 0; i < 59; ++i) deep = dict({{"nested", deep}});
    const std::pair<const char*, Value> shapes[] = {
        {"strings", Value("entitlements as a string")},
        {"many", dict({{kBTHApplicationGroupsEntitlement, many}})},
        {"deep", dict({{kBTHApplicationGroupsEntitlement, deep}})},
        {"paths",
         entitledTo(kBTHApplicationGroupsEntitlement, {"../escape", "a/b", "..", "ok.group"})},
    };
    for (const auto& [name, entitlements] : shapes) {
        const std::string identifier = std::string("sys.kelp.groups.forged.") + name;
        ASSERT_EQ(process(identifier, dict({{kBTHEntitlementsKey, entitlements}})), 1u) << name;
        const Value reply = call(groupPaths(identifier));
        ASSERT_EQ(code(reply), 1u) << name;
        for (const auto& [group, path] :
             *reply.find("ReplyGroupContainerDict")->dictionaryValue()) {
            EXPECT_EQ(group, "ok.group") << name;
            EXPECT_EQ(fs::path(*path.string()).parent_path(), deviceRoot() / kAppGroupDirectory);
        }
    }
    EXPECT_FALSE(fs::exists(deviceRoot() / "private/var/mobile/Containers/Shared/escape"));
    EXPECT_NE(daemonLog().find("names the unusable group identifier ../escape"), std::string::npos);
}

}  // namespace
}  // namespace berth
