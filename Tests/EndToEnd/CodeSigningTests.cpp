#include "Client/CodeSigning.h"

#include "Client/Containers.h"
#include "EndToEnd/Wire.h"
#include "Support/ScratchDirectory.h"
#include "files/OSTDictionaryFile.h"
#include "platform/codec/PropertyList.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

using namespace ost::test;
using ost::OSTArray;
using ost::OSTDictionary;
using ostrand::Connection;
using ostrand::ContainerClass;

namespace {

constexpr const char* entitlementsKey = "com.tamarok.Ostrand.Entitlements";
constexpr const char* appGroupsKey = "com.tamarok.security.application-groups";
constexpr const char* systemGroupsKey = "com.tamarok.security.system-groups";
constexpr const char* systemContainerKey = "com.tamarok.security.system-container";

constexpr const char* mappingFile = "/private/var/root/Library/Ostrand/ost_code_signing_info.plist";
constexpr const char* appGroupDirectory = "/private/var/mobile/Containers/Shared/AppGroup";

/// A client that waits longer has met a deadlock.
constexpr std::chrono::seconds patience{60};

constexpr std::uint64_t mobile = 501;

OSTArray strings(const std::vector<std::string>& values) { return OSTArray(values.begin(), values.end()); }

OSTDictionary infoWith(OSTDictionary entitlements) {
    return OSTDictionary({{entitlementsKey, std::move(entitlements)}});
}

OSTDictionary inGroups(const std::vector<std::string>& groups) {
    return infoWith(OSTDictionary({{appGroupsKey, strings(groups)}}));
}

Connection connect(const wire::Client& client) { return Connection(client.connect().release(), patience); }

// What came of a request, in words; of a path the directory that it is in.

std::string words(const ostrand::Error& error) {
    return error.kind == ostrand::Error::Kind::failed ? "error " + std::to_string(error.code)
           : error == ostrand::Error::refused()       ? "refused"
                                                      : error.description();
}

std::string words(const std::string& path) { return std::filesystem::path(path).parent_path(); }

std::string words(const ostrand::GroupPaths& paths) {
    std::string text;
    for (const auto& [group, path] : paths)
        text += group + " in " + words(path) + " ";
    return text;
}

std::string words(const std::vector<std::string>& identifiers) { return testing::PrintToString(identifiers); }
std::string words(const OSTDictionary& info) { return info.description(); }

template<typename T>
std::string words(const ostrand::Result<T>& result) {
    if (!result)
        return words(result.error());
    if constexpr (std::is_void_v<T>)
        return "done";
    else
        return words(*result);
}

using CodeSigningTest = BootedDeviceTest;

TEST_F(CodeSigningTest, AClientGetsWhatItsIdentityAndItsUserGive) {
    const wire::Identity app{.identifier = "com.example.App",
                             .entitlements =
                                 OSTDictionary({{appGroupsKey, strings({"group.app"})},
                                                {systemGroupsKey, strings({"systemgroup.app", "without prefix"})},
                                                {systemContainerKey, true}}),
                             .user = mobile};
    const wire::Identity bare{.identifier = "com.example.Bare", .entitlements = OSTDictionary(), .user = mobile};
    auto otherUsers = app;
    otherUsers.user = mobile + 1;
    const wire::Identity noEntitlements{.identifier = "com.example.App", .user = mobile};

    const auto& socket = device().socket();
    const wire::Client installerClient(socket, wire::allowed()), appClient(socket, app), bareClient(socket, bare),
        otherUserClient(socket, otherUsers), unsignedClient(socket, noEntitlements);
    auto installer = connect(installerClient);
    ASSERT_TRUE(ostrand::registerCodeSigning(installer, {"com.example.Other", inGroups({"group.other"})}));

    const std::string inAppGroups = std::string(" in ") + appGroupDirectory + " ";
    const std::string inSystemGroups = "/private/var/containers/Shared/SystemGroup";
    const std::string inSystem = "/private/var/containers/Data/System";
    const auto groups = [](std::uint64_t user, const std::optional<std::string>& identifier = {}) {
        return
            [=](Connection& connection) { return words(ostrand::groupContainerPaths(connection, user, identifier)); };
    };
    const auto ids = [](std::uint64_t user, const std::optional<std::string>& identifier = {}) {
        return [=](Connection& connection) { return words(ostrand::groupIdentifiers(connection, user, identifier)); };
    };
    const auto system = [](const std::optional<std::string>& identifier = {}) {
        return [=](Connection& connection) { return words(ostrand::systemContainerPath(connection, identifier)); };
    };
    const auto systemGroups = [](const std::optional<std::string>& identifier = {}) {
        return
            [=](Connection& connection) { return words(ostrand::systemGroupContainerPaths(connection, identifier)); };
    };
    const auto systemGroup = [](const std::string& group, const std::optional<std::string>& identifier = {}) {
        return [=](Connection& connection) {
            return words(ostrand::systemGroupContainerPath(connection, group, identifier));
        };
    };
    const auto show = [](Connection& connection) {
        return words(ostrand::codeSigningInfo(connection, "com.example.App"));
    };
    const auto registers = [](Connection& connection) {
        return words(ostrand::registerCodeSigning(connection, {"com.example.App", inGroups({"group.other"})}));
    };
    const auto invalidates = [](Connection& connection) {
        return words(ostrand::invalidateCodeSigningWithoutBundle(connection));
    };
    const struct {
        const char* name;
        const wire::Client& client;
        std::function<std::string(Connection&)> request;
        std::string outcome;
    } rows[] = {
        {"own groups, of the current user", appClient, groups(ost::OSTCurrentUserPlaceholder),
         "group.app" + inAppGroups},
        {"own groups, by user id", appClient, groups(mobile), "group.app" + inAppGroups},
        {"groups of another identifier", appClient, groups(mobile, "com.example.Other"), "group.other" + inAppGroups},
        {"groups of nobody", appClient, groups(mobile, "com.example.Nobody"), ""},
        {"groups for another user", appClient, groups(mobile + 1), "error 38"},
        {"groups for the system user", installerClient, groups(499), "error 38"},
        {"mobile's groups, as another user", otherUserClient, groups(mobile), "error 38"},
        {"no entitlements to be in a group", bareClient, groups(mobile), ""},
        {"no entitlements dictionary", unsignedClient, groups(mobile), "refused"},

        {"group identifiers", installerClient, ids(mobile, "com.example.App"), R"({ "group.app" })"},
        {"group identifiers of nobody", installerClient, ids(ost::OSTCurrentUserPlaceholder, "com.example.Nobody"),
         "{}"},
        {"group identifiers for a bundle's user", installerClient, ids(33, "com.example.App"), "error 38"},
        {"group identifiers, not entitled", appClient, ids(mobile), "refused"},

        {"own system container", appClient, system(), inSystem},
        {"own system container, not entitled", bareClient, system(), "error 55"},
        {"another's system container", bareClient, system("com.example.Nobody"), "error 55"},
        {"another's system container, entitled", installerClient, system("com.example.Nobody"), inSystem},
        {"a well-known system container", bareClient, system("com.tamarok.pellord"), inSystem},
        {"nearly a well-known one", bareClient, system("com.tamarok.Pellord"), "error 55"},

        {"own system groups", appClient, systemGroups(), "systemgroup.app in " + inSystemGroups + " "},
        {"no system groups", bareClient, systemGroups(), ""},
        {"a system group that is granted", appClient, systemGroup("systemgroup.app"), inSystemGroups},
        {"one without the prefix", appClient, systemGroup("without prefix"), "error 55"},
        {"one that is not granted", bareClient, systemGroup("systemgroup.app"), "error 55"},
        {"one that the other identifier has not", appClient, systemGroup("systemgroup.app", "com.example.Bare"),
         "error 21"},
        {"a well-known one", bareClient, systemGroup("systemgroup.com.tamarok.marrowfell"), inSystemGroups},

        {"registering, not entitled", appClient, registers, "refused"},
        {"showing, not entitled", appClient, show, "refused"},
        {"invalidating, not entitled", appClient, invalidates, "refused"},
        {"what the client has registered itself", installerClient, show, infoWith(*app.entitlements).description()},
        {"invalidating", installerClient, invalidates, "done"},
        {"it stays valid without a bundle", installerClient, show, infoWith(*app.entitlements).description()},
    };
    for (const auto& row : rows) {
        auto connection = connect(row.client);
        EXPECT_EQ(row.outcome, row.request(connection)) << row.name;
    }
    EXPECT_EQ("error 21", words(ostrand::codeSigningInfo(installer, "com.example.Other"))) << "which has no bundle";
    EXPECT_TRUE(std::filesystem::exists(device().onHost(inSystem) / "com.tamarok.pellord"));
    EXPECT_TRUE(std::filesystem::exists(device().onHost(inSystemGroups) / "systemgroup.com.tamarok.marrowfell"));
}

TEST_F(CodeSigningTest, RequestsOfTheWrongShapeRemoveNothing) {
    const wire::Client installer(device().socket(), wire::allowed());
    auto registered = connect(installer);
    ASSERT_TRUE(ostrand::registerCodeSigning(registered, {"com.example.App", inGroups({"group.app"})}));
    const struct {
        const char* name;
        wire::Entries entries;
        std::uint64_t error;
    } rows[] = {
        {"information of another type",
         {{"Identifier", wire::text("com.example.App")}, {"CodeSigningInfo", wire::text("x")}},
         38},
        {"a number below all signed ones",
         {{"Identifier", wire::text("com.example.App")},
          {"CodeSigningInfo", wire::map({{"n", '\x3b' + std::string(8, '\xff')}})}},
         38},
        {"options of another type",
         {{"Identifier", wire::text("com.example.App")},
          {"CodeSigningInfo", wire::map({})},
          {"OptionsDictionary", wire::number(1)}},
         38},
        {"no identifier", {{"CodeSigningInfo", wire::map({})}}, 18},
        {"an identifier of another type", {{"Identifier", wire::number(1)}, {"CodeSigningInfo", wire::map({})}}, 18},
        {"nothing at all", {}, 18},
    };
    auto connection = installer.connect();
    const auto before = readFile(device().onHost(mappingFile));
    for (const auto& row : rows) {
        auto entries = row.entries;
        entries.emplace_back("Command", wire::number(18));
        const auto reply = connection.call(wire::request(7, entries));
        EXPECT_EQ(row.error, reply.error()) << row.name;
        EXPECT_EQ("ReplyError", reply.keys()) << row.name;
    }
    for (const auto* const key : {"CodeSigningInfo", "Nothing"}) {
        const auto reply = connection.call(wire::request(8, {{"Command", wire::number(19)}, {key, wire::map({})}}));
        EXPECT_EQ(21U, reply.error()) << "the identifier has no default";
    }
    EXPECT_EQ(before, readFile(device().onHost(mappingFile)));
}

TEST_F(CodeSigningTest, TheProgramRegistersShowsAndRemoves) {
    const auto scratch = makeScratchDirectory();
    const std::string xml = scratch / "info.xml", binary = scratch / "info.binary", options = scratch / "options";
    writeFile(xml, R"(<?xml version="1.0"?><plist version="1.0"><dict>
        <key>com.tamarok.Ostrand.Entitlements</key><dict>
            <key>com.tamarok.security.application-groups</key><array><string>group.a</string><string>b"
</string></array>
            <key>com.tamarok.security.system-container</key><true/></dict>
        <key>Empty</key><array/>
        <key>Hash</key><data>AP8=</data>
        <key>Made</key><date>2026-11-22T19:46:01Z</date>
        <key>Version</key><integer>-3</integer></dict></plist>)");
    const auto info = ost::OST_dictionaryWithContentsOfURL(xml, 4096).value();
    writeFile(binary, ost::platform::serializeBinaryPropertyList(info));
    writeFile(options, ost::platform::serializeBinaryPropertyList(
                           OSTDictionary({{"com.tamarok.Ostrand.PlaceholderEntitlements", true}})));

    const auto run = [&](std::vector<std::string> words) {
        const auto outcome = device().ostrandctl(std::move(words));
        return outcome.status == 0 ? outcome.output : "status " + std::to_string(outcome.status);
    };
    const std::string id = "com.example.App";
    EXPECT_EQ("status 1", run({"codesign", "show", id}));
    EXPECT_EQ("registered " + id + "\n",
              run({"codesign", "register", id, "--info", xml, "--class", "Data/Application"}));
    const std::string tree = R"(Empty []
Hash <00ff>
Made 2026-11-22T19:46:01Z
Version -3
com.tamarok.Ostrand.Entitlements
    com.tamarok.security.application-groups
        - "group.a"
        - "b\"\u000a"
    com.tamarok.security.system-container true
)";
    EXPECT_EQ(tree, run({"codesign", "show", id}));
    EXPECT_EQ("registered plug-in\n", run({"codesign", "register", "plug-in", "--info", binary, "--parent", id}));
    EXPECT_EQ(R"({"Empty": [], "Hash": "00ff", "Made": 1795376761, "Version": -3, )"
              R"("com.tamarok.Ostrand.Entitlements": {"com.tamarok.security.application-groups": ["group.a", )"
              R"("b\"\u000a"], "com.tamarok.security.system-container": true}})"
              "\n",
              run({"codesign", "show", "plug-in", "--json"}));

    const auto file = ost::OST_dictionaryWithContentsOfURL(device().onHost(mappingFile).native(), 1U << 20U).value();
    const auto* const entry = file.find(id)->asDictionary();
    EXPECT_EQ(ost::OSTValue(std::uint64_t{2}), *entry->find("DataContainerClass"));
    EXPECT_EQ(ost::OSTValue(strings({"plug-in"})), *entry->find("ChildBundleIds"));

    EXPECT_EQ("b\"\\n\ngroup.a\n", run({"groups", "ids", "--identifier", id, "--user", "mobile"}));
    EXPECT_NE(std::string::npos,
              run({"groups", "paths", "--identifier", id}).find(std::string("group.a  ") + appGroupDirectory));
    EXPECT_TRUE(run({"system", "path", "--identifier", id}).starts_with("/private/var/containers/Data/System/"));
    EXPECT_EQ("{\"paths\": {}}\n", run({"groups", "paths", "--system", "--json"}));
    EXPECT_EQ("/private/var/containers/Shared/SystemGroup/systemgroup.com.tamarok.marrowfell\n",
              run({"system", "path", "--group", "systemgroup.com.tamarok.marrowfell"}));

    EXPECT_EQ("registered " + id + "\n", run({"codesign", "register", id, "--info", xml, "--options", options}));
    EXPECT_EQ("status 1", run({"codesign", "show", id})) << "a placeholder does not count";
    EXPECT_EQ("removed plug-in\n", run({"codesign", "remove", "plug-in"}));
    EXPECT_EQ("status 1", run({"codesign", "show", "plug-in"}));

    const std::vector<std::string> refused[] = {
        {"codesign", "register", id},
        {"codesign", "register", id, "--info", xml, "--options", options, "--placeholder"},
        {"codesign", "register", id, "--info", "-", "--options", "-"},
        {"codesign", "register", id, "--info", xml, "--class", "Data/Nothing"},
        {"groups", "paths", "--system", "--user", "501"},
        {"codesign"},
        {"codesign", "sign"},
    };
    for (const auto& words : refused)
        EXPECT_EQ("status 2", run(words)) << testing::PrintToString(words);
    EXPECT_EQ("status 1", run({"codesign", "register", id, "--info", scratch / "missing"}));
}

