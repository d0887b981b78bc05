#include "codesigning/CodeSigningTest.h"
#include "store/OSTContainerCache.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace ost {
namespace {

namespace fs = std::filesystem;
using namespace test;
using enum OSTContainerClass;

class CodeSigningMigration : public CodeSigningTest {
protected:
    static constexpr const char* library = "/private/var/root/Library/Ostrand/";
    static constexpr const char* legacyFile = "/private/var/root/Library/Ostrand/ost_entitlements.plist";
    static constexpr const char* groupIdsKey = "com.tamarok.Tessaly.GroupContainerIDs";

    static void migrate() { mapping().performAllCodeSigningMigrationAndReconciliation(); }
    static bool marked(const std::string& step) {
        return fs::exists(library + ("ost_" + step + "_migration_complete.plist"));
    }
    static std::string makeWithInfo(OSTContainerClass containerClass, std::string_view identifier, const char* key,
                                    OSTValue value) {
        const auto url = makeContainer(containerClass, identifier);
        auto metadata = *cached(containerClass, identifier);
        metadata.info =
            std::make_shared<const OSTDictionary>(std::vector<OSTDictionary::Entry>{{key, std::move(value)}});
        EXPECT_TRUE(metadata.writeMetadataToDisk());
        EXPECT_TRUE(OSTContainerCache::sharedInstance().addContainerMetadata(metadata));
        return url;
    }
    static bool hasInfo(OSTContainerClass containerClass, std::string_view identifier) {
        return OSTMetadata::readAndValidateMetadataAtUrl(cached(containerClass, identifier)->url,
                                                         userOf(containerClass), OSTCheckClassPath::yes)
                   ->info != nullptr;
    }
    static OSTDictionary cachedInfo(std::string value) {
        return OSTDictionary({{"Entitlements", OSTDictionary({{"from", OSTValue(std::move(value))}})}});
    }
    /// Where an entry's entitlements come from.
    static std::string source(std::string_view identifier) {
        const auto entry = entryOnDisk(identifier);
        const auto* const from = entry && entry->entitlements() ? entry->entitlements()->find("from") : nullptr;
        return from ? *from->asString() : entry ? "elsewhere" : "nowhere";
    }
};

TEST_F(CodeSigningMigration, GroupsOfDataContainersBecomeInvalidEntriesOnce) {
    writeMapping(OSTDictionary({{"registered", entryWith(OSTDictionary({{"from", std::string("installer")}}))}}));
    makeWithInfo(dataVPNPlugin, "new", groupIdsKey, strings({"group.new"}));
    makeWithInfo(dataApplication, "registered", groupIdsKey, strings({"group.registered"}));
    const auto kept = makeContainer(sharedAppGroup, "group.new");
    const auto unreferenced = makeContainer(sharedAppGroup, "group.of-nobody");

    migrate();
    const auto entry = entryOnDisk("new");
    ASSERT_TRUE(entry);
    EXPECT_TRUE(entry->invalid);
    EXPECT_EQ(6U, entry->dataContainerClass);
    EXPECT_EQ(appGroups({"group.new"}), *entry->entitlements());
    EXPECT_EQ("installer", source("registered"));
    EXPECT_FALSE(hasInfo(dataVPNPlugin, "new"));
    EXPECT_FALSE(hasInfo(dataApplication, "registered"));
    EXPECT_TRUE(lives(sharedAppGroup, "group.new", kept));
    EXPECT_FALSE(lives(sharedAppGroup, "group.of-nobody", unreferenced));
    EXPECT_TRUE(marked("group_id"));

    makeWithInfo(dataApplication, "late", groupIdsKey, strings({"group.late"}));
    migrate();
    EXPECT_TRUE(hasInfo(dataApplication, "late"));
}

TEST_F(CodeSigningMigration, CachedInfoWinsOverTheLegacyFileWhichWinsOverGroupsAndNothingOverAValidEntry) {
    writeMapping(OSTDictionary({{"valid", entryWith(OSTDictionary({{"from", std::string("installer")}}))}}));
    OSTDictionary legacy;
    for (const auto* const identifier : {"valid", "cached", "legacy", "caller's"}) {
        makeWithInfo(dataApplication, identifier, groupIdsKey, strings({"group"}));
        legacy.set(identifier, OSTDictionary({{"from", std::string("legacy")}}));
    }
    legacy.set("odd", OSTValue("no dictionary"));
    legacy.set("com.tamarok.Ostrand.ChildPluginBundleIDs",
               OSTDictionary({{"legacy", OSTArray{"child", OSTValue(std::uint64_t{1})}}}));
    legacy.set("com.tamarok.Ostrand.EntitlementsRegisteredByCaller", OSTDictionary({{"caller's", OSTValue(true)}}));
    legacy.set("com.tamarok.Ostrand.PlaceholderEntitlements", OSTDictionary({{"legacy", OSTValue(false)}}));
    writeFile(legacyFile, platform::serializeBinaryPropertyList(legacy));
    const std::pair<OSTContainerClass, std::uint64_t> pairs[] = {
        {bundleApplication, 2}, {bundleLoomworkPlugin, 4}, {bundleVPNPlugin, 6}, {bundleFramework, 0}};
    for (const auto& [bundleClass, dataClass] : pairs)
        makeWithInfo(bundleClass, "of " + std::to_string(dataClass), OSTCachedCodeSigningInfoKey, cachedInfo("cached"));
    for (const auto* const identifier : {"valid", "cached"})
        makeWithInfo(bundleApplication, identifier, OSTCachedCodeSigningInfoKey, cachedInfo("cached"));

    migrate();
    EXPECT_EQ("installer", source("valid"));
    EXPECT_EQ("cached", source("cached"));
    EXPECT_FALSE(entryOnDisk("cached")->invalid);
    EXPECT_EQ("legacy", source("legacy"));
    EXPECT_TRUE(entryOnDisk("legacy")->invalid);
    EXPECT_TRUE(entryOnDisk("legacy")->placeholder);
    EXPECT_EQ(std::vector<std::string>{"child"}, entryOnDisk("legacy")->childBundleIdentifiers);
    EXPECT_FALSE(entryOnDisk("caller's")->invalid);
    EXPECT_TRUE(entryOnDisk("caller's")->registeredByCaller);
    EXPECT_EQ("elsewhere", source("odd"));
    for (const auto& [bundleClass, dataClass] : pairs) {
        EXPECT_EQ(dataClass, entryOnDisk("of " + std::to_string(dataClass))->dataContainerClass);
        EXPECT_FALSE(hasInfo(bundleClass, "of " + std::to_string(dataClass)));
    }
    EXPECT_FALSE(fs::exists(legacyFile));
    EXPECT_TRUE(marked("code_signing"));
}

TEST_F(CodeSigningMigration, NoGroupContainerGoesWhileADamagedEntryMayReferenceIt) {
    writeMapping(OSTDictionary({{"damaged", OSTValue("no dictionary")}}));
    const auto group = makeContainer(sharedAppGroup, "group");
    migrate();
    EXPECT_TRUE(lives(sharedAppGroup, "group", group));
    ASSERT_EQ(OSTErrorCode::success, registerInfo("damaged", OSTDictionary()));
    migrate();
    EXPECT_FALSE(lives(sharedAppGroup, "group", group));
}

TEST_F(CodeSigningMigration, WhatCannotBeReadOrWrittenIsKeptAndNoGroupContainerGoes) {
    const auto group = makeContainer(sharedAppGroup, "group.of-the-legacy-file");
    writeFile(legacyFile, "no property list");
    migrate();
    EXPECT_TRUE(fs::exists(legacyFile));
    EXPECT_TRUE(lives(sharedAppGroup, "group.of-the-legacy-file", group));

    // A write that fails must not let the next run believe that its entries are on disk.
    auto legacy = appGroups({"group.of-the-legacy-file"});
    legacy = OSTDictionary(
        {{"legacy", legacy},
         {"com.tamarok.Ostrand.EntitlementsRegisteredByCaller", OSTDictionary({{"legacy", OSTValue(true)}})}});
    writeFile(legacyFile, platform::serializeBinaryPropertyList(legacy));
    ASSERT_EQ(0, ::mount(library, library, nullptr, MS_BIND, nullptr));
    ASSERT_EQ(0, ::mount(nullptr, library, nullptr, MS_BIND | MS_REMOUNT | MS_RDONLY, nullptr));
    migrate();
    unmount(library);
    EXPECT_FALSE(fs::exists(mappingFile));
    EXPECT_TRUE(lives(sharedAppGroup, "group.of-the-legacy-file", group));

    migrate();
    EXPECT_FALSE(fs::exists(legacyFile));
    EXPECT_TRUE(entryOnDisk("legacy"));
    EXPECT_TRUE(lives(sharedAppGroup, "group.of-the-legacy-file", group));
}

} // namespace
} // namespace ost
