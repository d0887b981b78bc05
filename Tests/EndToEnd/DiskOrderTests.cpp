#include "EndToEnd/DiskOrder.h"

#include "Client/Attributes.h"
#include "Client/CodeSigning.h"
#include "Client/Containers.h"
#include "Client/Maintenance.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "platform/codec/PropertyList.h"
#include "store/OSTReplaceFile.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

using namespace ost::test;
using ost::OSTArray;
using ost::OSTDictionary;
using ost::OSTValue;
using ostrand::Container;
using enum ost::OSTContainerClass;

namespace {

namespace fs = std::filesystem;

const std::vector<std::string> none;

/// A daemon that is watched on a disk that keeps no order.
class DiskOrderTest : public GatedDeviceTest {
protected:
    void SetUp() override {
        GatedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        order = std::make_unique<DiskOrder>(device().image());
        startAgain();
    }
    void TearDown() override {
        if (device().daemonIsUp())
            device().killDaemon(); // before what watches it
    }

    /// Another daemon in the place of the one that is there, if any.
    void startAgain(bool isSuccessor = false) {
        if (device().daemonIsUp())
            device().killDaemon();
        order->forget(isSuccessor);
        device().startDaemon({}, std::ref(*order));
        ASSERT_TRUE(device().waitForFirstPass());
    }

    void expectOrder(const std::string& after) {
        EXPECT_EQ(order->notOnDisk(), none) << "after " << after;
        EXPECT_EQ(order->takenTooEarly(), none) << "during " << after;
    }
    /// What was answered is on disk, and so was all on which a step relied.
    void expectOrder(const std::string& after, const auto& answer) {
        EXPECT_TRUE(answer) << after << ": " << (answer ? "" : answer.error().description());
        expectOrder(after);
        order->forget();
    }

    Container make(ost::OSTContainerClass containerClass, const std::string& identifier, bool transient = false) {
        auto connection = device().connect();
        const auto made = ostrand::createOrLookup(
            connection, {containerClass, ost::usualUserOf(containerClass), identifier, transient},
            ostrand::WhenMissing::create);
        expectOrder("creation of " + identifier, made);
        return made.value();
    }
    static ostrand::ContainerReference referenceTo(ost::OSTContainerClass containerClass, const Container& container) {
        return {containerClass, ost::usualUserOf(containerClass), container.identifier, container.uuid};
    }
    ostrand::Result<void> registerWithGroups(const OSTArray& groups) {
        auto connection = device().connect();
        return ostrand::registerCodeSigning(
            connection,
            {.identifier = "b",
             .info = OSTDictionary({{"com.tamarok.Ostrand.Entitlements",
                                     OSTDictionary({{"com.tamarok.security.application-groups", groups}})}})});
    }
    void writeLegacyEntitlements() {
        writeFile(onHost("root/Library/Ostrand/ost_entitlements.plist"),
                  ost::platform::serializeBinaryPropertyList(
                      OSTDictionary({{"legacy", OSTDictionary({{"from", OSTValue(std::string("legacy"))}})}})));
    }
    fs::path onHost(const std::string& belowVar) { return device().onHost("/private/var/" + belowVar); }

    std::unique_ptr<DiskOrder> order;
};

} // namespace

