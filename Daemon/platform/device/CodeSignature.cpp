#include "platform/device/CodeSignature.h"

#include "Protocol/OSTKeys.h"
#include "platform/codec/PropertyList.h"
#include "platform/device/ExtendedAttributes.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/vfs.h>
#include <sys/xattr.h>

#include <algorithm>
#include <array>
#include <cerrno>

namespace ost::platform {

namespace {

/// What ordinary signatures fit into. The kernel allocates and clears as much as its caller has room for, so the first
/// question has room for little.
constexpr std::size_t ordinarySignature = 1024;

/// Those that date every change of an extended attribute; tmpfs does since Linux 6.1.
constexpr std::array<long, 4> datingFileSystems = {EXT4_SUPER_MAGIC, XFS_SUPER_MAGIC, BTRFS_SUPER_MAGIC, TMPFS_MAGIC};

bool isTrustworthy(const struct stat& status) {
    return S_ISREG(status.st_mode) && status.st_uid == 0 && (status.st_mode & (S_IWGRP | S_IWOTH)) == 0;
}

} // namespace

std::expected<RawCodeSignature, Errno> readCodeSignature(int fd, std::span<char> buffer) {
    struct stat status{};
    if (::fstat(fd, &status) != 0)
        return std::unexpected(errno);
    return readCodeSignature(fd, status, buffer);
}

std::expected<RawCodeSignature, Errno> readCodeSignature(int fd, const struct stat& status, std::span<char> buffer) {
    RawCodeSignature signature{.bytes = {}, .device = status.st_dev};
    if (!isTrustworthy(status))
        return signature;
    const auto ordinary = std::min(ordinarySignature, buffer.size());
    const auto space = std::as_writable_bytes(buffer);
    auto size = getAttribute(fd, codeSignatureAttribute, space.first(ordinary));
    if (!size && size.error() == ERANGE)
        size = getAttribute(fd, codeSignatureAttribute, space);
    if (!size && size.error() != ENODATA && size.error() != ENOTSUP)
        return std::unexpected(size.error());
    if (size)
        signature.bytes = {buffer.data(), *size};
    return signature;
}

SignatureFileSystem signatureFileSystem(int fd) {
    struct statfs fileSystem{};
    if (::fstatfs(fd, &fileSystem) != 0)
        return {};
    const auto type = fileSystem.f_type;
    // What a user mounts never lets set-user-id bits count; what an administrator mounts may.
    return {.ofUser = type == FUSE_SUPER_MAGIC && (fileSystem.f_flags & ST_NOSUID) != 0,
            .showsChanges = std::ranges::find(datingFileSystems, type) != datingFileSystems.end()};
}

CodeSigningIdentity parseCodeSignature(std::string_view raw) {
    CodeSigningIdentity identity;
    if (raw.empty())
        return identity;
    const auto value = parsePropertyList(raw);
    const auto* const signature = value ? value->asDictionary() : nullptr;
    if (!signature)
        return identity;
    if (const auto* const identifier = signature->find(signatureKey::identifier); identifier && identifier->asString())
        identity.identifier = *identifier->asString();
    if (const auto* const entitlements = signature->find(signatureKey::entitlements))
        identity.entitlements = entitlements->sharedDictionary();
    return identity;
}

std::expected<FileDescriptor, Errno> openProgram(const std::string& path) {
    FileDescriptor program(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY));
    struct stat status{};
    if (!program || ::fstat(program.get(), &status) != 0)
        return std::unexpected(errno);
    if (!S_ISREG(status.st_mode))
        return std::unexpected(EINVAL);
    return program;
}

std::expected<void, Errno> writeCodeSignature(int fd, const OSTDictionary& signature) {
    const auto raw = serializeBinaryPropertyList(signature);
    if (::fsetxattr(fd, codeSignatureAttribute, raw.data(), raw.size(), 0) != 0)
        return std::unexpected(errno);
    return {};
}

} // namespace ost::platform
