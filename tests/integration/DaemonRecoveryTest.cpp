// Crash safety of replace and create through the real daemon: the daemon is
// killed where a replace or a creation has reached a given on-disk state, and
// the next start must put every container where the replace journal says and
// lose no data. Also the replace command's refusals, a replace that goes
// through, and one whose second move fails.
#include <signal.h>

#include "BTHMetadata.h"
#include "BTHPropertyListFile.h"
#include "DaemonSupport.h"
#include "core/ErrorCodes.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace test;

const fs::path& root() {
    return deviceRoot();
}

constexpr const char* kSelf = "sys.kelp.recovery.tester";
constexpr const char* kFaults = "BERTH_TEST_FAULTS";
constexpr uint64_t kDataClass = 2;
constexpr uint64_t kPluginDataClass = 4;
constexpr uint64_t kMobile = 501;
constexpr uint64_t kOther = 502;

// A container as the reply that made it names it, with the marker file the
// test put into it.
struct Container {
    std::string identifier;
    uint64_t containerClass = 0;
    uint64_t user = 0;
    bool transient = false;
    Value uuid;
    fs::path path;
    std::string marker;

    fs::path markerAt(const fs::path& directory) const { return directory / "Documents" / marker; }
};

// Command 7 about `container`, found by its UUID.
Value metadataOf(const Container& container) {
    Value m = request(7, container.containerClass, container.user, container.identifier);
    m.set("UUID", container.uuid);
    return m;
}

// Command 2: `replacement` takes the place of `old` (none: of nothing).
Value replace(const Container* old, const Container& replacement) {
    Value m = dict({{"Command", uint64_t{2}},
                    {"NewContainerUUID", replacement.uuid},
                    {"NewContainerClass", replacement.containerClass},
                    {"NewContainerUserID", replacement.user},
                    {"NewIdentifier", replacement.identifier}});
    if (old) {
        m.set("OldContainerUUID", old->uuid);
        m.set("OldContainerClass", old->containerClass);
        m.set("OldContainerUserID", old->user);
        m.set("OldIdentifier", old->identifier);
    }
    return m;
}

// Every file named `name` anywhere under the device root: where a marker's
// data is, if anywhere.
std::vector<fs::path> filesNamed(const std::string& name) {
    std::vector<fs::path> found;
    std::error_code ec;
    for (auto it = fs::recursive_directory_iterator(
             root(), fs::directory_options::skip_permission_denied, ec);
         !ec && it != fs::recursive_directory_iterator(); it.increment(ec)) {
        if (it->path().filename() == name) found.push_back(it->path());
    }
    EXPECT_FALSE(ec) << ec.message();
    return found;
}

// Nothing of an unfinished replace or creation is left.
void expectNoReplaceInProgress() {
    EXPECT_EQ(listing(root() / kReplaceDirectory), std::vector<std::string>{});
    EXPECT_EQ(listing(root() / kStagingDirectory), std::vector<std::string>{});
}

// The first start of each test does the once-per-boot work; the restarts
// after a crash are restarts within the same boot, which keep transient
// containers.
class DaemonRecoveryTest : public DaemonFixture {
  protected:
    void SetUp() override {
        DaemonFixture::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        tag_ = Uuid::random().string();
        signSelf(kSelf, dict({{"sys.kelp.private.Berth.allowed", true}}));
    }

    // Sends `message` to a daemon armed to die on the way: no reply comes,
    // and the daemon ends by SIGKILL.
    void callIntoCrash(const Value& message) {
        BerthError error;
        const std::optional<Value> reply =
            connection_->request(message, std::chrono::seconds(20), &error);
        EXPECT_FALSE(reply) << reply->description();
        EXPECT_NE(error.code, BerthError::Code::Timeout) << error.message;
        EXPECT_EQ(daemon_->waitForExit(), 128 + SIGKILL);
        connection_.reset();
    }

    // `base` made unique to this run of the test: identifiers and marker
    // names never meet leftovers of an earlier run on the same root.
    std::string named(const std::string& base) const { return base + "." + tag_; }

    // Creates a container and puts a marker file into it, named by `marker`
    // made unique.
    void make(uint64_t containerClass, uint64_t user, const std::string& identifier, bool transient,
              const std::string& marker, Container* made) {
        const Value reply = call(create(containerClass, user, identifier, transient));
        ASSERT_EQ(code(reply), uint64_t{BTHErrorSuccess}) << reply.description();
        *made = Container{.identifier = identifier,
                          .containerClass = containerClass,
                          .user = user,
                          .transient = transient,
                          .uuid = *reply.find("ReplyUUID"),
                          .path = text(reply, "ReplyPath"),
                          .marker = named(marker)};
        ASSERT_FALSE(made->path.empty());
        writeFile(made->markerAt(made->path), made->marker);
    }

