#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/OSTValue.h"

#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <expected>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace ost::platform {

/// The extended attribute that signs a program: a property list with "Identifier" and "Entitlements", each optional.
/// Only root can write or see attributes of this name space.
inline constexpr const char* codeSignatureAttribute = "trusted.ostrand.signature";

/// The most that Linux keeps in an extended attribute; what a reader offers is therefore always enough.
inline constexpr std::size_t maximumCodeSignature = 65536;

/// What a program's signature says, as far as it is of the right type.
struct CodeSigningIdentity {
    std::optional<std::string> identifier;
    std::shared_ptr<const OSTDictionary> entitlements; ///< null when the program has none
};

/// A signature as it stands on a file.
struct RawCodeSignature {
    std::string_view bytes; ///< empty when the program counts as unsigned
    dev_t device;           ///< the file system it was read from
};

/// Reads the signature of the program `fd`, which may be opened with O_PATH, into `buffer`. It does not count unless
/// the file is a regular one of root that nobody else may write. Fails with the errno of reading it.
[[nodiscard]] std::expected<RawCodeSignature, Errno> readCodeSignature(int fd, std::span<char> buffer);
/// The same for a caller that has just asked for the file's status.
[[nodiscard]] std::expected<RawCodeSignature, Errno> readCodeSignature(int fd, const struct stat& status,
                                                                       std::span<char> buffer);

/// What the file system of a program means for the program's signature.
struct SignatureFileSystem {
    /// Its content, owners and attributes included, is what an unprivileged user says: one mounted by a user with the
    /// help of FUSE. Also said of one that cannot be asked.
    bool ofUser = true;
    /// Every change of an extended attribute shows in the file's time of last change.
    bool showsChanges = false;
};

/// About the file system of the open file `fd`.
[[nodiscard]] SignatureFileSystem signatureFileSystem(int fd);

/// The identity in a raw signature; an empty one when the bytes are no property-list dictionary.
[[nodiscard]] CodeSigningIdentity parseCodeSignature(std::string_view raw);

/// Opens the program at `path` to sign it; a symbolic link or anything but a regular file is refused (ELOOP, EINVAL).
[[nodiscard]] std::expected<FileDescriptor, Errno> openProgram(const std::string& path);

/// Signs the open program `fd`. Fails with an errno, ENOSPC or E2BIG when the file system cannot hold so large a
/// signature.
[[nodiscard]] std::expected<void, Errno> writeCodeSignature(int fd, const OSTDictionary& signature);

} // namespace ost::platform
