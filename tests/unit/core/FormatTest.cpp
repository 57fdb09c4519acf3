#include <gtest/gtest.h>

#include <filesystem>
#include <memory>

#include "core/Format.h"
#include "core/Value.h"

namespace berth {
namespace {

struct Thing {
    std::string description() const { return "<thing>"; }
};

TEST(FormatTest, ObjectsUnderAtSign) {
    std::filesystem::path p = "/private/var/containers/Bundle";
    EXPECT_EQ(format("Failed to read metadata at URL %@", p),
              "Failed to read metadata at URL /private/var/containers/Bundle");
    EXPECT_EQ(format("%@ and %@", Thing{}, std::string("text")), "<thing> and text");
    std::shared_ptr<Thing> none;
    std::optional<std::string> missing;
    EXPECT_EQ(format("%@ %@ %@", none, missing, nullptr), "(null) (null) (null)");
    EXPECT_EQ(format("%@", Value(uint64_t{12})), "12");
    EXPECT_EQ(format("%@", 42), "42");
}

TEST(FormatTest, IntegerConversionsTruncateAsTheirLengthSays) {
    EXPECT_EQ(format("%u", uint64_t{0x1FFFFFFFF}), "4294967295");
    EXPECT_EQ(format("%llu", uint64_t{0x1FFFFFFFF}), "8589934591");
    EXPECT_EQ(format("%d", -5), "-5");
    EXPECT_EQ(format("%u", -1), "4294967295");
    EXPECT_EQ(format("%ld", int64_t{-9000000000}), "-9000000000");
    EXPECT_EQ(format("%lld/%zu/%x/%o/%c", 7, size_t{8}, 255, 8, 'A'), "7/8/ff/10/A");
    EXPECT_EQ(format("%05d|%-4d|%+d", 42, 7, 3), "00042|7   |+3");
}

TEST(FormatTest, TextsPercentAndMismatches) {
    EXPECT_EQ(format("%s: %s", "mkdir", std::string("No such file")), "mkdir: No such file");
    EXPECT_EQ(format("100%% of %s", static_cast<const char*>(nullptr)), "100% of (null)");
    EXPECT_EQ(format("%d", "text"), "text");
    EXPECT_EQ(format("%s", 12), "12");
    // Fewer arguments than conversions: nothing is read past the end.
    EXPECT_EQ(format("a %@ b %d c"), "a  b  c");
    // More arguments than conversions: the rest are ignored.
    EXPECT_EQ(format("x", 1, 2), "x");
    // A format that ends inside a conversion keeps the text as it is.
    EXPECT_EQ(format("tail %l"), "tail %l");
}

TEST(FormatTest, QuotedTextsReadVerbatim) {
    EXPECT_EQ(format("Failed to create log directory at \"%@\": %@", std::filesystem::path("/x"),
                     std::string("err")),
              "Failed to create log directory at \"/x\": err");
    EXPECT_EQ(
        format("notify_register_dispatch for notification \"%s\" failed; returned %d\n", "lock", 3),
        "notify_register_dispatch for notification \"lock\" failed; returned 3\n");
}

}  // namespace
}  // namespace berth
