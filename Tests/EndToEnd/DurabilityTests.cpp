#include "EndToEnd/GatedProcess.h"
#include "files/OSTFileManager.h"
#include "platform/device/SandboxUserState.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <functional>

using namespace ost::test;

namespace {

/// Operations that answer for what is on disk, each in a process whose calls fail one after the other.
class DurabilityTest : public StoreTest {
protected:
    /// How many waits for the disk there are without which the operation does not succeed.
    static unsigned waitsOf(const std::function<bool()>& operation) {
        unsigned waits = 0;
        for (unsigned call = 1;; ++call) {
            for (const auto* const place : {"/made", "/other/item"})
                std::filesystem::remove_all(place);
            std::filesystem::remove_all(ost::platform::sandboxStateDirectory);
            GatedProcess process([&] { return operation() ? 0 : 1; },
                                 {.kind = Fault::Kind::fail, .call = call, .error = EIO});
            const bool succeeded = process.wait() == 0;
            const auto course = process.conclude();
            if (course.faultedCall == "fsync" || course.faultedCall == "syncfs") {
                EXPECT_FALSE(succeeded) << "at call " << call;
                ++waits;
            }
            if (course.faultedCall.empty()) {
                EXPECT_TRUE(succeeded);
                return waits;
            }
        }
    }
};

TEST_F(DurabilityTest, ANewDirectoryOfTheLayoutIsOnDiskInItsParentOrIsNotMade) {
    const auto make = [] {
        const bool made =
            ost::OSTFileManager::defaultManager()
                .createDirectoryAtURL("/made/in/layout", {.withIntermediateDirectories = true, .durable = true})
                .has_value();
        return made && std::filesystem::exists("/made/in/layout");
    };
    EXPECT_EQ(3U, waitsOf(make));
}

TEST_F(DurabilityTest, AnItemOfTheSandboxIsOnDiskWhenItIsSet) {
    const auto set = [] { return ost::platform::setSandboxUserStateItem(501, 1, "item", "/path").has_value(); };
    EXPECT_EQ(4U, waitsOf(set));
}

TEST_F(DurabilityTest, AMoveToAnotherFileSystemIsOnDiskThereBeforeItsSourceGoes) {
    std::filesystem::create_directory("/other");
    mountOver("/other");
    const auto move = [] {
        const auto& files = ost::OSTFileManager::defaultManager();
        return files.createDirectoryAtURL("/made/item", {.withIntermediateDirectories = true}) &&
               files.moveItemAtURL("/made/item", "/other/item") && files.itemExistsAtURL("/other/item");
    };
    EXPECT_EQ(2U, waitsOf(move));
}

} // namespace
