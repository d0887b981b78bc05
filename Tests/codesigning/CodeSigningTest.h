#pragma once

#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTCodeSigningStoreDelegate.h"
#include "files/OSTDictionaryFile.h"
#include "platform/codec/PropertyList.h"
#include "store/OSTLocks.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <sys/mount.h>

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ost::test {

inline constexpr const char* mappingFile = "/private/var/root/Library/Ostrand/ost_code_signing_info.plist";
inline constexpr const char* appGroupsKey = "com.tamarok.security.application-groups";
inline constexpr const char* systemGroupsKey = "com.tamarok.security.system-groups";
inline constexpr const char* olderSystemGroupsKey = "com.tamarok.security.system-group-containers";

inline OSTArray strings(const std::vector<std::string>& values) { return OSTArray(values.begin(), values.end()); }

/// Entitlements that list application groups.
inline OSTDictionary appGroups(const std::vector<std::string>& groups) {
    return OSTDictionary({{appGroupsKey, strings(groups)}});
}

inline OSTDictionary systemGroups(const std::vector<std::string>& groups) {
    return OSTDictionary({{systemGroupsKey, strings(groups)}});
}

/// An entry of the mapping file.
inline OSTDictionary entryWith(OSTDictionary entitlements) {
    auto info = std::make_shared<const OSTDictionary>(
        std::vector<OSTDictionary::Entry>{{OSTEntitlementsKey, std::move(entitlements)}});
    return OSTCodeSigningEntry{.codeSigningInfo = std::move(info)}.serialize();
}

/// A test of the code-signing mapping and what hangs on it, in a device of its own whose store asks the mapping.
class CodeSigningTest : public StoreTest {
protected:
    CodeSigningTest() {
        static OSTCodeSigningStoreDelegate delegate;
        OSTStoreDelegate::join(delegate);
    }

    /// Made at its first use: until then a test may write the mapping file.
    static OSTCodeSigningMapping& mapping() { return OSTCodeSigningMapping::sharedInstance(); }

    static void writeMapping(const OSTDictionary& dictionary) {
        writeFile(mappingFile, platform::serializeBinaryPropertyList(dictionary));
    }
    static OSTDictionary onDisk() { return *OST_dictionaryWithContentsOfURL(mappingFile, OSTLargeDictionaryFileSize); }
    /// The entry of an identifier as the file has it.
    static std::optional<OSTCodeSigningEntry> entryOnDisk(std::string_view identifier) {
        const auto file = onDisk();
        const auto* const value = file.find(identifier);
        if (!value || !value->asDictionary())
            return std::nullopt;
        return OSTCodeSigningEntry::withSerializedDictionary(*value->asDictionary());
    }

    static OSTErrorCode codeOf(const std::expected<void, OSTErrorCode>& result) {
        return result ? OSTErrorCode::success : result.error();
    }

    static OSTErrorCode registerInfo(std::string_view identifier, OSTDictionary info,
                                     const OSTRegistrationOptions& options = {}) {
        return codeOf(mapping().processCodeSigningInfo(std::make_shared<const OSTDictionary>(std::move(info)),
                                                       identifier, options));
    }
    static OSTErrorCode registerEntitlements(std::string_view identifier, OSTValue entitlements,
                                             const OSTRegistrationOptions& options = {}) {
        return registerInfo(identifier, OSTDictionary({{OSTEntitlementsKey, std::move(entitlements)}}), options);
    }
    static OSTErrorCode remove(std::string_view identifier) {
        return codeOf(mapping().processCodeSigningInfo(nullptr, identifier, {}));
    }

    static void unmount(const std::filesystem::path& directory) { ::umount2(directory.c_str(), MNT_DETACH); }

    /// Makes a container, whatever its identifier is made of, and gives its path.
    static std::string makeContainer(OSTContainerClass containerClass, std::string_view identifier) {
        const auto made = store().createOrLookupContainerForUser(
            {.name = {userOf(containerClass), containerClass, identifier}, .createIfNecessary = true});
        return made ? (*made)->url : std::string();
    }
    /// Whether a container is there, on disk and for the cache, which must agree.
    static bool lives(OSTContainerClass containerClass, std::string_view identifier, const std::string& path) {
        const auto record = cached(containerClass, identifier);
        EXPECT_EQ(record != nullptr, std::filesystem::exists(path)) << identifier;
        return record != nullptr;
    }
};

} // namespace ost::test
