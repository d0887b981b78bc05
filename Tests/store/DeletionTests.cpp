#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTCodeSigningStoreDelegate.h"
#include "platform/codec/PropertyList.h"
#include "platform/device/SandboxUserState.h"
#include "store/OSTLocks.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <future>
#include <thread>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;
using platform::sandboxStateDirectory;
using platform::UUID;

class Deletion : public test::StoreTest {
protected:
    static OSTDeletion deletionOf(const std::vector<OSTMetadataRecord>& records) {
        OSTDeletion deletion;
        for (const auto& record : records)
            add(deletion, record->uuid, record->identifier, record->containerClass);
        return deletion;
    }
    static void add(OSTDeletion& deletion, std::optional<UUID> uuid, std::optional<std::string_view> identifier,
                    OSTContainerClass containerClass) {
        deletion.userIds.push_back(userOf(containerClass));
        deletion.uuids.push_back(uuid);
        deletion.identifiers.push_back(identifier);
        deletion.classes.push_back(containerClass);
    }
    /// The code of an operation: 1 for success.
    static int codeOf(const std::expected<void, OSTErrorCode>& result) {
        return static_cast<int>(result ? OSTErrorCode::success : result.error());
    }
    static int stage(const OSTDeletion& deletion) {
        return codeOf(store().stageForDeleteContainersWithUsers(deletion));
    }
    static fs::path onDeathRow(const OSTMetadataRecord& record) {
        return fs::path(deathRow) / fs::path(record->url).filename();
    }
};

TEST_F(Deletion, ListsOfDifferentLengthAreRefusedBeforeAnyLock) {
    const auto record = make(dataApplication, "a");
    const auto before = places();
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    OSTDeletion cases[3] = {deletionOf({record}), deletionOf({record}), deletionOf({record})};
    cases[0].uuids.clear();
    cases[1].identifiers.clear();
    cases[2].classes.push_back(dataApplication);
    for (const auto& deletion : cases)
        EXPECT_EQ(11, stage(deletion));
    EXPECT_EQ(before, places());
    EXPECT_TRUE(cached(dataApplication, "a"));
}

TEST_F(Deletion, EntriesThatNameNoContainerArePassedOver) {
    const auto first = make(dataApplication, "first");
    const auto last = make(bundleApplication, "last");
    const auto kept = make(dataApplication, "kept");
    auto deletion = deletionOf({first});
    add(deletion, std::nullopt, "kept", dataApplication);
    add(deletion, kept->uuid, std::nullopt, dataApplication);
    add(deletion, kept->uuid, "kept", undefined);
    add(deletion, kept->uuid, "kept", max);
    add(deletion, kept->uuid, "kept", static_cast<OSTContainerClass>((std::uint64_t{1} << 32U) | 2U));
    add(deletion, kept->uuid, "kept", dataVPNPlugin);
    add(deletion, kept->uuid, "other", dataApplication);
    add(deletion, UUID::generate(), "kept", dataApplication);
    add(deletion, kept->uuid, "kept", dataApplication);
    deletion.userIds.back() = 502;
    add(deletion, last->uuid, "last", bundleApplication);
    EXPECT_EQ(1, stage(deletion));
    EXPECT_TRUE(fs::exists(onDeathRow(first) / "first"));
    EXPECT_TRUE(fs::exists(onDeathRow(last) / "last"));
    EXPECT_EQ(2U, names(deathRow).size());
    EXPECT_EQ(kept->url, cached(dataApplication, "kept")->url);
    EXPECT_FALSE(cached(dataApplication, "first"));
    EXPECT_FALSE(cached(bundleApplication, "last"));
}

TEST_F(Deletion, UserThatIsMissingIsAnExceptionThatLeavesNoLock) {
    const auto one = make(dataApplication, "one");
    const auto two = make(dataApplication, "two");
    auto deletion = deletionOf({one, two});
    deletion.userIds.pop_back();
    EXPECT_EQ(40, stage(deletion));
    EXPECT_FALSE(cached(dataApplication, "one"));
    EXPECT_TRUE(cached(dataApplication, "two"));
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    EXPECT_EQ(1, codeOf(store().stageForDeleteContainer(*two, false))) << "who holds the lock stages without";
}

