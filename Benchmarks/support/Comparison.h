#pragma once

#include <benchmark/benchmark.h>

#include <functional>

namespace ost::benchmarks {

/// What a sample is.
enum class Unit { seconds, perSecond, bytes };

/// What the daemon has to reach.
struct Target {
    enum class Kind { ratioAtMost, ratioAtLeast, valueAtMost };
    Kind kind;
    double limit;
};

/// One row of the table: the daemon's work beside the bare work. Both are sampled in turn, as often as the benchmark
/// has iterations, because absolute figures drift; their medians make the row.
struct Comparison {
    Unit unit;
    Target target;
    std::function<double()> daemon;
    std::function<double()> baseline;

    void run(benchmark::State& state) const;
};

/// Runs the program's benchmarks and prints a row for each. Gives whether all could be measured.
[[nodiscard]] bool runComparisons();

/// Registers `function`, which throws when it cannot measure, as the row `work` with a number of turns.
int registerComparison(const char* work, int turns, void (*function)(benchmark::State&));

} // namespace ost::benchmarks
