#include "Client/ctl/Commands.h"
#include "Client/ctl/Completion.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

using namespace ostrand::ctl;

namespace {

TEST(Completion, ComesFromTheTableAndTheDevice) {
    const auto device = ost::test::makeScratchDirectory();
    std::filesystem::create_directory(device / "etc");
    std::ofstream(device / "etc/passwd") << "mobile:x:501:501::/:/bin/sh\n$(x):x:502:502::/:/bin/sh\n";
    const std::string directory = device.string();
    const struct {
        std::vector<std::string_view> words;
        std::string candidates;
    } rows[] = {
        {{"cre"}, "create "},
        {{"device", ""}, "lock state unlock "},
        {{"device", "un"}, "unlock "},
        {{"help", "device", "un"}, "unlock "},
        {{"--device", directory, "codesign", "re"}, "register remove "},
        {{"create", "--cl"}, "--class "},
        {{"create", "--class", "data/"}, ""},
        {{"create", "--class", "Data/V"}, "Data/VPNPlugin Data/VexelService "},
        {{"create", "--class=Data/V"}, "--class=Data/VPNPlugin --class=Data/VexelService "},
        {{"create", "--class", "=", "Data/V"}, "Data/VPNPlugin Data/VexelService "},
        {{"create", "--class", "=", "Data/System", "--tr"}, "--transient "},
        {{"create", "--class", "2", "--c"}, ""},
        {{"--device", directory, "list", "--user", ""}, "mobile "},
        {{"watch", "--level", "n"}, "notice "},
        {{"sign", ""}, ":files "},
        {{"--device", ""}, ":directories "},
        {{"run", "--", ""}, ":programs "},
        {{"run", "--", "sh", "-"}, ":files "},
        {{"purge", ""}, ""},
        {{"nonsense", ""}, ""},
        {{}, ""},
    };
    for (const auto& [words, candidates] : rows) {
        std::string line;
        for (const auto& candidate : completions(commandTable(), words))
            line += candidate + " ";
        EXPECT_EQ(line, candidates) << (words.empty() ? "" : words.back());
    }
}

} // namespace
