// The bulk directory-attribute read, batched and one entry at a time: every
// entry once, with the attributes lstat gives, across several batches.
#include <fcntl.h>
#include <sys/stat.h>

#include <map>

#include "TestSupport.h"
#include "platform/BulkDirectoryRead.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using namespace test;
using Entry = fs::BulkEntry;

std::map<std::string, Entry> readAll(const stdfs::path& dir, bool batched) {
    fs::BulkDirectoryReader reader(batched);
    UniqueFd fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::map<std::string, Entry> entries;
    std::vector<Entry> batch;
    int n;
    while ((n = reader.read(fd.get(), &batch)) > 0)
        for (Entry entry : batch) {
            const std::string name(entry.name);
            entry.name = {};
            EXPECT_TRUE(entries.emplace(name, entry).second) << "listed twice: " << name;
        }
    EXPECT_EQ(n, 0);
    return entries;
}

class BulkDirectoryRead : public ::testing::TestWithParam<bool> {};

TEST_P(BulkDirectoryRead, GivesEveryEntryOnceWithWhatLstatSays) {
    ScratchDir dir;
    // Long names make the listing span several 32 KiB reads.
    const std::string padding(180, 'n');
    for (int i = 0; i < 400; ++i)
        writeFile(dir / (padding + std::to_string(i)), std::string(i * 37, 'x'));
    stdfs::create_directory(dir / "sub");
    stdfs::create_hard_link(dir / (padding + "7"), dir / "linked");
    stdfs::create_symlink("sub", dir / "link");
    ASSERT_EQ(::mkfifo((dir / "fifo").c_str(), 0600), 0);

    const std::map<std::string, Entry> entries = readAll(dir.path(), GetParam());
    ASSERT_EQ(entries.size(), 404u);
    for (const auto& [name, entry] : entries) {
        const struct stat st = lstatOf(dir / name);
        ASSERT_TRUE(entry.has(Entry::kType)) << name;
        EXPECT_FALSE(entry.has(Entry::kError)) << name;
        EXPECT_EQ(entry.fileId, st.st_ino) << name;
        if (S_ISDIR(st.st_mode)) {
            EXPECT_EQ(entry.type, Entry::Type::Directory);
            EXPECT_FALSE(entry.has(Entry::kAllocSize)) << "a directory needs no statx";
            continue;
        }
        EXPECT_EQ(entry.type, S_ISREG(st.st_mode)   ? Entry::Type::File
                              : S_ISLNK(st.st_mode) ? Entry::Type::Symlink
                                                    : Entry::Type::Other)
            << name;
        EXPECT_EQ(entry.linkCount, st.st_nlink) << name;
        EXPECT_EQ(entry.allocSize, static_cast<uint64_t>(st.st_blocks) * 512) << name;
    }
    EXPECT_EQ(entries.at("linked").linkCount, 2u);
}

TEST_P(BulkDirectoryRead, FailsWithErrnoOnADescriptorThatIsNoDirectory) {
    ScratchDir dir;
    writeFile(dir / "file", "x");
    UniqueFd fd(::open((dir / "file").c_str(), O_RDONLY | O_CLOEXEC));
    fs::BulkDirectoryReader reader(GetParam());
    std::vector<Entry> batch;
    errno = 0;
    EXPECT_EQ(reader.read(fd.get(), &batch), -1);
    EXPECT_EQ(errno, ENOTDIR);
    EXPECT_TRUE(batch.empty());
}

INSTANTIATE_TEST_SUITE_P(BatchedAndOneByOne, BulkDirectoryRead, ::testing::Bool());

}  // namespace
}  // namespace berth
