#include "Client/ctl/DeathRow.h"

#include "Client/DeviceFiles.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <functional>
#include <memory>

namespace ostrand::ctl {

namespace {

using ost::platform::Errno;
using ost::platform::FileDescriptor;
using ost::platform::pathByAppending;

constexpr unsigned deepest = 200; ///< each level holds a descriptor
constexpr std::uint64_t blockSize = 512;

using DirectoryStream = std::unique_ptr<DIR, int (*)(DIR*)>;

DirectoryStream streamOf(FileDescriptor directory) {
    DirectoryStream stream(::fdopendir(directory.get()), ::closedir);
    if (stream)
        (void)directory.release();
    return stream;
}

void forEachName(DIR* directory, const std::function<void(const char*)>& visit) {
    while (const auto* const entry = ::readdir(directory)) {
        const std::string_view name = entry->d_name;
        if (name != "." && name != "..")
            visit(entry->d_name);
    }
}

FileDescriptor openDirectory(int parent, const char* name) {
    return FileDescriptor(::openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
}

/// Adds up what lies in a directory and below. An item that goes meanwhile counts or does not.
void measure(FileDescriptor directory, CondemnedItem& item, unsigned depth) {
    const auto stream =
        directory && depth < deepest ? streamOf(std::move(directory)) : DirectoryStream(nullptr, ::closedir);
    if (!stream) {
        item.measured = false;
        return;
    }
    const int parent = ::dirfd(stream.get());
    forEachName(stream.get(), [&](const char* name) {
        struct stat status{};
        if (::fstatat(parent, name, &status, AT_SYMLINK_NOFOLLOW) != 0)
            return;
        if (S_ISDIR(status.st_mode))
            return measure(openDirectory(parent, name), item, depth + 1);
        ++item.files;
        item.bytes += static_cast<std::uint64_t>(status.st_blocks) * blockSize / std::max<nlink_t>(status.st_nlink, 1);
    });
}

std::string identifierOf(const DeviceFiles& files, const char* name) {
    const auto bytes =
        files.content(pathByAppending(pathByAppending(deathRowDirectory, name), metadataName), largestMetadata);
    const auto metadata = bytes ? dictionaryIn(*bytes) : std::nullopt;
    const auto* const identifier = metadata ? metadata->find("OSTMetadataIdentifier") : nullptr;
    return identifier && identifier->asString() ? *identifier->asString() : "";
}

CondemnedItem lookAt(const DeviceFiles& files, int parent, const char* name) {
    CondemnedItem item{.name = name, .identifier = {}};
    auto directory = openDirectory(parent, name);
    if (!directory) {
        item.files = 1;
        item.measured = errno == ENOTDIR || errno == ELOOP;
        return item;
    }
    item.identifier = identifierOf(files, name);
    measure(std::move(directory), item, 0);
    return item;
}

std::expected<DirectoryStream, Errno> openDeathRow(const DeviceFiles& files) {
    auto directory = files.open(deathRowDirectory, O_RDONLY | O_DIRECTORY);
    if (!directory && directory.error() == ENOENT)
        return DirectoryStream(nullptr, ::closedir);
    auto stream = streamOf(OST_TRY(std::move(directory)));
    if (!stream)
        return std::unexpected(errno);
    return stream;
}

} // namespace

std::expected<std::vector<CondemnedItem>, Errno> deathRowOf(const std::string& device) {
    const auto files = OST_TRY(DeviceFiles::of(device));
    const auto stream = OST_TRY(openDeathRow(files));
    std::vector<CondemnedItem> items;
    if (stream)
        forEachName(stream.get(),
                    [&](const char* name) { items.push_back(lookAt(files, ::dirfd(stream.get()), name)); });
    std::ranges::sort(items, std::greater(), &CondemnedItem::bytes);
    return items;
}

std::size_t deathRowLength(const std::string& device) {
    const auto files = DeviceFiles::of(device);
    const auto stream = files ? openDeathRow(*files) : std::unexpected(files.error());
    std::size_t length = 0;
    if (stream && *stream)
        forEachName(stream->get(), [&](const char*) { ++length; });
    return length;
}

} // namespace ostrand::ctl
