#include "EndToEnd/DeviceLog.h"

#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <sched.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <iterator>
#include <regex>
#include <sstream>

namespace ost::test {

std::vector<std::string> DeviceLog::takeErrors() {
    static const std::regex errorLine(
        R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z <Error> \[\d+:\d+\] ([^:]+: .*))"); // The rest of a line.
    std::istringstream complaints(_device.complaints().substr(_seen));
    std::vector<std::string> errors;
    for (std::string line; std::getline(complaints, line);) {
        _seen += line.size() + 1;
        std::smatch parts;
        if (std::regex_match(line, parts, errorLine))
            errors.push_back(parts[1]);
        else if (!line.starts_with("ostrand-device: "))
            ADD_FAILURE() << "This is no log line: " << line;
    }
    return errors;
}

std::size_t linesInLogFile(const BootedDevice& device, const std::string& text) {
    std::istringstream lines(readFile(device.onHost("/private/var/root/Library/Logs/Ostrand/ostrandd.log")));
    std::size_t count = 0;
    for (std::string line; std::getline(lines, line);)
        count += line.find(text) != std::string::npos ? 1 : 0;
    return count;
}

std::size_t openDescriptors(pid_t process) {
    return static_cast<std::size_t>(
        std::distance(std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/fd"), {}));
}

std::size_t residentMemory(pid_t process) {
    std::size_t total = 0, resident = 0;
    std::ifstream("/proc/" + std::to_string(process) + "/statm") >> total >> resident;
    return resident * static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
}

bool comesTrue(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline)
            return false;
        ::sched_yield();
    }
    return true;
}

} // namespace ost::test
