#include "Client/Attributes.h"
#include "Client/Maintenance.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "platform/codec/PropertyList.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <array>
#include <cerrno>
#include <filesystem>
#include <set>
#include <string>

using namespace ost::test;
using ost::OSTArray;
using ost::OSTDictionary;
using ost::OSTValue;
using ostrand::Connection;
using ostrand::ContainerClass;

namespace {

namespace fs = std::filesystem;

ostrand::Result<ostrand::Container> make(Connection& connection, ContainerClass containerClass,
                                         const std::string& identifier) {
    return ostrand::createOrLookup(
        connection,
        {.containerClass = containerClass, .user = ost::usualUserOf(containerClass), .identifier = identifier},
        ostrand::WhenMissing::create);
}

/// A daemon whose file-system calls fail or kill it while it wipes a container.
class WipeFaultTest : public GatedDeviceTest {
protected:
    /// Has the fault befall one call after the other of a wipe, until it comes to none.
    void wipeAtEveryCall(Fault::Kind kind) {
        std::set<bool> wiped;
        for (unsigned call = 1; !HasFailure(); call += toNextCall) {
            auto connection = device().connect();
            const auto container = make(connection, ContainerClass::dataApplication, "a");
            ASSERT_TRUE(container);
            const auto data = device().onHost(container->path) / "Documents/data";
            writeFile(data, "a person's");
            device().daemon().prepare({.kind = kind, .call = call, .error = EIO});
            const auto answer = ostrand::wipe(connection, {ContainerClass::dataApplication, 501, "a"});
            const auto course = device().daemon().conclude();
            SCOPED_TRACE("fault at call " + std::to_string(call) + ", " + course.faultedCall);
            if (kind == Fault::Kind::kill && !course.faultedCall.empty()) {
                device().startDaemon();
                ASSERT_TRUE(device().waitForFirstPass());
            }
            auto again = device().connect();
            const auto found = make(again, ContainerClass::dataApplication, "a");
            ASSERT_TRUE(found) << found.error().description();
            EXPECT_TRUE(found->existed);
            EXPECT_EQ(found->uuid, container->uuid);
            EXPECT_EQ(found->path, container->path);
            EXPECT_TRUE(fs::is_directory(device().onHost(found->path) / "Library/Caches"));
            EXPECT_EQ(containersOnDisk(device().onHost(found->path).parent_path()).size(), 1U);
            EXPECT_TRUE(!answer || !fs::exists(data));
            wiped.insert(!fs::exists(data));
            if (course.faultedCall.empty()) {
                EXPECT_TRUE(answer) << answer.error().description();
                break;
            }
        }
        EXPECT_EQ((std::set{false, true}), wiped);
        device().killDaemon();
        device().startDaemon();
        ASSERT_TRUE(device().waitForFirstPass());
        EXPECT_EQ(leftovers(device().image()), std::vector<std::string>());
    }
};

/// A device that an older release left: bundles and logs in their old places, entitlements in bundles, in data
/// containers and in the old file, a group that nobody references, items that are no containers. Each round begins with
/// the same disk, right after a boot.
class UpgradeFaultTest : public GatedDeviceTest {
protected:
    void SetUp() override {
        GatedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        ASSERT_NO_FATAL_FAILURE(_makeContainers());
        device().killDaemon();
        fs::create_directories(_onHost("mobile/Containers"));
        fs::rename(_onHost("containers/Bundle"), _onHost("mobile/Containers/Bundle"));
        writeFile(_onHost("mobile/Library/Ostrand/old"), "");
        writeFile(_onHost("mobile/Library/Logs/Ostrand/old.log"), "");
        writeFile(_onHost("mobile/Containers/Data/Application/orphan/file"), "");
        OSTDictionary legacy;
        for (const auto* const identifier : {"cached", "legacy"})
            legacy.set(identifier, OSTDictionary({{"from", OSTValue(std::string("legacy"))}}));
        writeFile(_onHost("root/Library/Ostrand/ost_entitlements.plist"),
                  ost::platform::serializeBinaryPropertyList(legacy));
        fs::create_directory(_snapshot);
        for (const auto* const directory : kept)
            _copyTree(_onHost(directory), _snapshot / directory);
    }

    /// The disk of a device that has just booted with this release for the first time. The daemon is down.
    void restore() {
        if (device().daemonIsUp())
            device().killDaemon();
        for (const auto* const directory : kept) {
            fs::remove_all(_onHost(directory));
            _copyTree(_snapshot / directory, _onHost(directory));
        }
        fs::remove(_firstBootMarker());
    }

    void start() {
        device().startDaemon();
        ASSERT_TRUE(device().waitForFirstPass());
    }

    /// Migrates undisturbed and says what the disk holds then: all names, modes and owners, and the mapping.
    std::string migrated() {
        auto connection = device().connect();
        const auto answer = ostrand::migrate(connection);
        EXPECT_TRUE(answer) << answer.error().description();
        EXPECT_TRUE(ostrand::destroyDeathRow(connection));
        const auto mapping =
            ost::platform::parsePropertyList(readFile(_onHost("root/Library/Ostrand/ost_code_signing_info.plist")));
        auto state = mapping ? mapping->description() : "no mapping";
        for (const auto* const directory : kept)
            state += std::string("\n") + directory + ":\n" + tree(_onHost(directory));
        return state;
    }

