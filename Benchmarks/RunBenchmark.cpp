// Running a program in its containers, beside starting the same program as the same user and one upcall.

#include "Client/Upcall.h"
#include "Support/BootedDevice.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/OneProcessor.h"
#include "support/Require.h"
#include "support/Stopwatch.h"

#include <grp.h>
#include <unistd.h>

#include <stdexcept>
#include <string>

namespace ost::benchmarks {

using test::BootedDevice;
using test::builtProgram;
using test::ChildProcess;
using test::makeScratchDirectory;

namespace {

constexpr const char* identifier = "com.example.Sketches";
constexpr const char* program = "/bin/true";
constexpr uid_t user = 501;

int becomeUserAndRun() {
    if (::setgroups(0, nullptr) == 0 && ::setgid(user) == 0 && ::setuid(user) == 0)
        ::execl(program, program, nullptr);
    return 1;
}

void requireSuccess(ChildProcess&& process) {
    if (process.wait() != 0)
        throw std::runtime_error("the program was not run");
}

void runTrue(benchmark::State& state) {
    const OneProcessor oneProcessor;
    const auto device = makeScratchDirectory(0711) / "device";
    const BootedDevice booted(device);
    registerApplication(booted, identifier);
    const std::vector<std::string> command{
        builtProgram("ostrandctl"), "run", "--device", device, "--identifier", identifier, program};
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.5},
               .daemon = [&] { return secondsOf([&] { requireSuccess(ChildProcess(command)); }); },
               .baseline =
                   [&] {
                       return secondsOf([&] {
                           require(
                               ostrand::processContainers(device, {.containerIdentifier = identifier, .user = user}),
                               "ask for the containers");
                           requireSuccess(ChildProcess(becomeUserAndRun));
                       });
                   }}
        .run(state);
}

[[maybe_unused]] const int row = registerComparison("run /bin/true in its containers", 201, runTrue);

} // namespace

} // namespace ost::benchmarks
