#include "codesigning/OSTCodeSigningStoreDelegate.h"
#include "platform/base/UUID.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;

class Reboot : public test::StoreTest {
protected:
    Reboot() {
        static OSTCodeSigningStoreDelegate delegate;
        OSTStoreDelegate::join(delegate);
    }
    static std::string uuidName() { return platform::UUID::generate().string(); }

    static constexpr const char* applications = "/private/var/mobile/Containers/Data/Application";
    static constexpr const char* systemContainers = "/private/var/containers/Data/System";
};

TEST_F(Reboot, TransientContainersOfEverybodyGoAndOthersStay) {
    const auto data = make(dataApplication, "kept");
    const OSTMetadataRecord transients[] = {make(dataApplication, "a", true), make(bundleApplication, "b", true),
                                            make(dataSystem, "c", true)};
    store().rebootContainerManagerCleanup();
    EXPECT_TRUE(fs::exists(data->url));
    for (const auto& transient : transients)
        EXPECT_FALSE(fs::exists(transient->url)) << transient->url;
    EXPECT_EQ(3U, names(deathRow).size());
}

TEST_F(Reboot, WhatAnEarlierProcessLeftUnfinishedGoesWhereverItIs) {
    const auto made = make(dataApplication, "a.file.system");
    mountOver(made->url);
    const fs::path places[] = {applications,
                               made->url,
                               "/private/var/containers/Bundle",
                               "/private/var/mobile",
                               "/private/var/root/Library/Logs/Ostrand",
                               "/tmp"};
    for (const auto& place : places) {
        test::writeFile(place / ".temp.a1b2c3.d4e5f6", "unfinished");
        test::writeFile(place / ".temp.user", "");
        ASSERT_EQ(0, ::lchown((place / ".temp.user").c_str(), 501, 501));
    }
    store().containerManagerCleanup();
    EXPECT_EQ(1, passCode());
    for (const auto& place : places) {
        EXPECT_FALSE(fs::exists(place / ".temp.a1b2c3.d4e5f6")) << place;
        EXPECT_TRUE(fs::exists(place / ".temp.user")) << place;
    }
}

TEST_F(Reboot, OrphansOfEveryKindGoToDeathRow) {
    const auto invalid = fs::path(applications) / uuidName();
    test::writeFile(invalid / ".com.tamarok.ostrand.metadata.plist", "invalid");
    const auto wellknown = fs::path(systemContainers) / "com.tamarok.pellord";
    test::writeFile(wellknown / ".com.tamarok.ostrand.metadata.plist", "");

    test::writeFile("/outside/.com.tamarok.ostrand.metadata.plist", "");
    const fs::path orphans[] = {
        fs::path(applications) / uuidName() / "without-metadata", fs::path(applications) / "no-uuid" / "content",
        fs::path(systemContainers) / "systemgroup.com.tamarok.marrowfell" / "of-the-other-class",
        "/private/var/containers/Shared/SystemGroup/com.tamarok.pellord/content"};
    for (const auto& orphan : orphans)
        test::writeFile(orphan, "");
    const fs::path links[] = {fs::path(applications) / uuidName(), fs::path(applications) / "link"};
    for (const auto& link : links)
        fs::create_symlink("/outside", link);
    const auto file = fs::path(systemContainers) / uuidName();
    test::writeFile(file, "");

    store().rebootContainerManagerCleanup();
    EXPECT_TRUE(fs::exists(invalid));
    EXPECT_TRUE(fs::exists(wellknown));
    for (const auto& orphan : orphans)
        EXPECT_FALSE(fs::exists(orphan.parent_path())) << orphan;
    for (const auto& link : links)
        EXPECT_FALSE(fs::is_symlink(link)) << link;
    EXPECT_FALSE(fs::exists(file));

    EXPECT_EQ(1, passCode());
    EXPECT_TRUE(fs::exists("/outside/.com.tamarok.ostrand.metadata.plist"));
}

TEST_F(Reboot, LinksInThePlaceOfDirectoriesAreNotFollowed) {
    fs::create_directories("/outside/" + uuidName());
    fs::create_directories(fs::path(applications).parent_path());
    fs::create_symlink("/outside", applications);
    fs::create_directories("/private/var/mobile/Library/Caches/com.tamarok.ostrandd");
    fs::create_symlink("/outside", "/private/var/mobile/Library/Caches/com.tamarok.ostrandd/Temp");
    const auto before = test::tree("/outside");
    store().rebootContainerManagerCleanup();
    EXPECT_EQ(1, passCode());
    EXPECT_EQ(before, test::tree("/outside"));
}

} // namespace
} // namespace ost
