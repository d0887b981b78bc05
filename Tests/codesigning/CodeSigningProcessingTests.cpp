#include "codesigning/CodeSigningTest.h"

#include "Protocol/OSTEntitlements.h"
#include "store/OSTContainerCache.h"

#include <filesystem>
#include <functional>
#include <limits>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;
using test::appGroups;
using test::appGroupsKey;
using test::entryWith;
using test::mappingFile;
using test::systemGroups;

using Identifiers = std::optional<std::vector<std::string>>;

constexpr const char* app = "com.example.App";

const OSTDictionary systemContainer({{OSTSystemContainerKey, true}});

class CodeSigningProcessing : public test::CodeSigningTest {
protected:
    /// The children of an identifier as the file has them.
    static Identifiers childrenOnDisk(std::string_view identifier) {
        const auto entry = entryOnDisk(identifier);
        return entry ? entry->childBundleIdentifiers : std::nullopt;
    }
    /// Whether the operation writes the file.
    static bool writes(const auto& operation) {
        fs::remove(mappingFile);
        EXPECT_EQ(OSTErrorCode::success, operation());
        return fs::exists(mappingFile);
    }
};

TEST_F(CodeSigningProcessing, ARegistrationCountsAndNothingOfTheOneBefore) {
    auto stale = entryWith(systemContainer);
    for (const auto* flag : {"Invalid", "Placeholder", "RegisteredByCaller"})
        stale.set(flag, true);
    stale.set("DataContainerClass", std::uint64_t{4});
    writeMapping(OSTDictionary({{app, stale}}));

    const OSTDictionary info({{OSTEntitlementsKey, appGroups({"g"})}, {"Signer", "somebody"}});
    const struct {
        OSTRegistrationOptions options;
        std::string flags;
        std::uint64_t containerClass;
        bool visible;
    } rows[] = {
        {{}, "---", 0, true},
        {{.dataContainerClass = ~std::uint64_t{0}, .registeredByCaller = true}, "--R", ~std::uint64_t{0}, true},
        {{.dataContainerClass = 2, .placeholder = true}, "-P-", 2, false},
        {{.registeredByCaller = true, .placeholder = true}, "-PR", 0, false},
        {{}, "---", 0, true},
    };
    for (const auto& row : rows) {
        ASSERT_EQ(OSTErrorCode::success, registerInfo(app, info, row.options));
        const auto entry = entryOnDisk(app);
        ASSERT_TRUE(entry);
        EXPECT_EQ(info, *entry->codeSigningInfo);
        EXPECT_EQ(row.flags, std::string(entry->invalid ? "I" : "-") + (entry->placeholder ? "P" : "-") +
                                 (entry->registeredByCaller ? "R" : "-"));
        EXPECT_EQ(row.containerClass, mapping().dataContainerTypeForIdentifier(app));
        EXPECT_EQ(row.visible, mapping().getCodeSigningInfoForIdentifier(app) != nullptr);
        EXPECT_EQ(Identifiers({"g"}), mapping().appGroupIdentifiersForIdentifier(app));
        EXPECT_FALSE(writes([&] { return registerInfo(app, info, row.options); })) << "the same again";
    }
    EXPECT_TRUE(writes([] { return remove(app); }));
    EXPECT_EQ(0U, onDisk().size());
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier(app));
    EXPECT_FALSE(writes([] { return remove(app); })) << "nothing is left to be removed";
    EXPECT_EQ(OSTErrorCode::noIdentifier, codeOf(mapping().processCodeSigningInfo(nullptr, std::nullopt, {})));
}

TEST_F(CodeSigningProcessing, NoIdentifierOfARegistrationIsEndless) {
    const std::string endless(1025, 'a');
    const auto group = "systemgroup." + endless;
    EXPECT_EQ(OSTErrorCode::invalidObject, registerEntitlements(endless, OSTDictionary()));
    EXPECT_EQ(OSTErrorCode::invalidObject,
              registerEntitlements(app, OSTDictionary(), {.parentBundleIdentifier = endless}));
    EXPECT_EQ(OSTErrorCode::invalidObject, registerEntitlements(app, test::appGroups({"g", endless})));
    EXPECT_EQ(OSTErrorCode::invalidObject,
              registerEntitlements(app, OSTDictionary({{test::olderSystemGroupsKey, group}})));
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier(app));
    EXPECT_EQ(OSTErrorCode::success, registerEntitlements(app, test::appGroups({std::string(1024, 'a')})));
}

