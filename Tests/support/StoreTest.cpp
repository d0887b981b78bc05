#include "support/StoreTest.h"

#include "store/OSTContainerCache.h"

#include <sys/mount.h>
#include <sys/stat.h>

#include <algorithm>
#include <future>
#include <stdexcept>

namespace ost::test {

namespace fs = std::filesystem;

StoreTest::StoreTest() { ::umask(0); }

std::uint32_t StoreTest::userOf(OSTContainerClass containerClass) {
    return isBundleClass(containerClass)   ? OSTInstallerUserId
           : isSystemClass(containerClass) ? OSTSystemUserId
                                           : OSTDefaultUserId;
}

OSTMetadataRecord StoreTest::make(OSTContainerClass containerClass, std::string_view identifier, bool transient) {
    const auto made = store().createOrLookupContainerForUser(
        {.name = {userOf(containerClass), containerClass, identifier, transient}, .createIfNecessary = true});
    if (!made)
        throw std::runtime_error("no container for " + std::string(identifier));
    writeFile(fs::path((*made)->url) / identifier, identifier);
    return *made;
}

OSTMetadataRecord StoreTest::cached(OSTContainerClass containerClass, std::string_view identifier, bool transient) {
    const auto found = OSTContainerCache::sharedInstance().containerForUser(
        {userOf(containerClass), containerClass, identifier, transient});
    return found ? *found : nullptr;
}

std::int64_t StoreTest::passCode() {
    std::promise<std::int64_t> code;
    store().deleteContainersOnDeathRowWithCompletion([&](std::int64_t value) { code.set_value(value); });
    return code.get_future().get();
}

std::vector<std::string> StoreTest::names(const fs::path& directory) {
    std::vector<std::string> names;
    std::error_code missing;
    for (const auto& entry : fs::directory_iterator(directory, missing))
        names.push_back(entry.path().filename());
    std::ranges::sort(names);
    return names;
}

std::string StoreTest::places() {
    std::string all;
    for (const auto* const place :
         {"/private/var/containers", "/private/var/mobile/Containers", "/private/var/mobile/Library/Caches",
          "/private/var/tessalyd", "/private/var/root/Library/Caches/com.tamarok.ostrandd/Temp", staging})
        if (fs::exists(place))
            all += std::string(place) + "\n" + tree(place);
    return all;
}

void StoreTest::mountOver(const fs::path& directory, bool readOnly) {
    if (::mount("none", directory.c_str(), "tmpfs", readOnly ? MS_RDONLY : 0, "size=1m") != 0)
        throw std::runtime_error("cannot mount over " + directory.string());
}

} // namespace ost::test
