#include "upcall/OSTProcessContainers.h"

#include "Protocol/OSTContainerClass.h"
#include "Protocol/OSTUpcall.h"
#include "codesigning/OSTCodeSigningMapping.h"
#include "model/OSTContainerName.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"
#include "platform/base/Unicode.h"
#include "platform/codec/OSTPackBuffer.h"
#include "platform/ipc/UpcallPacket.h"
#include "store/OSTClientConnection.h"

#include <algorithm>
#include <cerrno>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ost {

namespace {

using namespace upcall;
using platform::LogLevel;

constexpr std::size_t answerBlockSize = 4096;
constexpr const char* rootHome = "/private/var/root";
constexpr const char* temporaryDirectoryName = "tmp";

/// A line under the name of the one operation that all this is.
template<typename... Arguments>
void log(LogLevel level, platform::Message<Arguments...> format, const Arguments&... arguments) {
    platform::logAs<Arguments...>(level, "server_get_process_containers", format, arguments...);
}

/// What a process is and asks for. The strings lie in the request.
struct ProcessRequest {
    std::optional<std::string_view> codeSignatureId;
    std::optional<std::string_view> containerId;
    std::optional<std::string_view> systemContainerId;
    std::uint32_t userId = 0;
    std::uint32_t type = applicationType;
    std::vector<std::string_view> appGroupIds;
    std::vector<std::string_view> systemGroupIds;

    [[nodiscard]] const std::optional<std::string_view>& dataContainerId() const {
        return containerId ? containerId : codeSignatureId;
    }
};

template<typename Value>
using Result = std::expected<Value, std::int32_t>;

Result<std::string_view> unpackString(sb_packbuff& buffer, const char* name) {
    auto string = sb_packbuff_unpack_string(buffer);
    // No metadata file and no path could hold such an identifier.
    if (string && !platform::isValidText(*string))
        string = std::unexpected(OSTPackBufferError::invalidArgument);
    if (string)
        return *string;
    log(LogLevel::error, "failed: to unpack string for %s. error: %d\n", name, std::to_underlying(string.error()));
    return std::unexpected(OSTUpcallRefused);
}

Result<std::uint32_t> unpackNumber(sb_packbuff& buffer, platform::Message<int> failure) {
    const auto number = sb_packbuff_unpack_uint32(buffer);
    if (number)
        return *number;
    log<int>(LogLevel::error, failure, std::to_underlying(number.error()));
    return std::unexpected(OSTUpcallRefused);
}

Result<void> readItem(sb_packbuff& buffer, std::uint16_t valueType, ProcessRequest& request) {
    switch (valueType) {
    case codeSignatureId:
        request.codeSignatureId = OST_TRY(unpackString(buffer, "VN_KERN_REQUEST_CODE_SIGNATURE_ID"));
        return {};
    case containerId:
        request.containerId = OST_TRY(unpackString(buffer, "VN_KERN_REQUEST_CONTAINER_ID"));
        return {};
    case applicationId:
        OST_TRY(unpackString(buffer, "VN_KERN_REQUEST_APPLICATION_ID"));
        return {};
    case personaId:
        request.userId =
            OST_TRY(unpackNumber(buffer, "failed: to unpack uint32 for VN_KERN_REQUEST_PERSONA_ID. error: %d\n"));
        return {};
    case appGroupId:
        request.appGroupIds.push_back(OST_TRY(unpackString(buffer, "VN_KERN_REQUEST_APP_GROUP_ID")));
        return {};
    case containerType:
        request.type =
            OST_TRY(unpackNumber(buffer, "failed: to unpack uint32 for VN_KERN_REQUEST_CONTAINER_TYPE. error: %d\n"));
        return {};
    case systemContainerId:
        request.systemContainerId = OST_TRY(unpackString(buffer, "VN_KERN_REQUEST_CONTAINER_ID"));
        return {};
    case systemGroupId:
        request.systemGroupIds.push_back(OST_TRY(unpackString(buffer, "VN_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID")));
        return {};
    default:
        log(LogLevel::error, "unexpected value: %u\n", unsigned{valueType});
        return std::unexpected(OSTUpcallUnexpectedValue);
    }
}

Result<ProcessRequest> readRequest(std::span<std::byte> bytes) {
    const auto buffer = sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true, OSTPackBufferDeallocType::none);
    if (!buffer) {
        log(LogLevel::error, "sb_packbuff_init() of request data fails");
        return std::unexpected(OSTUpcallNoBuffer);
    }
    ProcessRequest request;
    while (const auto valueType = sb_packbuff_get_item_value_type(*buffer))
        OST_TRY(readItem(*buffer, *valueType, request));
    return request;
}

using GroupContainers = std::vector<std::pair<std::string_view, OSTMetadataRecord>>;

/// What the store has for a process.
struct ProcessContainers {
    OSTMetadataRecord data;
    OSTMetadataRecord system;
    GroupContainers appGroups;
    GroupContainers systemGroups;
    bool makeMissing = false;
    bool complete = true; ///< every look-up has succeeded
};

