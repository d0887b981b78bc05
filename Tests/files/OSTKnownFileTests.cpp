#include "files/OSTKnownFile.h"

#include "Support/ScratchDirectory.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <functional>

namespace ost {
namespace {

namespace fs = std::filesystem;

class KnownFile : public testing::Test {
protected:
    KnownFile() {
        test::writeFile(directory / "file", "x");
        while (lookWithoutDescriptors() == std::unexpected(EMFILE))
            (void)look(); // until the clock has gone on
    }
    [[nodiscard]] std::expected<bool, platform::Errno> look() { return known.look(directory, "file"); }
    std::expected<bool, platform::Errno> lookWithoutDescriptors() {
        rlimit limit{};
        ::getrlimit(RLIMIT_NOFILE, &limit);
        const rlimit none{.rlim_cur = 0, .rlim_max = limit.rlim_max};
        ::setrlimit(RLIMIT_NOFILE, &none);
        const auto found = look();
        ::setrlimit(RLIMIT_NOFILE, &limit);
        return found;
    }

    const fs::path scratch = fs::canonical(test::makeScratchDirectory());
    const fs::path directory = scratch / "directory";
    OSTKnownFile known;
};

TEST_F(KnownFile, ThatIsThereIsSeenWithoutADescriptor) {
    EXPECT_EQ(true, lookWithoutDescriptors());
    test::writeFile(directory / "file", "y");
    EXPECT_EQ(true, look());
}

TEST_F(KnownFile, WhateverTakesItAwayIsSeenAtOnce) {
    const auto another = scratch / "another";
    const std::function<void()> changes[] = {
        [&] { fs::remove(directory / "file"); },
        [&] { fs::rename(directory / "file", directory / "elsewhere"); },
        [&] { fs::remove(directory / "file"), fs::create_symlink(another, directory / "file"); },
        [&] { fs::rename(directory, another); },
        [&] { fs::rename(directory, another), fs::create_directory_symlink(another, directory); },
        [&] { fs::rename(directory, another), fs::create_directory(directory); },
        [&] { fs::rename(directory, another), test::writeFile(directory, ""); },
    };
    int index = 0;
    for (const auto& change : changes) {
        fs::remove_all(another);
        fs::remove_all(directory);
        test::writeFile(directory / "file", "x");
        EXPECT_EQ(true, look());
        change();
        EXPECT_EQ(false, look()) << "change " << index++;
    }
}

} // namespace
} // namespace ost
