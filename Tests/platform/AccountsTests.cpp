#include "platform/device/Accounts.h"

#include "support/DeviceTest.h"

namespace ost::platform {
namespace {

class AccountsTest : public test::DeviceTest {};

TEST_F(AccountsTest, FindsUsersAndGroupsByNameAndNumber) {
    test::writeFile("/etc/passwd", "# comment\n"
                                   "root:x:0:0:Root,,:/private/var/root:/bin/sh\n"
                                   "short:x:1\n"
                                   "long:x:2:2:::/bin/sh:more\n"
                                   "signed:x:-3:3:::\n"
                                   "large:x:4294967296:4:::\n"
                                   ":x:5:5:::\n"
                                   "mobile:x:501:502::/private/var/mobile:\n"
                                   "second:x:501:503::/elsewhere:\n"
                                   "last:x:4294967294:6:::");
    const Account mobile{"mobile", 501, 502, "/private/var/mobile"};
    EXPECT_EQ(accountForName("mobile"), mobile);
    EXPECT_EQ(accountForUserId(501), mobile);
    EXPECT_EQ(accountForUserId(0).value().home, "/private/var/root");
    EXPECT_EQ(accountForName("last").value().uid, 4294967294);
    for (const char* name : {"short", "long", "signed", "large", "", "mobil", "x"})
        EXPECT_EQ(accountForName(name).error(), ENOENT) << name;
    EXPECT_EQ(accountForUserId(5).error(), ENOENT);

    test::writeFile("/etc/group", "root:x:0:\n\nsystemusers:x:600:a,b\nbroken:x:\n");
    EXPECT_EQ(groupForName("systemusers"), 600U);
    EXPECT_EQ(groupForId(600), "systemusers");
    EXPECT_EQ(groupForName("broken").error(), ENOENT);
    EXPECT_EQ(groupForId(7).error(), ENOENT);

    test::writeFile("/other/etc/group", "one:x:1:ab\ntwo:x:2:b,a\nthree:x:3:\nown:x:4:a\nfive:x:5:a,aa,a\n");
    EXPECT_EQ(groupsOf({"a", 700, 4, ""}, "/other"), (std::vector<gid_t>{4, 2, 5}));
    EXPECT_EQ(groupsOf({"c", 700, 9, ""}, "/other"), std::vector<gid_t>{9});
}

TEST_F(AccountsTest, FailWhenTheDatabaseCannotBeRead) {
    std::filesystem::remove("/etc/passwd");
    EXPECT_EQ(accountForUserId(0).error(), ENOENT);
    std::filesystem::create_directory("/etc/passwd");
    EXPECT_EQ(accountForUserId(0).error(), EINVAL);
    std::filesystem::resize_file("/etc/group", 64 << 20);
    EXPECT_EQ(groupForId(0).error(), EFBIG);
}

} // namespace
} // namespace ost::platform
