// Disk usage of a large data container through a real berthd (command 23),
// side by side with GNU du on the same tree in the same run.
//
// The container holds `files` regular files spread over `directories`
// directories two levels deep (sizes from a few bytes to 16 KiB), plus one
// hard link for every hundredth file. Each round measures both, in
// alternating order, with the page cache warm (one untimed round of each
// first); the table gives the median and fastest times and the ratio of the
// medians. Both must agree on the bytes: du's total less the directories'
// own blocks, which a container's usage leaves out.
//
//   usage_bench <path of berthd> [files, default 100000]
//               [directories, default 1000] [rounds, default 9]
//
// Run as root. The scratch device root is removed afterwards, except when a
// run fails.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <vector>

#include "BenchDaemon.h"
#include "BenchSummary.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

using Clock = std::chrono::steady_clock;

[[noreturn]] void die(const std::string& why) {
    throw std::runtime_error(why);
}

double millisecondsSince(Clock::time_point start) {
    return std::chrono::duration<double, std::milli>(Clock::now() - start).count();
}

struct Settings {
    std::filesystem::path berthd;
    uint64_t files = 100000;
    uint64_t directories = 1000;
    int rounds = 9;
};

// Fills `root` and returns the number of bytes du will count for the
// directories themselves.
uint64_t populate(const std::filesystem::path& root, const Settings& settings) {
    const uint64_t perGroup = 32;  // directories per first-level directory
    std::string data(16384, 'd');
    uint64_t directoryBlocks = 0;
    std::vector<std::filesystem::path> directories;
    for (uint64_t d = 0; d < settings.directories; ++d) {
        const auto dir = root / "Library" / ("group" + std::to_string(d / perGroup)) /
                         ("dir" + std::to_string(d));
        std::filesystem::create_directories(dir);
        directories.push_back(dir);
    }
    for (uint64_t f = 0; f < settings.files; ++f) {
        const auto& dir = directories[f % directories.size()];
        const auto path = dir / ("file" + std::to_string(f));
        UniqueFd fd(::open(path.c_str(), O_CREAT | O_WRONLY | O_TRUNC | O_CLOEXEC, 0644));
        if (!fd) die("cannot write " + path.string());
        const size_t size = (f * 7919) % data.size() + 1;
        if (::write(fd.get(), data.data(), size) != static_cast<ssize_t>(size))
            die("short write of " + path.string());
        if (f % 100 == 0)
            std::filesystem::create_hard_link(path, dir / ("link" + std::to_string(f)));
    }
    for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
        struct stat st;
        if (entry.is_directory() && ::lstat(entry.path().c_str(), &st) == 0)
            directoryBlocks += static_cast<uint64_t>(st.st_blocks) * 512;
    }
    struct stat st;
    if (::lstat(root.c_str(), &st) == 0)
        directoryBlocks += static_cast<uint64_t>(st.st_blocks) * 512;
    return directoryBlocks;
}

// GNU du's total for `root`, and how long it took (fork and exec included,
// as a script pays them).
uint64_t runDu(const std::filesystem::path& root, double* milliseconds) {
    int pipeFds[2];
    if (::pipe2(pipeFds, O_CLOEXEC) != 0) die("pipe");
    const auto start = Clock::now();
    const pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(pipeFds[1], STDOUT_FILENO);
        ::execlp("du", "du", "-s", "--block-size=1", root.c_str(), nullptr);
        _exit(127);
    }
    ::close(pipeFds[1]);
    std::string output;
    char buffer[256];
    ssize_t n;
    while ((n = ::read(pipeFds[0], buffer, sizeof buffer)) > 0) output.append(buffer, n);
    ::close(pipeFds[0]);
    int status = 0;
    ::waitpid(pid, &status, 0);
    *milliseconds = millisecondsSince(start);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) die("du failed");
    return std::strtoull(output.c_str(), nullptr, 10);
}

uint64_t runDaemon(bench::BenchClient& client, const Value& request, double* milliseconds) {
    const auto start = Clock::now();
    const std::optional<Value> reply = client.exchange(request);
    *milliseconds = millisecondsSince(start);
    const Value* code = reply ? reply->find("ReplyError") : nullptr;
    const Value* usage = reply ? reply->find("ReplyDiskUsage") : nullptr;
    if (!code || code->uint64Value() != 1u || !usage) die("disk-usage request failed");
    return *usage->uint64Value();
}

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
}

