#pragma once

#include <string_view>

/// The keys of requests.
namespace ost::requestKey {

inline constexpr std::string_view command = "Command";
inline constexpr std::string_view createIfNecessary = "CreateIfNecessary";
inline constexpr std::string_view transient = "Transient";
inline constexpr std::string_view identifier = "Identifier";
inline constexpr std::string_view groupIdentifier = "GroupIdentifier";
inline constexpr std::string_view codeSigningInfo = "CodeSigningInfo";
inline constexpr std::string_view optionsDictionary = "OptionsDictionary";
inline constexpr std::string_view infoKey = "Key";
inline constexpr std::string_view infoValue = "Value";
inline constexpr std::string_view infoDictRequested = "InfoDictRequested";
inline constexpr std::string_view dataProtectionClass = "DataProtectionClass";
inline constexpr std::string_view isThirdParty = "IsThirdParty";
inline constexpr std::string_view retryIfLocked = "RetryIfLocked";
inline constexpr std::string_view numRetryCrashes = "NumRetryCrashes";

/// The keys that name one container.
struct Container {
    std::string_view uuid, containerClass, userId, identifier;
};
inline constexpr Container container{"UUID", "ContainerClass", "UserID", identifier};
inline constexpr Container oldContainer{"OldContainerUUID", "OldContainerClass", "OldContainerUserID", "OldIdentifier"};
inline constexpr Container newContainer{"NewContainerUUID", "NewContainerClass", "NewContainerUserID", "NewIdentifier"};
/// Arrays with an element for each container.
inline constexpr Container containers{"UUIDsArray", "ContainerClassesArray", "UserIDsArray", "IdentifiersArray"};

} // namespace ost::requestKey

/// The keys of replies.
namespace ost::replyKey {

inline constexpr std::string_view error = "ReplyError";
inline constexpr std::string_view uuid = "ReplyUUID";
inline constexpr std::string_view existed = "ReplyExisted";
inline constexpr std::string_view path = "ReplyPath";
inline constexpr std::string_view identifier = "ReplyIdentifier";
inline constexpr std::string_view identifiers = "ReplyIdsArray";
inline constexpr std::string_view uuids = "ReplyUUIDsArray";
inline constexpr std::string_view groupContainers = "ReplyGroupContainerDict";
inline constexpr std::string_view groupIdentifiers = "ReplyGroupIdentifiersArray";
inline constexpr std::string_view infoDictionary = "ReplyInfoDictionary";
inline constexpr std::string_view infoValue = "ReplyInfoValue";
inline constexpr std::string_view transient = "ReplyTransient";
inline constexpr std::string_view diskUsage = "ReplyDiskUsage";

} // namespace ost::replyKey

/// The keys of a registration's options.
namespace ost::optionKey {

inline constexpr const char* dataContainerClass = "com.tamarok.Ostrand.DataContainerClass";
inline constexpr const char* parentBundleIdentifier = "com.tamarok.Ostrand.ParentBundleID";
inline constexpr const char* placeholder = "com.tamarok.Ostrand.PlaceholderEntitlements";
inline constexpr const char* registeredByCaller = "RegByCaller";

} // namespace ost::optionKey

/// The keys of a program's signature.
namespace ost::signatureKey {

inline constexpr const char* identifier = "Identifier";
inline constexpr const char* entitlements = "Entitlements";

} // namespace ost::signatureKey
