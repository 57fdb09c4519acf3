// Emptying death row against `rm -rf`, side by side in one run.
//
// Each repetition builds two identical trees on the same file system (the
// scratch device root): 10 x 10 x 10 nested directories, each leaf holding
// small files, 100,000 files by default. One tree is renamed onto the death
// row of a real berthd serving that root, and the daemon is asked to empty
// death row (command 4, over its request socket; the time is the request's
// round trip, and the reply comes only when the emptying is done). The other
// tree is removed by `rm -rf`. The order alternates between repetitions, and
// the page cache is flushed to disk (sync) before each timed removal.
//
//   deathrow_bench [files per tree, default 100000] [repetitions, default 4]
//                  [path of berthd, default: next to the bench directory]
//
// Printed per repetition: the wall-clock time of both removals and their
// ratio (daemon / rm), and the processor time (user + system) each spent:
// the daemon's from its /proc stat across the emptying (it does nothing
// else meanwhile), rm's from its rusage. On a busy machine the processor
// times are the steadier comparison. Then the medians.
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "BenchDaemon.h"
#include "BenchSummary.h"
#include "core/RelayCodec.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

[[noreturn]] void die(const std::string& what) {
    std::fprintf(stderr, "deathrow_bench: %s\n", what.c_str());
    std::exit(1);
}

double secondsSince(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

struct Cost {
    double wall = 0;
    double cpu = 0;  // user + system
};

// User plus system time of all threads of `pid` so far.
double processorSeconds(pid_t pid) {
    FILE* file = std::fopen(("/proc/" + std::to_string(pid) + "/stat").c_str(), "r");
    if (!file) die("no /proc stat of the daemon");
    char buffer[1024] = {};
    const size_t got = std::fread(buffer, 1, sizeof buffer - 1, file);
    std::fclose(file);
    // Fields after the command name, which ends at the last ')': state is
    // field 3, utime field 14, stime field 15.
    const char* rest = std::strrchr(buffer, ')');
    if (!rest || got == 0) die("unreadable /proc stat");
    unsigned long utime = 0, stime = 0;
    if (std::sscanf(rest + 2, "%*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %lu %lu", &utime,
                    &stime) != 2)
        die("unreadable /proc stat");
    return static_cast<double>(utime + stime) / static_cast<double>(::sysconf(_SC_CLK_TCK));
}

// 10 x 10 x 10 directories; the files are spread over the 1,000 leaves.
void buildTree(const fs::path& top, int files) {
    constexpr int kFanOut = 10;
    constexpr int kLeaves = kFanOut * kFanOut * kFanOut;
    static const std::string contents(64, 'x');
    for (int leaf = 0; leaf < kLeaves; ++leaf) {
        const fs::path dir = top / std::to_string(leaf / 100) / std::to_string(leaf / 10 % 10) /
                             std::to_string(leaf % 10);
        fs::create_directories(dir);
        UniqueFd dirFd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        if (!dirFd) die("open " + dir.string());
        for (int i = leaf; i < files; i += kLeaves) {
            const std::string name = "file" + std::to_string(i);
            UniqueFd fd(
                ::openat(dirFd.get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
            if (!fd || ::write(fd.get(), contents.data(), contents.size()) < 0)
                die("write " + (dir / name).string());
        }
    }
}

// A berthd serving `root`, this program signed into the root's registry as
// a client holding ".allowed", and one connection to it; killed when the
// object goes.
class Daemon {
  public:
    Daemon(const fs::path& binary, const fs::path& root)
        : prepared_(prepare(root)), daemon_(binary, root), client_(daemon_.socket(), kPatience) {
        if (!client_.connected()) die("cannot connect to berthd");
    }

    pid_t pid() const { return daemon_.pid(); }

    // Sends `request` and waits for its reply; returns "ReplyError".
    uint64_t call(const Value& request) {
        const uint64_t code = client_.call(request);
        if (code == 0) die("no reply from berthd");
        return code;
    }

  private:
    // Emptying a large death row takes minutes on a slow disk.
    static constexpr std::chrono::seconds kPatience{900};

    static bool prepare(const fs::path& root) {
        Value entitlements = Value::dictionary();
        entitlements.set("sys.kelp.private.Berth.allowed", true);
        bench::prepareBenchRoot(root, "sys.kelp.bench.deathrow", entitlements);
        return true;
    }

    bool prepared_;  // the root is ready before the daemon starts on it
    bench::BenchDaemon daemon_;
    bench::BenchClient client_;
};

Value emptyDeathRowRequest() {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{4});
    return request;
}

Cost timeDaemon(Daemon& daemon, const fs::path& tree, const fs::path& deathRow) {
    fs::rename(tree, deathRow / tree.filename());
    ::sync();
    const double cpuBefore = processorSeconds(daemon.pid());
    const auto start = Clock::now();
    const uint64_t code = daemon.call(emptyDeathRowRequest());
    const Cost cost{secondsSince(start), processorSeconds(daemon.pid()) - cpuBefore};
    if (code != 1) die("emptying death row answered " + std::to_string(code));
    if (!fs::is_empty(deathRow)) die("death row not empty after the emptying");
    return cost;
}

Cost timeRm(const fs::path& tree) {
    ::sync();
    const auto start = Clock::now();
    const pid_t pid = ::fork();
    if (pid == 0) {
        ::execlp("rm", "rm", "-rf", "--", tree.c_str(), nullptr);
        _exit(127);
    }
    int status = 0;
    rusage usage{};
    ::wait4(pid, &status, 0, &usage);
    const double wall = secondsSince(start);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0 || fs::exists(tree)) die("rm -rf failed");
    auto seconds = [](const timeval& t) { return static_cast<double>(t.tv_sec) + t.tv_usec / 1e6; };
    return {wall, seconds(usage.ru_utime) + seconds(usage.ru_stime)};
}

void printRow(const std::string& label, const char* first, const Cost& daemon, const Cost& rm) {
    std::printf("%4s %-10s | %13.3f %13.3f %6.2f | %13.3f %13.3f %6.2f\n", label.c_str(), first,
                daemon.wall, rm.wall, daemon.wall / rm.wall, daemon.cpu, rm.cpu,
                rm.cpu > 0 ? daemon.cpu / rm.cpu : 0.0);
    std::fflush(stdout);
}

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    const size_t n = values.size();
    return n % 2 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

}  // namespace
}  // namespace berth