void run(const Settings& settings, const std::filesystem::path& root) {
    Value entitlements = Value::dictionary();
    entitlements.set("sys.kelp.private.Berth.allowed", true);
    bench::prepareBenchRoot(root, "sys.kelp.bench.usage", entitlements);
    bench::BenchDaemon daemon(settings.berthd, root);
    bench::BenchClient client(daemon.socket());
    if (!client.connected()) die("cannot connect");

    Value create = Value::dictionary();
    create.set("Command", uint64_t{0});
    create.set("ContainerClass", uint64_t{2});
    create.set("UserID", uint64_t{1});
    create.set("Identifier", "sys.kelp.bench.usage.app");
    create.set("CreateIfNecessary", true);
    const std::optional<Value> made = client.exchange(create);
    const Value* path = made ? made->find("ReplyPath") : nullptr;
    if (!path || !path->string()) die("cannot create the container");
    const std::filesystem::path container = *path->string();

    const auto start = Clock::now();
    const uint64_t directoryBlocks = populate(container, settings);
    std::printf("wrote %llu files (and %llu hard links) in %llu directories in %.1f s\n",
                (unsigned long long)settings.files, (unsigned long long)(settings.files + 99) / 100,
                (unsigned long long)settings.directories, millisecondsSince(start) / 1000);

    Value usage = Value::dictionary();
    usage.set("Command", uint64_t{23});
    usage.set("ContainerClass", uint64_t{2});
    usage.set("UserID", uint64_t{1});
    usage.set("Identifier", "sys.kelp.bench.usage.app");
    usage.set("UUID", *made->find("ReplyUUID"));

    double ignored;
    const uint64_t duBytes = runDu(container, &ignored);  // warms the page cache
    const uint64_t daemonBytes = runDaemon(client, usage, &ignored);
    if (daemonBytes != duBytes - directoryBlocks)
        die("the daemon counted " + std::to_string(daemonBytes) + " bytes, du less directories " +
            std::to_string(duBytes - directoryBlocks));

    std::vector<double> daemonTimes, duTimes;
    for (int round = 0; round < settings.rounds; ++round) {
        double daemonMs = 0, duMs = 0;
        if (round % 2 == 0) {
            runDaemon(client, usage, &daemonMs);
            runDu(container, &duMs);
        } else {
            runDu(container, &duMs);
            runDaemon(client, usage, &daemonMs);
        }
        daemonTimes.push_back(daemonMs);
        duTimes.push_back(duMs);
    }
    std::printf("%-22s %12s %12s %16s\n", "", "median ms", "fastest ms", "bytes");
    std::printf("%-22s %12.1f %12.1f %16llu\n", "berthd command 23", median(daemonTimes),
                *std::min_element(daemonTimes.begin(), daemonTimes.end()),
                (unsigned long long)daemonBytes);
    std::printf("%-22s %12.1f %12.1f %16llu\n", "du -s --block-size=1", median(duTimes),
                *std::min_element(duTimes.begin(), duTimes.end()), (unsigned long long)duBytes);
    std::printf("ratio berthd/du (medians): %.2fx over %d alternating rounds\n",
                median(daemonTimes) / median(duTimes), settings.rounds);
    bench::printSummary("usage", "command 23, " + std::to_string(settings.files) + " files", "ms",
                        median(daemonTimes), "du -s", median(duTimes));
}

}  // namespace
}  // namespace berth

int main(int argc, char** argv) {
    using namespace berth;
    std::setvbuf(stdout, nullptr, _IOLBF, 0);
    if (argc < 2) {
        std::fprintf(stderr,
                     "usage: usage_bench <path of berthd> [files, default 100000] [directories, "
                     "default 1000] [rounds, default 9]\n");
        return 64;
    }
    Settings settings;
    settings.berthd = std::filesystem::absolute(argv[1]);
    if (argc > 2) settings.files = std::strtoull(argv[2], nullptr, 10);
    if (argc > 3) settings.directories = std::strtoull(argv[3], nullptr, 10);
    if (argc > 4) settings.rounds = std::atoi(argv[4]);
    if (settings.files == 0 || settings.directories == 0 || settings.rounds < 1) {
        std::fprintf(stderr, "usage_bench: files, directories and rounds must be positive\n");
        return 64;
    }
    return bench::runOnScratchRoot("usage-bench",
                                   [&](const std::filesystem::path& root) { run(settings, root); });
}
