#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <bit>
#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <limits>
#include <string>

#include "platform/Vlist.h"
#include "platform/VlistText.h"
#include "platform/VlistXmlWriter.h"

using om::OMError;
using om::Uuid;
using om::Value;
using om::Vlist;
using om::VlistText;
using om::VlistXmlWriter;

namespace {

constexpr double kInf = std::numeric_limits<double>::infinity();

// Stricter than Value's ==: kinds must match (integers aside), dictionaries keep their order and
// reals their bits, except that any NaN matches any NaN.
void expectIdentical(const Value& a, const Value& b, const std::string& where = "root")
{
    SCOPED_TRACE(where);
    if (a.isInteger() && b.isInteger()) {
        EXPECT_EQ(a, b);
        return;
    }
    ASSERT_EQ(a.type(), b.type());
    switch (a.type()) {
    case Value::Type::Real:
    case Value::Type::Date: {
        const double x = a.isReal() ? *a.asDouble() : *a.asDate();
        const double y = b.isReal() ? *b.asDouble() : *b.asDate();
        if (!(std::isnan(x) && std::isnan(y))) {
            EXPECT_EQ(std::bit_cast<uint64_t>(x), std::bit_cast<uint64_t>(y)) << x << " vs " << y;
        }
        return;
    }
    case Value::Type::Array:
        ASSERT_EQ(a.count(), b.count());
        for (size_t i = 0; i < a.count(); ++i)
            expectIdentical(a.at(i), b.at(i), where + "[" + std::to_string(i) + "]");
        return;
    case Value::Type::Dictionary:
        ASSERT_EQ(a.count(), b.count());
        for (size_t i = 0; i < a.count(); ++i) {
            EXPECT_EQ(a.entries()[i].first, b.entries()[i].first);
            expectIdentical(a.entries()[i].second, b.entries()[i].second, where + "." + a.entries()[i].first);
        }
        return;
    default:
        EXPECT_EQ(a, b);
    }
}

Value parsed(std::string_view text)
{
    auto result = Vlist::parse(text);
    EXPECT_TRUE(result.ok()) << result.error().localizedDescription();
    return result.ok() ? *result : Value();
}

// The error text of a document that must be refused.
std::string refusal(std::string_view text, int64_t code = om::kPlatformErrorMalformed)
{
    auto result = Vlist::parse(text);
    if (result.ok())
        return "parsed: " + result->description();
    EXPECT_EQ(result.error().code(), code) << result.error().localizedDescription();
    return result.error().localizedDescription();
}

std::string document(std::string_view body)
{
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<vlist version=\"1\">\n" + std::string(body) + "</vlist>\n";
}

std::string nested(const char* open, const char* close, size_t depth)
{
    std::string text;
    for (size_t i = 0; i < depth; ++i)
        text += open;
    for (size_t i = 0; i < depth; ++i)
        text += close;
    return document(text + "\n");
}

Value everyKind()
{
    std::vector<uint8_t> allBytes(256);
    for (size_t i = 0; i < allBytes.size(); ++i)
        allBytes[i] = static_cast<uint8_t>(i);
    return Value::dictionary({
        { "strings",
            Value::array({ "", "plain", "h\xC3\xA9llo \xE2\x98\x83 \xF0\x9D\x84\x9E", "<a & 'b' \"c\"> ]]>",
                "  padded  ", "line\r\nbreak\ttab", "\x7F\xC2\x80" }) },
        { "integers",
            Value::array({ Value::integer(0), Value::integer(-1), Value::integer(INT64_MIN), Value::integer(INT64_MAX),
                Value::unsignedInteger(uint64_t { INT64_MAX } + 1), Value::unsignedInteger(UINT64_MAX) }) },
        { "reals",
            Value::array({ Value::real(0.1), Value::real(-0.0), Value::real(5e-324), Value::real(DBL_MAX),
                Value::real(-DBL_MAX), Value::real(kInf), Value::real(-kInf), Value::real(NAN), Value::real(1e300),
                Value::real(-2.5e-10), Value::real(3.0) }) },
        { "booleans", Value::array({ Value::boolean(true), Value::boolean(false) }) },
        { "data",
            Value::array({ Value::data(std::vector<uint8_t> {}), Value::data(std::vector<uint8_t> { 1 }),
                Value::data(std::vector<uint8_t> { 1, 2 }), Value::data(std::vector<uint8_t> { 1, 2, 3 }),
                Value::data(allBytes) }) },
        { "dates",
            Value::array({ Value::date(0), Value::date(1795341600), Value::date(1700000000.25), Value::date(-0.5),
                Value::date(-62135596800.0), Value::date(1e15 + 0.5), Value::date(-5e-324), Value::date(kInf),
                Value::date(1e300), Value::date(NAN) }) },
        { "uuids",
            Value::array({ Value::uuid(Uuid()), Value::uuid(*Uuid::parse("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0")) }) },
        { "empty", Value::dictionary({ { "dict", Value::dictionary({}) }, { "array", Value::array({}) } }) },
        { "nested",
            Value::array({ Value::dictionary({ { "a", Value::array({ Value::array({ Value::integer(1) }) }) } }) }) },
        { "", "empty key" },
    });
}

} // namespace