int main(int argc, char** argv) {
    using namespace berth;
    const int files = argc > 1 ? std::atoi(argv[1]) : 100000;
    const int repetitions = argc > 2 ? std::atoi(argv[2]) : 4;
    const fs::path binary =
        argc > 3 ? fs::path(argv[3])
                 : fs::read_symlink("/proc/self/exe").parent_path().parent_path() / "berthd";
    if (files <= 0 || repetitions <= 0) die("usage: deathrow_bench [files] [repetitions] [berthd]");

    char templ[] = "/tmp/deathrow-bench.XXXXXX";
    if (!::mkdtemp(templ)) die("mkdtemp");
    const fs::path dir = templ;
    const fs::path root = dir / "root";
    // The daemon's device root; this program reads it too (the registry).
    ::setenv("BERTH_ROOT", root.c_str(), 1);
    std::vector<Cost> daemonCosts, rmCosts;
    {
        Daemon daemon(binary, root);
        // Waits out the emptying the daemon starts with.
        daemon.call(emptyDeathRowRequest());
        const fs::path deathRow = root / "private/var/root/Library/Caches/sys.kelp.berthd/Dead";
        if (!fs::is_directory(deathRow)) die("no death row at " + deathRow.string());

        std::printf("%d files in 1,110 directories per tree, %d repetitions\n", files, repetitions);
        std::printf("%4s %-10s | %13s %13s %6s | %13s %13s %6s\n", "rep", "first", "death row s",
                    "rm -rf s", "ratio", "death row cpu", "rm -rf cpu", "ratio");
        for (int rep = 0; rep < repetitions; ++rep) {
            const fs::path forDaemon = root / "private/var/bench-daemon";
            const fs::path forRm = root / "private/var/bench-rm";
            buildTree(forDaemon, files);
            buildTree(forRm, files);
            const bool daemonFirst = rep % 2 == 0;
            Cost daemonCost, rmCost;
            if (daemonFirst) daemonCost = timeDaemon(daemon, forDaemon, deathRow);
            rmCost = timeRm(forRm);
            if (!daemonFirst) daemonCost = timeDaemon(daemon, forDaemon, deathRow);
            daemonCosts.push_back(daemonCost);
            rmCosts.push_back(rmCost);
            printRow(std::to_string(rep), daemonFirst ? "death row" : "rm", daemonCost, rmCost);
        }
    }
    auto medianOf = [](const std::vector<Cost>& costs) {
        std::vector<double> wall, cpu;
        for (const Cost& cost : costs) wall.push_back(cost.wall), cpu.push_back(cost.cpu);
        return Cost{median(wall), median(cpu)};
    };
    const Cost daemonMedian = medianOf(daemonCosts), rmMedian = medianOf(rmCosts);
    printRow("med", "", daemonMedian, rmMedian);
    const std::string tree = std::to_string(files) + " files";
    bench::printSummary("deathrow", "empty " + tree + ", wall", "s", daemonMedian.wall, "rm -rf",
                        rmMedian.wall);
    bench::printSummary("deathrow", "empty " + tree + ", cpu", "s", daemonMedian.cpu, "rm -rf",
                        rmMedian.cpu);
    std::error_code ignored;
    fs::remove_all(dir, ignored);
    return 0;
}
