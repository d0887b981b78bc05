#include "Client/Containers.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <set>
#include <string>

using namespace ost::test;
using ostrand::Connection;
using ostrand::ContainerClass;

namespace {

struct Kind {
    const char* name;
    ContainerClass containerClass;
    const char* classDirectory;
    std::set<std::uint64_t> codes; ///< what a creation fails with, never a bare errno
};

void PrintTo(const Kind& kind, std::ostream* out) { *out << kind.name; }

/// A daemon whose file-system calls fail or kill it while it makes a container.
class CreationFaultTest : public GatedDeviceTest, public testing::WithParamInterface<Kind> {
protected:
    static ostrand::Result<ostrand::Container> create(Connection& connection, const std::string& identifier) {
        return ostrand::createOrLookup(connection,
                                       {.containerClass = GetParam().containerClass,
                                        .user = ost::usualUserOf(GetParam().containerClass),
                                        .identifier = identifier},
                                       ostrand::WhenMissing::create);
    }

    /// The containers, once the daemon and the disk agree on them and each is whole.
    Containers wholeContainers(Connection& connection) {
        const auto directory = device().onHost(GetParam().classDirectory);
        for (const auto& name : namesIn(directory))
            EXPECT_TRUE(std::filesystem::is_directory(directory / name / "Library/Caches")) << name;
        auto onDisk = containersOnDisk(directory);
        EXPECT_EQ(listedContainers(connection, GetParam().containerClass, false), onDisk);
        return onDisk;
    }
};

} // namespace

TEST_P(CreationFaultTest, AKillAtAnyMomentLeavesAWholeContainerOrNone) {
    std::set<bool> outcomes;
    for (unsigned call = 1;; ++call) {
        const auto identifier = "com.example." + std::to_string(call);
        auto connection = device().connect();
        device().daemon().prepare({.kind = Fault::Kind::kill, .call = call});
        const auto answer = create(connection, identifier);
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("killed at call " + std::to_string(call) + ", " + course.faultedCall);
        if (course.faultedCall.empty()) {
            EXPECT_TRUE(answer);
            break;
        }
        device().startDaemon();
        ASSERT_TRUE(device().waitForFirstPass());
        EXPECT_EQ(leftovers(device().image()), std::vector<std::string>());
        auto again = device().connect();
        const auto containers = wholeContainers(again);
        const bool exists = containers.contains(identifier);
        EXPECT_TRUE(!answer || (exists && containers.at(identifier) == answer->uuid.string()));
        const auto found = create(again, identifier);
        ASSERT_TRUE(found);
        EXPECT_EQ(found->existed, exists);
        outcomes.insert(exists);
        if (HasFailure())
            break;
    }
    EXPECT_EQ((std::set{false, true}), outcomes);
}

TEST_P(CreationFaultTest, ACallThatFailsIsAnsweredWithItsCodeAndLeavesNothing) {
    for (unsigned call = 1;; call += toNextCall) {
        const auto identifier = "com.example." + std::to_string(call);
        auto connection = device().connect();
        wholeContainers(connection); // it knows the caller and the class now
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = ENOSPC});
        const auto answer = create(connection, identifier);
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("no space at call " + std::to_string(call) + ", " + course.faultedCall);
        EXPECT_TRUE(answer || answer.error() == ostrand::Error::refused() ||
                    GetParam().codes.contains(answer.error().code))
            << answer.error().description();
        auto again = device().connect();
        const auto containers = wholeContainers(again);
        EXPECT_TRUE(!answer || containers.contains(identifier));
        const auto retried = create(again, identifier);
        ASSERT_TRUE(retried) << retried.error().description();
        EXPECT_EQ(retried->existed, containers.contains(identifier));
        ASSERT_TRUE(ostrand::destroyDeathRow(again));
        EXPECT_EQ(leftovers(device().image()), std::vector<std::string>());
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
}

INSTANTIATE_TEST_SUITE_P(Classes, CreationFaultTest,
                         testing::Values(Kind{"Data",
                                              ContainerClass::dataApplication,
                                              "/private/var/mobile/Containers/Data/Application",
                                              {6, 7, 8, 9, 34, 43, 44, 45}},
                                         Kind{"SystemGroup",
                                              ContainerClass::sharedSystemGroup,
                                              "/private/var/containers/Shared/SystemGroup",
                                              {6, 7, 8, 9, 34, 43, 44, 45, 63}}),
                         [](const auto& test) { return test.param.name; });
