#include "codesigning/CodeSigningTest.h"

#include "codesigning/OSTWhitelist.h"
#include "store/OSTContainerCache.h"

#include <filesystem>

namespace ost {
namespace {

using test::entryWith;
using test::mappingFile;
using test::strings;

using CodeSigningMapping = test::CodeSigningTest;

std::shared_ptr<const OSTDictionary> shared(OSTDictionary dictionary) {
    return std::make_shared<const OSTDictionary>(std::move(dictionary));
}

TEST_F(CodeSigningMapping, EntrySurvivesItsSerializedForm) {
    EXPECT_EQ(4U, OSTCodeSigningEntry{}.serialize().size());
    OSTCodeSigningEntry entry{.codeSigningInfo = shared(OSTDictionary({{"k", std::string("v")}})),
                              .childBundleIdentifiers = std::vector<std::string>{"a", "b"},
                              .invalid = true,
                              .placeholder = true,
                              .registeredByCaller = true,
                              .dataContainerClass = ~std::uint64_t{0}};
    EXPECT_EQ(entry, OSTCodeSigningEntry::withSerializedDictionary(entry.serialize()));

    auto other = entry;
    other.childBundleIdentifiers = std::vector<std::string>{"b", "a"};
    EXPECT_NE(entry, other) << "the order of the children counts";
    entry.childBundleIdentifiers.emplace();
    other.childBundleIdentifiers.reset();
    EXPECT_NE(entry, other) << "no children is not an empty list of them";

    const auto strange =
        OSTCodeSigningEntry::withSerializedDictionary(OSTDictionary({{"Invalid", std::uint64_t{0}},
                                                                     {"Placeholder", "yes"},
                                                                     {"CodeSigningInfo", "no dictionary"},
                                                                     {"ChildBundleIds", OSTDictionary()},
                                                                     {"DataContainerClass", OSTArray()}}));
    EXPECT_EQ(OSTCodeSigningEntry{}, strange);
}

TEST_F(CodeSigningMapping, CallersEntitlementsAreWrittenWhenTheyChange) {
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier("org.example.app"));
    EXPECT_FALSE(std::filesystem::exists(mappingFile)) << "nothing is written before the first change";
    const auto entitlements = shared(OSTDictionary({{"key", true}}));
    ASSERT_EQ(OSTErrorCode::success,
              codeOf(mapping().processCallerRegisteredEntitlements(entitlements, "org.example.app")));
    EXPECT_TRUE(mapping().codeSigningInfoExistForIdentifier("org.example.app"));
    EXPECT_TRUE(mapping().identifierHasCallerRegisteredEntitlements("org.example.app"));
    const auto written = onDisk();
    const auto entry = OSTCodeSigningEntry::withSerializedDictionary(*written.find("org.example.app")->asDictionary());
    EXPECT_TRUE(entry.registeredByCaller);
    EXPECT_EQ(*entitlements, *entry.entitlements());

    std::filesystem::remove(mappingFile);
    ASSERT_EQ(OSTErrorCode::success, codeOf(mapping().processCallerRegisteredEntitlements(
                                         shared(OSTDictionary(*entitlements)), "org.example.app")));
    EXPECT_FALSE(std::filesystem::exists(mappingFile)) << "an unchanged registration writes nothing";
    ASSERT_EQ(OSTErrorCode::success,
              codeOf(mapping().processCallerRegisteredEntitlements(shared({}), "org.example.app")));
    EXPECT_EQ(1U, onDisk().size());
    EXPECT_EQ(OSTErrorCode::noIdentifier,
              codeOf(mapping().processCallerRegisteredEntitlements(entitlements, std::nullopt)));
}

TEST_F(CodeSigningMapping, GroupListsAreReadFromTheEntitlements) {
    constexpr const char* app = "com.tamarok.security.application-groups";
    constexpr const char* system = "com.tamarok.security.system-groups";
    constexpr const char* older = "com.tamarok.security.system-group-containers";
    using List = std::optional<std::vector<std::string>>;
    struct Case {
        OSTDictionary entitlements;
        List appGroups, systemGroups;
    };
    const Case cases[] = {
        {{}, {}, {}},
        {OSTDictionary({{app, std::string("one")}}), List({"one"}), {}},
        {OSTDictionary({{app, strings({"b", "a", "b"})}}), List({"a", "b"}), {}},
        {OSTDictionary({{app, OSTArray{"a", OSTValue(std::uint64_t{1})}}}), {}, {}},
        {OSTDictionary({{app, std::uint64_t{1}}}), {}, {}},
        {OSTDictionary({{system, strings({"systemgroup.a", "other", "systemgroup.c"})}}),
         {},
         List({"systemgroup.a", "systemgroup.c"})},
        {OSTDictionary({{system, OSTArray()}, {older, "systemgroup.old"}}), {}, List({"systemgroup.old"})},
        {OSTDictionary({{system, "systemgroup.new"}, {older, "systemgroup.old"}}), {}, List({"systemgroup.new"})},
    };
    OSTDictionary file;
    for (std::size_t i = 0; i < std::size(cases); ++i)
        file.set(std::to_string(i), entryWith(cases[i].entitlements));
    writeMapping(file);
    for (std::size_t i = 0; i < std::size(cases); ++i) {
        EXPECT_EQ(cases[i].appGroups, mapping().appGroupIdentifiersForIdentifier(std::to_string(i))) << i;
        EXPECT_EQ(cases[i].systemGroups, mapping().systemGroupIdentifiersForIdentifier(std::to_string(i))) << i;
    }
}

TEST_F(CodeSigningMapping, PlaceholderAndInvalidEntriesAreHiddenFromOutside) {
    auto placeholder = entryWith(OSTDictionary({{"com.tamarok.security.system-container", true}}));
    placeholder.set("Placeholder", true);
    placeholder.set("DataContainerClass", std::uint64_t{4});
    auto invalid = entryWith({});
    invalid.set("Invalid", true);
    writeMapping(
        OSTDictionary({{"p", placeholder}, {"i", invalid}, {"good", entryWith({})}, {"broken", "no dictionary"}}));
    EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier("p"));
    EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier("i"));
    EXPECT_TRUE(mapping().getCodeSigningInfoForIdentifier("good"));
    EXPECT_TRUE(mapping().codeSigningInfoExistForIdentifier("p"));
    EXPECT_TRUE(mapping().identifierHasSystemContainer("p"));
    EXPECT_FALSE(mapping().identifierHasSystemContainer("i"));
    EXPECT_EQ(4U, mapping().dataContainerTypeForIdentifier("p"));
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier("broken"));
}

