#pragma once

#include "platform/base/OSTError.h"

#include <string>
#include <string_view>

namespace ost {

/// The operating system's build version, read once; absent when the system does not say.
[[nodiscard]] const std::optional<std::string>& OSTCurrentBuildVersion();

/// Marks a one-time migration as done: `OSTGlobalConfiguration::migrationFileExistsWithName` finds the file from now
/// on, also after a power cut. A failure is logged, and the migration runs again the next time.
///
/// On disk: a binary property list with "OSTMigrationVersionNumber", the build version where there is one, and
/// "OSTMigrationTime", the time as text; nobody reads them back.
void writeMigrationFileToDiskWithName(std::string_view name);
/// The same in another directory than the daemon's library.
void writeMigrationFileToDiskWithName(std::string_view name, std::string_view directory);

} // namespace ost
