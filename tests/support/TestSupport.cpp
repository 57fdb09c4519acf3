#include "TestSupport.h"

#include <fcntl.h>
#include <grp.h>
#include <linux/fs.h>
#include <spdlog/sinks/base_sink.h>
#include <sys/ioctl.h>
#include <sys/un.h>
#include <sys/wait.h>

#include <bit>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

#include "BTHAsyncWork.h"
#include "BTHLog.h"
#include "BTHPropertyListFile.h"
#include "platform/DeviceRoot.h"
#include "platform/UniqueFd.h"

namespace berth::test {

namespace {

void clearImmutableTree(const std::filesystem::path& root) {
    std::error_code ec;
    setImmutable(root, false);
    if (!std::filesystem::is_directory(std::filesystem::symlink_status(root, ec))) return;
    for (auto it = std::filesystem::recursive_directory_iterator(
             root, std::filesystem::directory_options::skip_permission_denied, ec);
         !ec && it != std::filesystem::recursive_directory_iterator(); it.increment(ec))
        if (!it->is_symlink(ec)) setImmutable(it->path(), false);
}

class CaptureSink final : public spdlog::sinks::base_sink<std::mutex> {
  public:
    explicit CaptureSink(LogCapture* owner) : owner_(owner) {}

  protected:
    void sink_it_(const spdlog::details::log_msg& msg) override {
        owner_->record(std::string(msg.payload.data(), msg.payload.size()));
    }
    void flush_() override {}

  private:
    LogCapture* owner_;
};

int levelOf(const std::string& name) {
    if (name == "error") return 3;
    if (name == "warning") return 4;
    if (name == "notice") return 5;
    if (name == "debug") return 7;
    return 0;
}

}  // namespace

ScratchDir::ScratchDir(const std::filesystem::path& parent) {
    std::string templ = (parent / "berth-test.XXXXXX").string();
    if (!mkdtemp(templ.data())) throw std::runtime_error("mkdtemp failed in " + parent.string());
    path_ = templ;
}

ScratchDir::~ScratchDir() {
    clearImmutableTree(path_);
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
}

LogCapture::LogCapture(int threshold) {
    auto handle = std::make_shared<BTHLogHandle>("test", threshold);
    handle->addSink(std::make_shared<CaptureSink>(this));
    BTHLogSetHandle(handle);
}

LogCapture::~LogCapture() {
    BTHLogSetHandle(nullptr);
}

void LogCapture::record(const std::string& formatted) {
    // "<level> function: message"
    Line line{0, {}, formatted};
    size_t close = formatted.find("> ");
    if (!formatted.empty() && formatted[0] == '<' && close != std::string::npos) {
        line.level = levelOf(formatted.substr(1, close - 1));
        size_t colon = formatted.find(": ", close + 2);
        if (colon != std::string::npos) {
            line.function = formatted.substr(close + 2, colon - close - 2);
            line.message = formatted.substr(colon + 2);
        }
    }
    std::lock_guard lock(mutex_);
    lines_.push_back(std::move(line));
}

std::vector<LogCapture::Line> LogCapture::lines() const {
    std::lock_guard lock(mutex_);
    return lines_;
}

bool LogCapture::contains(int level, const std::string& text) const {
    return count(level, text) > 0;
}

size_t LogCapture::count(int level, const std::string& text) const {
    std::lock_guard lock(mutex_);
    size_t n = 0;
    for (const Line& line : lines_)
        if (line.level == level && line.message.find(text) != std::string::npos) ++n;
    return n;
}

void writeFile(const std::filesystem::path& path, const std::string& text) {
    std::ofstream out(path, std::ofstream::binary | std::ofstream::trunc);
    out << text;
    if (!out) throw std::runtime_error("cannot write " + path.string());
}

void waitForDeathRowQueue() {
    BTHDeathRowQueue()->sync([] {});
}

void writeDeviceProperties(const Value& properties) {
    const std::filesystem::path url = DeviceRoot::resolve("/etc/berthd/DeviceProperties.plist");
    std::filesystem::create_directories(url.parent_path());
    if (!BTH_writeToURL(properties, url, 0, nullptr))
        throw std::runtime_error("cannot write " + url.string());
}

std::string readFile(const std::filesystem::path& path) {
    std::ifstream in(path, std::ifstream::binary);
    std::ostringstream s;
    s << in.rdbuf();
    return s.str();
}

bool setImmutable(const std::filesystem::path& path, bool on) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
    if (!fd) return false;
    int flags = 0;
    if (::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) return false;
    flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
    return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) == 0;
}

