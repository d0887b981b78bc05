#include "Client/CodeSigning.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "support/DeviceTest.h"
#include "support/Sanitized.h"

#include <gtest/gtest.h>

#include <sys/resource.h>

#include <cerrno>
#include <functional>
#include <string>
#include <vector>

using namespace ost::test;
using ostrand::Connection;
using ostrand::ContainerClass;

namespace {

constexpr const char* classDirectory = "/private/var/mobile/Containers/Data/Application";
constexpr const char* kept = "com.example.kept";
constexpr std::uint64_t deletionFailed = 28;
constexpr std::uint64_t replaceFileInvalid = 35;
constexpr std::uint64_t cacheRebuildFailed = 43;

/// A daemon that lacks a descriptor for a moment, while it looks at what is on disk.
class LookingFaultTest : public GatedDeviceTest {
protected:
    void SetUp() override {
        GatedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        auto connection = device().connect();
        for (const auto* identifier : {kept, "com.example.other"})
            ASSERT_TRUE(look(connection, identifier, ostrand::WhenMissing::create));
        live = containersOnDisk(device().onHost(classDirectory));
    }

    static ostrand::ContainerRequest nameOf(const std::string& identifier) {
        return {.containerClass = ContainerClass::dataApplication, .user = 501, .identifier = identifier};
    }
    static ostrand::Result<ostrand::Container> look(Connection& connection, const std::string& identifier,
                                                    ostrand::WhenMissing whenMissing) {
        return ostrand::createOrLookup(connection, nameOf(identifier), whenMissing);
    }
    /// A failure that claims nothing of containers: they are not called missing, for one.
    static bool claimsNothing(const ostrand::Error& error) {
        return error == ostrand::Error::refused() || error == ostrand::Error::failed(cacheRebuildFailed) ||
               error == ostrand::Error::failed(replaceFileInvalid);
    }
    /// Asks whatever there is to ask for containers that exist.
    void askForAll(Connection connection) {
        if (const auto found = look(connection, kept, ostrand::WhenMissing::create))
            EXPECT_TRUE(found->existed);
        else
            EXPECT_TRUE(claimsNothing(found.error())) << found.error().description();
        const auto found = look(connection, kept, ostrand::WhenMissing::fail);
        EXPECT_TRUE(found || claimsNothing(found.error())) << found.error().description();
        for (const bool transient : {false, true}) {
            auto name = nameOf("");
            name.transient = transient;
            if (const auto list = ostrand::list(connection, name))
                EXPECT_EQ(list->size(), transient ? 0 : live.size());
            else
                EXPECT_TRUE(claimsNothing(list.error())) << list.error().description();
        }
    }
    void expectAllIsFound() {
        auto connection = device().connect();
        EXPECT_EQ(live, listedContainers(connection, ContainerClass::dataApplication, false));
        EXPECT_EQ(live, containersOnDisk(device().onHost(classDirectory)));
    }

    Containers live;
};

TEST_F(LookingFaultTest, NoCallThatFailsInAColdScanHidesAContainer) {
    for (unsigned call = 1;; call += toNextCall) {
        device().killDaemon();
        device().startDaemon();
        ASSERT_TRUE(device().waitForFirstPass());
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = EMFILE});
        askForAll(device().connect());
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("no descriptor at call " + std::to_string(call) + ", " + course.faultedCall);
        expectAllIsFound();
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
}

TEST_F(LookingFaultTest, WhatAnEarlierDaemonLeftIsWaitedForOnce) {
    unsigned waits = 0;
    for (unsigned call = 1;; ++call) {
        device().killDaemon();
        device().startDaemon();
        ASSERT_TRUE(device().waitForFirstPass());
        auto connection = device().connect();
        ASSERT_EQ(listedContainers(connection, ContainerClass::dataSystem, false), Containers()); // it knows the caller
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = EIO});
        const auto found = look(connection, kept, ostrand::WhenMissing::fail);
        const auto course = device().daemon().conclude();
        if (course.faultedCall == "syncfs") {
            EXPECT_FALSE(found) << "at call " << call;
            ++waits;
        }
        auto again = device().connect();
        EXPECT_TRUE(look(again, kept, ostrand::WhenMissing::fail));
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
    EXPECT_EQ(1U, waits);
}

