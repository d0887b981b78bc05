#include "model/OSTFailureReport.h"

#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <stdexcept>

namespace ost {
namespace {

using FailureReport = test::DeviceTest;

OSTResult<int> guardedOperation() {
    return OSTGuarded([]() -> OSTResult<int> { throw std::out_of_range("beyond the end"); });
}

TEST_F(FailureReport, ExceptionBecomesTheOperationsFailure) {
    const auto result = guardedOperation();
    ASSERT_FALSE(result);
    EXPECT_TRUE(result.error().is(OSTErrorCode::exceptionCaught));
    EXPECT_EQ("guardedOperation", result.error().functionName());
    EXPECT_TRUE(result.error().message()->starts_with("Got exception: std::out_of_range: beyond the end : ("))
        << *result.error().message();
    EXPECT_EQ(5, *OSTGuarded([]() -> OSTResult<int> { return 5; }));
}

TEST_F(FailureReport, InternalBuildStopsWithTheReport) {
    test::writeFile("/etc/device-capabilities", "InternalBuild=true\n");
    EXPECT_DEATH((void)guardedOperation(), "\\*\\* INTERNAL ERROR: Uncaught Exception \\*\\*");
    std::string report;
    for (const auto& file : std::filesystem::directory_iterator("/private/var/root/Library/Logs/CrashReporter"))
        report += test::readFile(file.path());
    EXPECT_TRUE(report.starts_with("** INTERNAL ERROR: Uncaught Exception **\nException: ")) << report;
    EXPECT_NE(std::string::npos, report.find("std::out_of_range: beyond the end\nStack:\n0x")) << report;
    EXPECT_NE(std::string::npos, report.find("guardedOperation()")) << report;
}

TEST(FailureReportText, ShowsWhatThereIs) {
    EXPECT_NE(std::string::npos,
              OSTUncaughtExceptionReport({.name = "Name", .reason = "", .callStackSymbols = {"one", "two"}})
                  .find("Name: \nStack:\none\ntwo"));
}

} // namespace
} // namespace ost
