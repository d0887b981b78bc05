#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTCodeSigningStoreDelegate.h"
#include "platform/codec/PropertyList.h"
#include "platform/device/SandboxUserState.h"
#include "store/OSTLocks.h"
#include "store/OSTReplaceFile.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <sys/mount.h>
#include <sys/stat.h>

#include <csignal>
#include <filesystem>
#include <functional>
#include <stdexcept>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;
using platform::UUID;

/// Acts in the middle of a bundle's replacement, when the old container is parked and the new one still waits.
class Midway final : public test::StoreDelegate {
public:
    std::function<OSTResult<void>()> act = [] { return OSTResult<void>(); };
    bool restored = false;

    Restoration rememberIdentifierAndItsChildren(std::string_view) override {
        return [this] { restored = true; };
    }
    OSTResult<void> invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view) override { return act(); }
    std::optional<std::string> wellknownContainerForId(std::string_view identifier, OSTContainerClass) override {
        return identifier == "well.known" ? std::optional<std::string>("known.name") : std::nullopt;
    }
};

class Replacement : public test::StoreTest {
protected:
    Replacement() { OSTStoreDelegate::join(midway); }

    static OSTReplacement replacementOf(const OSTMetadataRecord& old, const OSTMetadataRecord& fresh,
                                        bool preserveOldUUID = false) {
        const auto side = [](const OSTMetadataRecord& record) {
            return OSTContainerReference{record->name(), record->uuid};
        };
        return {.oldContainer = old ? side(old) : OSTContainerReference{},
                .newContainer = side(fresh),
                .preserveOldUUID = preserveOldUUID};
    }
    /// The code of the operation: 1 for success.
    static int replace(const OSTReplacement& replacement) {
        const auto result = store().replaceContainer(replacement);
        return static_cast<int>(result ? OSTErrorCode::success : result.error());
    }
    static int replace(const OSTMetadataRecord& old, const OSTMetadataRecord& fresh, bool preserveOldUUID = false) {
        return replace(replacementOf(old, fresh, preserveOldUUID));
    }
    static fs::path nameOf(const OSTMetadataRecord& record) { return fs::path(record->url).filename(); }

    /// Makes a container a mount point, which cannot be renamed.
    static void pinDown(const OSTMetadataRecord& record) {
        mountOver(record->url);
        ASSERT_TRUE(record->writeMetadataToDisk());
    }
    static void expectNothingUnderWay() {
        EXPECT_TRUE(names(staging).empty());
        EXPECT_TRUE(names(replaceDirectory).empty());
    }

    static inline Midway midway;
};

TEST_F(Replacement, PutsTheNewContainerInThePlaceOfTheOldOne) {
    int round = 0;
    for (const bool transient : {false, true})
        for (const bool preserveOldUUID : {false, true}) {
            const auto suffix = std::to_string(round++);
            const auto old = make(dataApplication, "old" + suffix, transient);
            const auto fresh = make(dataApplication, "new" + suffix, !transient);
            const auto place = preserveOldUUID ? fs::path(old->url) : fs::path(old->url).parent_path() / nameOf(fresh);
            ASSERT_EQ(1, replace(old, fresh, preserveOldUUID));

            EXPECT_TRUE(fs::exists(place / fresh->identifier));
            EXPECT_FALSE(fs::exists(place / old->identifier));
            EXPECT_FALSE(fs::exists(fresh->url));
            EXPECT_EQ(preserveOldUUID, fs::exists(old->url));
            EXPECT_EQ(place, fs::read_symlink(fs::path(platform::sandboxStateDirectory) / "501/1" / fresh->identifier));
            const auto record = cached(dataApplication, fresh->identifier, transient);
            ASSERT_TRUE(record);
            EXPECT_EQ(place, record->url);
            EXPECT_EQ(transient, record->transient);
            EXPECT_EQ(preserveOldUUID ? old->uuid : fresh->uuid, record->uuid);
            const auto onDisk = OSTMetadata::readAndValidateMetadataAtUrl(place.native(), 501, OSTCheckClassPath::no);
            EXPECT_EQ(record->uuid, onDisk.value().uuid);
            EXPECT_FALSE(cached(dataApplication, fresh->identifier, !transient));
            EXPECT_FALSE(cached(dataApplication, old->identifier, transient));
            expectNothingUnderWay();
            EXPECT_EQ(2U, names(deathRow).size()) << "the old container and the replace file";
            EXPECT_EQ(1, passCode());
        }
}

