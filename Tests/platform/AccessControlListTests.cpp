#include "platform/device/AccessControlList.h"

#include "platform/base/FileDescriptor.h"
#include "platform/device/Membership.h"
#include "support/DeviceTest.h"

#include <fcntl.h>
#include <grp.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <functional>
#include <utility>

namespace ost::platform {
namespace {

constexpr uid_t serviceUser = 777;
constexpr uid_t nobody = 65534;
constexpr uid_t unprivileged = 4294967294;
const std::string top = "/container";

using Grants = std::vector<std::pair<std::uint32_t, std::uint32_t>>; // permissions, flags
const Grants topLevel{{0x3ffe, 0x160}, {0x624, 0}};
const Grants directory{{0x3ffe, 0x60}};
const Grants file{{0x3fbe, 0x10}};

class AccessControlListTest : public test::DeviceTest {
protected:
    static AccessControlList makeACL(const Grants& grants) {
        auto acl = AccessControlList::create(grants.size()).value();
        for (const auto& [permissions, flags] : grants) {
            auto* entry = acl.createEntry().value();
            EXPECT_TRUE(entry->addPermissions(permissions) && entry->addFlags(flags));
            EXPECT_TRUE(entry->setTag(AccessControlList::extendedAllow));
            EXPECT_TRUE(entry->setQualifier(groupUUIDForName("systemusers").value()));
        }
        return acl;
    }

    static FileDescriptor open(const std::string& path) {
        return FileDescriptor(::open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    }

    static void standardize(const std::string& path, const Grants& grants) {
        const auto item = open(path);
        EXPECT_TRUE(makeACL(grants).apply(item.get()));
        EXPECT_TRUE(setModeKeepingMask(item.get(), 0));
        EXPECT_EQ(::fchownat(item.get(), "", unprivileged, unprivileged, AT_EMPTY_PATH), 0);
    }

    /// Whether `action` succeeds in a process of the user with no other group than `group`.
    static bool canAs(uid_t user, gid_t group, const std::function<bool()>& action) {
        const pid_t child = ::fork();
        if (child == 0) {
            const bool became = ::setgroups(1, &group) == 0 && ::setgid(nobody) == 0 && ::setuid(user) == 0;
            ::umask(022);
            ::_exit(!became ? 2 : action() ? 0 : 1);
        }
        int status = 0;
        EXPECT_EQ(::waitpid(child, &status, 0), child);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) < 2);
        return WEXITSTATUS(status) == 0;
    }
    static bool serviceCan(const std::function<bool()>& action) {
        return canAs(serviceUser, groupIdForUUID(groupUUIDForName("systemusers").value()).value(), action);
    }
    static bool nobodyCan(const std::function<bool()>& action) { return canAs(nobody, nobody, action); }

    static auto opens(const std::string& path, int flags) {
        return [=] { return FileDescriptor(::open(path.c_str(), flags | O_CLOEXEC, 0666)).get() >= 0; };
    }
    static auto lists(const std::string& path) { return opens(path, O_RDONLY | O_DIRECTORY); }

    static mode_t modeOf(const std::string& path) {
        struct stat status{};
        EXPECT_EQ(::lstat(path.c_str(), &status), 0);
        return status.st_mode & 07777;
    }

