#include "Client/ctl/Commands.h"
#include "Client/ctl/Hints.h"
#include "Client/ctl/JSON.h"
#include "Client/ctl/Suggestion.h"
#include "Client/ctl/Values.h"

#include "Protocol/OSTErrorCode.h"

#include <gtest/gtest.h>

using namespace ostrand;
using namespace ostrand::ctl;

namespace {

TEST(DidYouMean, NamesWhatIsNearOrTheOnlyOneThatContainsTheWord) {
    const std::string candidates[] = {"create", "delete", "device lock", "device unlock", "Shared/AppGroup"};
    const struct {
        std::string word, meant;
    } rows[] = {
        {"creat", "create"},
        {"crate", "create"},
        {"cretae", "create"},
        {"DELTE", "delete"},
        {"group", "Shared/AppGroup"},
        {"device lokc", "device lock"},
        {"device", ""},
        {"", ""},
        {"x", ""},
        {"cccccc", ""},
        {std::string(100000, 'c'), ""},
    };
    for (const auto& [word, meant] : rows)
        EXPECT_EQ(didYouMean(word, candidates), meant.empty() ? "" : "; did you mean \"" + meant + "\"?") << word;
    EXPECT_EQ(classNamed("data/aplication").error().message,
              "no container class is called \"data/aplication\"; did you mean \"Data/Application\"?");
}

TEST(Hints, SayOfEveryErrorWhatCanBeDone) {
    for (std::uint64_t code = 0; code < 4096; ++code)
        EXPECT_EQ(hintFor(Error::failed(code)).empty(), code == 1) << code;
    EXPECT_NE(hintFor(Error::failed(55)).find("com.tamarok.security.system-container"), std::string_view::npos);
    EXPECT_NE(hintFor(Error::transport(ENOENT)).find("--device"), std::string_view::npos);
    EXPECT_NE(hintFor(Error::refused()).find("ostrandctl sign"), std::string_view::npos);
}

TEST(CommandTable, SaysOfEveryCommandWhatItsJSONLooksLike) {
    for (const auto& command : commandTable().commands) {
        const auto form = parseJSON(command.json);
        EXPECT_TRUE(form && form->asDictionary()) << command.name << ": " << command.json;
    }
}

} // namespace