TEST_F(Replacement, UnderAnotherIdentifierTakesNobodyElsesPlace) {
    for (const bool transient : {false, true}) {
        const auto old = make(dataApplication, "a", transient);
        const auto fresh = make(dataApplication, "b", !transient);
        const auto third = make(dataApplication, "b", transient);
        const auto before = places();
        EXPECT_EQ(27, replace(old, fresh)) << transient;
        EXPECT_EQ(before, places());
        EXPECT_EQ(third->uuid, cached(dataApplication, "b", transient)->uuid);
        EXPECT_EQ(1, replace(third, fresh));
    }
    EXPECT_EQ(1, replace(make(dataApplication, "c"), make(dataApplication, "d"), true)) << "both live, and no third";
}

TEST_F(Replacement, StartsAPassOnlyWhenAskedTo) {
    for (const bool start : {false, true}) {
        const auto old = make(dataApplication, "a");
        const auto fresh = make(dataApplication, "a", true);
        auto replacement = replacementOf(old, fresh);
        replacement.startDeletionThread = start;
        EXPECT_EQ(1, replace(replacement));
        OSTDeathRowQueue().sync([] {});
        EXPECT_EQ(start, names(deathRow).empty());
    }
}

TEST_F(Replacement, FileThatIsStillPendingIsDiscardedBeforeItsContainerGoes) {
    const auto pend = [](const OSTMetadataRecord& record) {
        const auto token = UUID::generate().string();
        const OSTReplaceFile file{.oldURL = record->url,
                                  .newURL = record->url,
                                  .stagingURL = fs::path(staging) / token,
                                  .destinationURL = record->url};
        EXPECT_TRUE(file._writeToDiskReplaceAt(OSTReplaceFile::urlOfToken(token)));
    };
    const auto other = make(dataApplication, "other");
    pend(other);
    const auto deleted = make(dataApplication, "deleted");
    pend(deleted);
    EXPECT_TRUE(store().stageForDeleteContainer(*deleted));
    const auto old = make(dataApplication, "old");
    const auto fresh = make(dataApplication, "fresh", true);
    pend(old);
    pend(fresh);
    EXPECT_EQ(1, replace(old, fresh));
    const auto transient = make(dataApplication, "transient", true);
    pend(transient);
    make(dataApplication, "transient", true);
    const auto renamed = make(dataApplication, "renamed");
    pend(renamed);
    EXPECT_TRUE(store().regenerateDirectoryUUIDForUser({renamed->name(), renamed->uuid}));
    pend(make(dataApplication, "swept", true));
    store().rebootContainerManagerCleanup();
    EXPECT_EQ(1U, names(replaceDirectory).size()) << "that of the other one";
    store().containerManagerSetup();
    EXPECT_TRUE(names(replaceDirectory).empty());
}

TEST_F(Replacement, IsWrittenDownBeforeTheFirstMove) {
    const auto old = make(bundleApplication, "a");
    const auto fresh = make(bundleApplication, "a", true);
    midway.act = [&]() -> OSTResult<void> {
        const auto files = names(replaceDirectory);
        const auto parked = names(staging);
        EXPECT_EQ(1U, files.size());
        EXPECT_EQ(std::vector<std::string>{fs::path(files.front()).stem()}, parked) << "both are named by one token";
        EXPECT_TRUE(UUID::parse(parked.front()));
        const auto url = fs::path(replaceDirectory) / files.front();
        EXPECT_TRUE(test::readFile(url).starts_with("bplist00"));
        const auto file = OSTReplaceFile::_readAndValidateReplaceFileAtUrl(url);
        EXPECT_EQ(old->url, file->oldURL);
        EXPECT_EQ(fresh->url, file->newURL);
        EXPECT_EQ(fs::path(staging) / parked.front(), file->stagingURL);
        EXPECT_EQ(fs::path(old->url).parent_path() / nameOf(fresh), file->destinationURL);
        EXPECT_TRUE(fs::exists(fs::path(file->stagingURL) / "a"));
        EXPECT_TRUE(fs::exists(fresh->url));
        return {};
    };
    EXPECT_EQ(1, replace(old, fresh));
    EXPECT_FALSE(midway.restored);

    const OSTReplaceFile incomplete{.oldURL = "/a", .newURL = "/b", .stagingURL = "/c", .destinationURL = ""};
    EXPECT_TRUE(incomplete._writeToDiskReplaceAt("/x.plist").error().is(OSTErrorCode::replaceDescriptionIncomplete));
    EXPECT_FALSE(fs::exists("/x.plist"));
}