UniqueFd connectUnix(const std::filesystem::path& path, int type) {
    UniqueFd fd(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    if (fd && ::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        fd.reset();
    return fd;
}

struct stat lstatOf(const std::filesystem::path& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st;
}

std::set<std::string> namesIn(const std::filesystem::path& directory) {
    std::set<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(directory))
        names.insert(entry.path().filename());
    return names;
}

UniqueFd makeDirectoryChain(const std::filesystem::path& top, int depth, int fileEvery,
                            const std::string& name) {
    UniqueFd level(::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    for (int i = 0; i < depth && level; ++i) {
        EXPECT_EQ(::mkdirat(level.get(), name.c_str(), 0755), 0) << std::strerror(errno);
        if (fileEvery > 0 && i % fileEvery == 0)
            UniqueFd(::openat(level.get(), "f", O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
        level = UniqueFd(::openat(level.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    }
    EXPECT_TRUE(level) << "the chain stopped: " << std::strerror(errno);
    return level;
}

int openDescriptorCount() {
    int count = 0;
    for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator("/proc/self/fd"))
        ++count;
    return count;
}

DescriptorLimit::DescriptorLimit(rlim_t limit) {
    ::getrlimit(RLIMIT_NOFILE, &saved_);
    struct rlimit lowered = saved_;
    lowered.rlim_cur = limit;
    EXPECT_EQ(::setrlimit(RLIMIT_NOFILE, &lowered), 0) << std::strerror(errno);
}

DescriptorLimit::~DescriptorLimit() {
    ::setrlimit(RLIMIT_NOFILE, &saved_);
}

void expectPOSIXError(const BTHErrorRef& error, int code, const std::string& description,
                      const std::string& function) {
    ASSERT_TRUE(error) << "no error, expected errno " << code;
    EXPECT_TRUE(error->isPOSIXError(code)) << error->description();
    if (!description.empty()) {
        EXPECT_EQ(error->localizedDescription(), description);
    }
    if (!function.empty()) {
        EXPECT_EQ(error->functionName(), function);
    }
}

::testing::AssertionResult identical(const Value& a, const Value& b, const std::string& at) {
    auto differ = [&](const std::string& what) {
        return ::testing::AssertionFailure() << at << ": " << what;
    };
    if (a.kind() != b.kind())
        return differ(std::string(kindName(a.kind())) + " vs " + kindName(b.kind()));
    auto bits = [](const Value& v) {
        return std::bit_cast<uint64_t>(
            v.kind() == Value::Kind::Double ? *v.doubleValue() : v.date()->secondsSince1970);
    };
    if (a.kind() == Value::Kind::Double || a.kind() == Value::Kind::Date)
        return bits(a) == bits(b) ? ::testing::AssertionSuccess() : differ("bits differ");
    if (auto* x = a.arrayValue()) {
        if (x->size() != b.size()) return differ("array sizes differ");
        for (size_t i = 0; i < x->size(); ++i)
            if (auto r = identical((*x)[i], (*b.arrayValue())[i], at + std::to_string(i) + "/"); !r)
                return r;
        return ::testing::AssertionSuccess();
    }
    if (auto* x = a.dictionaryValue()) {
        if (x->size() != b.size()) return differ("dictionary sizes differ");
        for (const auto& [key, element] : *x) {
            const Value* other = b.find(key);
            if (!other) return differ("missing " + key);
            if (auto r = identical(element, *other, at + key + "/"); !r) return r;
        }
        return ::testing::AssertionSuccess();
    }
    return a == b ? ::testing::AssertionSuccess()
                  : differ(a.description() + " vs " + b.description());
}

bool eventually(const std::function<bool()>& condition, std::chrono::milliseconds limit) {
    const auto end = std::chrono::steady_clock::now() + limit;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > end) return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

int inChild(const std::function<int()>& body, std::optional<uid_t> user) {
    const pid_t pid = ::fork();
    if (pid == 0) {
        if (user && (::setgroups(0, nullptr) != 0 || ::setresgid(*user, *user, *user) != 0 ||
                     ::setresuid(*user, *user, *user) != 0))
            ::_exit(100);
        ::_exit(body());
    }
    int status = 0;
    if (pid < 0 || ::waitpid(pid, &status, 0) != pid) return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

void Event::set() {
    std::lock_guard lock(mutex_);
    set_ = true;
    changed_.notify_all();
}

bool Event::isSet() const {
    std::lock_guard lock(mutex_);
    return set_;
}

bool Event::wait(std::chrono::milliseconds limit) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, limit, [this] { return set_; });
}

LinkSwapper::LinkSwapper(const std::filesystem::path& tree, const std::filesystem::path& outside)
    : thread_([this, victim = tree / "victim", aside = tree / "victim.real",
               innerAside = tree / "inner.real", target = outside.string()] {
          const std::filesystem::path inner = aside / "inner";
          const auto pause = std::chrono::microseconds(100);
          while (!stop_.load()) {
              if (::rename(victim.c_str(), aside.c_str()) == 0) {
                  ::symlink(target.c_str(), victim.c_str());
                  ::rename(inner.c_str(), innerAside.c_str());
                  ::symlink((target + "/inner").c_str(), inner.c_str());
                  std::this_thread::sleep_for(pause);
                  ::unlink(inner.c_str());
                  ::rename(innerAside.c_str(), inner.c_str());
                  ::unlink(victim.c_str());
                  ::rename(aside.c_str(), victim.c_str());
              }
              std::this_thread::sleep_for(pause);
          }
      }) {}

LinkSwapper::~LinkSwapper() {
    stop_ = true;
    thread_.join();
}

}  // namespace berth::test
