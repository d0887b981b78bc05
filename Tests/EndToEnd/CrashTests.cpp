#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/StoreView.h"
#include "EndToEnd/Wire.h"
#include "support/BootedDevice.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <map>
#include <mutex>
#include <random>
#include <thread>

namespace ost::test::wire {

namespace {

constexpr unsigned clients = 4;
constexpr unsigned containersOfAClient = 150;
constexpr unsigned kills = 5;

/// What the daemon has answered, so it must never forget it.
struct Answer {
    platform::UUID uuid;
    std::string path;
};

/// The answers of all clients.
class Answers {
public:
    void add(const std::string& identifier, Answer answer) {
        const std::lock_guard lock(_mutex);
        _answers.emplace(identifier, std::move(answer));
        _grown.notify_all();
    }

    void waitForMoreThan(std::size_t count) {
        std::unique_lock lock(_mutex);
        _grown.wait(lock, [&] { return _answers.size() > count; });
    }

    std::map<std::string, Answer> all() {
        const std::lock_guard lock(_mutex);
        return _answers;
    }

private:
    std::mutex _mutex;
    std::condition_variable _grown;
    std::map<std::string, Answer> _answers;
};

/// Creates containers one after the other and leaves its mark in each; goes on with a new connection when the daemon
/// dies.
void create(const BootedDevice& device, const Client& caller, const std::string& name, Answers& answers) {
    auto connection = caller.connect();
    for (unsigned i = 0; i < containersOfAClient;) {
        const auto identifier = name + "." + std::to_string(i);
        connection.send(creation(i, identifier));
        const auto reply = connection.receive();
        if (!reply) {
            connection = caller.connect();
            continue;
        }
        ASSERT_EQ(reply->error(), 1U) << identifier;
        const auto path = reply->text("ReplyPath");
        writeFile(device.onHost(path) / "Documents/mark", identifier);
        answers.add(identifier, {reply->uuid("ReplyUUID"), path});
        ++i;
    }
}

class CrashTest : public BootedDeviceTest {
protected:
    static constexpr const char* classDirectory = "/private/var/mobile/Containers/Data/Application";

    void expectNothingIsLeftOver(const Client& caller) {
        const auto reply = caller.connect().call(request(1, {{"Command", number(4)}}));
        EXPECT_EQ(reply.error(), 1U);
        EXPECT_EQ(leftovers(device().image()), std::vector<std::string>());
    }

    void expectAllThere(const Client& caller, const std::map<std::string, Answer>& answers) {
        auto connection = caller.connect();
        for (const auto& [identifier, answer] : answers) {
            const auto found = connection.call(creation(1, identifier, false));
            ASSERT_EQ(found.error(), 1U) << identifier;
            EXPECT_EQ(found.uuid("ReplyUUID"), answer.uuid) << identifier;
            EXPECT_EQ(found.text("ReplyPath"), answer.path) << identifier;
            EXPECT_EQ(readFile(device().onHost(answer.path) / "Documents/mark"), identifier);
        }
    }

    /// Every item of the class directory is a whole container, and the daemon knows just these.
    void expectNothingHalfMade(const Client& caller) {
        const auto onDisk = containersOnDisk(device().onHost(classDirectory));
        for (const auto& container : std::filesystem::directory_iterator(device().onHost(classDirectory)))
            for (const char* directory : {"Documents", "Library/Caches", "Library/Preferences", "tmp"})
                EXPECT_TRUE(std::filesystem::is_directory(container.path() / directory)) << container.path();
        const auto listed = caller.connect().call(
            request(1, {{"Command", number(1)}, {"ContainerClass", number(2)}, {"UserID", number(501)}}));
        Containers known;
        const auto identifiers = listed.texts("ReplyIdsArray");
        const auto uuids = listed.uuids("ReplyUUIDsArray");
        for (std::size_t i = 0; i < identifiers.size() && i < uuids.size(); ++i)
            known.emplace(identifiers[i], uuids[i].string());
        EXPECT_EQ(known, onDisk);
    }
};

} // namespace

TEST_F(CrashTest, NothingThatWasAnsweredIsLostAndNothingIsHalfMade) {
    std::vector<std::unique_ptr<Client>> callers;
    for (unsigned i = 0; i < clients; ++i)
        callers.push_back(std::make_unique<Client>(device().socket(), allowed("com.example.client", i % 2 ? 501 : 0)));
    Answers answers;
    {
        std::vector<std::jthread> threads;
        for (unsigned i = 0; i < clients; ++i)
            threads.emplace_back(
                [&, i] { create(device(), *callers[i], "com.example.c" + std::to_string(i), answers); });
        // Each kill comes at some moment of the work that is going on just then.
        const auto seed = std::random_device()();
        RecordProperty("seed", std::to_string(seed));
        std::minstd_rand random(seed);
        constexpr unsigned share = clients * containersOfAClient / (kills + 1);
        for (unsigned kill = 0; kill < kills; ++kill) {
            answers.waitForMoreThan(kill * share + random() % share);
            device().killDaemon(kill % 2 == 0 ? SIGKILL : SIGTERM);
        }
    }
    ASSERT_EQ(answers.all().size(), clients * containersOfAClient);
    for (const bool rebooted : {false, true}) {
        if (rebooted)
            device().reboot();
        expectNothingIsLeftOver(*callers[0]);
        expectAllThere(*callers[0], answers.all());
        expectNothingHalfMade(*callers[0]);
    }
}

TEST_F(CrashTest, LoadLeavesNoDescriptorOpen) {
    const Client caller(device().socket(), allowed());
    const auto work = [&](unsigned round) {
        std::vector<std::jthread> threads;
        for (unsigned i = 0; i < clients; ++i)
            threads.emplace_back([&, i] {
                auto connection = caller.connect();
                for (unsigned n = 0; n < 25; ++n) {
                    const auto identifier = std::to_string(round) + "." + std::to_string(i) + "." + std::to_string(n);
                    EXPECT_EQ(connection.call(creation(n, identifier, n % 5 != 0)).error(), n % 5 != 0 ? 1U : 21U);
                }
                EXPECT_TRUE(connection.isRefused(request(1, {{"Command", number(26)}})));
            });
    };
    work(0); // what is opened once and for all
    const auto daemon = device().daemonId();
    const auto before = openDescriptors(daemon);
    for (unsigned round = 1; round < 10; ++round)
        work(round);
    EXPECT_TRUE(comesTrue([&] { return openDescriptors(daemon) <= before; }))
        << before << " before, " << openDescriptors(daemon) << " after";
    EXPECT_EQ(device().daemonId(), daemon);
}

} // namespace ost::test::wire
