#include "platform/device/TerminationAssertion.h"

#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <filesystem>

namespace ost::platform {
namespace {

constexpr const char* application = "com.example.a";

class TerminationAssertionTest : public test::DeviceTest {
protected:
    static pid_t startProcess() {
        const pid_t child = ::fork();
        if (child == 0)
            for (;;)
                ::pause();
        return child;
    }
    /// The signal that ended the process; 0 while it runs.
    static int signalThatEnded(pid_t process) {
        int status = 0;
        return ::waitpid(process, &status, WNOHANG) == process ? WTERMSIG(status) : 0;
    }
    static bool isHeld() { return terminationAssertion(application).value().has_value(); }
};

TEST_F(TerminationAssertionTest, EndsTheApplicationsProcessesAndNoOthers) {
    const pid_t own = startProcess(), other = startProcess();
    const auto registered = registerApplication(application, processInstance(own).value());
    ASSERT_TRUE(registered);
    auto earlier = processInstance(other).value(); // the number's last owner, of which the record was left behind
    earlier.startTime -= 1;
    const auto leftBehind = std::string(applicationsDirectory) + "/" + application + "/" + std::to_string(other);
    test::writeFile(leftBehind, std::to_string(earlier.startTime));

    int error = -1;
    const auto assertion = TerminationAssertion::create(application, TerminationAssertion::Reason::installation,
                                                        [&](int value) { error = value; });
    EXPECT_EQ(error, 0);
    EXPECT_EQ(signalThatEnded(own), SIGTERM);
    EXPECT_EQ(signalThatEnded(other), 0);
    EXPECT_EQ(terminationAssertion(application).value(), "installation");
    assertion->invalidate();
    EXPECT_FALSE(isHeld());
    ::kill(other, SIGKILL);
}

TEST_F(TerminationAssertionTest, IsRefusedWhenItCannotBeRecorded) {
    test::writeFile(assertionsDirectory, "");
    int error = 0;
    const auto assertion = TerminationAssertion::create(application, TerminationAssertion::Reason::critical,
                                                        [&](int value) { error = value; });
    EXPECT_EQ(error, ENOTDIR);
    assertion->invalidate();
}

TEST_F(TerminationAssertionTest, DoesNotOutliveItsHolder) {
    if (const pid_t holder = ::fork(); holder == 0) {
        const auto assertion =
            TerminationAssertion::create(application, TerminationAssertion::Reason::installation, [](int /*error*/) {});
        ::_exit(isHeld() ? 0 : 1);
    } else {
        int status = 0;
        ASSERT_EQ(::waitpid(holder, &status, 0), holder);
        EXPECT_EQ(status, 0);
    }
    EXPECT_FALSE(isHeld());
    const auto again =
        TerminationAssertion::create(application, TerminationAssertion::Reason::installation, [](int /*error*/) {});
    EXPECT_TRUE(isHeld());
    const auto directory = std::filesystem::directory_iterator(std::string(assertionsDirectory) + "/" + application);
    EXPECT_EQ(std::distance(begin(directory), end(directory)), 1) << "what the other one left has been removed";
}

} // namespace
} // namespace ost::platform
