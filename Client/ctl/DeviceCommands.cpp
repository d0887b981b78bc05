#include "Client/ctl/Commands.h"
#include "platform/device/DeviceLockState.h"

namespace ostrand::ctl {

namespace {

Outcome reportOf(int state) {
    const std::string words = state == ost::platform::deviceLocked     ? "locked"
                              : state == ost::platform::deviceUnlocked ? "unlocked"
                                                                       : "unknown";
    Report report;
    report.text = words + "\n";
    report.json.set("state", words);
    report.json.set("number", static_cast<std::int64_t>(state));
    return report;
}

Outcome setState(const Arguments& arguments, int state) {
    const auto device = deviceDirectory(arguments);
    if (const auto written = ost::platform::writeDeviceLockState(state, device); !written)
        return std::unexpected(Failure::system("cannot write the lock state of " + device, written.error()));
    return reportOf(state);
}

Outcome lock(const Arguments& arguments) { return setState(arguments, ost::platform::deviceLocked); }
Outcome unlock(const Arguments& arguments) { return setState(arguments, ost::platform::deviceUnlocked); }
Outcome state(const Arguments& arguments) {
    const auto device = deviceDirectory(arguments);
    const auto state = ost::platform::deviceLockState(device);
    if (!state)
        return std::unexpected(Failure::system("cannot read the lock state of " + device, state.error()));
    return reportOf(*state);
}

} // namespace

std::vector<Command> deviceCommands() {
    return {
        {"device lock",
         "puts the device into the locked state",
         {},
         {},
         "",
         lock,
         R"({"state": "string", "number": "number"})"},
        {"device unlock",
         "ends the locked state; the daemon then does what had to wait for it",
         {},
         {},
         "",
         unlock,
         R"({"state": "string", "number": "number"})"},
        {"device state",
         "prints whether the device is locked",
         {},
         {},
         "",
         state,
         R"({"state": "string", "number": "number"})"},
    };
}

} // namespace ostrand::ctl
