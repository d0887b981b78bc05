#pragma once

#include "Client/Connection.h"
#include "Client/Containers.h"
#include "platform/base/OSTValue.h"

#include <cstdint>
#include <optional>
#include <string>

namespace ostrand {

// What one container carries. All of these ask for full access, and fail with 21 when the container is not there under
// that UUID, with 38 for a user that does not fit the class.

/// The info value of a key. Fails with 24 when there is none.
[[nodiscard]] Result<ost::OSTValue> infoValue(Connection& connection, const ContainerReference& container,
                                              const std::string& key);

/// Sets the info value of a key, or removes the key when there is no value. It is on disk when this returns. Fails with
/// 34, and changes nothing, when it cannot be written: a container's values have room for nearly 1 MiB.
[[nodiscard]] Result<void> setInfoValue(Connection& connection, const ContainerReference& container,
                                        const std::string& key, const std::optional<ost::OSTValue>& value);

/// What the daemon knows of a container.
struct ContainerMetadata {
    std::string path; ///< of the device
    bool transient;
    ost::OSTDictionary info;
};
[[nodiscard]] Result<ContainerMetadata> metadata(Connection& connection, const ContainerReference& container);

/// Makes the directories again that every container of the class has; what is there stays as it is. Fails with 6 when
/// something else is in the place of one.
[[nodiscard]] Result<void> recreateDefaultStructure(Connection& connection, const ContainerReference& container);

/// Gives the container's directory a new name. Fails with 48 for a container whose name others know.
[[nodiscard]] Result<void> regenerateDirectoryUUID(Connection& connection, const ContainerReference& container);

/// A live data container that is to get another protection class.
struct DataProtection {
    ContainerClass containerClass = ContainerClass::dataApplication;
    std::uint64_t user = ost::OSTCurrentUserPlaceholder;
    std::string identifier;
    std::int64_t protectionClass = 0;
    bool outsideDeveloper = false; ///< allows the classes 0, 1 and 3 only
    bool retryIfLocked = false;    ///< wait for an unlock instead of failing with 61
};

/// Gives a data container another protection class and returns when that is done, which may take an unlock of the
/// device. Fails with 10 when the container was replaced meanwhile, with 38 for a class that may not be, with an errno
/// for an item that could not be changed. An errno of 1 is no failure on the wire: whether the class was recorded
/// tells.
[[nodiscard]] Result<void> setDataProtection(Connection& connection, const DataProtection& change);

/// The same in two steps, for one who has something to do meanwhile: the number that the first gives is what
/// `Connection::receive` asks for.
[[nodiscard]] Result<std::uint32_t> beginSettingDataProtection(Connection& connection, const DataProtection& change);

/// The info value that says which class a data container was last set to.
inline constexpr const char* protectionClassKey = "com.tamarok.Tessaly.ContentProtectionClass";

} // namespace ostrand
