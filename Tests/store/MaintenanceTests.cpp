#include "files/OSTFileManager.h"
#include "platform/codec/PropertyList.h"
#include "store/OSTContainerCache.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;

class Maintenance : public test::StoreTest {
protected:
    static int wipe(const OSTClientConnection& client, OSTContainerClass containerClass,
                    std::optional<std::string_view> identifier) {
        const auto result = client.deleteDataContainerContentForUser(
            {.userId = userOf(containerClass), .containerClass = containerClass, .identifier = identifier});
        return static_cast<int>(result ? OSTErrorCode::success : result.error());
    }
    static std::expected<std::uint64_t, OSTErrorCode> usage(const OSTMetadata& record) {
        return store().diskUsageForUserId({.name = record.name(), .uuid = record.uuid});
    }
    static platform::UUID uuidOnDisk(const OSTMetadata& record) {
        return OSTMetadata::readAndValidateMetadataAtUrl(record.url, record.uid, OSTCheckClassPath::yes)->uuid;
    }
};

TEST_F(Maintenance, AWipedContainerKeepsUUIDAndPlaceAndNothingElse) {
    const auto before = make(dataApplication, "a");
    std::ifstream open(fs::path(before->url) / "a");
    ASSERT_EQ(1, wipe(store(), dataApplication, "a"));

    const auto after = cached(dataApplication, "a");
    EXPECT_EQ(before->url, after->url);
    EXPECT_EQ(before->uuid, after->uuid);
    EXPECT_EQ(before->uuid, uuidOnDisk(*after));
    EXPECT_FALSE(fs::exists(fs::path(after->url) / "a"));
    EXPECT_TRUE(fs::is_directory(fs::path(after->url) / "Library/Caches"));
    EXPECT_FALSE(cached(dataApplication, "a", true));
    EXPECT_TRUE(names(staging).empty());
    EXPECT_EQ(1, passCode());

    // What an application had open is still there for it.
    std::string content;
    open >> content;
    EXPECT_EQ("a", content);
}

TEST_F(Maintenance, WhatMayNotBeWipedIsRefusedAndKept) {
    const OSTClientConnection plugIns({.entitledWipeIdentifiers = {{"plug-in"}}});
    const OSTClientConnection nobody({});
    make(dataApplication, "a");
    make(dataLoomworkPlugin, "other");
    make(dataLoomworkPlugin, "plug-in");
    make(bundleApplication, "a");
    const auto before = places();
    EXPECT_EQ(18, wipe(store(), dataApplication, std::nullopt));
    EXPECT_EQ(11, wipe(store(), bundleApplication, "a"));
    EXPECT_EQ(11, wipe(store(), dataSystem, "a"));
    EXPECT_EQ(21, wipe(store(), dataApplication, "absent"));
    EXPECT_EQ(11, wipe(plugIns, dataApplication, "a"));
    EXPECT_EQ(55, wipe(plugIns, dataLoomworkPlugin, "other"));
    EXPECT_EQ(55, wipe(nobody, dataLoomworkPlugin, "plug-in"));
    EXPECT_EQ(before, places());
    EXPECT_EQ(1, wipe(plugIns, dataLoomworkPlugin, "plug-in"));
}

TEST_F(Maintenance, TheUsageOfABundleIsMeasuredOnceAndThatOfDataEachTime) {
    for (const auto containerClass : {bundleApplication, dataApplication}) {
        const auto record = make(containerClass, "a");
        const auto first = usage(*record);
        ASSERT_TRUE(first);
        EXPECT_LT(0U, *first);
        test::writeFile(fs::path(record->url) / "more", std::string(1'000'000, 'x'));
        EXPECT_EQ(isBundleClass(containerClass), *first == usage(*record)) << record->url;
    }
    OSTMetadata other = *cached(dataApplication, "a");
    EXPECT_EQ(21, static_cast<int>(
                      store().diskUsageForUserId({.name = other.name(), .uuid = platform::UUID::generate()}).error()));
    EXPECT_EQ(11, static_cast<int>(store().diskUsageForUserId({.name = other.name()}).error()));
}

TEST_F(Maintenance, ABundleThatIsReplacedWhileItIsMeasuredDoesNotInheritTheFigure) {
    for (int round = 0; round < 8; ++round) {
        const auto old = make(bundleApplication, "a");
        for (int file = 0; file < 2000; ++file)
            test::writeFile(fs::path(old->url) / std::to_string(file), "x");
        const auto fresh = make(bundleApplication, "a", true);
        std::jthread measuring([&] { EXPECT_TRUE(usage(*old)); });
        ASSERT_TRUE(store().replaceContainer({.oldContainer = {.name = old->name(), .uuid = old->uuid},
                                              .newContainer = {.name = fresh->name(), .uuid = fresh->uuid},
                                              .preserveOldUUID = true}));
        measuring.join();
        const auto now = cached(bundleApplication, "a");
        EXPECT_EQ(OSTFileManager::defaultManager().diskUsageForURL(now->url), usage(*now));
    }
}

TEST_F(Maintenance, TheRetryTestEndsTheProcessUntilItsCountIsSpentAlsoFromAForgottenZero) {
    const auto retry = [](std::uint64_t crashes) {
        const pid_t child = ::fork();
        if (child == 0) {
            const auto result = store().retryTestForUser(OSTDefaultUserId, crashes);
            ::_exit(result ? 42 : 43);
        }
        int status = 0;
        ::waitpid(child, &status, 0);
        return WEXITSTATUS(status);
    };
    EXPECT_EQ(0, retry(1));
    EXPECT_EQ(42, retry(5));
    EXPECT_EQ(42, retry(0));

    auto left = *make(dataApplication, "com.tamarok.retryTest");
    left.info =
        std::make_shared<const OSTDictionary>(std::vector<OSTDictionary::Entry>{{"CrashCounter", std::uint64_t{0}}});
    ASSERT_TRUE(OSTContainerCache::sharedInstance().addContainerMetadata(left));
    EXPECT_EQ(42, retry(7));
}

} // namespace
} // namespace ost
