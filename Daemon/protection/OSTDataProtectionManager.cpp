#include "protection/OSTDataProtectionManager.h"

#include "model/OSTFailureReport.h"
#include "platform/base/Log.h"
#include "protection/OSTApplicationTerminationAssertion.h"
#include "protection/OSTDataProtectionChangeOperation.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"

#include <memory>
#include <string>
#include <utility>

namespace ost {

namespace {

using ChangeType = OSTDataProtectionChangeType;

/// The classes that have a meaning here.
constexpr std::int32_t classNeverRequested = 2;
constexpr std::int32_t highestClassOfOtherDevelopers = 3;
constexpr std::int32_t classWithoutKeys = 0;

std::int32_t recordedClass(const OSTMetadata& metadata) {
    const auto* const value = metadata.info ? metadata.info->find(OSTContentProtectionClassKey) : nullptr;
    const auto number = value ? value->unsignedValue() : std::nullopt;
    return number ? static_cast<std::int32_t>(*number) : OSTDefaultContentProtectionClass;
}

/// The live container that the request names.
OSTResult<OSTMetadataRecord> containerOf(const OSTDataProtectionRequest& request) {
    const auto& [userId, containerClass, identifier, transient] = request.container;
    if (!identifier || !isPerUserClass(containerClass))
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                              "Can't act on an invalid object: userId: %u, ID: %@, class: %ld", userId,
                                              identifier, containerClass));
    auto found = OSTContainerCache::sharedInstance().containerForUser({userId, containerClass, identifier});
    if (!found)
        return std::unexpected(OSTCreateError(OSTErrorCode::notFound, found.error(),
                                              "No Container with userId: %u, identifier: %@, Class: %ld", userId,
                                              identifier, containerClass));
    return found;
}

OSTResult<void> checkClass(const OSTDataProtectionRequest& request) {
    const auto requested = request.dataProtectionClass;
    if (requested == classNeverRequested)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::invalidParameter, "Data protection class %d is not allowed", requested));
    const bool tooHigh = static_cast<std::uint32_t>(requested) > std::uint32_t{highestClassOfOtherDevelopers};
    if (request.isSecondOrThirdPartyApp && tooHigh)
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidParameter,
                                              "Data protection class %d is invalid for 2nd and 3rd party apps",
                                              requested));
    return {};
}

ChangeType changeType(std::int32_t requested, std::int32_t current) {
    const bool lowers = requested < current;
    const bool addsKeys = requested <= classNeverRequested && current == classWithoutKeys;
    return lowers || addsKeys ? ChangeType::directoriesAndFiles : ChangeType::directories;
}

/// The application's assertion, from the first retry to the end of the change. A change that is dropped gives it back.
class SharedAssertion {
public:
    SharedAssertion() = default;
    SharedAssertion(const SharedAssertion&) = delete;
    SharedAssertion& operator=(const SharedAssertion&) = delete;
    ~SharedAssertion() { invalidate(); }

    void take(const std::string& identifier) {
        invalidate();
        _assertion = OSTApplicationTerminationAssertion::withBundleIdentifier(
            identifier, OSTApplicationTerminationAssertion::Reason::installation);
    }
    void invalidate() {
        if (_assertion)
            _assertion->invalidate();
        _assertion.reset();
    }

private:
    std::unique_ptr<OSTApplicationTerminationAssertion> _assertion;
};

constexpr const char* entryFunction = "setDataProtectionOnDataContainerForUser";

/// Writes down the class that the container has now. What it was is no failure of the change, which has happened.
void recordClass(const OSTDataProtectionChangeOperation& operation) {
    const auto& metadata = *operation.change().dataContainerMetadata;
    const auto newClass = operation.change().newDataProtectionClass;
    const OSTIdentifierLock lock({metadata.uuid.string()}, OSTLockKind::writing);
    const auto recorded = operation.containerIsAnother()
                              ? std::unexpected(OSTErrorCode::unexpectedPath)
                              : OSTClientConnection::sharedClientConnection().setInfoValue(
                                    OSTValue(static_cast<std::int64_t>(newClass)), OSTContentProtectionClassKey,
                                    {.name = metadata.name(), .uuid = metadata.uuid}, OSTUseLocking::no);
    if (!recorded)
        platform::logAs(platform::LogLevel::error, entryFunction,
                        "Failed to set protection class info for %@ at %@ to %d : %llu", metadata.identifier,
                        metadata.url, newClass, recorded.error());
}

/// The end of a change, however it ended.
void finish(const OSTDataProtectionChangeOperation& operation, SharedAssertion& assertion, bool wasLocked,
            const OSTError* error) {
    const auto& [metadata, newClass, retryIfLocked, changeTypeOfIt] = operation.change();
    if (error)
        platform::logAs(platform::LogLevel::error, entryFunction,
                        "Failed to set data protection on container with identifier %@ at %@ to %d: %@",
                        metadata->identifier, metadata->url, newClass, *error);
    if (wasLocked && retryIfLocked)
        platform::logAs(platform::LogLevel::error, entryFunction,
                        "Unexpectedly got completion block called with wasLocked");
    assertion.invalidate();
    if (!error && !wasLocked)
        recordClass(operation);
}

} // namespace

const OSTDataProtectionManager& OSTDataProtectionManager::defaultManager() {
    static const OSTDataProtectionManager manager;
    return manager;
}

void OSTDataProtectionManager::setDataProtectionOnDataContainerForUser(const OSTDataProtectionRequest& request,
                                                                       Completion completion) const {
    const auto found = containerOf(request);
    if (!found)
        return completion(found.error().code());
    const auto current = recordedClass(**found);
    if (request.dataProtectionClass == current)
        return completion(OSTErrorCode::success);
    if (const auto checked = checkClass(request); !checked)
        return completion(checked.error().code());

    const auto operation = OSTDataProtectionChangeOperation::withChange(
        {.dataContainerMetadata = *found,
         .newDataProtectionClass = request.dataProtectionClass,
         .retryIfLocked = request.retryIfLocked,
         .operationType = changeType(request.dataProtectionClass, current)});
    const auto assertion = std::make_shared<SharedAssertion>();
    operation->setRetryStartBlock([assertion, identifier = (*found)->identifier] { assertion->take(identifier); });
    operation->setCompletionBlock([assertion, completion = std::move(completion),
                                   &change = *operation](bool wasLocked, const OSTError* error) mutable {
        finish(change, *assertion, wasLocked, error);
        completion(error ? error->code() : OSTErrorCode::success);
    });
    operation->performChangeOperation();
}

} // namespace ost