    /// Has a fault befall one call after the other of what `disturbed` does. The next start and migration must lead to
    /// the same disk as if nothing had happened; where a call failed, that is the start after the next boot.
    void atEveryCall(Fault::Kind kind, const auto& disturbed) {
        restore();
        ASSERT_NO_FATAL_FAILURE(start());
        const auto expected = migrated();
        for (const auto* const entitled : {"cached", "legacy", "grouped"})
            EXPECT_NE(expected.find(entitled), std::string::npos) << expected;
        const unsigned step = kind == Fault::Kind::fail ? 5 : toNextCall;
        for (unsigned call = 1; !HasFailure(); call += step) {
            restore();
            const auto course = disturbed(Fault{.kind = kind, .call = call, .error = EIO});
            SCOPED_TRACE("fault at call " + std::to_string(call) + ", " + course.faultedCall);
            device().killDaemon();
            if (kind == Fault::Kind::fail)
                fs::remove(_firstBootMarker());
            ASSERT_NO_FATAL_FAILURE(start());
            EXPECT_EQ(migrated(), expected);
            if (course.faultedCall.empty())
                break;
        }
    }

    void disturbStart(Fault::Kind kind) {
        atEveryCall(kind, [&](const Fault& fault) {
            device().startDaemon(fault);
            static_cast<void>(device().waitForFirstPass()); // It may have ended early.
            return device().daemon().conclude();
        });
    }
    void disturbMigration(Fault::Kind kind) {
        atEveryCall(kind, [&](const Fault& fault) {
            device().startDaemon();
            EXPECT_TRUE(device().waitForFirstPass());
            auto connection = device().connect();
            static_cast<void>(listedContainers(connection, ContainerClass::dataApplication, false));
            device().daemon().prepare(fault);
            static_cast<void>(ostrand::migrate(connection));
            return device().daemon().conclude();
        });
    }

private:
    static constexpr std::array kept{"containers", "mobile", "root"};

    fs::path _firstBootMarker() { return device().onHost("/dev/shm/sem.ostrandd.fb_check"); }
    fs::path _onHost(const std::string& belowVar) { return device().onHost("/private/var/" + belowVar); }

    static void _copyTree(const fs::path& from, const fs::path& to) {
        ASSERT_EQ(ChildProcess({"cp", "--archive", "--no-target-directory", from, to}, "/dev/null").wait(), 0);
    }

    void _makeContainers() {
        auto connection = device().connect();
        const auto carry = [&](ContainerClass containerClass, const std::string& identifier, const char* key,
                               OSTValue value) {
            const auto made = make(connection, containerClass, identifier);
            ASSERT_TRUE(made);
            const ostrand::ContainerReference reference{containerClass, ost::usualUserOf(containerClass), identifier,
                                                        made->uuid};
            ASSERT_TRUE(ostrand::setInfoValue(connection, reference, key, value));
        };
        const OSTDictionary entitlements({{"from", OSTValue(std::string("bundle"))}});
        carry(ContainerClass::bundleApplication, "cached", "com.tamarok.Tessaly.CachedCodeSigningInfo",
              OSTDictionary({{"Entitlements", entitlements}}));
        for (const auto* const identifier : {"cached", "legacy", "grouped"})
            carry(ContainerClass::dataApplication, identifier, "com.tamarok.Tessaly.GroupContainerIDs",
                  OSTArray{OSTValue(std::string("group.kept"))});
        for (const auto* const group : {"group.kept", "group.of-nobody"})
            ASSERT_TRUE(make(connection, ContainerClass::sharedAppGroup, group));
        ASSERT_TRUE(make(connection, ContainerClass::dataSystem, "com.example.system"));
    }

    const fs::path _snapshot = makeScratchDirectory() / "var";
};

} // namespace

TEST_F(WipeFaultTest, AKillAtAnyMomentLeavesTheContainerWithItsOldContentOrTheNew) {
    wipeAtEveryCall(Fault::Kind::kill);
}

TEST_F(WipeFaultTest, AWipeThatFailsLeavesTheContainer) { wipeAtEveryCall(Fault::Kind::fail); }

TEST_F(UpgradeFaultTest, AStartThatIsKilledAtAnyCallIsMadeGoodByTheNext) { disturbStart(Fault::Kind::kill); }

TEST_F(UpgradeFaultTest, AStartThatFailsAtAnyCallIsMadeGoodByTheNext) { disturbStart(Fault::Kind::fail); }

TEST_F(UpgradeFaultTest, AMigrationThatIsKilledAtAnyCallIsMadeGoodByTheNext) { disturbMigration(Fault::Kind::kill); }

TEST_F(UpgradeFaultTest, AMigrationThatFailsAtAnyCallIsMadeGoodByTheNext) { disturbMigration(Fault::Kind::fail); }
