// A look-up while a thousand other connections are idle, dozens are busy and a hundred mean harm, beside one while the
// daemon has nothing else to do.

#include "support/Comparison.h"
#include "support/LoadedDevice.h"

#include <stdexcept>

namespace ost::benchmarks {

namespace {

constexpr unsigned lookUps = 2000;

double secondsUnderLoad(LoadedDevice& device, double percentile) {
    const auto before = device.holding();
    double seconds = 0;
    {
        const LoadedDevice::Load load(device);
        seconds = percentileOf(device.lookUps(lookUps), percentile);
    }
    if (!device.returnsTo(before))
        throw std::runtime_error("the daemon keeps what the load has taken");
    return seconds;
}

void compare(benchmark::State& state, double percentile) {
    LoadedDevice device;
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 2.0},
               .daemon = [&] { return secondsUnderLoad(device, percentile); },
               .baseline = [&] { return percentileOf(device.lookUps(lookUps), percentile); }}
        .run(state);
}

void median(benchmark::State& state) { compare(state, 0.5); }
void slowest(benchmark::State& state) { compare(state, 0.99); }

[[maybe_unused]] const int medians = registerComparison("look-up under load, median", 7, median);
[[maybe_unused]] const int percentiles = registerComparison("look-up under load, 99th percentile", 7, slowest);

} // namespace

} // namespace ost::benchmarks
