#include "Client/ctl/Output.h"
#include "Client/ctl/Values.h"

#include <gtest/gtest.h>

#include <limits>

using namespace ostrand;
using namespace ostrand::ctl;

namespace {

TEST(Output, WritesJSONThatHoldsWhateverTheValuesHold) {
    ost::OSTDictionary dictionary;
    dictionary.set("b", ost::OSTArray{true, std::uint64_t{1}, ost::OSTArray{}});
    dictionary.set("a\"", ost::OSTDictionary());
    const struct {
        ost::OSTValue value;
        std::string json;
    } rows[] = {
        {dictionary, R"({"a\"": {}, "b": [true, 1, []]})"},
        {std::string("a\\b/\n\x1b[\0\x7f", 9), R"("a\\b/\u000a\u001b[\u0000\u007f")"},
        {"h\u00e9 \u65e5 \U0001f600 \u0085", "\"h\u00e9 \u65e5 \U0001f600 \\u0085\""},
        {"left \u202e right", R"("left \u202e right")"},
        {"cut \xe6\x97, stray \x80, surrogate \xed\xa0\x80",
         "\"cut \ufffd\ufffd, stray \ufffd, surrogate \ufffd\ufffd\ufffd\""},
        {std::numeric_limits<std::uint64_t>::max(), "18446744073709551615"},
        {std::numeric_limits<std::int64_t>::min(), "-9223372036854775808"},
        {0.5, "0.5"},
        {std::numeric_limits<double>::infinity(), "null"},
        {ost::OSTData{std::string("\x00\xff", 2)}, "\"00ff\""},
        {ost::OSTDate{1.5}, "1.5"},
    };
    for (const auto& [value, json] : rows)
        EXPECT_EQ(jsonText(value), json);
}

TEST(Output, WritesATreeThatIsPlainToReadWhateverTheValuesHold) {
    const ost::OSTDictionary inner({{"k\n", std::string("\x1b[\"")}});
    const ost::OSTDictionary dictionary(
        {{"array", ost::OSTArray{std::int64_t{-1}, ost::OSTArray{true, inner}, ost::OSTArray{}}},
         {"data", ost::OSTData{std::string("\x00\xff", 2)}},
         {"date", ost::OSTDate{0}},
         {"dictionary", inner},
         {"empty", ost::OSTDictionary()},
         {"real", 0.5}});
    EXPECT_EQ(treeText(dictionary), R"(array
    - -1
    -
        - true
        -
            k\n "\u001b[\""
    - []
data <00ff>
date 1970-01-01T00:00:00Z
dictionary
    k\n "\u001b[\""
empty {}
real 0.5
)");
    EXPECT_EQ(treeText({}), "");
}

TEST(Output, SaysOfAFailureWhatProgramsAndPeopleNeed) {
    const struct {
        Failure failure;
        int status;
        std::string json;
    } rows[] = {
        {Failure::of(Error::failed(21)), 1,
         R"({"error": {"code": 21, "hint": "ostrandctl list --class C --user U shows what there is; transient ones )"
         R"(with --transient.", "kind": "failed", "message": "error 21: no such container"}})"},
        {Failure::system("cannot open a\nb", ENOENT), 1,
         R"({"error": {"code": 2, "kind": "local", "message": "cannot open a\\nb: No such file or directory"}})"},
        {Failure::usage("what?"), 2, R"({"error": {"kind": "usage", "message": "what?"}})"},
    };
    for (const auto& [failure, status, json] : rows) {
        EXPECT_EQ(failure.exitStatus, status);
        EXPECT_EQ(jsonText(failure.json), json);
    }
}

TEST(Output, AlignsColumnsByCharacters) {
    Table table;
    table.add({"a", "b"});
    table.add({"h\u00e9h\u00e9", "long one", "c"});
    table.add({"x", "y", "z"});
    EXPECT_EQ(table.text(), "a     b\nh\u00e9h\u00e9  long one  c\nx     y         z\n");
    EXPECT_EQ(sizeText(1023), "  1023 B  ");
    EXPECT_EQ(sizeText(18022400), "  17.2 MiB");
    EXPECT_EQ(sizeText(~std::uint64_t{0}), "  16.0 EiB");
    EXPECT_EQ(countOf(1, "file") + ", " + countOf(0, "file"), "1 file, 0 files");
}

TEST(ErrorCodes, AreTheSystemsOwnBeforeTheyAreErrnos) {
    const struct {
        std::uint64_t code;
        std::string meaning;
    } rows[] = {
        {21, "no such container"},
        {28, "deletion failed"},
        {63, "an access control list could not be built or applied"},
        {EACCES, "system error: Permission denied"},
        {0, "the daemon could not read its code-signing file, and did nothing"},
        {4000, "unknown code"},
        {~std::uint64_t{0}, "unknown code"},
    };
    for (const auto& [code, meaning] : rows)
        EXPECT_EQ(Error::failed(code).description(), "error " + std::to_string(code) + ": " + meaning);
}

TEST(ContainerClass, IsNamedInAnyCaseAndHasAUsualUserThatFits) {
    for (std::uint64_t number = 1; number <= 13; ++number) {
        const auto containerClass = static_cast<ContainerClass>(number);
        const auto name = std::string(ost::pathComponentForContainerClass(containerClass));
        EXPECT_EQ(classNamed(name), containerClass);
        const auto user = usualUserOf(containerClass);
        EXPECT_TRUE(OSTUserIdFitsClass(containerClass, user == ost::OSTCurrentUserPlaceholder ? 501 : user)) << name;
    }
    EXPECT_EQ(classNamed("dAtA/aPPlication"), ContainerClass::dataApplication);
    for (const auto* const name : {"", "Undefined", "MAX", "Data", "Data/Applications"})
        EXPECT_FALSE(classNamed(name)) << name;
}

} // namespace
