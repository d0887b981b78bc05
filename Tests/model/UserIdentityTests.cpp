#include "model/OSTUserIdentity.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <optional>

namespace ost {
namespace {

using UserIdentity = test::DeviceTest;

TEST_F(UserIdentity, IsResolvedByTheFirstRuleThatApplies) {
    struct Case {
        std::uint32_t userId;
        std::uint64_t containerClass;
        std::uint32_t client;
        std::optional<std::uint32_t> resolved;
    };
    const Case cases[] = {
        {33, 1, 501, 33}, // bundle classes: 33, from anybody
        {33, 8, 0, 33},
        {1, 1, 0, std::nullopt},
        {501, 1, 501, std::nullopt},
        {499, 12, 501, 499}, // system classes: 499
        {499, 13, 0, 499},
        {1, 12, 0, std::nullopt},
        {501, 2, 501, 501}, // a user process acts for itself
        {1, 2, 501, 501},
        {502, 2, 501, std::nullopt},
        {1, 0, 501, 501}, // and the class is not tested
        {501, 14, 501, 501},
        {1, 2, 0, 501}, // a system client: the placeholder is the mobile user
        {1, 0, 0, 501},
        {501, 2, 500, 501},
        {600, 7, 33, 600},
        {400, 2, 0, std::nullopt},
        {501, 0, 0, std::nullopt},
        {501, 14, 0, std::nullopt},
        {501, std::uint64_t{1} << 32 | 2, 0, std::nullopt}, // all 64 bits count
    };
    for (const auto& c : cases) {
        const auto result = validateUserId(c.userId, static_cast<OSTContainerClass>(c.containerClass), c.client);
        const auto expected = c.resolved ? std::expected<std::uint32_t, OSTErrorCode>(*c.resolved)
                                         : std::unexpected(OSTErrorCode::invalidParameter);
        EXPECT_TRUE(expected == result) << c.userId << " " << c.containerClass << " " << c.client;
    }
}

TEST_F(UserIdentity, PlaceholderIsUserZeroWithoutAMobileAccount) {
    test::writeFile("/etc/passwd", "root:x:0:0::/private/var/root:/bin/sh\n");
    EXPECT_EQ(0U, validateUserId(1, OSTContainerClass::dataApplication, 0).value_or(99));
}

} // namespace
} // namespace ost
