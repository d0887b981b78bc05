#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/Wire.h"
#include "model/OSTMetadata.h"
#include "service/OSTCommandTable.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <limits>
#include <map>

namespace ost::test::wire {

using testing::PrintToString;
using Lines = std::vector<std::string>;

namespace {

const std::string createdKeys = "ReplyError ReplyExisted ReplyIdentifier ReplyPath ReplyUUID";

std::string entitlement(std::string_view name) { return "com.tamarok.private.Ostrand." + std::string(name); }

class RequestTest : public BootedDeviceTest {
protected:
    [[nodiscard]] Client client(const Identity& identity) { return {device().socket(), identity}; }
};

/// Of whom the commands ask, as clients see it.
std::string_view requiredFor(std::uint64_t command) {
    switch (command) {
    case 0:
    case 13:
    case 15:
    case 16:
    case 17:
        return "none";
    case 11:
        return "wipeContainer";
    case 24:
        return "dataMigration";
    default:
        return "allowed";
    }
}

} // namespace

TEST_F(RequestTest, ACommandWithoutNumberIsTheFirstAndOneThatDoesNotExistIsRefused) {
    const auto caller = client(allowed());
    auto connection = caller.connect();
    const auto reply = connection.call(
        request(1, {{"ContainerClass", number(2)}, {"UserID", number(501)}, {"CreateIfNecessary", truth(true)}}));
    EXPECT_EQ(reply.keys(), createdKeys);

    DeviceLog log(device());
    for (const std::uint64_t command : {std::uint64_t{26}, std::uint64_t{1} << 32}) {
        EXPECT_TRUE(caller.connect().isRefused(request(1, {{"Command", number(command)}})));
        EXPECT_EQ(log.takeErrors(), Lines{"OSTProcessVexelEvent: Invalid command index: " + std::to_string(command)});
    }
}

TEST_F(RequestTest, EntitlementsDecideWhichCommandsAClientMayRun) {
    const auto with = [](OSTDictionary dictionary) {
        return Identity{.identifier = "com.example.client", .entitlements = std::move(dictionary), .user = 501};
    };
    const auto wiping = [&](OSTValue value) {
        OSTDictionary dictionary;
        dictionary.set(entitlement("wipeContainer"), std::move(value));
        return with(std::move(dictionary));
    };
    OSTDictionary untrue;
    untrue.set(entitlement("allowed"), "true");
    untrue.set(entitlement("dataMigration"), false);
    const struct {
        const char* who;
        Identity identity;
        Lines rights; // beside the open commands
    } rows[] = {
        {"allowed", with(entitlements({entitlement("allowed")})), {"allowed", "wipeContainer", "dataMigration"}},
        {"otherIdLookup", with(entitlements({entitlement("otherIdLookup")})), {}},
        {"dataMigration", with(entitlements({entitlement("dataMigration")})), {"dataMigration"}},
        {"wipeContainer array", wiping(OSTArray{"com.example.plugin"}), {"wipeContainer"}},
        {"wipeContainer empty array", wiping(OSTArray{}), {"wipeContainer"}},
        {"wipeContainer true", wiping(true), {}},
        {"values that are no true", with(untrue), {}},
        {"no entitlement at all", with({}), {}},
    };
    for (const auto& [who, identity, rights] : rows) {
        const auto caller = client(identity);
        for (std::uint64_t command = 0; command < OSTCommandCount; ++command) {
            const std::string required(requiredFor(command));
            const bool entitled = required == "none" || std::ranges::find(rights, required) != rights.end();
            const bool available = OSTCommandTable[command].handler != nullptr;
            const bool wipes = required == "wipeContainer" && identity.entitlements->find(entitlement(required));
            Lines refusal;
            if (!available)
                refusal = {"OSTProcessVexelEvent: Command " + std::to_string(command) + " is not available"};
            else if (!entitled)
                refusal = {"checkEntitlementsAndInitClientObject: connection attempt from pid " +
                           std::to_string(caller.id()) +
                           " (com.example.client) missing required entitlement: " + entitlement(required)};
            if (available && required == "wipeContainer" && !(wipes && entitled))
                refusal.insert(refusal.begin(), "checkEntitlementsAndInitClientObject: No entitled containers to wipe");

            DeviceLog log(device());
            auto connection = caller.connect();
            connection.send(request(9, {{"Command", number(command)}}));
            const auto reply = connection.receive();
            const auto errors = log.takeErrors();
            const auto context = std::string(who) + ", command " + std::to_string(command);
            ASSERT_EQ(reply.has_value(), entitled && available) << context << ": " << PrintToString(errors);
            if (reply)
                EXPECT_NE(reply->error(), 0U) << context;
            else
                EXPECT_EQ(errors, refusal) << context;
        }
    }
}

TEST_F(RequestTest, AProgramThatIsNotSignedOrNotTrustworthyMayDoNothing) {
    auto writableByOthers = allowed();
    writableByOthers.programMode = 0757;
    auto writableByGroup = allowed();
    writableByGroup.programMode = 0775;
    auto ofSomebody = allowed();
    ofSomebody.programOwner = 501;
    const struct {
        const char* who;
        Identity identity;
        std::string identifier;
    } rows[] = {
        {"not signed", {}, "(null)"},
        {"an identifier alone", {.identifier = "com.example.plain"}, "com.example.plain"},
        {"a program that its group may write", writableByGroup, "(null)"},
        {"a program that all may write", writableByOthers, "(null)"},
        {"a program of a user", ofSomebody, "(null)"},
    };
    // Only a daemon that answers has made all directories that a start makes.
    EXPECT_EQ(client(allowed()).connect().call(creation(1, "com.example.a", false)).error(), 21U);
    const auto untouched = tree(device().onHost("/private/var/mobile"));
    for (const auto& [who, identity, identifier] : rows) {
        const auto caller = client(identity);
        DeviceLog log(device());
        EXPECT_TRUE(caller.connect().isRefused(creation(1, "com.example.a"))) << who;
        EXPECT_EQ(log.takeErrors(), Lines()) << who << ": an open command leaves no line";
        EXPECT_TRUE(caller.connect().isRefused(request(1, {{"Command", number(1)}}))) << who;
        EXPECT_EQ(log.takeErrors(), Lines{"checkEntitlementsAndInitClientObject: connection attempt from pid " +
                                          std::to_string(caller.id()) + " (" + identifier +
                                          ") missing required entitlement: " + entitlement("allowed")})
            << who;
    }
    EXPECT_EQ(tree(device().onHost("/private/var/mobile")), untouched);
}

TEST_F(RequestTest, EveryRequestIsJudgedAnew) {
    const auto caller = client(allowed("com.example.first"));
    auto connection = caller.connect();
    const auto lookup =
        request(1, {{"ContainerClass", number(2)}, {"UserID", number(501)}, {"CreateIfNecessary", truth(true)}});
    EXPECT_EQ(connection.call(lookup).text("ReplyIdentifier"), "com.example.first");
    caller.sign({.identifier = "com.example.second", .entitlements = OSTDictionary()});
    EXPECT_EQ(connection.call(lookup).text("ReplyIdentifier"), "com.example.second");
    caller.sign({.identifier = "com.example.second"});
    EXPECT_TRUE(connection.isRefused(lookup));
}

TEST_F(RequestTest, AnswersOfTheFirstCommandForEachUserAndValue) {
    constexpr std::uint64_t highBits = std::uint64_t{7} << 32;
    const auto root = client(allowed("com.example.root"));
    const auto mobile = client({.identifier = "com.example.mobile", .entitlements = OSTDictionary(), .user = 501});
    const auto nameless = client({.entitlements = OSTDictionary(), .user = 501});
    const auto seeker = client({.identifier = "com.example.seeker",
                                .entitlements = entitlements({entitlement("otherIdLookup")}),
                                .user = 501});
    const auto lookup = [](std::uint64_t containerClass, std::uint64_t user, Entries more = {}) {
        Entries entries{{"ContainerClass", number(containerClass)}, {"UserID", number(user)}};
        entries.insert(entries.end(), more.begin(), more.end());
        return entries;
    };
    const std::pair<std::string_view, std::string> create{"CreateIfNecessary", truth(true)};
    const std::pair<std::string_view, std::string> named{"Identifier", text("com.example.x")};
    const struct {
        const char* what;
        const Client& caller;
        Entries entries;
        std::uint64_t error;
        std::string identifier; // of the container, when there is one
    } rows[] = {
        {"the client's own identifier", mobile, lookup(2, 501, {create}), 1, "com.example.mobile"},
        {"no identifier at all", nameless, lookup(2, 501, {create}), 11, ""},
        {"a null is no identifier", mobile, lookup(2, 501, {{"Identifier", null()}}), 1, "com.example.mobile"},
        {"nor is a number", mobile, lookup(2, 501, {{"Identifier", number(1)}}), 1, "com.example.mobile"},
        {"another identifier", mobile, lookup(2, 501, {create, named}), 1, "com.example.x"},
        {"the placeholder of a user", mobile, lookup(2, 1, {named}), 1, "com.example.x"},
        {"the placeholder of a system client", root, lookup(2, 1, {named}), 1, "com.example.x"},
        {"high bits of the user", root, lookup(2, highBits | 501, {named}), 1, "com.example.x"},
        {"high bits of the placeholder", mobile, lookup(2, highBits | 1, {named}), 1, "com.example.x"},
        {"high bits of the class", mobile, lookup(highBits | 2, 501, {named}), 11, ""},
        {"somebody else's user", mobile, lookup(2, 502, {named}), 38, ""},
        {"a user that fits no class", root, lookup(2, 400, {named}), 38, ""},
        {"no class, from a system client", root, lookup(0, 501, {named}), 38, ""},
        {"no class, from a user", mobile, lookup(0, 501, {named}), 11, ""},
        {"the class after the last", mobile, lookup(14, 501, {named}), 11, ""},
        {"nothing but a command", root, {{"Command", number(0)}}, 38, ""},
        {"a bundle, from a user", mobile, lookup(1, 33, {create, named}), 1, "com.example.x"},
        {"a bundle of another user", root, lookup(1, 501, {create, named}), 38, ""},
        {"a bundle of the placeholder", root, lookup(1, 1, {create, named}), 38, ""},
        {"a system container, not entitled", mobile, lookup(12, 499, {create}), 55, ""},
        {"a system container, looked up", seeker, lookup(12, 499, {create, named}), 1, "com.example.x"},
        {"a system group", mobile, lookup(13, 499, {create, named}), 1, "com.example.x"},
        {"a system container of a user", root, lookup(12, 501, {create, named}), 38, ""},
        {"one that is not there", root, lookup(4, 501, {named}), 21, ""},
        {"the same, transient", root, lookup(2, 501, {named, {"Transient", truth(true)}}), 21, ""},
        {"a class in words", root, {{"ContainerClass", text("2")}, {"UserID", number(501)}, named}, 38, ""},
        {"a negative class", mobile, {{"ContainerClass", signedNumber(-2)}, {"UserID", number(501)}, named}, 11, ""},
        {"a real for a user", root, {{"ContainerClass", number(2)}, {"UserID", real(501)}, named}, 38, ""},
        {"a number for the creation", root, lookup(4, 501, {named, {"CreateIfNecessary", number(1)}}), 21, ""},
        {"a text for the command", root, lookup(2, 501, {{"Command", text("1")}, named}), 1, "com.example.x"},
        {"a negative command", root, lookup(2, 501, {{"Command", signedNumber(-1)}, named}), 1, "com.example.x"},
        {"a key that means nothing", root, lookup(2, 501, {named, {"Colour", map({})}}), 1, "com.example.x"},
        {"a user without account", root, lookup(2, 777, {create, named}), 43, ""},
    };
    for (const auto& [what, caller, entries, error, identifier] : rows) {
        const auto reply = caller.connect().call(request(5, entries));
        EXPECT_EQ(reply.error(), error) << what;
        EXPECT_EQ(reply.keys(), error == 1 ? createdKeys : "ReplyError") << what;
        EXPECT_EQ(reply.text("ReplyIdentifier"), identifier) << what;
        if (error == 1) {
            EXPECT_TRUE(std::filesystem::is_directory(device().onHost(reply.text("ReplyPath")))) << what;
        }
    }
}

TEST_F(RequestTest, CreatesOnceFindsAndLists) {
    const auto caller = client(allowed());
    auto connection = caller.connect();
    const auto made = connection.call(creation(1, "com.example.b"));
    const auto found = connection.call(creation(2, "com.example.b", false));
    const auto another = connection.call(creation(3, "com.example.a"));
    EXPECT_FALSE(made.truth("ReplyExisted"));
    EXPECT_TRUE(found.truth("ReplyExisted"));
    EXPECT_EQ(found.uuid("ReplyUUID"), made.uuid("ReplyUUID"));
    EXPECT_EQ(found.text("ReplyPath"), made.text("ReplyPath"));

    const auto list = [&](std::uint64_t containerClass, std::uint64_t user, bool transient) {
        return connection.call(request(4, {{"Command", number(1)},
                                           {"ContainerClass", number(containerClass)},
                                           {"UserID", number(user)},
                                           {"Transient", truth(transient)}}));
    };
    const auto listed = list(2, 1, false);
    EXPECT_EQ(listed.keys(), "ReplyError ReplyIdsArray ReplyUUIDsArray");
    std::map<std::string, platform::UUID> containers;
    const auto identifiers = listed.texts("ReplyIdsArray");
    const auto uuids = listed.uuids("ReplyUUIDsArray");
    ASSERT_EQ(identifiers.size(), uuids.size());
    for (std::size_t i = 0; i < identifiers.size(); ++i)
        containers.emplace(identifiers[i], uuids[i]);
    EXPECT_EQ(containers, (std::map<std::string, platform::UUID>{{"com.example.a", another.uuid("ReplyUUID")},
                                                                 {"com.example.b", made.uuid("ReplyUUID")}}));
    EXPECT_EQ(list(2, 501, true).keys(), "ReplyError ReplyIdsArray ReplyUUIDsArray");
    EXPECT_EQ(list(2, 501, true).texts("ReplyIdsArray"), Lines());
    for (const auto& [containerClass, user, error] :
         {std::array<std::uint64_t, 3>{2, 400, 38}, {0, 501, 38}, {14, 501, 38}, {1, 501, 38}}) {
        const auto refused = list(containerClass, user, false);
        EXPECT_EQ(refused.error(), error);
        EXPECT_EQ(refused.keys(), "ReplyError");
    }
    const auto user = client(allowed("com.example.user", 501));
    const auto refused = user.connect().call(request(1, {{"Command", number(1)}, {"UserID", number(501)}}));
    EXPECT_EQ(refused.error(), 11U) << "a class that does not exist is the store's to refuse";
    EXPECT_EQ(refused.keys(), "ReplyError");
}

TEST_F(RequestTest, AListingThatNoFrameHoldsLacksTheLongestIdentifiers) {
    for (char name = 'a'; name < 'a' + 17; ++name) {
        const std::string url = "/private/var/mobile/Containers/Data/Application/" + std::string(1, name);
        std::filesystem::create_directories(device().onHost(url));
        ASSERT_TRUE((OSTMetadata{.uid = 501,
                                 .uuid = platform::UUID::generate(),
                                 .containerClass = OSTContainerClass::dataApplication,
                                 .identifier = std::string(name == 'c' ? 1'040'001 : 1'040'000, name),
                                 .url = device().onHost(url)}
                         .writeMetadataToDisk()));
    }
    const auto caller = client(allowed());
    DeviceLog log(device());
    const auto listing = caller.connect().call(
        request(1, {{"Command", number(1)}, {"ContainerClass", number(2)}, {"UserID", number(501)}}));
    EXPECT_EQ(listing.error(), 1U);
    std::string first;
    for (const auto& identifier : listing.texts("ReplyIdsArray"))
        first += identifier[0];
    std::ranges::sort(first);
    EXPECT_EQ(first, "abdefghijklmnopq");
    EXPECT_EQ(listing.uuids("ReplyUUIDsArray").size(), first.size());
    const auto errors = log.takeErrors();
    ASSERT_EQ(errors.size(), 1U);
    EXPECT_NE(errors[0].find("/Data/Application/c)"), std::string::npos) << errors[0];
}

TEST_F(RequestTest, RepliesComeInOrderUnderTheNumbersOfTheirRequests) {
    const auto caller = client(allowed());
    auto connection = caller.connect();
    constexpr auto last = std::numeric_limits<std::uint32_t>::max();
    std::vector<std::uint32_t> numbers{0, last, 7, 7, 1, 0};
    for (std::uint32_t i = 0; i < 200; ++i)
        numbers.push_back(last - i * 7919);
    std::string requests;
    for (std::size_t i = 0; i < numbers.size(); ++i)
        requests += creation(numbers[i], "com.example." + std::to_string(i), i % 2 == 0);
    connection.send(requests);
    connection.finish();
    for (std::size_t i = 0; i < numbers.size(); ++i) {
        const auto reply = connection.receive();
        ASSERT_TRUE(reply) << i;
        EXPECT_EQ(reply->requestNumber(), numbers[i]);
        EXPECT_EQ(reply->error(), i % 2 == 0 ? 1U : 21U);
    }
    EXPECT_TRUE(connection.isClosed());
}

TEST_F(RequestTest, ARefusalKeepsEarlierRepliesAndDropsLaterRequests) {
    const auto caller = client(allowed());
    auto connection = caller.connect();
    connection.send(creation(1, "com.example.before") + request(2, {{"Command", number(26)}}) +
                    creation(3, "com.example.behind"));
    const auto before = connection.receive();
    ASSERT_TRUE(before);
    EXPECT_EQ(before->requestNumber(), 1U);
    EXPECT_EQ(before->error(), 1U);
    EXPECT_TRUE(connection.isClosed());
    EXPECT_EQ(caller.connect().call(creation(1, "com.example.behind", false)).error(), 21U);
}

} // namespace ost::test::wire
