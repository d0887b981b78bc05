#include "Client/Confinement.h"

#include <sys/stat.h>
#include <sys/syscall.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>

namespace ostrand {

using ost::platform::Errno;
using ost::platform::FileDescriptor;

namespace {

// The kernel's interface, which the headers of a host need not have, or only in part.

namespace right {
constexpr std::uint64_t execute = 1U << 0U;
constexpr std::uint64_t writeFile = 1U << 1U;
constexpr std::uint64_t readFile = 1U << 2U;
constexpr std::uint64_t readDirectory = 1U << 3U;
constexpr std::uint64_t removeDirectory = 1U << 4U;
constexpr std::uint64_t removeFile = 1U << 5U;
constexpr std::uint64_t makeDirectory = 1U << 7U;
constexpr std::uint64_t makeRegular = 1U << 8U;
constexpr std::uint64_t makeSocket = 1U << 9U;
constexpr std::uint64_t makeFIFO = 1U << 10U;
constexpr std::uint64_t makeLink = 1U << 12U;
constexpr std::uint64_t refer = 1U << 13U;         // to move and link between directories
constexpr std::uint64_t truncate = 1U << 14U;      // by path
constexpr std::uint64_t controlDevice = 1U << 15U; // ioctl
} // namespace right

constexpr std::uint64_t abstractSocketScope = 1U << 0U;
constexpr std::uint64_t signalScope = 1U << 1U;

/// The number of rights that a version knows: those of the first `count` bits.
constexpr int rightCount(int version) { return version >= 5 ? 16 : std::clamp(version, 1, 3) + 12; }
constexpr int firstVersionWithScopes = 6;

struct RulesetAttributes {
    std::uint64_t handledFileAccess;
    std::uint64_t handledNetworkAccess;
    std::uint64_t scoped;
};

struct [[gnu::packed]] PathRule {
    std::uint64_t allowed;
    std::int32_t file;
};

constexpr unsigned versionFlag = 1;
constexpr int pathRule = 1;

long createRuleset(const RulesetAttributes* attributes, std::size_t size, unsigned flags) {
    return ::syscall(SYS_landlock_create_ruleset, attributes, size, flags);
}

constexpr std::uint64_t fileRights =
    right::execute | right::writeFile | right::readFile | right::truncate | right::controlDevice;

constexpr std::uint64_t rightsOf(FileAccess access) {
    constexpr auto read = right::readFile | right::readDirectory;
    switch (access) {
    case FileAccess::readAndExecute:
        return read | right::execute;
    case FileAccess::read:
        return read;
    case FileAccess::readAndWrite:
        return read | right::writeFile | right::truncate | right::controlDevice;
    case FileAccess::own:
        return read | right::writeFile | right::truncate | right::removeDirectory | right::removeFile |
               right::makeDirectory | right::makeRegular | right::makeSocket | right::makeFIFO | right::makeLink |
               right::refer;
    }
    return 0;
}

} // namespace

int Confinement::version() { return static_cast<int>(std::max(createRuleset(nullptr, 0, versionFlag), 0L)); }

std::expected<Confinement, Errno> Confinement::create() {
    const int known = version();
    if (known == 0)
        return std::unexpected(EOPNOTSUPP);
    RulesetAttributes attributes{};
    attributes.handledFileAccess = (std::uint64_t{1} << static_cast<unsigned>(rightCount(known))) - 1;
    if (known >= firstVersionWithScopes)
        attributes.scoped = abstractSocketScope | signalScope;
    // An old kernel knows only the beginning of the structure; the rest is then zero, which it accepts.
    FileDescriptor rules(static_cast<int>(createRuleset(&attributes, sizeof attributes, 0)));
    if (!rules)
        return std::unexpected(errno);
    return Confinement(std::move(rules), attributes.handledFileAccess);
}

std::expected<void, Errno> Confinement::allow(int file, FileAccess access) {
    struct stat status{};
    if (::fstat(file, &status) != 0)
        return std::unexpected(errno);
    const auto applicable = S_ISDIR(status.st_mode) ? _handled : _handled & fileRights;
    const PathRule rule{.allowed = rightsOf(access) & applicable, .file = file};
    if (::syscall(SYS_landlock_add_rule, _rules.get(), pathRule, &rule, 0) != 0)
        return std::unexpected(errno);
    return {};
}

std::expected<void, Errno> Confinement::enter() const noexcept {
    if (::syscall(SYS_landlock_restrict_self, _rules.get(), 0) != 0)
        return std::unexpected(errno);
    return {};
}

} // namespace ostrand
