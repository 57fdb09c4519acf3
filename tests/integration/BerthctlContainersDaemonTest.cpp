// The container subcommands of berthctl against a real daemon on a scratch
// device root, run as a child process the way a script runs them: the
// requests they build must be the ones the daemon's handlers read, and what
// they print must be what the daemon did.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <optional>
#include <string>
#include <vector>

#include "DaemonProcess.h"
#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "core/ValueJson.h"
#include "platform/CodeSigningRegistry.h"
#include "platform/NamedSemaphore.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace fs = std::filesystem;

const fs::path& root() {
    static const fs::path& path = test::installScratchDeviceRoot();
    return path;
}
const bool kRootInstalled = !root().empty();

const fs::path kBerthctl = BERTHCTL_BINARY_PATH;
const fs::path kDeathRow = "private/var/root/Library/Caches/sys.kelp.berthd/Dead";

struct Outcome {
    int status = -1;
    std::string out;
    std::string err;
};

// Runs berthctl with `args` (BERTH_ROOT inherited) and collects its output.
Outcome berthctl(std::vector<std::string> args) {
    test::ScratchDir outputs;
    UniqueFd out(::open((outputs / "out").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    UniqueFd err(::open((outputs / "err").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    args.insert(args.begin(), kBerthctl.string());
    std::vector<char*> argv;
    for (std::string& arg : args) argv.push_back(arg.data());
    argv.push_back(nullptr);
    Outcome result;
    const pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(out.get(), STDOUT_FILENO);
        ::dup2(err.get(), STDERR_FILENO);
        ::execv(argv[0], argv.data());
        _exit(127);
    }
    int status = 0;
    if (pid < 0 || ::waitpid(pid, &status, 0) != pid) return result;
    result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    result.out = test::readFile(outputs / "out");
    result.err = test::readFile(outputs / "err");
    return result;
}

// The one line of JSON a --json run printed.
Value printed(const Outcome& outcome) {
    std::string why;
    std::optional<Value> value = valueFromJson(outcome.out, &why);
    EXPECT_TRUE(value) << why << "\n" << outcome.out << outcome.err;
    return value.value_or(Value());
}

std::string text(const Value& object, const char* key) {
    const Value* member = object.find(key);
    return member && member->isString() ? *member->string() : std::string();
}

class BerthctlContainersDaemonTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        ASSERT_TRUE(kRootInstalled);
        Value entitlements = Value::dictionary();
        entitlements.set("sys.kelp.private.Berth.allowed", true);
        entitlements.set("sys.kelp.private.Berth.otherIdLookup", true);
        std::string why;
        ASSERT_EQ(
            CodeSigningRegistry().sign(kBerthctl, "sys.kelp.berthctl.test", entitlements, &why), 0)
            << why;
        daemon_.emplace(root());
        ASSERT_TRUE(daemon_->waitUntilServing()) << daemon_->standardError();
    }

    // The scratch root's first-boot marker outlives the test otherwise.
    void TearDown() override { NamedSemaphore::remove("berthd.fb_check"); }

    std::optional<test::DaemonProcess> daemon_;
};

TEST_F(BerthctlContainersDaemonTest, ContainerRoundTrip) {
    const std::vector<std::string> notes = {"--class", "Data/Application", "--identifier",
                                            "com.example.notes"};
    auto with = [&notes](std::vector<std::string> args) {
        args.insert(args.end(), notes.begin(), notes.end());
        return berthctl(std::move(args));
    };

    const Outcome created = with({"--json", "create"});
    ASSERT_EQ(created.status, 0) << created.err;
    const Value made = printed(created);
    EXPECT_EQ(*made.find("existed"), Value(false));
    const std::string uuid = text(made, "uuid");
    const fs::path path = text(made, "path");
    ASSERT_TRUE(Uuid::parse(uuid)) << created.out;
    EXPECT_TRUE(fs::is_directory(path)) << path;

    const Value found = printed(with({"--json", "lookup"}));
    EXPECT_EQ(*found.find("existed"), Value(true));
    EXPECT_EQ(text(found, "uuid"), uuid);
    EXPECT_EQ(text(found, "path"), path.string());

    Value entry = Value::dictionary();
    entry.set("identifier", "com.example.notes");
    entry.set("uuid", uuid);
    const Value listed = printed(berthctl({"--json", "list", "--class", "2"}));
    ASSERT_TRUE(listed.isArray()) << listed.description();
    EXPECT_NE(std::find(listed.arrayValue()->begin(), listed.arrayValue()->end(), entry),
              listed.arrayValue()->end());

    // A typed value goes in and comes back with its kind, looked up by
    // identifier or addressed by UUID.
    ASSERT_EQ(with({"info", "set", "blob", R"({"data": "AAEC"})"}).status, 0);
    const Value blob = Value(Value::Data{0, 1, 2});
    EXPECT_EQ(printed(with({"--json", "info", "get", "blob"})), blob);
    EXPECT_EQ(printed(with({"--json", "info", "get", "blob", "--uuid", uuid})), blob);
    const Value metadata = printed(with({"--json", "metadata", "--info"}));
    EXPECT_EQ(text(metadata, "path"), path.string());
    EXPECT_EQ(*metadata.find("transient"), Value(false));
    ASSERT_TRUE(metadata.find("info"));
    EXPECT_EQ(*metadata.find("info")->find("blob"), blob);

    ASSERT_EQ(with({"info", "remove", "blob"}).status, 0);
    const Outcome gone = with({"info", "get", "blob"});
    EXPECT_EQ(gone.status, 1);
    EXPECT_TRUE(gone.out.empty());
    EXPECT_EQ(gone.err.rfind("error: BTHErrorInfoValueNotFound (24): ", 0), 0u) << gone.err;

    // Both numbers of the command make a removed standard directory again.
    std::vector<fs::path> standard;
    for (const fs::directory_entry& item : fs::directory_iterator(path))
        if (item.is_directory()) standard.push_back(item.path());
    ASSERT_FALSE(standard.empty());
    for (const char* command : {"8", "22"}) {
        fs::remove_all(standard.front());
        const Outcome recreated = with({"recreate-structure", "--command", command});
        EXPECT_EQ(recreated.status, 0) << recreated.err;
        EXPECT_TRUE(fs::is_directory(standard.front())) << command;
    }
}

TEST_F(BerthctlContainersDaemonTest, RefusalsPrintTheCodeAndFail) {
    const Outcome absent =
        berthctl({"lookup", "--class", "2", "--identifier", "com.example.absent"});
    EXPECT_EQ(absent.status, 1);
    EXPECT_TRUE(absent.out.empty());
    EXPECT_EQ(absent.err, "error: BTHErrorNotFound (21): no such container\n");

    // Another UUID than the identifier's container: not found, not another
    // container's value.
    ASSERT_EQ(berthctl({"create", "--class", "2", "--identifier", "com.example.mail"}).status, 0);
    const Outcome mismatch = berthctl({"metadata", "--class", "2", "--identifier",
                                       "com.example.mail", "--uuid", Uuid::random().string()});
    EXPECT_EQ(mismatch.status, 1);
    EXPECT_NE(mismatch.err.find("(21)"), std::string::npos) << mismatch.err;

    // Bundle containers belong to user 33 alone.
    const Outcome wrongUser =
        berthctl({"create", "--class", "Bundle/Application", "--user", "501", "--identifier", "x"});
    EXPECT_EQ(wrongUser.status, 1);
    EXPECT_NE(wrongUser.err.find("BTHErrorInvalidParameter (38)"), std::string::npos)
        << wrongUser.err;
}

TEST_F(BerthctlContainersDaemonTest, RemovalAndReplace) {
    const std::string notes = "com.example.notes";
    auto on = [](const std::string& identifier, std::vector<std::string> args) {
        args.insert(args.end(), {"--class", "2", "--identifier", identifier});
        return berthctl(std::move(args));
    };
    auto lookUp = [&on](const std::string& identifier) {
        return printed(on(identifier, {"--json", "lookup"}));
    };
    const Value made = printed(on(notes, {"--json", "create"}));
    const std::string uuid = text(made, "uuid");
    const fs::path path = text(made, "path");
    test::writeFile(path / "note", "kept");

    // A new directory name in the same parent; the same container and files.
    ASSERT_EQ(on(notes, {"regenerate"}).status, 0);
    const Value moved = lookUp(notes);
    const fs::path renamed = text(moved, "path");
    EXPECT_EQ(text(moved, "uuid"), uuid);
    EXPECT_NE(renamed, path);
    EXPECT_EQ(renamed.parent_path(), path.parent_path());
    EXPECT_FALSE(fs::exists(path));
    EXPECT_EQ(test::readFile(renamed / "note"), "kept");

    // Fresh contents under the same UUID and path.
    ASSERT_EQ(on(notes, {"wipe"}).status, 0);
    const Value wiped = lookUp(notes);
    EXPECT_EQ(text(wiped, "uuid"), uuid);
    EXPECT_EQ(text(wiped, "path"), renamed.string());
    EXPECT_TRUE(fs::is_directory(renamed));
    EXPECT_FALSE(fs::exists(renamed / "note"));

    const std::vector<std::string> replaceNotes = {
        "replace", "--class", "2", "--old-identifier", notes, "--new-identifier", notes};
    const Outcome itself = berthctl(replaceNotes);
    EXPECT_EQ(itself.status, 1);
    EXPECT_EQ(itself.err.rfind("error: BTHErrorReplaceSameContainer (22): ", 0), 0u) << itself.err;
    // A transient container of the same identifier, given by its UUID,
    // takes its place.
    const std::string fresh = text(printed(on(notes, {"--json", "create", "--transient"})), "uuid");
    std::vector<std::string> replaceWithFresh = replaceNotes;
    replaceWithFresh.insert(replaceWithFresh.end(), {"--new-uuid", fresh});
    const Outcome replaced = berthctl(replaceWithFresh);
    ASSERT_EQ(replaced.status, 0) << replaced.err;
    EXPECT_EQ(text(lookUp(notes), "uuid"), fresh);
    EXPECT_FALSE(fs::exists(renamed));

    // Deleted or staged, a container is gone at once; its directory waits on
    // death row until that is emptied.
    const fs::path mail = text(printed(on("com.example.mail", {"--json", "create"})), "path");
    ASSERT_EQ(on(notes, {"delete"}).status, 0);
    const Outcome staged = berthctl({"stage-delete", "--container", "2:1:com.example.mail"});
    ASSERT_EQ(staged.status, 0) << staged.err;
    for (const std::string& gone : {notes, std::string("com.example.mail")})
        EXPECT_EQ(on(gone, {"lookup"}).status, 1) << gone;
    EXPECT_FALSE(fs::exists(mail));
    const Outcome emptied = berthctl({"empty-death-row"});
    EXPECT_EQ(emptied.status, 0) << emptied.err;
    EXPECT_TRUE(fs::is_empty(root() / kDeathRow));
}

}  // namespace
}  // namespace berth

