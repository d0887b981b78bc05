#include "Client/ctl/DeathRow.h"

#include "platform/base/FileDescriptor.h"
#include "platform/base/Try.h"
#include "platform/codec/PropertyList.h"

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

constexpr const char* deathRow = "private/var/root/Library/Caches/com.tamarok.ostrandd/Dead";
constexpr const char* metadataName = ".com.tamarok.ostrand.metadata.plist";
constexpr std::size_t largestMetadata = std::size_t{1} << 20U;
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

std::string identifierIn(int directory) {
    const FileDescriptor file(::openat(directory, metadataName, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat status{};
    if (!file || ::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode) ||
        static_cast<std::size_t>(status.st_size) > largestMetadata)
        return {};
    std::string bytes(static_cast<std::size_t>(status.st_size), '\0');
    const auto count = ::pread(file.get(), bytes.data(), bytes.size(), 0);
    bytes.resize(static_cast<std::size_t>(std::max<ssize_t>(count, 0)));
    const auto metadata = ost::platform::parsePropertyList(bytes);
    const auto* const dictionary = metadata ? metadata->asDictionary() : nullptr;
    const auto* const identifier = dictionary ? dictionary->find("OSTMetadataIdentifier") : nullptr;
    return identifier && identifier->asString() ? *identifier->asString() : "";
}

CondemnedItem lookAt(int parent, const char* name) {
    CondemnedItem item{.name = name, .identifier = {}};
    auto directory = openDirectory(parent, name);
    if (!directory) {
        item.files = 1;
        item.measured = errno == ENOTDIR || errno == ELOOP;
        return item;
    }
    item.identifier = identifierIn(directory.get());
    measure(std::move(directory), item, 0);
    return item;
}

std::expected<DirectoryStream, Errno> openDeathRow(const std::string& device) {
    const FileDescriptor root(::open(device.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!root)
        return std::unexpected(errno);
    auto directory = ost::platform::openWithoutLinks(root.get(), deathRow, O_RDONLY | O_DIRECTORY);
    if (!directory && directory.error() == ENOENT)
        return DirectoryStream(nullptr, ::closedir);
    auto stream = streamOf(OST_TRY(std::move(directory)));
    if (!stream)
        return std::unexpected(errno);
    return stream;
}

} // namespace

std::expected<std::vector<CondemnedItem>, Errno> deathRowOf(const std::string& device) {
    const auto stream = OST_TRY(openDeathRow(device));
    std::vector<CondemnedItem> items;
    if (stream)
        forEachName(stream.get(), [&](const char* name) { items.push_back(lookAt(::dirfd(stream.get()), name)); });
    std::ranges::sort(items, std::greater(), &CondemnedItem::bytes);
    return items;
}

std::size_t deathRowLength(const std::string& device) {
    const auto stream = openDeathRow(device);
    std::size_t length = 0;
    if (stream && *stream)
        forEachName(stream->get(), [&](const char*) { ++length; });
    return length;
}

} // namespace ostrand::ctl