/// Nothing is made for a process that also asks under an identifier too long for anything to be made: it could not get
/// all that it asks for.
bool mayMakeContainers(const ProcessRequest& request) {
    const auto fits = [](std::string_view identifier) { return identifier.size() <= OSTLongestIdentifier; };
    return fits(request.dataContainerId().value_or("")) && fits(request.systemContainerId.value_or("")) &&
           std::ranges::all_of(request.appGroupIds, fits) && std::ranges::all_of(request.systemGroupIds, fits);
}

using LookupResult = std::expected<OSTMetadataRecord, OSTErrorCode>;

LookupResult lookUp(const ProcessContainers& found, std::uint32_t userId, std::string_view identifier,
                    OSTContainerClass containerClass) {
    return OSTClientConnection::sharedClientConnection().createOrLookupContainerForUser(
        {.name = {userId, containerClass, identifier}, .createIfNecessary = found.makeMissing});
}

/// The class of the data container: what the mapping knows, seen beside what the sandbox says.
OSTContainerClass dataClassFor(std::string_view identifier, std::uint32_t type) {
    const OSTContainerClass known{OSTCodeSigningMapping::sharedInstance().dataContainerTypeForIdentifier(identifier)};
    if (!isPerUserClass(known)) {
        const auto fallback =
            type == pluginType ? OSTContainerClass::dataLoomworkPlugin : OSTContainerClass::dataApplication;
        log(LogLevel::error, "Invalid data container class for %@: %llu", identifier, known);
        log(LogLevel::notice, "SB Type: %u, falling back to class: %llu", type, fallback);
        return fallback;
    }
    if (type == pluginType && known != OSTContainerClass::dataLoomworkPlugin) {
        log(LogLevel::notice, "SB Type: %u, TY Type: %llu.  Declaring this a plugin", type, known);
        return OSTContainerClass::dataLoomworkPlugin;
    }
    if (type == applicationType && known != OSTContainerClass::dataApplication)
        log(LogLevel::notice, "SB type is app, but TY type is %llu", known);
    return known;
}

void findDataContainer(const ProcessRequest& request, ProcessContainers& found) {
    const auto& identifier = request.dataContainerId();
    if (!identifier)
        return;
    const auto container = lookUp(found, request.userId, *identifier, dataClassFor(*identifier, request.type));
    if (container) {
        found.data = *container;
        return;
    }
    log(LogLevel::error, "createOrLookupContainerForUser: Failed with error: %llu", container.error());
    found.complete = false;
}

void findSystemContainer(const ProcessRequest& request, ProcessContainers& found) {
    if (!request.systemContainerId)
        return;
    const auto container = lookUp(found, OSTSystemUserId, *request.systemContainerId, OSTContainerClass::dataSystem);
    if (container) {
        found.system = *container;
        return;
    }
    log(LogLevel::error, "createOrLookupContainerForUser:(system container) Failed with error: %llu",
        container.error());
    found.complete = false;
}

void findAppGroups(const ProcessRequest& request, ProcessContainers& found) {
    for (const auto identifier : request.appGroupIds) {
        const auto container = lookUp(found, request.userId, identifier, OSTContainerClass::sharedAppGroup);
        if (container) {
            found.appGroups.emplace_back(identifier, *container);
            continue;
        }
        log(LogLevel::error, "createOrLookupGroupContainersForUser: Failed with error: %llu", container.error());
        found.complete = false;
    }
}

void findSystemGroups(const ProcessRequest& request, ProcessContainers& found) {
    for (const auto identifier : request.systemGroupIds) {
        const auto container = lookUp(found, OSTSystemUserId, identifier, OSTContainerClass::sharedSystemGroup);
        if (container) {
            found.systemGroups.emplace_back(identifier, *container);
            continue;
        }
        log(LogLevel::error, "createOrLookupContainerForUser:(system group container) Failed with error: %llu",
            container.error());
        found.complete = false;
    }
}

ProcessContainers findContainers(const ProcessRequest& request) {
    ProcessContainers found;
    found.makeMissing = mayMakeContainers(request);
    findDataContainer(request, found);
    findSystemContainer(request, found);
    findAppGroups(request, found);
    findSystemGroups(request, found);
    return found;
}

using GroupPaths = std::vector<std::pair<std::string, std::string>>;

/// What is answered, as far as it applies.
struct ProcessPaths {
    std::optional<std::string> home, data, temporary, system;
    GroupPaths appGroups, systemGroups;
};

std::optional<std::string> homeOf(std::uint32_t userId) {
    if (userId == OSTRootUserId)
        return rootHome;
    const auto* const user = OSTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(userId);
    return user ? user->userHomeDirectory() : std::nullopt;
}

std::optional<std::string> pathOf(const OSTMetadataRecord& container) {
    return container ? std::optional(container->url) : std::nullopt;
}

GroupPaths pathsOf(const GroupContainers& containers) {
    GroupPaths paths;
    for (const auto& [identifier, container] : containers)
        paths.emplace_back(identifier, container->url);
    return paths;
}

