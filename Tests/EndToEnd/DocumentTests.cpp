#include "Support/ScratchDirectory.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <regex>
#include <sstream>

using namespace ost::test;

namespace {

const std::filesystem::path sources = OSTRAND_SOURCE_DIR;

/// What stands between a line "```LANGUAGE" and the next line "```", all such blocks one after the other.
std::string blocksOf(const std::string& document, const std::string& language) {
    const std::string begin = "\n```" + language + "\n", end = "\n```\n";
    std::string text;
    for (auto at = document.find(begin); at != document.npos; at = document.find(begin, at)) {
        const auto from = at + begin.size();
        at = document.find(end, from);
        text += document.substr(from, at + 1 - from);
    }
    return text;
}

/// A text without what differs from one run to the next: UUIDs and durations.
std::string withoutChance(const std::string& text) {
    static const std::regex uuid("[0-9A-Fa-f]{8}(-[0-9A-Fa-f]{4}){3}-[0-9A-Fa-f]{12}"), duration("[0-9]+\\.[0-9]{3} s");
    return std::regex_replace(std::regex_replace(text, uuid, "UUID"), duration, "0 s");
}

/// What documents show is done on a device, by programs that may do everything.
class DocumentTest : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (!IsSkipped())
            scratch = makeScratchDirectory();
    }

    /// Copies a program and signs the copy; gives its path.
    std::string signedCopy(const std::filesystem::path& program, const std::string& name) {
        const auto copy = scratch / name;
        std::filesystem::copy_file(std::filesystem::canonical(program), copy);
        std::filesystem::permissions(copy, std::filesystem::perms::owner_all);
        ChildProcess sign({builtProgram("ostrandctl"), "sign", copy, "--identifier", "com.example." + name,
                           "--entitlement", "com.tamarok.private.Ostrand.allowed"});
        EXPECT_EQ(sign.wait(), 0);
        return copy;
    }

    /// What a command of a shell prints, errors included.
    std::string shell(const std::string& command) {
        ChildProcess child({"/usr/bin/env", "-i", "PATH=" + scratch.string() + ":/usr/bin:/bin",
                            "OSTRAND_DEVICE=" + device().image().string(), "/bin/sh", "-c", "exec 2>&1; " + command});
        auto output = child.readAll();
        child.wait();
        return output;
    }

    std::filesystem::path scratch;
};

TEST_F(DocumentTest, TheTourOfTheFirstPageIsAsItShows) {
    signedCopy(builtProgram("ostrandctl"), "ostrandctl");
    shell("ostrandctl usage"); // the daemon's first line about its users goes elsewhere
    std::istringstream tour(blocksOf(readFile(sources / "README.md"), "console"));
    std::string shown, done;
    for (std::string line; std::getline(tour, line);) {
        shown += line + "\n";
        if (line.starts_with("$ "))
            done += line + "\n" + shell(line.substr(2));
    }
    EXPECT_NE(shown, "");
    EXPECT_EQ(withoutChance(done), withoutChance(shown));
}

TEST_F(DocumentTest, TheClientInPythonDoesWhatItsPageSays) {
    if (std::system("/usr/bin/python3 -c 'import cbor2' 2>/dev/null") != 0)
        GTEST_SKIP() << "needs python3-cbor2";
    const auto python = signedCopy("/usr/bin/python3", "python");
    const auto page = readFile(sources / "docs/python.md");
    const auto program = blocksOf(page, "python");
    writeFile(scratch / "wire.py", program);
    EXPECT_LE(std::ranges::count(program, '\n'), 60);
    EXPECT_EQ(withoutChance(shell("python " + (scratch / "wire.py").string())), withoutChance(blocksOf(page, "text")));
}

TEST_F(DocumentTest, TheExampleOfTheLibraryIsServedByEveryDaemon) {
    ChildProcess client({signedCopy(builtProgram("client-example"), "example"), device().image()});
    EXPECT_EQ(client.readLine(), "start 1 of com.example.example");
    const auto listed = client.readLine();
    EXPECT_TRUE(listed.ends_with("  com.example.example")) << listed;
    device().killDaemon();
    client.closeInput();
    EXPECT_EQ(client.readLine(), listed) << "the connection was lost, and nobody noticed";
    EXPECT_EQ(client.wait(), 0);
}

} // namespace
