#include "platform/codec/CBOR.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>
#include <vector>

namespace ost::platform {
namespace {

using namespace std::string_literals;

/// Bytes written as hexadecimal digits, spaces for the reader's eye.
std::string bytes(std::string_view digits) {
    std::string result;
    int high = -1;
    for (const char digit : digits) {
        if (digit == ' ')
            continue;
        const int value = digit <= '9' ? digit - '0' : digit - 'a' + 10;
        if (high >= 0)
            result += static_cast<char>(high << 4 | value);
        high = high < 0 ? value : -1;
    }
    return result;
}

/// A map of one entry, "v", with the encoded `value`.
std::string mapOf(std::string_view value) { return bytes("a1 61 76") + std::string(value); }

std::string nested(std::size_t arrays) { return mapOf(std::string(arrays - 1, '\x81') + "\x80"); }

TEST(CBOR, RefusesWhatIsNotOfTheSubset) {
    const struct {
        const char* what;
        std::string payload;
    } cases[] = {
        {"nothing", ""},
        {"no map", bytes("80")},
        {"map of indefinite length", bytes("bf ff")},
        {"text of indefinite length", mapOf(bytes("7f 61 61 ff"))},
        {"break", mapOf(bytes("ff"))},
        {"reserved encoding", mapOf(bytes("1c"))},
        {"bytes after the item", bytes("a0 00")},
        {"missing value", bytes("a1 61 76")},
        {"head that ends early", mapOf(bytes("1b 00 00 00 00 00 00 00"))},
        {"text that ends early", mapOf(bytes("62 61"))},
        {"text of the greatest length", mapOf(bytes("7b ff ff ff ff ff ff ff ff"))},
        {"array of the greatest count", mapOf(bytes("9b ff ff ff ff ff ff ff ff"))},
        {"map of a count that overflows when doubled", bytes("bb 80 00 00 00 00 00 00 00")},
        {"number as key", bytes("a1 00 00")},
        {"data as key", bytes("a1 41 76 00")},
        {"key that stands twice", bytes("a2 61 76 00 61 76 01")},
        {"key that stands twice in another width", bytes("a2 61 76 00 78 01 76 01")},
        {"key that stands twice inside", mapOf(bytes("a2 60 00 60 00"))},
        {"NUL in a text", mapOf(bytes("61 00"))},
        {"NUL in a long text", mapOf("\x6a"s + "nine byte"s + "\0"s)},
        {"NUL in a key", bytes("a1 61 00 00")},
        {"lone continuation byte", mapOf(bytes("61 80"))},
        {"overlong UTF-8", mapOf(bytes("62 c0 80"))},
        {"surrogate in UTF-8", mapOf(bytes("63 ed a0 80"))},
        {"UTF-8 beyond U+10FFFF", mapOf(bytes("64 f4 90 80 80"))},
        {"UTF-8 that ends early", mapOf(bytes("62 c3 28"))},
        {"unknown tag", mapOf(bytes("c2 41 01"))},
        {"tag around nothing", mapOf(bytes("c1"))},
        {"tag inside a tag", mapOf(bytes("c1 c1 00"))},
        {"date of a text", mapOf(bytes("c1 61 30"))},
        {"date of a boolean", mapOf(bytes("c1 f5"))},
        {"UUID of 15 bytes", mapOf(bytes("d8 25 4f") + std::string(15, 'u'))},
        {"UUID of a text", mapOf(bytes("d8 25 70") + std::string(16, 'u'))},
        {"undefined", mapOf(bytes("f7"))},
        {"simple value", mapOf(bytes("e0"))},
        {"simple value of two bytes", mapOf(bytes("f8 20"))},
        {"nested 65 deep", nested(64)},
    };
    for (const auto& [what, payload] : cases)
        EXPECT_FALSE(validateCBOR(payload)) << what;
}

TEST(CBOR, FindsAKeyThatStandsTwiceAmongMany) {
    const auto mapWithKeys = [](int distinct, const std::string& last) {
        std::string payload;
        CBOREncoder encoder(payload);
        encoder.beginMap(static_cast<std::uint64_t>(distinct) + 1);
        for (int i = 0; i < distinct; ++i) {
            encoder.key(std::to_string(i));
            encoder.null();
        }
        encoder.key(last);
        encoder.boolean(true);
        return payload;
    };
    for (const int distinct : {1, 15, 16, 17, 100'000}) {
        EXPECT_TRUE(validateCBOR(mapWithKeys(distinct, "other"))) << distinct;
        EXPECT_FALSE(validateCBOR(mapWithKeys(distinct, "0"))) << distinct;
    }
}

TEST(CBOR, ReadsEveryWidth) {
    for (const auto* const encoded : {"17", "18 17", "19 00 17", "1a 00 00 00 17", "1b 00 00 00 00 00 00 00 17"}) {
        const auto payload = mapOf(bytes(encoded));
        EXPECT_EQ(validateCBOR(payload)->find("v")->asUnsigned(), 0x17) << encoded;
    }
    const struct {
        const char* encoded;
        double value;
    } reals[] = {{"f9 3c 00", 1.0},
                 {"f9 c4 00", -4.0},
                 {"f9 00 01", std::ldexp(1.0, -24)},
                 {"f9 7c 00", std::numeric_limits<double>::infinity()},
                 {"fa 47 c3 50 00", 100000.0},
                 {"fb c0 10 66 66 66 66 66 66", -4.1}};
    for (const auto& [encoded, value] : reals) {
        const auto payload = mapOf(bytes(encoded));
        EXPECT_EQ(validateCBOR(payload)->find("v")->asReal(), value) << encoded;
        const auto date = mapOf("\xc1" + bytes(encoded));
        EXPECT_EQ(validateCBOR(date)->find("v")->asDate(), value) << encoded;
    }
    const auto deepest = nested(63);
    EXPECT_TRUE(validateCBOR(deepest));
}

TEST(CBOR, ReadsIntegersByValue) {
    constexpr auto largest = std::numeric_limits<std::int64_t>::max();
    constexpr auto smallest = std::numeric_limits<std::int64_t>::min();
    const struct {
        const char* encoded;
        std::optional<std::uint64_t> asUnsigned;
        std::optional<std::int64_t> asSigned;
    } cases[] = {
        {"00", 0, 0},
        {"20", std::nullopt, -1},
        {"1b 7f ff ff ff ff ff ff ff", largest, largest},
        {"1b 80 00 00 00 00 00 00 00", std::uint64_t{1} << 63, std::nullopt},
        {"3b 7f ff ff ff ff ff ff ff", std::nullopt, smallest},
        {"3b 80 00 00 00 00 00 00 00", std::nullopt, std::nullopt},
        {"f5", std::nullopt, std::nullopt},
        {"61 31", std::nullopt, std::nullopt},
    };
    for (const auto& [encoded, asUnsigned, asSigned] : cases) {
        const auto payload = mapOf(bytes(encoded));
        const auto item = validateCBOR(payload)->find("v");
        ASSERT_TRUE(item);
        EXPECT_EQ(item->asUnsigned(), asUnsigned) << encoded;
        EXPECT_EQ(item->asSigned(), asSigned) << encoded;
    }
}

TEST(CBOR, ReadsWhatItWrites) {
    const auto uuid = UUID::generate();
    std::string payload;
    CBOREncoder encoder(payload);
    encoder.beginMap(11);
    encoder.key("unsigned"), encoder.unsignedNumber(0xffffffffffffffff);
    encoder.key("signed"), encoder.signedNumber(-500);
    encoder.key("boolean"), encoder.boolean(true);
    encoder.key("null"), encoder.null();
    encoder.key("real"), encoder.real(0.1);
    encoder.key("text"), encoder.text("Grüße 🦢");
    encoder.key("data"), encoder.data("\0\xff"s);
    encoder.key("uuid"), encoder.uuid(uuid);
    encoder.key("date"), encoder.date(-86400);
    encoder.key("moment"), encoder.date(0.5);
    encoder.key("array"), encoder.beginArray(3);
    encoder.beginMap(1), encoder.key("inner"), encoder.beginArray(0);
    encoder.null();
    encoder.text("last");

    const auto root = validateCBOR(payload);
    ASSERT_TRUE(root) << root.error().description();
    EXPECT_EQ(root->find("unsigned")->asUnsigned(), 0xffffffffffffffff);
    EXPECT_EQ(root->find("signed")->asSigned(), -500);
    EXPECT_EQ(root->find("boolean")->asBoolean(), true);
    EXPECT_FALSE(root->find("null"));
    EXPECT_EQ(root->find("real")->asReal(), 0.1);
    EXPECT_EQ(root->find("text")->asText(), "Grüße 🦢");
    EXPECT_EQ(root->find("data")->asData(), "\0\xff"s);
    EXPECT_EQ(root->find("uuid")->asUUID(), uuid);
    EXPECT_EQ(root->find("date")->asDate(), -86400);
    EXPECT_EQ(root->find("moment")->asDate(), 0.5);
    EXPECT_FALSE(root->find("text")->asData() || root->find("uuid")->asData() || root->find("date")->asReal());

    std::vector<CBORType> types;
    for (const auto item : root->find("array")->elements())
        types.push_back(item.type());
    EXPECT_EQ(types, (std::vector{CBORType::map, CBORType::null, CBORType::text}));
    EXPECT_EQ((*root->find("array")->elements().begin()).find("inner")->count(), 0);

    std::vector<std::string> keys;
    for (const auto [key, value] : root->entries())
        keys.emplace_back(key);
    EXPECT_EQ(keys, (std::vector<std::string>{"unsigned", "signed", "boolean", "real", "text", "data", "uuid", "date",
                                              "moment", "array"}));
    EXPECT_EQ(root->bytes(), payload);
}

TEST(CBOR, WritesTheShortestForm) {
    const struct {
        std::int64_t value;
        const char* encoded;
    } cases[] = {{0, "00"},
                 {23, "17"},
                 {24, "18 18"},
                 {255, "18 ff"},
                 {256, "19 01 00"},
                 {65535, "19 ff ff"},
                 {-1, "20"},
                 {-24, "37"},
                 {-25, "38 18"},
                 {-65537, "3a 00 01 00 00"},
                 {65536, "1a 00 01 00 00"},
                 {4294967296, "1b 00 00 00 01 00 00 00 00"}};
    for (const auto& [value, encoded] : cases) {
        std::string out;
        CBOREncoder(out).signedNumber(value);
        EXPECT_EQ(out, bytes(encoded)) << value;
    }
    std::string date;
    CBOREncoder(date).date(1'000'000);
    EXPECT_EQ(date, bytes("c1 1a 00 0f 42 40"));
}

} // namespace
} // namespace ost::platform