TEST(Vlist, DesignExampleIsWrittenExactly)
{
    Value value = Value::dictionary({ { "version", Value::integer(16) }, { "data", Value::dictionary({}) } });
    const std::string expected = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
                                 "<vlist version=\"1\">\n"
                                 "<dict>\n"
                                 "  <key>version</key><integer>16</integer>\n"
                                 "  <key>data</key><dict/>\n"
                                 "</dict>\n"
                                 "</vlist>\n";
    EXPECT_EQ(Vlist::writeXml(value), expected);
    expectIdentical(parsed(expected), value);
}

TEST(Vlist, EveryKindRoundTripsThroughBothForms)
{
    const Value value = everyKind();
    const std::string xml = Vlist::writeXml(value);
    const std::vector<uint8_t> binary = Vlist::writeBinary(value);

    expectIdentical(parsed(xml), value);
    auto fromBinary = Vlist::parse(binary);
    ASSERT_TRUE(fromBinary.ok()) << fromBinary.error().localizedDescription();
    expectIdentical(*fromBinary, value);
    EXPECT_EQ(Vlist::writeXml(*fromBinary), xml);
    EXPECT_EQ(Vlist::writeBinary(parsed(xml)), binary);
}

TEST(Vlist, BinaryFormIsMagicThenCbor)
{
    auto bytes = Vlist::writeBinary(Value::integer(7));
    EXPECT_EQ(bytes, (std::vector<uint8_t> { 'v', 'l', 's', 't', '1', 0, 0x07 }));

    bytes.push_back(0x07);
    auto trailing = Vlist::parse(bytes);
    ASSERT_FALSE(trailing.ok());
    EXPECT_NE(trailing.error().localizedDescription().find("binary vlist: "), std::string::npos);

    auto otherVersion = Vlist::parse(std::string_view("vlst2\0\x07", 7));
    ASSERT_FALSE(otherVersion.ok());
    EXPECT_EQ(otherVersion.error().code(), om::kPlatformErrorUnsupported);
}

TEST(Vlist, DictionaryOrderIsKeptInBothForms)
{
    Value value = Value::dictionary({ { "zeta", 1 }, { "alpha", 2 }, { "mid", 3 } });
    const std::string xml = Vlist::writeXml(value);
    EXPECT_LT(xml.find("zeta"), xml.find("alpha"));
    EXPECT_LT(xml.find("alpha"), xml.find("mid"));
    expectIdentical(parsed(xml), value);
    expectIdentical(*Vlist::parse(Vlist::writeBinary(value)), value);
}

