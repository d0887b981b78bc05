#include "platform/base/OSTValue.h"

#include <gtest/gtest.h>

#include <limits>

namespace ost {
namespace {

OSTValue u(std::uint64_t value) { return OSTValue(value); }
OSTValue s(std::int64_t value) { return OSTValue(value); }

TEST(OSTValueTests, GivesNumbersAsUnsignedValues) {
    constexpr auto largest = std::numeric_limits<std::uint64_t>::max();
    const struct {
        OSTValue value;
        std::optional<std::uint64_t> expected;
        bool truth;
    } cases[] = {
        {u(0), 0, false},
        {u(largest), largest, true},
        {s(-1), largest, true},
        {s(7), 7, true},
        {true, 1, true},
        {false, 0, false},
        {1.9, 1, true},
        {0.5, 0, true},
        {-3.5, 0, true},
        {-0.0, 0, false},
        {0x1p64, largest, true},
        {std::numeric_limits<double>::infinity(), largest, true},
        {std::numeric_limits<double>::quiet_NaN(), 0, true},
        {"1", std::nullopt, false},
        {OSTData{"1"}, std::nullopt, false},
        {OSTDate{1}, std::nullopt, false},
        {OSTArray{u(1)}, std::nullopt, false},
    };
    for (const auto& [value, expected, truth] : cases) {
        SCOPED_TRACE(value.description());
        EXPECT_EQ(value.unsignedValue(), expected);
        EXPECT_EQ(value.isNumber(), expected.has_value());
        EXPECT_EQ(value.truthValue(), truth);
    }
}

TEST(OSTValueTests, ComparesByTypeAndDeepValue) {
    const auto nested = [](std::uint64_t leaf) { return OSTValue(OSTArray{"a", OSTDictionary({{"k", u(leaf)}})}); };
    EXPECT_EQ(s(5), u(5)) << "a number has one form";
    EXPECT_EQ(nested(1), nested(1));
    EXPECT_NE(nested(1), nested(2));
    EXPECT_NE(s(-1), u(std::numeric_limits<std::uint64_t>::max()));
    EXPECT_NE(u(1), OSTValue(true));
    EXPECT_NE(u(1), OSTValue(1.0));
    EXPECT_NE(OSTValue("a"), OSTValue(OSTData{"a"}));
    EXPECT_NE(OSTValue(OSTArray{}), OSTValue(OSTDictionary()));
}

TEST(OSTValueTests, DescribesValuesInWords) {
    const std::pair<OSTValue, std::string> cases[] = {
        {"text as it is", "text as it is"},
        {s(-42), "-42"},
        {0.5, "0.5"},
        {true, "1"},
        {OSTArray{}, "()"},
        {OSTArray{"a", u(2)}, "(a, 2)"},
        {OSTDictionary(), "{}"},
        {OSTDictionary({{"b", OSTArray{false}}, {"a", u(1)}}), "{a = 1; b = (0); }"},
        {OSTData{std::string("\x00\xab\xff", 3)}, "<00abff>"},
        {OSTDate{0}, "1970-01-01T00:00:00Z"},
        {OSTDate{-0.5}, "1969-12-31T23:59:59Z"},
        {OSTDate{1795376761}, "2026-11-22T19:46:01Z"},
        {OSTDate{1e300}, "1e+300"},
    };
    for (const auto& [value, words] : cases)
        EXPECT_EQ(value.description(), words);
}

TEST(OSTValueTests, CutsLongDescriptionsBetweenCharacters) {
    std::string accents;
    for (int i = 0; i < 5000; ++i)
        accents += "é";
    const OSTValue long_[] = {accents, "x" + accents, OSTData{accents}, OSTArray(5000, u(12345)),
                              OSTDictionary({{accents, u(1)}})};
    for (const auto& value : long_) {
        const auto words = value.description();
        EXPECT_LE(words.size(), 4100U);
        ASSERT_TRUE(words.ends_with("…"));
        const auto last = static_cast<unsigned char>(words[words.size() - 4]);
        EXPECT_NE(last, 0xc3) << "the first byte of the cut character remains";
    }
}

TEST(OSTValueTests, DictionaryKeepsTheLastOfEqualKeysInOrderOfBytes) {
    OSTDictionary dictionary({{"b", u(1)}, {"a", u(2)}, {"b", u(3)}, {"\xc3\xa9", u(4)}, {"", u(5)}, {"b", u(6)}});
    EXPECT_EQ(dictionary.description(), "{ = 5; a = 2; b = 6; é = 4; }");

    dictionary.set("a", "changed");
    dictionary.set("aa", "new");
    dictionary.remove("");
    dictionary.remove("absent");
    EXPECT_EQ(dictionary.description(), "{a = changed; aa = new; b = 6; é = 4; }");
    EXPECT_EQ(dictionary.find("c"), nullptr);
    ASSERT_NE(dictionary.find("aa"), nullptr);
    EXPECT_EQ(*dictionary.find("aa")->asString(), "new");
}

} // namespace
} // namespace ost
