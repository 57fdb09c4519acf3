#include "platform/PropertyList.h"

#include <plist/plist.h>

#include <cmath>
#include <cstdlib>

#include "TestSupport.h"

namespace berth::plist {
namespace {

using Bytes = std::vector<uint8_t>;
using test::identical;

Bytes bytesOf(std::string_view s) {
    return Bytes(s.begin(), s.end());
}

std::optional<Value> parseText(std::string_view s, std::string* why = nullptr,
                               const Limits& limits = {}) {
    const Bytes b = bytesOf(s);
    return parse(b, why, limits);
}

Bytes serialized(const Value& v) {
    std::string why;
    std::optional<Bytes> b = serializeBinary(v, &why);
    EXPECT_TRUE(b) << why;
    return b.value_or(Bytes{});
}

// A tree with every kind a property list holds, with the sizes where the
// encodings change.
Value everyKind() {
    Value ints = Value::array();
    for (uint64_t u : {uint64_t{0}, uint64_t{255}, uint64_t{256}, uint64_t{65535}, uint64_t{65536},
                       uint64_t{0xFFFFFFFF}, uint64_t{1} << 32, uint64_t{INT64_MAX},
                       uint64_t{1} << 63, UINT64_MAX})
        ints.push(u);
    for (int64_t i : {int64_t{-1}, int64_t{-256}, INT64_MIN}) ints.push(i);
    Value nested = Value::dictionary();
    nested.set("empty array", Value::array());
    nested.set("empty dictionary", Value::dictionary());
    nested.set("clé ünïcode \U0001F600", "value");
    Value root = Value::dictionary();
    root.set("integers", ints);
    root.set("reals", Value(Value::Array{Value(0.5), Value(-1e300), Value(0.0), Value(3.25e-10)}));
    root.set("bools", Value(Value::Array{Value(true), Value(false)}));
    root.set("ascii", "sys.kelp.application");
    root.set("long ascii", std::string(70000, 'x'));
    root.set("empty string", "");
    root.set("non-ascii", "h\xC3\xA9llo \xE6\x97\xA5\xE6\x9C\xAC \U0001F600");
    root.set("data", Value(Value::Data{0, 1, 2, 0xFF}));
    root.set("big data", Value(Value::Data(300, 0xAB)));
    root.set("empty data", Value(Value::Data{}));
    root.set("dates", Value(Value::Array{Value(Value::Date{1700000000.25}), Value(Value::Date{0}),
                                         Value(Value::Date{-1e9})}));
    root.set("nested", nested);
    return root;
}

// A binary property list assembled from raw objects, for inputs that no
// writer makes. The trailer starts 32 bytes before the end.
Bytes binaryFile(const std::vector<Bytes>& objects, uint8_t refSize = 1, uint64_t top = 0) {
    Bytes out = bytesOf("bplist00");
    std::vector<uint64_t> offsets;
    for (const Bytes& o : objects) {
        offsets.push_back(out.size());
        out.insert(out.end(), o.begin(), o.end());
    }
    const uint64_t table = out.size();
    const uint8_t offsetSize = table <= 0xFF ? 1 : table <= 0xFFFF ? 2 : 4;
    auto put = [&](uint64_t v, size_t n) {
        for (size_t i = n; i-- > 0;) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
    };
    for (uint64_t o : offsets) put(o, offsetSize);
    out.insert(out.end(), 6, 0);
    out.push_back(offsetSize);
    out.push_back(refSize);
    put(objects.size(), 8);
    put(top, 8);
    put(table, 8);
    return out;
}

// `count` arrays, each holding `fanout` references to the next; the last is
// empty.
Bytes chainOfArrays(size_t count, size_t fanout) {
    const uint8_t refSize = count > 0xFFFF ? 4 : count > 0xFF ? 2 : 1;
    std::vector<Bytes> objects;
    for (size_t i = 0; i + 1 < count; ++i) {
        Bytes o{static_cast<uint8_t>(0xA0 | fanout)};
        for (size_t k = 0; k < fanout; ++k)
            for (size_t b = refSize; b-- > 0;)
                o.push_back(static_cast<uint8_t>((i + 1) >> (8 * b)));
        objects.push_back(o);
    }
    objects.push_back({0xA0});
    return binaryFile(objects, refSize);
}

void expectRejected(const Bytes& file, const std::string& reason, const Limits& limits = {}) {
    std::string why;
    EXPECT_FALSE(parse(file, &why, limits)) << "expected rejection: " << reason;
    EXPECT_EQ(why, reason);
}

TEST(PropertyListTest, EveryKindRoundTripsThroughTheBinaryFormat) {
    const Value original = everyKind();
    std::optional<Value> back = parse(serialized(original));
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, original);
    // Unsigned values above INT64_MAX stay positive; negative ones stay negative.
    const Value::Array& ints = *back->find("integers")->arrayValue();
    EXPECT_TRUE(identical(ints[9], Value(UINT64_MAX)));
    EXPECT_TRUE(identical(ints[10], Value(int64_t{-1})));
    // A value that is not a dictionary is a property list too.
    EXPECT_EQ(*parse(serialized(Value("top"))), Value("top"));
}

TEST(PropertyListTest, WriterUsesTheSmallestIntegerEncodingAndUtf16OnlyWhenNeeded) {
    const struct {
        Value value;
        Bytes object;
    } cases[] = {
        {Value(0), {0x10, 0}},
        {Value(255u), {0x10, 0xFF}},
        {Value(256), {0x11, 1, 0}},
        {Value(65536), {0x12, 0, 1, 0, 0}},
        {Value(uint64_t{1} << 32), {0x13, 0, 0, 0, 1, 0, 0, 0, 0}},
        {Value(-2), {0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE}},
        {Value(uint64_t{1} << 63), {0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0x80, 0, 0, 0, 0, 0, 0, 0}},
        {Value("ab"), {0x52, 'a', 'b'}},
        {Value("\xC3\xA9"), {0x61, 0x00, 0xE9}},
        {Value("\U0001F600"), {0x62, 0xD8, 0x3D, 0xDE, 0x00}},
        {Value(std::string(15, 'z')),
         {0x5F, 0x10, 15, 'z', 'z', 'z', 'z', 'z', 'z', 'z', 'z', 'z', 'z', 'z', 'z', 'z', 'z',
          'z'}},
    };
    for (const auto& c : cases) {
        const Bytes file = serialized(c.value);
        ASSERT_GT(file.size(), 8 + c.object.size());
        EXPECT_EQ(Bytes(file.begin() + 8, file.begin() + 8 + c.object.size()), c.object)
            << c.value.description();
    }
}

TEST(PropertyListTest, WriterIsDeterministicAndStoresEqualStringsOnce) {
    Value a = Value::dictionary(), b = Value::dictionary();
    a.set("k1", "v");
    a.set("k2", Value(Value::Array{Value("v"), Value("k1")}));
    b.set("k2", Value(Value::Array{Value("v"), Value("k1")}));
    b.set("k1", "v");
    const Bytes file = serialized(a);
    EXPECT_EQ(file, serialized(b));
    // dictionary, "k1", "k2", "v", the array: five objects.
    EXPECT_EQ(file[file.size() - 32 + 15], 5);
    EXPECT_EQ(*parse(file), a);
}

TEST(PropertyListTest, WriterRefusesWhatHasNoFormOrWouldNotReadBack) {
    Value deep = Value::array();
    for (int i = 0; i < 300; ++i) deep = Value(Value::Array{deep});
    Value withNull = Value::dictionary();
    withNull.set("n", nullptr);
    const struct {
        Value value;
        const char* reason;
    } cases[] = {
        {withNull, "null has no property-list form"},
        {Value(Value::Array{Value(Uuid::random())}), "UUID has no property-list form"},
        {Value(std::string("\xC3\x28")), "string is not UTF-8"},
        {Value(std::string("\xED\xA0\x80")), "string is not UTF-8"},  // an encoded surrogate
        {deep, "nested too deeply"},
    };
    for (const auto& c : cases) {
        std::string why;
        EXPECT_FALSE(serializeBinary(c.value, &why)) << c.reason;
        EXPECT_EQ(why, c.reason);
    }
}

// ---- binary reader: malformed files

TEST(PropertyListTest, EveryTruncationOfABinaryFileIsRejected) {
    const Bytes file = serialized(everyKind());
    for (size_t n = 0; n < file.size(); n += (n < 200 || file.size() - n < 200) ? 1 : 997) {
        EXPECT_FALSE(parse(std::span(file.data(), n))) << "prefix of " << n << " bytes";
    }
}

TEST(PropertyListTest, BadTrailersAreRejected) {
    const Bytes good = binaryFile({{0xA1, 1}, {0x09}});
    ASSERT_EQ(*parse(good), Value(Value::Array{Value(true)}));
    const size_t t = good.size() - 32;
    auto patched = [&](size_t at, std::initializer_list<uint8_t> bytes) {
        Bytes b = good;
        std::copy(bytes.begin(), bytes.end(), b.begin() + at);
        return b;
    };
    expectRejected(patched(t + 6, {3}), "bad offset size in trailer");
    expectRejected(patched(t + 6, {0}), "bad offset size in trailer");
    expectRejected(patched(t + 7, {16}), "bad reference size in trailer");
    expectRejected(patched(t + 15, {0}), "no objects");
    expectRejected(patched(t + 8, {0, 0, 0, 1}), "too many objects");
    expectRejected(patched(t + 14, {2, 0}), "reference size too small for the object count");
    expectRejected(patched(t + 23, {2}), "top object out of range");
    expectRejected(patched(t + 31, {4}), "bad offset table offset");     // in the header
    expectRejected(patched(t + 24, {0xFF}), "bad offset table offset");  // far past the end
    expectRejected(patched(t + 31, {static_cast<uint8_t>(t)}), "truncated offset table");
    expectRejected(patched(0, {'b', 'p', 'l', 'i', 's', 't', '1', '5'}),
                   "unsupported binary property-list version");
}

TEST(PropertyListTest, OffsetsReferencesAndLengthsOutsideTheFileAreRejected) {
    // Offset entries pointing into the header and into the offset table.
    Bytes intoHeader = binaryFile({{0x09}});
    intoHeader[intoHeader.size() - 33] = 3;
    expectRejected(intoHeader, "object offset out of range");
    Bytes intoTable = binaryFile({{0x09}});
    intoTable[intoTable.size() - 33] = 9;
    expectRejected(intoTable, "object offset out of range");

    expectRejected(binaryFile({{0xA1, 7}, {0x09}}), "object reference out of range");
    expectRejected(binaryFile({{0xD1, 1, 9}, {0x51, 'k'}}), "object reference out of range");
    expectRejected(binaryFile({{0x55, 'a', 'b'}}), "truncated string");
    expectRejected(binaryFile({{0x62, 0, 'a'}}), "truncated string");
    expectRejected(binaryFile({{0x4F, 0x13, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}}),
                   "truncated data");
    expectRejected(binaryFile({{0x4F, 0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}}),
                   "bad object size");                                   // a negative length
    expectRejected(binaryFile({{0x5F, 0x51, 'a'}}), "bad object size");  // the length is no integer
    expectRejected(binaryFile({{0xAF, 0x13, 0x40, 0, 0, 0, 0, 0, 0, 0, 0}}), "truncated container");
    expectRejected(binaryFile({{0x13, 1, 2, 3}}), "truncated integer");
    expectRejected(binaryFile({{0x33, 0, 0}}), "truncated real");
}

TEST(PropertyListTest, ObjectsOutsideTheFormatAreRejected) {
    const struct {
        Bytes object;
        const char* reason;
    } cases[] = {
        {{0x00}, "unsupported object type"},     // null
        {{0x0F}, "unsupported object type"},     // fill
        {{0x80, 1}, "unsupported object type"},  // UID
        {{0xC0}, "unsupported object type"},     // set
        {{0x71, 'a'}, "unsupported object type"},
        {{0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0}, "integer beyond 64 bits"},
        {{0x15, 0}, "bad integer size"},
        {{0x20, 0}, "bad real size"},
        {{0x32, 0, 0, 0, 0}, "bad date size"},
        {{0x52, 'a', 0x80}, "non-ASCII byte in ASCII string"},
        {{0x61, 0xD8, 0x00}, "unpaired surrogate in string"},
        {{0x61, 0xDC, 0x00}, "unpaired surrogate in string"},
        {{0x62, 0xD8, 0x00, 0x00, 0x41}, "unpaired surrogate in string"},
    };
    for (const auto& c : cases) expectRejected(binaryFile({c.object}), c.reason);
    expectRejected(binaryFile({{0xD1, 1, 1}, {0x10, 1}}), "dictionary key is not a string");
    expectRejected(binaryFile({{0xD2, 1, 1, 2, 2}, {0x51, 'k'}, {0x09}}),
                   "repeated dictionary key");
    // 16-byte integers with a zero high half and 4-byte reals are read.
    EXPECT_EQ(*parse(binaryFile({{0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 7}})),
              Value(7));
    EXPECT_EQ(*parse(binaryFile({{0x22, 0x3F, 0xC0, 0, 0}})), Value(1.5));
}

TEST(PropertyListTest, CyclesAreRejectedAndSharedReferencesAreNot) {
    expectRejected(binaryFile({{0xA1, 0}}), "cyclic object reference");
    expectRejected(binaryFile({{0xA1, 1}, {0xD1, 2, 3}, {0x51, 'k'}, {0xA2, 4, 0}, {0x08}}),
                   "cyclic object reference");
    // The same array twice, and twice inside a dictionary: a DAG, not a cycle.
    std::optional<Value> shared = parse(binaryFile(
        {{0xA2, 1, 1}, {0xD2, 2, 3, 4, 4}, {0x51, 'a'}, {0x51, 'b'}, {0xA1, 5}, {0x10, 9}}));
    ASSERT_TRUE(shared);
    Value inner = Value::dictionary();
    inner.set("a", Value(Value::Array{Value(9)}));
    inner.set("b", Value(Value::Array{Value(9)}));
    EXPECT_EQ(*shared, Value(Value::Array{inner, inner}));
}

TEST(PropertyListTest, NestingAndExpansionAreBounded) {
    expectRejected(chainOfArrays(100000, 1), "nested too deeply");
    // A few hundred bytes that would expand to 2^64 values.
    expectRejected(chainOfArrays(64, 2), "too many values");

    Limits small;
    small.maxDepth = 8;
    EXPECT_TRUE(parse(chainOfArrays(8, 1), nullptr, small));
    expectRejected(chainOfArrays(9, 1), "nested too deeply", small);

    // One 1000-byte data object used 100 times.
    std::vector<Bytes> objects{{0xAF, 0x10, 100}};
    objects[0].insert(objects[0].end(), 100, 1);
    objects.push_back({0x4F, 0x11, 0x03, 0xE8});
    objects[1].insert(objects[1].end(), 1000, 0x5A);
    const Bytes fanOut = binaryFile(objects);
    small.maxValueBytes = 99999;
    expectRejected(fanOut, "too much text and data", small);
    small.maxValueBytes = 100000;
    EXPECT_EQ(parse(fanOut, nullptr, small)->size(), 100u);

    small.maxBytes = fanOut.size() - 1;
    expectRejected(fanOut, "input too large", small);
}

// ---- XML reader

TEST(PropertyListTest, XmlReaderAcceptsTheFormsPropertyListsUse) {
    const std::string xml =
        "\xEF\xBB\xBF<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
        "<!-- leading comment -->\n"
        "<!DOCTYPE plist PUBLIC \"-//Kelp//DTD PLIST 1.0//EN\" \"plist.dtd\">\n"
        "<plist version=\"1.0\">\n<dict>\n"
        "  <key>Identifier</key><string>sys.kelp.a &lt;&amp;&gt; &quot;&apos; "
        "&#233;&#x1F600;</string>\n"
        "  <!-- a comment between entries -->\n"
        "  <key>cdata</key><string><![CDATA[<not a tag> & raw]]> tail</string>\n"
        "  <key>empty</key><string/>\n"
        "  <key>ints</key><array><integer>-9223372036854775808</integer>"
        "<integer> 18446744073709551615 </integer><integer>0x1F</integer><integer>+7</integer>"
        "</array>\n"
        "  <key>reals</key><array><real>1e3</real><real>-0.5</real><real>2</real></array>\n"
        "  <key>flags</key><array><true/><false/><true></true></array>\n"
        "  <key>when</key><date>2001-01-01T00:00:00Z</date>\n"
        "  <key>leap</key><date>2024-02-29T12:30:15.5Z</date>\n"
        "  <key>blob</key><data>\n\tAAEC\n\t/w==\n</data>\n"
        "  <key>none</key><data/>\n"
        "  <key></key><dict/>\n"
        "  <key>list</key><array/>\n"
        "</dict>\n</plist>\n<!-- trailing -->\n";
    std::string why;
    std::optional<Value> v = parseText(xml, &why);
    ASSERT_TRUE(v) << why;
    Value expected = Value::dictionary();
    expected.set("Identifier", "sys.kelp.a <&> \"' \xC3\xA9\U0001F600");
    expected.set("cdata", "<not a tag> & raw tail");
    expected.set("empty", "");
    expected.set("ints",
                 Value(Value::Array{Value(INT64_MIN), Value(UINT64_MAX), Value(31), Value(7)}));
    expected.set("reals", Value(Value::Array{Value(1000.0), Value(-0.5), Value(2.0)}));
    expected.set("flags", Value(Value::Array{Value(true), Value(false), Value(true)}));
    expected.set("when", Value(Value::Date{978307200}));
    expected.set("leap", Value(Value::Date{1709209815.5}));
    expected.set("blob", Value(Value::Data{0, 1, 2, 0xFF}));
    expected.set("none", Value(Value::Data{}));
    expected.set("", Value::dictionary());
    expected.set("list", Value::array());
    EXPECT_EQ(*v, expected);
    // A bare value without the <plist> element.
    EXPECT_EQ(*parseText("<array><integer>1</integer></array>"), Value(Value::Array{Value(1)}));
}

TEST(PropertyListTest, XmlReaderRejectsMalformedDocuments) {
    auto doc = [](const std::string& body) {
        return "<plist version=\"1.0\">" + body + "</plist>";
    };
    const struct {
        std::string xml;
        const char* reason;
    } cases[] = {
        {"", "not a property list"},
        {"hello", "not a property list"},
        {"<plist/>", "property list without a value"},
        {doc("<dict><key>a</key></dict>"), "key without value"},
        {doc("<dict><string>a</string></dict>"), "expected a key"},
        {doc("<dict><key>a</key><true/><key>a</key><false/></dict>"), "repeated dictionary key"},
        {doc("<array><string>a</string></dict>"), "mismatched end tag"},
        {doc("<string>a</integer>"), "mismatched end tag"},
        {doc("<array><key>a</key></array>"), "unknown element"},
        {doc("<set/>"), "unknown element"},
        {doc("<integer>18446744073709551616</integer>"), "malformed integer"},
        {doc("<integer>-9223372036854775809</integer>"), "malformed integer"},
        {doc("<integer>12abc</integer>"), "malformed integer"},
        {doc("<integer/>"), "malformed integer"},
        {doc("<real>1.5.2</real>"), "malformed real"},
        {doc("<date>2023-02-29T00:00:00Z</date>"), "malformed date"},
        {doc("<date>2023-13-01T00:00:00Z</date>"), "malformed date"},
        {doc("<date>2023-01-01T00:00:00</date>"), "malformed date"},
        {doc("<data>AAE*</data>"), "malformed base64 data"},
        {doc("<data>A</data>"), "malformed base64 data"},
        {doc("<data>AA==AA</data>"), "malformed base64 data"},
        {doc("<string>&bogus;</string>"), "malformed reference"},
        {doc("<string>&#0;</string>"), "malformed reference"},
        {doc("<string>&#xD800;</string>"), "malformed reference"},
        {doc("<string>a & b</string>"), "malformed reference"},
        {doc("<string>\xC3\x28</string>"), "string is not UTF-8"},
        {doc("<string>a<b/></string>"), "element inside text"},
        {doc("<true>yes</true>"), "text inside boolean"},
        {"<plist><string>open", "unterminated element"},
        {doc("<!-- open <true/>"), "unterminated markup"},
        {doc("<true/>") + "<true/>", "content after the property list"},
        {doc("<true/><true/>"), "expected </plist>"},
        {"<!DOCTYPE plist [<!ENTITY x \"y\">]><plist><true/></plist>",
         "document type with internal subset"},
    };
    for (const auto& c : cases) {
        std::string why;
        EXPECT_FALSE(parseText(c.xml, &why)) << c.xml;
        EXPECT_EQ(why, c.reason) << c.xml;
    }
}

TEST(PropertyListTest, XmlNestingAndCountsAreBounded) {
    for (const char* element : {"array", "dict"}) {
        std::string xml = "<plist>";
        for (int i = 0; i < 100000; ++i)
            xml += std::string("<") + element + ">" + (element[0] == 'd' ? "<key>k</key>" : "");
        std::string why;
        EXPECT_FALSE(parseText(xml, &why));
        EXPECT_EQ(why, "nested too deeply") << element;
    }
    auto nestedArrays = [](int depth) {
        std::string xml;
        for (int i = 0; i < depth; ++i) xml += "<array>";
        for (int i = 0; i < depth; ++i) xml += "</array>";
        return xml;
    };
    Limits small;
    small.maxDepth = 8;
    EXPECT_TRUE(parseText(nestedArrays(8), nullptr, small));
    EXPECT_FALSE(parseText(nestedArrays(9), nullptr, small));
    small.maxDepth = 256;
    small.maxObjects = 3;
    EXPECT_TRUE(parseText("<array><true/><true/></array>", nullptr, small));
    std::string why;
    EXPECT_FALSE(parseText("<array><true/><true/><true/></array>", &why, small));
    EXPECT_EQ(why, "too many values");
}

// ---- libplist as an independent oracle

struct PlistFree {
    void operator()(void* node) const { plist_free(node); }
};
using PlistTree = std::unique_ptr<void, PlistFree>;

// libplist's reading of a tree. It keeps every integer in one unsigned
// 64-bit kind, so integers become UInt64 with the same bits; compare with
// integerBits() of our value.
// One value of a node, read by libplist's getter `get`.
template <class T, class Getter>
T read(plist_t node, Getter get) {
    T value{};
    get(node, &value);
    return value;
}

Value fromLibplist(plist_t node) {
    switch (plist_get_node_type(node)) {
        case PLIST_BOOLEAN:
            return Value(read<uint8_t>(node, plist_get_bool_val) != 0);
        case PLIST_UINT:
            return Value(read<uint64_t>(node, plist_get_uint_val));
        case PLIST_REAL:
            return Value(read<double>(node, plist_get_real_val));
        case PLIST_DATE: {
            int32_t sec, usec;
            plist_get_date_val(node, &sec, &usec);
            return Value(Value::Date{sec + usec / 1e6 + 978307200.0});
        }
        case PLIST_STRING: {
            std::unique_ptr<char, decltype(&std::free)> s(read<char*>(node, plist_get_string_val),
                                                          std::free);
            return Value(s.get());
        }
        case PLIST_DATA: {
            char* d = nullptr;
            uint64_t n = 0;
            plist_get_data_val(node, &d, &n);
            Value v(Value::Data(d, d + n));
            std::free(d);
            return v;
        }
        case PLIST_ARRAY: {
            Value v = Value::array();
            for (uint32_t i = 0; i < plist_array_get_size(node); ++i)
                v.push(fromLibplist(plist_array_get_item(node, i)));
            return v;
        }
        case PLIST_DICT: {
            Value v = Value::dictionary();
            plist_dict_iter it = nullptr;
            plist_dict_new_iter(node, &it);
            char* key = nullptr;
            plist_t item = nullptr;
            for (plist_dict_next_item(node, it, &key, &item); item;
                 plist_dict_next_item(node, it, &key, &item)) {
                v.set(key, fromLibplist(item));
                std::free(key);
                key = nullptr;
            }
            std::free(it);
            return v;
        }
        default:
            ADD_FAILURE() << "unexpected libplist node type";
            return Value();
    }
}

// `v` with every integer replaced by a UInt64 of the same 64 bits.
Value integerBits(const Value& v) {
    if (v.isInteger()) return Value(*v.uint64Value());
    Value out = v;
    if (Value::Array* a = out.arrayValue())
        for (Value& element : *a) element = integerBits(element);
    if (Value::Dictionary* d = out.dictionaryValue())
        for (auto& [key, element] : *d) element = integerBits(element);
    return out;
}

TEST(PropertyListTest, LibplistReadsWhatWeWrite) {
    const Value original = everyKind();
    const Bytes file = serialized(original);
    plist_t raw = nullptr;
    plist_from_bin(reinterpret_cast<const char*>(file.data()), file.size(), &raw);
    PlistTree tree(raw);
    ASSERT_TRUE(tree) << "libplist rejected our file";
    EXPECT_EQ(fromLibplist(tree.get()), integerBits(original));

    // libplist renders its 16-byte integers unsigned and 8-byte ones signed,
    // which shows how we wrote the integers that share their 64 bits.
    char* xml = nullptr;
    uint32_t length = 0;
    plist_to_xml(tree.get(), &xml, &length);
    const std::string text(xml, length);
    plist_to_xml_free(xml);
    EXPECT_NE(text.find("<integer>18446744073709551615</integer>"), std::string::npos);
    EXPECT_NE(text.find("<integer>9223372036854775808</integer>"), std::string::npos);
    EXPECT_NE(text.find("<integer>-1</integer>"), std::string::npos);
    EXPECT_NE(text.find("<integer>-9223372036854775808</integer>"), std::string::npos);
}

TEST(PropertyListTest, WeReadWhatLibplistWritesInBothFormats) {
    PlistTree root(plist_new_dict());
    plist_t list = plist_new_array();
    for (plist_t item : {plist_new_uint(0), plist_new_uint(300), plist_new_uint(uint64_t{1} << 40),
                         plist_new_uint(static_cast<uint64_t>(-42)), plist_new_real(-2.75e-3),
                         plist_new_bool(1), plist_new_dict(), plist_new_array()})
        plist_array_append_item(list, item);
    plist_dict_set_item(root.get(), "list", list);
    plist_dict_set_item(root.get(), "ascii", plist_new_string("sys.kelp.berth"));
    plist_dict_set_item(root.get(), "text <&>", plist_new_string("\xC3\xA9t\xC3\xA9 \U0001F600"));
    plist_dict_set_item(root.get(), "long", plist_new_string(std::string(40, 'q').c_str()));
    std::string blob;
    for (int i = 0; i < 200; ++i) blob += static_cast<char>(i * 7);
    plist_dict_set_item(root.get(), "blob", plist_new_data(blob.data(), blob.size()));
    plist_dict_set_item(root.get(), "when", plist_new_date(722000000, 0));

    char* out = nullptr;
    uint32_t length = 0;
    plist_to_bin(root.get(), &out, &length);
    const Bytes binary(out, out + length);
    plist_to_bin_free(out);
    plist_to_xml(root.get(), &out, &length);
    const Bytes xml(out, out + length);
    plist_to_xml_free(out);

    for (const Bytes* file : {&binary, &xml}) {
        std::string why;
        std::optional<Value> v = parse(*file, &why);
        ASSERT_TRUE(v) << why;
        EXPECT_EQ(integerBits(*v), fromLibplist(root.get()));
        // libplist's 8-byte integers are signed.
        EXPECT_EQ((*v->find("list")->arrayValue())[3], Value(-42));
        // What we read, we write again unchanged.
        EXPECT_EQ(*parse(serialized(*v)), *v);
    }
}

}  // namespace
}  // namespace berth::plist
