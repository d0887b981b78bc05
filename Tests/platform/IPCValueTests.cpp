#include "platform/codec/IPCValue.h"

#include <gtest/gtest.h>

#include <functional>
#include <limits>

namespace ost::platform {
namespace {

/// A message whose "v" is the item that `write` writes.
class Message {
public:
    explicit Message(const std::function<void(CBOREncoder&)>& write) {
        CBOREncoder encoder(_bytes);
        encoder.beginMap(1);
        encoder.key("v");
        write(encoder);
        EXPECT_TRUE(validateCBOR(_bytes));
    }
    [[nodiscard]] std::optional<OSTValue> value() const {
        const auto root = validateCBOR(_bytes);
        const auto item = root ? root->find("v") : std::nullopt;
        return item ? propertyListValue(*item) : std::nullopt;
    }

private:
    std::string _bytes;
};

TEST(IPCValue, PropertyListValuesSurviveTheWire) {
    constexpr auto largest = std::numeric_limits<std::uint64_t>::max();
    constexpr auto least = std::numeric_limits<std::int64_t>::min();
    const OSTArray every{true,
                         false,
                         std::uint64_t{0},
                         largest,
                         std::int64_t{-1},
                         least,
                         0.5,
                         -1e300,
                         "",
                         "\u65e5\u672c\n",
                         OSTData{},
                         OSTData{std::string("\0\xff", 2)},
                         OSTDate{1.5},
                         OSTDate{-86400},
                         OSTArray(),
                         OSTDictionary()};
    const OSTDictionary dictionary({{"every", every}, {"", "empty key"}, {"nested", OSTDictionary({{"a", every}})}});
    const auto value = Message([&](auto& encoder) { encodePropertyListValue(encoder, dictionary); }).value();
    ASSERT_TRUE(value);
    EXPECT_EQ(OSTValue(dictionary), *value);
    for (const auto& element : every)
        EXPECT_EQ(element, Message([&](auto& encoder) { encodePropertyListValue(encoder, element); }).value());
}

TEST(IPCValue, WhatHasNoCounterpartIsLeftOut) {
    const auto uuid = UUID::generate();
    const struct {
        const char* name;
        std::function<void(CBOREncoder&)> write;
    } rows[] = {
        {"null", [](auto& encoder) { encoder.null(); }},
        {"a UUID", [&](auto& encoder) { encoder.uuid(uuid); }},
    };
    for (const auto& row : rows) {
        EXPECT_EQ(std::nullopt, Message(row.write).value()) << row.name;
        EXPECT_EQ(OSTValue(OSTArray{"a", "b"}), Message([&](auto& encoder) {
                                                    encoder.beginArray(3);
                                                    encoder.text("a");
                                                    row.write(encoder);
                                                    encoder.text("b");
                                                }).value())
            << row.name;
        EXPECT_EQ(OSTValue(OSTDictionary({{"b", true}})), Message([&](auto& encoder) {
                                                              encoder.beginMap(2);
                                                              encoder.key("a");
                                                              row.write(encoder);
                                                              encoder.key("b");
                                                              encoder.boolean(true);
                                                          }).value())
            << row.name;
    }
}

TEST(IPCValue, ANumberBelowAllSignedOnesIsRefusedWithWhatHoldsIt) {
    const std::string ofNegative("\xa1\x61v\x3b\xff\xff\xff\xff\xff\xff\xff\xff", 12);
    const auto negative = validateCBOR(ofNegative);
    ASSERT_TRUE(negative);
    const auto write = [&](CBOREncoder& encoder) { encoder.item(*negative->find("v")); };
    EXPECT_EQ(std::nullopt, Message(write).value());
    EXPECT_EQ(std::nullopt, Message([&](auto& encoder) {
                                encoder.beginArray(1);
                                encoder.beginMap(1);
                                encoder.key("a");
                                write(encoder);
                            }).value());
}

TEST(IPCValue, KeysMayComeInAnyOrderAndNestAsDeepAsTheWireAllows) {
    EXPECT_EQ(OSTValue(OSTDictionary({{"a", true}, {"b", false}})), Message([](auto& encoder) {
                                                                        encoder.beginMap(2);
                                                                        encoder.key("b");
                                                                        encoder.boolean(false);
                                                                        encoder.key("a");
                                                                        encoder.boolean(true);
                                                                    }).value());
    constexpr int deepest = 63; // The message itself is a level.
    OSTValue nested = OSTArray();
    for (int level = 1; level < deepest; ++level)
        nested = level % 2 == 0 ? OSTValue(OSTArray{nested}) : OSTValue(OSTDictionary({{"k", nested}}));
    EXPECT_EQ(nested, Message([&](auto& encoder) { encodePropertyListValue(encoder, nested); }).value());
}

TEST(IPCValue, WhatWouldBecomeTooManyObjectsIsRefusedAsAWhole) {
    const auto booleans = [](std::uint64_t count) {
        return [count](CBOREncoder& encoder) {
            encoder.beginArray(2);
            encoder.beginArray(count);
            for (std::uint64_t i = 0; i < count; ++i)
                encoder.boolean(true);
            encoder.text("behind");
        };
    };
    constexpr std::uint64_t others = 3;
    const auto most = Message(booleans(maximumConvertedObjects - others)).value();
    ASSERT_TRUE(most);
    EXPECT_EQ(maximumConvertedObjects - others, most->asArray()->front().asArray()->size());
    EXPECT_EQ(std::nullopt, Message(booleans(maximumConvertedObjects - others + 1)).value());
}

} // namespace
} // namespace ost::platform
