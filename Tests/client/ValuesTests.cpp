#include "Client/ctl/Values.h"
#include "platform/codec/PropertyList.h"

#include "Support/ScratchDirectory.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <cstdio>

using namespace ostrand;
using namespace ostrand::ctl;

namespace {

/// The value, or the reason that there is none.
template<typename T>
std::string outcome(const std::expected<T, Failure>& value) {
    if (!value)
        return value.error().message;
    if constexpr (requires { value->description(); })
        return value->description();
    else
        return std::to_string(static_cast<std::uint64_t>(*value));
}

TEST(Values, MeanWhatTheyName) {
    const std::string device = ost::test::makeScratchDirectory();
    EXPECT_NE(outcome(userNamed("mobile", device)).find("cannot read"), std::string::npos);
    ost::test::writeFile(device + "/etc/passwd", "mobile:x:501:501::/private/var/mobile:\n7:x:8:8::/:\n");
    const struct {
        std::string result, expected;
    } rows[] = {
        {outcome(classNamed("2")), "2"},
        {outcome(classNamed("shared/APPGROUP")), "7"},
        {outcome(classNamed("4000")), "4000"},
        {outcome(classNamed("-1")), "no container class is called \"-1\""},
        {outcome(classNamed("a\n")), "no container class is called \"a\\n\""},
        {outcome(userNamed("mobile", device)), "501"},
        {outcome(userNamed("7", device)), "7"},
        {outcome(userNamed("root", device)), "the device has no account \"root\""},
    };
    for (const auto& [result, expected] : rows)
        EXPECT_EQ(result, expected);
}

TEST(Values, DictionariesAreReadInBothEncodingsAndFromStandardInput) {
    const auto directory = ost::test::makeScratchDirectory();
    const std::string file = directory / "file";
    ost::OSTValue deep = std::string("x");
    for (int level = 1; level < 63; ++level)
        deep = ost::OSTArray{deep};
    auto deeper = ost::OSTDictionary({{"k", ost::OSTArray{deep}}});
    const struct {
        std::string content, expected;
    } rows[] = {
        {"<plist version=\"1.0\"><dict><key>k</key><true/></dict></plist>", "{k = 1; }"},
        {ost::platform::serializeBinaryPropertyList(ost::OSTDictionary({{"k", ost::OSTData{"x"}}})), "{k = <78>; }"},
        {"<plist version=\"1.0\"><array/></plist>", file + " is no property-list dictionary"},
        {"", file + " is no property-list dictionary: "},
        {ost::platform::serializeBinaryPropertyList(deeper), file + " is no property-list dictionary: "},
        {std::string(5000, ' '), file + " is too large"},
    };
    for (const auto& [content, expected] : rows) {
        ost::test::writeFile(file, content);
        EXPECT_TRUE(outcome(dictionaryIn(file, 4096)).starts_with(expected)) << outcome(dictionaryIn(file, 4096));
    }
    EXPECT_NE(outcome(dictionaryIn(directory / "missing")).find("No such file"), std::string::npos);
    EXPECT_NE(outcome(dictionaryIn(directory)).find("Is a directory"), std::string::npos);

    ost::test::writeFile(file, rows[0].content);
    ASSERT_TRUE(std::freopen(file.c_str(), "r", stdin));
    EXPECT_EQ(outcome(dictionaryIn("-")), rows[0].expected);
}

} // namespace
