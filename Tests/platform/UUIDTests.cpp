#include "platform/base/UUID.h"

#include <gtest/gtest.h>

namespace ost::platform {

TEST(UUID, ReadsAndWritesTheCanonicalForm) {
    const auto uuid = UUID::parse("6e9B6E7e-0102-4f03-A405-060708090aFF");
    ASSERT_TRUE(uuid);
    EXPECT_EQ(uuid->string(), "6E9B6E7E-0102-4F03-A405-060708090AFF");
    EXPECT_EQ(uuid->bytes()[0], 0x6e);
    EXPECT_EQ(uuid->bytes()[15], 0xff);
    EXPECT_EQ(UUID::parse(uuid->string()), uuid);
    EXPECT_EQ(UUID::fromBytes(uuid->view()), uuid);

    for (const auto* const refused : {"", "6E9B6E7E-0102-4F03-A405-060708090AF",
                                      "6E9B6E7E-0102-4F03-A405-060708090AFF ", "6E9B6E7E00102-4F03-A405-060708090AFF",
                                      "6E9B6E7E-0102-4F03-A405-060708090AFG", "6E9B6E7-E0102-4F03-A405-060708090AFF",
                                      "{E9B6E7E-0102-4F03-A405-060708090AF}", "6E9B6E7E-0102-4F03-A405-06070809-AFF"})
        EXPECT_FALSE(UUID::parse(refused)) << refused;
    EXPECT_FALSE(UUID::fromBytes("fifteen bytes.."));
}

TEST(UUID, GeneratesRandomOnes) {
    const auto first = UUID::generate();
    EXPECT_NE(first, UUID::generate());
    EXPECT_EQ(first.string()[14], '4');
    EXPECT_NE(std::string("89AB").find(first.string()[19]), std::string::npos);
}

} // namespace ost::platform
