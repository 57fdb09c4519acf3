#include "core/ValueJson.h"

#include <cmath>
#include <limits>

#include "TestSupport.h"
#include "core/RelayCodec.h"

namespace berth {
namespace {

using test::identical;

Value parse(const std::string& text) {
    std::string error;
    auto value = valueFromJson(text, &error);
    EXPECT_TRUE(value) << text << ": " << error;
    return value.value_or(Value());
}

std::string parseError(const std::string& text) {
    std::string error;
    EXPECT_FALSE(valueFromJson(text, &error)) << text;
    return error;
}

TEST(ValueJsonTest, PlainJsonMapsToTheNaturalKinds) {
    EXPECT_TRUE(identical(parse("null"), Value()));
    EXPECT_TRUE(identical(parse("true"), Value(true)));
    EXPECT_TRUE(identical(parse("0"), Value(uint64_t{0})));
    EXPECT_TRUE(identical(parse("-0"), Value(uint64_t{0})));
    EXPECT_TRUE(identical(parse("18446744073709551615"), Value(UINT64_MAX)));
    EXPECT_TRUE(identical(parse("-1"), Value(int64_t{-1})));
    EXPECT_TRUE(identical(parse("-9223372036854775808"), Value(INT64_MIN)));
    EXPECT_TRUE(identical(parse("2.0"), Value(2.0)));
    EXPECT_TRUE(identical(parse("1e2"), Value(100.0)));
    EXPECT_TRUE(identical(parse("18446744073709551616"), Value(18446744073709551616.0)));
    EXPECT_TRUE(identical(parse(R"("a\u0000b")"), Value(std::string("a\0b", 3))));
    EXPECT_TRUE(identical(parse(R"("\ud83d\udea2")"), Value("\xF0\x9F\x9A\xA2")));

    Value expected = Value::dictionary();
    expected.set("Command", uint64_t{3});
    expected.set("List", Value(Value::Array{Value("a"), Value(), Value(Value::Array{})}));
    expected.set("Info", Value::dictionary());
    EXPECT_TRUE(
        identical(parse(R"({"Command": 3, "List": ["a", null, []], "Info": {}})"), expected));
}

TEST(ValueJsonTest, WrappersForceTheirKind) {
    EXPECT_TRUE(identical(parse(R"({"int64": 5})"), Value(int64_t{5})));
    EXPECT_TRUE(identical(parse(R"({"int64": 9223372036854775807})"), Value(INT64_MAX)));
    EXPECT_TRUE(identical(parse(R"({"uint64": 0})"), Value(uint64_t{0})));
    EXPECT_TRUE(identical(parse(R"({"double": 3})"), Value(3.0)));
    EXPECT_TRUE(std::isnan(*parse(R"({"double": "nan"})").doubleValue()));
    EXPECT_TRUE(
        identical(parse(R"({"double": "-inf"})"), Value(-std::numeric_limits<double>::infinity())));
    EXPECT_TRUE(identical(parse(R"({"date": 1500000000})"), Value(Value::Date{1.5e9})));
    EXPECT_TRUE(identical(parse(R"({"uuid": "1b4e28ba-2fa1-11d2-883f-0016d3cca427"})"),
                          Value(*Uuid::parse("1B4E28BA-2FA1-11D2-883F-0016D3CCA427"))));
    EXPECT_TRUE(identical(parse(R"({"data": "AAEC/w=="})"), Value(Value::Data{0, 1, 2, 0xFF})));
    EXPECT_TRUE(identical(parse(R"({"data": "AAE="})"), Value(Value::Data{0, 1})));
    EXPECT_TRUE(identical(parse(R"({"data": ""})"), Value(Value::Data{})));

    // The dictionary wrapper lets a dictionary have a kind name as its only key.
    Value dict = Value::dictionary();
    dict.set("data", "not base64!");
    EXPECT_TRUE(identical(parse(R"({"dictionary": {"data": "not base64!"}})"), dict));
    // Two members, one of them a kind name: an ordinary dictionary.
    Value two = parse(R"({"uint64": "x", "other": 1})");
    EXPECT_TRUE(identical(*two.find("uint64"), Value("x")));
}

TEST(ValueJsonTest, RefusesWhatItCannotRepresentAndSaysWhere) {
    EXPECT_NE(parseError(R"({"uint64": -1})").find("expected an integer from 0"),
              std::string::npos);
    parseError(R"({"uint64": 1.5})");
    parseError(R"({"uint64": "5"})");
    parseError(R"({"int64": 9223372036854775808})");
    parseError(R"({"double": "NaN"})");
    parseError(R"({"date": true})");
    parseError(R"({"uuid": "1b4e28ba2fa111d2883f0016d3cca427"})");
    parseError(R"({"dictionary": [1]})");
    for (const char* bad :
         {"AAE", "AAF=", "AA=A", "====", "A A=", "AA\\n==", "AAE=AAAA=", "Zm9v-A=="}) {
        EXPECT_EQ(parseError(std::string(R"({"data": ")") + bad + "\"}"), "/data: invalid base64")
            << bad;
    }
    EXPECT_EQ(parseError(R"({"Info": {"a/b~": [0, {"data": "!"}]}})"),
              "/Info/a~1b~0/1/data: invalid base64");
    EXPECT_EQ(parseError(R"({"a": 1, "a": 2})"), "duplicate member \"a\"");
    EXPECT_EQ(parseError(R"([{"a": 1}, {"b": {"a": 1, "a": 2}}])"), "duplicate member \"a\"");
    EXPECT_FALSE(parseError("{\"a\": 1,}").empty());
    EXPECT_FALSE(parseError("\"\xC0\x80\"").empty());  // overlong UTF-8 in the text
    EXPECT_FALSE(parseError(R"("\ud800")").empty());   // lone surrogate escape
    EXPECT_FALSE(parseError("").empty());

    // Same nesting limit as the wire, and hostile depth stops early.
    std::string deep = std::string(relay::kMaxDepth, '[') + std::string(relay::kMaxDepth, ']');
    EXPECT_TRUE(valueFromJson(deep));
    std::string innermost;
    for (int i = 0; i < relay::kMaxDepth; ++i) innermost += "/0";
    EXPECT_EQ(parseError("[" + deep + "]"), innermost + ": nesting too deep");
    EXPECT_EQ(parseError(std::string(1000000, '[')), "nesting too deep");
}

TEST(ValueJsonTest, OutputWrapsOnlyWhatPlainJsonWouldMisread) {
    Value v = Value::dictionary();
    v.set("n", uint64_t{5});
    v.set("i", int64_t{-5});
    v.set("j", int64_t{5});
    v.set("d", 2.0);
    v.set("s", "x");
    v.set("nan", std::numeric_limits<double>::quiet_NaN());
    v.set("one", Value(Value::Dictionary{{"uuid", Value("plain string")}}));
    EXPECT_EQ(valueToJson(v), R"({"d":2.0,"i":-5,"j":{"int64":5},"n":5,"nan":{"double":"nan"},)"
                              R"("one":{"dictionary":{"uuid":"plain string"}},"s":"x"})");
    EXPECT_EQ(valueToJson(Value(Value::Data{0xFF})), R"({"data":"/w=="})");
    EXPECT_EQ(valueToJson(Value("\xFF")), "\"\xEF\xBF\xBD\"");
    EXPECT_EQ(valueToJson(Value(Value::Array{Value(true)}), 2), "[\n  true\n]");
}

TEST(ValueJsonTest, EveryValueSurvivesTextAndBack) {
    Value inner = Value::dictionary();
    inner.set("data", Value(Value::Data{1, 2, 3}));  // a kind name as the only key
    Value nestedWrapperKey = Value::dictionary();
    nestedWrapperKey.set("dictionary", inner);
    Value v = Value::dictionary();
    v.set("uint64 max", UINT64_MAX);
    v.set("uint64 zero", uint64_t{0});
    v.set("int64 min", INT64_MIN);
    v.set("int64 max", INT64_MAX);
    v.set("int64 zero", int64_t{0});
    v.set("integral double", 2.0);
    v.set("negative zero", -0.0);
    v.set("tiny", 5e-324);
    v.set("huge", 1.7976931348623157e308);
    v.set("third", 1.0 / 3.0);
    v.set("inf", std::numeric_limits<double>::infinity());
    v.set("date", Value(Value::Date{1.25}));
    v.set("infinite date", Value(Value::Date{-std::numeric_limits<double>::infinity()}));
    v.set("uuid", Uuid::random());
    v.set("bytes", Value(Value::Data{0, 0xFF, 0x10, 0x80, 0x00}));
    v.set("nul", std::string("\0\0", 2));
    v.set(std::string("key\0with nul", 12), "\xE2\x82\xAC");
    v.set("nested", Value(Value::Array{nestedWrapperKey, inner, Value::dictionary(), Value::array(),
                                       Value(), Value(false)}));
    for (size_t n = 0; n <= 5; ++n) {  // every base64 padding case
        v.set("data" + std::to_string(n), Value(Value::Data(n, 0xA5)));
    }
    for (int indent : {-1, 4}) {
        auto back = valueFromJson(valueToJson(v, indent));
        ASSERT_TRUE(back);
        EXPECT_TRUE(identical(v, *back)) << valueToJson(v, indent);
    }
}

}  // namespace
}  // namespace berth