TEST_F(DiskOrderTest, ContainersAreMadeChangedAndDeletedOnDiskBeforeItIsAnswered) {
    for (const auto containerClass : {dataApplication, sharedAppGroup, bundleApplication, dataSystem}) {
        const auto made = make(containerClass, "a");
        const auto reference = referenceTo(containerClass, made);
        auto connection = device().connect();
        expectOrder("an info value", ostrand::setInfoValue(connection, reference, "k", OSTValue(std::string("v"))));
        expectOrder("a new name", ostrand::regenerateDirectoryUUID(connection, reference));
        fs::remove_all(device().onHost(ostrand::metadata(connection, reference)->path) / "Library");
        expectOrder("restoring the structure", ostrand::recreateDefaultStructure(connection, reference));
        if (containerClass == dataApplication)
            expectOrder("a protection class", ostrand::setDataProtection(connection, {containerClass, 501, "a", 1}));
        if (containerClass == dataApplication || containerClass == sharedAppGroup)
            expectOrder("a wipe", ostrand::wipe(connection, {containerClass, 501, "a"}));
        expectOrder("a deletion", ostrand::stageForDeletion(connection, {reference}));
    }
    make(dataApplication, "t", true);
    auto connection = device().connect();
    EXPECT_FALSE(ostrand::createOrLookup(connection, {dataApplication, 501, "t", true}, ostrand::WhenMissing::fail));
    expectOrder("a transient container that was thrown away");
}

TEST_F(DiskOrderTest, OneContainerTakesTheOthersPlaceStepByStep) {
    for (const auto containerClass : {dataApplication, bundleApplication})
        for (const bool oldIsTransient : {false, true}) {
            const auto old = make(containerClass, "b", oldIsTransient);
            const auto fresh = make(containerClass, "b", !oldIsTransient);
            expectOrder("a registration", registerWithGroups({OSTValue(std::string("group.a"))}));
            auto connection = device().connect();
            expectOrder("a replacement", ostrand::replace(connection, referenceTo(containerClass, old),
                                                          referenceTo(containerClass, fresh)));
            expectOrder("a deletion", ostrand::stageForDeletion(connection, {referenceTo(containerClass, fresh)}));
        }
    const auto fresh = make(dataApplication, "c", true);
    auto connection = device().connect();
    expectOrder("a placement", ostrand::replace(connection, {}, referenceTo(dataApplication, fresh)));
}

TEST_F(DiskOrderTest, WhatAFailedReplacementMovedBackIsOnDiskBeforeItsFileGoes) {
    for (unsigned call = 1; !HasFailure(); call += toNextCall) {
        const auto old = make(dataApplication, "b");
        const auto fresh = make(dataApplication, "b", true);
        auto connection = device().connect();
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = EIO});
        static_cast<void>(
            ostrand::replace(connection, referenceTo(dataApplication, old), referenceTo(dataApplication, fresh)));
        const auto course = device().daemon().conclude();
        EXPECT_EQ(order->takenTooEarly(), none) << course.faultedCall << " fails at call " << call;
        order->forget();
        if (course.faultedCall.empty())
            return;
    }
}

TEST_F(DiskOrderTest, RegistrationAndWhatItDeletesAreOnDisk) {
    expectOrder("a registration", registerWithGroups({OSTValue(std::string("group.a"))}));
    make(sharedAppGroup, "group.a");
    expectOrder("a registration without the group", registerWithGroups({}));
    EXPECT_EQ(namesIn(onHost("mobile/Containers/Shared/AppGroup")), none);
}

TEST_F(DiskOrderTest, ADaemonWaitsForWhatAKilledOneMovedBeforeItAnswersForIt) {
    const auto made = make(dataApplication, "a");
    expectOrder("a registration", registerWithGroups({}));
    const auto expectWait = [&](const std::string& what, const std::string& belowVar, const auto& act) {
        startAgain(true);
        EXPECT_TRUE(act()) << what;
        EXPECT_TRUE(order->waitedFor().contains("/private/var/" + belowVar)) << what;
    };
    // An info value may be in place that nobody waited for.
    expectWait("a look-up", std::string("mobile/Containers/Data/Application") + DiskOrder::ofFileSystem, [&] {
        auto connection = device().connect();
        return ostrand::createOrLookup(connection, {dataApplication, 501, "a", false}, ostrand::WhenMissing::fail);
    });
    expectWait("the same registration", "root/Library/Ostrand", [&] { return registerWithGroups({}); });
    expectWait("a deletion", "root/Library/Ostrand/Replace", [&] {
        auto connection = device().connect();
        return ostrand::stageForDeletion(connection, {referenceTo(dataApplication, made)});
    });
}

