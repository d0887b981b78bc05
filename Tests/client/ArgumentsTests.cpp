#include "Client/ctl/Arguments.h"
#include "Client/ctl/Commands.h"

#include <gtest/gtest.h>

#include <sstream>

using namespace ostrand::ctl;

namespace {

const CommandTable table{
    .program = "tool",
    .summary = "Does things.",
    .options = {{"where", "DIR", "the place"}, {"loud", "", "say more"}},
    .commands = {
        {"make",
         "makes a thing",
         {{"NAME", "its name"}, {"SIZE", "its size", Operand::Count::optional}},
         {{"colour", "C", "its colour", Option::Count::required}, {"part", "P", "a part", Option::Count::repeated}},
         "Things last.",
         nullptr},
        {"lamp on", "lights the lamp", {}, {}, "", nullptr},
        {"lamp off", "puts it out", {}, {}, "", nullptr},
        {"drop", "drops things", {{"NAME", "their names", Operand::Count::several}}, {}, "", nullptr},
    }};

/// What a command line comes to, in one line.
std::string outcomeOf(const std::string& line) {
    std::istringstream in(line);
    std::vector<std::string> words;
    for (std::string word; in >> word;)
        words.push_back(word);
    const std::vector<std::string_view> views(words.begin(), words.end());
    const auto parsed = parseCommandLine(table, views);
    if (const auto* const help = std::get_if<Help>(&parsed))
        return "help: " + help->text.substr(0, help->text.find('\n'));
    if (const auto* const error = std::get_if<UsageError>(&parsed))
        return error->message + " | " + error->usage;
    const auto& [command, arguments] = std::get<Invocation>(parsed);
    std::string text(command->name);
    for (const auto name : {"where", "loud", "colour", "part", "NAME", "SIZE"})
        for (const auto& value : arguments.values(name))
            text += std::string(" ") + name + "=" + value;
    return text;
}

TEST(Arguments, ComeFromTheTableAlone) {
    const std::string usage = " | usage: tool [--where DIR] [--loud] COMMAND ...";
    const std::string usageOfMake = "usage: tool [--where DIR] [--loud] make --colour C [--part P]... NAME [SIZE]";
    const struct {
        std::string line, outcome;
    } rows[] = {
        {"make x --colour red", "make colour=red NAME=x"},
        {"--where=/a make --colour=a=b x 3 --loud", "make where=/a loud= colour=a=b NAME=x SIZE=3"},
        {"make --part 1 x --colour= --part 2", "make colour= part=1 part=2 NAME=x"},
        {"make --colour --help x", "make colour=--help NAME=x"},
        {"make --colour c -- --help", "make colour=c NAME=--help"},
        {"make --colour c -", "make colour=c NAME=-"},
        {"lamp --loud off", "lamp off loud="},
        {"drop x --loud y z", "drop loud= NAME=x NAME=y NAME=z"},
        {"drop", "missing NAME | usage: tool [--where DIR] [--loud] drop NAME..."},
        {"--help", "help: usage: tool [--where DIR] [--loud] COMMAND ..."},
        {"lamp -h", "help: usage: tool [--where DIR] [--loud] lamp COMMAND ..."},
        {"make --help", "help: " + usageOfMake},
        {"", "no command given" + usage},
        {"break", "unknown command \"break\"" + usage},
        {"la on", "unknown command \"la\"; did you mean \"lamp\"?" + usage},
        {"help", "help: usage: tool [--where DIR] [--loud] COMMAND ..."},
        {"help lamp off", "help: usage: tool [--where DIR] [--loud] lamp off"},
        {"lamp dim",
         "unknown command \"lamp dim\": lamp off, lamp on | usage: tool [--where DIR] [--loud] lamp COMMAND ..."},
        {"lamp",
         "\"lamp\" needs a further word: lamp off, lamp on | usage: tool [--where DIR] [--loud] lamp COMMAND ..."},
        {"lamp on off", "unexpected argument \"off\" | usage: tool [--where DIR] [--loud] lamp on"},
        {"--colour c make x", "unknown option --colour" + usage},
        {"make x --colour c -q", "unknown option -q | " + usageOfMake},
        {"make x --colour c --shape=y", "unknown option --shape | " + usageOfMake},
        {"make x", "missing --colour C | " + usageOfMake},
        {"make --colour c", "missing NAME | " + usageOfMake},
        {"make x --colour", "--colour needs a value | " + usageOfMake},
        {"make x --colour c --colour d", "--colour is given twice | " + usageOfMake},
        {"make x --colour c --loud=1", "--loud takes no value | " + usageOfMake},
    };
    for (const auto& [line, outcome] : rows)
        EXPECT_EQ(outcomeOf(line), outcome) << line;
}

TEST(Arguments, HelpNamesEverythingThatTheTableAccepts) {
    const std::string_view words[] = {"make", "--help"};
    EXPECT_EQ(std::get<Help>(parseCommandLine(table, words)).text,
              "usage: tool [--where DIR] [--loud] make --colour C [--part P]... NAME [SIZE]\n\n"
              "makes a thing\n\nThings last.\n\n"
              "arguments:\n  NAME  its name\n  SIZE  its size\n\n"
              "options:\n  --colour C   its colour\n  --part P     a part\n  --where DIR  the place\n"
              "  --loud       say more\n  --help       shows this\n");
}

TEST(CommandTable, HasEveryCommandOnceAndNoneHidesAnother) {
    const auto& commands = commandTable().commands;
    for (const auto& one : commands)
        for (const auto& other : commands)
            EXPECT_TRUE(&one == &other || !(std::string(one.name) + " ").starts_with(std::string(other.name) + " "))
                << one.name;
}

} // namespace
