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

// Text from clients and disk becomes exactly one line, whatever it holds.
TEST(BTHLogTest, EveryLineBreakerIsEscapedAndOtherTextKept) {
    const std::pair<std::string, std::string> cases[] = {
        {"com.example.app", "com.example.app"},
        {"a\nb", "a\\nb"},
        {"fake\r<error> main: forged", "fake\\r<error> main: forged"},
        {"\x1b[2K\rforged", "\\x1B[2K\\rforged"},
        {std::string("nul\0byte", 8), "nul\\x00byte"},
        {"\tindented del\x7f", "\tindented del\\x7F"},
        {"next\xc2\x85line", "next\\u0085line"},  // C1 NEL
        {"csi\xc2\x9b"
         "2J",
         "csi\\u009B2J"},  // C1 CSI
        {"sep\xe2\x80\xa8par\xe2\x80\xa9", "sep\\u2028par\\u2029"},
        {"lone\x9b byte", "lone\\x9B byte"},  // not UTF-8
        {"overlong\xc0\x8a", "overlong\\xC0\\x8A"},
        {"caf\xc3\xa9 \xe6\x97\xa5 \xf0\x9f\x93\xa6", "caf\xc3\xa9 \xe6\x97\xa5 \xf0\x9f\x93\xa6"},
        {"truncated\xe2\x80", "truncated\\xE2\\x80"},
        {"ends the line\n", "ends the line"},
    };
    for (const auto& [text, escaped] : cases) EXPECT_EQ(BTHLogEscape(text), escaped) << text;

    test::LogCapture log;
    BTH_FUNCTION("main");
    BTHLogNotice("identifier %s", "x\r\x1b[1A\xe2\x80\xa8y");
    ASSERT_EQ(log.lines().size(), 1u);
    EXPECT_EQ(log.lines()[0].message, "identifier x\\r\\x1B[1A\\u2028y");
}

}  // namespace
}  // namespace berth
