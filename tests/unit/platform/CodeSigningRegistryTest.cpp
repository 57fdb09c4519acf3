// The code-signing service against real processes: signed copies of a system
// program are started in a scratch device root and identified by pid and
// pidfd, then the registry, the executable and the process are tampered with.
#include "platform/CodeSigningRegistry.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <fstream>

#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "platform/DeviceRoot.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using namespace test;

[[maybe_unused]] const auto& kRoot = installScratchDeviceRoot();

ExecutableId idOf(const fs::path& path) {
    struct stat status {};
    EXPECT_EQ(::stat(path.c_str(), &status), 0) << path;
    return {status.st_dev, status.st_ino};
}

// A child process running `argv[0]`, started only once exec has succeeded
// (so /proc shows the new program, not a copy of the test), with a pidfd.
// Killed and reaped when the object goes.
class Child {
  public:
    explicit Child(std::vector<std::string> argv, int stdinFd = -1) {
        int sync[2];
        if (::pipe2(sync, O_CLOEXEC) != 0) return;
        pid_ = ::fork();
        if (pid_ == 0) {
            if (stdinFd >= 0) ::dup2(stdinFd, STDIN_FILENO);
            std::vector<char*> args;
            for (auto& arg : argv) args.push_back(arg.data());
            args.push_back(nullptr);
            ::execv(args[0], args.data());
            const int error = errno;
            (void)!::write(sync[1], &error, sizeof error);
            ::_exit(127);
        }
        ::close(sync[1]);
        int error = 0;
        const bool execFailed = ::read(sync[0], &error, sizeof error) == sizeof error;
        ::close(sync[0]);
        EXPECT_FALSE(execFailed) << argv[0] << ": " << strerror(error);
        pidfd_.reset(static_cast<int>(::syscall(SYS_pidfd_open, pid_, 0)));
        EXPECT_TRUE(pidfd_.valid()) << strerror(errno);
    }
    ~Child() {
        if (pid_ > 0 && !reaped_) reap();
    }

    pid_t pid() const { return pid_; }
    int pidfd() const { return pidfd_.get(); }

    // Kills the process; it stays a zombie until reap().
    void killWithoutReaping() {
        ::kill(pid_, SIGKILL);
        siginfo_t info{};
        ::waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOWAIT);
    }
    void reap() {
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
        reaped_ = true;
    }

  private:
    pid_t pid_ = -1;
    UniqueFd pidfd_;
    bool reaped_ = false;
};

CodeSigningRegistry::Options withRacyWindow(std::chrono::nanoseconds window) {
    return {.directory = {}, .racyWindow = window};
}

Value sampleEntitlements() {
    return dict({{"sys.kelp.private.Berth.allowed", true},
                 {"sys.kelp.private.Berth.wipeContainer",
                  Value(Value::Array{Value("a.b.c"), Value("d.e.f")})}});
}

class CodeSigningRegistryTest : public ::testing::Test {
  protected:
    void SetUp() override {
        BERTH_REQUIRE_ROOT();
        fs::remove_all(DeviceRoot::resolve("/etc"));
        sleeper_ = copyOf("/bin/sleep", "sleeper");
    }

    fs::path copyOf(const fs::path& source, const std::string& name) {
        fs::path copy = bin_ / name;
        fs::copy_file(source, copy, fs::copy_options::overwrite_existing);
        fs::permissions(copy, fs::perms(0755));
        return copy;
    }

    void signSleeper(const std::string& identifier = "sys.kelp.test.sleeper") {
        std::string why;
        ASSERT_EQ(registry_.sign(sleeper_, identifier, sampleEntitlements(), &why), 0) << why;
    }

    fs::path entryFile(const fs::path& executable) const {
        return registry_.directory() / CodeSigningRegistry::entryFileName(executable);
    }

    Child startSleeper() { return Child({sleeper_.string(), "30"}); }

    ScratchDir bin_;
    fs::path sleeper_;
    // No racy window: a file copied a moment ago may be cached at once.
    CodeSigningRegistry registry_{withRacyWindow(0ns)};
};