TEST_F(Replacement, WithoutAnOldContainerMovesTheNewOneToAFreePlace) {
    const auto fresh = make(dataApplication, "a", true);
    const auto taken = make(dataApplication, "b");
    const auto other = make(dataApplication, "b", true);
    ASSERT_EQ(1, replace(nullptr, fresh));
    const auto record = cached(dataApplication, "a");
    ASSERT_TRUE(record);
    EXPECT_EQ(fs::path(taken->url).parent_path() / nameOf(fresh), record->url);
    EXPECT_TRUE(fs::exists(fs::path(record->url) / "a"));
    EXPECT_EQ(fresh->uuid, record->uuid);
    EXPECT_FALSE(cached(dataApplication, "a", true));
    EXPECT_TRUE(names(deathRow).empty());

    const auto before = places();
    EXPECT_EQ(27, replace(nullptr, other)) << "a container of that identifier lives";
    EXPECT_EQ(27, replace(nullptr, taken)) << "it lives there itself";
    fs::rename(fs::path(taken->url) / OSTMetadataFileName, "/aside");
    EXPECT_EQ(44, replace(nullptr, other)) << "the cache's own error";
    fs::rename("/aside", fs::path(taken->url) / OSTMetadataFileName);
    EXPECT_EQ(before, places());
    EXPECT_TRUE(names(deathRow).empty()) << "there was no replace file";
}

TEST_F(Replacement, RefusesWhatDoesNotGoTogether) {
    const auto old = make(dataApplication, "old");
    const auto fresh = make(dataApplication, "new", true);
    const auto changed = [&](auto change) {
        auto replacement = replacementOf(old, fresh);
        change(replacement);
        return replacement;
    };
    const auto before = places();
    struct Case {
        int code;
        OSTReplacement replacement;
    };
    const Case checkedFirst[] = {
        {11, changed([](auto& r) { r.newContainer.uuid.reset(); })},
        {11, changed([](auto& r) { r.newContainer.name.containerClass = undefined; })},
        {11, changed([](auto& r) { r.newContainer.name.containerClass = max; })},
        {11, changed([](auto& r) { r.oldContainer.name.containerClass = max; })},
        {11, changed([](auto& r) { r.oldContainer = {}, r.preserveOldUUID = true; })},
        {23, changed([](auto& r) {
             r.newContainer.name.containerClass = dataVPNPlugin, r.newContainer.name.userId = 502;
         })},
        {56, changed([](auto& r) { r.newContainer.name.userId = 502; })},
    };
    {
        const OSTAllIdentifiersLock lock(OSTLockKind::writing);
        for (const auto& [code, replacement] : checkedFirst)
            EXPECT_EQ(code, replace(replacement)) << "before any lock";
    }
    const Case cases[] = {
        {21, changed([](auto& r) { r.oldContainer.uuid = UUID::generate(); })},
        {21, changed([](auto& r) { r.oldContainer.name.identifier.reset(); })},
        {21, changed([](auto& r) { r.newContainer.uuid = UUID::generate(); })},
        {21, changed([](auto& r) { r.newContainer.name.identifier = "old"; })},
        {22, replacementOf(old, old)},
        {22, replacementOf(fresh, fresh, true)},
    };
    for (const auto& [code, replacement] : cases)
        EXPECT_EQ(code, replace(replacement));
    EXPECT_EQ(before, places());
    EXPECT_EQ(27, replace(old, make(dataApplication, "living"))) << "its place is its own";
    EXPECT_EQ(10, replace(make(dataSystem, "old", true), make(dataSystem, "well.known"))) << "a name that is no UUID";
    expectNothingUnderWay();
    EXPECT_TRUE(names(deathRow).empty());
}