/// Everybody at once, each on a connection of its own.
class BusyCodeSigningTest : public CodeSigningTest {
protected:
    void SetUp() override {
        CodeSigningTest::SetUp();
        if (IsSkipped())
            return;
        _installer.emplace(device().socket(), wire::allowed());
        _app.emplace(device().socket(), wire::Identity{.identifier = "com.example.App",
                                                       .entitlements = OSTDictionary(
                                                           {{appGroupsKey, strings({"group.shared", "group.app"})}}),
                                                       .user = mobile});
    }

    enum class As { installer, app };

    /// Runs the work many times. What it gives is what went wrong.
    void start(As who, std::function<std::string(Connection&, int)> work) {
        _threads.emplace_back([this, work = std::move(work), connection = _connect(who)]() mutable {
            for (int round = 0; round < rounds; ++round)
                if (const auto problem = work(connection, round); !problem.empty()) {
                    const std::lock_guard lock(_mutex);
                    ADD_FAILURE() << "round " << round << ": " << problem;
                    return;
                }
        });
    }
    void join() {
        for (auto& thread : _threads)
            thread.join();
        _threads.clear();
    }

    Connection connectAsInstaller() { return _connect(As::installer); }

    static constexpr int rounds = 100;

private:
    Connection _connect(As who) { return connect(who == As::installer ? *_installer : *_app); }

