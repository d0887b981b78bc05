#include "Device/Help.h"
#include "Device/ServiceLauncher.h"
#include "platform/base/FileDescriptor.h"

#include <fcntl.h>
#include <getopt.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>

using ost::device::BootOptions;
using ost::device::helpSummary;
using ost::device::helpUsage;
using ost::device::ServiceLauncher;

namespace {

constexpr int usageError = 2;

void printHelp() {
    std::printf("Usage: %s\n\n%s\n\n", helpUsage.data(), helpSummary.data());
    for (const auto& [name, value, text] : ost::device::helpRows) {
        const auto left = std::string(name).append(name.empty() || value.empty() ? "" : " ").append(value);
        std::printf("  %-15s%s\n", left.c_str(), text.data());
    }
    std::printf("\n%s\n\nExit status: %s\n", ost::device::helpEnd.data(), ost::device::helpExitStatus.data());
}

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
            printHelp();
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
        printHelp();
        return EXIT_SUCCESS;
    }
    auto options = verb == "boot" ? parse(count - 1, arguments + 1) : std::unexpected(usageError);
    if (options)
        return boot(*std::move(options));
    if (options.error() == usageError)
        std::fprintf(stderr, "Usage: %s\n", helpUsage.data());
    return options.error();
}
