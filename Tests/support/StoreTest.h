#pragma once

#include "store/OSTClientConnection.h"
#include "store/OSTStoreDelegate.h"
#include "support/DeviceTest.h"

#include <cstdint>
#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

namespace ost::test {

/// A code-signing floor that entitles nobody to anything and knows no name; a test overrides what it is about.
class StoreDelegate : public OSTStoreDelegate {
public:
    bool identifierHasSystemContainer(std::string_view) override { return false; }
    std::optional<std::string> wellknownContainerForId(std::string_view, OSTContainerClass) override {
        return std::nullopt;
    }
    bool containerIdIsWellknown(std::string_view, OSTContainerClass) override { return false; }
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(std::string_view) override {}
    Restoration rememberIdentifierAndItsChildren(std::string_view) override {
        return [] {};
    }
    OSTResult<void> invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view) override { return {}; }
};

/// A test of store operations, in a device of its own. Everything is done for the user that a class's containers
/// usually belong to: 33 for bundles, 499 for system containers, else 501.
class StoreTest : public DeviceTest {
protected:
    static constexpr const char* deathRow = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead";
    static constexpr const char* staging = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Staging";
    static constexpr const char* replaceDirectory = "/private/var/root/Library/Ostrand/Replace";

    StoreTest();

    static OSTClientConnection& store() { return OSTClientConnection::sharedClientConnection(); }
    static std::uint32_t userOf(OSTContainerClass containerClass);

    /// Makes a container, with a file in it that is named as its identifier.
    static OSTMetadataRecord make(OSTContainerClass containerClass, std::string_view identifier,
                                  bool transient = false);
    /// What the cache knows of a container; null when nothing.
    static OSTMetadataRecord cached(OSTContainerClass containerClass, std::string_view identifier,
                                    bool transient = false);

    /// Runs a death-row pass to its end.
    static std::int64_t passCode();

    /// The names in a directory, sorted; none when there is no directory.
    static std::vector<std::string> names(const std::filesystem::path& directory);
    /// What lies in the places of containers, live and transient, and in staging.
    static std::string places();

    /// Mounts an empty file system in place of a directory, for this process alone.
    static void mountOver(const std::filesystem::path& directory, bool readOnly = false);
};

} // namespace ost::test
