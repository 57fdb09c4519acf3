#include "DaemonSupport.h"

#include <fcntl.h>
#include <grp.h>
#include <sys/wait.h>

#include "platform/CodeSigningRegistry.h"
#include "platform/NamedSemaphore.h"
#include "platform/UniqueFd.h"

namespace berth::test {

namespace fs = std::filesystem;

constexpr const char* kFirstBootMarker = "berthd.fb_check";

const fs::path& deviceRoot() {
    static const fs::path& path = installScratchDeviceRoot();
    return path;
}

Value request(uint64_t command, uint64_t containerClass, uint64_t user,
              std::optional<std::string> identifier) {
    Value m = dict({{"Command", command}, {"ContainerClass", containerClass}, {"UserID", user}});
    if (identifier) m.set("Identifier", *identifier);
    return m;
}

Value create(uint64_t containerClass, uint64_t user, const std::string& identifier, bool transient,
             bool createIfNecessary) {
    Value m = request(0, containerClass, user, identifier);
    m.set("CreateIfNecessary", createIfNecessary);
    m.set("Transient", transient);
    return m;
}

Value about(uint64_t command, uint64_t containerClass, uint64_t user, const Value& created) {
    Value m = request(command, containerClass, user, text(created, "ReplyIdentifier"));
    m.set("UUID", *created.find("ReplyUUID"));
    return m;
}

uint64_t code(const Value& reply) {
    const Value* value = reply.find("ReplyError");
    return value ? value->uint64Value().value_or(0) : 0;
}

std::string text(const Value& reply, const char* key) {
    const Value* value = reply.find(key);
    return value && value->string() ? *value->string() : std::string();
}

std::vector<std::string> listing(const fs::path& directory) {
    std::vector<std::string> names;
    std::error_code ignored;
    for (const auto& entry : fs::directory_iterator(directory, ignored))
        names.push_back(entry.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
}

std::string daemonLog() {
    return readFile(deviceRoot() / "private/var/root/Library/Logs/Berth/berthd.log");
}

bool deathRowEmpties() {
    for (int i = 0; i < 250; ++i) {
        if (listing(deviceRoot() / kDeathRowDirectory).empty()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return false;
}

void signSelf(const std::string& identifier, const Value& entitlements) {
    std::string why;
    ASSERT_EQ(CodeSigningRegistry().sign(fs::read_symlink("/proc/self/exe"), identifier,
                                         entitlements, &why),
              0)
        << why;
}

void DaemonFixture::SetUp() {
    BERTH_REQUIRE_ROOT();
    ASSERT_FALSE(deviceRoot().empty());
    // Each test's first start does the once-per-boot work.
    NamedSemaphore::remove(kFirstBootMarker);
}

void DaemonFixture::TearDown() {
    connection_.reset();
    daemon_.reset();
    NamedSemaphore::remove(kFirstBootMarker);
}

void DaemonFixture::start(std::map<std::string, std::string> environment) {
    connection_.reset();
    daemon_.reset();
    daemon_.emplace(deviceRoot(), std::move(environment));
    ASSERT_TRUE(daemon_->waitUntilServing()) << daemon_->standardError();
    connection_ = BerthConnection::connect(daemon_->requestSocket());
    ASSERT_TRUE(connection_);
}

Value DaemonFixture::call(const Value& message) {
    BerthError error;
    std::optional<Value> reply = connection_->request(message, std::chrono::seconds(20), &error);
    EXPECT_TRUE(reply) << error.message;
    return reply ? *reply : Value::dictionary();
}

Outcome run(const fs::path& program, const std::vector<std::string>& args,
            std::optional<uid_t> user) {
    ScratchDir outputs;
    UniqueFd out(::open((outputs / "out").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    UniqueFd err(::open((outputs / "err").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    std::vector<std::string> strings{program.string()};
    strings.insert(strings.end(), args.begin(), args.end());
    std::vector<char*> argv;
    for (auto& s : strings) argv.push_back(s.data());
    argv.push_back(nullptr);
    Outcome result;
    const pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(out.get(), STDOUT_FILENO);
        ::dup2(err.get(), STDERR_FILENO);
        if (user && (::setgroups(0, nullptr) != 0 || ::setgid(*user) != 0 || ::setuid(*user) != 0))
            _exit(126);
        ::execv(argv[0], argv.data());
        _exit(127);
    }
    int status = 0;
    if (pid < 0 || ::waitpid(pid, &status, 0) != pid) return result;
    result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    result.out = readFile(outputs / "out");
    result.err = readFile(outputs / "err");
    return result;
}

}  // namespace berth::test
