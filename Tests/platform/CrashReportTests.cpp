#include "platform/device/CrashReport.h"

#include "platform/base/StackTrace.h"
#include "support/DeviceTest.h"

#include <exception>
#include <stdexcept>
#include <thread>

namespace ost::platform {
namespace {

class CrashReportTest : public test::DeviceTest {};

TEST_F(CrashReportTest, IsTheLastThingAProcessWrites) {
    const std::string message = "** INTERNAL ERROR **\n" + std::string(10000, 'x');
    EXPECT_DEATH(crashWithMessage(message), "\\*\\* INTERNAL ERROR \\*\\*\nx{10000}\n");
    const auto reports = test::tree(crashReportDirectory);
    ASSERT_TRUE(reports.starts_with("-rw------- 0:0 ostrandd-20")) << reports;
    ASSERT_TRUE(reports.ends_with(".crash\n")) << reports;
    const auto name = reports.substr(reports.find("ostrandd-"));
    EXPECT_EQ(test::readFile(std::string(crashReportDirectory) + "/" + name.substr(0, name.size() - 1)),
              message + "\n");
}

TEST_F(CrashReportTest, EndsTheProcessWhateverStandsInTheWay) {
    std::filesystem::remove_all("/private/var/root");
    test::writeFile("/private/var/root", "no directory");
    EXPECT_EXIT(crashWithMessage("last words"), testing::KilledBySignal(SIGABRT), "last words");
}

[[gnu::noinline]] void throwsHere(std::size_t index) {
    if (index < 1)
        throw std::out_of_range("index");
}

TEST(StackTrace, NamesTheFunctionThatThrew) {
    try {
        throwsHere(0);
    } catch (const std::exception&) {
        const auto frames = exceptionCallStackSymbols();
        ASSERT_GT(frames.size(), 2U);
        EXPECT_NE(frames[0].find(" ost::platform::(anonymous namespace)::throwsHere(unsigned long)"), std::string::npos)
            << frames[0];
        for (const auto& frame : frames)
            EXPECT_TRUE(frame.starts_with("0x")) << frame;
    }
}

TEST(StackTrace, IsNotThatOfAnotherThrow) {
    std::exception_ptr elsewhere;
    std::thread([&] { elsewhere = std::make_exception_ptr(std::out_of_range("elsewhere")); }).join();
    try {
        throwsHere(0);
    } catch (const std::exception&) {
    }
    try {
        std::rethrow_exception(elsewhere);
    } catch (const std::exception&) {
        for (const auto& frame : exceptionCallStackSymbols())
            EXPECT_EQ(frame.find("throwsHere"), std::string::npos) << frame;
    }
}

} // namespace
} // namespace ost::platform
