#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/OSTValue.h"

#include <sys/stat.h>

#include <cstddef>
#include <expected>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ostrand {

/// Reads paths of a device, none of them through a link, and waits for nobody. Paths are absolute there.
///
/// Threads: any. Failures are errnos.
class DeviceFiles {
public:
    /// Those of the device with that directory.
    [[nodiscard]] static std::expected<DeviceFiles, ost::platform::Errno> of(const std::string& device);

    [[nodiscard]] std::expected<ost::platform::FileDescriptor, ost::platform::Errno> open(const std::string& path,
                                                                                          int flags) const;

    /// The names in a directory, without hidden ones, sorted; none when there is no directory.
    [[nodiscard]] std::expected<std::vector<std::string>, ost::platform::Errno> names(const std::string& path) const;

    /// The bytes of a regular file. Fails with EINVAL for anything else, with EFBIG for more than `largest` bytes.
    [[nodiscard]] std::expected<std::string, ost::platform::Errno> content(const std::string& path,
                                                                           std::size_t largest) const;

    [[nodiscard]] std::optional<std::string> linkTarget(const std::string& path) const;

    [[nodiscard]] std::expected<struct stat, ost::platform::Errno> status(const std::string& path) const;

private:
    explicit DeviceFiles(ost::platform::FileDescriptor root) : _root(std::move(root)) {}

    ost::platform::FileDescriptor _root;
};

inline constexpr const char* deathRowDirectory = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead";

/// The file in each container that says what it is.
inline constexpr const char* metadataName = ".com.tamarok.ostrand.metadata.plist";
inline constexpr std::size_t largestMetadata = std::size_t{1} << 20U;

/// The dictionary that a property list is.
[[nodiscard]] std::optional<ost::OSTDictionary> dictionaryIn(std::string_view bytes);

} // namespace ostrand
