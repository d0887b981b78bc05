#include "codesigning/CodeSigningTest.h"
#include "support/Sanitized.h"

#include "codesigning/OSTGroupManager.h"
#include "platform/base/Log.h"

#include <filesystem>
#include <map>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;
using test::appGroups;
using test::appGroupsKey;
using test::entryWith;
using test::systemGroups;

using Groups = std::vector<std::string>;

/// A change of one identifier's groups while others reference some of them.
struct Change {
    const char* name;
    OSTDictionary before;
    std::optional<OSTDictionary> after; ///< none: the identifier is removed
    Groups released;
};

class GroupManager : public test::CodeSigningTest {
protected:
    static const OSTGroupManager& manager() { return OSTGroupManager::defaultManager(); }

    static OSTClientConnection client() {
        return OSTClientConnection({.clientBundleIdentifier = "com.example.App", .clientUserId = 501});
    }

    /// Makes the containers of all groups, changes "com.example.App" and expects that just those of the released ones
    /// are gone.
    static void expectReleases(const Change& change, OSTContainerClass containerClass, const Groups& groups) {
        ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", change.before));
        std::map<std::string, std::string> paths;
        for (const auto& group : groups)
            paths[group] = makeContainer(containerClass, group);
        ASSERT_EQ(OSTErrorCode::success,
                  change.after ? registerEntitlements("com.example.App", *change.after) : remove("com.example.App"));
        Groups released;
        for (const auto& group : groups)
            if (!lives(containerClass, group, paths[group]))
                released.push_back(group);
        EXPECT_EQ(change.released, released) << change.name;
        ASSERT_EQ(OSTErrorCode::success, remove("com.example.App"));
    }
};

OSTDictionary withFlag(OSTDictionary entry, const char* flag) {
    entry.set(flag, true);
    return entry;
}

TEST_F(GroupManager, AnApplicationGroupGoesWithItsLastReference) {
    writeMapping(OSTDictionary({{"valid", entryWith(appGroups({"shared"}))},
                                {"invalid", withFlag(entryWith(appGroups({"of invalid"})), "Invalid")},
                                {"placeholder", withFlag(entryWith(appGroups({"of placeholder"})), "Placeholder")},
                                {"malformed", entryWith(OSTDictionary({{appGroupsKey, OSTArray{"own", true}}}))},
                                {"system", entryWith(systemGroups({"own"}))}}));
    const auto one = OSTDictionary({{appGroupsKey, std::string("own")}});
    const Change changes[] = {
        {"one of two leaves", appGroups({"own", "shared"}), appGroups({"own"}), {}},
        {"the last leaves", appGroups({"own", "shared"}), appGroups({"shared"}), {"own"}},
        {"all leave", appGroups({"own", "own too", "shared"}), OSTDictionary(), {"own", "own too"}},
        {"removed", appGroups({"own", "shared"}), std::nullopt, {"own"}},
        {"another order", appGroups({"own", "own too"}), appGroups({"own too", "own"}), {}},
        {"named twice", appGroups({"own", "own"}), appGroups({"own"}), {}},
        {"one string for a list of one", one, appGroups({"own"}), {}},
        {"one string", one, OSTDictionary(), {"own"}},
        {"more groups", appGroups({"own"}), appGroups({"own", "own too"}), {}},
        {"the new list is malformed", appGroups({"own"}), OSTDictionary({{appGroupsKey, true}}), {"own"}},
        {"the old list was malformed", OSTDictionary({{appGroupsKey, OSTArray{"own", true}}}), appGroups({}), {}},
        {"entries that do not count outside count here",
         appGroups({"of invalid", "of placeholder"}),
         appGroups({}),
         {}},
    };
    for (const auto& change : changes)
        expectReleases(change, sharedAppGroup, {"of invalid", "of placeholder", "own", "own too", "shared"});
}