TEST(Vlist, IntegersTakeTheirKindFromTheirRange)
{
    EXPECT_EQ(parsed(document("<integer>9223372036854775807</integer>\n")).type(), Value::Type::Integer);
    Value unsignedMin = parsed(document("<integer>9223372036854775808</integer>\n"));
    EXPECT_EQ(unsignedMin.type(), Value::Type::Unsigned);
    EXPECT_EQ(*unsignedMin.asUInt64(), uint64_t { 1 } << 63);
    EXPECT_EQ(*parsed(document("<integer>18446744073709551615</integer>\n")).asUInt64(), UINT64_MAX);
    EXPECT_EQ(*parsed(document("<integer>-9223372036854775808</integer>\n")).asInt64(), INT64_MIN);
    EXPECT_EQ(*parsed(document("<integer> +42 </integer>\n")).asInt64(), 42);
    EXPECT_EQ(*parsed(document("<integer>-0</integer>\n")).asInt64(), 0);

    EXPECT_EQ(refusal(document("<integer>18446744073709551616</integer>\n")),
        "line 3: integer \"18446744073709551616\" does not fit 64 bits");
    EXPECT_EQ(refusal(document("<integer>-9223372036854775809</integer>\n")),
        "line 3: integer \"-9223372036854775809\" does not fit 64 bits");
    for (const char* bad : { "", "1.0", "0x10", "+-1", "1 2", "--1", "1e3" })
        EXPECT_EQ(refusal(document("<integer>" + std::string(bad) + "</integer>\n")).substr(0, 24),
            "line 3: invalid integer ")
            << bad;
}

TEST(Vlist, UuidReadsEitherCaseAndWritesUpperCase)
{
    Value lower = parsed(document("<uuid>0f1e2d3c-4b5a-6978-8796-a5b4c3d2e1f0</uuid>\n"));
    Value upper = parsed(document("<uuid> 0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0 </uuid>\n"));
    EXPECT_EQ(lower, upper);
    EXPECT_NE(Vlist::writeXml(lower).find("<uuid>0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0</uuid>"), std::string::npos);
    EXPECT_EQ(refusal(document("<uuid>0f1e2d3c4b5a69788796a5b4c3d2e1f0</uuid>\n")),
        "line 3: invalid uuid \"0f1e2d3c4b5a69788796a5b4c3d2e1f0\"");
}

TEST(Vlist, ScalarTextAroundValues)
{
    EXPECT_EQ(*parsed(document("<string>  a <!-- note --> b  </string>\n")).asString(), "  a  b  ");
    EXPECT_EQ(*parsed(document("<string><![CDATA[<x> & y]]></string>\n")).asString(), "<x> & y");
    EXPECT_EQ(*parsed(document("<string>caf&#xE9; &amp; &lt;&gt;</string>\n")).asString(), "caf\xC3\xA9 & <>");
    EXPECT_EQ(*parsed(document("<string>a\r\nb</string>\n")).asString(), "a\nb");
    EXPECT_EQ(*parsed(document("<string/>\n")).asString(), "");
    EXPECT_EQ(*parsed(document("<data>\n  AAEC\n  Aw==\n</data>\n")).asData(), (std::vector<uint8_t> { 0, 1, 2, 3 }));
    EXPECT_EQ(*parsed(document("<real>-inf</real>\n")).asDouble(), -kInf);
    EXPECT_TRUE(std::isnan(*parsed(document("<real>nan</real>\n")).asDouble()));
    Value spaced = parsed(document("<!-- c -->\n<dict>\n  <?pi x?>\n  <key>k</key>\n\n  <true/>\n</dict>\n"));
    EXPECT_EQ(spaced["k"], Value::boolean(true));
}