TEST_F(DiskOrderTest, ARecoveryWaitsForWhatIsInPlaceBeforeTheFileGoes) {
    const auto made = make(dataApplication, "a");
    const std::string token = "0F0F0F0F-1111-4222-8333-444444444444";
    const std::string staging = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Staging/" + token;
    for (const bool newIsInPlace : {true, false}) {
        device().killDaemon();
        const auto elsewhere = fs::path(made.path).parent_path() / token;
        ASSERT_TRUE((ost::OSTReplaceFile{.oldURL = newIsInPlace ? elsewhere.string() : made.path,
                                         .newURL = elsewhere,
                                         .stagingURL = staging,
                                         .destinationURL = newIsInPlace ? made.path : elsewhere.string()}
                         ._writeToDiskReplaceAt(onHost("root/Library/Ostrand/Replace/" + token + ".plist"))));
        if (!newIsInPlace)
            fs::rename(device().onHost(made.path), device().onHost(staging));
        startAgain(true);
        EXPECT_TRUE(fs::exists(device().onHost(made.path)));
        EXPECT_EQ(order->takenTooEarly(), none) << newIsInPlace;
    }
}

TEST_F(DiskOrderTest, AMigrationIsOnDiskBeforeItIsMarkedAsDone) {
    const auto bundle = make(bundleApplication, "cached");
    const auto data = make(dataApplication, "grouped");
    const auto system = make(dataSystem, "system");
    auto connection = device().connect();
    expectOrder("an info value",
                ostrand::setInfoValue(
                    connection, referenceTo(bundleApplication, bundle), "com.tamarok.Tessaly.CachedCodeSigningInfo",
                    OSTDictionary({{"Entitlements", OSTDictionary({{"from", OSTValue(std::string("bundle"))}})}})));
    expectOrder("an info value", ostrand::setInfoValue(connection, referenceTo(dataApplication, data),
                                                       "com.tamarok.Tessaly.GroupContainerIDs",
                                                       OSTArray{OSTValue(std::string("group.kept"))}));
    device().killDaemon();
    writeLegacyEntitlements();
    writeFile(device().onHost(bundle.path) / "a/file", "");
    writeFile(device().onHost(system.path) / "tmp/file", "");
    // One class as a whole, and one container into a class that is there.
    const auto old = onHost("mobile/Containers/Bundle");
    fs::create_directories(old / "Application");
    fs::rename(device().onHost(bundle.path), old / "Application" / fs::path(bundle.path).filename());
    fs::create_directories(old / "Framework");
    fs::remove(onHost("containers/Bundle/Framework"));
    fs::remove(device().onHost("/dev/shm/sem.ostrandd.fb_check"));
    startAgain();
    EXPECT_EQ(order->takenTooEarly(), none);
    EXPECT_TRUE(fs::exists(device().onHost(bundle.path)));

    auto again = device().connect();
    expectOrder("a migration", ostrand::migrate(again));
    writeLegacyEntitlements();
    expectOrder("a migration of the old entitlements alone", ostrand::migrate(again));
}

TEST_F(DiskOrderTest, TheTwinOfABundleGoesWhenTheOtherIsOnDisk) {
    const auto bundle = make(bundleApplication, "twin");
    device().killDaemon();
    const auto old = onHost("mobile/Containers/Bundle/Application");
    fs::create_directories(old);
    fs::copy(device().onHost(bundle.path), old / fs::path(bundle.path).filename());
    fs::remove(device().onHost("/dev/shm/sem.ostrandd.fb_check"));
    startAgain(true);
    EXPECT_EQ(order->takenTooEarly(), none);
    EXPECT_FALSE(fs::exists(old));
    EXPECT_TRUE(fs::exists(device().onHost(bundle.path)));
}