TEST_F(GroupManager, ASystemGroupGoesWithItsLastReference) {
    const auto older = [](const Groups& groups) {
        return OSTDictionary({{test::olderSystemGroupsKey, test::strings(groups)}});
    };
    writeMapping(OSTDictionary({{"other", entryWith(systemGroups({"systemgroup.shared"}))},
                                {"older", entryWith(older({"systemgroup.of older"}))},
                                {"app", entryWith(appGroups({"systemgroup.own"}))}}));
    const Change changes[] = {
        {"one of two leaves",
         systemGroups({"systemgroup.own", "systemgroup.shared"}),
         systemGroups({"systemgroup.own"}),
         {}},
        {"the last leaves", systemGroups({"systemgroup.own"}), OSTDictionary(), {"systemgroup.own"}},
        {"removed", systemGroups({"systemgroup.own"}), std::nullopt, {"systemgroup.own"}},
        {"from the older entitlement", older({"systemgroup.own"}), systemGroups({}), {"systemgroup.own"}},
        {"to the older entitlement", systemGroups({"systemgroup.own"}), older({"systemgroup.own"}), {}},
        {"the older one of another", systemGroups({"systemgroup.of older"}), systemGroups({}), {}},
        {"without the prefix it never was a group", systemGroups({"no prefix"}), systemGroups({}), {}},
    };
    for (const auto& change : changes)
        expectReleases(change, sharedSystemGroup,
                       {"no prefix", "systemgroup.of older", "systemgroup.own", "systemgroup.shared"});
}

TEST_F(GroupManager, AGroupThatWasNeverMadeOrWhoseUserIsMissingIsLeft) {
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", appGroups({"never made", "made"})));
    const auto path = makeContainer(sharedAppGroup, "made");
    const auto places = StoreTest::places();
    fs::rename("/private/var/mobile", "/private/var/elsewhere");
    EXPECT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", OSTDictionary()));
    fs::rename("/private/var/elsewhere", "/private/var/mobile");
    EXPECT_EQ(places, StoreTest::places());
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", appGroups({"never made", "made"})));
    EXPECT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", appGroups({"made"})));
    EXPECT_EQ(places, StoreTest::places());
    EXPECT_TRUE(lives(sharedAppGroup, "made", path));
}

TEST_F(GroupManager, PathsAreThoseOfTheIdentifiersGroupsOnly) {
    auto entitlements = appGroups({"b", "a/../b\n"});
    entitlements.set(test::systemGroupsKey, test::strings({"systemgroup.a", "no prefix"}));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.Other", entitlements));
    auto connection = client();
    const auto paths = manager().groupContainerPathsForUser(501, connection, "com.example.Other");
    ASSERT_TRUE(paths);
    EXPECT_TRUE(connection.identity().allowGroupIdLookup);
    ASSERT_EQ(2U, paths->size());
    for (const auto& [group, path] : *paths) {
        EXPECT_EQ("/private/var/mobile/Containers/Shared/AppGroup", fs::path(path).parent_path());
        EXPECT_TRUE(platform::UUID::parse(fs::path(path).filename().native())) << path;
        EXPECT_TRUE(lives(sharedAppGroup, group, path));
    }
    EXPECT_EQ(*paths, manager().groupContainerPathsForUser(501, connection, "com.example.Other").value())
        << "once more";

    const auto system = manager().groupContainerPathsForUser(499, connection, "com.example.Other");
    ASSERT_TRUE(system);
    ASSERT_EQ(1U, system->size());
    EXPECT_TRUE(lives(sharedSystemGroup, "systemgroup.a", system->at("systemgroup.a")));

    using Paths = OSTGroupManager::Paths;
    EXPECT_EQ(Paths(), manager().groupContainerPathsForUser(501, connection, "com.example.App").value());
    EXPECT_EQ(OSTErrorCode::invalidObject, manager().groupContainerPathsForUser(501, connection, std::nullopt).error());
    EXPECT_FALSE(OSTHoldsAllIdentifiersLock());
}

TEST_F(GroupManager, AGroupWhoseContainerCannotBeMadeIsLeftOut) {
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", appGroups({"made", "in the way"})));
    const auto made = makeContainer(sharedAppGroup, "made");
    mountOver(staging, true);
    auto connection = client();
    const auto paths = manager().groupContainerPathsForUser(501, connection, "com.example.App");
    ASSERT_TRUE(paths);
    EXPECT_EQ((OSTGroupManager::Paths{{"made", made}}), *paths);
}

