// SPDX-License-Identifier: Apache-2.0
// Property lists: values, the bytes of the binary form (derived by hand, read and written), the XML form, and bytes of
// both that want to crash the reader, keep it busy or fill the memory.
#include "plist/Codec.h"
#include "support/Allocations.h"

#include <cmath>
#include <gtest/gtest.h>
#include <limits>
#include <random>

namespace zor::plist::test {
namespace {

using Objects = std::vector<Data>;

Data bytesOf(std::string_view text) {
    return {text.begin(), text.end()};
}

Data operator+(Data left, const Data& right) {
    left.insert(left.end(), right.begin(), right.end());
    return left;
}

/// The place in a trailer that says something else than the truth.
struct Frame {
    std::uint64_t root = 0;
    std::size_t offsetWidth = 1;
    std::size_t referenceWidth = 1;
};

/// Magic, the objects as they are given, a true offset table, and the trailer.
Data assemble(const Objects& objects, const Frame& frame = {}) {
    Data out = bytesOf("bplist00");
    const auto put = [&out](std::uint64_t number, std::size_t width) {
        for (std::size_t i = width; i-- > 0;)
            out.push_back(i < 8 ? static_cast<std::uint8_t>(number >> (8 * i)) : 0);
    };
    std::vector<std::size_t> offsets;
    for (const Data& object : objects) {
        offsets.push_back(out.size());
        out = out + object;
    }
    const std::size_t table = out.size();
    for (const std::size_t offset : offsets)
        put(offset, frame.offsetWidth);
    put(frame.offsetWidth, 7);
    put(frame.referenceWidth, 1);
    for (const std::uint64_t number : {std::uint64_t{objects.size()}, frame.root, std::uint64_t{table}})
        put(number, 8);
    return out;
}

/// `depth` arrays inside each other.
Value nestedArrays(std::size_t depth) {
    Value value(Array{});
    for (std::size_t i = 1; i < depth; ++i)
        value = Value(Array{std::exchange(value, {})});
    return value;
}

/// Offsets are as wide as that of the table needs, which is the highest.
Data wholeListOf(const Data& object) {
    return assemble({object}, {.offsetWidth = object.size() < 248 ? 1U : 2U});
}

/// Scalars, and their object bytes derived by hand.
const std::vector<std::pair<Value, Data>>& scalars() {
    constexpr auto least = std::numeric_limits<std::int64_t>::min();
    constexpr auto most = std::numeric_limits<std::int64_t>::max();
    constexpr double nan = std::numeric_limits<double>::quiet_NaN();
    static const std::vector<std::pair<Value, Data>> rows = {
        {false, {0x08}},
        {true, {0x09}},
        {255, {0x10, 0xFF}},
        {256, {0x11, 0x01, 0x00}},
        {std::uint32_t{0xFFFFFFFF}, {0x12, 0xFF, 0xFF, 0xFF, 0xFF}},
        {std::int64_t{1} << 32, {0x13, 0, 0, 0, 1, 0, 0, 0, 0}},
        {-1, {0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
        {least, {0x13, 0x80, 0, 0, 0, 0, 0, 0, 0}},
        {most, {0x13, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
        {std::uint64_t{1} << 63, {0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0x80, 0, 0, 0, 0, 0, 0, 0}},
        {~std::uint64_t{0}, {0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
        {1.5, {0x23, 0x3F, 0xF8, 0, 0, 0, 0, 0, 0}},
        {nan, {0x23, 0x7F, 0xF8, 0, 0, 0, 0, 0, 0}},
        {Date{1.0}, {0x33, 0x3F, 0xF0, 0, 0, 0, 0, 0, 0}},
        {"", {0x50}},
        {"abcdefghijklmn", Data{0x5E} + bytesOf("abcdefghijklmn")},
        {"abcdefghijklmno", Data{0x5F, 0x10, 0x0F} + bytesOf("abcdefghijklmno")},
        {std::string(300, 'x'), Data{0x5F, 0x11, 0x01, 0x2C} + Data(300, 'x')},
        {"\u00E9", {0x61, 0x00, 0xE9}},
        {"a\U0001F600", {0x63, 0x00, 0x61, 0xD8, 0x3D, 0xDE, 0x00}},
        {"\U0010FFFF", {0x62, 0xDB, 0xFF, 0xDF, 0xFF}},
        {Data{1, 2, 3}, {0x43, 1, 2, 3}},
        {Array{}, {0xA0}},
        {Dictionary{}, {0xD0}}};
    return rows;
}

/// A value, or a reason inside the input.
std::expected<Value, ReadError> judged(std::expected<Value, ReadError> read, std::size_t size) {
    EXPECT_TRUE(read || (*read.error().reason != '\0' && read.error().offset <= size));
    return read;
}

/// Reads under watch, in memory that the input pays for. The factor of two and the constant are the allocator's
/// rounding and the reader itself.
std::expected<Value, ReadError> readWatched(const Data& bytes) {
    const support::MemoryWatch watch;
    auto read = readBinary(bytes);
    EXPECT_LE(watch.peakBytes(), 2 * memoryBytesMax(bytes.size()) + 1024);
    return judged(std::move(read), bytes.size());
}

/// `levels` containers, each holding the next `fanOut` times; the last holds a boolean as often.
Data laughs(std::size_t levels, std::size_t fanOut) {
    Objects objects;
    for (std::size_t level = 1; level <= levels; ++level)
        objects.push_back(Data{static_cast<std::uint8_t>(0xA0 + fanOut)} +
                          Data(fanOut, static_cast<std::uint8_t>(level)));
    objects.push_back({0x09});
    return assemble(objects, {.offsetWidth = 2});
}

constexpr const char* documentType =
    "<!DOCTYPE plist PUBLIC \"-//Example//DTD PLIST 1.0//EN\" \"http://localhost:1/PropertyList-1.0.dtd\">\n";

std::string inPlist(const std::string& body) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n" + std::string(documentType) + "<plist version=\"1.0\">" +
           body + "</plist>\n";
}

std::expected<Value, ReadError> read(const std::string& text) {
    return judged(readPropertyList(bytesOf(text)), text.size());
}

std::string repeated(const std::string& part, std::size_t times) {
    std::string result;
    while (times-- > 0)
        result += part;
    return result;
}

void expectReason(const std::expected<Value, ReadError>& result, const char* reason) {
    ASSERT_FALSE(result) << reason;
    EXPECT_NE(std::string(result.error().reason).find(reason), std::string::npos)
        << reason << " but " << result.error().text();
}

// Goal: a scalar has exactly the bytes of the format. Method: hand-derived object bytes, both directions.
TEST(BinaryForm, ScalarsBothWays) {
    for (const auto& [value, object] : scalars()) {
        const Data whole = wholeListOf(object);
        EXPECT_TRUE(writeBinary(value) == whole) << describe(&value);
        const auto read = readBinary(whole);
        EXPECT_TRUE(read && *read == value) << describe(&value);
    }
}

// Goal: a whole file is right to the byte, and follows what a buffer already holds; no part of it passes for one.
// Method: one message, by hand. Damaged ones are the fuzz target's.
TEST(BinaryForm, WholeMessageBothWays) {
    const Value message(Dictionary{{"b", Array{Value(true), Value("x")}}, {"a", 7}});
    const Data expected = bytesOf("bplist00") + Data{0xD2, 1, 3, 2, 4} + // at 8: two keys, two values
                          Data{0x51, 'a'} + Data{0x10, 7} +              // at 13, 15
                          Data{0x51, 'b'} + Data{0xA2, 5, 6} +           // at 17, 19
                          Data{0x09} + Data{0x51, 'x'} +                 // at 22, 23
                          Data{8, 13, 15, 17, 19, 22, 23} +              // at 25: the table
                          Data{0, 0, 0, 0, 0, 0, 1, 1} + Data{0, 0, 0, 0, 0, 0, 0, 7} + Data(8, 0) +
                          Data{0, 0, 0, 0, 0, 0, 0, 25};
    Data buffer{0xAA, 0xBB};
    ASSERT_TRUE(appendBinary(message, buffer));
    EXPECT_EQ(buffer, Data({0xAA, 0xBB}) + expected);
    const auto read = readBinary(expected);
    ASSERT_TRUE(read) << read.error().text();
    EXPECT_EQ(*read, message);
    for (std::size_t length = 0; length < expected.size(); ++length)
        EXPECT_FALSE(readWatched({expected.begin(), expected.begin() + static_cast<std::ptrdiff_t>(length)})) << length;
}

// Goal: forms that only other writers make are read. Method: objects by hand, with the value they stand for: a real of
// four bytes, a small number in 16 bytes, a short count spelled out, ASCII in UTF-16; a root that is not the first,
// other widths, one string as key and values, a shared empty container, and a key that comes twice: the later counts.
TEST(BinaryForm, FormsOfOtherWriters) {
    const std::pair<Data, Value> rows[] = {
        {wholeListOf({0x22, 0x3F, 0xC0, 0, 0}), 1.5},
        {wholeListOf(Data{0x14} + Data(15, 0) + Data{9}), 9},
        {wholeListOf({0x5F, 0x13, 0, 0, 0, 0, 0, 0, 0, 1, 'a'}), "a"},
        {wholeListOf({0x61, 0, 'a'}), "a"},
        {assemble({{0x08}, {0xA1, 0}}, {.root = 1}), Array{Value(false)}},
        {assemble({{0xA1, 0, 0, 1}, {0x09}}, {.offsetWidth = 8, .referenceWidth = 3}), Array{Value(true)}},
        {assemble({{0xD1, 1, 2}, {0x51, 'k'}, {0xA2, 1, 1}}), Dictionary{{"k", Array{Value("k"), Value("k")}}}},
        {assemble({{0xA2, 1, 1}, {0xD0}}), Array{Value(Dictionary{}), Value(Dictionary{})}},
        {assemble({{0xD3, 1, 2, 1, 3, 3, 4}, {0x51, 'z'}, {0x51, 'a'}, {0x10, 1}, {0x10, 2}}),
         Dictionary{{"a", 1}, {"z", 2}}}};
    for (const auto& [bytes, value] : rows) {
        const auto read = readBinary(bytes);
        EXPECT_TRUE(read && *read == value) << describe(&value);
    }
}

// Goal: what cannot be read back is not written, and the caller's buffer stays as it was. Method: strings that are no
// UTF-8 (cut off, overlong, surrogates, above the last character) or hold NUL, and too deep a value.
TEST(BinaryForm, RefusesToWrite) {
    using namespace std::string_literals;
    std::vector<Value> values = {Dictionary{{"\xFF", 1}}, Array{Value("fine"), Value("\xFF")}, nestedArrays(65)};
    for (const std::string& text : {"\xC3"s, "a\x80"s, "\xC0\xAF"s, "\xE0\x9F\xBF"s, "\xF0\x8F\xBF\xBF"s,
                                    "\xED\xA0\x80"s, "\xF4\x90\x80\x80"s, "a\0b"s, "\u00E9\0"s})
        values.emplace_back(text);
    for (const Value& value : values) {
        Data buffer{1, 2, 3};
        const auto done = appendBinary(value, buffer);
        EXPECT_TRUE(!done && *done.error().reason != '\0') << describe(&value);
        EXPECT_EQ(buffer, Data({1, 2, 3}));
    }
}

Value randomValue(std::mt19937& random, int depth = 0) {
    const std::size_t kind = random() % (depth < 5 ? 9 : 7);
    const auto scalar = [&]() -> const Value& { return scalars()[random() % scalars().size()].first; };
    if (kind < 7)
        return scalar();
    Array values;
    Dictionary entries;
    for (std::size_t i = random() % 20; i > 0; --i) {
        if (kind == 7)
            values.push_back(randomValue(random, depth + 1));
        else
            entries.set(describe(&scalar()), randomValue(random, depth + 1));
    }
    return kind == 7 ? Value(values) : Value(entries);
}

// Goal: any value survives, and equal values have equal bytes. Method: seeded random trees of the scalars, written,
// read, written again; arrays on both sides of the counts at which offsets and references grow.
TEST(BinaryForm, RoundTrips) {
    std::vector<Value> values;
    for (std::mt19937 random(1); values.size() < 1000;)
        values.push_back(randomValue(random));
    for (const std::size_t count : {254U, 255U, 65534U, 65535U})
        values.emplace_back(Array(count, Value(true)));
    for (const Value& value : values) {
        const auto written = writeBinary(value);
        ASSERT_TRUE(written);
        const auto read = readBinary(*written);
        ASSERT_TRUE(read && *read == value) << describe(&value);
        ASSERT_TRUE(*writeBinary(*read) == *written);
    }
}

// Goal: each refusal has its own reason. Method: a table of reasons, each with broken lists.
TEST(BinaryHostile, RefusedWithAReason) {
    const Data boolean{0x09};
    const Data mostBytes{0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF};
    const struct {
        const char* reason;
        std::vector<Data> files;
    } files[] = {
        {"not a binary", {{}}},
        {"version 00", {bytesOf("bplist16 and much more that is long enough for a trailer")}},
        {"too short", {bytesOf("bplist00"), assemble({})}},
        {"width", {assemble({boolean}) + Data{0}}},
        {"width of an offset",
         {assemble({boolean, boolean}, {.offsetWidth = 0}), assemble({boolean}, {.offsetWidth = 9})}},
        {"width of a reference",
         {assemble({boolean}, {.referenceWidth = 0}), assemble({boolean}, {.referenceWidth = 9})}},
        {"does not exist", {assemble({boolean}, {.root = 1}), assemble({boolean}, {.root = ~std::uint64_t{0}})}},
        {"more memory", {laughs(10, 10), laughs(60, 14)}},
    };
    const struct {
        const char* reason;
        std::vector<Objects> lists;
    } lists[] = {
        {"does not exist", {{{0xA1, 7}}}},
        {"null or fill", {{{0x00}}, {{0x0F}}}},
        // UID, set, ordered set, unknown.
        {"type", {{{0x80, 1}}, {{0xC1, 1}, boolean}, {{0xB1, 1}, boolean}, {{0x70}}}},
        {"more than 16", {{{0x15}, Data(32, 0)}}},
        {"does not fit", {{{0x14}, {0, 0, 0, 0, 0, 0, 0, 1}, Data(8, 0)}, {{0x14}, Data(16, 0xFF)}}},
        {"neither", {{{0x20, 0}}}},
        {"not 8 bytes", {{{0x32, 0, 0, 0, 0}}}},
        // Integer, real, date, data, two counts, UTF-16, array, dictionary.
        {"cut off", {{{0x13, 0, 0, 0, 0, 0, 0}}, {{0x23, 0}}, {{0x33, 0}}, {{0x42, 0}}, {{0x5F}}, {{0x5F, 0x12, 0}}}},
        {"cut off", {{{0x62, 0, 'a', 0}}, {{0xA2, 0}}, {{0xD1, 0}}}},
        // Data and an array as long as memory, UTF-16 and a dictionary whose bytes overflow.
        {"cut off",
         {{{0x4F, 0x13}, mostBytes},
          {{0xAF, 0x13, 0x1F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
          {{0x6F, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0}},
          {{0xDF, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 1, 0, 0}}}},
        {"a count that is no integer", {{{0x5F, 0x14}, Data(16, 0)}, {{0x5F, 0x51, 'a'}}}},
        {"above 127", {{{0x51, 0x80}}, {{0x5B}, bytesOf("0123456789\xFF")}}},
        {"NUL", {{{0x53, 'a', 0, 'b'}}, {{0x59, 'a', 'b', 0}, bytesOf("cdefgh")}, {{0x62, 0, 'a', 0, 0}}}},
        // A high one at the end, before another object and before a letter, a low one first.
        {"surrogate", {{{0x61, 0xD8, 0}}, {{0x61, 0xD8, 0}, {0xDC, 0}}}},
        {"surrogate", {{{0x62, 0xD8, 0, 0, 'a'}}, {{0x62, 0xDC, 0, 0xD8, 0}}}},
        {"key", {{{0xD1, 1, 1}, {0x10, 1}}, {{0xD1, 0, 0}}}},
        {"contains itself", {{{0xA1, 0}}, {{0xD1, 1, 2}, {0x51, 'k'}, {0xA1, 0}}}},
    };
    for (const auto& row : files)
        for (const Data& file : row.files)
            expectReason(readWatched(file), row.reason);
    for (const auto& row : lists)
        for (const Objects& list : row.lists)
            expectReason(readWatched(assemble(list)), row.reason);
}

// Goal: nothing shared multiplies: payload, or members of a long list, pay for themselves each time. Method: one long
// object of each kind with payload, referred to very often, and an array of one boolean, which may be long when it is
// not one.
TEST(BinaryHostile, SharedPayload) {
    for (const std::uint8_t marker : {0x4F, 0x5F, 0x6F}) {
        const Data payload = Data{marker, 0x11, 0x0F, 0xA0} + Data(marker == 0x6F ? 8000 : 4000, 'a');
        for (const std::size_t references : {2U, 4000U}) {
            const Data array{0xAF, 0x11, static_cast<std::uint8_t>(references >> 8),
                             static_cast<std::uint8_t>(references)};
            const auto read = readWatched(assemble({array + Data(references, 1), payload}, {.offsetWidth = 2}));
            EXPECT_EQ(read.has_value(), references == 2) << int{marker} << ", " << references;
        }
    }
    constexpr std::size_t count = 200'000;
    const Data array = Data{0xAF, 0x12, 0, 0x03, 0x0D, 0x40} + Data(count, 1);
    EXPECT_FALSE(readWatched(assemble({array, {0x09}}, {.offsetWidth = 4})));
    EXPECT_TRUE(readWatched(*writeBinary(Array(count, Value(true)))));
}

// Goal: 64 containers in each other are read and written, 65 are not. Method: chains of arrays in both directions.
TEST(BinaryHostile, NestingLimit) {
    EXPECT_EQ(*readBinary(*writeBinary(nestedArrays(nestingMax))), nestedArrays(nestingMax));
    for (const std::size_t depth : {64U, 65U, 200U}) {
        Objects objects;
        for (std::size_t i = 1; i < depth; ++i)
            objects.push_back({0xA1, static_cast<std::uint8_t>(i)});
        objects.push_back({0xA0});
        const auto read = readWatched(assemble(objects, {.offsetWidth = 2}));
        EXPECT_EQ(read.has_value(), depth <= nestingMax) << depth;
    }
}

// Goal: each element means what it says. Method: a table of bodies and values.
TEST(Xml, Values) {
    constexpr auto least = std::numeric_limits<std::int64_t>::min();
    const struct {
        const char* body;
        Value value;
    } rows[] = {
        {"<true/>", true},
        {"<integer> +7\n</integer>", 7},
        {"<integer>-9223372036854775808</integer>", least},
        {"<integer>18446744073709551615</integer>", ~std::uint64_t{0}},
        {"<integer>0xfF</integer>", 255},
        {"<integer>-0x10</integer>", -16},
        {"<real>-1.5e3</real>", -1500.0},
        {"<real>nan</real>", std::nan("")},
        {"<string> a\n&lt;&amp;&gt;&quot;&apos;&#233;&#x1F600;<![CDATA[<&]]><!-- no --></string>",
         " a\n<&>\"'\u00E9\U0001F600<&"},
        {"<date>2001-01-01T00:00:00Z</date>", Date{0}},
        {"<date>2000-02-29T23:59:59Z</date>", Date{-26438401}},
        {"<date>0001-01-01T00:00:00Z</date>", Date{-63113904000}},
        {"<data>\n\tAA==\n</data>", Data{0}},
        {"<data>AAEC\nAw = =</data>", Data{0, 1, 2, 3}},
        {"<data>+/8=</data>", Data{0xFB, 0xFF}},
        {"<array><integer>1</integer> <array/>\n<dict/></array>", Array{Value(1), Value(Array{}), Value(Dictionary{})}},
        {"<dict><key>b</key><true/><key></key><string>empty</string><key>b</key><dict><key>c</key><real>1</real>"
         "</dict></dict>",
         Dictionary{{"", "empty"}, {"b", Dictionary{{"c", 1.0}}}}},
    };
    for (const auto& row : rows) {
        const auto value = read(inPlist(row.body));
        ASSERT_TRUE(value) << row.body << ": " << value.error().text();
        EXPECT_EQ(*value, row.value) << row.body << " is " << describe(&*value);
    }
    // The document type is optional, and the declaration may name another encoding.
    EXPECT_EQ(*read("<plist><string>a</string></plist>"), Value("a"));
    EXPECT_EQ(*read("<?xml version='1.0' encoding='ISO-8859-1'?><plist><string>\xE9</string></plist>"),
              Value("\u00E9"));
    EXPECT_EQ(*read("\xEF\xBB\xBF<plist><true/></plist>"), Value(true));
    // The first bytes decide the form.
    EXPECT_EQ(*readPropertyList(assemble({{0x09}})), Value(true));
    expectReason(read("bplist17"), "version");
}

// Goal: everything else is refused with a reason. Method: tables of contents of an element, of bodies and of documents.
TEST(Xml, RefusedBodies) {
    const std::pair<std::string, std::vector<std::string>> contents[] = {
        {"integer", {"", "1.0", "--1", "+-1", "0x", "0x-1", "1 2", "\u0661"}},
        {"integer", {"18446744073709551616", "-9223372036854775809"}},
        {"real", {"", "1,5", "+-1", "0x1p3", "1e999"}},
        {"date", {"2001-01-01", "2001-02-29T00:00:00Z", "2001-13-01T00:00:00Z", "2001-01-01T24:00:00Z"}},
        {"date", {"2001-01-01T00:00:60Z", "2001-01-01T00:00:00+0", "+001-01-01T00:00:00Z"}},
        {"data", {"A", "AA", "AA=", "AA===", "AA==AA==", "====", "A-__"}},
        {"dict", {"a", "<true/>", "<key>a</key>", "<key>a</key><key>b</key><true/>", "<key>a</key><true/><true/>"}},
        {"string", {"\x01", "&#0;", "&#xD800;", "\xC0\xAF", "\xED\xA0\x80", "\xFF", "&undefined;"}},
        {"string", {std::string(1, '\0'), "<string>a</string>"}},
        {"array", {"<key>a</key>"}},
        {"true", {"yes"}},
        {"plist", {"<true/>"}},
    };
    for (const auto& [element, texts] : contents)
        for (const std::string& text : texts)
            EXPECT_FALSE(read(inPlist("<" + element + ">" + text + "</" + element + ">"))) << element << ": " << text;
    for (const char* body : {"", "text", "<true/><true/>", "<true/>text", "<null/>", "<x:dict/>", "<key>a</key>",
                             "<string id='1'>a</string>", "<real>1 </real >2", "<string>a", "<array>", "</array>"})
        EXPECT_FALSE(read(inPlist(body))) << body;
    for (const char* document :
         {"", " ", "plist", "<dict/>", "<plist/>", "<plist><true/></plist><plist><true/></plist>",
          "<plist><true/></plist>trailing", "<?xml version='1.0' encoding='utf-7'?><plist><true/></plist>"})
        EXPECT_FALSE(read(document)) << document;
}

// Goal: nothing can be declared, so nothing can grow or be fetched. Method: the known attacks, each refused before its
// first entity is used; the reason shows which door was closed.
TEST(Xml, EntityAttacks) {
    const std::string use = "]><plist><string>&a;</string></plist>";
    const std::string declarations[] = {
        "<!ENTITY a 'x'>",
        "<!ENTITY b 'ha'><!ENTITY a '&b;&b;&b;&b;&b;&b;&b;&b;'>",
        "<!ENTITY a '" + std::string(100000, 'x') + "'>",
        "<!ENTITY a SYSTEM 'file:///etc/passwd'>",
        "<!ENTITY % p SYSTEM 'file:///etc/passwd'> %p;",
        "<!ATTLIST plist version CDATA '&a;'>",
    };
    for (const std::string& declaration : declarations)
        expectReason(read("<!DOCTYPE plist [" + declaration + use), "declarations");
    expectReason(read("<!DOCTYPE plist []><plist><true/></plist>"), "declarations");
    // With a document type that is not read, the parser by itself would leave this one out of the text.
    expectReason(read(documentType + use.substr(2)), "not predefined");
    expectReason(read(use.substr(2)), "undefined entity");
}

// Goal: depth, length and count are bounded. Method: documents on both sides of the limit, memory watched.
TEST(Xml, Limits) {
    for (const std::size_t depth : {64U, 65U, 100000U}) {
        for (const auto& [open, close] :
             {std::pair("<array>", "</array>"), std::pair("<dict><key>k</key>", "</dict>")}) {
            // A dictionary's key needs a value, the innermost one too.
            const auto result = read(inPlist(repeated(open, depth) + "<true/>" + repeated(close, depth)));
            EXPECT_EQ(result.has_value(), depth <= 64) << open << depth;
        }
    }
    const std::string wide = inPlist("<array>" + repeated("<true/>", 100000) + "</array>");
    const support::MemoryWatch watch;
    EXPECT_TRUE(readXml(bytesOf(wide)));
    EXPECT_LE(watch.peakBytes(), 32 * wide.size());

    expectReason(read(inPlist("<string>" + std::string(16U << 20, 'x') + "</string>")), "too long");
}

} // namespace
} // namespace zor::plist::test