TEST_F(CodeSigningProcessing, ChildrenAreLinkedToTheirParentAndDroppedWithTheirEntries) {
    const auto registerChild = [](std::string_view child) {
        return registerEntitlements(child, OSTDictionary(), {.parentBundleIdentifier = app});
    };
    ASSERT_EQ(OSTErrorCode::success, registerChild("early"));
    EXPECT_FALSE(entryOnDisk(app)) << "a parent that nobody registered gets no entry";

    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, OSTDictionary()));
    EXPECT_EQ(Identifiers(), childrenOnDisk(app));
    for (const auto* child : {"b", "a", "early", "b"})
        ASSERT_EQ(OSTErrorCode::success, registerChild(child));
    EXPECT_EQ(Identifiers({"b", "a", "early"}), childrenOnDisk(app)) << "each once, in the order of the links";
    EXPECT_FALSE(writes([&] { return registerChild("a"); }));

    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, appGroups({"g"}), {.parentBundleIdentifier = app}));
    EXPECT_EQ(Identifiers({"b", "a", "early"}), childrenOnDisk(app)) << "carried over; nobody is its own child";

    EXPECT_FALSE(writes([] { return registerEntitlements(app, appGroups({"g"}), {.parentBundleIdentifier = app}); }));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("other", OSTDictionary(), {.parentBundleIdentifier = app}));
    ASSERT_EQ(OSTErrorCode::success, remove("other"));

    ASSERT_EQ(OSTErrorCode::success, remove("a"));
    EXPECT_EQ(Identifiers({"b", "a", "early", "other"}), childrenOnDisk(app));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, appGroups({"g"})));
    EXPECT_EQ(Identifiers({"b", "early"}), childrenOnDisk(app)) << "dropped the next time the parent is processed";
    for (const auto* child : {"b", "early"})
        ASSERT_EQ(OSTErrorCode::success, remove(child));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, OSTDictionary()));
    EXPECT_EQ(Identifiers(std::vector<std::string>()), childrenOnDisk(app)) << "an empty list stays one";

    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("late", OSTDictionary()));
    EXPECT_TRUE(writes([&] { return registerChild("late"); })) << "the link alone is a change";
    EXPECT_EQ(Identifiers({"late"}), childrenOnDisk(app));
}

TEST_F(CodeSigningProcessing, TheSystemContainerGoesWithItsEntitlement) {
    const struct {
        const char* name;
        std::optional<OSTDictionary> info; ///< none: the identifier is removed
        bool stays;
    } rows[] = {
        {"still true", OSTDictionary({{OSTEntitlementsKey, systemContainer}, {"Version", std::uint64_t{2}}}), true},
        {"a true number",
         OSTDictionary({{OSTEntitlementsKey, OSTDictionary({{OSTSystemContainerKey, std::uint64_t{7}}})}}), true},
        {"false", OSTDictionary({{OSTEntitlementsKey, OSTDictionary({{OSTSystemContainerKey, false}})}}), false},
        {"a string",
         OSTDictionary({{OSTEntitlementsKey, OSTDictionary({{OSTSystemContainerKey, std::string("true")}})}}), false},
        {"no such entitlement", OSTDictionary({{OSTEntitlementsKey, OSTDictionary()}}), false},
        {"entitlements of another type", OSTDictionary({{OSTEntitlementsKey, OSTArray{OSTSystemContainerKey}}}), false},
        {"no entitlements", OSTDictionary(), false},
        {"removed", std::nullopt, false},
    };
    for (const auto& row : rows) {
        ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, systemContainer)) << row.name;
        const auto path = makeContainer(dataSystem, app);
        const auto others = makeContainer(dataApplication, app);
        ASSERT_EQ(OSTErrorCode::success, row.info ? registerInfo(app, *row.info) : remove(app)) << row.name;
        EXPECT_EQ(row.stays, lives(dataSystem, app, path)) << row.name;
        EXPECT_TRUE(lives(dataApplication, app, others)) << row.name;
    }
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, systemContainer));
    EXPECT_EQ(OSTErrorCode::success, remove(app)) << "a container that was never made is no failure";
}

