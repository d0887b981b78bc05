#include "Client/DeviceFiles.h"

#include "platform/base/Try.h"
#include "platform/codec/PropertyList.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <memory>

namespace ostrand {

using ost::platform::Errno;
using ost::platform::FileDescriptor;

std::expected<DeviceFiles, Errno> DeviceFiles::of(const std::string& device) {
    FileDescriptor root(::open(device.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!root)
        return std::unexpected(errno);
    return DeviceFiles(std::move(root));
}

std::expected<FileDescriptor, Errno> DeviceFiles::open(const std::string& path, int flags) const {
    return ost::platform::openWithoutLinks(_root.get(), path.substr(1).c_str(), flags | O_NONBLOCK | O_NOCTTY);
}

std::expected<std::vector<std::string>, Errno> DeviceFiles::names(const std::string& path) const {
    auto directory = open(path, O_RDONLY | O_DIRECTORY);
    if (!directory && directory.error() == ENOENT)
        return std::vector<std::string>();
    const int descriptor = OST_TRY(std::move(directory)).release();
    const std::unique_ptr<DIR, int (*)(DIR*)> stream(::fdopendir(descriptor), ::closedir);
    std::vector<std::string> names;
    while (const auto* const entry = ::readdir(stream.get()))
        if (entry->d_name[0] != '.')
            names.emplace_back(entry->d_name);
    std::ranges::sort(names);
    return names;
}

std::expected<std::string, Errno> DeviceFiles::content(const std::string& path, std::size_t largest) const {
    const auto file = OST_TRY(open(path, O_RDONLY));
    struct stat status{};
    if (::fstat(file.get(), &status) != 0)
        return std::unexpected(errno);
    if (!S_ISREG(status.st_mode))
        return std::unexpected(EINVAL);
    if (static_cast<std::size_t>(status.st_size) > largest)
        return std::unexpected(EFBIG);
    std::string bytes(static_cast<std::size_t>(status.st_size), '\0');
    const auto count = ::pread(file.get(), bytes.data(), bytes.size(), 0);
    if (count < 0)
        return std::unexpected(errno);
    bytes.resize(static_cast<std::size_t>(count));
    return bytes;
}

std::optional<std::string> DeviceFiles::linkTarget(const std::string& path) const {
    const auto link =
        ost::platform::openWithoutLinks(_root.get(), path.substr(1, path.rfind('/') - 1).c_str(), O_PATH | O_DIRECTORY);
    std::string target(PATH_MAX, '\0');
    const auto length =
        link ? ::readlinkat(link->get(), path.c_str() + path.rfind('/') + 1, target.data(), target.size()) : -1;
    if (length < 0)
        return std::nullopt;
    target.resize(static_cast<std::size_t>(length));
    return target;
}

std::expected<struct stat, Errno> DeviceFiles::status(const std::string& path) const {
    const auto item = OST_TRY(ost::platform::openWithoutLinks(_root.get(), path.substr(1).c_str(), O_PATH));
    struct stat found{};
    if (::fstat(item.get(), &found) != 0)
        return std::unexpected(errno);
    return found;
}

std::optional<ost::OSTDictionary> dictionaryIn(std::string_view bytes) {
    const auto value = ost::platform::parsePropertyList(bytes);
    return value && value->asDictionary() ? std::optional(*value->asDictionary()) : std::nullopt;
}

} // namespace ostrand
