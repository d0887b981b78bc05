#include "model/OSTMigrationMarker.h"

#include "files/OSTDictionaryFile.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Immortal.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/device/DeviceCapabilities.h"

#include <ctime>

namespace ost {

namespace {

/// "2026-11-22 19:46:01 +0000"
std::string currentTimeAsText() {
    const std::time_t now = std::time(nullptr);
    std::tm parts{};
    char text[64];
    ::gmtime_r(&now, &parts);
    return {text, std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &parts)};
}

} // namespace

const std::optional<std::string>& OSTCurrentBuildVersion() {
    static platform::Immortal version([] { return platform::buildVersion(); });
    return *version;
}

void writeMigrationFileToDiskWithName(std::string_view name) {
    writeMigrationFileToDiskWithName(name, OSTGlobalConfiguration::sharedInstance().libraryDirectory());
}

void writeMigrationFileToDiskWithName(std::string_view name, std::string_view directory) {
    OSTDictionary marker({{"OSTMigrationTime", currentTimeAsText()}});
    if (const auto& version = OSTCurrentBuildVersion())
        marker.set("OSTMigrationVersionNumber", OSTValue(*version));
    const auto url = platform::pathByAppending(directory, name);
    if (const auto written = OST_writeToURL(marker, url, OSTSmallDictionaryFileSize); !written)
        platform::logError("Failed to write migration file on %@ for %@ : %@", OSTCurrentBuildVersion(), name,
                           written.error());
    else
        platform::logNotice("Migration successfully completed on %@ for %@", OSTCurrentBuildVersion(), name);
}

} // namespace ost
