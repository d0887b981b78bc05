#include "EndToEnd/Wire.h"
#include "support/BootedDeviceTest.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace ost::test::wire {
namespace {

std::string array(const std::vector<std::string>& elements) {
    std::string bytes;
    platform::CBOREncoder(bytes).beginArray(elements.size());
    for (const auto& element : elements)
        bytes += element;
    return bytes;
}

/// A client that may do everything, on a device with data containers of the mobile user.
class RemovalCommands : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        client.emplace(device().socket(), allowed("com.example.allowed", 501));
        connection.emplace(client->connect());
    }

    Reply call(std::uint64_t command, Entries entries) {
        entries.emplace_back("Command", number(command));
        return connection->call(request(1, entries));
    }
    Reply make(std::string_view identifier, bool transient = false) {
        return call(0, {{"ContainerClass", number(2)},
                        {"UserID", number(1)},
                        {"Identifier", text(identifier)},
                        {"Transient", truth(transient)},
                        {"CreateIfNecessary", truth(true)}});
    }
    std::vector<std::string> listed() {
        return call(1, {{"ContainerClass", number(2)}, {"UserID", number(501)}}).texts("ReplyIdsArray");
    }

    std::optional<Client> client;
    std::optional<Connection> connection;
};

TEST_F(RemovalCommands, StagingPairsItsArraysOrTouchesNothing) {
    const auto a = uuid(make("a").uuid("ReplyUUID")), b = uuid(make("b").uuid("ReplyUUID"));
    const auto two = number(2), user = number(501), placeholder = number((std::uint64_t{7} << 32U) | 1U);
    const auto stage = [&](std::string classes, std::string uuids, std::string users, std::string identifiers) {
        return call(3, {{"ContainerClassesArray", std::move(classes)},
                        {"UUIDsArray", std::move(uuids)},
                        {"UserIDsArray", std::move(users)},
                        {"IdentifiersArray", std::move(identifiers)}});
    };
    const struct {
        std::uint64_t code;
        std::string classes, uuids, users, identifiers;
    } refused[] = {
        {11, array({two}), array({a}), array({user, user}), array({text("a")})},
        {11, array({two}), array({a, b}), array({user}), array({text("a")})},
        {11, array({two, two}), array({a}), array({user}), array({text("a")})},
        {11, array({two}), array({a}), array({user}), array({})},
        {11, array({two}), array({a}), array({user}), text("a")},
        {11, number(2), array({a}), array({}), array({text("a")})},
        {38, array({two}), array({a}), array({number(500)}), array({text("a")})},
        {38, array({two}), array({a}), array({number(502)}), array({text("a")})},
        {38, array({two, number(1)}), array({a, b}), array({user, user}), array({text("a"), text("b")})},
        {40, array({two}), array({a}), array({}), array({text("a")})},
    };
    for (const auto& [code, classes, uuids, users, identifiers] : refused) {
        const auto reply = stage(classes, uuids, users, identifiers);
        EXPECT_EQ(code, reply.error());
        EXPECT_EQ("ReplyError", reply.keys());
    }
    EXPECT_EQ(11U, call(3, {{"UUIDsArray", array({a})}}).error());
    EXPECT_EQ(1U, call(3, {}).error()) << "nothing was named";
    EXPECT_EQ(2U, listed().size());

    // What is no UUID, no text or no container is passed over; only the low half of a number is a user id.
    EXPECT_EQ(1U, stage(array({two, two, two, two}), array({text("a"), a, b, b}),
                        array({user, user, user, placeholder}), array({text("a"), number(1), text("a"), text("b")}))
                      .error());
    EXPECT_EQ(std::vector<std::string>{"a"}, listed());
}