TEST_F(CodeSigningRegistryTest, SignedExecutableIdentifiesItsProcesses) {
    fs::create_symlink(sleeper_, bin_ / "link");
    SignatureEntry written;
    std::string why;
    ASSERT_EQ(registry_.sign(bin_ / "link", "sys.kelp.test.sleeper", sampleEntitlements(), &why,
                             &written),
              0)
        << why;
    EXPECT_EQ(written.executablePath, fs::canonical(sleeper_));

    const struct stat status = lstatOf(entryFile(written.executablePath));
    EXPECT_TRUE(S_ISREG(status.st_mode));
    EXPECT_EQ(status.st_uid, 0u);
    EXPECT_EQ(status.st_mode & 07777, 0644u);

    CodeSigningRegistry::Listing listing = registry_.list();
    ASSERT_EQ(listing.entries.size(), 1u);
    EXPECT_EQ(listing.entries[0], written);
    EXPECT_TRUE(listing.ignored.empty());

    Child child = startSleeper();
    std::optional<PeerIdentity> identity = registry_.identify(child.pid(), child.pidfd(), &why);
    ASSERT_TRUE(identity) << why;
    EXPECT_EQ(identity->identifier, "sys.kelp.test.sleeper");
    EXPECT_EQ(identity->entitlements, sampleEntitlements());
    EXPECT_EQ(identity->executable, idOf(sleeper_));
    EXPECT_EQ(identity->executablePath, written.executablePath);
    EXPECT_EQ(registry_.executableOf(child.pid(), child.pidfd()), idOf(sleeper_));

    // Signing again replaces the entry; the running process now reads as the new identity.
    ASSERT_EQ(registry_.sign(sleeper_, "sys.kelp.test.renamed", Value::dictionary(), &why), 0);
    identity = registry_.identify(child.pid(), child.pidfd(), &why);
    ASSERT_TRUE(identity) << why;
    EXPECT_EQ(identity->identifier, "sys.kelp.test.renamed");
    EXPECT_EQ(identity->entitlements, Value::dictionary());
    EXPECT_EQ(registry_.list().entries.size(), 1u);
}

TEST_F(CodeSigningRegistryTest, NoIdentityWithoutAMatchingSignature) {
    std::string why;
    {
        Child unsigned_ = startSleeper();
        EXPECT_FALSE(registry_.identify(unsigned_.pid(), unsigned_.pidfd(), &why));
        EXPECT_NE(why.find("no signature"), std::string::npos) << why;
    }

    // The same contents at another path are not the signed executable.
    signSleeper();
    fs::path twin = copyOf(sleeper_, "twin");
    {
        Child child({twin.string(), "30"});
        EXPECT_FALSE(registry_.identify(child.pid(), child.pidfd(), &why));
    }

    // Changed after signing: the digest no longer matches.
    {
        std::ofstream(sleeper_, std::ofstream::app) << '\n';
        Child child = startSleeper();
        EXPECT_FALSE(registry_.identify(child.pid(), child.pidfd(), &why));
        EXPECT_NE(why.find("do not match"), std::string::npos) << why;
    }

    // Signing the changed file binds its new contents; removing the entry ends that.
    signSleeper();
    Child child = startSleeper();
    ASSERT_TRUE(registry_.identify(child.pid(), child.pidfd(), &why)) << why;
    EXPECT_EQ(registry_.remove(sleeper_, &why), 0) << why;
    EXPECT_FALSE(registry_.identify(child.pid(), child.pidfd(), &why));
    EXPECT_EQ(registry_.remove(sleeper_, &why), ENOENT);
    EXPECT_TRUE(registry_.list().entries.empty());
}

