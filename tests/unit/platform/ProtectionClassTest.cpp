// The protection-class store: own and inherited classes, and the locked
// device's refusal for class 1 items, both with a given lock answer and
// with the key bag's state file.
#include "platform/ProtectionClass.h"

#include <fcntl.h>
#include <sys/xattr.h>

#include "ScratchDeviceRoot.h"
#include "TestSupport.h"
#include "platform/KeyBagState.h"
#include "platform/LockStateNotification.h"
#include "platform/UniqueFd.h"

namespace berth {
namespace {

namespace stdfs = std::filesystem;
using test::ScratchDir;

// This program's own device root, so the lock state file it writes is its own.
const bool kRootNamed = !test::installScratchDeviceRoot().empty();

const protection::LockQuery kLocked = [] { return true; };
const protection::LockQuery kUnlocked = [] { return false; };

UniqueFd openItem(const stdfs::path& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    EXPECT_TRUE(fd) << path << ": " << strerror(errno);
    return fd;
}

// The class of `path`, or -(error number).
int32_t classOf(const stdfs::path& path, const protection::LockQuery& lock = kUnlocked) {
    UniqueFd fd = openItem(path);
    int32_t value = 0;
    const int err = protection::getClass(fd.get(), &value, lock);
    return err ? -err : value;
}

int setClass(const stdfs::path& path, int32_t value,
             const protection::LockQuery& lock = kUnlocked) {
    UniqueFd fd = openItem(path);
    return protection::setClass(fd.get(), value, lock);
}

TEST(ProtectionClassTest, ItemsWithoutAClassTakeTheNearestAncestorsOrZero) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    stdfs::create_directories(dir / "a/b/c/d");
    for (const char* f : {"a/b/file", "a/b/c/d/file", "plain"}) test::writeFile(dir / f, "");
    EXPECT_EQ(classOf(dir / "a/b/file"), 0);
    EXPECT_EQ(classOf(dir / "plain"), 0);

    ASSERT_EQ(setClass(dir / "a", 3), 0);
    ASSERT_EQ(setClass(dir / "a/b/c", 2), 0);
    for (const auto& [item, expected] : {std::pair{"a", 3},
                                         {"a/b", 3},
                                         {"a/b/file", 3},
                                         {"a/b/c", 2},
                                         {"a/b/c/d/file", 2},
                                         {"plain", 0}})
        EXPECT_EQ(classOf(dir / item), expected) << item;

    // A file's own class wins over its directory's; negative classes are kept.
    ASSERT_EQ(setClass(dir / "a/b/file", -7), 0);
    EXPECT_EQ(classOf(dir / "a/b/file"), -7);

    // A file moved elsewhere inherits from where it is now.
    stdfs::rename(dir / "a/b/c/d/file", dir / "a/b/moved");
    EXPECT_EQ(classOf(dir / "a/b/moved"), 3);

    // An attribute of the wrong size is not a class.
    ASSERT_EQ(::setxattr((dir / "plain").c_str(), protection::kAttributeName, "xy", 2, 0), 0);
    EXPECT_EQ(classOf(dir / "plain"), -EINVAL);
}

TEST(ProtectionClassTest, ClassOneItemsAreOutOfReachWhileTheDeviceIsLocked) {
    BERTH_REQUIRE_ROOT();
    ScratchDir dir;
    stdfs::create_directories(dir / "one/sub");
    stdfs::create_directories(dir / "three");
    test::writeFile(dir / "one/sub/file", "");
    test::writeFile(dir / "three/file", "");
    ASSERT_EQ(setClass(dir / "one", 1), 0);
    ASSERT_EQ(setClass(dir / "three", 3), 0);

    // Own and inherited class 1 alike: neither read nor changed.
    for (const char* item : {"one", "one/sub", "one/sub/file"}) {
        EXPECT_EQ(classOf(dir / item, kLocked), -EPERM) << item;
        EXPECT_EQ(setClass(dir / item, 3, kLocked), EPERM) << item;
        EXPECT_EQ(classOf(dir / item, kUnlocked), 1) << item;
    }
    // Other classes are not affected by the lock, and may become class 1.
    EXPECT_EQ(classOf(dir / "three/file", kLocked), 3);
    EXPECT_EQ(setClass(dir / "three/file", 1, kLocked), 0);
    EXPECT_EQ(classOf(dir / "three/file", kLocked), -EPERM);

    // Unlocked, class 1 items change like any other.
    EXPECT_EQ(setClass(dir / "one/sub/file", 4, kUnlocked), 0);
    EXPECT_EQ(classOf(dir / "one/sub/file", kLocked), 4);
}

TEST(ProtectionClassTest, WithoutAGivenAnswerTheKeyBagStateDecides) {
    BERTH_REQUIRE_ROOT();
    ASSERT_TRUE(kRootNamed);
    ScratchDir dir;
    stdfs::create_directories(dir / "one");
    ASSERT_EQ(setClass(dir / "one", 1), 0);
    UniqueFd fd = openItem(dir / "one");
    int32_t value = 0;

    EXPECT_FALSE(keybag::deviceIsLocked());  // no state file yet
    EXPECT_EQ(protection::getClass(fd.get(), &value), 0);
    EXPECT_EQ(value, 1);

    ASSERT_TRUE(LockStateNotification::setLockState(1));
    EXPECT_TRUE(keybag::deviceIsLocked());
    EXPECT_EQ(protection::getClass(fd.get(), &value), EPERM);
    EXPECT_EQ(protection::setClass(fd.get(), 3), EPERM);

    ASSERT_TRUE(LockStateNotification::setLockState(0));
    EXPECT_FALSE(keybag::deviceIsLocked());
    EXPECT_EQ(protection::setClass(fd.get(), 3), 0);
}

}  // namespace
}  // namespace berth