    // The permanent container of `identifier` (user 501, class 2), looked up
    // without creating anything, is `uuid` at `path`.
    void expectLookUp(const std::string& identifier, const Value& uuid, const fs::path& path) {
        const Value found = call(create(kDataClass, kMobile, identifier, false, false));
        ASSERT_EQ(code(found), uint64_t{BTHErrorSuccess}) << found.description();
        EXPECT_EQ(*found.find("ReplyUUID"), uuid);
        EXPECT_EQ(text(found, "ReplyPath"), path.string());
        EXPECT_EQ(*found.find("ReplyExisted"), Value(true));
        // The metadata file at that place names the same container.
        const auto onDisk = BTHMetadata::readAndValidateMetadataAtUrl(path, kMobile, true, nullptr);
        ASSERT_TRUE(onDisk) << path;
        EXPECT_EQ(Value(onDisk->uuid()), uuid);
        EXPECT_EQ(onDisk->identifier(), identifier);
    }

    // The daemon finds `container` by its UUID at `path`, with its marker
    // there.
    void expectFoundAt(const Container& container, const fs::path& path, bool transient) {
        const Value found = call(metadataOf(container));
        ASSERT_EQ(code(found), uint64_t{BTHErrorSuccess})
            << container.identifier << " " << found.description();
        EXPECT_EQ(text(found, "ReplyPath"), path.string());
        EXPECT_EQ(*found.find("ReplyTransient"), Value(transient));
        EXPECT_EQ(readFile(container.markerAt(path)), container.marker);
    }

    // Where a replace puts `replacement` (a data container of user 501).
    static fs::path destinationOf(const Container& replacement) {
        return root() / kDataClassDirectory / replacement.path.filename();
    }

    // The replace went through: `replacement` holds the place, `old` is gone.
    void expectReplaced(const Container& old, const Container& replacement) {
        expectLookUp(old.identifier, replacement.uuid, destinationOf(replacement));
        expectFoundAt(replacement, destinationOf(replacement), false);
        EXPECT_EQ(code(call(metadataOf(old))), uint64_t{BTHErrorNotFound});
        EXPECT_FALSE(fs::exists(old.path));
        EXPECT_FALSE(fs::exists(replacement.path));
    }

    // The replace was undone: both are where they were, the old marker in
    // exactly one place.
    void expectUndone(const Container& old, const Container& replacement) {
        EXPECT_EQ(filesNamed(old.marker), std::vector<fs::path>{old.markerAt(old.path)});
        expectLookUp(old.identifier, old.uuid, old.path);
        expectFoundAt(old, old.path, false);
        expectFoundAt(replacement, replacement.path, true);
    }

    std::string tag_;
};

// A crash point of replace and the on-disk state it leaves.
struct ReplaceCrash {
    const char* name;
    const char* point;
    bool oldAside;    // the old container went into staging
    bool newMovedIn;  // the new container reached its destination
};

const ReplaceCrash kReplaceCrashes[] = {
    {"JournalWritten", "replace.journal-written", false, false},
    {"OldStaged", "replace.old-staged", true, false},
    {"NewMoved", "replace.new-moved", true, true},
};

void PrintTo(const ReplaceCrash& crash, std::ostream* os) {
    *os << crash.point;
}

class DaemonReplaceCrashTest : public DaemonRecoveryTest,
                               public ::testing::WithParamInterface<ReplaceCrash> {};