TEST_F(LookingFaultTest, WithoutDescriptorsAKnownContainerIsNotSaidToBeGone) {
    if (isSanitized)
        GTEST_SKIP() << "The sanitizer's look at objects needs descriptors itself";
    auto connection = device().connect();
    ASSERT_TRUE(look(connection, kept, ostrand::WhenMissing::fail));
    rlimit usual{};
    ASSERT_EQ(0, ::prlimit(device().daemon().id(), RLIMIT_NOFILE, nullptr, &usual));
    const rlimit none{.rlim_cur = 0, .rlim_max = usual.rlim_max};
    ASSERT_EQ(0, ::prlimit(device().daemon().id(), RLIMIT_NOFILE, &none, nullptr));
    askForAll(std::move(connection));
    ASSERT_EQ(0, ::prlimit(device().daemon().id(), RLIMIT_NOFILE, &usual, nullptr));
    expectAllIsFound();
}

TEST_F(LookingFaultTest, ADeletionThatCannotLookFails) {
    for (unsigned call = 1;; ++call) {
        auto connection = device().connect();
        const auto identifier = "com.example.deleted" + std::to_string(call);
        const auto made = look(connection, identifier, ostrand::WhenMissing::create);
        ASSERT_TRUE(made);
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = EMFILE});
        const auto deleted = ostrand::deleteContainer(connection, nameOf(identifier));
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("no descriptor at call " + std::to_string(call) + ", " + course.faultedCall);
        const bool alive = containersOnDisk(device().onHost(classDirectory)).contains(identifier);
        if (!deleted && deleted.error() == ostrand::Error::failed(deletionFailed)) {
            EXPECT_FALSE(alive) << "only the wait for the disk has failed";
        } else {
            EXPECT_EQ(alive, !deleted);
            EXPECT_TRUE(deleted || claimsNothing(deleted.error())) << deleted.error().description();
        }
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
}

TEST_F(LookingFaultTest, AnItemThatCannotBeDestroyedAtTheMomentStaysOnDeathRow) {
    const auto item = device().onHost("/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead/item");
    for (unsigned call = 1;; ++call) {
        auto connection = device().connect();
        writeFile(item / "directory/file", "x");
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = EMFILE});
        (void)ostrand::destroyDeathRow(connection);
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("no descriptor at call " + std::to_string(call) + ", " + course.faultedCall);
        EXPECT_EQ(std::vector<std::string>(), namesIn(device().onHost("/tmp")));
        auto again = device().connect();
        EXPECT_TRUE(ostrand::destroyDeathRow(again));
        EXPECT_EQ(std::vector<std::string>(), leftovers(device().image()));
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
}

TEST_F(LookingFaultTest, AMappingFileThatCannotBeReadAtOnceIsReadLater) {
    auto connection = device().connect();
    ASSERT_TRUE(ostrand::registerCodeSigning(
        connection, {kept, ost::OSTDictionary({{"com.tamarok.Ostrand.Entitlements", ost::OSTDictionary()}}),
                     ostrand::RegistrationOptions{}.dictionary()}));
    for (unsigned call = 1;; call += toNextCall) {
        device().killDaemon();
        device().startDaemon({.kind = Fault::Kind::fail, .call = call, .error = EMFILE});
        const bool up = device().waitForFirstPass();
        {
            auto early = device().connect();
            if (up)
                (void)ostrand::codeSigningInfo(early, kept);
        }
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("no descriptor at call " + std::to_string(call) + ", " + course.faultedCall);
        if (!up)
            device().startDaemon();
        auto late = device().connect();
        EXPECT_TRUE(ostrand::codeSigningInfo(late, kept));
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
}

} // namespace