TEST_F(CodeSigningProcessing, EntitlementsOfTheWrongTypeGiveNothingAndHarmNothing) {
    const OSTDictionary infos[] = {
        OSTDictionary(),
        OSTDictionary({{OSTEntitlementsKey, true}}),
        OSTDictionary({{OSTEntitlementsKey, std::string(appGroupsKey)}}),
        OSTDictionary({{OSTEntitlementsKey, OSTArray{appGroups({"g"})}}}),
        OSTDictionary({{OSTEntitlementsKey, OSTDictionary({{OSTSystemContainerKey, OSTData{"1"}}})}}),
        OSTDictionary({{OSTEntitlementsKey, OSTDictionary({{appGroupsKey, OSTDictionary({{"g", true}})}})}}),
        OSTDictionary({{OSTEntitlementsKey, OSTDictionary({{appGroupsKey, OSTArray{OSTValue(OSTArray{"g"})}}})}}),
        OSTDictionary({{OSTEntitlementsKey, OSTDictionary({{test::systemGroupsKey, OSTDate{1}}})}}),
    };
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.Other", appGroups({"g"})));
    const auto group = makeContainer(sharedAppGroup, "g");
    for (const auto& info : infos) {
        SCOPED_TRACE(info.description());
        ASSERT_EQ(OSTErrorCode::success, registerInfo(app, info));
        EXPECT_EQ(info, *mapping().getCodeSigningInfoForIdentifier(app));
        EXPECT_FALSE(mapping().identifierHasSystemContainer(app));
        EXPECT_EQ(Identifiers(), mapping().appGroupIdentifiersForIdentifier(app));
        EXPECT_EQ(Identifiers(), mapping().systemGroupIdentifiersForIdentifier(app));
        EXPECT_TRUE(lives(sharedAppGroup, "g", group));
    }
    // An entry whose information has the wrong type is none, though it is there.
    EXPECT_EQ(OSTErrorCode::success, remove(app));
}

TEST_F(CodeSigningProcessing, NoPathIsMadeOfAnIdentifier) {
    const std::vector<std::string> identifiers = {"",
                                                  "/",
                                                  "..",
                                                  "../../../evil",
                                                  "/private/var/evil",
                                                  "a/evil\n\t\x01\x7f",
                                                  "evil \u65e5\u672c",
                                                  std::string(1000, 'e'),
                                                  "evil%2f..%2f",
                                                  ".evil"};
    for (const auto& identifier : identifiers) {
        ASSERT_EQ(OSTErrorCode::success, registerEntitlements(identifier, appGroups({identifier}),
                                                              {.parentBundleIdentifier = identifier + "/parent"}));
        ASSERT_EQ(OSTErrorCode::success, registerEntitlements(identifier + "/plug-in", systemContainer,
                                                              {.parentBundleIdentifier = identifier}));
        ASSERT_EQ(Identifiers({identifier + "/plug-in"}), childrenOnDisk(identifier));
    }
    EXPECT_EQ("-rw-r--r-- 0:0 ost_code_signing_info.plist\n", test::tree(fs::path(mappingFile).parent_path()));
    EXPECT_EQ(std::string::npos, test::tree("/private").find("evil"));
    EXPECT_EQ(2 * identifiers.size(), onDisk().size());
    for (const auto& identifier : identifiers) {
        ASSERT_EQ(OSTErrorCode::success, remove(identifier));
        ASSERT_EQ(OSTErrorCode::success, remove(identifier + "/plug-in"));
    }
    EXPECT_EQ(0U, onDisk().size());
    EXPECT_FALSE(fs::exists("/private/var/evil"));
}

TEST_F(CodeSigningProcessing, WhatIsNoEntryStaysInTheFileUntilItsIdentifierIsRegistered) {
    const OSTDictionary strange({{"array", OSTArray{"x", OSTDate{5}}}, {"data", OSTData{"y"}}, {"string", "z"}});
    auto file = strange;
    file.set(app, entryWith(appGroups({"g"})));
    file.set("empty", OSTDictionary());
    writeMapping(file);
    for (const auto& [identifier, value] : strange) {
        EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier(identifier));
        EXPECT_EQ(0U, mapping().dataContainerTypeForIdentifier(identifier));
    }
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier("empty")) << "an entry without information";

    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, OSTDictionary()));
    for (const auto& [identifier, value] : strange) {
        ASSERT_TRUE(onDisk().find(identifier)) << identifier;
        EXPECT_EQ(value, *onDisk().find(identifier));
    }
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("string", appGroups({"g"})));
    EXPECT_EQ(entryWith(appGroups({"g"})), *onDisk().find("string")->asDictionary());

    // Nor does it hide what is taken over from a bundle container.
    auto bundle = *make(bundleApplication, "data");
    bundle.info = std::make_shared<const OSTDictionary>(std::vector<OSTDictionary::Entry>{
        {"com.tamarok.Tessaly.CachedCodeSigningInfo", OSTDictionary({{OSTEntitlementsKey, systemContainer}})}});
    ASSERT_TRUE(OSTContainerCache::sharedInstance().addContainerMetadata(bundle));
    EXPECT_TRUE(mapping().codeSigningInfoExistForIdentifier("data"));
    EXPECT_FALSE(mapping().identifierHasSystemContainer("data"))
        << "entitlements have another name in a bundle container";
    ASSERT_TRUE(entryOnDisk("data"));
    EXPECT_EQ(2U, entryOnDisk("data")->dataContainerClass);
}