TEST(VlistXmlReader, RefusalsNameTheLine)
{
    EXPECT_EQ(refusal(document("<dict>\n  <key>a</key><foo/>\n</dict>\n")), "line 4: unknown element <foo>");
    EXPECT_EQ(refusal(document("<dict>\n  <key>a</key><string>x</string>\n  stray\n</dict>\n")),
        "line 5: unexpected text \"stray\" in <dict>");
    EXPECT_EQ(refusal(document("<array>\n  <true/> oops\n</array>\n")), "line 4: unexpected text \"oops\" in <array>");
    EXPECT_EQ(refusal(document("hello\n")), "line 3: unexpected text \"hello\" in <vlist>");
    EXPECT_EQ(refusal(document("<array>\r\n  <true/>\r\n  h\xC3\xA9llo\r\n  w\xC3\xB6rld\r\n  <true/>\r\n</array>\n")),
        "line 5: unexpected text \"h\xC3\xA9llo\n  w\xC3\xB6rld\" in <array>");
    EXPECT_EQ(refusal(document("<dict>\n  <key>a</key>\n</dict>\n")), "line 4: key \"a\" has no value");
    EXPECT_EQ(refusal(document("<dict>\n  <key>a</key>\n  <key>b</key><true/>\n</dict>\n")),
        "line 4: key \"a\" has no value");
    EXPECT_EQ(refusal(document("<dict>\n  <string>x</string>\n</dict>\n")),
        "line 4: <string> where a <key> is expected in <dict>");
    EXPECT_EQ(
        refusal(document("<dict>\n  <key>a</key><true/>\n  <key>b</key><true/>\n  <key>a</key><false/>\n</dict>\n")),
        "line 6: duplicate key \"a\"");
    EXPECT_EQ(refusal(document("<true/>\n<false/>\n")), "line 4: more than one value in <vlist>");
    EXPECT_EQ(refusal(document("<!-- nothing -->\n")), "line 2: <vlist> holds no value");
    EXPECT_EQ(refusal(document("<array>\n  <key>a</key>\n</array>\n")), "line 4: <key> outside a <dict>");
    EXPECT_EQ(refusal(document("<string>a<b/>c</string>\n")), "line 3: element <b> inside <string>");
    EXPECT_EQ(refusal(document("<String>x</String>\n")), "line 3: unknown element <String>");
    EXPECT_EQ(refusal(document("<x:string xmlns:x=\"urn:x\">a</x:string>\n")), "line 3: unknown element <x:string>");
    EXPECT_EQ(refusal(document("<true>yes</true>\n")), "line 3: <true> holds text; it must be empty");
    EXPECT_EQ(refusal(document("<real>1e400</real>\n")), "line 3: invalid real \"1e400\"");
    EXPECT_EQ(refusal(document("<data>AAE*</data>\n")), "line 3: invalid base64 in <data>");
    EXPECT_EQ(
        refusal(document("<date>2026-02-29T00:00:00Z</date>\n")), "line 3: invalid date \"2026-02-29T00:00:00Z\"");
}

TEST(VlistXmlReader, DocumentShapeIsChecked)
{
    EXPECT_EQ(refusal("<?xml version=\"1.0\"?>\n<config version=\"1\"><true/></config>\n"),
        "line 2: root element <config> is not <vlist>");
    EXPECT_EQ(refusal("<vlist><true/></vlist>"), "line 1: <vlist> has no version");
    EXPECT_EQ(refusal("<vlist version=\"2\"><true/></vlist>"), "line 1: unsupported vlist version \"2\"");
    EXPECT_EQ(refusal(document("<dict>\n  <key>a</key><true/>\n</array>\n")).substr(0, 8), "line 5: ");
    EXPECT_EQ(refusal("").substr(0, 8), "line 1: ");
    EXPECT_EQ(refusal(document("<string>\xFF</string>\n")).substr(0, 8), "line 3: ");
}

