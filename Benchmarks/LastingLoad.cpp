// Looks containers up beside a load that lasts, and says how long that takes, what it takes of a quiet daemon, how long
// the echo of another process takes beside the same load, and whether the daemon gives back what the load has taken.

#include "support/LoadedDevice.h"
#include "support/Workshop.h"

#include "platform/base/Text.h"

#include <cstdio>
#include <cstdlib>
#include <exception>

namespace ost::benchmarks {

namespace {

void printRow(const char* name, const std::vector<double>& quiet, const std::vector<double>& loaded,
              double percentile) {
    constexpr double microseconds = 1e6;
    const auto alone = percentileOf(quiet, percentile), beside = percentileOf(loaded, percentile);
    std::printf("%-24s %9.1f us quiet %9.1f us under load %6.2f times\n", name, alone * microseconds,
                beside * microseconds, beside / alone);
}

void printHolding(const char* when, const LoadedDevice::Holding& holding) {
    std::printf("%-24s %9.1f MiB resident %9zu descriptors\n", when,
                static_cast<double>(holding.residentBytes) / (1 << 20), holding.descriptors);
}

/// Whether the daemon gave everything back.
bool bear(std::chrono::seconds duration) {
    constexpr unsigned samples = 20'000;
    LoadedDevice device;
    const auto quiet = device.lookUps(samples), quietEchoes = device.echoes(samples);
    const auto before = device.holding();
    printHolding("before the load", before);
    std::vector<double> loaded, loadedEchoes;
    {
        const LoadedDevice::Load load(device);
        loaded = device.lookUps(duration);
        loadedEchoes = device.echoes(samples);
        printHolding("under the load", device.holding());
    }
    const bool isBack = device.returnsTo(before);
    printHolding("after the load", device.holding());
    printRow("look-up, median", quiet, loaded, 0.5);
    printRow("look-up, 99th percentile", quiet, loaded, 0.99);
    printRow("echo, median", quietEchoes, loadedEchoes, 0.5);
    printRow("echo, 99th percentile", quietEchoes, loadedEchoes, 0.99);
    if (!isBack)
        std::printf("the daemon keeps what the load has taken\n");
    return isBack;
}

} // namespace

} // namespace ost::benchmarks

int main(int count, char** arguments) {
    const auto seconds = count == 2 ? ost::platform::numberIn<unsigned>(arguments[1]) : std::nullopt;
    if (!seconds || *seconds == 0) {
        std::fprintf(stderr, "usage: %s SECONDS\n", arguments[0]);
        return EXIT_FAILURE;
    }
    try {
        ost::benchmarks::enterWorkshop(arguments);
        return ost::benchmarks::bear(std::chrono::seconds(*seconds)) ? EXIT_SUCCESS : EXIT_FAILURE;
    } catch (const std::exception& exception) {
        std::fprintf(stderr, "%s cannot be run, which takes root: %s\n", arguments[0], exception.what());
        return EXIT_FAILURE;
    }
}
