#include "support/Comparison.h"
#include "support/Workshop.h"

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <exception>

int main(int count, char** arguments) {
    try {
        ost::benchmarks::enterWorkshop(arguments);
    } catch (const std::exception& exception) {
        std::fprintf(stderr, "%s cannot be run, which takes root: %s\n", arguments[0], exception.what());
        return EXIT_FAILURE;
    }
    benchmark::Initialize(&count, arguments);
    if (benchmark::ReportUnrecognizedArguments(count, arguments))
        return EXIT_FAILURE;
    return ost::benchmarks::runComparisons() ? EXIT_SUCCESS : EXIT_FAILURE;
}