TEST_F(Deletion, SandboxForgetsWhatIsStaged) {
    const struct {
        OSTContainerClass containerClass;
        std::string item; ///< empty: the sandbox has none
    } rows[] = {{dataApplication, "501/1"}, {dataTempDir, "501/1"},     {sharedAppGroup, "501/2"},
                {dataSystem, "0/4"},        {sharedSystemGroup, "0/8"}, {bundleFramework, ""}};
    for (const auto& [containerClass, item] : rows) {
        // Items of the same name for every user and type, of which just one has to go.
        std::string links;
        for (const std::uint32_t user : {0U, 33U, 499U, 501U})
            for (const std::uint64_t type : {1U, 2U, 4U, 8U}) {
                ASSERT_TRUE(platform::setSandboxUserStateItem(user, type, "a", "/somewhere"));
                if (const auto place = std::to_string(user) + "/" + std::to_string(type); place != item)
                    links += place + " ";
            }
        const auto record = make(containerClass, "a");
        EXPECT_EQ(1, stage(deletionOf({record})));
        EXPECT_FALSE(fs::exists(record->url)) << item;
        EXPECT_TRUE(fs::exists(onDeathRow(record) / "a")) << item;
        EXPECT_FALSE(cached(containerClass, "a")) << item;
        std::string left;
        for (const auto& user : names(sandboxStateDirectory))
            for (const auto& type : names(fs::path(sandboxStateDirectory) / user))
                if (!names(fs::path(sandboxStateDirectory) / user / type).empty())
                    left += user + "/" + type + " ";
        EXPECT_EQ(links, left);
    }
}

TEST_F(Deletion, UUIDTellsTheLiveContainerFromTheTransientOne) {
    for (const bool transient : {true, false}) {
        const auto gone = make(dataApplication, "a", transient);
        const auto kept = make(dataApplication, "a", !transient);
        EXPECT_EQ(1, stage(deletionOf({gone})));
        EXPECT_FALSE(cached(dataApplication, "a", transient));
        EXPECT_TRUE(fs::exists(onDeathRow(gone)));
        EXPECT_EQ(kept->url, cached(dataApplication, "a", !transient)->url);
        EXPECT_EQ(1, stage(deletionOf({kept})));
        EXPECT_EQ(1, passCode());
    }
}

TEST_F(Deletion, CodeSigningGoesWithABundle) {
    const auto entry = [](std::optional<std::vector<std::string>> children = {}) {
        return OSTCodeSigningEntry{.codeSigningInfo = std::make_shared<const OSTDictionary>(),
                                   .childBundleIdentifiers = std::move(children)}
            .serialize();
    };
    test::writeFile(
        "/private/var/root/Library/Ostrand/ost_code_signing_info.plist",
        platform::serializeBinaryPropertyList(OSTDictionary({{"app", entry(std::vector<std::string>{"app.a", "app.b"})},
                                                             {"app.a", entry()},
                                                             {"app.b", entry()},
                                                             {"apple", entry()}})));
    static OSTCodeSigningStoreDelegate delegate;
    OSTStoreDelegate::join(delegate);
    const auto known = [] {
        std::string list;
        for (const auto* const identifier : {"app", "app.a", "app.b", "apple"})
            if (OSTCodeSigningMapping::sharedInstance().codeSigningInfoExistForIdentifier(identifier))
                list.append(identifier).append(" ");
        return list;
    };
    EXPECT_EQ(1, stage(deletionOf({make(dataApplication, "app")})));
    EXPECT_EQ("app app.a app.b apple ", known());
    EXPECT_EQ(1, stage(deletionOf({make(bundleApplication, "app")})));
    EXPECT_EQ("apple ", known());
}

