#include "files/OSTDictionaryFile.h"
#include "platform/device/SandboxUserState.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <thread>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;

template<typename T>
int codeOf(const std::expected<T, OSTErrorCode>& result) {
    return static_cast<int>(result ? OSTErrorCode::success : result.error());
}

class Attributes : public test::StoreTest {
protected:
    static OSTContainerReference referenceTo(const OSTMetadataRecord& record) { return {record->name(), record->uuid}; }

    static int set(const OSTMetadataRecord& record, std::string_view key, const std::optional<OSTValue>& value) {
        return codeOf(store().setInfoValue(value, key, referenceTo(record)));
    }

    /// The info values in the container's file, as text; "none" when it has no dictionary of them.
    static std::string infoOnDisk(const std::string& url) {
        const auto read = OSTMetadata::readAndValidateMetadataAtUrl(url, OSTDefaultUserId, OSTCheckClassPath::no);
        return !read ? "no metadata" : read->info ? read->info->description() : "none";
    }
    /// The same of what the store answers.
    static std::string info(const OSTMetadataRecord& record) {
        const auto read = store().metadataForUser(referenceTo(record));
        return !read ? "no container" : (*read)->info ? (*read)->info->description() : "none";
    }
    static std::string where(const OSTMetadataRecord& record) {
        return store().metadataForUser(referenceTo(record)).value()->url;
    }
};

TEST_F(Attributes, RefuseWhatNamesNoContainerBeforeAnyLockIsTaken) {
    const auto record = make(dataApplication, "a");
    const auto everyOperation = [](const OSTContainerReference& container, std::optional<std::string_view> key = "k") {
        return std::vector{codeOf(store().setInfoValue(OSTValue("v"), key, container)),
                           codeOf(store().infoValueForKey(key, container)), codeOf(store().metadataForUser(container)),
                           codeOf(store().recreateDefaultStructureForUser(container)),
                           codeOf(store().regenerateDirectoryUUIDForUser(container))};
    };
    const auto all = [](int code) { return std::vector(5, code); };
    const OSTIdentifierLock lock({record->uuid.string()}, OSTLockKind::writing);

    auto container = referenceTo(record);
    container.uuid.reset();
    EXPECT_EQ(everyOperation(container), all(11));
    for (const std::uint64_t number : {std::uint64_t{0}, std::uint64_t{14}, std::uint64_t{1} << 32U}) {
        container = referenceTo(record);
        container.name.containerClass = static_cast<OSTContainerClass>(number);
        EXPECT_EQ(everyOperation(container), all(11)) << number;
    }
    EXPECT_EQ(codeOf(store().setInfoValue(OSTValue("v"), std::nullopt, referenceTo(record))), 38);
    EXPECT_EQ(codeOf(store().infoValueForKey(std::nullopt, referenceTo(record))), 38);

    container = referenceTo(record);
    container.uuid = platform::UUID::generate();
    EXPECT_EQ(everyOperation(container), all(21));
    container = referenceTo(record);
    container.name.identifier.reset();
    container.uuid = platform::UUID::generate();
    EXPECT_EQ(everyOperation(container), all(21));
}

TEST_F(Attributes, InfoValuesAreInTheFileAndInMemoryAlike) {
    const auto record = make(dataApplication, "a");
    EXPECT_EQ(codeOf(store().infoValueForKey("k", referenceTo(record))), 24);
    EXPECT_EQ(set(record, "k", OSTValue("v")), 1);
    EXPECT_EQ(set(record, "n", OSTValue(std::int64_t{-1})), 1);
    EXPECT_EQ(store().infoValueForKey("k", referenceTo(record)), OSTValue("v"));
    EXPECT_EQ(infoOnDisk(record->url), "{k = v; n = -1; }");
    EXPECT_EQ(info(record), infoOnDisk(record->url));
    EXPECT_EQ(set(record, "k", std::nullopt), 1);
    EXPECT_EQ(infoOnDisk(record->url), "{n = -1; }");
    EXPECT_EQ(set(record, "n", std::nullopt), 1);
    EXPECT_EQ(infoOnDisk(record->url), "none");
    EXPECT_EQ(info(record), "none");
    EXPECT_EQ(set(record, "n", std::nullopt), 1) << "a key that is not there";
}

TEST_F(Attributes, AValueThatCannotBeWrittenChangesNothing) {
    const auto record = make(dataApplication, "a");
    ASSERT_EQ(set(record, "k", OSTValue("v")), 1);
    EXPECT_EQ(set(record, "big", OSTValue(std::string(OSTSmallDictionaryFileSize, 'x'))), 34);
    EXPECT_EQ(info(record), "{k = v; }");

    // In the place of the file, a directory that nothing replaces.
    const auto file = fs::path(record->metadataFileURL());
    fs::remove(file);
    fs::create_directory(file);
    EXPECT_EQ(set(record, "k", OSTValue("w")), 34);
    EXPECT_EQ(info(record), "{k = v; }");
    EXPECT_EQ(names(fs::path(record->url).parent_path()).size(), 1U) << "no unfinished file is left";
}