TEST_F(CodeSigningProcessing, WhatIsNotANumberIsNoChangeEither) {
    const auto nan = std::numeric_limits<double>::quiet_NaN();
    const OSTDictionary info({{"date", OSTDate{nan}}, {"real", nan}});
    ASSERT_EQ(OSTErrorCode::success, registerInfo(app, info));
    fs::remove(mappingFile);
    ASSERT_EQ(OSTErrorCode::success, registerInfo(app, info));
    EXPECT_FALSE(fs::exists(mappingFile)) << "nothing is written";
}

TEST_F(CodeSigningProcessing, AFailedWriteIsReportedAndMadeGoodByTheNext) {
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, appGroups({"g"})));
    const auto group = makeContainer(sharedAppGroup, "g");
    const auto before = test::readFile(mappingFile);
    mountOver(fs::path(mappingFile).parent_path(), true);

    EXPECT_EQ(OSTErrorCode::mappingWriteFailed, registerEntitlements(app, OSTDictionary()));
    EXPECT_FALSE(lives(sharedAppGroup, "g", group)) << "the consequences have come before the write";
    EXPECT_EQ(Identifiers(), mapping().appGroupIdentifiersForIdentifier(app));
    EXPECT_EQ(OSTErrorCode::mappingWriteFailed,
              codeOf(mapping().invalidateCodeSigningInfoForAppsWithoutBundleContainer()));
    EXPECT_FALSE(mapping().getCodeSigningInfoForIdentifier(app));
    EXPECT_EQ(OSTErrorCode::mappingWriteFailed, remove(app));
    EXPECT_FALSE(mapping().codeSigningInfoExistForIdentifier(app));

    unmount(fs::path(mappingFile).parent_path());
    EXPECT_EQ(before, test::readFile(mappingFile));
    ASSERT_EQ(OSTErrorCode::success, remove(app)) << "what changes nothing is written too, since it is answered";
    EXPECT_EQ(0U, onDisk().size());
}

TEST_F(CodeSigningProcessing, AMappingThatCannotBeReadProcessesNothing) {
    constexpr const char* damaged = "bplist00 damaged";
    test::writeFile(mappingFile, damaged);
    const auto group = makeContainer(sharedAppGroup, "g");
    const auto bundle = makeContainer(bundleApplication, app);
    EXPECT_FALSE(mapping().isAvailable());
    EXPECT_EQ(OSTErrorCode::noProcessingResult, registerEntitlements(app, appGroups({"g"})));
    EXPECT_EQ(OSTErrorCode::noProcessingResult, remove(app));
    EXPECT_EQ(OSTErrorCode::noProcessingResult,
              codeOf(mapping().invalidateCodeSigningInfoForAppsWithoutBundleContainer()));
    EXPECT_EQ(Identifiers(), mapping().appGroupIdentifiersForIdentifier(app));
    EXPECT_TRUE(store().deleteContainerForUser({33, bundleApplication, app}));
    EXPECT_FALSE(fs::exists(bundle));
    EXPECT_TRUE(lives(sharedAppGroup, "g", group));
    EXPECT_EQ(damaged, test::readFile(mappingFile));
}

TEST_F(CodeSigningProcessing, DeletingABundleRemovesTheIdentifierAndItsChildrenWithAllTheyHad) {
    const OSTRegistrationOptions child{.parentBundleIdentifier = app};
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, appGroups({"of all", "shared"})));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("plug-in", systemContainer, child));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("other plug-in", appGroups({"of all"}), child));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("gone plug-in", OSTDictionary(), child));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.Other", appGroups({"shared"})));
    ASSERT_EQ(OSTErrorCode::success, remove("gone plug-in"));
    const auto bundle = makeContainer(bundleApplication, app);
    const auto ofPlugIn = makeContainer(dataSystem, "plug-in");
    const auto ofAll = makeContainer(sharedAppGroup, "of all");
    const auto shared = makeContainer(sharedAppGroup, "shared");

    ASSERT_TRUE(store().deleteContainerForUser({33, bundleApplication, app}));
    EXPECT_FALSE(lives(bundleApplication, app, bundle));
    EXPECT_FALSE(lives(dataSystem, "plug-in", ofPlugIn));
    EXPECT_FALSE(lives(sharedAppGroup, "of all", ofAll));
    EXPECT_TRUE(lives(sharedAppGroup, "shared", shared));
    EXPECT_EQ(1U, onDisk().size());
    EXPECT_TRUE(entryOnDisk("com.example.Other"));
}

