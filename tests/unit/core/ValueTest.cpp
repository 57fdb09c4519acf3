#include <gtest/gtest.h>

#include <cmath>

#include <limits>
#include <unordered_set>

#include "core/Uuid.h"
#include "core/Value.h"

namespace berth {
namespace {

Value sampleTree() {
    Value info = Value::dictionary();
    info.set("ContentProtection", int32_t{-1});
    info.set("Flags", Value(Value::Array{Value(true), Value(uint64_t{1} << 63), Value(2.5)}));
    Value root = Value::dictionary();
    root.set("Identifier", "sys.kelp.app");
    root.set("Info", info);
    root.set("Blob", Value(Value::Data{0, 1, 2, 0}));
    root.set("When", Value(Value::Date{1.5e9}));
    root.set("Id", *Uuid::parse("1b4e28ba-2fa1-11d2-883f-0016d3cca427"));
    return root;
}

TEST(ValueTest, IntegersCompareByValueAcrossKindsAndHashAgrees) {
    EXPECT_EQ(Value(int64_t{5}), Value(uint64_t{5}));
    EXPECT_EQ(Value(int64_t{5}).hash(), Value(uint64_t{5}).hash());
    // The same bits, different numbers.
    EXPECT_NE(Value(int64_t{-1}), Value(UINT64_MAX));
    EXPECT_NE(Value(int64_t{0}), Value(false));
    EXPECT_NE(Value(int64_t{1}), Value(1.0));
    EXPECT_NE(Value("1"), Value(int64_t{1}));
}

TEST(ValueTest, DeepEqualityAndHashOfTrees) {
    Value a = sampleTree(), b = sampleTree();
    EXPECT_EQ(a, b);
    EXPECT_EQ(a.hash(), b.hash());
    std::unordered_set<Value> set{a};
    EXPECT_TRUE(set.count(b));

    Value changed = sampleTree();
    Value info = *changed.find("Info");
    info.set("ContentProtection", int32_t{3});
    changed.set("Info", info);
    EXPECT_NE(a, changed);
    EXPECT_FALSE(set.count(changed));
}

// A stored mapping is compared with what was written: a NaN anywhere in it
// (a real or a date) must not make a value unequal to itself or to its copy
// read back, and equal values must hash alike (zeros of either sign too).
TEST(ValueTest, NaNsAndSignedZerosCompareAndHashAsTheSameNumber) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    for (const Value& v : {Value(nan), Value(Value::Date{nan})}) {
        EXPECT_EQ(v, v);
        EXPECT_EQ(v.hash(), Value(v).hash());
    }
    EXPECT_EQ(Value(nan), Value(-nan));
    EXPECT_EQ(Value(nan).hash(), Value(-nan).hash());
    EXPECT_EQ(Value(0.0), Value(-0.0));
    EXPECT_EQ(Value(0.0).hash(), Value(-0.0).hash());
    EXPECT_EQ(Value(Value::Date{0.0}).hash(), Value(Value::Date{-0.0}).hash());
    EXPECT_NE(Value(nan), Value(0.0));
    EXPECT_NE(Value(Value::Date{nan}), Value(nan));

    Value tree = sampleTree();
    tree.set("When", Value(Value::Date{nan}));
    Value list = Value::array();
    list.push(Value(nan));
    tree.set("List", list);
    Value copy = tree;
    EXPECT_EQ(tree, copy);
    std::unordered_set<Value> set{tree};
    EXPECT_TRUE(set.count(copy));
}

TEST(ValueTest, TypedViewsAnswerOnlyForTheirKind) {
    Value s("text");
    EXPECT_NE(s.string(), nullptr);
    EXPECT_EQ(s.data(), nullptr);
    EXPECT_EQ(s.find("x"), nullptr);
    EXPECT_FALSE(s.uint64Value());
    s.set("k", 1);  // not a dictionary: ignored
    EXPECT_EQ(s, Value("text"));

    EXPECT_EQ(*Value(int64_t{-2}).uint64Value(), UINT64_MAX - 1);
    EXPECT_EQ(*Value(UINT64_MAX).int64Value(), -1);
    EXPECT_EQ(*Value(7.9).uint64Value(), 7u);
}

TEST(ValueTest, DescriptionQuotesOnlyNestedStringsThatNeedIt) {
    EXPECT_EQ(Value("plain text").description(), "plain text");
    Value d = Value::dictionary();
    d.set("a b", "c d");
    d.set("k", "v");
    EXPECT_EQ(d.description(), "{\n    \"a b\" = \"c d\";\n    k = v;\n}");
    EXPECT_EQ(Value(Value::Data{0xde, 0xad, 0xbe, 0xef, 1}).description(), "<deadbeef 01>");
    EXPECT_EQ(Value().description(), "(null)");
    // Dates an app's file can hold but no calendar time can.
    EXPECT_EQ(Value(Value::Date{0}).description(), "1970-01-01 00:00:00 +0000");
    EXPECT_EQ(Value(Value::Date{1.15627e30}).description(), "1.15627e+30 seconds since 1970");
    EXPECT_EQ(Value(Value::Date{-INFINITY}).description(), "-inf seconds since 1970");
}

TEST(UuidTest, ParsesCanonicalFormOnlyAndPrintsUpperCase) {
    auto u = Uuid::parse("1b4e28ba-2fa1-11d2-883f-0016d3cca427");
    ASSERT_TRUE(u);
    EXPECT_EQ(u->string(), "1B4E28BA-2FA1-11D2-883F-0016D3CCA427");
    EXPECT_EQ(Uuid::parse(u->string()), u);
    for (const char* bad :
         {"", "1b4e28ba2fa111d2883f0016d3cca427", "{1b4e28ba-2fa1-11d2-883f-0016d3cca427}",
          "1b4e28ba-2fa1-11d2-883f-0016d3cca42g", "1b4e28ba-2fa1-11d2-883f-0016d3cca4270",
          "1b4e28ba+2fa1-11d2-883f-0016d3cca427"})
        EXPECT_FALSE(Uuid::parse(bad)) << bad;
}

TEST(UuidTest, RandomUuidsAreVersionFourAndDistinct) {
    std::unordered_set<Uuid> seen;
    for (int i = 0; i < 1000; ++i) {
        Uuid u = Uuid::random();
        EXPECT_EQ(u.bytes()[6] >> 4, 4);
        EXPECT_EQ(u.bytes()[8] >> 6, 2);
        EXPECT_TRUE(seen.insert(u).second);
    }
}

}  // namespace
}  // namespace berth
