// Syncs submitted together: every item is synced, and a failing one is
// reported without keeping the others from being synced.
#include "platform/SyncTogether.h"

#include <fcntl.h>

#include <vector>

#include "TestSupport.h"

namespace berth {
namespace {

TEST(SyncTogetherTest, SyncsEveryItemAndReportsTheFirstFailure) {
    test::ScratchDir dir;
    test::writeFile(dir / "file", "data");
    UniqueFd file(::open((dir / "file").c_str(), O_RDONLY | O_CLOEXEC));
    UniqueFd directory(::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    ASSERT_TRUE(file && directory);
    const std::vector<int> good = {file.get(), directory.get()};
    EXPECT_EQ(syncTogether(good), 0);
    EXPECT_EQ(syncTogether(std::span<const int>()), 0);
    const std::vector<int> withClosed = {file.get(), 987654, directory.get()};
    EXPECT_EQ(syncTogether(withClosed), EBADF);
    // The ring is still usable after a failed item.
    EXPECT_EQ(syncTogether(good), 0);
}

}  // namespace
}  // namespace berth
