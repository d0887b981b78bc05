#include "Protocol/OSTServices.h"
#include "service/OSTDaemon.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

namespace ost {
namespace {

namespace fs = std::filesystem;

constexpr const char* logFile = "/private/var/root/Library/Logs/Ostrand/ostrandd.log";

/// A device on which something stands in the way of a start.
class Start : public test::StoreTest {
protected:
    Start() { fs::create_directories(OSTServiceSocketDirectory); }

    static bool logHas(const char* line) { return test::readFile(logFile).contains(line); }

    OSTDaemon daemon;
};

} // namespace

TEST_F(Start, EndsWhenTheSandboxCouldNotAsk) {
    test::writeFile(fs::path(OSTServiceSocketDirectory) / OSTKernServiceName, "");
    EXPECT_FALSE(daemon.start());
    EXPECT_TRUE(logHas("Failed to check in service com.tamarok.ostrandd.upcall: File exists"));
    EXPECT_TRUE(logHas("Failed to initialize kernel upcall interface. THIS IS BAD! Exiting."));
    EXPECT_FALSE(logHas("first boot cleanup complete"));
    EXPECT_TRUE(fs::is_empty("/dev/shm")) << "the next start is the first one still";
}

TEST_F(Start, GoesOnWithoutClients) {
    test::writeFile(fs::path(OSTServiceSocketDirectory) / OSTServiceName, "");
    EXPECT_TRUE(daemon.start());
    EXPECT_TRUE(logHas("unable to start vexel service!"));
}

TEST_F(Start, GoesOnWithoutTheMarkerOfItsFirstBoot) {
    mountOver("/dev/shm", true);
    EXPECT_TRUE(daemon.start());
    EXPECT_TRUE(logHas("Failed to create semaphore ostrandd.fb_check: Read-only file system"));
    EXPECT_TRUE(logHas("first boot cleanup complete"));
}

TEST_F(Start, GoesOnWithoutALog) {
    fs::create_directories(fs::path(logFile) / "directory");
    EXPECT_TRUE(daemon.start());
    EXPECT_FALSE(fs::is_empty("/dev/shm"));
}

} // namespace ost