TEST_F(CodeSigningRegistryTest, UntrustedEntriesAreIgnored) {
    signSleeper();
    // Same contents as the sleeper, so only the entry's own path tells them apart.
    fs::path other = copyOf(sleeper_, "other");
    std::string why;
    ASSERT_EQ(registry_.sign(other, "sys.kelp.test.other", Value::dictionary(), &why), 0) << why;
    const fs::path entry = entryFile(sleeper_), directory = registry_.directory();
    const fs::path stash = bin_ / "stash", otherEntry = entryFile(other);
    using Step = std::function<void()>;
    auto chmodTo = [](fs::path p, mode_t m) -> Step { return [=] { ::chmod(p.c_str(), m); }; };
    auto chownTo = [](fs::path p, uid_t u) -> Step { return [=] { ::chown(p.c_str(), u, u); }; };
    const Step putBack = [&] { fs::rename(stash, entry); };
    struct Tamper {
        const char* what;
        Step apply, undo;
    };
    const Tamper tampers[] = {
        {"entry group-writable", chmodTo(entry, 0664), chmodTo(entry, 0644)},
        {"entry other-writable", chmodTo(entry, 0646), chmodTo(entry, 0644)},
        {"entry not root's", chownTo(entry, 65534), chownTo(entry, 0)},
        {"directory group-writable", chmodTo(directory, 0775), chmodTo(directory, 0755)},
        {"parent not root's", chownTo(directory.parent_path(), 65534),
         chownTo(directory.parent_path(), 0)},
        {"entry is a link to a good entry",
         [&] { fs::rename(entry, stash), fs::create_symlink(stash, entry); }, putBack},
        {"entry of another executable under this name",
         [&] { fs::rename(entry, stash), fs::copy_file(otherEntry, entry); }, putBack},
    };

    Child child = startSleeper();
    for (const Tamper& tamper : tampers) {
        SCOPED_TRACE(tamper.what);
        tamper.apply();
        EXPECT_FALSE(registry_.identify(child.pid(), child.pidfd(), &why));
        EXPECT_FALSE(why.empty());
        CodeSigningRegistry::Listing listing = registry_.list();
        for (const SignatureEntry& listed : listing.entries)
            EXPECT_NE(listed.executablePath, sleeper_);
        tamper.undo();
        EXPECT_TRUE(registry_.identify(child.pid(), child.pidfd(), &why)) << why;
    }

    // A file-level problem names the file it ignored.
    ::chmod(entry.c_str(), 0664);
    CodeSigningRegistry::Listing listing = registry_.list();
    ASSERT_EQ(listing.ignored.size(), 1u);
    EXPECT_EQ(listing.ignored[0].fileName, entry.filename().string());
    ASSERT_EQ(listing.entries.size(), 1u);
    EXPECT_EQ(listing.entries[0].identifier, "sys.kelp.test.other");
}

TEST_F(CodeSigningRegistryTest, SignIsRootOnlyAndRefusesBadInput) {
    EXPECT_EQ(inChild([&] {
                  if (::seteuid(65534) != 0) return 2;
                  CodeSigningRegistry registry;
                  return registry.sign(sleeper_, "x", Value::dictionary()) == EPERM &&
                                 registry.remove(sleeper_) == EPERM
                             ? 0
                             : 1;
              }),
              0);

    const Value withUuid = dict({{"key", Uuid::random()}});
    EXPECT_EQ(registry_.sign("relative/sleeper", "x", Value::dictionary()), EINVAL);
    EXPECT_EQ(registry_.sign(bin_.path(), "x", Value::dictionary()), EINVAL);
    EXPECT_EQ(registry_.sign(sleeper_, "", Value::dictionary()), EINVAL);
    EXPECT_EQ(registry_.sign(sleeper_, "x", Value::array()), EINVAL);
    EXPECT_EQ(registry_.sign(sleeper_, "x", withUuid), EINVAL);
    EXPECT_EQ(registry_.sign(bin_ / "absent", "x", Value::dictionary()), ENOENT);
    EXPECT_TRUE(registry_.list().entries.empty());

    // A registry directory someone else could write to is not used.
    fs::create_directories(registry_.directory());
    ::chown(registry_.directory().c_str(), 65534, 65534);
    std::string why;
    EXPECT_EQ(registry_.sign(sleeper_, "x", Value::dictionary(), &why), EPERM);
    EXPECT_NE(why.find("not root's alone"), std::string::npos) << why;
}

TEST_F(CodeSigningRegistryTest, UnitsAreSignedByNameBesideExecutables) {
    signSleeper();
    SignatureEntry written;
    std::string why;
    ASSERT_EQ(registry_.signUnit("lanternd.service", "sys.kelp.lanternd", sampleEntitlements(),
                                 &why, &written),
              0)
        << why;
    EXPECT_TRUE(written.isUnit());
    EXPECT_EQ(written.key(), "lanternd.service");
    EXPECT_EQ(lstatOf(registry_.directory() /
                      CodeSigningRegistry::entryFileName(std::string("lanternd.service")))
                      .st_mode &
                  07777,
              0644u);
    EXPECT_EQ(registry_.entryForUnit("lanternd.service", &why), written) << why;
    // A unit is no executable, and an executable no unit.
    EXPECT_FALSE(registry_.entryFor("lanternd.service"));
    EXPECT_FALSE(registry_.entryForUnit("other.service", &why));
    EXPECT_NE(why.find("no signature for other.service"), std::string::npos) << why;

    CodeSigningRegistry::Listing listing = registry_.list();
    ASSERT_EQ(listing.entries.size(), 2u);
    EXPECT_EQ(listing.entries[0].executablePath, fs::canonical(sleeper_));
    EXPECT_EQ(listing.entries[1], written);

    // The entry of one unit under another's name is not the other's.
    ASSERT_EQ(registry_.signUnit("other.service", "sys.kelp.other", Value::dictionary()), 0);
    const fs::path otherFile =
        registry_.directory() / CodeSigningRegistry::entryFileName(std::string("other.service"));
    fs::copy_file(
        registry_.directory() / CodeSigningRegistry::entryFileName(std::string("lanternd.service")),
        otherFile, fs::copy_options::overwrite_existing);
    EXPECT_FALSE(registry_.entryForUnit("other.service", &why));
    EXPECT_NE(why.find("names another unit (lanternd.service)"), std::string::npos) << why;

    for (const char* bad : {"", "lanternd", "a.slice", "a/b.service", "../x.service"})
        EXPECT_EQ(registry_.signUnit(bad, "x", Value::dictionary()), EINVAL) << bad;
    EXPECT_EQ(registry_.signUnit("a.service", "", Value::dictionary()), EINVAL);
    EXPECT_EQ(registry_.signUnit("a.service", "x", Value::array()), EINVAL);
    EXPECT_EQ(inChild([] {
                  if (::seteuid(65534) != 0) return 2;
                  CodeSigningRegistry registry;
                  return registry.signUnit("a.service", "x", Value::dictionary()) == EPERM &&
                                 registry.removeUnit("lanternd.service") == EPERM
                             ? 0
                             : 1;
              }),
              0);

    EXPECT_EQ(registry_.removeUnit("lanternd.service", &why), 0) << why;
    EXPECT_EQ(registry_.removeUnit("lanternd.service", &why), ENOENT);
    EXPECT_FALSE(registry_.entryForUnit("lanternd.service"));
}

