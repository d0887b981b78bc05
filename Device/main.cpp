#include "Device/ServiceLauncher.h"
#include "platform/base/FileDescriptor.h"

#include <fcntl.h>
#include <getopt.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string_view>

using ost::device::BootOptions;
using ost::device::ServiceLauncher;

namespace {

constexpr int usageError = 2;

constexpr const char* help = R"(Usage: ostrand-device boot --image DIR [--daemon PATH] [-- COMMAND...]

Boots the device whose file system lies in DIR and keeps its container daemon running. A DIR that is no device image is made
one. Requires root.

  --image DIR    the device image; its sockets are in DIR/private/var/run
  --daemon PATH  the daemon (default: ostrandd beside this program)
  COMMAND        runs on the host once the daemon serves, with OSTRAND_DEVICE set to DIR; the device goes down when it ends
  --help         prints this

Without COMMAND the device runs until SIGTERM or SIGINT. If the launcher is killed, the daemon is killed with it.

Exit status: that of COMMAND; else 0, 1 when the device cannot be booted, 2 when the arguments make no sense.
)";

std::filesystem::path defaultDaemon() {
    return std::filesystem::read_symlink("/proc/self/exe").replace_filename("ostrandd");
}

/// The options of `boot`, or the status to exit with.
std::expected<BootOptions, int> parse(int count, char** arguments) {
    static constexpr std::array options{option{"image", required_argument, nullptr, 'i'},
                                        option{"daemon", required_argument, nullptr, 'd'},
                                        option{"help", no_argument, nullptr, 'h'}, option{}};
    BootOptions boot;
    for (int option = 0; (option = ::getopt_long(count, arguments, "+", options.data(), nullptr)) != -1;) {
        if (option == 'i') {
            boot.image = optarg;
        } else if (option == 'd') {
            boot.daemon = optarg;
        } else if (option == 'h') {
            std::fputs(help, stdout);
            return std::unexpected(EXIT_SUCCESS);
        } else {
            return std::unexpected(usageError);
        }
    }
    boot.command.assign(arguments + optind, arguments + count);
    const bool hasDashes = std::string_view(arguments[optind - 1]) == "--";
    if (boot.image.empty() || boot.command.empty() == hasDashes)
        return std::unexpected(usageError);
    return boot;
}

int boot(BootOptions options) {
    if (options.daemon.empty())
        options.daemon = defaultDaemon();
    auto launcher = ServiceLauncher::prepare(options);
    if (!launcher) {
        std::fprintf(stderr, "ostrand-device: %s\n", launcher.error().description().c_str());
        return EXIT_FAILURE;
    }
    return launcher->run();
}

} // namespace

int main(int count, char** arguments) {
    ost::platform::openMissingStandardFiles();
    const std::string_view verb = count > 1 ? arguments[1] : "";
    if (verb == "--help") {
        std::fputs(help, stdout);
        return EXIT_SUCCESS;
    }
    auto options = verb == "boot" ? parse(count - 1, arguments + 1) : std::unexpected(usageError);
    if (options)
        return boot(*std::move(options));
    if (options.error() == usageError)
        std::fputs("Usage: ostrand-device boot --image DIR [--daemon PATH] [-- COMMAND...]\n", stderr);
    return options.error();
}
