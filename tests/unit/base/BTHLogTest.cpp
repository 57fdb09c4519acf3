#include "BTHLog.h"

#include <fstream>

#include "TestSupport.h"
#include "platform/RotatingLogSink.h"

namespace berth {
namespace {

using test::ScratchDir;

TEST(BTHLogTest, LevelGuards) {
    BTHLogSetHandle(nullptr);
    EXPECT_TRUE(BTHLogEnabled(3));
    EXPECT_TRUE(BTHLogEnabled(5));
    EXPECT_FALSE(BTHLogEnabled(7)) << "debug needs a handle";

    auto handle = std::make_shared<BTHLogHandle>("t", 5);
    BTHLogSetHandle(handle);
    EXPECT_TRUE(BTHLogEnabled(4));
    EXPECT_TRUE(BTHLogEnabled(5));
    EXPECT_FALSE(BTHLogEnabled(7));
    handle->setThreshold(7);
    EXPECT_TRUE(BTHLogEnabled(7));
    handle->setThreshold(3);
    EXPECT_FALSE(BTHLogEnabled(4));
    EXPECT_TRUE(BTHLogEnabled(3));
    BTHLogSetHandle(nullptr);
}

TEST(BTHLogTest, MacrosSkipArgumentsOfLinesNotWritten) {
    test::LogCapture log(5);
    BTH_FUNCTION("-[BTHLogTest macros]");
    int evaluated = 0;
    auto touch = [&] { return ++evaluated; };
    BTHLogDebug("debug %d", touch());
    EXPECT_EQ(evaluated, 0);
    BTHLogNotice("notice %d", touch());
    EXPECT_EQ(evaluated, 1);
    ASSERT_EQ(log.lines().size(), 1u);
    EXPECT_EQ(log.lines()[0].function, "-[BTHLogTest macros]");
    EXPECT_EQ(log.lines()[0].message, "notice 1");
    EXPECT_EQ(log.lines()[0].level, 5);
}

size_t countFiles(const std::filesystem::path& dir) {
    return test::namesIn(dir).size();
}

TEST(BTHLogTest, RotationKeepsTheCountAndNamesFilesWithNumericSuffixes) {
    ScratchDir dir;
    const auto path = dir / "berthd.log";
    {
        auto handle = std::make_shared<BTHLogHandle>("sys.kelp.berthd", 5);
        ASSERT_TRUE(handle->enableDiskLogging(path, 1, 1024));
        BTHLogSetHandle(handle);
        BTH_FUNCTION("main");
        for (int i = 0; i < 100; ++i) BTHLogNotice("line %d of the rotation test", i);
        BTHLogSetHandle(nullptr);
    }
    EXPECT_TRUE(std::filesystem::exists(path));
    EXPECT_TRUE(std::filesystem::exists(dir / "berthd.log.1"));
    EXPECT_EQ(countFiles(dir.path()), 2u);
    EXPECT_LE(std::filesystem::file_size(path), 1024u);
    std::string current = test::readFile(path);
    EXPECT_NE(current.find("<notice> main: line 99 of the rotation test\n"), std::string::npos);

    ScratchDir four;
    {
        auto handle = std::make_shared<BTHLogHandle>("sys.kelp.berthd", 5);
        ASSERT_TRUE(handle->enableDiskLogging(four / "berthd.log", 4, 512));
        for (int i = 0; i < 200; ++i)
            handle->write(5, "main", "a line that fills the file quickly");
    }
    EXPECT_EQ(countFiles(four.path()), 5u);
    EXPECT_TRUE(std::filesystem::exists(four / "berthd.log.4"));
    EXPECT_FALSE(std::filesystem::exists(four / "berthd.log.5"));
}

TEST(BTHLogTest, UnopenableLogFileIsReported) {
    ScratchDir dir;
    BTHLogHandle handle("sys.kelp.berthd", 5);
    EXPECT_FALSE(handle.enableDiskLogging(dir / "missing" / "berthd.log", 1, 1024));
}

}  // namespace
}  // namespace berth
