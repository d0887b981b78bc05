#include "support/Comparison.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <exception>
#include <span>
#include <string>
#include <utility>
#include <vector>

namespace ost::benchmarks {

namespace {

/// "%g" with three digits, and what the number counts.
std::string shown(double value, const char* unit) {
    std::array<char, 64> text;
    const char* const format = value < 100 ? "%.3g %s" : "%.0f %s";
    std::snprintf(text.data(), text.size(), format, value, unit);
    return text.data();
}

std::string shown(double value, Unit unit) {
    using Step = std::pair<double, const char*>;
    static constexpr std::array<Step, 3> times{Step{1, "s"}, Step{1e-3, "ms"}, Step{1e-6, "us"}};
    static constexpr std::array<Step, 2> rates{Step{1e3, "k/s"}, Step{1, "/s"}};
    static constexpr std::array<Step, 1> sizes{Step{1, "B"}};
    const std::span<const Step> steps = unit == Unit::seconds     ? std::span<const Step>(times)
                                        : unit == Unit::perSecond ? std::span<const Step>(rates)
                                                                  : std::span<const Step>(sizes);
    const auto step = std::ranges::find_if(steps, [&](const Step& candidate) { return value >= candidate.first; });
    const auto& [size, name] = step == steps.end() ? steps.back() : *step;
    return shown(value / size, name);
}

double medianOf(std::vector<double> samples) {
    const auto middle = samples.begin() + static_cast<std::ptrdiff_t>(samples.size() / 2);
    std::ranges::nth_element(samples, middle);
    return *middle;
}

bool isMet(const Target& target, double value, double ratio) {
    switch (target.kind) {
    case Target::Kind::ratioAtMost:
        return ratio <= target.limit;
    case Target::Kind::ratioAtLeast:
        return ratio >= target.limit;
    case Target::Kind::valueAtMost:
        return value <= target.limit;
    }
    std::unreachable();
}

std::string shown(const Target& target, Unit unit) {
    const std::string limit =
        target.kind == Target::Kind::valueAtMost ? shown(target.limit, unit) : shown(target.limit, "times");
    return (target.kind == Target::Kind::ratioAtLeast ? ">= " : "<= ") + limit;
}

/// Prints the columns that a comparison has put into the label.
class RowReporter : public benchmark::BenchmarkReporter {
public:
    bool ReportContext(const Context& /*context*/) override { return true; }

    void ReportRuns(const std::vector<Run>& runs) override {
        for (const auto& run : runs) {
            if (run.error_occurred)
                std::printf("%-44s cannot be measured: %s\n", run.run_name.function_name.c_str(),
                            run.error_message.c_str());
            else
                std::printf("%-44s %s\n", run.run_name.function_name.c_str(), run.report_label.c_str());
            _allMeasured &= !run.error_occurred;
        }
        std::fflush(stdout);
    }

    [[nodiscard]] bool allMeasured() const { return _allMeasured; }

private:
    bool _allMeasured = true;
};

} // namespace

void Comparison::run(benchmark::State& state) const {
    std::vector<double> ofDaemon;
    std::vector<double> ofBaseline;
    for ([[maybe_unused]] auto turn : state) {
        ofDaemon.push_back(daemon());
        ofBaseline.push_back(baseline());
    }
    const double value = medianOf(std::move(ofDaemon));
    const double bare = medianOf(std::move(ofBaseline));
    const double ratio = value / bare;
    state.counters["daemon"] = value;
    state.counters["baseline"] = bare;
    state.counters["ratio"] = ratio;

    std::array<char, 128> columns;
    std::snprintf(columns.data(), columns.size(), "%12s %12s %8.2f   %-13s %s", shown(value, unit).c_str(),
                  shown(bare, unit).c_str(), ratio, shown(target, unit).c_str(),
                  isMet(target, value, ratio) ? "met" : "missed");
    state.SetLabel(columns.data());
}

bool runComparisons() {
    RowReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    return reporter.allMeasured();
}

int registerComparison(const char* work, int turns, void (*function)(benchmark::State&)) {
    const auto measure = [function](benchmark::State& state) {
        try {
            function(state);
        } catch (const std::exception& exception) {
            state.SkipWithError(exception.what());
        }
    };
    benchmark::RegisterBenchmark(work, measure)->Iterations(turns);
    return turns;
}

} // namespace ost::benchmarks
