#include "platform/device/MountTable.h"

#include "platform/base/FileDescriptor.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <optional>
#include <string_view>

namespace ost::platform {

namespace {

/// Thousands of mounts. A user may make many more in a name space of his own, to keep those busy who look.
constexpr std::size_t longestTable = std::size_t{4} << 20;
constexpr std::size_t readAtATime = std::size_t{64} << 10;

/// The kernel does not say beforehand how long it is.
std::expected<std::string, Errno> readTable(int process) {
    const FileDescriptor file(::openat(process, "mountinfo", O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!file)
        return std::unexpected(errno);
    std::string table;
    while (table.size() <= longestTable) {
        const auto have = table.size();
        table.resize(have + readAtATime);
        const auto count = ::read(file.get(), table.data() + have, readAtATime);
        if (count < 0 && errno != EINTR)
            return std::unexpected(errno);
        table.resize(have + static_cast<std::size_t>(std::max<ssize_t>(count, 0)));
        if (count == 0)
            return table;
    }
    return std::unexpected(EFBIG);
}

struct Line {
    std::uint64_t id = 0;
    dev_t device = 0;
    Mount mount;
};

/// "36 35 98:0 /root /mounted/here rw,nosuid shared:1 - ext4 /dev/root rw": blanks in paths are written otherwise.
std::optional<Line> parse(std::string_view text) {
    const auto id = numberIn<std::uint64_t>(takeUntil(text, ' '));
    takeUntil(text, ' '); // the parent
    auto device = takeUntil(text, ' ');
    const auto major = numberIn<unsigned>(takeUntil(device, ':'));
    const auto minor = numberIn<unsigned>(device);
    takeUntil(text, ' '); // where in the file system
    takeUntil(text, ' '); // where in the tree
    auto options = takeUntil(text, ' ');
    while (!text.empty() && takeUntil(text, ' ') != "-") {
    }
    if (!id || !major || !minor || text.empty())
        return std::nullopt;
    Line line{
        .id = *id, .device = ::makedev(*major, *minor), .mount = {.fileSystem = std::string(takeUntil(text, ' '))}};
    while (!options.empty())
        line.mount.forbidsSetUserId |= takeUntil(options, ',') == "nosuid";
    return line;
}

} // namespace

std::expected<Mount, Errno> findMount(int process, std::uint64_t mountId, dev_t device) {
    const auto table = OST_TRY(readTable(process));
    std::optional<Mount> ofDevice;
    for (std::string_view rest = table; !rest.empty();) {
        auto line = parse(takeUntil(rest, '\n'));
        if (line && line->id == mountId)
            return std::move(line->mount);
        if (line && line->device == device && !ofDevice)
            ofDevice = std::move(line->mount);
    }
    if (ofDevice)
        return *std::move(ofDevice);
    return std::unexpected(ENOENT);
}

} // namespace ost::platform
