#include "Client/ContainerClass.h"
#include "Client/ErrorCodes.h"
#include "Client/ctl/Output.h"
#include "model/OSTContainerClass.h"
#include "platform/base/OSTError.h"

#include <gtest/gtest.h>

#include <limits>

using namespace ostrand;
using namespace ostrand::ctl;

namespace {

TEST(Output, writesJSONThatHoldsWhateverTheValuesHold) {
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

TEST(Output, writesATreeThatIsPlainToReadWhateverTheValuesHold) {
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

TEST(Output, saysOfAFailureWhatProgramsAndPeopleNeed) {
    const struct {
        Failure failure;
        int status;
        std::string json;
    } rows[] = {
        {Failure::of(Error::failed(21)), 1,
         R"({"error": {"code": 21, "kind": "failed", "message": "error 21: no such container"}})"},
        {Failure::of(Error::refused()), 1,
         R"({"error": {"kind": "refused", "message": "the daemon refused the request and closed the connection"}})"},
        {Failure::system("cannot open a\nb", ENOENT), 1,
         R"({"error": {"code": 2, "kind": "local", "message": "cannot open a\\nb: No such file or directory"}})"},
        {Failure::usage("what?"), 2, R"({"error": {"kind": "usage", "message": "what?"}})"},
    };
    for (const auto& [failure, status, json] : rows) {
        EXPECT_EQ(failure.exitStatus, status);
        EXPECT_EQ(jsonText(failure.json), json);
    }
}

TEST(ErrorCodes, areTheSystemsOwnBeforeTheyAreErrnos) {
    const struct {
        std::uint64_t code;
        std::string meaning;
    } rows[] = {
        {static_cast<std::uint64_t>(ost::OSTErrorCode::notFound), "no such container"},
        {static_cast<std::uint64_t>(ost::OSTErrorCode::deletionFailed), "deletion failed"},
        {static_cast<std::uint64_t>(ost::OSTErrorCode::accessControlListFailed),
         "an access control list could not be built or applied"},
        {EACCES, "system error: Permission denied"},
        {0, "the daemon could not read its code-signing file, and did nothing"},
        {4000, "unknown code"},
        {~std::uint64_t{0}, "unknown code"},
    };
    for (const auto& [code, meaning] : rows)
        EXPECT_EQ(meaningOfErrorCode(code), meaning) << code;
}

TEST(ContainerClass, agreesWithTheDaemonOnNamesAndUsers) {
    for (std::uint64_t number = 1; number <= 13; ++number) {
        const auto containerClass = static_cast<ContainerClass>(number);
        const auto daemonsClass = static_cast<ost::OSTContainerClass>(number);
        const auto name = ost::pathComponentForContainerClass(daemonsClass);
        EXPECT_EQ(nameOf(containerClass), name);
        EXPECT_EQ(containerClassNamed(name), containerClass);
        const auto user = usualUserOf(containerClass);
        EXPECT_TRUE(ost::OSTUserIdFitsClass(daemonsClass, user == currentUser ? 501 : user)) << name;
    }
    EXPECT_EQ(containerClassNamed("dAtA/aPPlication"), ContainerClass::dataApplication);
    for (const auto* const name : {"", "Undefined", "MAX", "Data", "Data/Applications"})
        EXPECT_EQ(containerClassNamed(name), std::nullopt) << name;
}

} // namespace
