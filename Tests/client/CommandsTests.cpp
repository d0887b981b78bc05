#include "Client/ctl/Commands.h"
#include "platform/device/CodeSignature.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sys/stat.h>
#include <unistd.h>

using namespace ostrand::ctl;

namespace {

Outcome run(const std::vector<std::string_view>& words) {
    const auto parsed = parseCommandLine(commandTable(), words);
    if (const auto* const error = std::get_if<UsageError>(&parsed))
        return std::unexpected(Failure::usage(error->message));
    const auto& invocation = std::get<Invocation>(parsed);
    return invocation.command->run(invocation.arguments);
}

/// The signature of a file in words; empty when it has none that counts.
std::string signatureOf(const std::string& file) {
    std::vector<char> buffer(ost::platform::maximumCodeSignature);
    const auto program = ost::platform::openProgram(file);
    const auto identity =
        ost::platform::parseCodeSignature(ost::platform::readCodeSignature(program->get(), buffer).value().bytes);
    return identity.identifier.value_or("") + (identity.entitlements ? identity.entitlements->description() : "");
}

TEST(SignCommand, SignsWhatCountsAndGivesNoPrivateRightsToOthers) {
    if (geteuid() != 0)
        GTEST_SKIP() << "only root may sign";
    const auto directory = ost::test::makeScratchDirectory();
    const std::string file = directory / "program", list = directory / "list";
    std::ofstream(list) << "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
                           "<key>com.tamarok.private.Ostrand.wipeContainer</key><array><string>a</string></array>"
                           "</dict></plist>";
    const std::string_view allowed = "com.tamarok.private.Ostrand.allowed";
    const struct {
        mode_t mode;
        uid_t owner;
        std::vector<std::string_view> words;
        std::string outcome;
    } rows[] = {
        {0755, 0, {"--identifier", "com.a"}, "com.a"},
        {0755, 0, {"--entitlement", "x", "--entitlement", "y"}, "{x = 1; y = 1; }"},
        {0750,
         0,
         {"--identifier", "com.a", "--entitlement", allowed},
         "com.a{com.tamarok.private.Ostrand.allowed = 1; }"},
        {0754, 0, {"--entitlements", list}, "{com.tamarok.private.Ostrand.wipeContainer = (a); }"},
        {0751, 0, {"--force", "--entitlement", allowed}, "{com.tamarok.private.Ostrand.allowed = 1; }"},
        {0701, 0, {"--entitlement", allowed}, "others may execute it"},
        {0701, 0, {"--entitlements", list}, "others may execute it"},
        {0770, 0, {"--force", "--identifier", "com.a"}, "group or others may write it"},
        {0702, 0, {"--force", "--identifier", "com.a"}, "group or others may write it"},
        {0755, 5, {"--force", "--identifier", "com.a"}, "its owner is not root"},
        {0755, 0, {"--entitlements", file}, "is no property-list dictionary"},
        {0755, 0, {}, "neither an identifier nor entitlements"},
    };
    for (const auto& [mode, owner, words, outcome] : rows) {
        std::filesystem::remove(file);
        std::ofstream(file) << "a program";
        ASSERT_EQ(chown(file.c_str(), owner, 0), 0);
        ASSERT_EQ(chmod(file.c_str(), mode), 0);
        std::vector<std::string_view> all{"sign", file};
        all.insert(all.end(), words.begin(), words.end());
        const auto result = run(all);
        if (result) {
            EXPECT_EQ(signatureOf(file), outcome);
            continue;
        }
        EXPECT_NE(result.error().message.find(outcome), std::string::npos) << result.error().message;
        ASSERT_EQ(chown(file.c_str(), 0, 0), 0);
        ASSERT_EQ(chmod(file.c_str(), 0700), 0);
        EXPECT_EQ(signatureOf(file), "") << "a refusal must leave the file alone";
    }
    std::filesystem::create_symlink(file, directory / "link");
    const auto link = run({"sign", (directory / "link").native(), "--identifier", "com.a"});
    ASSERT_FALSE(link);
    EXPECT_TRUE(link.error().message.ends_with("is no regular file")) << link.error().message;
}

TEST(DeviceCommands, SetAndShowTheLockStateOfTheDeviceThatIsNamed) {
    const std::string device = ost::test::makeScratchDirectory();
    const auto state = [&](std::string_view word) {
        const auto result = run({"device", word, "--device", device});
        return result ? result->text : result.error().message;
    };
    EXPECT_EQ(state("lock"), "cannot write the lock state of " + device + ": No such file or directory");
    std::filesystem::create_directories(device + "/private/var/run");
    EXPECT_EQ(state("state"), "unlocked\n");
    EXPECT_EQ(state("lock"), "locked\n");
    EXPECT_EQ(state("state"), "locked\n");
    EXPECT_EQ(state("unlock"), "unlocked\n");
    EXPECT_EQ(state("state"), "unlocked\n");
}

} // namespace