TEST(VlistXmlReader, EntityDeclarationsStopTheParse)
{
    const std::string external = "<?xml version=\"1.0\"?>\n<!DOCTYPE vlist [\n"
                                 "  <!ENTITY leak SYSTEM \"file:///etc/passwd\">\n]>\n"
                                 "<vlist version=\"1\"><string>&leak;</string></vlist>\n";
    EXPECT_EQ(refusal(external), "line 3: entity declaration \"leak\" is not allowed");

    std::string laughs = "<?xml version=\"1.0\"?>\n<!DOCTYPE vlist [\n  <!ENTITY a \"haha\">\n";
    for (char c = 'b'; c <= 'k'; ++c)
        laughs += std::string("  <!ENTITY ") + c + " \"&" + char(c - 1) + ";&" + char(c - 1) + ";&" + char(c - 1)
            + ";\">\n";
    laughs += "]>\n<vlist version=\"1\"><string>&k;</string></vlist>\n";
    EXPECT_EQ(refusal(laughs), "line 3: entity declaration \"a\" is not allowed");

    const std::string parameter
        = "<?xml version=\"1.0\"?>\n<!DOCTYPE vlist [\n<!ENTITY % p SYSTEM \"http://127.0.0.1:1/x\">\n%p;\n]>\n"
          "<vlist version=\"1\"><true/></vlist>\n";
    EXPECT_EQ(refusal(parameter), "line 3: entity declaration \"p\" is not allowed");
}

