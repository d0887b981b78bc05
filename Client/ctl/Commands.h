#pragma once

#include "Client/Connection.h"
#include "Client/ctl/Arguments.h"

#include <string>
#include <type_traits>
#include <vector>

namespace ostrand::ctl {

/// The rows of the command table, by what they are about.
[[nodiscard]] std::vector<Command> containerCommands();
[[nodiscard]] std::vector<Command> attributeCommands();
[[nodiscard]] std::vector<Command> protectionCommands();
[[nodiscard]] std::vector<Command> maintenanceCommands();
[[nodiscard]] std::vector<Command> codeSigningCommands();
[[nodiscard]] std::vector<Command> signingCommands();
[[nodiscard]] std::vector<Command> deviceCommands();
[[nodiscard]] std::vector<Command> runCommands();
[[nodiscard]] std::vector<Command> watchCommands();

/// The whole table, and what is common to all commands.
[[nodiscard]] const CommandTable& commandTable();

/// The device's directory: `--device`, else the environment's OSTRAND_DEVICE, else "/".
[[nodiscard]] std::string deviceDirectory(const Arguments& arguments);

/// Connects to the device's daemon.
[[nodiscard]] std::expected<Connection, Failure> connectToDevice(const Arguments& arguments,
                                                                 Connection::Timeout timeout = {});

/// The result of a request as a command hands it on.
template<typename T>
[[nodiscard]] std::expected<T, Failure> orFailure(Result<T> result) {
    if (!result)
        return std::unexpected(Failure::of(result.error()));
    if constexpr (std::is_void_v<T>)
        return {};
    else
        return *std::move(result);
}

} // namespace ostrand::ctl
