#include "Client/ctl/Commands.h"
#include "Client/ctl/Completion.h"
#include "Client/ctl/Terminal.h"

#include <unistd.h>

#include <algorithm>
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

void complain(const Failure& failure, const std::string& usage = {}) {
    const auto name = styled("ostrandctl:", Style::error, STDERR_FILENO);
    std::fprintf(stderr, "%s %s\n", name.c_str(), failure.message.c_str());
    if (!failure.hint.empty())
        std::fprintf(stderr, "%s %s\n", styled("hint:", Style::strong, STDERR_FILENO).c_str(), failure.hint.c_str());
    if (!usage.empty())
        std::fprintf(stderr, "%s\n", usage.c_str());
}

int printFailure(const Failure& failure, bool asJSON, const std::string& usage) {
    complain(failure, usage);
    if (asJSON)
        print(jsonText(failure.json) + "\n");
    return failure.exitStatus;
}

int printOutcome(const Invocation& invocation, const Outcome& outcome) {
    const bool asJSON = invocation.arguments.has("json");
    if (outcome) {
        const int failed =
            outcome->isPrinted ? EXIT_SUCCESS : print(asJSON ? jsonText(outcome->json) + "\n" : outcome->text);
        return failed != 0 ? failed : outcome->exitStatus;
    }
    return printFailure(outcome.error(), asJSON,
                        outcome.error().isUsage ? usageLine(commandTable(), *invocation.command) : "");
}

/// Whether JSON is asked for in a command line that makes no sense.
bool asksForJSON(std::span<const std::string_view> words) {
    const auto end = std::ranges::find(words, "--");
    return std::find(words.begin(), end, "--json") != end;
}

/// For the shells: "ostrandctl __complete -- WORD..." prints what may stand in the place of the last word.
int complete(std::span<const std::string_view> words) {
    std::string lines;
    for (const auto& candidate : completions(commandTable(), words))
        lines += candidate + "\n";
    return print(lines);
}

} // namespace

int main(int argc, char** argv) {
    const std::vector<std::string_view> words(argv + (argc > 0), argv + argc);
    if (words.size() >= 2 && words[0] == "__complete" && words[1] == "--")
        return complete(std::span(words).subspan(2));
    const auto parsed = parseCommandLine(commandTable(), words);
    if (const auto* const help = std::get_if<Help>(&parsed))
        return print(help->text);
    if (const auto* const error = std::get_if<UsageError>(&parsed))
        return printFailure(Failure::usage(error->message), asksForJSON(words), error->usage);
    const auto& invocation = std::get<Invocation>(parsed);
    return printOutcome(invocation, invocation.command->run(invocation.arguments));
}
