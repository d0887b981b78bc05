#include "Client/ctl/Commands.h"

#include <cstdio>
#include <cstdlib>

using namespace ostrand::ctl;

namespace {

/// What cannot be printed was not delivered: the exit status says so.
int print(const std::string& text) {
    const bool written = std::fputs(text.c_str(), stdout) >= 0 && std::fflush(stdout) == 0;
    if (!written)
        std::perror("ostrandctl: standard output");
    return written ? EXIT_SUCCESS : EXIT_FAILURE;
}

void complain(const std::string& message, const std::string& usage = {}) {
    std::fprintf(stderr, "ostrandctl: %s\n", message.c_str());
    if (!usage.empty())
        std::fprintf(stderr, "%s\n", usage.c_str());
}

int printOutcome(const Invocation& invocation, const Outcome& outcome) {
    const bool asJSON = invocation.arguments.has("json");
    if (outcome) {
        const auto inJSON = [&] { return outcome->json.empty() ? std::string() : jsonText(outcome->json) + "\n"; };
        const int failed = print(asJSON ? inJSON() : outcome->text);
        return failed != 0 ? failed : outcome->exitStatus;
    }
    const auto& failure = outcome.error();
    if (failure.exitStatus == Failure::usageStatus) {
        complain(failure.message, usageLine(commandTable(), *invocation.command));
        return failure.exitStatus;
    }
    complain(failure.message);
    if (asJSON)
        print(jsonText(failure.json) + "\n");
    return failure.exitStatus;
}

} // namespace

int main(int argc, char** argv) {
    const std::vector<std::string_view> words(argv + (argc > 0), argv + argc);
    const auto parsed = parseCommandLine(commandTable(), words);
    if (const auto* const help = std::get_if<Help>(&parsed))
        return print(help->text);
    if (const auto* const error = std::get_if<UsageError>(&parsed)) {
        complain(error->message, error->usage);
        return Failure::usageStatus;
    }
    const auto& invocation = std::get<Invocation>(parsed);
    return printOutcome(invocation, invocation.command->run(invocation.arguments));
}
