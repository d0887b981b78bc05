#include "model/OSTFailureReport.h"

#include "platform/base/StackTrace.h"
#include "platform/device/CrashReport.h"
#include "platform/device/DeviceCapabilities.h"
#include "platform/threads/ThreadName.h"

#include <cxxabi.h>

#include <cstdlib>
#include <memory>
#include <typeinfo>

namespace ost {

namespace {

std::string nameOfCurrentException() {
    const std::type_info* type = abi::__cxa_current_exception_type();
    if (type == nullptr)
        return "unknown exception";
    int status = 0;
    const std::unique_ptr<char, decltype(&std::free)> name(abi::__cxa_demangle(type->name(), nullptr, nullptr, &status),
                                                           &std::free);
    return name ? name.get() : type->name();
}

} // namespace

OSTCaughtException OSTCaughtException::current() {
    OSTCaughtException caught{nameOfCurrentException(), {}, platform::exceptionCallStackSymbols()};
    try {
        throw;
    } catch (const std::exception& exception) {
        caught.reason = exception.what();
    } catch (...) {
        caught.reason.clear(); // one of another kind has no reason to give
    }
    return caught;
}

std::string OSTUncaughtExceptionReport(const OSTCaughtException& exception) {
    std::string report = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
    if (const auto thread = platform::currentThreadName(); !thread.empty())
        report += "<" + thread + "> ";
    if (!exception.name.empty())
        report += exception.name + ": ";
    report += exception.reason + "\nStack:\n";
    for (std::size_t i = 0; i < exception.callStackSymbols.size(); ++i) {
        if (i > 0)
            report += '\n';
        report += exception.callStackSymbols[i];
    }
    return report;
}

OSTError OSTErrorFromCurrentException(const std::source_location& where) {
    const auto exception = OSTCaughtException::current();
    OSTError error = OSTCreateErrorAt(where, OSTErrorCode::exceptionCaught, nullptr, "Got exception: %@ : %@",
                                      exception, exception.callStackSymbols);
    if (platform::deviceCapability("InternalBuild"))
        platform::crashWithMessage(OSTUncaughtExceptionReport(exception));
    return error;
}

} // namespace ost
