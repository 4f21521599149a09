// SPDX-License-Identifier: Apache-2.0
// The XML form: what it says, what it must not say, and what damage does to it.
#include "plist/Xml.h"
#include "plist/Read.h"
#include "plist/Samples.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>

namespace zor::plist::test {

namespace {

constexpr const char* documentType =
    "<!DOCTYPE plist PUBLIC \"-//Example//DTD PLIST 1.0//EN\" \"http://localhost:1/PropertyList-1.0.dtd\">\n";

std::string inPlist(const std::string& body) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n" + std::string(documentType) + "<plist version=\"1.0\">" +
           body + "</plist>\n";
}

std::expected<Value, ReadError> read(const std::string& text) {
    const Data bytes = bytesOf(text);
    auto result = readPropertyList(bytes);
    if (!result) {
        EXPECT_STRNE(result.error().reason, "");
        EXPECT_LE(result.error().offset, bytes.size());
    }
    return result;
}

std::string repeated(const std::string& part, std::size_t times) {
    std::string result;
    while (times-- > 0)
        result += part;
    return result;
}

} // namespace

// Goal: each element means what it says. Method: a table of bodies and values.
TEST(Xml, Values) {
    constexpr auto least = std::numeric_limits<std::int64_t>::min();
    const struct {
        const char* body;
        Value value;
    } rows[] = {
        {"<true/>", true},
        {"<false></false>", false},
        {"<integer>42</integer>", 42},
        {"<integer> +7\n</integer>", 7},
        {"<integer>-9223372036854775808</integer>", least},
        {"<integer>18446744073709551615</integer>", ~std::uint64_t{0}},
        {"<integer>0xfF</integer>", 255},
        {"<integer>-0x10</integer>", -16},
        {"<integer>0xFFFFFFFFFFFFFFFF</integer>", ~std::uint64_t{0}},
        {"<real>-1.5e3</real>", -1500.0},
        {"<real>+inf</real>", std::numeric_limits<double>::infinity()},
        {"<real>nan</real>", std::nan("")},
        {"<string/>", ""},
        {"<string> a\n&lt;&amp;&gt;&quot;&apos;&#233;&#x1F600;<![CDATA[<&]]><!-- no --></string>",
         " a\n<&>\"'\u00E9\U0001F600<&"},
        {"<date>2001-01-01T00:00:00Z</date>", Date{0}},
        {"<date>2000-02-29T23:59:59Z</date>", Date{-26438401}},
        {"<date>2026-11-24T10:15:30Z</date>", Date{817208130}},
        {"<date>0001-01-01T00:00:00Z</date>", Date{-63113904000}},
        {"<data/>", Data{}},
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
}

// Goal: everything else is refused with a reason. Method: a table of bodies.
TEST(Xml, RefusedBodies) {
    const std::string rows[] = {
        "",
        "text",
        "<true/><true/>",
        "<true/>text",
        "<null/>",
        "<plist><true/></plist>",
        "<x:dict/>",
        "<true>yes</true>",
        "<string id='1'>a</string>",
        "<string><string>a</string></string>",
        "<integer></integer>",
        "<integer>1.0</integer>",
        "<integer>--1</integer>",
        "<integer>+-1</integer>",
        "<integer>0x</integer>",
        "<integer>0x-1</integer>",
        "<integer>1 2</integer>",
        "<integer>18446744073709551616</integer>",
        "<integer>-9223372036854775809</integer>",
        "<integer>\u0661</integer>",
        "<real></real>",
        "<real>1,5</real>",
        "<real>+-1</real>",
        "<real>0x1p3</real>",
        "<real>1e999</real>",
        "<real>1 </real >2",
        "<date>2001-01-01</date>",
        "<date>2001-02-29T00:00:00Z</date>",
        "<date>2001-13-01T00:00:00Z</date>",
        "<date>2001-01-01T24:00:00Z</date>",
        "<date>2001-01-01T00:00:60Z</date>",
        "<date>2001-01-01T00:00:00+0</date>",
        "<date>+001-01-01T00:00:00Z</date>",
        "<data>A</data>",
        "<data>AA</data>",
        "<data>AA=</data>",
        "<data>AA===</data>",
        "<data>AA==AA==</data>",
        "<data>====</data>",
        "<data>A-__</data>",
        "<dict><true/></dict>",
        "<dict><key>a</key></dict>",
        "<dict><key>a</key><key>b</key><true/></dict>",
        "<dict><key>a</key><true/><true/></dict>",
        "<array><key>a</key></array>",
        "<key>a</key>",
        "<dict>a</dict>",
        "<string>\x01</string>",
        "<string>&#0;</string>",
        "<string>&#xD800;</string>",
        "<string>\xC0\xAF</string>",
        "<string>\xED\xA0\x80</string>",
        "<string>\xFF</string>",
        std::string("<string>\0</string>", 18),
        "<string>&undefined;</string>",
        "<string>a",
        "<array>",
        "</array>",
    };
    for (const std::string& body : rows)
        EXPECT_FALSE(read(inPlist(body))) << body;
    for (const char* document :
         {"", " ", "plist", "<dict/>", "<plist/>", "<plist><true/></plist><plist><true/></plist>",
          "<plist><true/></plist>trailing", "<?xml version='1.0' encoding='utf-7'?><plist><true/></plist>"})
        EXPECT_FALSE(read(document)) << document;
}

// Goal: nothing can be declared, so nothing can grow or be fetched. Method: the known attacks, each refused before its
// first entity is used; the reason shows which door was closed.
TEST(Xml, EntityAttacks) {
    const std::string use = "<plist><string>&a;</string></plist>";
    const struct {
        const char* name;
        std::string document;
        const char* reason;
    } rows[] = {
        {"internal", "<!DOCTYPE plist [<!ENTITY a 'x'>]>" + use, "declarations"},
        {"laughs", "<!DOCTYPE plist [<!ENTITY b 'ha'><!ENTITY a '&b;&b;&b;&b;&b;&b;&b;&b;'>]>" + use, "declarations"},
        {"quadratic", "<!DOCTYPE plist [<!ENTITY a '" + std::string(100000, 'x') + "'>]>" + use, "declarations"},
        {"a file", "<!DOCTYPE plist [<!ENTITY a SYSTEM 'file:///etc/passwd'>]>" + use, "declarations"},
        {"parameter", "<!DOCTYPE plist [<!ENTITY % p SYSTEM 'file:///etc/passwd'> %p;]>" + use, "declarations"},
        {"attribute default", "<!DOCTYPE plist [<!ATTLIST plist version CDATA '&a;'>]>" + use, "declarations"},
        {"empty subset", "<!DOCTYPE plist []><plist><true/></plist>", "declarations"},
        // With a document type that is not read, the parser by itself would leave this one out of the text.
        {"undeclared", std::string(documentType) + use, "not predefined"},
        {"undeclared, no document type", use, "undefined entity"},
    };
    for (const auto& row : rows) {
        const auto result = read(row.document);
        ASSERT_FALSE(result) << row.name;
        EXPECT_NE(std::string(result.error().reason).find(row.reason), std::string::npos)
            << row.name << ": " << result.error().text();
    }
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
    const MemoryWatch watch;
    EXPECT_TRUE(readXml(bytesOf(wide)));
    EXPECT_LE(watch.peakBytes(), 32 * wide.size());

    const std::string tooLong = inPlist("<string>" + std::string(16U << 20, 'x') + "</string>");
    const auto refused = read(tooLong);
    ASSERT_FALSE(refused);
    EXPECT_NE(std::string(refused.error().reason).find("too long"), std::string::npos);
}

// Goal: no cut and no changed byte does harm. Method: every cut, and every bit of every byte, of one full document.
TEST(Xml, SystematicDamage) {
    const std::string whole = inPlist(
        "<dict><key>a</key><array><integer>1</integer><real>2</real><true/></array><key>\u00E9</key><data>AAEC</data>"
        "<key>d</key><date>2001-01-01T00:00:00Z</date></dict>");
    ASSERT_TRUE(read(whole));
    for (std::size_t length = 0; length < whole.size() - 1; ++length)
        ASSERT_FALSE(read(whole.substr(0, length))) << length;
    for (std::size_t at = 0; at < whole.size(); ++at) {
        for (const int bits : {1, 2, 4, 8, 16, 32, 64, 128, 255}) {
            std::string damaged = whole;
            damaged[at] = static_cast<char>(damaged[at] ^ bits);
            (void)read(damaged);
        }
    }
}

// Goal: the first bytes decide the form. Method: one of each, and a binary one of an unknown version.
TEST(Xml, EitherForm) {
    EXPECT_EQ(*readPropertyList(assemble({{0x09}})), Value(true));
    EXPECT_EQ(*read(inPlist("<true/>")), Value(true));
    const auto other = read("bplist17");
    ASSERT_FALSE(other);
    EXPECT_NE(std::string(other.error().reason).find("version"), std::string::npos);
}

} // namespace zor::plist::test
