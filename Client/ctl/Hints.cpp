#include "Client/ctl/Hints.h"

#include "Protocol/OSTErrorCode.h"

#include <cerrno>

namespace ostrand::ctl {

namespace {

constexpr std::string_view seeLog = "The daemon's log names the item and the reason: ostrandctl watch --once.";
constexpr std::string_view seeDisk =
    "The daemon's log names the item and the reason (ostrandctl watch --once); is the disk full or read-only?";
constexpr std::string_view askAgain = "Nothing is lost. Ask again; when it stays, see ostrandctl watch --once.";
constexpr std::string_view damaged =
    "The container is not served. ostrandctl check says which it is and what repairs it.";

// NOLINTNEXTLINE(readability-function-size): one case a code, and the compiler sees that none is missing
constexpr std::string_view hintForCode(ost::OSTErrorCode code) {
    switch (code) {
    case ost::OSTErrorCode::success:
        return {};
    case ost::OSTErrorCode::noProcessingResult:
        return "Repair or remove ost_code_signing_info.plist and restart the daemon; ostrandctl watch --once tells "
               "why.";
    case ost::OSTErrorCode::moveAsideFailed:
    case ost::OSTErrorCode::transientRemovalFailed:
    case ost::OSTErrorCode::stagingCreationFailed:
    case ost::OSTErrorCode::moveToLiveFailed:
    case ost::OSTErrorCode::stagingRemovalFailed:
    case ost::OSTErrorCode::moveOldToStagingFailed:
    case ost::OSTErrorCode::replacingMoveFailed:
    case ost::OSTErrorCode::replaceCleanupFailed:
    case ost::OSTErrorCode::moveToDeathRowFailed:
    case ost::OSTErrorCode::mappingWriteFailed:
    case ost::OSTErrorCode::deletionFailed:
        return seeDisk;
    case ost::OSTErrorCode::subDirectoryCreationFailed:
        return "Something else may stand in the place of a directory: ostrandctl show names the container's path.";
    case ost::OSTErrorCode::unexpectedPath:
        return "The container was replaced, wiped or renamed meanwhile: look it up again, then ask again.";
    case ost::OSTErrorCode::invalidObject:
        return "Give a class from 1 to 13 that the command is for, a user whom it fits, and an identifier of at most "
               "1024 bytes: see the command's --help.";
    case ost::OSTErrorCode::metadataUnreadable:
    case ost::OSTErrorCode::metadataInvalid:
    case ost::OSTErrorCode::cacheInconsistent:
    case ost::OSTErrorCode::corruptPropertyList:
        return damaged;
    case ost::OSTErrorCode::destructionFailed:
        return "It stays on death row for the next pass: ostrandctl purge --dry-run shows it, watch --once tells why.";
    case ost::OSTErrorCode::noIdentifier:
        return "Name the container's identifier.";
    case ost::OSTErrorCode::notFound:
        return "ostrandctl list --class C --user U shows what there is; transient ones with --transient.";
    case ost::OSTErrorCode::replacedByItself:
        return "Name two containers that differ.";
    case ost::OSTErrorCode::classesDiffer:
        return "A container can only take the place of one of its own class.";
    case ost::OSTErrorCode::noInfoValue:
        return "ostrandctl info list ID shows the keys that the container has.";
    case ost::OSTErrorCode::alreadyExists:
        return "Name the container that is there with --old, or delete it first.";
    case ost::OSTErrorCode::replaceDescriptionIncomplete:
    case ost::OSTErrorCode::replaceFileInvalid:
        return "The daemon's next start tries again; ostrandctl watch --once tells what is wrong with the file.";
    case ost::OSTErrorCode::dictionaryWriteFailed:
        return "Is the disk full? All info values of one container have room for 1 MiB.";
    case ost::OSTErrorCode::invalidParameter:
        return "Bundles belong to user 33, system containers to 499, all others to users above 500 and to them alone. "
               "Protection class 2 cannot be asked for, nor 4 with --outside-developer.";
    case ost::OSTErrorCode::exceptionCaught:
        return "This is a fault of the daemon: please report it with the lines of ostrandctl watch --once.";
    case ost::OSTErrorCode::cacheRebuildFailed:
        return "Nothing is lost. The user may have no account on the device; else ask again, and when it stays, see "
               "ostrandctl watch --once.";
    case ost::OSTErrorCode::cacheAddFailed:
    case ost::OSTErrorCode::cacheRemoveFailed:
    case ost::OSTErrorCode::invalidCacheInput:
    case ost::OSTErrorCode::countsDiffer:
        return askAgain;
    case ost::OSTErrorCode::moveToNewUUIDFailed:
        return "A container under a well-known name keeps its directory's name.";
    case ost::OSTErrorCode::notEntitled:
        return "Register com.tamarok.security.system-container for it, or, for a system group, "
               "com.tamarok.security.system-groups: ostrandctl codesign register.";
    case ost::OSTErrorCode::usersDiffer:
        return "A container can only take the place of one of the same user.";
    case ost::OSTErrorCode::lockedWithoutRetry:
        return "Unlock the device (ostrandctl device unlock), or let the change wait for it: --retry-if-locked.";
    case ost::OSTErrorCode::ownerChangeFailed:
    case ost::OSTErrorCode::accessControlListFailed:
        return "Everything else was done. The daemon's log names the item: ostrandctl watch --once; then migrate "
               "again.";
    }
    return {};
}

/// An errno that has the number of one of the system's own codes is never told apart from it.
constexpr std::string_view hintForErrno(std::uint64_t number) {
    switch (number) {
    case EDQUOT:
        return "Make room on the device: ostrandctl purge destroys what is deleted, usage shows what is large.";
    case EROFS:
        return "The device is mounted read-only.";
    case EMSGSIZE:
        return "The answer is larger than a message may be.";
    default:
        return seeLog;
    }
}

constexpr std::string_view hintForTransport(std::uint64_t number) {
    switch (number) {
    case ENOENT:
        return "No device is booted there. Name its directory with --device or OSTRAND_DEVICE; systemctl start "
               "ostrandd.socket or ostrand-device boot brings one up.";
    case ECONNREFUSED:
        return "Nobody serves the device's socket: systemctl status ostrandd.socket ostrandd.service.";
    case EACCES:
        return "The device's directory is closed to you: ask as root.";
    case ECONNRESET:
        return "The daemon ended while it answered. It is started again: look whether it was done, then ask again.";
    case ETIMEDOUT:
        return "The daemon takes no connections for the moment: ask again, or see journalctl -u ostrandd.";
    default:
        return "See journalctl -u ostrandd.";
    }
}

} // namespace

std::string_view hintFor(const Error& error) {
    switch (error.kind) {
    case Error::Kind::refused:
        return "A program must be signed for what it asks, and belong to root: ostrandctl sign COPY --identifier ID "
               "--entitlement com.tamarok.private.Ostrand.allowed, with a copy that root alone may execute. The "
               "daemon's log says what was missing.";
    case Error::Kind::transport:
        return hintForTransport(error.code);
    case Error::Kind::failed:
        break;
    }
    const auto code = static_cast<ost::OSTErrorCode>(error.code);
    return ost::meaningOf(code).empty() ? hintForErrno(error.code) : hintForCode(code);
}

} // namespace ostrand::ctl
