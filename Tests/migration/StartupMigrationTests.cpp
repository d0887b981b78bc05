#include "codesigning/OSTCodeSigningStoreDelegate.h"
#include "migration/OSTContainerMigrator.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <sys/mount.h>

#include <filesystem>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;

class StartupMigration : public test::StoreTest {
protected:
    StartupMigration() {
        static OSTCodeSigningStoreDelegate delegate;
        OSTStoreDelegate::join(delegate);
    }
    static bool migrate() {
        return OSTContainerMigrator::sharedInstance().performSynchronousDaemonStartupMigration().has_value();
    }
    /// Moves the bundle containers to where an older release had them.
    static void makeOld() {
        fs::create_directories(fs::path(oldBundles).parent_path());
        fs::rename(bundles, oldBundles);
    }

    static constexpr const char* oldLogs = "/private/var/mobile/Library/Logs/Ostrand";
    static constexpr const char* logs = "/private/var/root/Library/Logs/Ostrand";
    static constexpr const char* oldBundles = "/private/var/mobile/Containers/Bundle";
    static constexpr const char* bundles = "/private/var/containers/Bundle";
};

TEST_F(StartupMigration, OldLocationsOfTheUserAreCleared) {
    test::writeFile("/private/var/mobile/Library/Ostrand/deep/file", "");
    test::writeFile(fs::path(oldLogs) / "ostrandd.log", "old");
    test::writeFile(fs::path(oldLogs) / "other.log", "other");
    test::writeFile(fs::path(logs) / "ostrandd.log", "live");
    ASSERT_TRUE(migrate());
    EXPECT_FALSE(fs::exists("/private/var/mobile/Library/Ostrand"));
    EXPECT_FALSE(fs::exists(oldLogs));
    EXPECT_EQ("live", test::readFile(fs::path(logs) / "ostrandd.log"));
    EXPECT_EQ("old", test::readFile(fs::path(logs) / "ostrandd.log.1"));
    EXPECT_EQ("other", test::readFile(fs::path(logs) / "other.log"));
}

TEST_F(StartupMigration, LinksInOldLocationsAreNotFollowed) {
    test::writeFile("/outside/file", "");
    fs::create_directories(fs::path(oldLogs).parent_path());
    fs::create_directory_symlink("/outside", oldLogs);
    fs::create_directory_symlink("/outside", "/private/var/mobile/Library/Ostrand");
    fs::create_directories(oldBundles);
    fs::create_directory_symlink("/outside", fs::path(oldBundles) / "Application");
    EXPECT_FALSE(migrate());
    EXPECT_TRUE(fs::exists("/outside/file"));
    EXPECT_FALSE(fs::is_symlink(oldLogs));
    EXPECT_FALSE(fs::is_symlink(fs::path(bundles) / "Application"));
}

TEST_F(StartupMigration, BundleContainersMoveAlsoWhenTheTargetExists) {
    const auto a = make(bundleApplication, "a");
    const auto b = make(bundleFramework, "b");
    makeOld();
    fs::create_directories(fs::path(bundles) / "Application");
    test::writeFile(fs::path(oldBundles) / ".note", "old");
    test::writeFile(fs::path(bundles) / ".note", "new");
    ASSERT_TRUE(migrate());
    EXPECT_EQ("new", test::readFile(fs::path(bundles) / ".note"));
    EXPECT_EQ("old", test::readFile(fs::path(bundles) / ".note.1"));
    EXPECT_FALSE(fs::exists(oldBundles));
    EXPECT_TRUE(fs::exists(fs::path(a->url) / "a"));
    EXPECT_TRUE(fs::exists(fs::path(b->url) / "b"));
}

TEST_F(StartupMigration, AnOldTreeThatIsAMountPointIsEmptiedAndKeepsNothingElseFromBeingMigrated) {
    const auto a = make(bundleApplication, "a");
    fs::create_directories(oldBundles);
    mountOver(oldBundles);
    fs::copy(bundles, oldBundles, fs::copy_options::recursive);
    fs::remove_all(bundles);
    EXPECT_TRUE(migrate());
    EXPECT_TRUE(fs::is_empty(oldBundles));
    EXPECT_TRUE(fs::exists(fs::path(a->url) / "a"));
    ::umount2(oldBundles, MNT_DETACH);
}

TEST_F(StartupMigration, AnInterruptedMoveIsFinishedAndNothingIsLostOrDoubled) {
    const auto copied = make(bundleApplication, "copied");
    const auto waiting = make(bundleApplication, "waiting");
    const auto taken = make(bundleApplication, "taken");
    makeOld();
    fs::create_directories(fs::path(bundles) / "Application");
    const auto old = [](const OSTMetadataRecord& record) {
        return fs::path(oldBundles) / "Application" / fs::path(record->url).filename();
    };
    fs::copy(old(copied), copied->url, fs::copy_options::recursive);
    test::writeFile(fs::path(taken->url) / "anybody's", "");

    EXPECT_FALSE(migrate());
    EXPECT_EQ(std::vector<std::string>{fs::path(taken->url).filename()}, names(fs::path(oldBundles) / "Application"));
    EXPECT_TRUE(fs::exists(fs::path(copied->url) / "copied"));
    EXPECT_TRUE(fs::exists(fs::path(waiting->url) / "waiting"));
    EXPECT_TRUE(fs::exists(fs::path(taken->url) / "anybody's"));
    EXPECT_TRUE(fs::exists(old(taken) / "taken"));

    fs::remove_all(taken->url);
    EXPECT_TRUE(migrate());
    EXPECT_FALSE(fs::exists(oldBundles));
    EXPECT_TRUE(fs::exists(fs::path(taken->url) / "taken"));
}

TEST_F(StartupMigration, WellKnownContainersGetTheirPlacesAndOneWhosePlaceIsTakenStaysWhereItIs) {
    const fs::path directory = "/private/var/containers/Data/System";
    const fs::path fixed[] = {directory / "com.tamarok.pellord", directory / "com.tamarok.quiltrad"};
    const fs::path old[] = {directory / "00000000-0000-0000-0000-000000000001",
                            directory / "00000000-0000-0000-0000-000000000002"};
    for (std::size_t i = 0; i < 2; ++i) {
        fs::create_directories(old[i]);
        const OSTMetadata metadata{.uid = OSTSystemUserId,
                                   .uuid = platform::UUID::generate(),
                                   .containerClass = dataSystem,
                                   .identifier = fixed[i].filename(),
                                   .url = old[i]};
        ASSERT_TRUE(metadata.writeMetadataToDisk());
    }
    test::writeFile(fixed[0] / "in-the-way", "");

    EXPECT_FALSE(migrate());
    EXPECT_EQ(old[0], cached(dataSystem, "com.tamarok.pellord")->url);
    EXPECT_EQ(fixed[1], cached(dataSystem, "com.tamarok.quiltrad")->url);
    EXPECT_FALSE(fs::exists(old[1]));
    EXPECT_TRUE(fs::exists(fixed[0] / "in-the-way"));

    fs::remove_all(fixed[0]);
    EXPECT_TRUE(migrate());
    EXPECT_EQ(fixed[0], cached(dataSystem, "com.tamarok.pellord")->url);
    EXPECT_TRUE(migrate());
}

} // namespace
} // namespace ost
