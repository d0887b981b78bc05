#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/StoreView.h"
#include "EndToEnd/Wire.h"
#include "support/BootedDeviceTest.h"

#include "Client/Containers.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <filesystem>
#include <mutex>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

using namespace ost::test;
using ostrand::ContainerClass;
using ostrand::Error;

namespace {

constexpr int clients = 8;
constexpr int rounds = 120;
constexpr std::array identifiers{"com.example.a", "com.example.b", "com.example.c"};

/// What requests may answer when others work on the same containers: not there (any more), there already, and for two
/// that were one and the same at different moments, a container replaced by itself.
constexpr std::array<std::uint64_t, 3> lostRaces{21, 27, 22};

/// Longer than all rounds together take; a client that waits longer has met a deadlock.
constexpr std::chrono::seconds patience{60};

/// Clients that create, delete and replace the same few containers of one class at the same time.
class ChurnTest : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (!IsSkipped())
            _client.emplace(device().socket(), wire::allowed());
    }

    [[nodiscard]] ostrand::Connection connect() {
        const std::lock_guard lock(_mutex);
        return ostrand::Connection(_client->connect().release(), patience);
    }

    /// Everybody at once, with a pause for nobody.
    void churn(ContainerClass containerClass);

    /// The disk holds one container for each identifier at most, and the daemon lists just those.
    void expectOrder(ContainerClass containerClass);

private:
    void _churnAsOne(unsigned seed, ContainerClass containerClass);

    std::mutex _mutex; ///< the client makes one connection at a time
    std::optional<wire::Client> _client;
};

/// One client's part.
class Churner {
public:
    Churner(ostrand::Connection connection, ContainerClass containerClass, unsigned seed)
        : _connection(std::move(connection)), _class(containerClass), _random(seed) {}

    /// One request. The error that it met, unless another client's request explains it.
    std::optional<Error> step() {
        const std::string identifier = identifiers[_pick(identifiers.size())];
        const bool transient = _pick(2) == 0;
        switch (_pick(4)) {
        case 0:
            return _unexpected(
                ostrand::createOrLookup(_connection, _named(identifier, transient), ostrand::WhenMissing::create));
        case 1:
            return _unexpected(ostrand::deleteContainer(_connection, _named(identifier, false)));
        case 2:
            return _delete(identifier, transient);
        default:
            return _replace(identifier, transient);
        }
    }

private:
    std::size_t _pick(std::size_t count) { return std::uniform_int_distribution<std::size_t>(0, count - 1)(_random); }

    [[nodiscard]] ostrand::ContainerRequest _named(const std::string& identifier, bool transient) const {
        return {.containerClass = _class,
                .user = ost::usualUserOf(_class),
                .identifier = identifier,
                .transient = transient};
    }

    /// What a list has under an identifier.
    std::optional<ostrand::ContainerReference> _find(const std::string& identifier, bool transient) {
        const auto list = ostrand::list(_connection, _named(identifier, transient));
        if (list)
            for (const auto& listed : *list)
                if (listed.identifier == identifier)
                    return ostrand::ContainerReference{_class, ost::usualUserOf(_class), identifier, listed.uuid};
        return std::nullopt;
    }

    std::optional<Error> _delete(const std::string& identifier, bool transient) {
        const auto found = _find(identifier, transient);
        return found ? _unexpected(ostrand::stageForDeletion(_connection, {*found})) : std::nullopt;
    }

    std::optional<Error> _replace(const std::string& identifier, bool oldIsTransient) {
        const auto old = _find(identifier, oldIsTransient);
        const auto other = _find(identifier, !oldIsTransient);
        return other ? _unexpected(ostrand::replace(_connection, old, *other)) : std::nullopt;
    }

    template<typename T>
    static std::optional<Error> _unexpected(const ostrand::Result<T>& result) {
        if (result || (result.error().kind == Error::Kind::failed &&
                       std::ranges::find(lostRaces, result.error().code) != lostRaces.end()))
            return std::nullopt;
        return result.error();
    }

    ostrand::Connection _connection;
    ContainerClass _class;
    std::mt19937 _random;
};

void ChurnTest::_churnAsOne(unsigned seed, ContainerClass containerClass) {
    Churner churner(connect(), containerClass, seed);
    for (int round = 0; round < rounds; ++round)
        if (const auto error = churner.step())
            FAIL() << error->description();
}

void ChurnTest::churn(ContainerClass containerClass) {
    const auto seed = std::random_device()();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::vector<std::jthread> threads;
    for (unsigned number = 0; number < clients; ++number)
        threads.emplace_back([&, number] { _churnAsOne(seed + number, containerClass); });
}

void ChurnTest::expectOrder(ContainerClass containerClass) {
    auto connection = connect();
    for (const bool transient : {false, true}) {
        const auto probe = ostrand::createOrLookup(connection,
                                                   {.containerClass = containerClass,
                                                    .user = ost::usualUserOf(containerClass),
                                                    .identifier = "com.example.probe",
                                                    .transient = transient},
                                                   ostrand::WhenMissing::create);
        ASSERT_TRUE(probe) << probe.error().description();
        const auto classDirectory = device().onHost(probe->path).parent_path();
        EXPECT_EQ(listedContainers(connection, containerClass, transient), containersOnDisk(classDirectory));
    }
    ASSERT_TRUE(ostrand::destroyDeathRow(connection));
    EXPECT_EQ(leftovers(device().image()), std::vector<std::string>());
}

} // namespace

TEST_F(ChurnTest, CacheAndDiskAgreeAndNoDescriptorIsLeftAfterClientsWorkedOnTheSameContainers) {
    for (const auto containerClass : {ContainerClass::dataApplication, ContainerClass::bundleApplication}) {
        churn(containerClass);
        expectOrder(containerClass); // what is opened once and for all is open now
        const auto before = openDescriptors(device().daemonId());
        churn(containerClass);
        expectOrder(containerClass);
        EXPECT_TRUE(comesTrue([&] { return openDescriptors(device().daemonId()) <= before; }))
            << before << " before, " << openDescriptors(device().daemonId()) << " after";
        device().killDaemon();
        expectOrder(containerClass);
    }
}
