#pragma once

#include <gtest/gtest.h>

#include <sys/types.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

namespace ost::test {

/// A test that runs inside a device of its own: its constructor makes a scratch image and changes root into it, with an
/// empty /dev/shm and a /proc, so that the fixed paths of the system are there and harm nobody. The image is removed
/// after the process.
///
/// There is no way back out, hence one such test per process, which is how ctest runs them. Skipped without root.
class DeviceTest : public testing::Test {
protected:
    DeviceTest();

private:
    static void _enterDevice();
};

/// Makes or replaces a file, and the directories above it where they are missing.
void writeFile(const std::filesystem::path& file, std::string_view content, mode_t mode = 0644);

/// The content of a file. Throws when it cannot be read.
std::string readFile(const std::filesystem::path& file);

/// The protection class that an item bears on disk; absent when it bears none.
std::optional<std::string> recordedProtectionClass(const std::filesystem::path& item);
/// Has the item bear that class. The test fails when it cannot.
void recordProtectionClass(const std::filesystem::path& item, const std::string& protectionClass);

/// What lies below a directory, sorted, one line for each item: mode, owner, path relative to `directory`, and where a
/// link points: "drwxr-xr-x 501:501 Data/Application", "lrwxrwxrwx 0:0 link -> target". Links are not followed.
std::string tree(const std::filesystem::path& directory);

} // namespace ost::test
