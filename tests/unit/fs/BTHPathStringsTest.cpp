#include "BTHPathStrings.h"

#include <dirent.h>
#include <fcntl.h>

#include "TestSupport.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

TEST(BTHPathStringsTest, OnlyAWholeDotDotComponentCounts) {
    for (const char* path : {"..", "../a", "a/..", "a/../b", "/..", "a//..//b", "../", "./.."})
        EXPECT_TRUE(containsDotDotPathComponents(path)) << path;
    for (const char* path : {"", ".", "/", "...", "..a", "a..", "a/..b/c", "a/b..", "a/./b", ". ."})
        EXPECT_FALSE(containsDotDotPathComponents(path)) << path;
}

TEST(BTHPathStringsTest, NamesThatAreNotUTF8ComeBackByteForByte) {
    test::ScratchDir scratch;
    const std::string name = "caf\xe9-\xff\xfe";  // Latin-1 and stray bytes
    test::writeFile(scratch / name, "x");

    std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(scratch.path().c_str()), closedir);
    ASSERT_TRUE(dir);
    std::optional<std::string> found;
    while (dirent* entry = readdir(dir.get()))
        if (entry->d_name[0] != '.') found = stringWithFileSystemRepresentation(entry->d_name);
    ASSERT_TRUE(found);
    EXPECT_EQ(*found, name);
    // The string reaches the same item again.
    UniqueFd fd(::open((scratch.path() / *found).c_str(), O_RDONLY | O_CLOEXEC));
    EXPECT_TRUE(fd.valid());

    EXPECT_EQ(stringWithFileSystemRepresentation(name.data(), name.size()), name);
    EXPECT_EQ(stringWithFileSystemRepresentation(name.data(), 3), "caf");
}

TEST(BTHPathStringsTest, BytesThatCannotBeAPathGiveNoString) {
    const char withNul[] = {'a', '\0', 'b'};
    EXPECT_EQ(stringWithFileSystemRepresentation(withNul, sizeof withNul), std::nullopt);
    EXPECT_EQ(stringWithFileSystemRepresentation(nullptr), std::nullopt);
    EXPECT_EQ(stringWithFileSystemRepresentation(nullptr, 4), std::nullopt);
    EXPECT_EQ(stringWithFileSystemRepresentation(nullptr, 0), "");
    EXPECT_EQ(stringWithFileSystemRepresentation(""), "");
}

}  // namespace
}  // namespace berth