namespace berth {
namespace {

// The group and code-signing subcommands: what the installer records decides
// which groups an identifier gets.
TEST_F(BerthctlContainersDaemonTest, GroupsFollowRecordedCodeSigningInformation) {
    const Outcome recorded =
        berthctl({"codesign", "process", "com.example.grouped", "--entitlements", "--data-class",
                  "2", "--info", R"({"sys.kelp.security.application-groups": ["group.ctl"]})"});
    ASSERT_EQ(recorded.status, 0) << recorded.err;
    const Value info = printed(berthctl({"--json", "codesign", "get", "com.example.grouped"}));
    EXPECT_EQ(
        *info.find("sys.kelp.Berth.Entitlements")->find("sys.kelp.security.application-groups"),
        Value(Value::Array{"group.ctl"}));

    const Value paths =
        printed(berthctl({"--json", "groups", "--identifier", "com.example.grouped"}));
    const fs::path group = text(paths, "group.ctl");
    EXPECT_TRUE(fs::is_directory(group)) << paths.description();
    const Outcome identifiers =
        berthctl({"group-identifiers", "--identifier", "com.example.grouped"});
    EXPECT_EQ(identifiers.out, "group.ctl\n");

    const Outcome refused = berthctl({"system-group", "systemgroup.sys.kelp.ctl.other"});
    EXPECT_EQ(refused.status, 1);
    EXPECT_NE(refused.err.find("BTHErrorNotEntitled (55)"), std::string::npos) << refused.err;
    const Outcome wellKnown = berthctl({"system-container", "--identifier", "sys.kelp.quarryd"});
    EXPECT_EQ(fs::path(wellKnown.out.substr(0, wellKnown.out.size() - 1)).filename(),
              "sys.kelp.quarryd");

    // Removing the information removes its only reference to the group.
    EXPECT_EQ(berthctl({"codesign", "process", "com.example.grouped"}).status, 0);
    EXPECT_FALSE(fs::exists(group));
    const Outcome gone = berthctl({"codesign", "get", "com.example.grouped"});
    EXPECT_EQ(gone.status, 1);
    EXPECT_NE(gone.err.find("BTHErrorNotFound (21)"), std::string::npos) << gone.err;
    EXPECT_EQ(berthctl({"codesign", "invalidate"}).status, 0);
    EXPECT_EQ(berthctl({"codesign", "process", "x", "--info", "[1]"}).status, 64);
}

}  // namespace
}  // namespace berth