TEST_P(DaemonReplaceCrashTest, RestartFinishesOrUndoesTheReplace) {
    const ReplaceCrash& crash = GetParam();
    const std::string identifier = named(std::string("sys.kelp.recovery.") + crash.name);
    ASSERT_NO_FATAL_FAILURE(start({{kFaults, crash.point}}));
    Container old, replacement;
    ASSERT_NO_FATAL_FAILURE(
        make(kDataClass, kMobile, identifier, false, std::string("old-") + crash.name, &old));
    ASSERT_NO_FATAL_FAILURE(make(kDataClass, kMobile, identifier, true,
                                 std::string("new-") + crash.name, &replacement));
    ASSERT_NE(replacement.path.parent_path(), old.path.parent_path());
    const fs::path destination = destinationOf(replacement);

    ASSERT_NO_FATAL_FAILURE(callIntoCrash(replace(&old, replacement)));

    // The crash left the journal and the state its point names.
    const std::vector<std::string> journals = listing(root() / kReplaceDirectory);
    ASSERT_EQ(journals.size(), 1u);
    const fs::path journalPath = root() / kReplaceDirectory / journals[0];
    const std::optional<Value> journal =
        BTH_dictionaryWithContentsOfURL(journalPath, BTHReadImmutable, nullptr);
    ASSERT_TRUE(journal);
    const fs::path staging = root() / kStagingDirectory / journalPath.stem();
    EXPECT_EQ(text(*journal, "BTHReplaceOperationOldURL"), old.path.string());
    EXPECT_EQ(text(*journal, "BTHReplaceOperationNewURL"), replacement.path.string());
    EXPECT_EQ(text(*journal, "BTHReplaceOperationStagingURL"), staging.string());
    EXPECT_EQ(text(*journal, "BTHReplaceOperationDestURL"), destination.string());
    EXPECT_EQ(fs::exists(old.markerAt(old.path)), !crash.oldAside);
    EXPECT_EQ(fs::exists(old.markerAt(staging)), crash.oldAside);
    EXPECT_EQ(fs::exists(replacement.markerAt(replacement.path)), !crash.newMovedIn);
    EXPECT_EQ(fs::exists(replacement.markerAt(destination)), crash.newMovedIn);

    ASSERT_NO_FATAL_FAILURE(start());
    expectNoReplaceInProgress();
    EXPECT_TRUE(deathRowEmpties());

    if (crash.newMovedIn) {
        // The replace had done its work: the new container holds the place,
        // and the old contents were destroyed with the staging leftovers.
        EXPECT_EQ(filesNamed(old.marker), std::vector<fs::path>{});
        EXPECT_EQ(filesNamed(replacement.marker),
                  std::vector<fs::path>{replacement.markerAt(destination)});
        expectReplaced(old, replacement);
        return;
    }
    // Undone: each marker in exactly one place, where it was.
    EXPECT_EQ(filesNamed(replacement.marker),
              std::vector<fs::path>{replacement.markerAt(replacement.path)});
    EXPECT_FALSE(fs::exists(destination));
    expectUndone(old, replacement);
    // The recovered store lets the same replace run to its end.
    const Value again = call(replace(&old, replacement));
    ASSERT_EQ(code(again), uint64_t{BTHErrorSuccess}) << again.description();
    expectReplaced(old, replacement);
    expectNoReplaceInProgress();
}

INSTANTIATE_TEST_SUITE_P(CrashPoints, DaemonReplaceCrashTest, ::testing::ValuesIn(kReplaceCrashes),
                         [](const ::testing::TestParamInfo<ReplaceCrash>& info) {
                             return std::string(info.param.name);
                         });

TEST_F(DaemonRecoveryTest, CrashDuringCreationLeavesNoContainer) {
    const std::string identifier = named("sys.kelp.recovery.staged");
    const fs::path dataDirectory = root() / kDataClassDirectory;
    ASSERT_NO_FATAL_FAILURE(start({{kFaults, "create.staged"}}));
    const std::vector<std::string> before = listing(dataDirectory);
    ASSERT_NO_FATAL_FAILURE(callIntoCrash(create(kDataClass, kMobile, identifier)));
    // Built in staging, never moved to its live place.
    const std::vector<std::string> staged = listing(root() / kStagingDirectory);
    ASSERT_EQ(staged.size(), 1u);
    EXPECT_TRUE(fs::exists(BTHMetadata::metadataFileURL(root() / kStagingDirectory / staged[0])));
    EXPECT_EQ(listing(dataDirectory), before);

    ASSERT_NO_FATAL_FAILURE(start());
    expectNoReplaceInProgress();
    EXPECT_TRUE(deathRowEmpties());
    EXPECT_EQ(listing(dataDirectory), before);
    EXPECT_EQ(code(call(create(kDataClass, kMobile, identifier, false, false))),
              uint64_t{BTHErrorNotFound});
    const Value made = call(create(kDataClass, kMobile, identifier));
    ASSERT_EQ(code(made), uint64_t{BTHErrorSuccess}) << made.description();
    EXPECT_EQ(*made.find("ReplyExisted"), Value(false));
    EXPECT_EQ(fs::path(text(made, "ReplyPath")).parent_path(), dataDirectory);
    expectLookUp(identifier, *made.find("ReplyUUID"), text(made, "ReplyPath"));
}

