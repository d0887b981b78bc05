#include "JSONForm.h"
#include "Support/ScratchDirectory.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <algorithm>

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
                                     "--entitlement", "com.tamarok.private.Ostrand.allowed", "--entitlement",
                                     "com.tamarok.private.Ostrand.dataMigration"});
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
        if (result.status == 0 && std::ranges::find(words, "--json") != words.end()) {
            words.erase(words.begin());
            EXPECT_EQ(faultOfJSON(words, result.output), "") << result.output;
        }
        return result;
    }

    const std::filesystem::path scratch = makeScratchDirectory();
    const std::string signedProgram = scratch / "signed", unsignedProgram = scratch / "unsigned";
    std::optional<ScratchDevice> device;
};

/// What stands behind a word at the beginning of a line.
std::string field(const std::string& output, const std::string& name) {
    const auto at = ("\n" + output).find("\n" + name + " ");
    const auto begin = at == std::string::npos ? at : output.find_first_not_of(' ', at + name.size());
    return begin == std::string::npos ? "" : output.substr(begin, output.find('\n', begin) - begin);
}

TEST_F(CommandLine, CreatesFindsAndListsContainers) {
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

TEST_F(CommandLine, DeletesStagesDestroysAndReplacesContainers) {
    const auto make = [&](const std::string& identifier, bool transient = false) {
        auto words = std::vector<std::string>{"create", "--class", "2", identifier};
        if (transient)
            words.emplace_back("--transient");
        return ostrandctl(words).output;
    };
    const auto pathOf = [&](const std::string& made) { return device->onHost(field(made, "path")); };
    const auto b = make("com.example.b"), c = make("com.example.c");
    make("com.example.a");
    EXPECT_EQ(ostrandctl({"delete", "--class", "2", "com.example.a"}).output, "deleted com.example.a\n");
    EXPECT_EQ(ostrandctl({"delete", "--class", "2", "com.example.a"}).status, 1) << "it is gone";
    make("com.example.a", true);
    EXPECT_EQ(ostrandctl({"delete", "--class", "2", "--transient", "--json", "com.example.a"}).output,
              "{\"deleted\": \"com.example.a\"}\n");

    const auto missing = ostrandctl({"stage", "--class", "2", "com.example.b", "com.example.none"});
    EXPECT_NE(missing.errors.find("error 21: no such container: com.example.none"), std::string::npos)
        << missing.errors;
    EXPECT_TRUE(std::filesystem::exists(pathOf(b))) << "all or none";
    EXPECT_EQ(ostrandctl({"stage", "--class", "2", "com.example.b", "com.example.c"}).output,
              "staged " + field(b, "uuid") + "  com.example.b\nstaged " + field(c, "uuid") + "  com.example.c\n");

    const auto old = make("com.example.old"), fresh = make("com.example.new", true);
    const std::vector<std::string> replace{"replace",         "--class",         "2",     "--new",
                                           "com.example.new", "--new-transient", "--old", "com.example.old"};
    EXPECT_EQ(ostrandctl(replace).output,
              "old  " + field(old, "uuid") + "  com.example.old\nnew  " + field(fresh, "uuid") + "  com.example.new\n");
    EXPECT_EQ(ostrandctl(replace).status, 1) << "neither is there any more";
    EXPECT_EQ(ostrandctl({"list", "--class", "2"}).output, field(fresh, "uuid") + "  com.example.new\n");
    const auto other = make("com.example.other", true);
    const auto placed = ostrandctl(
        {"replace", "--class", "2", "--new", "com.example.other", "--new-uuid", field(other, "uuid"), "--json"});
    EXPECT_EQ(placed.output,
              "{\"new\": {\"identifier\": \"com.example.other\", \"uuid\": \"" + field(other, "uuid") + "\"}}\n");
    EXPECT_EQ(ostrandctl({"list", "--class", "2", "--transient"}).output, "");

    const auto deathRow = device->onHost("/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead");
    EXPECT_FALSE(std::filesystem::is_empty(deathRow));
    const auto purged = ostrandctl({"purge"});
    EXPECT_TRUE(purged.output.starts_with("death row is empty after ")) << purged.output;
    EXPECT_EQ(purged.errors, "waiting until everything on death row is destroyed\n");
    EXPECT_TRUE(std::filesystem::is_empty(deathRow)) << "the reply comes when it is done";
    EXPECT_TRUE(ostrandctl({"purge", "--json"}).output.starts_with("{\"seconds\": "));
}

TEST_F(CommandLine, ShowsAndChangesWhatAContainerCarries) {
    const auto made = ostrandctl({"create", "--class", "2", "com.example.a"});
    const auto with = [](std::vector<std::string> words, const std::vector<std::string>& more = {}) {
        words.insert(words.end(), {"--class", "2", "com.example.a"});
        words.insert(words.end(), more.begin(), more.end());
        return words;
    };
    const auto file = scratch / "plist";
    writeFile(file, "<plist version=\"1.0\"><array><integer>-1</integer></array></plist>");
    const struct {
        std::vector<std::string> value;
        std::string shown;
    } rows[] = {
        {{R"({"a": [1, true, "\u00e4"]})"}, R"({"k": {"a": [1, true, "ä"]}})"},
        {{"--string", "1"}, R"({"k": "1"})"},
        {{"--integer", "-5"}, R"({"k": -5})"},
        {{"--boolean", "true"}, R"({"k": true})"},
        {{"--data", "00ff"}, R"({"k": "00ff"})"},
        {{"--date", "1970-01-01T00:00:10Z"}, R"({"k": 10})"},
        {{"--plist", file}, R"({"k": [-1]})"},
    };
    EXPECT_EQ(ostrandctl(with({"info", "list", "--json"})).output, "{}\n");
    for (const auto& [value, shown] : rows) {
        auto words = with({"info", "set"}, {"k"});
        words.insert(words.end(), value.begin(), value.end());
        const auto set = ostrandctl(words);
        EXPECT_EQ(set.status, 0) << set.errors;
        EXPECT_EQ(ostrandctl(with({"info", "get", "--json"}, {"k"})).output, shown + "\n");
    }
    EXPECT_EQ(ostrandctl(with({"info", "set"}, {"k"})).status, 2);
    EXPECT_EQ(ostrandctl(with({"info", "set", "--string", "x"}, {"k", "1"})).status, 2);
    EXPECT_EQ(ostrandctl(with({"info", "set"}, {"k", "null"})).status, 2);

    const auto shown = ostrandctl(with({"show"})).output;
    for (const auto* const name : {"identifier", "uuid", "path"})
        EXPECT_EQ(field(shown, name), field(made.output, name));
    EXPECT_EQ(field(shown, "protection"), "never set (counts as 3)");
    EXPECT_EQ(ostrandctl({"protect", "--class", "1", "com.example.a"}).output,
              "com.example.a has protection class 1\n");
    EXPECT_EQ(field(ostrandctl(with({"show"})).output, "protection"), "1");
    EXPECT_EQ(ostrandctl(with({"info", "remove"}, {"k"})).status, 0);
    EXPECT_EQ(ostrandctl(with({"info", "list"})).output, "com.tamarok.Tessaly.ContentProtectionClass 1\n");
    EXPECT_EQ(ostrandctl(with({"restore-structure"})).status, 0);
    const auto renamed = ostrandctl(with({"rename-directory"})).output;
    EXPECT_EQ(renamed.substr(renamed.find('\n') + 1), field(ostrandctl(with({"show"})).output, "path") + "\n");
}

TEST_F(CommandLine, MeasuresWipesMigratesAndChecks) {
    const auto made = ostrandctl({"create", "--class", "2", "com.example.a"});
    const auto container = device->onHost(field(made.output, "path"));
    writeFile(container / "Documents/data", std::string(100'000, 'x'));
    EXPECT_TRUE(ostrandctl({"usage", "--json"}).output.starts_with("{\"bytes\": 1")) << "four of 4 KiB are in it";
    EXPECT_EQ(ostrandctl({"wipe", "--class", "2", "com.example.a"}).output, "wiped com.example.a\n");
    EXPECT_FALSE(std::filesystem::exists(container / "Documents/data"));
    EXPECT_EQ(field(ostrandctl({"lookup", "--class", "2", "com.example.a"}).output, "uuid"),
              field(made.output, "uuid"));
    EXPECT_EQ(ostrandctl({"migrate"}).status, 0);

    EXPECT_EQ(ostrandctl({"check"}).output, "1 containers, 0 findings\n");
    std::filesystem::create_directory(container.parent_path() / "planted");
    std::filesystem::create_directory_symlink("/nowhere", container.parent_path() / "link");
    std::filesystem::remove(device->onHost("/private/var/db/sandbox-state/501/1/com.example.a"));
    const auto checked = ostrandctl({"check", "--json"});
    EXPECT_EQ(checked.status, 1);
    for (const auto& name : {std::string("planted"), std::string("link"), container.filename().string()})
        EXPECT_NE(checked.output.find("/" + name + "\""), std::string::npos) << checked.output;
    EXPECT_EQ(run(unsignedProgram, {"check"}).status, 2) << "nothing is found by whom the daemon refuses";
}

TEST_F(CommandLine, DryRunsSayWhatWouldGoAndLeaveItAndTheLogIsShownByLevel) {
    const auto made = ostrandctl({"create", "--class", "2", "com.example.a"});
    const auto path = field(made.output, "path"), uuid = field(made.output, "uuid");
    const std::string size = "   4.0 KiB  "; // the metadata file
    const auto wouldDelete =
        size + uuid + "  com.example.a  " + path + "\n" + size + "in 1 container would be deleted\n";
    for (const auto* const verb : {"delete", "stage"}) {
        EXPECT_EQ(ostrandctl({verb, "--class", "2", "com.example.a", "--dry-run"}).output, wouldDelete);
        ostrandctl({verb, "--class", "2", "com.example.a", "--dry-run", "--json"});
        EXPECT_TRUE(std::filesystem::exists(device->onHost(path)));
    }
    ostrandctl({"delete", "--class", "2", "com.example.a"});
    for (int i = 0; i < 2; ++i) {
        const auto wouldDestroy = ostrandctl({"purge", "--dry-run"}).output;
        EXPECT_NE(wouldDestroy.find("  com.example.a\n" + size + "in 1 item would be destroyed\n"), std::string::npos)
            << wouldDestroy;
    }
    ostrandctl({"purge", "--dry-run", "--json"});

    EXPECT_NE(ostrandctl({"watch", "--once"}).output.find("<Notice>"), std::string::npos);
    EXPECT_EQ(ostrandctl({"watch", "--once", "--level", "error"}).output.find("<Notice>"), std::string::npos);
    const auto last = ostrandctl({"watch", "--once", "--json", "--lines", "1"}).output;
    EXPECT_EQ(std::ranges::count(last, '\n'), 1) << last;
}

TEST_F(CommandLine, SaysHowARequestFailedAndLeavesTheDeviceAlone) {
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
        {signedProgram, {"delete", "--class", "2"}, 2, "no identifier given"},
        {signedProgram, {"replace", "--class", "2", "--new", "a", "--new-uuid", "x"}, 2, "\"x\" is no UUID"},
        {signedProgram, {"replace", "--class", "2", "--new", "a", "--old-uuid", "x"}, 2, "--old-uuid needs --old"},
        {signedProgram, {"protect", "--class", "2", "com.example.b"}, 1, "error 21: no such container"},
        {signedProgram, {"protect", "--class", "x", "com.example.b"}, 2, "\"x\" is no protection class"},
        {signedProgram, {"protect", "--class", "5", "com.example.b"}, 2, "\"5\" is no protection class"},
        {signedProgram,
         {"codesign", "show", "com.example.b"},
         1,
         "error 21: nothing that counts is registered for com"},
        {unsignedProgram, {"purge"}, 1, "the daemon refused the request"},
        {signedProgram, {"stage", "--class", "2", "com.exmaple.ctl"}, 1, "; did you mean \"com.example.ctl\"?\nhint: "},
        {signedProgram,
         {"codesign", "register", "b", "--info", "-"},
         1,
         "standard input is no property-list dictionary"},
        {signedProgram, {"create", "com.example.b"}, 2, "missing --class C\nusage: ostrandctl "},
    };
    ostrandctl({"create", "--class", "2"});
    for (const auto& [program, words, status, complaint] : rows) {
        const auto result = run(program, words);
        EXPECT_EQ(result.status, status) << complaint;
        EXPECT_EQ(result.output, "") << complaint;
        EXPECT_NE(result.errors.find(complaint), std::string::npos) << result.errors;
    }
    const auto left = ostrandctl({"list", "--class", "2"}).output;
    EXPECT_TRUE(left.ends_with("  com.example.ctl\n") && std::ranges::count(left, '\n') == 1) << left;
}

} // namespace
