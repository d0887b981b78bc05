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
            .exitStatus =
                "\nexit status:\n"
                "  0  it was done\n"
                "  1  it was not, and standard error says why; of check: something was found\n"
                "  2  the command line makes no sense; of check: not everything could be looked at\n"
                "  of run: the program's own, or 128 and the number of the signal that ended it\n"
                "\nwith --json, a failure is printed as\n"
                "  {\"error\": {\"kind\": \"string\", \"code?\": \"number\", \"message\": \"string\", "
                "\"hint?\": \"string\"}}\n"
                "  kind: usage, local (on this side), transport (no daemon), refused, failed (code says how)\n",
            .commands = {},
        };
        for (const auto part : {containerCommands, attributeCommands, protectionCommands, maintenanceCommands,
                                codeSigningCommands, watchCommands, signingCommands, deviceCommands, runCommands})
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

std::expected<Connection, Failure> connectToDevice(const Arguments& arguments, Connection::Timeout timeout) {
    return orFailure(Connection::open(deviceDirectory(arguments), timeout));
}

} // namespace ostrand::ctl