TEST_F(Replacement, FailureMidwayPutsTheOldContainerBack) {
    const auto old = make(bundleApplication, "old");
    const auto fresh = make(bundleApplication, "new", true);
    const auto destination = fs::path(old->url).parent_path() / nameOf(fresh);
    const auto before = places();
    const struct {
        int code;
        std::function<OSTResult<void>()> act;
        std::function<void()> tidy;
    } rows[] = {
        {59, [] { return std::unexpected(OSTCreateError(OSTErrorCode::mappingWriteFailed, "unwritable")); }, [] {}},
        {40, []() -> OSTResult<void> { throw std::runtime_error("midway"); }, [] {}},
        {15,
         [&] {
             fs::rename(fresh->url, "/aside");
             return OSTResult<void>();
         },
         [&] { fs::rename("/aside", fresh->url); }},
        {15,
         [&] {
             test::writeFile(destination / "occupied", "");
             return OSTResult<void>();
         },
         [&] { fs::remove_all(destination); }},
    };
    for (const auto& [code, act, tidy] : rows) {
        midway.act = act;
        midway.restored = false;
        EXPECT_EQ(code, replace(old, fresh));
        tidy();
        EXPECT_EQ(before, places()) << code;
        EXPECT_TRUE(midway.restored) << code;
        EXPECT_EQ(old->url, cached(bundleApplication, "old")->url) << code;
        EXPECT_EQ(old->uuid, cached(bundleApplication, "old")->uuid) << code;
        EXPECT_EQ(fresh->url, cached(bundleApplication, "new", true)->url) << code;
        EXPECT_TRUE(names(replaceDirectory).empty()) << code;
        EXPECT_EQ(std::string::npos, test::tree(deathRow).find("/old\n")) << code;
        EXPECT_EQ(1, passCode());
    }
    midway.act = [] { return OSTResult<void>(); };
    EXPECT_EQ(1, replace(old, fresh, true)) << "no lock was left behind";
}

TEST_F(Replacement, MovesThatFailChangeNothing) {
    const auto old = make(dataApplication, "old");
    const auto fresh = make(dataApplication, "new", true);
    const auto expectUnchanged = [&, before = places()] {
        EXPECT_EQ(before, places());
        EXPECT_EQ(old->url, cached(dataApplication, "old")->url);
        EXPECT_EQ(fresh->url, cached(dataApplication, "new", true)->url);
    };
    fs::create_directories(replaceDirectory);
    mountOver(replaceDirectory, true);
    EXPECT_EQ(34, replace(old, fresh)) << "no replace file can be written";
    expectUnchanged();
    ASSERT_EQ(0, ::umount(replaceDirectory));

    const auto pinnedOld = make(dataApplication, "pinned");
    pinDown(pinnedOld);
    EXPECT_EQ(14, replace(pinnedOld, fresh));
    EXPECT_TRUE(cached(dataApplication, "pinned"));
    ASSERT_EQ(0, ::umount(pinnedOld->url.c_str()));
    const auto pinnedNew = make(dataApplication, "pinnedNew", true);
    pinDown(pinnedNew);
    EXPECT_EQ(15, replace(old, pinnedNew));
    EXPECT_EQ(15, replace(old, pinnedNew, true));
    EXPECT_EQ(old->url, cached(dataApplication, "old")->url);
    EXPECT_TRUE(fs::exists(fs::path(old->url) / "old"));
    expectNothingUnderWay();
}