TEST_F(RemovalCommands, DeletionNamesItsContainer) {
    const auto made = make("a");
    const auto remove = [&](const Entries& entries) { return call(10, entries).error(); };
    EXPECT_EQ(38U, remove({{"ContainerClass", number(2)}, {"UserID", number(502)}, {"Identifier", text("a")}}));
    EXPECT_EQ(38U, remove({{"Identifier", text("a")}}));
    EXPECT_EQ(11U, remove({{"ContainerClass", number(2)}, {"UserID", number(1)}})) << "the client's own is no default";
    EXPECT_EQ(std::vector<std::string>{"a"}, listed());
    EXPECT_EQ(1U, remove({{"ContainerClass", number(2)}, {"UserID", number(1)}, {"Identifier", text("a")}}));
    EXPECT_EQ(21U, remove({{"ContainerClass", number(2)}, {"UserID", number(1)}, {"Identifier", text("a")}}));
    EXPECT_FALSE(std::filesystem::exists(device().onHost(made.text("ReplyPath"))));
}

TEST_F(RemovalCommands, ReplacementValidatesTheSidesThatItHas) {
    const auto old = make("old"), fresh = make("new", true);
    const Entries oldSide{{"OldContainerUUID", uuid(old.uuid("ReplyUUID"))},
                          {"OldContainerClass", number(2)},
                          {"OldContainerUserID", number(1)},
                          {"OldIdentifier", text("old")}};
    const Entries newSide{{"NewContainerUUID", uuid(fresh.uuid("ReplyUUID"))},
                          {"NewContainerClass", number(2)},
                          {"NewContainerUserID", number(501)},
                          {"NewIdentifier", text("new")}};
    /// The code of a replacement by both sides, with one value changed.
    const auto replaced = [&](std::string_view key = {}, std::string value = {}) {
        Entries entries = oldSide;
        entries.insert(entries.end(), newSide.begin(), newSide.end());
        for (auto& entry : entries)
            if (entry.first == key)
                entry.second = value;
        return call(2, entries).error();
    };
    EXPECT_EQ(38U, replaced("OldContainerUserID", number(502)));
    EXPECT_EQ(38U, replaced("NewContainerUserID", null()));
    EXPECT_EQ(38U, replaced("NewContainerClass", number(1)));
    EXPECT_EQ(11U, replaced("NewContainerUUID", text("no UUID")));
    EXPECT_EQ(21U, replaced("NewIdentifier", null()));
    EXPECT_EQ(21U, replaced("OldIdentifier", text("other")));
    EXPECT_EQ(23U, replaced("OldContainerClass", number(4)));
    EXPECT_EQ(std::vector<std::string>{"old"}, listed());

    EXPECT_EQ(1U, replaced());
    EXPECT_EQ(std::vector<std::string>{"new"}, listed());
    const auto other = make("other", true);
    EXPECT_EQ(1U, call(2, {{"OldContainerClass", number(99)}, // of no account without a UUID
                           {"OldIdentifier", text("new")},
                           {"NewContainerUUID", uuid(other.uuid("ReplyUUID"))},
                           {"NewContainerClass", number(2)},
                           {"NewContainerUserID", number(1)},
                           {"NewIdentifier", text("other")}})
                      .error());
    EXPECT_EQ(2U, listed().size());
}

TEST_F(RemovalCommands, DeathRowIsEmptyWhenTheReplyComes) {
    const auto deathRow = device().onHost("/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead");
    for (int round = 0; round < 3; ++round) {
        const auto path = device().onHost(make("a").text("ReplyPath"));
        for (int i = 0; i < 500; ++i)
            std::filesystem::create_directory(path / std::to_string(i));
        const Entries about{{"ContainerClass", number(2)}, {"UserID", number(501)}, {"Identifier", text("a")}};
        EXPECT_EQ(1U, call(10, about).error());
        EXPECT_TRUE(std::filesystem::exists(deathRow / path.filename()));
        const auto reply = call(4, {});
        EXPECT_EQ(1U, reply.error());
        EXPECT_EQ("ReplyError", reply.keys());
        EXPECT_TRUE(std::filesystem::is_empty(deathRow));
    }
}

} // namespace
} // namespace ost::test::wire