TEST_F(GroupManager, IdentifiersAreTheApplicationGroupsWhoeverAsks) {
    auto entitlements = appGroups({"b", "a", "b"});
    entitlements.set(test::systemGroupsKey, "systemgroup.a");
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", entitlements));
    EXPECT_EQ(Groups({"a", "b"}), manager().groupContainerIdentifiersForUser(499, "com.example.App").value());
    EXPECT_EQ(Groups(), manager().groupContainerIdentifiersForUser(501, "nobody").value());
    EXPECT_EQ(OSTErrorCode::invalidObject, manager().groupContainerIdentifiersForUser(501, std::nullopt).error());
}

TEST_F(GroupManager, ReconciliationDeletesWhatNoEntryNames) {
    writeMapping(OSTDictionary({{"a", entryWith(appGroups({"valid"}))},
                                {"b", withFlag(entryWith(appGroups({"invalid"})), "Invalid")},
                                {"c", withFlag(entryWith(appGroups({"placeholder"})), "Placeholder")},
                                {"d", entryWith(systemGroups({"system only"}))}}));
    std::map<std::string, std::string> paths;
    for (const auto* group : {"invalid", "placeholder", "system only", "unreferenced", "valid"})
        paths[group] = makeContainer(sharedAppGroup, group);
    const auto ofSystem = makeContainer(sharedSystemGroup, "systemgroup.unreferenced");
    {
        const OSTAllIdentifiersLock lock(OSTLockKind::writing);
        manager().reconcileGroupContainersOfType(OSTGroupType::application);
    }
    Groups left;
    for (const auto& [group, path] : paths)
        if (lives(sharedAppGroup, group, path))
            left.push_back(group);
    EXPECT_EQ(Groups({"invalid", "placeholder", "valid"}), left);
    EXPECT_TRUE(lives(sharedSystemGroup, "systemgroup.unreferenced", ofSystem));
}

TEST_F(GroupManager, ReconciliationDeletesNothingWhenNobodyKnowsWhoReferencesWhat) {
    test::writeFile(test::mappingFile, "damaged");
    const auto path = makeContainer(sharedAppGroup, "g");
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    manager().reconcileGroupContainersOfType(OSTGroupType::application);
    EXPECT_TRUE(lives(sharedAppGroup, "g", path));
}

TEST_F(GroupManager, ReconciliationSaysThatNobodyKnowsEvenWhereThereIsNothingToClean) {
    test::writeFile(test::mappingFile, "damaged");
    ASSERT_TRUE(platform::Log::shared().open(platform::LogLevel::notice, {"/log", 1, 1U << 20U}));
    fs::rename("/private/var/mobile", "/private/var/elsewhere");
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    manager().reconcileGroupContainersOfType(OSTGroupType::application);
    EXPECT_TRUE(test::readFile("/log").contains("Failed to get reference count information for group type: 0"));
}

TEST_F(GroupManager, AMillionGroupsAreOneListLikeAnother) {
    constexpr std::size_t million = test::isSanitized ? 100'000 : 1'000'000;
    const auto last = "group." + std::to_string(million - 1);
    Groups groups;
    for (std::size_t number = 0; number < million; ++number)
        groups.push_back("group." + std::to_string(number));
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", appGroups(groups)));
    const auto kept = makeContainer(sharedAppGroup, "group.77");
    const auto released = makeContainer(sharedAppGroup, last);
    EXPECT_EQ(million, manager().groupContainerIdentifiersForUser(501, "com.example.App")->size());
    EXPECT_EQ(million, onDisk()
                           .find("com.example.App")
                           ->asDictionary()
                           ->find("CodeSigningInfo")
                           ->asDictionary()
                           ->find(OSTEntitlementsKey)
                           ->asDictionary()
                           ->find(appGroupsKey)
                           ->asArray()
                           ->size());
    ASSERT_EQ(OSTErrorCode::success, registerEntitlements("com.example.App", appGroups({"group.77"})));
    EXPECT_TRUE(lives(sharedAppGroup, "group.77", kept));
    EXPECT_FALSE(lives(sharedAppGroup, last, released));
}

} // namespace
} // namespace ost