std::vector<std::string> descriptionOf(const GroupPaths& groups) {
    std::vector<std::string> lines;
    for (const auto& [identifier, path] : groups)
        lines.push_back(std::string(identifier).append(" = ").append(path));
    return lines;
}

void logPaths(const ProcessRequest& request, const ProcessPaths& paths) {
    if (!platform::Log::shared().accepts(LogLevel::debug))
        return;
    log(LogLevel::debug, "UPCALL-Containers for %@(%u):", request.dataContainerId(), request.userId);
    log(LogLevel::debug, "dataContainerURL: %@", paths.data);
    log(LogLevel::debug, "tempContainerURL: %@", paths.temporary);
    log(LogLevel::debug, "homeDirURL: %@", paths.home);
    log(LogLevel::debug, "groupURLs: %@", descriptionOf(paths.appGroups));
    log(LogLevel::debug, "systemContainerURL: %@", paths.system);
    log(LogLevel::debug, "systemGroupURLs: %@", descriptionOf(paths.systemGroups));
}

ProcessPaths pathsFor(const ProcessRequest& request, const ProcessContainers& found) {
    ProcessPaths paths{.home = homeOf(request.userId),
                       .data = pathOf(found.data),
                       .temporary = {},
                       .system = pathOf(found.system),
                       .appGroups = pathsOf(found.appGroups),
                       .systemGroups = pathsOf(found.systemGroups)};
    if (paths.data)
        paths.temporary = platform::pathByAppending(*paths.data, temporaryDirectoryName);
    logPaths(request, paths);
    return paths;
}

/// Packs the items of an answer until one fails; the flag that ends them says whether one did.
class AnswerPacker {
public:
    AnswerPacker(sb_packbuff& buffer, bool success) : _buffer(buffer), _success(success) {}

    void packPath(std::uint16_t type, const std::optional<std::string>& path) {
        if (!_success || !path)
            return;
        const auto packed = sb_packbuff_pack_string(_buffer, type, path->c_str(), path->size());
        if (packed)
            return;
        log(LogLevel::error, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n",
            std::to_underlying(packed.error()), unsigned{type}, *path);
        _success = false;
    }

    void packAppGroups(const GroupPaths& groups) {
        _packGroups(groups, answeredAppGroupId, appGroupPath,
                    "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, group container: %s\n");
    }

    void packSystemGroups(const GroupPaths& groups) {
        _packGroups(groups, answeredSystemGroupId, systemGroupPath,
                    "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, system group container: %s\n");
    }

    void packSuccess() {
        const auto packed = sb_packbuff_pack_uint32(_buffer, successFlag, _success ? 1 : 0);
        if (!packed)
            log(LogLevel::error, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n",
                std::to_underlying(packed.error()), unsigned{successFlag}, unsigned{_success});
    }

private:
    void _packGroups(const GroupPaths& groups, std::uint16_t keyType, std::uint16_t pathType,
                     platform::Message<int, std::string, std::string> failure) {
        for (const auto& [identifier, path] : groups) {
            if (!_success)
                return;
            const auto packed =
                sb_packbuff_pack_key_with_string_value(_buffer, keyType, identifier.c_str(), pathType, path.c_str());
            if (packed)
                continue;
            log<int, std::string, std::string>(LogLevel::error, failure, std::to_underlying(packed.error()), identifier,
                                               path);
            _success = false;
        }
    }

    sb_packbuff& _buffer;
    bool _success;
};

void packAnswer(sb_packbuff& buffer, const ProcessRequest& request, const ProcessContainers& found) {
    const auto paths = found.complete ? pathsFor(request, found) : ProcessPaths();
    AnswerPacker packer(buffer, found.complete);
    packer.packPath(homePath, paths.home);
    packer.packPath(dataContainerPath, paths.data);
    packer.packPath(temporaryPath, paths.temporary);
    packer.packAppGroups(paths.appGroups);
    packer.packPath(systemContainerPath, paths.system);
    packer.packSystemGroups(paths.systemGroups);
    packer.packSuccess();
}

/// Copies the answer to where the kernel can take it.
Result<OSTUpcallAnswer> copyAnswer(const sb_packbuff& buffer) {
    const auto* const bytes = sb_packbuff_get_bytes(buffer);
    const auto size = static_cast<std::uint32_t>(sb_packbuff_get_size(buffer));
    auto region = platform::makeUpcallRegion({bytes, size});
    if (!region) {
        log(LogLevel::error, "Failed to copy the answer at %p, size: %u: %d", bytes, size, region.error());
        return std::unexpected(region.error());
    }
    log(LogLevel::debug, "packbuff bytes: %p, reply bytes: %p, reply size: %u", bytes, region->get(), size);
    return OSTUpcallAnswer{*std::move(region), size};
}

} // namespace

std::expected<OSTUpcallAnswer, std::int32_t> server_get_process_containers(std::span<std::byte> request) {
    const auto process = OST_TRY(readRequest(request));
    const auto answer = sb_packbuff_new(answerBlockSize);
    if (!answer)
        return std::unexpected(OSTUpcallNoBuffer);
    packAnswer(*answer, process, findContainers(process));
    return copyAnswer(*answer);
}

} // namespace ost
