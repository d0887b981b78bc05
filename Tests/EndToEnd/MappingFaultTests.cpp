#include "Client/CodeSigning.h"

#include "EndToEnd/GatedDevice.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "files/OSTDictionaryFile.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <set>
#include <string>

using namespace ost::test;
using ost::OSTArray;
using ost::OSTDictionary;
using ostrand::Connection;

namespace {

constexpr const char* mappingFile = "/private/var/root/Library/Ostrand/ost_code_signing_info.plist";

OSTDictionary infoOf(const std::string& identifier) {
    const OSTDictionary entitlements({{"com.tamarok.security.application-groups", OSTArray{"group." + identifier}}});
    return OSTDictionary({{"com.tamarok.Ostrand.Entitlements", entitlements}});
}

std::string words(const ostrand::Result<void>& answer) {
    return answer                                         ? "done"
           : answer.error() == ostrand::Error::refused()  ? "refused"
           : answer.error() == ostrand::Error::failed(59) ? "not written"
                                                          : answer.error().description();
}

/// What a reader that is not ours finds in the mapping file: a line for each identifier, with the class of its data
/// container. Ours, where the host has no other.
std::string independentlyRead(const std::filesystem::path& file) {
    const auto scratch = makeScratchDirectory();
    ChildProcess python({"sh", "-c", R"(command -v python3 >/dev/null || { echo none; exit; }
        exec python3 -c 'import plistlib, sys
for k, v in sorted(plistlib.load(open(sys.argv[1], "rb")).items()): print(k, v["DataContainerClass"])' "$0")",
                         file},
                        scratch / "errors");
    auto text = python.readAll();
    if (python.wait() != 0)
        return "unreadable: " + readFile(scratch / "errors");
    if (text != "none\n")
        return text;
    text.clear();
    const auto read = ost::OST_dictionaryWithContentsOfURL(file.native(), 1U << 24U);
    if (!read)
        return "unreadable";
    for (const auto& [identifier, value] : *read)
        text += identifier + " " + value.asDictionary()->find("DataContainerClass")->description() + "\n";
    return text;
}

/// A daemon whose file-system calls fail or kill it while it rewrites the mapping file.
class MappingFaultTest : public GatedDeviceTest {
protected:
    void SetUp() override {
        GatedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        auto connection = device().connect();
        for (int other = 10; other < 50; ++other)
            ASSERT_TRUE(registerClass(connection, "com.example." + std::to_string(other), 9));
        ASSERT_TRUE(registerClass(connection, "com.example.changing", 0));
    }

    static ostrand::Result<void> registerClass(Connection& connection, const std::string& identifier,
                                               std::uint64_t dataContainerClass) {
        return ostrand::registerCodeSigning(
            connection, {identifier, infoOf(identifier),
                         ostrand::RegistrationOptions{.dataContainerClass = dataContainerClass}.dictionary()});
    }

    [[nodiscard]] std::string onDisk() { return independentlyRead(device().onHost(mappingFile)); }
    /// The file with another class for the identifier that changes.
    static std::string changed(const std::string& file, std::uint64_t from, std::uint64_t to) {
        const auto line = [](std::uint64_t number) { return "com.example.changing " + std::to_string(number) + "\n"; };
        const auto at = file.find(line(from));
        EXPECT_NE(std::string::npos, at) << file;
        return at == std::string::npos ? "" : std::string(file).replace(at, line(from).size(), line(to));
    }
};

TEST_F(MappingFaultTest, AKillAtAnyMomentLeavesTheOldFileOrTheNew) {
    std::set<bool> isNew;
    std::uint64_t current = 0;
    for (unsigned call = 1;; ++call) {
        const auto oldFile = onDisk(), newFile = changed(oldFile, current, current + 1);
        auto connection = device().connect();
        ASSERT_TRUE(ostrand::codeSigningInfo(connection, "com.example.changing"));
        device().daemon().prepare({.kind = Fault::Kind::kill, .call = call});
        const auto answer = registerClass(connection, "com.example.changing", current + 1);
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("killed at call " + std::to_string(call) + ", " + course.faultedCall);
        if (course.faultedCall.empty()) {
            EXPECT_TRUE(answer);
            EXPECT_EQ(newFile, onDisk());
            break;
        }
        const auto file = onDisk();
        ASSERT_TRUE(file == oldFile || file == newFile) << file;
        EXPECT_TRUE(!answer || file == newFile) << "what was answered has reached the disk";
        isNew.insert(file == newFile);
        current += file == newFile ? 1 : 0;

        device().startDaemon();
        auto again = device().connect();
        ASSERT_TRUE(registerClass(again, "com.example.after", call));
        ASSERT_TRUE(ostrand::removeCodeSigning(again, "com.example.after"));
        EXPECT_EQ(file, onDisk()) << "the next daemon goes on with what is there";
    }
    EXPECT_EQ((std::set{false, true}), isNew);
}

TEST_F(MappingFaultTest, ACallThatFailsIsAnsweredTrulyAndMadeGoodByTheNext) {
    std::set<std::string> answers;
    std::uint64_t current = 0;
    for (unsigned call = 1;; ++call) {
        const auto oldFile = onDisk(), newFile = changed(oldFile, current, current + 1);
        auto connection = device().connect();
        ASSERT_TRUE(ostrand::codeSigningInfo(connection, "com.example.changing"));
        device().daemon().prepare({.kind = Fault::Kind::fail, .call = call, .error = ENOSPC});
        const auto answer = words(registerClass(connection, "com.example.changing", current + 1));
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("no space at call " + std::to_string(call) + ", " + course.faultedCall);
        const auto file = onDisk();
        EXPECT_TRUE(file == newFile || (file == oldFile && answer != "done")) << answer << "\n" << file;
        answers.insert(answer);

        auto again = device().connect();
        ASSERT_TRUE(registerClass(again, "com.example.after", call));
        ASSERT_TRUE(ostrand::removeCodeSigning(again, "com.example.after"));
        EXPECT_EQ(answer == "refused" ? oldFile : newFile, onDisk());
        current += answer == "refused" ? 0 : 1;
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
    EXPECT_TRUE(answers.contains("not written"));
    answers.erase("refused");
    EXPECT_EQ((std::set<std::string>{"done", "not written"}), answers);
}

} // namespace
