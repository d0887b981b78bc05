#include "files/OSTFileManager.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <string>

namespace ost {
namespace {

namespace fs = std::filesystem;

class DiskUsage : public test::DeviceTest {
protected:
    static std::uint64_t usageOf(const fs::path& path) {
        return OSTFileManager::defaultManager().diskUsageForURL(path.string());
    }
    static std::uint64_t allocated(const fs::path& file) {
        struct stat status{};
        EXPECT_EQ(0, ::lstat(file.c_str(), &status));
        return static_cast<std::uint64_t>(status.st_blocks) * 512;
    }
    static constexpr const char* top = "/top";
};

TEST_F(DiskUsage, EveryFileCountsOnceAndNothingElseCounts) {
    test::writeFile("/outside/large", std::string(100'000, 'x'));
    test::writeFile("/top/a/file", std::string(10'000, 'x'));
    test::writeFile("/top/b/c/other", std::string(20'000, 'x'));
    fs::create_hard_link("/top/a/file", "/top/b/same");
    fs::create_hard_link("/outside/large", "/top/b/of-which-one-name-is-inside");
    fs::create_symlink("/outside", "/top/link-to-directory");
    fs::create_directories("/top/empty");
    ASSERT_EQ(0, ::mkfifo("/top/fifo", 0600));
    test::writeFile("/top/sparse", "");
    fs::resize_file("/top/sparse", std::uintmax_t{1} << 40U);
    fs::create_directories("/top/mounted");
    ASSERT_EQ(0, ::mount("none", "/top/mounted", "tmpfs", 0, "size=1m"));
    test::writeFile("/top/mounted/foreign", std::string(50'000, 'x'));

    EXPECT_EQ(allocated("/top/a/file") + allocated("/top/b/c/other") + allocated("/outside/large") +
                  allocated("/top/link-to-directory") + allocated("/top/sparse"),
              usageOf(top));
}

TEST_F(DiskUsage, WhatCannotBeMeasuredIsNothing) {
    test::writeFile("/file", std::string(10'000, 'x'));
    fs::create_symlink("/top", "/link");
    test::writeFile("/top/file", std::string(10'000, 'x'));
    for (const auto* const path : {"", "/absent", "/file", "/link"})
        EXPECT_EQ(0U, usageOf(path)) << path;
}

TEST_F(DiskUsage, TreesMayBeDeeperThanAPathCanBeLong) {
    const std::string name(200, 'd');
    fs::create_directory(top);
    int directory = ::open(top, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    for (int depth = 0; depth < 60; ++depth) {
        ASSERT_EQ(0, ::mkdirat(directory, name.c_str(), 0755));
        const int next = ::openat(directory, name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        ::close(directory);
        directory = next;
    }
    const int file = ::openat(directory, "file", O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    ASSERT_EQ(4, ::write(file, "deep", 4));
    struct stat status{};
    ASSERT_EQ(0, ::fstat(file, &status));
    ::close(file);
    ::close(directory);
    EXPECT_EQ(static_cast<std::uint64_t>(status.st_blocks) * 512, usageOf(top));
}

} // namespace
} // namespace ost