TEST_F(CodeSigningRegistryTest, OnlyTheLiveProcessOfThePidfdIsIdentified) {
    signSleeper();
    std::string why;
    Child first = startSleeper();
    Child second = startSleeper();
    ASSERT_TRUE(registry_.identify(second.pid(), second.pidfd(), &why)) << why;

    // A pid that now names another process than the pidfd's (as after reuse).
    EXPECT_FALSE(registry_.identify(second.pid(), first.pidfd(), &why));
    EXPECT_FALSE(registry_.executableOf(second.pid(), first.pidfd()));
    UniqueFd notAPidfd(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    EXPECT_FALSE(registry_.identify(second.pid(), notAPidfd.get(), &why));
    EXPECT_NE(why.find("not a pidfd"), std::string::npos) << why;

    first.killWithoutReaping();
    EXPECT_FALSE(registry_.identify(first.pid(), first.pidfd(), &why));
    EXPECT_FALSE(registry_.executableOf(first.pid(), first.pidfd()));
    first.reap();
    EXPECT_FALSE(registry_.identify(first.pid(), first.pidfd(), &why));
    EXPECT_FALSE(registry_.executableOf(first.pid(), first.pidfd(), &why));
}

TEST_F(CodeSigningRegistryTest, ExecutableOfFollowsExec) {
    signSleeper();
    int gate[2];
    ASSERT_EQ(::pipe2(gate, O_CLOEXEC), 0);
    UniqueFd readEnd(gate[0]), writeEnd(gate[1]);
    const std::string script = "read line; exec " + sleeper_.string() + " 30";
    Child child({"/bin/sh", "-c", script}, readEnd.get());

    std::string why;
    EXPECT_EQ(registry_.executableOf(child.pid(), child.pidfd(), &why), idOf("/bin/sh")) << why;
    EXPECT_FALSE(registry_.identify(child.pid(), child.pidfd(), &why));

    ASSERT_EQ(::write(writeEnd.get(), "go\n", 3), 3);
    EXPECT_TRUE(eventually(
        [&] { return registry_.executableOf(child.pid(), child.pidfd()) != idOf("/bin/sh"); }));
    EXPECT_EQ(registry_.executableOf(child.pid(), child.pidfd()), idOf(sleeper_));
    std::optional<PeerIdentity> identity = registry_.identify(child.pid(), child.pidfd(), &why);
    ASSERT_TRUE(identity) << why;
    EXPECT_EQ(identity->executable, idOf(sleeper_));
}

TEST_F(CodeSigningRegistryTest, ExecutableIsHashedOncePerVersion) {
    signSleeper();
    Child child = startSleeper();
    std::string why;
    const uint64_t start = registry_.digestComputations();
    ASSERT_TRUE(registry_.identify(child.pid(), child.pidfd(), &why)) << why;
    ASSERT_TRUE(registry_.identify(child.pid(), child.pidfd(), &why)) << why;
    EXPECT_EQ(registry_.digestComputations(), start + 1);

    // New times make a new version, even with the same contents.
    struct timespec times[2] = {{1000, 0}, {1000, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, sleeper_.c_str(), times, 0), 0);
    ASSERT_TRUE(registry_.identify(child.pid(), child.pidfd(), &why)) << why;
    EXPECT_EQ(registry_.digestComputations(), start + 2);

    // A file changed within the racy window is hashed every time.
    CodeSigningRegistry wary(withRacyWindow(std::chrono::hours(1)));
    ASSERT_TRUE(wary.identify(child.pid(), child.pidfd(), &why)) << why;
    ASSERT_TRUE(wary.identify(child.pid(), child.pidfd(), &why)) << why;
    EXPECT_EQ(wary.digestComputations(), 2u);
}

// --- The digest cache on plain files (no root needed) ---

const char* kAbcSha256 = "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad";

struct OpenFile {
    fs::path path;
    UniqueFd fd;
};

OpenFile makeFile(const ScratchDir& dir, const std::string& name, const std::string& text) {
    OpenFile file{dir / name, {}};
    writeFile(file.path, text);
    file.fd.reset(::open(file.path.c_str(), O_RDONLY | O_CLOEXEC));
    return file;
}

TEST(DigestCacheTest, DigestFollowsContentsEvenWithMtimeRestored) {
    ScratchDir dir;
    OpenFile file = makeFile(dir, "f", "abc");
    DigestCache cache(8, 0ns);
    std::optional<Sha256Digest> first = cache.digestOf(file.fd.get());
    ASSERT_TRUE(first);
    EXPECT_EQ(hexString(*first), kAbcSha256);
    EXPECT_EQ(cache.digestOf(file.fd.get()), first);
    EXPECT_EQ(cache.computations(), 1u);

    // Same size, other contents, old mtime put back: only the ctime tells.
    struct stat before {};
    ASSERT_EQ(::fstat(file.fd.get(), &before), 0);
    struct stat after {};
    do {
        writeFile(file.path, "abd");
        struct timespec times[2] = {before.st_atim, before.st_mtim};
        ASSERT_EQ(::utimensat(AT_FDCWD, file.path.c_str(), times, 0), 0);
        ASSERT_EQ(::fstat(file.fd.get(), &after), 0);
    } while (after.st_ctim.tv_sec == before.st_ctim.tv_sec &&
             after.st_ctim.tv_nsec == before.st_ctim.tv_nsec);
    std::optional<Sha256Digest> second = cache.digestOf(file.fd.get());
    ASSERT_TRUE(second);
    EXPECT_NE(second, first);
    EXPECT_EQ(cache.computations(), 2u);
}

TEST(DigestCacheTest, HoldsAtMostItsCapacityForgettingTheLeastRecentlyUsed) {
    ScratchDir dir;
    OpenFile a = makeFile(dir, "a", "A"), b = makeFile(dir, "b", "B"), c = makeFile(dir, "c", "C");
    DigestCache cache(2, 0ns);
    cache.digestOf(a.fd.get());
    cache.digestOf(b.fd.get());
    cache.digestOf(a.fd.get());  // a is now more recent than b
    cache.digestOf(c.fd.get());  // forgets b
    EXPECT_EQ(cache.computations(), 3u);
    EXPECT_EQ(cache.size(), 2u);
    cache.digestOf(a.fd.get());
    cache.digestOf(c.fd.get());
    EXPECT_EQ(cache.computations(), 3u);
    cache.digestOf(b.fd.get());
    EXPECT_EQ(cache.computations(), 4u);

    DigestCache none(0, 0ns);
    none.digestOf(a.fd.get());
    none.digestOf(a.fd.get());
    EXPECT_EQ(none.computations(), 2u);
}

TEST(DigestCacheTest, ConcurrentLookupsAgree) {
    ScratchDir dir;
    std::vector<OpenFile> files;
    std::vector<Sha256Digest> expected;
    for (int i = 0; i < 4; ++i) {
        std::string text(1000 + i, static_cast<char>('a' + i));
        files.push_back(makeFile(dir, std::string(1, static_cast<char>('0' + i)), text));
        expected.push_back(sha256({reinterpret_cast<const uint8_t*>(text.data()), text.size()}));
    }
    DigestCache cache(2, 0ns);
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t)
        threads.emplace_back([&, t] {
            for (int round = 0; round < 200; ++round) {
                size_t i = static_cast<size_t>(t + round) % files.size();
                if (cache.digestOf(files[i].fd.get()) != expected[i]) ++wrong;
            }
        });
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(wrong.load(), 0);
    EXPECT_LE(cache.size(), 2u);
}

}  // namespace
}  // namespace berth
