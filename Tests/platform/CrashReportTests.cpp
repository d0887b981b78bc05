#include "platform/device/CrashReport.h"

#include "platform/base/StackTrace.h"
#include "support/DeviceTest.h"

#include <stdexcept>

namespace ost::platform {
namespace {

class CrashReportTest : public test::DeviceTest {};

TEST_F(CrashReportTest, isTheLastThingAProcessWrites) {
    const std::string message = "** INTERNAL ERROR **\n" + std::string(10000, 'x');
    EXPECT_DEATH(crashWithMessage(message), "\\*\\* INTERNAL ERROR \\*\\*\nx{10000}\n");
    const auto reports = test::tree(crashReportDirectory);
    ASSERT_TRUE(reports.starts_with("-rw------- 0:0 ostrandd-20")) << reports;
    ASSERT_TRUE(reports.ends_with(".crash\n")) << reports;
    const auto name = reports.substr(reports.find("ostrandd-"));
    EXPECT_EQ(test::readFile(std::string(crashReportDirectory) + "/" + name.substr(0, name.size() - 1)),
              message + "\n");
}

TEST_F(CrashReportTest, endsTheProcessWhateverStandsInTheWay) {
    std::filesystem::remove_all("/private/var/root");
    test::writeFile("/private/var/root", "no directory");
    EXPECT_EXIT(crashWithMessage("last words"), testing::KilledBySignal(SIGABRT), "last words");
}

TEST(StackTrace, knowsTheFramesOfACall) {
    try {
        throw std::out_of_range("index");
    } catch (const std::exception&) {
        EXPECT_GT(exceptionCallStackSymbols().size(), 2U);
    }
    const auto frames = callStackSymbols();
    ASSERT_GT(frames.size(), 2U);
    for (const auto& frame : frames)
        EXPECT_NE(frame.find("0x"), std::string::npos) << frame;
}

} // namespace
} // namespace ost::platform
