#include "Client/Containers.h"
#include "EndToEnd/GatedDevice.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <functional>
#include <string>
#include <vector>

using namespace ost::test;
using ostrand::Connection;
using ostrand::Container;
using ostrand::ContainerClass;

namespace {

/// A way to delete containers of one class.
struct Way {
    const char* name;
    std::function<ostrand::Result<void>(Connection&, const std::vector<Container>&)> remove;
};

void PrintTo(const Way& way, std::ostream* out) { *out << way.name; }

ostrand::ContainerRequest named(const std::string& identifier) {
    return {.containerClass = ContainerClass::dataApplication, .identifier = identifier};
}

ostrand::Result<void> stage(Connection& connection, const std::vector<Container>& containers) {
    std::vector<ostrand::ContainerReference> references;
    for (const auto& container : containers)
        references.push_back({.containerClass = ContainerClass::dataApplication,
                              .identifier = container.identifier,
                              .uuid = container.uuid});
    return ostrand::stageForDeletion(connection, references);
}

class DeletionFaultTest : public GatedDeviceTest, public testing::WithParamInterface<Way> {};

std::uint64_t codeOf(const ostrand::Result<void>& answer) { return answer ? 1 : answer.error().code; }

} // namespace

TEST_P(DeletionFaultTest, IsOnDiskBeforeItIsAnswered) {
    unsigned waits = 0;
    for (unsigned call = 1;; ++call) {
        auto connection = device().connect();
        std::vector<Container> containers;
        for (const char* which : {"first", "second"})
            containers.push_back(
                ostrand::createOrLookup(connection, named(which + std::to_string(call)), ostrand::WhenMissing::create)
                    .value());
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = EIO});
        const auto answer = GetParam().remove(connection, containers);
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("fails at call " + std::to_string(call) + ", " + course.faultedCall);
        if (course.faultedCall == "fsync") {
            EXPECT_EQ(28U, codeOf(answer));
            ++waits;
        }
        if (course.faultedCall.empty()) {
            EXPECT_EQ(1U, codeOf(answer));
            break;
        }
        if (HasFailure())
            break;
    }
    EXPECT_EQ(1U, waits);
}

INSTANTIATE_TEST_SUITE_P(Ways, DeletionFaultTest,
                         testing::Values(Way{"OfSeveral", stage},
                                         Way{"OfOne",
                                             [](Connection& connection, const std::vector<Container>& containers) {
                                                 return ostrand::deleteContainer(connection,
                                                                                 named(containers[0].identifier));
                                             }}),
                         [](const auto& test) { return test.param.name; });