    void SetUp() override {
        ::umask(0);
        for (const auto& path : {top, top + "/Library"})
            ASSERT_EQ(::mkdir(path.c_str(), 0755), 0);
        test::writeFile(top + "/Library/data", "x", 0644);
    }
};

TEST_F(AccessControlListTest, OpensASystemContainerToSystemUsersAlone) {
    ASSERT_TRUE(makeACL(topLevel).apply(open(top).get()));
    standardize(top + "/Library", directory);
    standardize(top + "/Library/data", file);

    EXPECT_TRUE(serviceCan(lists(top)));
    EXPECT_TRUE(serviceCan(lists(top + "/Library")));
    EXPECT_TRUE(serviceCan(opens(top + "/Library/data", O_RDWR)));
    EXPECT_FALSE(nobodyCan(lists(top + "/Library")));
    EXPECT_FALSE(nobodyCan(opens(top + "/Library/data", O_RDONLY)));
    EXPECT_FALSE(nobodyCan(opens(top + "/mine", O_CREAT | O_WRONLY)));
    EXPECT_FALSE(canAs(serviceUser, nobody, lists(top + "/Library"))) << "the group decides, not the user";

    // What services make themselves belongs to all of them, and to nobody else.
    for (const auto& made : {top + "/made", top + "/Library/made"}) {
        EXPECT_TRUE(serviceCan(opens(made, O_CREAT | O_EXCL | O_WRONLY)));
        EXPECT_TRUE(serviceCan([&] { return ::mkdir((made + "-directory").c_str(), 0777) == 0; }));
        EXPECT_TRUE(canAs(serviceUser + 1, groupIdForUUID(groupUUIDForName("systemusers").value()).value(), [&] {
            return opens(made, O_RDWR)() && opens(made + "-directory/inside", O_CREAT | O_WRONLY)();
        }));
        EXPECT_FALSE(nobodyCan(opens(made, O_RDONLY)));
        EXPECT_FALSE(nobodyCan(lists(made + "-directory")));
    }
    EXPECT_EQ(modeOf(top), 01775U) << "owner and others keep their bits, the group bits show the mask";
}

TEST_F(AccessControlListTest, HandsEntriesDownToDirectoriesOfTheDaemon) {
    ASSERT_TRUE(makeACL(topLevel).apply(open(top).get()));
    const auto made = top + "/tmp";
    ASSERT_EQ(::mkdir(made.c_str(), 0), 0);
    EXPECT_FALSE(serviceCan(lists(made))) << "the mode masks what the kernel hands down";
    EXPECT_EQ(applyInheritedEntries(open(top).get(), open(made).get()), true);
    ASSERT_EQ(::chown(made.c_str(), unprivileged, unprivileged), 0);
    EXPECT_TRUE(serviceCan(opens(made + "/file", O_CREAT | O_WRONLY)));
    EXPECT_FALSE(nobodyCan(lists(made)));

    EXPECT_EQ(applyInheritedEntries(open("/").get(), open(made).get()), false);
}

TEST_F(AccessControlListTest, KeepsTheMaskAndTheEntriesWhenTheModeChanges) {
    const auto path = top + "/Library/data";
    standardize(path, file);
    const auto item = open(path);
    ASSERT_TRUE(setModeKeepingMask(item.get(), 01640));
    EXPECT_EQ(modeOf(path), 01670U);
    EXPECT_TRUE(serviceCan(opens(path, O_RDWR)));
    ASSERT_EQ(::chown(path.c_str(), unprivileged, nobody), 0);
    EXPECT_TRUE(nobodyCan(opens(path, O_RDONLY))) << "the owning group has what the mode gave it";
    EXPECT_FALSE(nobodyCan(opens(path, O_RDWR)));

    // An ACL applied again starts from the owning group's own bits, not from the mask.
    ASSERT_TRUE(makeACL(file).apply(item.get()));
    EXPECT_FALSE(nobodyCan(opens(path, O_RDWR)));
    // Without entries the item is back to its mode.
    ASSERT_TRUE(makeACL({}).apply(item.get()));
    EXPECT_EQ(modeOf(path), 01640U);
    ASSERT_TRUE(setModeKeepingMask(item.get(), 0604));
    EXPECT_EQ(modeOf(path), 0604U);
}

TEST_F(AccessControlListTest, ReplacesWhatADirectoryHandsDown) {
    const FileDescriptor item(::open(top.c_str(), O_RDONLY | O_DIRECTORY));
    ASSERT_TRUE(makeACL(directory).apply(item.get()));
    ASSERT_GT(::fgetxattr(item.get(), "system.posix_acl_default", nullptr, 0), 0);
    ASSERT_TRUE(makeACL(file).apply(item.get()));
    EXPECT_EQ(::fgetxattr(item.get(), "system.posix_acl_default", nullptr, 0), -1);
    EXPECT_TRUE(makeACL(file).apply(item.get()));
}

TEST_F(AccessControlListTest, LeavesWhatASymbolicLinkPointsAtAlone) {
    const auto link = top + "/link";
    ASSERT_EQ(::symlink("Library", link.c_str()), 0);
    const auto item = open(link);
    EXPECT_TRUE(makeACL(directory).apply(item.get()));
    EXPECT_TRUE(setModeKeepingMask(item.get(), 0));
    EXPECT_EQ(modeOf(top + "/Library"), 0755U);
}

TEST_F(AccessControlListTest, RefusesWhatTheModelDoesNotHave) {
    auto acl = AccessControlList::create(1).value();
    auto* entry = acl.createEntry().value();
    EXPECT_EQ(entry->addPermissions(0x1).error(), EINVAL);
    EXPECT_EQ(entry->addFlags(0x1000).error(), EINVAL);
    EXPECT_EQ(entry->setTag(2).error(), EINVAL);
    EXPECT_EQ(entry->setQualifier(UUID::generate()).error(), EINVAL);
    EXPECT_EQ(AccessControlList::create(129).error(), EINVAL);
    while (acl.entries().size() < AccessControlList::maximumEntries)
        ASSERT_TRUE(acl.createEntry());
    EXPECT_EQ(acl.createEntry().error(), ENOMEM);
    EXPECT_EQ(acl.apply(-1).error(), EBADF);
}

TEST_F(AccessControlListTest, NamesGroupsByStableUUIDs) {
    const auto uuid = groupUUIDForName("systemusers").value();
    EXPECT_EQ(uuid, groupUUIDForName("systemusers").value());
    EXPECT_EQ(groupNameForUUID(uuid).value(), "systemusers");
    EXPECT_EQ(groupUUIDForName("strangers").error(), ENOENT);
    EXPECT_EQ(groupNameForUUID(UUID::generate()).error(), ENOENT);
}

} // namespace
} // namespace ost::platform