TEST_F(Replacement, CodeSigningOfAReplacedBundleBecomesInvalidUnlessTheReplacementFails) {
    const auto entry = [](bool hasInfo, std::optional<std::vector<std::string>> children = {}) {
        return OSTCodeSigningEntry{.codeSigningInfo = hasInfo ? std::make_shared<const OSTDictionary>() : nullptr,
                                   .childBundleIdentifiers = std::move(children),
                                   .dataContainerClass = 2}
            .serialize();
    };
    const fs::path mappingFile = "/private/var/root/Library/Ostrand/ost_code_signing_info.plist";
    test::writeFile(mappingFile,
                    platform::serializeBinaryPropertyList(OSTDictionary(
                        {{"app", entry(true, std::vector<std::string>{"app.bare", "app.gone", "app.child"})},
                         {"app.bare", entry(false)},
                         {"app.child", entry(true)},
                         {"apple", entry(true)}})));
    static OSTCodeSigningStoreDelegate delegate;
    OSTStoreDelegate::join(delegate);
    auto& mapping = OSTCodeSigningMapping::sharedInstance();
    const auto valid = [&] {
        std::string list;
        for (const auto* const identifier : {"app", "app.child", "app.gone", "apple"})
            if (mapping.getCodeSigningInfoForIdentifier(identifier))
                list.append(identifier).append(" ");
        return list;
    };
    const auto old = make(bundleApplication, "app");
    const auto fresh = make(bundleApplication, "app", true);
    const auto onDisk = test::readFile(mappingFile);

    fs::rename(mappingFile, "/aside");
    fs::create_directory(mappingFile);
    EXPECT_EQ(59, replace(old, fresh)) << "the mapping cannot be written";
    EXPECT_EQ("app app.child apple ", valid());
    EXPECT_TRUE(fs::exists(fs::path(old->url) / "app"));
    fs::remove(mappingFile);
    fs::rename("/aside", mappingFile);

    const auto pinned = make(bundleApplication, "pinned", true);
    pinDown(pinned);
    EXPECT_EQ(15, replace(old, pinned));
    EXPECT_EQ("app app.child apple ", valid());
    EXPECT_EQ(2U, mapping.dataContainerTypeForIdentifier("app.bare")) << "an entry without information is one too";
    EXPECT_EQ(onDisk, test::readFile(mappingFile));

    EXPECT_EQ(1, replace(old, fresh));
    EXPECT_EQ("apple ", valid());
    EXPECT_TRUE(mapping.codeSigningInfoExistForIdentifier("app"));
}

// What cannot be put back

TEST_F(Replacement, OldContainerThatCannotBePutBackWaitsForTheNextStart) {
    const auto fresh = make(bundleApplication, "new", true);
    const auto occupy = [](const OSTMetadataRecord& record) { test::writeFile(record->url + "/occupied", ""); };
    for (const bool raises : {false, true}) {
        const auto old = make(bundleApplication, raises ? "raises" : "fails");
        const auto before = places();
        midway.act = [&]() -> OSTResult<void> {
            occupy(old);
            if (raises)
                throw std::runtime_error("midway");
            return std::unexpected(OSTCreateError(OSTErrorCode::mappingWriteFailed, "unwritable"));
        };
        if (raises)
            EXPECT_EXIT(replace(old, fresh), testing::KilledBySignal(SIGABRT), "Failed to recover replace move");
        else
            EXPECT_EQ(59, replace(old, fresh));
        EXPECT_TRUE(fs::exists(old->url + "/occupied"));
        EXPECT_EQ(1U, names(replaceDirectory).size());
        store().containerManagerCleanup();
        EXPECT_EQ(1, passCode());
        EXPECT_EQ(1U, names(staging).size()) << "what has a replace file is not thrown away";
        fs::remove_all(old->url);
        store().containerManagerSetup();
        EXPECT_EQ(before, places());
        expectNothingUnderWay();
    }
}

class ReplaceRecovery : public Replacement {
protected:
    static inline const std::string live = "/private/var/mobile/Containers/Data/Application";
    static inline const std::string token = "6F1E3A52-9C57-4C0B-8F0B-2C5D3B1B7E10";
    static inline const std::string oldURL = live + "/0B1C9E44-52C5-4B62-9A0E-1C5A2F0D6A01";
    static inline const std::string destination = live + "/0B1C9E44-52C5-4B62-9A0E-1C5A2F0D6A02";
    static inline const std::string parked = staging + ("/" + token);
    static inline const fs::path file = fs::path(replaceDirectory) / (token + ".plist");

