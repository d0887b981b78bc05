#include "support/BootedDevice.h"
#include "support/DeviceTest.h"
#include "support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <unistd.h>

using namespace ost::test;

namespace {

/// How a run of the program ended, and what it said.
struct RunResult {
    int status;
    std::string output, errors;
};

/// A booted device and two copies of the program: one signed with full access, one unsigned.
class CommandLine : public testing::Test {
protected:
    void SetUp() override {
        if (geteuid() != 0)
            GTEST_SKIP() << "needs root";
        device.emplace();
        for (const auto& copy : {signedProgram, unsignedProgram})
            std::filesystem::copy_file(builtProgram("ostrandctl"), copy);
        const auto run = ostrandctl({"sign", signedProgram, "--identifier", "com.example.ctl", "--force",
                                     "--entitlement", "com.tamarok.private.Ostrand.allowed"});
        ASSERT_EQ(run.status, 0) << run.errors;
    }

    RunResult ostrandctl(std::vector<std::string> words) { return run(signedProgram, std::move(words)); }
    RunResult run(const std::string& program, std::vector<std::string> words) {
        words.insert(words.begin(), {program, "--device", device->image()});
        const auto errors = scratch / "errors";
        std::filesystem::remove(errors);
        ChildProcess child(words, errors);
        child.closeInput();
        RunResult result{};
        for (auto line = child.readLine(); !line.empty(); line = child.readLine())
            result.output += line + "\n";
        result.status = child.wait();
        result.errors = readFile(errors);
        return result;
    }

    const std::filesystem::path scratch = makeScratchDirectory();
    const std::string signedProgram = scratch / "signed", unsignedProgram = scratch / "unsigned";
    std::optional<BootedDevice> device;
};

/// What stands behind a word at the beginning of a line.
std::string field(const std::string& output, const std::string& name) {
    const auto at = ("\n" + output).find("\n" + name + " ");
    const auto begin = at == std::string::npos ? at : output.find_first_not_of(' ', at + name.size());
    return begin == std::string::npos ? "" : output.substr(begin, output.find('\n', begin) - begin);
}

TEST_F(CommandLine, createsFindsAndListsContainers) {
    const auto created = ostrandctl({"create", "--class", "data/application", "com.example.a"});
    ASSERT_EQ(created.status, 0) << created.errors;
    const auto uuid = field(created.output, "uuid"), path = field(created.output, "path");
    EXPECT_EQ(field(created.output, "state"), "created");
    EXPECT_TRUE(std::filesystem::is_directory(device->onHost(path))) << path;

    const auto found =
        ostrandctl({"lookup", "--class=2", "--user", "mobile", "--identifier", "com.example.a", "--json"});
    EXPECT_EQ(found.output, R"({"existed": true, "identifier": "com.example.a", "path": ")" + path + R"(", "uuid": ")" +
                                uuid + "\"}\n");
    EXPECT_EQ(ostrandctl({"list", "--class", "2"}).output, uuid + "  com.example.a\n");
    EXPECT_EQ(ostrandctl({"list", "--class", "2", "--transient"}).output, "");
    EXPECT_EQ(field(ostrandctl({"create", "--class", "2"}).output, "identifier"), "com.example.ctl")
        << "without an identifier the program asks for its own container";
}

TEST_F(CommandLine, saysHowARequestFailedAndLeavesTheDeviceAlone) {
    const struct {
        std::string program;
        std::vector<std::string> words;
        int status;
        std::string complaint;
    } rows[] = {
        {signedProgram, {"lookup", "--class", "2", "com.example.b"}, 1, "error 21: no such container"},
        {signedProgram, {"create", "--class", "2", "--user", "400", "com.example.b"}, 1, "error 38: invalid parameter"},
        {signedProgram, {"create", "--class", "14", "com.example.b"}, 1, "error 11: "},
        {signedProgram, {"create", "--class", "2", "com.\x80"}, 1, "the daemon refused the request"},
        {unsignedProgram, {"create", "--class", "2", "com.example.b"}, 1, "the daemon refused the request"},
        {unsignedProgram, {"list", "--class", "2"}, 1, "the daemon refused the request"},
        {signedProgram, {"create", "--class", "2", "--user", "nobody-here", "com.example.b"}, 2, "has no account"},
        {signedProgram, {"create", "com.example.b"}, 2, "missing --class C\nusage: ostrandctl "},
    };
    for (const auto& [program, words, status, complaint] : rows) {
        const auto result = run(program, words);
        EXPECT_EQ(result.status, status) << complaint;
        EXPECT_EQ(result.output, "") << complaint;
        EXPECT_NE(result.errors.find(complaint), std::string::npos) << result.errors;
    }
    EXPECT_EQ(ostrandctl({"list", "--class", "2"}).output, "");
}

} // namespace
