#include "Client/ctl/Commands.h"

#include <cstdlib>
#include <iterator>

namespace ostrand::ctl {

const CommandTable& commandTable() {
    static const CommandTable table = [] {
        CommandTable all{
            .program = "ostrandctl",
            .summary = "Asks the container daemon of a device, and prepares programs and the device for it.",
            .options = {{"device", "DIR", "the device's directory; else OSTRAND_DEVICE of the environment, else /"},
                        {"json", "", "print one JSON object instead of text for people"}},
            .commands = {},
        };
        for (const auto part : {containerCommands, attributeCommands, protectionCommands, maintenanceCommands,
                                codeSigningCommands, signingCommands, deviceCommands, runCommands})
            std::ranges::move(part(), std::back_inserter(all.commands));
        return all;
    }();
    return table;
}

std::string deviceDirectory(const Arguments& arguments) {
    if (auto given = arguments.value("device"))
        return *std::move(given);
    const char* const environment = std::getenv("OSTRAND_DEVICE");
    return environment && *environment ? environment : "/";
}

std::expected<Connection, Failure> connectToDevice(const Arguments& arguments) {
    return orFailure(Connection::open(deviceDirectory(arguments)));
}

} // namespace ostrand::ctl
