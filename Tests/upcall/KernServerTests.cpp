#include "upcall/OSTKernServer.h"

#include "codesigning/CodeSigningTest.h"
#include "upcall/PackedItems.h"

#include <cstring>
#include <functional>

namespace ost {
namespace {

using Words = std::array<std::uint32_t, 26>;

class KernServerTest : public test::CodeSigningTest {
protected:
    KernServerTest() {
        const auto items = test::items::number(3, 501) + test::items::string(4, "group.a") + test::items::end;
        const auto* const bytes = reinterpret_cast<const std::byte*>(items.data());
        region.assign(bytes, bytes + items.size());
        const auto size = static_cast<std::uint32_t>(region.size());
        words = {0x80001513, 52, 0x1234, 0x5678, 0, 322514900, 1, 0, size, 0x01000100, 0, 1, size,
                 0,          52, 7,      0,      0, 0,         0, 0, 0,    0,          0, 0, 0};
    }

    /// The reply to the message with a change.
    [[nodiscard]] std::optional<platform::UpcallReply>
    reply(const std::function<void(platform::UpcallMessage&, Words&)>& change) const {
        platform::UpcallMessage message{};
        auto changed = words;
        message.region = region;
        change(message, changed);
        std::memcpy(message.bytes.data(), changed.data(), sizeof changed);
        return demux_server(message);
    }

    static std::vector<std::int32_t> wordsOf(const platform::UpcallReply& reply) {
        std::vector<std::int32_t> result(reply.bytes.size() / 4);
        std::memcpy(result.data(), reply.bytes.data(), reply.bytes.size());
        return result;
    }

    Words words;
    std::vector<std::byte> region;
};

TEST_F(KernServerTest, RefusesByTheFirstThingThatIsWrong) {
    struct Case {
        const char* name;
        std::int32_t code;
        std::function<void(platform::UpcallMessage&, Words&)> change;
    };
    const std::vector<Case> cases{
        {"a forgotten request", -303, [](auto&, auto& w) { w = {w[0], 36, w[2], 0, 0, 322514901}; }},
        {"not complex", -304, [](auto&, auto& w) { w[0] = 0x1513, w[9] = 0; }},
        {"no descriptor", -304, [](auto&, auto& w) { w[6] = 0; }},
        {"two descriptors", -304, [](auto&, auto& w) { w[6] = 2; }},
        {"short", -304, [](auto&, auto& w) { w[1] = 51; }},
        {"long", -304, [](auto&, auto& w) { w[1] = 53; }},
        {"another kind of descriptor", -300, [](auto&, auto& w) { w[9] = 0x02000100, w[14] = 31; }},
        {"another count", -300, [](auto&, auto& w) { w[12] += 8; }},
        {"another size", -300, [](auto&, auto& w) { w[8] += 8; }},
        {"no region", -300, [](auto& m, auto&) { m.region.reset(); }},
        {"another trailer", -309, [](auto&, auto& w) { w[13] = 1, w[23] = 9; }},
        {"a short trailer", -309, [](auto&, auto& w) { w[14] = 31; }},
        {"another sender", 5, [](auto&, auto& w) { w[23] = 9; }},
        {"an empty region", 9, [](auto& m, auto& w) { m.region->clear(), w[8] = w[12] = 0; }},
        {"not an item", 4, [](auto& m, auto&) { m.region->at(2) = std::byte{9}; }},
    };
    const auto before = test::tree("/private/var");
    for (const auto& [name, code, change] : cases) {
        const auto refused = reply(change);
        ASSERT_TRUE(refused) << name;
        EXPECT_FALSE(refused->region);
        const auto id = code == -303 ? 322515001 : 322515000;
        EXPECT_EQ(wordsOf(*refused), (std::vector<std::int32_t>{0x13, 36, 0x1234, 0, 0, id, 0, 1, code})) << name;
    }
    EXPECT_EQ(test::tree("/private/var"), before);
}

TEST_F(KernServerTest, DoesNotHandleOtherMessages) {
    for (const std::uint32_t id : {0U, 322514899U, 322514902U, 322515000U})
        EXPECT_FALSE(reply([&](auto&, auto& w) { w[5] = id; })) << id;
}

TEST_F(KernServerTest, AnswersWithARegion) {
    const auto answer = reply([](auto&, auto&) {});
    ASSERT_TRUE(answer && answer->region);
    std::string bytes(1000, '?');
    const auto size = ::pread(answer->region.get(), bytes.data(), bytes.size(), 0);
    bytes.resize(static_cast<std::size_t>(size));
    const auto path = cached(OSTContainerClass::sharedAppGroup, "group.a")->url;
    EXPECT_EQ(bytes, test::items::string(100, "/private/var/mobile") + test::items::string(3, "group.a") +
                         test::items::string(4, path) + test::items::number(0, 1) + test::items::end);
    const auto length = static_cast<std::int32_t>(bytes.size());
    EXPECT_EQ(wordsOf(*answer), (std::vector<std::int32_t>{INT32_MIN + 0x13, 52, 0x1234, 0, 0, 322515000, 1, 0, length,
                                                           0x01000101, 0, 1, length}));
}

} // namespace
} // namespace ost