TEST_F(CodeSigningProcessing, ApplicationsWithoutABundleAreInvalidatedUnlessTheirCallerRegisteredThem) {
    const struct {
        std::string identifier;
        OSTContainerClass bundle; ///< undefined: none
        bool byCaller, stays;
    } rows[] = {
        {"application", bundleApplication, false, true},
        {"loomwork", bundleLoomworkPlugin, false, true},
        {"vpn", bundleVPNPlugin, false, true},
        {"framework", bundleFramework, false, false},
        {"gone", undefined, false, false},
        {"data only", dataApplication, false, false},
        {"registered by caller", undefined, true, true},
    };
    for (const auto& row : rows) {
        ASSERT_EQ(OSTErrorCode::success,
                  registerEntitlements(row.identifier, OSTDictionary(), {.registeredByCaller = row.byCaller}));
        EXPECT_EQ(row.bundle == undefined, makeContainer(row.bundle, row.identifier).empty());
    }
    ASSERT_EQ(OSTErrorCode::success, codeOf(mapping().invalidateCodeSigningInfoForAppsWithoutBundleContainer()));
    for (const auto& row : rows) {
        EXPECT_EQ(row.stays, mapping().getCodeSigningInfoForIdentifier(row.identifier) != nullptr) << row.identifier;
        EXPECT_EQ(row.stays, !entryOnDisk(row.identifier)->invalid) << row.identifier;
        EXPECT_TRUE(mapping().codeSigningInfoExistForIdentifier(row.identifier)) << row.identifier;
    }
    EXPECT_TRUE(writes([] { return codeOf(mapping().invalidateCodeSigningInfoForAppsWithoutBundleContainer()); }))
        << "it is written even when nothing changes";
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("gone", OSTDictionary()));
    EXPECT_TRUE(mapping().getCodeSigningInfoForIdentifier("gone")) << "a new registration makes it valid";
}

TEST_F(CodeSigningProcessing, OneIdentifierAndItsChildrenAreInvalidated) {
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, OSTDictionary(), {.registeredByCaller = true}));
    for (const auto* child : {"a", "gone", "b"})
        ASSERT_EQ(OSTErrorCode::success, registerEntitlements(child, OSTDictionary(), {.parentBundleIdentifier = app}));
    ASSERT_EQ(OSTErrorCode::success, remove("gone"));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("other", OSTDictionary()));
    ASSERT_TRUE(mapping().invalidateCodeSigningInfoForIdentifierAndItsChildren(app));
    for (const auto* identifier : {app, "a", "b"})
        EXPECT_TRUE(entryOnDisk(identifier)->invalid) << identifier;
    EXPECT_FALSE(entryOnDisk("other")->invalid);
    EXPECT_FALSE(entryOnDisk("gone"));

    fs::remove(mappingFile);
    EXPECT_TRUE(mapping().invalidateCodeSigningInfoForIdentifierAndItsChildren("nobody"));
    EXPECT_EQ(4U, onDisk().size()) << "it is written even when nothing changes";
}

using CodeSigningProcessingDeathTest = CodeSigningProcessing;

TEST_F(CodeSigningProcessingDeathTest, LocksInTheWrongOrderStopTheProcess) {
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements(app, OSTDictionary()));
    const auto onTheQueue = [](const std::function<void()>& work) {
        mapping().iterateGroupIdsWithKey(OSTGroupKeys::application, [&](const auto&, const auto*) { work(); });
    };
    EXPECT_DEATH(onTheQueue([] { makeContainer(dataApplication, app); }), "furtherLocksForbidden");
    EXPECT_DEATH(onTheQueue([] { const OSTIdentifierLock lock({app}, OSTLockKind::reading); }),
                 "furtherLocksForbidden");
    EXPECT_DEATH(mapping().removeCodeSigningDictionariesForIdentifierAndItsChildren(app), "OSTHoldsAllIdentifiersLock");
    onTheQueue([] {});
    EXPECT_NE("", makeContainer(dataApplication, app)) << "off the queue the locks are free again";
}

} // namespace
} // namespace ost