TEST(VlistXmlReader, ExternalDtdIsNeverLoaded)
{
    // Were the DTD read, its entity would define &leak; and the document would parse.
    std::string directory = testing::TempDir() + "vlist-dtd.XXXXXX";
    ASSERT_NE(::mkdtemp(directory.data()), nullptr);
    const std::string dtd = directory + "/evil.dtd";
    {
        int fd = ::open(dtd.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
        ASSERT_GE(fd, 0);
        const std::string text = "<!ENTITY leak \"secret\">\n";
        ASSERT_EQ(::write(fd, text.data(), text.size()), ssize_t(text.size()));
        ::close(fd);
    }
    const std::string text = "<?xml version=\"1.0\"?>\n<!DOCTYPE vlist SYSTEM \"" + dtd
        + "\">\n<vlist version=\"1\"><string>&leak;</string></vlist>\n";
    const std::string error = refusal(text);
    EXPECT_EQ(error.substr(0, 8), "line 3: ");
    EXPECT_EQ(error.find("secret"), std::string::npos);
    EXPECT_TRUE(parsed(
        "<?xml version=\"1.0\"?>\n<!DOCTYPE vlist SYSTEM \"" + dtd + "\">\n<vlist version=\"1\"><true/></vlist>\n")
                    .isBoolean());
    std::filesystem::remove_all(directory);
}

TEST(VlistXmlReader, NestingLimitMatchesTheBinaryForm)
{
    for (bool dictionaries : { false, true }) {
        Value deepest = "leaf";
        for (int i = 0; i < 128; ++i)
            deepest = dictionaries ? Value::dictionary({ { "k", deepest } }) : Value::array({ deepest });
        expectIdentical(parsed(Vlist::writeXml(deepest)), deepest);
        EXPECT_TRUE(Vlist::parse(Vlist::writeBinary(deepest)).ok());

        Value tooDeep = Value::array({ deepest });
        EXPECT_NE(refusal(Vlist::writeXml(tooDeep), om::kPlatformErrorLimit).find("nesting deeper than 128 levels"),
            std::string::npos);
        auto binary = Vlist::parse(Vlist::writeBinary(tooDeep));
        ASSERT_FALSE(binary.ok());
        EXPECT_EQ(binary.error().code(), om::kPlatformErrorLimit);
    }
    EXPECT_EQ(
        refusal(nested("<array>", "</array>", 129), om::kPlatformErrorLimit), "line 3: nesting deeper than 128 levels");
    EXPECT_NE(refusal(nested("<array>", "</array>", 100000), om::kPlatformErrorLimit).find("nesting deeper"),
        std::string::npos);
}

TEST(VlistXmlWriter, NestedLayout)
{
    Value value = Value::dictionary({
        { "list", Value::array({ Value::integer(1), Value::dictionary({ { "x", "y" } }), Value::array({}) }) },
        { "inner", Value::dictionary({ { "on", Value::boolean(true) } }) },
        { "when", Value::date(1795341600.5) },
    });
    EXPECT_EQ(Vlist::writeXml(value),
        document("<dict>\n"
                 "  <key>list</key>\n"
                 "  <array>\n"
                 "    <integer>1</integer>\n"
                 "    <dict>\n"
                 "      <key>x</key><string>y</string>\n"
                 "    </dict>\n"
                 "    <array/>\n"
                 "  </array>\n"
                 "  <key>inner</key>\n"
                 "  <dict>\n"
                 "    <key>on</key><true/>\n"
                 "  </dict>\n"
                 "  <key>when</key><date>2026-11-22T10:00:00.5Z</date>\n"
                 "</dict>\n"));
    EXPECT_EQ(Vlist::writeXml(Value::array({})), document("<array/>\n"));
    EXPECT_EQ(Vlist::writeXml("x"), document("<string>x</string>\n"));
}

TEST(VlistXmlWriter, EscapesMarkupAndCarriageReturns)
{
    Value value = Value::dictionary({ { "<&>\"'", "a\r\nb <c> & \"d\" 'e'" } });
    const std::string xml = Vlist::writeXml(value);
    EXPECT_NE(xml.find("<key>&lt;&amp;&gt;&quot;&apos;</key>"
                       "<string>a&#13;\nb &lt;c&gt; &amp; &quot;d&quot; &apos;e&apos;</string>"),
        std::string::npos);
    expectIdentical(parsed(xml), value);
}

TEST(VlistXmlWriter, CharactersXmlCannotCarryBecomeReplacementCharacters)
{
    const std::string replacement = "\xEF\xBF\xBD";
    constexpr char kAwkward[] = "a\0b\x01\x1F"
                                "c\xEF\xBF\xBE"
                                "d\xFF"
                                "e\xC0\x80"
                                "\xF0\x9F\x98\x80";
    const std::string awkward(kAwkward, sizeof kAwkward - 1);
    EXPECT_FALSE(VlistXmlWriter::representable(awkward));
    EXPECT_TRUE(VlistXmlWriter::representable("tab\tnewline\ncr\r \xF0\x9F\x98\x80 <&>"));

    Value read = parsed(Vlist::writeXml(Value::string(awkward)));
    EXPECT_EQ(*read.asString(),
        "a" + replacement + "b" + replacement + replacement + "c" + replacement + "d" + replacement + "e" + replacement
            + replacement + "\xF0\x9F\x98\x80");

    // "\x01" and "\x02" both become U+FFFD: the written file must still read back.
    Value keys = Value::dictionary({ { "\x01", 1 }, { "ok", 2 }, { "\x02", 3 }, { replacement, 4 } });
    Value back = parsed(Vlist::writeXml(keys));
    ASSERT_EQ(back.count(), 2u);
    EXPECT_EQ(back[replacement], Value(1));
    EXPECT_EQ(back["ok"], Value(2));
    EXPECT_EQ(*Vlist::parse(Vlist::writeBinary(keys)), keys); // the binary form keeps them all
}

TEST(VlistText, DatesReadAndWriteCalendarText)
{
    auto text = [](double seconds) {
        std::string out;
        VlistText::appendDate(out, seconds);
        return out;
    };
    EXPECT_EQ(text(1795341600), "2026-11-22T10:00:00Z");
    EXPECT_EQ(text(1700000000.25), "2023-11-14T22:13:20.25Z");
    EXPECT_EQ(text(-0.5), "1969-12-31T23:59:59.5Z");
    EXPECT_EQ(text(253402300799), "9999-12-31T23:59:59Z");
    EXPECT_EQ(text(253402300800), "+10000-01-01T00:00:00Z");
    EXPECT_EQ(text(-62167219200), "0000-01-01T00:00:00Z");
    EXPECT_EQ(text(-62167219201), "-0001-12-31T23:59:59Z");
    EXPECT_EQ(text(kInf), "inf");
    EXPECT_EQ(text(NAN), "nan");

    EXPECT_EQ(VlistText::parseDate("2026-11-22T10:00:00Z"), 1795341600);
    EXPECT_EQ(VlistText::parseDate("2026-11-22T10:00:00.000Z"), 1795341600);
    EXPECT_EQ(VlistText::parseDate("1969-12-31T23:59:59.75Z"), -0.25);
    EXPECT_EQ(VlistText::parseDate("2000-02-29T00:00:00Z"), 951782400);
    EXPECT_EQ(VlistText::parseDate("-0001-12-31T23:59:59Z"), -62167219201);
    for (const char* bad : { "1900-02-29T00:00:00Z", "2026-13-01T00:00:00Z", "2026-04-31T00:00:00Z",
             "2026-11-22T24:00:00Z", "2026-11-22T10:60:00Z", "2026-11-22T10:00:60Z", "2026-11-22T10:00:00",
             "2026-11-22 10:00:00Z", "2026-11-22T10:00:00.Z", "2026-11-22T10:00:00+00:00", "12026-11-22T10:00:00Z",
             "26-11-22T10:00:00Z", "+1234567890123-01-01T00:00:00Z", "1795341600", "0", "" })
        EXPECT_FALSE(VlistText::parseDate(bad)) << bad;
}

TEST(VlistText, CalendarGivesWayToNumbersAtTwoToThe62)
{
    for (double seconds : { 0x1p62 - 512, -0x1p62 + 512 }) {
        std::string out;
        VlistText::appendDate(out, seconds);
        EXPECT_EQ(out.back(), 'Z') << out;
        EXPECT_EQ(VlistText::parseDate(out), seconds);
    }
    for (double seconds : { 0x1p62, -0x1p62, 1e300, -kInf }) {
        std::string out;
        VlistText::appendDate(out, seconds);
        EXPECT_NE(out.back(), 'Z') << out;
        EXPECT_EQ(VlistText::parseDate(out), seconds);
    }
}

// Deterministic sweep over bit patterns: every double a writer meets must read back exactly.
TEST(VlistText, DatesAndRealsReadBackBitExactly)
{
    uint64_t state = 0x9e3779b97f4a7c15ull;
    for (int i = 0; i < 20000; ++i) {
        state = state * 6364136223846793005ull + 1442695040888963407ull;
        double value = std::bit_cast<double>(state);
        if (i % 2) // also plenty of ordinary dates, with and without fractions
            value = std::ldexp(static_cast<double>(state >> 11), -20) - 0x1p32;
        std::string date;
        VlistText::appendDate(date, value);
        auto dateBack = VlistText::parseDate(date);
        ASSERT_TRUE(dateBack) << date;
        if (!std::isnan(value) && value != 0) { // a date's zero loses its sign
            ASSERT_EQ(std::bit_cast<uint64_t>(*dateBack), std::bit_cast<uint64_t>(value)) << date;
        }

        std::string real;
        VlistText::appendReal(real, value);
        auto realBack = VlistText::parseReal(real);
        ASSERT_TRUE(realBack) << real;
        if (!std::isnan(value)) {
            ASSERT_EQ(std::bit_cast<uint64_t>(*realBack), std::bit_cast<uint64_t>(value)) << real;
        }
    }
}

TEST(VlistText, RealSpellings)
{
    std::string out;
    VlistText::appendReal(out, 0.1);
    EXPECT_EQ(out, "0.1");
    EXPECT_EQ(VlistText::parseReal("+1.5"), 1.5);
    EXPECT_EQ(VlistText::parseReal("-2e-3"), -2e-3);
    EXPECT_EQ(VlistText::parseReal("inf"), kInf);
    EXPECT_EQ(VlistText::parseReal("-inf"), -kInf);
    for (const char* bad : { "", "+", "+-1", "1.5x", "0x10", " 1", "1e400", "one" })
        EXPECT_FALSE(VlistText::parseReal(bad)) << bad;
}

TEST(VlistText, Base64AcceptsWhitespaceAndOptionalPadding)
{
    using Bytes = std::vector<uint8_t>;
    EXPECT_EQ(VlistText::parseBase64("QQ=="), Bytes { 'A' });
    EXPECT_EQ(VlistText::parseBase64("QQ"), Bytes { 'A' });
    EXPECT_EQ(VlistText::parseBase64("QUI="), (Bytes { 'A', 'B' }));
    EXPECT_EQ(VlistText::parseBase64(" Q U\nJD\t\r"), (Bytes { 'A', 'B', 'C' }));
    EXPECT_EQ(VlistText::parseBase64(""), Bytes {});
    for (const char* bad : { "Q", "QQ=", "Q===", "====", "QQ==QQ==", "Q=Q=", "QUJD*", "QUJD-_" })
        EXPECT_FALSE(VlistText::parseBase64(bad)) << bad;
}

class VlistFile : public testing::Test {
protected:
    void SetUp() override
    {
        m_directory = testing::TempDir() + "vlist-file.XXXXXX";
        ASSERT_NE(::mkdtemp(m_directory.data()), nullptr);
    }
    void TearDown() override { std::filesystem::remove_all(m_directory); }

    std::string write(const std::string& name, std::string_view bytes)
    {
        const std::string path = m_directory + "/" + name;
        int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
        EXPECT_GE(fd, 0);
        EXPECT_EQ(::write(fd, bytes.data(), bytes.size()), ssize_t(bytes.size()));
        ::close(fd);
        return path;
    }

    std::string m_directory;
};

TEST_F(VlistFile, ReadsEitherForm)
{
    const Value value = everyKind();
    const auto binary = Vlist::writeBinary(value);
    auto fromXml = Vlist::readFile(write("a.vlist", Vlist::writeXml(value)));
    auto fromBinary = Vlist::readFile(
        write("b.vlist", std::string_view(reinterpret_cast<const char*>(binary.data()), binary.size())));
    ASSERT_TRUE(fromXml.ok()) << fromXml.error().localizedDescription();
    ASSERT_TRUE(fromBinary.ok()) << fromBinary.error().localizedDescription();
    expectIdentical(*fromXml, value);
    expectIdentical(*fromBinary, value);
}

TEST_F(VlistFile, ErrorsNameThePath)
{
    const std::string missing = m_directory + "/missing.vlist";
    auto absent = Vlist::readFile(missing);
    ASSERT_FALSE(absent.ok());
    EXPECT_EQ(absent.error().domain(), "POSIX");
    EXPECT_EQ(absent.error().code(), ENOENT);
    EXPECT_NE(absent.error().localizedDescription().find(missing), std::string::npos);

    const std::string bad = write("bad.vlist", document("<dict>\n  <foo/>\n</dict>\n"));
    auto malformed = Vlist::readFile(bad);
    ASSERT_FALSE(malformed.ok());
    EXPECT_EQ(malformed.error().localizedDescription(), bad + ": line 4: unknown element <foo>");

    auto directory = Vlist::readFile(m_directory);
    ASSERT_FALSE(directory.ok());
    EXPECT_NE(directory.error().localizedDescription().find(m_directory), std::string::npos);
}

TEST_F(VlistFile, SixtyFourMebibytesIsTheLimit)
{
    constexpr off_t kLimit = off_t { 64 } << 20;
    for (off_t size : { kLimit, kLimit + 1 }) {
        const std::string path = write("big.vlist", std::string_view("vlst1\0", 6));
        ASSERT_EQ(::truncate(path.c_str(), size), 0); // sparse: costs no disk
        auto result = Vlist::readFile(path);
        ASSERT_FALSE(result.ok()); // 0 and trailing zeros are no vlist; only the reason differs
        EXPECT_EQ(result.error().code() == om::kPlatformErrorLimit, size > kLimit)
            << result.error().localizedDescription();
        EXPECT_NE(result.error().localizedDescription().find(path), std::string::npos);
    }
}
