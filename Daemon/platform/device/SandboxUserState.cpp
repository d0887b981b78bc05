#include "platform/device/SandboxUserState.h"

#include "platform/base/DirectoryNames.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/FileName.h"
#include "platform/base/Path.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"
#include "platform/device/ExtendedAttributes.h"
#include "platform/threads/BlockingSection.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <string>

namespace ost::platform {

namespace {

constexpr const char* noteAttribute = "trusted.ostrand.sandbox-item";

/// Makes a link under a name that nothing else has, and gives the name. A crash may have left such a link behind, made
/// by a process that had our number.
std::expected<std::string, Errno> makeTemporaryLink(int directory, const std::string& path) {
    static std::atomic<unsigned> links = 0;
    for (;;) {
        auto name = "." + std::to_string(::getpid()) + "." + std::to_string(links++);
        if (::symlinkat(path.c_str(), directory, name.c_str()) == 0)
            return name;
        if (errno != EEXIST)
            return std::unexpected(errno);
    }
}

/// Waits until the names in the directory at `path` below `parent` are on disk.
std::expected<void, Errno> makeNamesDurable(int parent, const char* path) {
    const FileDescriptor directory(::openat(parent, path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    const BlockingSection blocking;
    if (!directory || ::fsync(directory.get()) != 0)
        return std::unexpected(errno);
    return {};
}

std::expected<FileDescriptor, Errno> openOrMake(int parent, const std::string& name) {
    constexpr mode_t searchable = 0755;
    constexpr int flags = O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    FileDescriptor directory(::openat(parent, name.c_str(), flags));
    if (!directory && errno == ENOENT) {
        if (::mkdirat(parent, name.c_str(), searchable) != 0 && errno != EEXIST)
            return std::unexpected(errno);
        const std::string holder(pathByDeletingLastComponent(name));
        OST_TRY(makeNamesDurable(parent, holder.empty() ? "." : holder.c_str()));
        directory.reset(::openat(parent, name.c_str(), flags));
    }
    if (!directory)
        return std::unexpected(errno);
    return directory;
}

/// Calls `act` with each item of a directory and with the directory itself.
void forEachItem(int parent, const std::string& name, const auto& act) {
    const auto directory = openWithoutLinks(parent, name.c_str(), O_RDONLY | O_DIRECTORY);
    const auto names = directory ? plainNames(*directory) : std::unexpected(directory.error());
    for (const auto& item : names.value_or(std::vector<std::string>()))
        act(directory->get(), item);
}

/// The path of a link at which nothing is; none also when that cannot be told.
std::optional<std::string> danglingPath(int directory, const std::string& link) {
    std::array<char, PATH_MAX> path;
    const auto length = ::readlinkat(directory, link.c_str(), path.data(), path.size() - 1);
    if (length <= 0)
        return std::nullopt;
    path[static_cast<std::size_t>(length)] = '\0';
    const bool dangles = ::faccessat(AT_FDCWD, path.data(), F_OK, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT;
    return dangles ? std::optional<std::string>(path.data()) : std::nullopt;
}

std::expected<FileDescriptor, Errno> openExistingItems(std::uint32_t userId, std::uint64_t type, int access) {
    const auto path = std::string(sandboxStateDirectory) + "/" + std::to_string(userId) + "/" + std::to_string(type);
    return openWithoutLinks(AT_FDCWD, path.c_str(), access | O_DIRECTORY);
}

/// The directory of a user's items of one type, which is there as a rule.
std::expected<FileDescriptor, Errno> openItems(std::uint32_t userId, std::uint64_t type) {
    if (auto existing = openExistingItems(userId, type, O_PATH))
        return existing;
    const auto user = std::to_string(userId), items = std::to_string(type);
    const auto top = OST_TRY(openOrMake(AT_FDCWD, sandboxStateDirectory));
    const auto ofUser = OST_TRY(openOrMake(top.get(), user));
    return openOrMake(ofUser.get(), items);
}

} // namespace

std::expected<void, Errno> setSandboxUserStateItem(std::uint32_t userId, std::uint64_t type, std::string_view key,
                                                   std::optional<std::string_view> path) {
    const auto items = OST_TRY(openItems(userId, type));
    const auto name = fileNameForKey(key);
    if (!path) {
        if (::unlinkat(items.get(), name.c_str(), 0) != 0 && errno != ENOENT)
            return std::unexpected(errno);
        return {};
    }
    const auto temporary = OST_TRY(makeTemporaryLink(items.get(), std::string(*path)));
    if (::renameat(items.get(), temporary.c_str(), items.get(), name.c_str()) != 0) {
        const int error = errno;
        ::unlinkat(items.get(), temporary.c_str(), 0);
        return std::unexpected(error);
    }
    return makeNamesDurable(items.get(), ".");
}

std::expected<void, Errno> noteSandboxUserStateItem(std::uint32_t userId, std::uint64_t type, int container) {
    OST_TRY(openItems(userId, type)); // without which nobody looks for notes
    constexpr std::array<std::byte, 1> note{std::byte{'1'}};
    return setAttribute(container, noteAttribute, note);
}

bool hasNoteOfSandboxUserStateItem(int container) {
    std::array<std::byte, 1> note;
    return getAttribute(container, noteAttribute, note).has_value();
}

std::optional<std::set<std::string>> keysOfSandboxUserStateItems(std::uint32_t userId, std::uint64_t type) {
    const auto items = openExistingItems(userId, type, O_RDONLY);
    const auto names = items ? plainNames(*items) : std::unexpected(items.error());
    if (!names)
        return std::nullopt;
    std::set<std::string> keys;
    for (const auto& name : *names)
        if (auto key = keyOfFileName(name))
            keys.insert(*std::move(key));
    return keys;
}

void removeUnfinishedSandboxUserStateItems() {
    forEachItem(AT_FDCWD, sandboxStateDirectory, [](int top, const std::string& user) {
        forEachItem(top, user, [](int ofUser, const std::string& type) {
            const auto items = openWithoutLinks(ofUser, type.c_str(), O_RDONLY | O_DIRECTORY);
            const auto names = items ? hiddenNames(*items) : std::unexpected(items.error());
            for (const auto& name : names.value_or(std::vector<std::string>()))
                ::unlinkat(items->get(), name.c_str(), 0);
        });
    });
}

std::vector<SandboxUserStateItem> danglingSandboxUserStateItems() {
    std::vector<SandboxUserStateItem> items;
    forEachItem(AT_FDCWD, sandboxStateDirectory, [&](int top, const std::string& user) {
        forEachItem(top, user, [&](int ofUser, const std::string& type) {
            forEachItem(ofUser, type, [&](int ofType, const std::string& name) {
                const auto userId = numberIn<std::uint32_t>(user);
                const auto number = numberIn<std::uint64_t>(type);
                const auto key = keyOfFileName(name);
                if (auto path = danglingPath(ofType, name); path && userId && number && key)
                    items.push_back({*userId, *number, *key, *std::move(path)});
            });
        });
    });
    return items;
}

} // namespace ost::platform
