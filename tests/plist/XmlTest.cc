// SPDX-License-Identifier: Apache-2.0
// The XML form: what it says, what it must not say, and what damage does to it.
#include "plist/Xml.h"
#include "plist/Read.h"
#include "plist/Samples.h"
#include "support/Allocations.h"

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

void expectReason(const std::expected<Value, ReadError>& result, const char* reason) {
    ASSERT_FALSE(result) << reason;
    EXPECT_NE(std::string(result.error().reason).find(reason), std::string::npos)
        << reason << " but " << result.error().text();
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

// Goal: no cut and no changed byte does harm. Method: both everywhere in one full document.
TEST(Xml, SystematicDamage) {
    const std::string whole = inPlist(
        "<dict><key>a</key><array><integer>1</integer><real>2</real><true/></array><key>\u00E9</key><data>AAEC</data>"
        "<key>d</key><date>2001-01-01T00:00:00Z</date></dict>");
    ASSERT_TRUE(read(whole));
    for (std::size_t length = 0; length < whole.size() - 1; ++length)
        ASSERT_FALSE(read(whole.substr(0, length))) << length;
    forEachDamage(bytesOf(whole), [](const Data& damaged) { (void)read({damaged.begin(), damaged.end()}); });
}

} // namespace zor::plist::test