    static OSTDictionary description() {
        return OSTDictionary({{"OSTReplaceOperationOldURL", oldURL},
                              {"OSTReplaceOperationNewURL",
                               "/private/var/mobile/Library/Caches/com.tamarok.ostrandd/Temp/Data/Application/"
                               "0B1C9E44-52C5-4B62-9A0E-1C5A2F0D6A02"},
                              {"OSTReplaceOperationStagingURL", parked},
                              {"OSTReplaceOperationDestURL", destination}});
    }
    static std::string binary(const OSTDictionary& dictionary) {
        return platform::serializeBinaryPropertyList(dictionary);
    }
    /// The description with another value under one key.
    static std::string with(const char* key, OSTValue value) {
        auto dictionary = description();
        dictionary.set(std::string("OSTReplaceOperation") + key, std::move(value));
        return binary(dictionary);
    }
    static std::string without(const char* key) {
        auto dictionary = description();
        dictionary.remove(std::string("OSTReplaceOperation") + key);
        return binary(dictionary);
    }
    /// The old container is parked, and neither it nor the new one is in place.
    static void plantParkedContainer() {
        fs::create_directories(live);
        fs::create_directories(replaceDirectory);
        for (const auto& path : {oldURL, destination, parked})
            fs::remove_all(path);
        test::writeFile(parked + "/old", "");
    }
    static void expectUntouched(const std::string& what) {
        EXPECT_FALSE(fs::exists(oldURL)) << what;
        EXPECT_TRUE(fs::exists(parked + "/old")) << what;
        EXPECT_TRUE(names(replaceDirectory).empty()) << what;
    }
};

TEST_F(ReplaceRecovery, DecidesByTheOldPlaceAndTheDestination) {
    store().containerManagerSetup(); // without a replace directory there is nothing to do
    const std::string xml = "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
                            "<key>OSTReplaceOperationOldURL</key><string>" +
                            oldURL + "</string><key>OSTReplaceOperationNewURL</key><string>" + destination +
                            "</string><key>OSTReplaceOperationStagingURL</key><string>" + parked +
                            "</string><key>OSTReplaceOperationDestURL</key><string>" + destination +
                            "</string></dict></plist>";
    for (const auto& bytes : {binary(description()), xml})
        for (const bool oldExists : {false, true})
            for (const bool destinationExists : {false, true}) {
                plantParkedContainer();
                if (oldExists)
                    fs::create_directory(oldURL);
                if (destinationExists)
                    fs::create_directory(destination);
                test::writeFile(file, bytes);
                store().containerManagerSetup();
                const bool putBack = !oldExists && !destinationExists;
                EXPECT_EQ(putBack, fs::exists(oldURL + "/old"));
                EXPECT_NE(putBack, fs::exists(parked));
                EXPECT_EQ(destinationExists, fs::exists(destination));
                EXPECT_TRUE(names(replaceDirectory).empty());
            }
}