TEST_F(CodeSigningMapping, FileThatCannotBeReadIsNeverOverwritten) {
    test::writeFile(mappingFile, "<plist version=\"1.0\"><array/></plist>");
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier("org.example.app"));
    EXPECT_NE(OSTErrorCode::success,
              codeOf(mapping().processCallerRegisteredEntitlements(shared({}), "org.example.app")));
    EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier("org.example.app"));
    EXPECT_EQ("<plist version=\"1.0\"><array/></plist>", test::readFile(mappingFile));
}

TEST_F(CodeSigningMapping, WriteFailureKeepsTheChangeInMemory) {
    std::filesystem::create_directories(std::string(mappingFile) + "/in-the-way");
    // The file is a directory: unreadable, so made one only once the mapping has been read.
    std::filesystem::remove_all(mappingFile);
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier("org.example.app"));
    std::filesystem::create_directories(std::string(mappingFile) + "/in-the-way");
    EXPECT_EQ(OSTErrorCode::mappingWriteFailed,
              codeOf(mapping().processCallerRegisteredEntitlements(shared({}), "org.example.app")));
    EXPECT_TRUE(mapping().codeSigningInfoExistForIdentifier("org.example.app"));
    std::filesystem::remove_all(mappingFile);
    EXPECT_EQ(OSTErrorCode::success,
              codeOf(mapping().processCallerRegisteredEntitlements(shared({}), "org.example.other")));
    EXPECT_EQ(2U, onDisk().size()) << "the next successful write stores everything";
}

TEST_F(CodeSigningMapping, InfoCachedInABundleContainerIsTakenOver) {
    const auto bundle = OSTClientConnection::sharedClientConnection().createOrLookupContainerForUser(
        {.name = {33, OSTContainerClass::bundleApplication, "org.example.app"}, .createIfNecessary = true});
    ASSERT_TRUE(bundle);
    OSTMetadata metadata = **bundle;
    metadata.info = shared(OSTDictionary(
        {{"com.tamarok.Tessaly.CachedCodeSigningInfo",
          OSTDictionary({{"Entitlements", OSTDictionary({{"com.tamarok.security.system-container", true}})}})}}));
    ASSERT_TRUE(OSTContainerCache::sharedInstance().addContainerMetadata(metadata));
    EXPECT_TRUE(mapping().identifierHasSystemContainer("org.example.app"));
    EXPECT_EQ(2U, mapping().dataContainerTypeForIdentifier("org.example.app"));
    EXPECT_EQ(1U, onDisk().size());
}

TEST(Whitelist, KnowsExactlyItsOwn) {
    const auto& whitelist = OSTWhitelist::sharedWhitelist();
    using enum OSTContainerClass;
    EXPECT_EQ("com.tamarok.pellord", whitelist.wellknownContainerForId("com.tamarok.pellord", dataSystem));
    EXPECT_EQ(std::nullopt, whitelist.wellknownContainerForId("com.tamarok.pellord", sharedSystemGroup));
    EXPECT_EQ(std::nullopt, whitelist.wellknownContainerForId("com.tamarok.Pellord", dataSystem));
    EXPECT_TRUE(whitelist.containerIdIsWellknown("systemgroup.com.tamarok.ossel.plinthwork", sharedSystemGroup));
    EXPECT_FALSE(whitelist.containerIdIsWellknown("systemgroup.com.tamarok.ossel.plinthwork", dataApplication));
    EXPECT_EQ(2U, whitelist.wellknownSystemContainers().size());
    EXPECT_EQ(4U, whitelist.wellknownSystemGroupContainers().size());
}

} // namespace
} // namespace ost