TEST_F(Attributes, ConcurrentSettersOfDifferentKeysLoseNothing) {
    const auto record = make(dataApplication, "a");
    std::vector<std::jthread> setters;
    for (int setter = 0; setter < 4; ++setter)
        setters.emplace_back([&, setter] {
            for (int i = 0; i < 10; ++i)
                EXPECT_EQ(set(record, std::to_string(setter) + "." + std::to_string(i), OSTValue("v")), 1);
        });
    setters.clear();
    EXPECT_EQ(store().metadataForUser(referenceTo(record)).value()->info->size(), 40U);
    EXPECT_EQ(infoOnDisk(record->url), info(record));
}

TEST_F(Attributes, TheDefaultStructureIsMadeAgainAndHarmsNobody) {
    const auto record = make(dataApplication, "a");
    const fs::path url = record->url;
    const auto whole = test::tree(url);
    for (const auto* const name : {"Documents", "Library", "tmp"})
        fs::remove_all(url / name);
    EXPECT_EQ(codeOf(store().recreateDefaultStructureForUser(referenceTo(record))), 1);
    EXPECT_EQ(test::tree(url), whole);

    test::writeFile(url / "Documents/mine", "", 0600);
    ASSERT_EQ(::chown((url / "Documents/mine").c_str(), 7, 8), 0);
    ASSERT_EQ(::chmod((url / "tmp").c_str(), 01777), 0);
    const auto withContent = test::tree(url);
    EXPECT_EQ(codeOf(store().recreateDefaultStructureForUser(referenceTo(record))), 1);
    EXPECT_EQ(test::tree(url), withContent);

    fs::create_directory("/victim");
    const auto plant = [&](const char* what) {
        fs::remove_all(url / "Library");
        if (what == std::string_view("link"))
            fs::create_symlink("/victim", url / "Library");
        else if (what == std::string_view("fifo"))
            ::mkfifo((url / "Library").c_str(), 0666);
        else
            test::writeFile(url / "Library", "");
    };
    for (const auto* const what : {"link", "fifo", "file"}) {
        plant(what);
        EXPECT_EQ(codeOf(store().recreateDefaultStructureForUser(referenceTo(record))), 6) << what;
    }
    struct stat status{};
    ASSERT_EQ(::stat("/victim", &status), 0);
    EXPECT_EQ(status.st_uid, 0U);
    EXPECT_TRUE(fs::is_empty("/victim"));
}

TEST_F(Attributes, ASystemContainerGetsItsStandardAgain) {
    const auto record = make(sharedSystemGroup, "g");
    const fs::path file = fs::path(record->url) / "Library/mine";
    test::writeFile(file, "");
    EXPECT_EQ(codeOf(store().recreateDefaultStructureForUser(referenceTo(record))), 1);
    struct stat status{};
    ASSERT_EQ(::stat(file.c_str(), &status), 0);
    EXPECT_EQ(status.st_uid, 4294967294U);
    EXPECT_EQ(status.st_mode & 0707U, 0U);
}

TEST_F(Attributes, ADirectoryGetsANewNameAndEverybodyFollows) {
    const auto record = make(dataApplication, "a");
    ASSERT_EQ(set(record, "k", OSTValue("v")), 1);
    EXPECT_EQ(codeOf(store().regenerateDirectoryUUIDForUser(referenceTo(record))), 1);
    const fs::path now = where(record), before = record->url;
    EXPECT_NE(now, before);
    EXPECT_EQ(now.parent_path(), before.parent_path());
    EXPECT_EQ(names(now.parent_path()), std::vector<std::string>{now.filename()});
    EXPECT_EQ(infoOnDisk(now), "{k = v; }");
    EXPECT_EQ(fs::read_symlink("/private/var/db/sandbox-state/501/1/a"), now);
    EXPECT_EQ(make(dataApplication, "a")->url, now);
}

TEST_F(Attributes, ATransientContainerMovesWithoutTheLiveOnesSandboxItem) {
    const auto live = make(dataApplication, "a");
    ASSERT_EQ(codeOf(store().regenerateDirectoryUUIDForUser(referenceTo(live))), 1);
    const auto transient = make(dataApplication, "a", true);
    EXPECT_EQ(codeOf(store().regenerateDirectoryUUIDForUser(referenceTo(transient))), 1);
    EXPECT_NE(where(transient), transient->url);
    EXPECT_EQ(fs::read_symlink("/private/var/db/sandbox-state/501/1/a"), where(live));
}

TEST_F(Attributes, AContainerThatCannotMoveStaysWhereItIs) {
    class Delegate final : public test::StoreDelegate {
        std::optional<std::string> wellknownContainerForId(std::string_view, OSTContainerClass) override {
            return "known.name";
        }
    } delegate;
    OSTStoreDelegate::join(delegate);
    const auto wellknown = make(dataSystem, "well.known");
    EXPECT_EQ(codeOf(store().regenerateDirectoryUUIDForUser(referenceTo(wellknown))), 48);
    EXPECT_EQ(where(wellknown), wellknown->url);

    const auto mounted = make(sharedSystemGroup, "mounted");
    mountOver(mounted->url);
    ASSERT_TRUE(mounted->writeMetadataToDisk());
    EXPECT_EQ(codeOf(store().regenerateDirectoryUUIDForUser(referenceTo(mounted))), 48);
    EXPECT_EQ(where(mounted), mounted->url);
}

} // namespace
} // namespace ost