TEST_F(ReplaceRecovery, InvalidReplaceFilesAreDiscardedAndMoveNothing) {
    const auto valid = binary(description());
    const struct {
        const char* what;
        std::string bytes;
    } rows[] = {
        {"empty", ""},
        {"truncated", valid.substr(0, valid.size() - 9)},
        {"garbage", "\x01\xff garbage"},
        {"no dictionary", "<plist version=\"1.0\"><array/></plist>"},
        {"giant", std::string(std::size_t{2} << 20U, ' ')},
        {"no old", without("OldURL")},
        {"no new", without("NewURL")},
        {"no staging", without("StagingURL")},
        {"no destination", without("DestURL")},
        {"number", with("OldURL", std::uint64_t{2})},
        {"array", with("DestURL", OSTArray{oldURL})},
        {"empty path", with("OldURL", "")},
        {"relative", with("OldURL", oldURL.substr(1))},
        {"elsewhere", with("OldURL", "/etc/ostrand")},
        {"way out", with("OldURL", live + "/../../../../../../../etc/ostrand")},
        {"dot", with("OldURL", live + "/..")},
        {"class directory", with("OldURL", live)},
        {"inside a container", with("OldURL", oldURL + "/Library")},
        {"user without account", with("OldURL", "/private/var/stranger/Containers/Data/Application/x")},
        {"destination elsewhere", with("DestURL", "/tmp/x")},
        {"new elsewhere", with("NewURL", "/tmp/x")},
        {"staging elsewhere", with("StagingURL", "/etc")},
        {"staging itself", with("StagingURL", staging)},
        {"above staging", with("StagingURL", staging + std::string("/.."))},
        {"inside what is parked", with("StagingURL", parked + "/old")},
    };
    for (const auto& [what, bytes] : rows) {
        plantParkedContainer();
        test::writeFile(file, bytes);
        store().containerManagerSetup();
        expectUntouched(what);
    }
    EXPECT_TRUE(fs::exists("/etc/passwd"));

    plantParkedContainer();
    fs::create_directory(file);
    ASSERT_EQ(0, ::mkfifo((fs::path(replaceDirectory) / "fifo").c_str(), 0666));
    test::writeFile("/outside.plist", valid);
    fs::create_symlink("/outside.plist", fs::path(replaceDirectory) / "link");
    store().containerManagerSetup();
    expectUntouched("no regular file");
    EXPECT_TRUE(fs::exists("/outside.plist"));
}

TEST_F(ReplaceRecovery, OnlyADirectoryInStagingIsPutBack) {
    plantParkedContainer();
    fs::rename(parked, "/victim");
    fs::create_directory_symlink("/victim", parked);
    test::writeFile(file, binary(description()));
    store().containerManagerSetup();
    expectUntouched("link");
    EXPECT_TRUE(fs::is_symlink(parked));

    fs::remove(parked);
    test::writeFile(parked, "");
    test::writeFile(file, binary(description()));
    store().containerManagerSetup();
    EXPECT_FALSE(fs::exists(oldURL));
    EXPECT_TRUE(names(replaceDirectory).empty());
}

TEST_F(ReplaceRecovery, MoveThatFailsIsTriedAgainAtTheNextStart) {
    plantParkedContainer();
    test::writeFile(file, binary(description()));
    fs::rename(live, live + ".away");
    for (int start = 0; start < 2; ++start) {
        store().containerManagerSetup();
        store().containerManagerCleanup();
        EXPECT_EQ(1, passCode());
        EXPECT_TRUE(fs::exists(file));
        EXPECT_TRUE(fs::exists(parked + "/old"));
    }
    fs::rename(live + ".away", live);
    store().containerManagerSetup();
    EXPECT_TRUE(fs::exists(oldURL + "/old"));
    expectNothingUnderWay();
}

TEST_F(ReplaceRecovery, WaitsForAHomeWhoseLinkLeadsNowhere) {
    const std::string away = "/volume/kim/Containers/Data/Application", name = "/0B1C9E44-52C5-4B62-9A0E-1C5A2F0D6A03";
    test::writeFile("/etc/passwd", test::readFile("/etc/passwd") + "kim:x:502:502::/homes/kim:/bin/sh\n");
    fs::create_directory_symlink("/volume", "/homes");
    plantParkedContainer();
    const OSTReplaceFile replaceFile{
        .oldURL = away + name, .newURL = away + name, .stagingURL = parked, .destinationURL = away + name};
    ASSERT_TRUE(replaceFile._writeToDiskReplaceAt(file));
    store().containerManagerSetup();
    store().containerManagerCleanup();
    EXPECT_EQ(1, passCode());
    EXPECT_TRUE(fs::exists(parked + "/old"));
    EXPECT_TRUE(store().stageForDeleteContainer(*make(dataApplication, "of somebody else")));
    fs::create_directories(away);
    store().containerManagerSetup();
    EXPECT_TRUE(fs::exists(away + name + "/old"));
    expectNothingUnderWay();
}

} // namespace
} // namespace ost