TEST_F(Deletion, WhatCannotBeMovedIsRemovedAndWhatCannotBeRemovedStays) {
    const auto removed = make(dataApplication, "removed");
    const auto kept = make(dataApplication, "kept");
    const auto last = make(dataApplication, "last");
    const auto alone = make(dataApplication, "alone");
    for (const auto& record : {removed, kept, alone})
        test::writeFile(onDeathRow(record) / "occupied", "");
    for (const auto& record : {kept, alone})
        mountOver(fs::path(record->url) / "tmp");
    ASSERT_TRUE(platform::setSandboxUserStateItem(501, 1, "kept", kept->url));
    EXPECT_EQ(1, stage(deletionOf({removed, kept, last})));
    EXPECT_FALSE(fs::exists(removed->url));
    EXPECT_FALSE(cached(dataApplication, "removed"));
    EXPECT_TRUE(fs::exists(kept->url));
    EXPECT_TRUE(fs::is_symlink(fs::path(sandboxStateDirectory) / "501/1/kept"));
    EXPECT_TRUE(fs::exists(onDeathRow(last) / "last"));
    EXPECT_EQ(28, codeOf(store().deleteContainerForUser(alone->name()))) << "what stays is not said to be deleted";
}

TEST_F(Deletion, OneContainerIsLookedUpAndStaged) {
    const auto remove = [](std::uint32_t user, std::optional<std::string_view> identifier, bool transient = false) {
        return codeOf(store().deleteContainerForUser({user, dataApplication, identifier, transient}));
    };
    EXPECT_EQ(21, remove(501, "a"));
    const auto live = make(dataApplication, "a");
    const auto transient = make(dataApplication, "a", true);
    EXPECT_EQ(11, remove(501, std::nullopt));
    EXPECT_EQ(11, remove(33, "a"));
    EXPECT_TRUE(fs::exists(live->url));
    EXPECT_EQ(1, remove(501, "a"));
    EXPECT_TRUE(fs::exists(onDeathRow(live) / "a"));
    EXPECT_FALSE(cached(dataApplication, "a"));
    EXPECT_TRUE(fs::exists(transient->url));
    EXPECT_EQ(21, remove(501, "a"));
    EXPECT_EQ(21, remove(501, "a", true)) << "the look-up has thrown it away";
    EXPECT_FALSE(fs::exists(transient->url));
}

TEST_F(Deletion, PassDestroysWhatItCanAndParksTheRest) {
    EXPECT_EQ(1, passCode());
    fs::remove(deathRow);
    EXPECT_EQ(ENOENT, passCode()) << "no death row";
    test::writeFile(deathRow, "");
    EXPECT_EQ(28, passCode()) << "no directory";
    fs::remove(deathRow);

    const fs::path row = deathRow;
    test::writeFile(row / "plain" / "deep" / "file", "");
    test::writeFile(row / "file", "");
    fs::create_directories(row / "stuck" / "mounted");
    mountOver(row / "stuck" / "mounted");
    EXPECT_EQ(EXDEV, passCode()) << "the removal's error";
    EXPECT_TRUE(names(row).empty());
    EXPECT_EQ(std::vector<std::string>{"stuck"}, names("/tmp"));
    EXPECT_EQ(1, passCode());

    // The place under /tmp is taken now.
    fs::create_directories(row / "stuck" / "mounted");
    mountOver(row / "stuck" / "mounted");
    test::writeFile(row / "other", "");
    EXPECT_EQ(17, passCode());
    EXPECT_EQ(std::vector<std::string>{"stuck"}, names(row));
}

TEST_F(Deletion, ItemsReachDeathRowWhilePassesEmptyIt) {
    constexpr int threads = 4;
    constexpr int rounds = 300;
    std::atomic<int> failures = 0;
    {
        std::atomic<bool> done = false;
        const std::jthread passes([&] {
            while (!done)
                failures += passCode() != 1;
        });
        std::vector<std::future<void>> movers;
        for (int t = 0; t < threads; ++t)
            movers.push_back(std::async(std::launch::async, [&, identifier = "app." + std::to_string(t)] {
                // Each round throws the container of the round before away.
                for (int i = 0; i < rounds; ++i)
                    failures +=
                        cached(dataApplication, make(dataApplication, identifier, true)->identifier, true) == nullptr;
                failures += stage(deletionOf({cached(dataApplication, identifier, true)})) != 1;
            }));
        for (auto& mover : movers)
            mover.get();
        done = true;
    }
    EXPECT_EQ(0, failures);
    EXPECT_EQ(1, passCode());
    EXPECT_TRUE(names(deathRow).empty());
    EXPECT_TRUE(names("/tmp").empty()) << "nothing was parked";
    EXPECT_TRUE(names("/private/var/mobile/Library/Caches/com.tamarok.ostrandd/Temp/Data/Application").empty());
}

} // namespace
} // namespace ost