TEST_F(DaemonRecoveryTest, ReplaceRefusalsTouchNothingAndASuccessRetiresTheOld) {
    const std::string identifier = named("sys.kelp.replace.app");
    ASSERT_NO_FATAL_FAILURE(start());
    Container old, replacement, plugin, otherUser;
    ASSERT_NO_FATAL_FAILURE(make(kDataClass, kMobile, identifier, false, "replace-old", &old));
    ASSERT_NO_FATAL_FAILURE(
        make(kDataClass, kMobile, identifier, true, "replace-new", &replacement));
    ASSERT_NO_FATAL_FAILURE(
        make(kPluginDataClass, kMobile, identifier, true, "replace-plugin", &plugin));
    ASSERT_NO_FATAL_FAILURE(
        make(kDataClass, kOther, identifier, true, "replace-other", &otherUser));

    struct Refusal {
        const char* what;
        const Container* old;
        const Container* replacement;
        uint64_t code;
    };
    const Refusal refusals[] = {
        {"itself", &old, &old, BTHErrorReplaceSameContainer},
        {"another class", &old, &plugin, BTHErrorReplaceClassMismatch},
        {"another user", &old, &otherUser, BTHErrorReplaceUserMismatch},
        {"no old container, onto a permanent one", nullptr, &replacement, BTHErrorAlreadyExists},
    };
    for (const Refusal& refusal : refusals) {
        EXPECT_EQ(code(call(replace(refusal.old, *refusal.replacement))), refusal.code)
            << refusal.what;
    }
    for (const Container* container : {&old, &replacement, &plugin, &otherUser})
        expectFoundAt(*container, container->path, container->transient);
    expectLookUp(identifier, old.uuid, old.path);
    expectNoReplaceInProgress();

    const Value replaced = call(replace(&old, replacement));
    ASSERT_EQ(code(replaced), uint64_t{BTHErrorSuccess}) << replaced.description();
    expectReplaced(old, replacement);
    expectNoReplaceInProgress();
    // The old contents are on death row (or already destroyed) until it is
    // emptied, and nowhere afterwards.
    for (const fs::path& marker : filesNamed(old.marker))
        EXPECT_TRUE(marker.string().starts_with((root() / kDeathRowDirectory).string())) << marker;
    EXPECT_EQ(code(call(dict({{"Command", uint64_t{4}}}))), uint64_t{BTHErrorSuccess});
    EXPECT_EQ(filesNamed(old.marker), std::vector<fs::path>{});

    // Without an old container, a transient container becomes a permanent
    // one when its identifier has none.
    Container fresh;
    ASSERT_NO_FATAL_FAILURE(
        make(kDataClass, kMobile, named("sys.kelp.replace.fresh"), true, "replace-fresh", &fresh));
    const Value promoted = call(replace(nullptr, fresh));
    ASSERT_EQ(code(promoted), uint64_t{BTHErrorSuccess}) << promoted.description();
    expectLookUp(fresh.identifier, fresh.uuid, destinationOf(fresh));
    expectFoundAt(fresh, destinationOf(fresh), false);
}

// Clears the immutable flag it was given when it goes.
struct ImmutableFlag {
    fs::path path;
    ~ImmutableFlag() { setImmutable(path, false); }
};

TEST_F(DaemonRecoveryTest, AFailedSecondMovePutsTheOldContainerBack) {
    const std::string identifier = named("sys.kelp.replace.stuck");
    ASSERT_NO_FATAL_FAILURE(start());
    Container old, replacement;
    ASSERT_NO_FATAL_FAILURE(make(kDataClass, kMobile, identifier, false, "stuck-old", &old));
    ASSERT_NO_FATAL_FAILURE(make(kDataClass, kMobile, identifier, true, "stuck-new", &replacement));
    // An immutable directory cannot be renamed: the replace moves the old
    // container aside, then fails to move the new one in.
    if (!setImmutable(replacement.path, true))
        GTEST_SKIP() << "no immutable flag on this file system";
    {
        const ImmutableFlag flag{replacement.path};
        EXPECT_EQ(code(call(replace(&old, replacement))), uint64_t{BTHErrorReplaceFailed});
    }
    expectUndone(old, replacement);
    expectNoReplaceInProgress();
    // The container put back is whole in the daemon's eyes: the same replace
    // goes through once the new container can move.
    const Value again = call(replace(&old, replacement));
    ASSERT_EQ(code(again), uint64_t{BTHErrorSuccess}) << again.description();
    expectReplaced(old, replacement);
}

}  // namespace
}  // namespace berth