    std::optional<wire::Client> _installer, _app;
    std::mutex _mutex;
    std::vector<std::thread> _threads;
};

template<typename T>
std::string unless(const ostrand::Result<T>& result, const std::string& what) {
    return result ? "" : what + ": " + words(result.error());
}

TEST_F(BusyCodeSigningTest, RegistrationsGoOnWhileEverybodyElseIsAtWork) {
    const auto infoOfRound = [](int round) {
        return inGroups({round % 2 == 0 ? "group.shared" : "group.own", "group." + std::to_string(round)});
    };
    for (const std::string registrar : {"com.example.A", "com.example.B"})
        start(As::installer, [&, registrar](Connection& connection, int round) {
            if (round % 5 == 3)
                return unless(ostrand::removeCodeSigning(connection, registrar), "remove");
            return unless(ostrand::registerCodeSigning(connection, {registrar, infoOfRound(round)}), "register");
        });
    start(As::installer, [](Connection& connection, int round) {
        const std::string identifier = "com.example.Deleted." + std::to_string(round);
        const ostrand::ContainerRequest bundle{
            .containerClass = ContainerClass::bundleApplication, .user = 33, .identifier = identifier};
        if (auto made = ostrand::createOrLookup(connection, bundle, ostrand::WhenMissing::create); !made)
            return unless(made, "make a bundle");
        if (auto registered = ostrand::registerCodeSigning(connection, {identifier, inGroups({"group.shared"})});
            !registered)
            return unless(registered, "register what has a bundle");
        return unless(ostrand::deleteContainer(connection, bundle), "delete a bundle");
    });
    start(As::installer, [](Connection& connection, int round) {
        return unless(ostrand::createOrLookup(connection,
                                              {.containerClass = ContainerClass::dataApplication,
                                               .user = mobile,
                                               .identifier = "com.example.Data." + std::to_string(round % 7)},
                                              ostrand::WhenMissing::create),
                      "look up");
    });
    start(As::installer, [](Connection& connection, int /*round*/) {
        return unless(ostrand::groupIdentifiers(connection, mobile, "com.example.A"), "group identifiers");
    });
    start(As::installer, [](Connection& connection, int /*round*/) {
        return unless(ostrand::invalidateCodeSigningWithoutBundle(connection), "invalidate");
    });
    start(As::app, [](Connection& connection, int /*round*/) {
        const auto paths = ostrand::groupContainerPaths(connection, mobile);
        if (paths && paths->size() != 2)
            return "paths: " + words(*paths);
        return unless(paths, "paths");
    });
    join();

    auto connection = connectAsInstaller();
    const auto file = ost::OST_dictionaryWithContentsOfURL(device().onHost(mappingFile).native(), 1U << 20U).value();
    std::set<std::string> registered;
    for (const auto& [identifier, entry] : file)
        registered.insert(identifier);
    EXPECT_EQ((std::set<std::string>{"com.example.A", "com.example.App", "com.example.B", "com.example.allowed"}),
              registered);
    for (const auto* const identifier : {"com.example.A", "com.example.B"}) {
        const auto* const entry = file.find(identifier);
        ASSERT_TRUE(entry && entry->asDictionary());
        EXPECT_EQ(ost::OSTValue(infoOfRound(rounds - 1)), *entry->asDictionary()->find("CodeSigningInfo"));
    }
    const auto paths = ostrand::groupContainerPaths(connection, mobile, "com.example.App");
    ASSERT_TRUE(paths);
    for (const auto& [group, path] : *paths)
        EXPECT_TRUE(std::filesystem::is_directory(device().onHost(path))) << group;
}

} // namespace
