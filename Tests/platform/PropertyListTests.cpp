#include "platform/codec/PropertyList.h"

#include <gtest/gtest.h>

#include <limits>

namespace ost::platform {
namespace {

using namespace std::string_literals;

OSTValue u(std::uint64_t value) { return OSTValue(value); }
OSTValue s(std::int64_t value) { return OSTValue(value); }

std::string bigEndian(std::uint64_t value, unsigned width) {
    std::string bytes(width, '\0');
    for (unsigned i = width; i-- > 0; value >>= 8)
        bytes[i] = static_cast<char>(value);
    return bytes;
}

/// A binary file made by hand, sound unless a field is changed.
struct BinaryFile {
    std::vector<std::string> objects;
    unsigned offsetWidth = 2;
    unsigned referenceWidth = 1;
    std::uint64_t root = 0;
    std::uint64_t count = objects.size();
    std::int64_t tableShift = 0;
    std::vector<std::size_t> aliases = {}; ///< further entries of the table, leading to these objects

    [[nodiscard]] std::string bytes() const {
        std::string file = "bplist00", table;
        std::vector<std::size_t> offsets;
        for (const auto& object : objects) {
            offsets.push_back(file.size());
            file += object;
        }
        for (const auto alias : aliases)
            offsets.push_back(offsets[alias]);
        for (const auto offset : offsets)
            table += bigEndian(offset, offsetWidth);
        const auto tableOffset = file.size() + static_cast<std::uint64_t>(tableShift);
        return file + table + std::string(6, '\0') + bigEndian(offsetWidth, 1) + bigEndian(referenceWidth, 1) +
               bigEndian(count, 8) + bigEndian(root, 8) + bigEndian(tableOffset, 8);
    }
};

std::string xml(const std::string& value) { return "<plist version=\"1.0\">" + value + "</plist>"; }

std::uint64_t objectCountOf(const std::string& file) {
    std::uint64_t count = 0;
    for (const char byte : file.substr(file.size() - 24, 8))
        count = count << 8 | static_cast<unsigned char>(byte);
    return count;
}

void expectRefused(const std::string& bytes, const std::string& reason, const PropertyListLimits& limits = {}) {
    const auto value = parsePropertyList(bytes, limits);
    ASSERT_FALSE(value) << bytes;
    EXPECT_NE(value.error().reason.find(reason), std::string::npos)
        << "\"" << value.error().reason << "\" instead of \"" << reason << "\" for " << bytes;
}

OSTDictionary everyType() {
    return OSTDictionary({{"string", "text"},
                          {"long", std::string(300, 'x')},
                          {"wide", "caf\u00e9 \u6f22 \U0001f600"},
                          {"", ""},
                          {"0", u(0)},
                          {"2^8", u(256)},
                          {"2^16", u(65536)},
                          {"2^32", u(1ULL << 32)},
                          {"2^63 - 1", u((1ULL << 63) - 1)},
                          {"2^63", u(1ULL << 63)},
                          {"2^64 - 1", u(~0ULL)},
                          {"-1", s(-1)},
                          {"-2^63", s(std::numeric_limits<std::int64_t>::min())},
                          {"real", 0.1},
                          {"infinity", std::numeric_limits<double>::infinity()},
                          {"true", true},
                          {"false", false},
                          {"data", OSTData{"\x00\xff"s}},
                          {"date", OSTDate{1795376761}},
                          {"array", OSTArray{OSTArray{}, u(1), OSTDictionary({{"k", OSTArray{"deep"}}})}}});
}

TEST(PropertyListTests, ReadsWhatItWrites) {
    const auto numbers = [](std::uint64_t count) {
        OSTArray array;
        for (std::uint64_t i = 0; i < count; ++i)
            array.push_back(u(i));
        return OSTDictionary({{"numbers", std::move(array)}});
    };
    const struct {
        OSTDictionary dictionary;
        int offsetWidth;
        int referenceWidth;
    } cases[] = {{OSTDictionary(), 1, 1}, {numbers(50), 1, 1}, {numbers(253), 2, 1},
                 {numbers(254), 2, 2},    {everyType(), 2, 1}, {numbers(70'000), 4, 4}};
    for (const auto& [dictionary, offsetWidth, referenceWidth] : cases) {
        const auto file = serializeBinaryPropertyList(dictionary);
        EXPECT_EQ(file[file.size() - 26], offsetWidth);
        EXPECT_EQ(file[file.size() - 25], referenceWidth);
        const auto value = parsePropertyList(file);
        ASSERT_TRUE(value) << value.error().reason;
        EXPECT_EQ(*value, OSTValue(dictionary));
    }
}

TEST(PropertyListTests, WritesTheLeastEncodingOnce) {
    const OSTArray repeated(1000, OSTArray{"equal", u(7), OSTData{"equal"}, "\u00e9"});
    EXPECT_EQ(objectCountOf(serializeBinaryPropertyList(OSTDictionary({{"equal", repeated}}))), 1U + 4 + 1 + 1000);

    const std::pair<OSTValue, std::string> cases[] = {
        {u(255), "\x10\xff"s},
        {u(256), "\x11\x01\x00"s},
        {u(65536), "\x12\x00\x01\x00\x00"s},
        {u(1ULL << 32), "\x13\x00\x00\x00\x01\x00\x00\x00\x00"s},
        {u(1ULL << 63), "\x14\x00\x00\x00\x00\x00\x00\x00\x00\x80\x00\x00\x00\x00\x00\x00\x00"s},
        {s(-2), "\x13\xff\xff\xff\xff\xff\xff\xff\xfe"s},
        {"ascii", "\x55\x61scii"s},
        {"\u00e9\U0001f600", "\x63\x00\xe9\xd8\x3d\xde\x00"s},
        {"a\xff", "\x62\x00\x61\xff\xfd"s},
        {std::string(15, 'a'), "\x5f\x10\x0f"s + std::string(15, 'a')},
    };
    for (const auto& [value, encoding] : cases) {
        const auto file = serializeBinaryPropertyList(OSTDictionary({{"k", value}}));
        EXPECT_EQ(file.substr(0, 10 + encoding.size()), "bplist00\x51k" + encoding);
    }
}

TEST(PropertyListTests, ReadsBinaryFilesOfOtherWriters) {
    const std::pair<BinaryFile, OSTValue> cases[] = {
        {{{"\x13\xff\xff\xff\xff\xff\xff\xff\xfd"s}}, s(-3)},
        {{{"\x12\xff\xff\xff\xff"s}}, u(0xffff'ffff)},
        {{{"\x14"s + std::string(8, '\0') + std::string(8, '\xff')}}, u(~0ULL)},
        {{{"\x22\x3f\xc0\x00\x00"s}}, 1.5},
        {{{"\x33\x00\x00\x00\x00\x00\x00\x00\x00"s}}, OSTDate{978'307'200}},
        {{{"\x5f\x13\x00\x00\x00\x00\x00\x00\x00\x01z"s}}, "z"},
        {{{"\x51z", "\xa2"s + std::string(15, '\0') + "\x00"s}, 8, 8, 1}, OSTArray{"z", "z"}},
        {{{"\x51r", "\x51z", "\xa2\x01\x00"s}, 3, 1, 2}, OSTArray{"z", "r"}},
        {{{"\xd3\x01\x02\x01\x03\x02\x04"s, "\x51k", "\x51j", "\x10\x01", "\x10\x02"}},
         OSTDictionary({{"k", u(2)}, {"j", "j"}})},
    };
    for (const auto& [file, expected] : cases) {
        const auto value = parsePropertyList(file.bytes());
        ASSERT_TRUE(value) << value.error().reason << " for " << expected.description();
        EXPECT_EQ(*value, expected);
    }
}

TEST(PropertyListTests, RefusesMalformedBinaryFiles) {
    const auto huge = ~std::uint64_t{0};
    const std::pair<std::string, BinaryFile> cases[] = {
        {"outside the table", {{}}},
        {"null or fill object", {{"\x00"s}}},
        {"null or fill object", {{"\x0f"}}},
        {"unsupported kind", {{"\x80\x01"}}},
        {"unsupported kind", {{"\xc0"}}},
        {"bad integer", {{"\x15" + std::string(32, '\0')}}},
        {"integer outside 64 bits", {{"\x14\x00\x00\x00\x00\x00\x00\x00\x01"s + std::string(8, '\0')}}},
        {"integer outside 64 bits", {{"\x14" + std::string(16, '\xff')}}},
        {"bad integer", {{"\x13\x00\x00"s}}},
        {"bad real", {{"\x21\x00\x00"s}}},
        {"bad date", {{"\x32\x00\x00\x00\x00"s}}},
        {"byte outside ASCII", {{"\x51\x80"}}},
        {"NUL in a string", {{"\x52z\x00"s}}},
        {"NUL in a string", {{"\x61\x00\x00"s}}},
        {"half a surrogate pair", {{"\x61\xd8\x00"s}}},
        {"half a surrogate pair", {{"\x62\xd8\x00\x00z"s}}},
        {"half a surrogate pair", {{"\x62\xdc\x00\x00z"s}}},
        {"string beyond the end", {{"\x62\x00z\x00"s}}},
        {"data beyond the end", {{"\x42z"}}},
        {"bad count", {{"\x4f"}}},
        {"bad count", {{"\x5f\x51\x01"}}},
        {"bad count", {{"\x5f\x14" + std::string(16, '\0')}}},
        {"data beyond the end", {{"\x4f\x13" + bigEndian(huge, 8)}}},
        {"string beyond the end", {{"\x6f\x13" + bigEndian(huge / 2 + 1, 8)}}},
        {"array or dictionary beyond the end", {{"\xaf\x13" + bigEndian(huge / 8 + 1, 8)}, 2, 8}},
        {"array or dictionary beyond the end", {{"\xdf\x13" + bigEndian(huge / 2 + 1, 8)}}},
        {"array or dictionary beyond the end", {{"\xa1"}}},
        {"outside the table", {{"\xd1\x01", "\x51k"}}},
        {"key that is no string", {{"\xd1\x01\x01", "\x10\x01"}}},
        {"outside the table", {{"\xa1\x01"}}},
        {"outside the table", {{"\x09"}, 2, 1, 1}},
        {"outside the table", {{"\x09"}, 2, 1, huge}},
        {"table shorter than its count", {{"\x09"}, 2, 1, 0, 2}},
        {"table shorter than its count", {{"\x09"}, 2, 1, 0, huge / 2 + 2}},
        {"width of offsets or references", {{"\x09"}, 0}},
        {"width of offsets or references", {{"\x09"}, 9}},
        {"width of offsets or references", {{"\x09"}, 2, 0}},
        {"width of offsets or references", {{"\x09"}, 2, 9}},
        {"object outside the file", {{"\x09"}, 2, 1, 0, 1, -1}},
        {"table outside the file", {{"\x09"}, 2, 1, 0, 1, 100}},
        {"table outside the file", {{"\x09"}, 2, 1, 0, 1, -5}},
        {"table outside the file", {{"\x09"}, 2, 1, 0, 1, -10}},
        {"holds itself", {{"\xa1\x00"s}}},
        {"holds itself", {{"\xd1\x01\x02", "\x51k", "\xa2\x00\x00"s}}},
    };
    for (const auto& [reason, file] : cases)
        expectRefused(file.bytes(), reason);
}

TEST(PropertyListTests, ReadsXML) {
    const std::pair<std::string, OSTValue> cases[] = {
        {"<string>a&lt;&gt;&amp;&quot;&apos;&#65;&#x1F600;</string>", "a<>&\"'A\U0001f600"},
        {"<string> a <!-- no -->\r\n<?no?> <![CDATA[<b>&amp;\r]]>\r</string>", " a \n <b>&amp;\n\n"},
        {"<string/>", ""},
        {"<integer> -12\n</integer>", s(-12)},
        {"<integer>0xFFFFFFFFFFFFFFFF</integer>", u(~0ULL)},
        {"<integer>18446744073709551615</integer>", u(~0ULL)},
        {"<integer>-9223372036854775808</integer>", s(std::numeric_limits<std::int64_t>::min())},
        {"<integer>-0x10</integer>", s(-16)},
        {"<real>-1.5e3</real>", -1500.0},
        {"<real>+infinity</real>", std::numeric_limits<double>::infinity()},
        {"<true/>", true},
        {"<false></false>", false},
        {"<data>\n AAH/ \t/w = =\n</data>", OSTData{"\x00\x01\xff\xff"s}},
        {"<data>YWI=</data>", OSTData{"ab"}},
        {"<data/>", OSTData{}},
        {"<date>2026-11-22T19:46:01Z</date>", OSTDate{1795376761}},
        {"<date>1600-02-29T00:00:00Z</date>", OSTDate{-11670998400}},
        {"<array/>", OSTArray{}},
        {"<array> <array></array> <!-- x --> </array>", OSTArray{OSTValue(OSTArray{})}},
        {"<dict><key>b</key><true/><key>a</key><integer>1</integer> <key>b</key><false/></dict>",
         OSTDictionary({{"a", u(1)}, {"b", false}})},
    };
    for (const auto& [text, expected] : cases) {
        const auto value = parsePropertyList(xml(text));
        ASSERT_TRUE(value) << value.error().reason << " in " << text;
        EXPECT_EQ(*value, expected) << text;
    }

    const auto prologue = parsePropertyList(
        "\xef\xbb\xbf<?xml version='1.0' encoding='utf-8' standalone=\"no\" ?>\n<!-- a - -->"
        "<!DOCTYPE plist PUBLIC \"-//A>[B]//EN\" 'http://a/'>\n<?p?><plist a='>' ><true /></plist ><!-- end -->\n");
    ASSERT_TRUE(prologue) << prologue.error().reason;
    EXPECT_EQ(*prologue, OSTValue(true));
}

TEST(PropertyListTests, RefusesMalformedXML) {
    const auto entity = [](const std::string& subset) {
        return "<!DOCTYPE plist " + subset + ">" + xml("<string>&x;</string>");
    };
    const std::pair<std::string, std::vector<std::string>> cases[] = {
        {"Neither a binary nor an XML property list", {"", "text"}},
        {"no element \"plist\" with a value", {"<plist/>", "<dict/>"}},
        {"value missing", {"<plist></plist>", xml("<dict><key>a</key></dict>")}},
        {"closing tag of another element",
         {"<plist><true/></dict>", xml("<string>a"), xml("<string>a</key>"), xml("<array></dict>")}},
        {"element without an end", {"<plist><true/>"}},
        {"element behind the root element", {xml("<true/>") + "<true/>"}},
        {"text outside an element that may hold it", {xml("<true/>") + "text", xml("text"), xml("<array>a</array>")}},
        {"more than one value", {xml("<true/><true/>")}},
        {"bad or unknown element",
         {xml("<unknown/>"),
          xml("<integer/>"),
          xml("<integer>1 2</integer>"),
          xml("<integer>--1</integer>"),
          xml("<integer>0x</integer>"),
          xml("<integer>1f</integer>"),
          xml("<integer>18446744073709551616</integer>"),
          xml("<integer>-9223372036854775809</integer>"),
          xml("<real>1,5</real>"),
          xml("<real>+-1</real>"),
          xml("<real></real>"),
          xml("<true>yes</true>"),
          xml("<data>A</data>"),
          xml("<data>AA</data>"),
          xml("<data>AA=A</data>"),
          xml("<data>====</data>"),
          xml("<data>AA-_</data>"),
          xml("<date>2026-11-22</date>"),
          xml("<date>2026-02-29T00:00:00Z</date>"),
          xml("<date>2026-13-01T00:00:00Z</date>"),
          xml("<date>2026-01-01T24:00:00Z</date>"),
          xml("<date>2026-01-01T00:00:+1Z</date>"),
          xml("<date>2026-01-01T00:00:00+</date>"),
          xml("<dict><key>a</key><key>b</key><true/></dict>"),
          xml("<array><key>a</key></array>")}},
        {"element inside a text", {xml("<string><true/></string>")}},
        {"unknown entity or character",
         {xml("<string>&nbsp;</string>"), xml("<string>&amp</string>"), xml("<string>&#0;</string>"),
          xml("<string>&#xD800;</string>"), xml("<string>&#x110000;</string>"), xml("<string>&#4294967361;</string>"),
          xml("<string>&#;</string>"), entity("SYSTEM 'file:///etc/passwd'")}},
        {"forbidden character", {xml("<string>a\0b</string>"s), xml("<string>\x01</string>")}},
        {"text that is not UTF-8",
         {xml("<string>\xff</string>"), xml("<string>\xc0\x80</string>"), xml("<string>\xed\xa0\x80</string>"),
          xml("<string>\xc3</string>")}},
        {"\"--\" in a comment", {xml("<string><!-- -- --></string>")}},
        {"]]> is missing", {xml("<string><![CDATA[</string>")}},
        {"value without a key", {xml("<dict><true/></dict>"), xml("<dict><string>a</string><true/></dict>")}},
        {"attribute without a value", {xml("<true a></true>")}},
        {"bad attribute value", {xml("<true a='<'/>"), xml("<true a='b/>")}},
        {"encoding other than UTF-8",
         {"<?xml version='1.0' encoding='UTF-16'?>" + xml("<true/>"),
          "<?xml version='1.0' encoding='ISO-8859-1'?>" + xml("<true/>")}},
        {"UTF-16 is not supported", {"\xff\xfe<\0p\0"s, "\0<\0p"s}},
        {"document type without an end", {"<!DOCTYPE plist"}},
        {"document type with declarations of its own",
         {entity("[<!ENTITY x 'y'>]"),
          entity("SYSTEM 'file:///etc/passwd' [<!ENTITY x SYSTEM 'file:///etc/passwd'>]")}},
    };
    for (const auto& [reason, documents] : cases)
        for (const auto& document : documents)
            expectRefused(document, reason);
}

TEST(PropertyListTests, SaysWhereXMLIsMalformed) {
    expectRefused("<plist>\n<array>\n<oops/>\n</array></plist>", "line 3: bad or unknown element \"oops\"");
}

TEST(PropertyListTests, RefusesEveryTruncation) {
    const std::string files[] = {
        serializeBinaryPropertyList(everyType()),
        "<?xml version=\"1.0\"?><!DOCTYPE plist><plist><dict><!-- c --><key>a</key><array><integer>1</integer></array>"
        "<key>b&amp;</key><data>AAAA</data><key>c</key><string><![CDATA[x]]></string></dict></plist>"};
    for (const auto& file : files) {
        ASSERT_TRUE(parsePropertyList(file));
        for (std::size_t length = 0; length < file.size(); ++length)
            EXPECT_FALSE(parsePropertyList(std::string(file, 0, length))) << length;
    }
}

TEST(PropertyListTests, BoundsDepthAndNumberOfObjects) {
    const auto nested = [](std::size_t depth) {
        BinaryFile file{std::vector<std::string>(depth, "\xa1?")};
        for (std::size_t i = 0; i + 1 < depth; ++i)
            file.objects[i][1] = static_cast<char>(i + 1);
        file.objects.back() = "\xa0";
        return file.bytes();
    };
    const auto nestedXML = [](std::size_t depth) {
        std::string text;
        for (std::size_t i = 0; i < depth; ++i)
            text = "<array>" + text + "</array>";
        return xml(text);
    };
    for (const auto& file : {nested(64), nestedXML(64)})
        EXPECT_TRUE(parsePropertyList(file));
    for (const auto& file : {nested(65), nestedXML(65)})
        expectRefused(file, "nested too deeply");

    const OSTDictionary fiveObjects({{"a", OSTArray{true, true}}});
    for (const auto& file :
         {serializeBinaryPropertyList(fiveObjects), xml("<dict><key>a</key><array><true/><true/></array></dict>")}) {
        EXPECT_TRUE(parsePropertyList(file, {.objectCount = 5}));
        expectRefused(file, "too many objects", {.objectCount = 4});
    }
}

TEST(PropertyListTests, RefusesTreesOutOfProportionToTheFile) {
    // Twenty-four arrays, each of which holds the next one twice: 2^24 in all.
    BinaryFile doubling{std::vector<std::string>(24, "\xa2??")};
    for (std::size_t i = 0; i + 1 < doubling.objects.size(); ++i)
        doubling.objects[i].replace(1, 2, 2, static_cast<char>(i + 1));
    doubling.objects.back() = "\xa0";

    // An array of 200 entries of the table, all of which lead to one array of 200 integers.
    const std::string twoHundred = "\xaf\x10\xc8";
    BinaryFile aliased{{twoHundred, twoHundred, "\x10\x01"}};
    aliased.aliases.assign(200, 1);
    aliased.count = 203;
    for (int i = 0; i < 200; ++i) {
        aliased.objects[0] += static_cast<char>(3 + i);
        aliased.objects[1] += '\x02';
    }

    // One long string, very often.
    BinaryFile repeated{{"\xaf\x12" + bigEndian(100'000, 4) + std::string(100'000, '\x01'),
                         "\x5f\x12" + bigEndian(1'000'000, 4) + std::string(1'000'000, 'x')},
                        4};

    for (const auto& file : {doubling, aliased, repeated})
        expectRefused(file.bytes(), "too often", {.objectCount = std::size_t{1} << 40});
    doubling.objects.erase(doubling.objects.begin() + 10, doubling.objects.end());
    doubling.objects.back() = "\xa0";
    doubling.count = 10;
    EXPECT_TRUE(parsePropertyList(doubling.bytes())) << "sharing within bounds is no fault";
}

TEST(PropertyListTests, ReadsItsOwnFilesHoweverOftenAStringOccurs) {
    for (const std::size_t length : {10U, 15U, 16U, 17U, 200U, 1000U}) {
        const OSTDictionary dictionary({{"k", OSTArray(20'000, std::string(length, 'x'))}});
        const auto file = serializeBinaryPropertyList(dictionary);
        const auto value = parsePropertyList(file);
        ASSERT_TRUE(value) << value.error().reason << " for " << length;
        EXPECT_EQ(*value, OSTValue(dictionary));
    }
}

} // namespace
} // namespace ost::platform
