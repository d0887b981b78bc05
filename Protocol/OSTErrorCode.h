#pragma once

#include <cstdint>
#include <string_view>

namespace ost {

/// The number that tells a caller how an operation ended. What leaves the daemon is this number alone: one of the
/// system's own codes below, or the errno of an error of the POSIX domain.
enum class OSTErrorCode : std::int64_t {
    noProcessingResult = 0, ///< of code signing: what is registered could not be read, so nothing was done
    success = 1,
    moveAsideFailed = 4,
    transientRemovalFailed = 5,
    subDirectoryCreationFailed = 6,
    stagingCreationFailed = 7,
    moveToLiveFailed = 8,
    stagingRemovalFailed = 9,
    unexpectedPath = 10,
    invalidObject = 11,
    metadataUnreadable = 12,
    moveOldToStagingFailed = 14,
    replacingMoveFailed = 15,
    destructionFailed = 17,
    noIdentifier = 18,
    notFound = 21,
    replacedByItself = 22,
    classesDiffer = 23,
    noInfoValue = 24,
    alreadyExists = 27,
    deletionFailed = 28,
    metadataInvalid = 29,
    replaceDescriptionIncomplete = 33,
    dictionaryWriteFailed = 34,
    replaceFileInvalid = 35,
    replaceCleanupFailed = 36,
    invalidParameter = 38,
    exceptionCaught = 40,
    moveToDeathRowFailed = 41,
    cacheRebuildFailed = 43,
    cacheInconsistent = 44,
    cacheAddFailed = 45,
    cacheRemoveFailed = 46,
    invalidCacheInput = 47,
    moveToNewUUIDFailed = 48,
    notEntitled = 55,
    usersDiffer = 56,
    mappingWriteFailed = 59,
    countsDiffer = 60,
    lockedWithoutRetry = 61,
    ownerChangeFailed = 62,
    accessControlListFailed = 63,
    corruptPropertyList = 2048, ///< of the general domain: a file does not hold the property list that was expected
};

/// The code in words; empty for a number that is none of the system's own.
// NOLINTNEXTLINE(readability-function-size): one case a code, and the compiler sees that none is missing
[[nodiscard]] constexpr std::string_view meaningOf(OSTErrorCode code) {
    switch (code) {
    case OSTErrorCode::noProcessingResult:
        return "the daemon could not read its code-signing file, and did nothing";
    case OSTErrorCode::success:
        return "success";
    case OSTErrorCode::moveAsideFailed:
        return "an item could not be moved out of the way before removal";
    case OSTErrorCode::transientRemovalFailed:
        return "a transient container could not be removed";
    case OSTErrorCode::subDirectoryCreationFailed:
        return "a container's sub-directory could not be created";
    case OSTErrorCode::stagingCreationFailed:
        return "the staging directory of a new container could not be created";
    case OSTErrorCode::moveToLiveFailed:
        return "a staged container could not be moved to its live place";
    case OSTErrorCode::stagingRemovalFailed:
        return "a staging directory could not be removed";
    case OSTErrorCode::unexpectedPath:
        return "a container's path is not what was expected";
    case OSTErrorCode::invalidObject:
        return "user, class, identifier or UUID missing or not acceptable";
    case OSTErrorCode::metadataUnreadable:
        return "the metadata file could not be read";
    case OSTErrorCode::moveOldToStagingFailed:
        return "the old container could not be moved to staging";
    case OSTErrorCode::replacingMoveFailed:
        return "the replacing move failed";
    case OSTErrorCode::destructionFailed:
        return "an item on death row could not be destroyed";
    case OSTErrorCode::noIdentifier:
        return "no identifier was given";
    case OSTErrorCode::notFound:
        return "no such container";
    case OSTErrorCode::replacedByItself:
        return "a container is to be replaced by itself";
    case OSTErrorCode::classesDiffer:
        return "the two containers of a replacement differ in class";
    case OSTErrorCode::noInfoValue:
        return "the container has no info value for the key";
    case OSTErrorCode::alreadyExists:
        return "the destination container already exists";
    case OSTErrorCode::deletionFailed:
        return "deletion failed";
    case OSTErrorCode::metadataInvalid:
        return "the metadata file's content is invalid";
    case OSTErrorCode::replaceDescriptionIncomplete:
        return "the replace operation's description is incomplete";
    case OSTErrorCode::dictionaryWriteFailed:
        return "a dictionary file could not be written";
    case OSTErrorCode::replaceFileInvalid:
        return "the replace file is unreadable or invalid, or its recovery failed";
    case OSTErrorCode::replaceCleanupFailed:
        return "clean-up after a replacement failed";
    case OSTErrorCode::invalidParameter:
        return "invalid parameter";
    case OSTErrorCode::exceptionCaught:
        return "an exception was caught inside the operation";
    case OSTErrorCode::moveToDeathRowFailed:
        return "an item could not be moved to death row";
    case OSTErrorCode::cacheRebuildFailed:
        return "a cache could not be rebuilt";
    case OSTErrorCode::cacheInconsistent:
        return "the cache names a container that has no metadata on disk";
    case OSTErrorCode::cacheAddFailed:
        return "a container could not be added to the cache";
    case OSTErrorCode::cacheRemoveFailed:
        return "a container could not be removed from the cache";
    case OSTErrorCode::invalidCacheInput:
        return "invalid input to the cache";
    case OSTErrorCode::moveToNewUUIDFailed:
        return "a container could not be moved to its new UUID directory";
    case OSTErrorCode::notEntitled:
        return "the client is not entitled to the system container it asks for";
    case OSTErrorCode::usersDiffer:
        return "the two containers of a replacement belong to different users";
    case OSTErrorCode::mappingWriteFailed:
        return "the code-signing mapping file could not be written";
    case OSTErrorCode::countsDiffer:
        return "values and identifiers of a mapping update differ in count";
    case OSTErrorCode::lockedWithoutRetry:
        return "the device was locked and no retry was asked for";
    case OSTErrorCode::ownerChangeFailed:
        return "the owner of a bundle container could not be changed";
    case OSTErrorCode::accessControlListFailed:
        return "an access control list could not be built or applied";
    case OSTErrorCode::corruptPropertyList:
        return "a property-list file could not be read as one";
    }
    return {};
}

} // namespace ost
