// A directory tree and a path, both chosen by the input, checked for
// containment in the tree's "base" directory. Whatever the tree holds (links
// climbing out, links to links, links to the base, magic links) and whatever
// the path says, the answer is a refusal or a real path inside the base, and
// an item opened through it lies inside the base.
//
// Input: the first line is the path below the base; every further line
// makes one item of the tree, relative to its top (which holds "base" and
// "outside"): "d NAME" a directory, "f NAME" a file, "l NAME TEXT" a link.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "BTHFileManager.h"
#include "BTHLog.h"

namespace {

namespace fs = std::filesystem;

constexpr size_t kMaxItems = 24;

// A scratch tree the input describes. It is built through descriptors, one
// name at a time, and never through a link: a link the input plants (say to
// "/") would otherwise carry later items out of the tree and onto the host.
class ScratchTree {
  public:
    ScratchTree() {
        std::string templ = (fs::temp_directory_path() / "berth-fuzz-contained.XXXXXX").string();
        if (!mkdtemp(templ.data())) std::abort();
        top_ = fs::canonical(templ);
        topFd_ = ::open(top_.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
        if (topFd_ < 0) std::abort();
    }
    ~ScratchTree() {
        ::close(topFd_);
        std::error_code ignored;
        fs::remove_all(top_, ignored);
    }

    // A fresh tree: empty "base" and "outside" with a secret, nothing else
    // left from an earlier input. (Removal never follows links.)
    void reset() {
        std::error_code ignored;
        for (const auto& entry : fs::directory_iterator(top_, ignored))
            fs::remove_all(entry.path(), ignored);
        fs::create_directories(top_ / "base");
        fs::create_directories(top_ / "outside");
        std::ofstream(top_ / "outside/secret") << "secret";
    }

    // Makes one item; names that climb or are absolute are skipped, and so
    // is an item whose way down meets a link or a file.
    void make(char kind, const std::string& name, const std::string& text) {
        const fs::path relative(name);
        // A NUL ends the name the kernel sees: "..\0x" would pass as a name
        // and climb out.
        if (name.empty() || relative.is_absolute() || name.find('\0') != std::string::npos ||
            text.find('\0') != std::string::npos)
            return;
        std::vector<std::string> parts;
        for (const auto& part : relative) {
            if (part == "..") return;
            if (!part.empty() && part != ".") parts.push_back(part.string());
        }
        if (parts.empty()) return;
        const std::string last = parts.back();
        parts.pop_back();
        int dir = ::dup(topFd_);
        for (const std::string& part : parts) {
            ::mkdirat(dir, part.c_str(), 0755);
            const int next =
                ::openat(dir, part.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
            ::close(dir);
            if (next < 0) return;
            dir = next;
        }
        if (kind == 'd') ::mkdirat(dir, last.c_str(), 0755);
        if (kind == 'l') ::symlinkat(text.c_str(), dir, last.c_str());
        if (kind == 'f') {
            const int file = ::openat(dir, last.c_str(),
                                      O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644);
            if (file >= 0) {
                (void)!::write(file, "item", 4);
                ::close(file);
            }
        }
        ::close(dir);
    }

    fs::path base() const { return top_ / "base"; }

  private:
    fs::path top_;
    int topFd_ = -1;
};

bool inside(const std::string& path, const std::string& base) {
    return path == base || path.rfind(base + "/", 0) == 0;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static ScratchTree tree;
    static const bool quiet = [] {
        berth::BTHLogSetHandle(std::make_shared<berth::BTHLogHandle>("fuzz", 0));
        return true;
    }();
    (void)quiet;
    tree.reset();

    std::istringstream input(std::string(reinterpret_cast<const char*>(data), size));
    std::string suspicious;
    std::getline(input, suspicious);
    std::string line;
    for (size_t items = 0; items < kMaxItems && std::getline(input, line); ++items) {
        if (line.size() < 3 || line[1] != ' ') continue;
        const std::string rest = line.substr(2);
        const size_t space = rest.find(' ');
        tree.make(line[0], rest.substr(0, space),
                  space == std::string::npos ? std::string() : rest.substr(space + 1));
    }

    const std::string base = tree.base().string();
    berth::BTHFileManager& manager = berth::BTHFileManager::defaultManager();
    const std::string path = base + "/" + suspicious;
    if (auto real = manager.realPathForURL(fs::path(path), tree.base())) {
        if (!inside(real->string(), base)) __builtin_trap();
        // An existing item it names is really inside. (A dangling link may
        // be named itself; it is never followed, as the open below shows.)
        std::error_code error;
        if (fs::exists(*real, error) && !fs::is_symlink(*real, error)) {
            const fs::path resolved = fs::canonical(*real, error);
            if (!error && !inside(resolved.string(), base)) __builtin_trap();
        }
    }
    // Both opens hand back a directory that really is inside, and an entry
    // name that is one name.
    for (const auto& item : {manager.openContainedItem(fs::path(path), tree.base()),
                             manager.openContainedEntry(fs::path(path), tree.base())}) {
        if (!item) continue;
        char where[4096] = {};
        const std::string link = "/proc/self/fd/" + std::to_string(item->parent.get());
        const ssize_t n = ::readlink(link.c_str(), where, sizeof where - 1);
        if (n <= 0 || !inside(std::string(where, n), base)) __builtin_trap();
        if (item->name.empty() || item->name == "." || item->name == ".." ||
            item->name.find('/') != std::string::npos)
            __builtin_trap();
    }
    return 0;
}
