#pragma once

#include <array>
#include <string_view>

namespace ost::device {

// What the launcher's help and its manual page say.

struct HelpRow {
    std::string_view name, value, text;
};

inline constexpr std::string_view helpUsage = "ostrand-device boot --image DIR [--daemon PATH] [-- COMMAND...]";
inline constexpr std::string_view helpSummary =
    "Boots the device whose file system lies in DIR and keeps its container daemon running. A DIR that is no device "
    "image is made one. Requires root.";
inline constexpr std::array<HelpRow, 4> helpRows{{
    {"--image", "DIR", "the device image; its sockets are in DIR/private/var/run"},
    {"--daemon", "PATH", "the daemon; without it, ostrandd beside this program"},
    {"", "COMMAND",
     "runs on the host once the daemon serves, with OSTRAND_DEVICE set to DIR; the device goes down "
     "when it ends"},
    {"--help", "", "prints this"},
}};
inline constexpr std::string_view helpEnd =
    "Without COMMAND the device runs until SIGTERM or SIGINT. If the launcher is killed, the daemon is killed with it.";
inline constexpr std::string_view helpExitStatus =
    "That of COMMAND; else 0, 1 when the device cannot be booted, 2 when the arguments make no sense.";

} // namespace ost::device
