#include "support/DeviceTest.h"

#include "Device/DeviceImage.h"
#include "Support/ScratchDirectory.h"
#include "support/Sanitized.h"

#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <vector>

namespace ost::test {

namespace {

constexpr const char* classAttribute = "trusted.ostrand.protection-class";

/// A test must not go on outside its device: it would act on the host.
template<typename Value, typename Error>
Value require(std::expected<Value, Error> result) {
    if (result)
        return *std::move(result);
    if constexpr (requires { result.error().description(); })
        std::fprintf(stderr, "%s\n", result.error().description().c_str());
    else
        std::perror("Failed to change root");
    std::_Exit(EXIT_FAILURE);
}

std::string permissions(mode_t mode) {
    std::string text = S_ISDIR(mode) ? "d" : S_ISLNK(mode) ? "l" : S_ISREG(mode) ? "-" : S_ISSOCK(mode) ? "s" : "?";
    for (int bit = 8; bit >= 0; --bit)
        text += (mode >> bit & 1) != 0 ? "xwr"[bit % 3] : '-';
    if ((mode & S_ISUID) != 0)
        text[3] = 's';
    if ((mode & S_ISGID) != 0)
        text[6] = 's';
    if ((mode & S_ISVTX) != 0)
        text[9] = 't';
    return text;
}

std::string treeLine(const std::filesystem::path& item, const std::filesystem::path& top) {
    struct stat status{};
    if (::lstat(item.c_str(), &status) != 0)
        return {};
    std::string line = permissions(status.st_mode) + ' ' + std::to_string(status.st_uid) + ':' +
                       std::to_string(status.st_gid) + ' ' + item.lexically_relative(top).string();
    if (S_ISLNK(status.st_mode))
        line += " -> " + std::filesystem::read_symlink(item).string();
    return line + '\n';
}

} // namespace

DeviceTest::DeviceTest() { _enterDevice(); }

void DeviceTest::_enterDevice() {
    if (::geteuid() != 0)
        GTEST_SKIP() << "A device image can be entered by root only";
    static bool entered = false;
    if (std::exchange(entered, true)) {
        std::fputs("This process is inside a device already: run one test at a time (ctest, --gtest_filter)\n", stderr);
        std::_Exit(EXIT_FAILURE);
    }
    auto image = require(device::DeviceImage::openOrMake(makeScratchDirectory() / "image"));
    require(image.mountDeviceFileSystems());
    if (isSanitized) // for the symbols in their reports
        require(image.mountHostLibraries());
    require(image.changeRoot());
}

void writeFile(const std::filesystem::path& file, std::string_view content, mode_t mode) {
    if (file.has_parent_path())
        std::filesystem::create_directories(file.parent_path());
    std::ofstream stream;
    stream.exceptions(std::ios::failbit | std::ios::badbit);
    stream.open(file, std::ios::binary | std::ios::trunc);
    stream.write(content.data(), static_cast<std::streamsize>(content.size()));
    stream.close();
    std::filesystem::permissions(file, static_cast<std::filesystem::perms>(mode));
}

std::string readFile(const std::filesystem::path& file) {
    std::ifstream stream;
    stream.exceptions(std::ios::failbit | std::ios::badbit);
    stream.open(file, std::ios::binary);
    return {std::istreambuf_iterator<char>(stream), std::istreambuf_iterator<char>()};
}

std::optional<std::string> recordedProtectionClass(const std::filesystem::path& item) {
    std::array<char, 16> text;
    const auto size = ::lgetxattr(item.c_str(), classAttribute, text.data(), text.size());
    return size < 0 ? std::nullopt : std::optional(std::string(text.data(), static_cast<std::size_t>(size)));
}

void recordProtectionClass(const std::filesystem::path& item, const std::string& protectionClass) {
    ASSERT_EQ(::lsetxattr(item.c_str(), classAttribute, protectionClass.data(), protectionClass.size(), 0), 0) << item;
}

std::string tree(const std::filesystem::path& directory) {
    std::vector<std::filesystem::path> items;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(directory))
        items.push_back(entry.path());
    std::ranges::sort(items);
    std::string lines;
    for (const auto& item : items)
        lines += treeLine(item, directory);
    return lines;
}

} // namespace ost::test
