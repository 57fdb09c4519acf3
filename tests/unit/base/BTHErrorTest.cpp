#include "BTHError.h"

#include "TestSupport.h"

namespace berth {
namespace {

using test::LogCapture;

TEST(BTHErrorTest, ExtraUserInfoIsKeptAndTheMakersKeysWin) {
    LogCapture log;
    Value extra = Value::dictionary();
    extra.set("Path", "/a/b");
    extra.set(kBTHFunctionNameKey, "impostor");
    BTHErrorRef e = BTHCreateError("-[BTHThing op:]", 77, kBTHErrorDomain, BTHErrorNotFound,
                                   nullptr, &extra, 0, "No container %@", "x");
    EXPECT_EQ(e->domain(), kBTHErrorDomain);
    EXPECT_EQ(e->code(), BTHErrorNotFound);
    EXPECT_EQ(*e->userInfo().find("Path"), Value("/a/b"));
    EXPECT_EQ(e->functionName(), "-[BTHThing op:]");
    EXPECT_EQ(e->sourceFileLine(), 77);
    EXPECT_EQ(e->localizedDescription(), "No container x");
    EXPECT_TRUE(log.lines().empty()) << "log flag 0 must not log";
}

TEST(BTHErrorTest, LogFlagWritesOneErrorLineWithLineAndUnderlyingError) {
    LogCapture log;
    BTHErrorRef posix = BTHCreatePOSIXError("-[BTHFileManager x]", 10, ENOENT, "gone");
    BTHErrorRef e = BTHCreateError("-[BTHMetadata writeMetadataToDiskWithError:]", 123,
                                   kBTHErrorDomain, BTHErrorWriteFailed, posix, nullptr, 1,
                                   "Failed to write metadata dictionary to URL %@", "/c");
    auto lines = log.lines();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].level, 3);
    EXPECT_EQ(lines[0].function, "-[BTHMetadata writeMetadataToDiskWithError:]");
    EXPECT_EQ(lines[0].message,
              "123: Failed to write metadata dictionary to URL /c (" + posix->description() + ")");
    EXPECT_EQ(e->underlyingError(), posix);

    BTHCreateError("plainFunction", 5, kBTHErrorDomain, BTHErrorInvalidArgument, nullptr, nullptr,
                   1, "bad %d", 3);
    ASSERT_EQ(log.lines().size(), 2u);
    EXPECT_EQ(log.lines()[1].message, "5: bad 3");
}

TEST(BTHErrorTest, NoFormatMeansNoDescriptionAndNoLineWhateverTheFlag) {
    LogCapture log;
    BTHErrorRef e =
        BTHCreateError("f", 1, kBTHErrorDomain, BTHErrorDeleteFailed, nullptr, nullptr, 1, nullptr);
    EXPECT_EQ(e->userInfo().find(kBTHLocalizedDescriptionKey), nullptr);
    EXPECT_TRUE(log.lines().empty());
}

TEST(BTHErrorTest, POSIXErrorsCarryExactlyThreeKeysAndNeverLog) {
    LogCapture log;
    BTHErrorRef e = BTHCreatePOSIXError("-[BTHFileManager removeItemAtURL:error:]", 9, EPERM,
                                        "removefile of %@ failed: %s", "/p", strerror(EPERM));
    EXPECT_EQ(e->domain(), kBTHPOSIXErrorDomain);
    EXPECT_EQ(e->code(), EPERM);
    EXPECT_EQ(e->userInfo().size(), 3u);
    EXPECT_EQ(e->localizedDescription(), "removefile of /p failed: Operation not permitted");
    EXPECT_TRUE(log.lines().empty());
}

TEST(BTHErrorTest, ExceptionErrorIsCode40WithTextAndCallStack) {
    LogCapture log;
    BTHErrorRef e;
    BTHCaughtException caught;
    try {
        throw std::runtime_error("boom");
    } catch (...) {
        caught = BTHCaughtException::from(std::current_exception());
        e = BTHCreateExceptionError("-[BTHContainerCache op]", 300, caught);
    }
    EXPECT_EQ(caught.name, "std::runtime_error");
    EXPECT_EQ(caught.reason, "boom");
    EXPECT_GT(caught.callStackSymbols.size(), 0u);
    EXPECT_TRUE(e->isBTHError(BTHErrorException));
    EXPECT_EQ(e->localizedDescription().rfind("Got exception: boom : (", 0), 0u);
    auto lines = log.lines();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].message.rfind("300: Got exception: boom : (", 0), 0u);
}

TEST(BTHErrorTest, CodesTravelSignExtendedAndHaveTheirNames) {
    BTHErrorRef e = BTHCreatePOSIXError("f", 1, -3, nullptr);
    EXPECT_EQ(e->code64(), UINT64_MAX - 2);
    EXPECT_EQ(BTHCreatePOSIXError("f", 1, 21, nullptr)->code64(), 21u);
    EXPECT_EQ(BTHErrorCodeName(21), "BTHErrorNotFound");
    EXPECT_EQ(BTHErrorCodeName(1), "BTHErrorSuccess");
    EXPECT_EQ(BTHErrorCodeName(2), "");
    EXPECT_EQ(BTHErrorCodeName(uint64_t{1} << 40 | 21), "");
}

}  // namespace
}  // namespace berth
