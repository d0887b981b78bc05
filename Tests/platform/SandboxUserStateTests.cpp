#include "platform/device/SandboxUserState.h"

#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <cerrno>
#include <thread>

namespace ost::platform {
namespace {

namespace fs = std::filesystem;

class SandboxUserState : public test::DeviceTest {
protected:
    static int set(std::uint32_t user, std::uint64_t type, std::string_view key, std::optional<std::string_view> path) {
        const auto done = setSandboxUserStateItem(user, type, key, path);
        return done ? Errno(0) : done.error();
    }
    static std::string state() { return test::tree(sandboxStateDirectory); }
};

TEST_F(SandboxUserState, ItemsAreLinksUnderUserTypeAndEscapedKey) {
    const std::string longest(255, 'x');
    const struct {
        std::string key, name;
    } rows[] = {
        {"org.example.App_1-2", "org.example.App_1-2"},
        {".hidden", "%2Ehidden"},
        {".", "%2E"},
        {"..", "%2E."},
        {"../../etc/passwd", "%2E.%2F..%2Fetc%2Fpasswd"},
        {"a b\n%", "a%20b%0A%25"},
        {std::string("n\0l", 3), "n%00l"},
        {"\xc3\xa9", "%C3%A9"},
        {longest, longest},
    };
    for (const auto& [key, name] : rows) {
        ASSERT_EQ(0, set(501, 1, key, "/private/var/mobile/C 1")) << name;
        EXPECT_EQ("/private/var/mobile/C 1", fs::read_symlink(fs::path(sandboxStateDirectory) / "501/1" / name));
        ASSERT_EQ(0, set(501, 1, key, std::nullopt));
        EXPECT_EQ("drwxr-xr-x 0:0 501\ndrwxr-xr-x 0:0 501/1\n", state()) << name;
        EXPECT_EQ(0, set(501, 1, key, std::nullopt)) << "an absent item is removed without complaint";
    }
    EXPECT_EQ(ENAMETOOLONG, set(501, 1, longest + "x", "/a"));
    EXPECT_EQ(ENAMETOOLONG, set(501, 1, std::string(86, '/'), "/a"));
    EXPECT_EQ("drwxr-xr-x 0:0 501\ndrwxr-xr-x 0:0 501/1\n", state()) << "a failure leaves nothing";
}

TEST_F(SandboxUserState, SettingReplacesOneItemAndNoOther) {
    ASSERT_EQ(0, set(501, 1, "a", "/one"));
    ASSERT_EQ(0, set(501, 2, "a", "/group"));
    ASSERT_EQ(0, set(0, 4, "a", "/system"));
    ASSERT_EQ(0, set(501, 1, "b", "/other"));
    test::writeFile("/victim", "untouched");
    ASSERT_EQ(0, set(501, 1, "a", "/victim"));
    ASSERT_EQ(0, set(501, 1, "a", "/two")) << "the link itself is replaced, not what it means";
    EXPECT_EQ("untouched", test::readFile("/victim"));
    EXPECT_EQ(
        "drwxr-xr-x 0:0 0\ndrwxr-xr-x 0:0 0/4\nlrwxrwxrwx 0:0 0/4/a -> /system\n"
        "drwxr-xr-x 0:0 501\ndrwxr-xr-x 0:0 501/1\nlrwxrwxrwx 0:0 501/1/a -> /two\nlrwxrwxrwx 0:0 501/1/b -> /other\n"
        "drwxr-xr-x 0:0 501/2\nlrwxrwxrwx 0:0 501/2/a -> /group\n",
        state());
}

TEST_F(SandboxUserState, WhatStandsInTheWayIsReported) {
    const fs::path items = fs::path(sandboxStateDirectory) / "501/1";
    fs::create_directories(items / "directory");
    EXPECT_EQ(EISDIR, set(501, 1, "directory", "/a"));
    EXPECT_EQ(EISDIR, set(501, 1, "directory", std::nullopt));
    fs::create_directory_symlink("/tmp", fs::path(sandboxStateDirectory) / "502");
    EXPECT_EQ(ENOTDIR, set(502, 1, "a", "/a"));

    // Links that a crash left behind, of a process with our number.
    for (int i = 0; i < 9; ++i)
        fs::create_symlink("/left", items / ("." + std::to_string(::getpid()) + "." + std::to_string(i)));
    EXPECT_EQ(0, set(501, 1, "a", "/a"));
    removeUnfinishedSandboxUserStateItems();
    EXPECT_EQ("drwxr-xr-x 0:0 501\ndrwxr-xr-x 0:0 501/1\nlrwxrwxrwx 0:0 501/1/a -> /a\n"
              "drwxr-xr-x 0:0 501/1/directory\nlrwxrwxrwx 0:0 502 -> /tmp\n",
              state());
}

TEST_F(SandboxUserState, ItemsAreSetFromAllThreads) {
    std::vector<std::jthread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([t] {
            const auto key = "item." + std::to_string(t);
            for (int i = 0; i < 200; ++i)
                EXPECT_EQ(0, set(static_cast<std::uint32_t>(501 + i % 3), 1, key, "/" + key));
        });
    threads.clear();
    std::string expected;
    for (const std::string user : {"501", "502", "503"}) {
        expected += "drwxr-xr-x 0:0 " + user + "\ndrwxr-xr-x 0:0 " + user + "/1\n";
        for (const std::string item : {"item.0", "item.1", "item.2", "item.3"})
            expected.append("lrwxrwxrwx 0:0 ")
                .append(user)
                .append("/1/")
                .append(item)
                .append(" -> /")
                .append(item + "\n");
    }
    EXPECT_EQ(expected, state());
}

TEST_F(SandboxUserState, TheItemsAtWhosePathsNothingIsAreTold) {
    EXPECT_TRUE(danglingSandboxUserStateItems().empty());
    const std::string key = ".a/%\xc3\xa4";
    EXPECT_EQ(0, set(501, 1, key, "/gone"));
    EXPECT_EQ(0, set(501, 1, "kept", "/tmp"));
    fs::create_symlink("/gone", fs::path(sandboxStateDirectory) / "501/1/%4"); // no key's name
    fs::create_directories(fs::path(sandboxStateDirectory) / "nobody/1");
    const auto items = danglingSandboxUserStateItems();
    ASSERT_EQ(1U, items.size());
    EXPECT_EQ(501U, items[0].userId);
    EXPECT_EQ(1U, items[0].type);
    EXPECT_EQ(key, items[0].key);
    EXPECT_EQ("/gone", items[0].path);
}

} // namespace
} // namespace ost::platform
