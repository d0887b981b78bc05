#include "Client/Attributes.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "model/OSTMetadata.h"
#include "platform/device/Applications.h"
#include "platform/device/DeviceLockState.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <array>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <set>
#include <string>

using namespace ost::test;
using ost::OSTValue;
using ostrand::Connection;

namespace {

namespace fs = std::filesystem;

constexpr const char* classDirectory = "/private/var/mobile/Containers/Data/Application";

/// A daemon whose file-system calls fail or kill it while it changes what one container carries.
class AttributeFaultTest : public GatedDeviceTest {
protected:
    void SetUp() override {
        GatedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        auto connection = device().connect();
        const auto made = ostrand::createOrLookup(
            connection, {.containerClass = ostrand::ContainerClass::dataApplication, .user = 501, .identifier = "a"},
            ostrand::WhenMissing::create);
        ASSERT_TRUE(made);
        container = {ostrand::ContainerClass::dataApplication, 501, "a", made->uuid};
    }

    /// Has the fault befall one call after the other of what `act` asks of the daemon, until it comes to none. `check`
    /// gets what `act` answered, and a connection to a daemon that serves. `begin` is done before, without faults.
    void atEveryCall(
        Fault::Kind kind, const auto& act, const auto& check,
        const std::function<void(Connection&)>& begin = [](Connection&) {}) {
        for (unsigned call = 1; !HasFailure(); ++call) {
            auto connection = device().connect();
            ASSERT_TRUE(ostrand::metadata(connection, container));
            begin(connection);
            device().daemon().prepare({.kind = kind, .call = call, .error = error});
            const auto answer = act(connection);
            const auto course = device().daemon().conclude();
            SCOPED_TRACE("fault at call " + std::to_string(call) + ", " + course.faultedCall);
            if (kind == Fault::Kind::kill && !course.faultedCall.empty()) {
                device().startDaemon();
                ASSERT_TRUE(device().waitForFirstPass());
            }
            auto again = device().connect();
            EXPECT_EQ(listedContainers(again, container.containerClass, false),
                      containersOnDisk(device().onHost(classDirectory)));
            check(again, answer);
            EXPECT_EQ(leftovers(device().image()), std::vector<std::string>());
            if (course.faultedCall.empty()) {
                EXPECT_TRUE(answer);
                return;
            }
        }
    }

    [[nodiscard]] std::string valueAnswered(Connection& connection, const std::string& key) const {
        const auto value = ostrand::infoValue(connection, container, key);
        return value ? value->description() : value.error() == ostrand::Error::failed(24) ? "none" : "no answer";
    }
    [[nodiscard]] std::string valueOnDisk(const std::string& key) {
        const auto read =
            ost::OSTMetadata::readAndValidateMetadataAtUrl(directory().native(), 501, ost::OSTCheckClassPath::no);
        const auto* const value = read && read->info ? read->info->find(key) : nullptr;
        return value ? value->description() : read ? "none" : "no file";
    }

    /// The protection class that an item of the container bears, empty when it bears none.
    [[nodiscard]] std::string classOf(const char* item) {
        return recordedProtectionClass(directory() / item).value_or("");
    }
    [[nodiscard]] fs::path directory() {
        return device().onHost(classDirectory) / namesIn(device().onHost(classDirectory)).at(0);
    }

    /// Where the sandbox finds the container.
    [[nodiscard]] std::string sandboxPath() {
        return fs::read_symlink(device().onHost("/private/var/db/sandbox-state/501/1/a"));
    }

    ostrand::ContainerReference container;
    int error = EIO; ///< of a call that fails
};

/// A setter that gives a key another number each time.
class Setter {
public:
    explicit Setter(const ostrand::ContainerReference& container) : _container(container) {}

    ostrand::Result<void> operator()(Connection& connection) {
        before = current;
        current = std::to_string(++_number);
        return ostrand::setInfoValue(connection, _container, "k", OSTValue(_number));
    }
    std::string before = "none", current = "none";

private:
    const ostrand::ContainerReference& _container;
    std::uint64_t _number = 0;
};

} // namespace

TEST_F(AttributeFaultTest, AKillAtAnyMomentOfASetLeavesTheOldValueOrTheNew) {
    Setter set(container);
    std::set<bool> isNew;
    atEveryCall(
        Fault::Kind::kill, [&](auto& connection) { return set(connection); },
        [&](auto& connection, const auto& answer) {
            const auto value = valueAnswered(connection, "k");
            EXPECT_TRUE(value == set.current || (value == set.before && !answer)) << value;
            EXPECT_EQ(valueOnDisk("k"), value);
            isNew.insert(value == set.current);
            set.current = value;
        });
    EXPECT_EQ((std::set{false, true}), isNew);
}

TEST_F(AttributeFaultTest, ASetThatFailsChangesNeitherFileNorMemory) {
    Setter set(container);
    atEveryCall(
        Fault::Kind::fail, [&](auto& connection) { return set(connection); },
        [&](auto& connection, const auto& answer) {
            EXPECT_TRUE(answer || answer.error() == ostrand::Error::refused() ||
                        answer.error() == ostrand::Error::failed(34) || answer.error() == ostrand::Error::failed(43))
                << answer.error().description();
            const auto value = valueAnswered(connection, "k");
            EXPECT_EQ(value, answer ? set.current : set.before);
            EXPECT_EQ(valueOnDisk("k"), value);
            set.current = value;
        });
}

TEST_F(AttributeFaultTest, AKillAtAnyMomentOfARegenerationLeavesOneContainerWithItsUUID) {
    auto first = device().connect();
    ASSERT_TRUE(ostrand::regenerateDirectoryUUID(first, container));
    std::set<bool> isRenamed;
    auto before = namesIn(device().onHost(classDirectory));
    atEveryCall(
        Fault::Kind::kill, [&](auto& connection) { return ostrand::regenerateDirectoryUUID(connection, container); },
        [&](auto& connection, const auto& answer) {
            const auto now = namesIn(device().onHost(classDirectory));
            const auto found = ostrand::metadata(connection, container);
            ASSERT_TRUE(found);
            EXPECT_EQ(std::vector<std::string>{fs::path(found->path).filename()}, now);
            EXPECT_TRUE(!answer || now != before);
            EXPECT_EQ(sandboxPath(), found->path);
            isRenamed.insert(now != before);
            before = now;
        });
    EXPECT_EQ((std::set{false, true}), isRenamed);
}

TEST_F(AttributeFaultTest, ARegenerationThatFailsLeavesOneContainerThatEverybodyFinds) {
    auto first = device().connect();
    ASSERT_TRUE(ostrand::regenerateDirectoryUUID(first, container));
    atEveryCall(
        Fault::Kind::fail, [&](auto& connection) { return ostrand::regenerateDirectoryUUID(connection, container); },
        [&](auto& connection, const auto& /*answer*/) {
            const auto found = ostrand::metadata(connection, container);
            ASSERT_TRUE(found);
            EXPECT_EQ(std::vector<std::string>{fs::path(found->path).filename()},
                      namesIn(device().onHost(classDirectory)));
        });
}

TEST_F(AttributeFaultTest, AnItemOfTheSandboxThatWasLostIsSetAgainWhenTheClassIsRead) {
    auto first = device().connect();
    ASSERT_TRUE(ostrand::regenerateDirectoryUUID(first, container));
    ASSERT_TRUE(ostrand::createOrLookup(first, {container.containerClass, 501, "never.moved", false},
                                        ostrand::WhenMissing::create));
    device().killDaemon();
    fs::remove(device().onHost("/private/var/db/sandbox-state/501/1/a"));
    device().startDaemon();
    auto again = device().connect();
    const auto found = ostrand::metadata(again, container);
    ASSERT_TRUE(found);
    EXPECT_EQ(sandboxPath(), found->path);
    EXPECT_EQ(namesIn(device().onHost("/private/var/db/sandbox-state/501/1")), std::vector<std::string>{"a"});
}

TEST_F(AttributeFaultTest, AKillAtAnyMomentOfAClassChangeLeavesEveryItemAndTheRecordOldOrNew) {
    for (const auto* const name : {"Documents/a", "tmp/b"})
        writeFile(directory() / name, "");
    // Lowers and raises in turn, so that each change has something to do; files are only ever lowered, once.
    int number = 0;
    std::string before = "3", current;
    atEveryCall(
        Fault::Kind::kill,
        [&](auto& connection) {
            current = before == "1" ? "3" : "1";
            number = std::stoi(current);
            return ostrand::setDataProtection(connection, {.user = 501, .identifier = "a", .protectionClass = number});
        },
        [&](auto& connection, const auto& answer) {
            const auto answered = valueAnswered(connection, ostrand::protectionClassKey);
            const auto now = answered == "none" ? "3" : answered;
            EXPECT_TRUE(now == current || (now == before && !answer)) << now;
            for (const auto* const directory : {"Documents", "Library/Caches", "tmp"}) {
                const auto has = classOf(directory);
                EXPECT_TRUE(now == current ? has == current : has.empty() || has == "1" || has == "3")
                    << directory << " " << has;
            }
            for (const auto* const file : {"Documents/a", "tmp/b"})
                EXPECT_TRUE(classOf(file).empty() || classOf(file) == "1") << file;
            before = now;
        });
}

namespace {

/// A daemon whose file-system calls fail while it lowers the class of a container.
class ClassChangeFaultTest : public AttributeFaultTest {
protected:
    void SetUp() override {
        AttributeFaultTest::SetUp();
        if (IsSkipped() || HasFatalFailure())
            return;
        error = ENOMEM; // An item that cannot be read for good is left out.
        for (const auto* const file : {"Documents/a", "tmp/b", outside})
            writeFile(directory() / file, "");
        auto connection = device().connect();
        raise(connection);
    }

    /// Every item as it was, and the class that is on record.
    void raise(Connection& connection) {
        for (const auto* const item : items)
            recordProtectionClass(directory() / item, "3");
        EXPECT_TRUE(
            ostrand::setInfoValue(connection, container, ostrand::protectionClassKey, OSTValue(std::uint64_t{3})));
    }
    void lock(bool locked) {
        ASSERT_TRUE(ost::platform::writeDeviceLockState(
            locked ? ost::platform::deviceLocked : ost::platform::deviceUnlocked, device().image()));
    }
    [[nodiscard]] std::set<std::string> classes() {
        std::set<std::string> found;
        for (const auto* const item : items)
            found.insert(classOf(item));
        return found;
    }

    /// What holds after a change that failed, and that it can be made again.
    void check(Connection& connection, const auto& answer) {
        using ostrand::Error;
        const bool succeeded = answer.has_value();
        EXPECT_TRUE(succeeded || answer.error() == Error::failed(ENOMEM) || answer.error() == Error::failed(21) ||
                    answer.error() == Error::refused())
            << answer.error().description();
        const std::set<std::string> old{"3"}, changed{"1"}, halfway{"1", "3"};
        const auto recorded = valueAnswered(connection, ostrand::protectionClassKey);
        EXPECT_EQ(valueOnDisk(ostrand::protectionClassKey), recorded);
        EXPECT_TRUE(recorded == "3" || (succeeded && recorded == "1")) << recorded;
        EXPECT_TRUE(classes() == changed || (!succeeded && (classes() == old || classes() == halfway)));
        EXPECT_EQ(classOf("."), "0");
        EXPECT_EQ(classOf(outside), "");
        const auto asserted = ost::platform::terminationAssertion("a", device().image());
        EXPECT_TRUE(asserted && !*asserted);

        EXPECT_TRUE(ostrand::setDataProtection(connection, lowered));
        EXPECT_EQ(valueAnswered(connection, ostrand::protectionClassKey), "1");
        EXPECT_EQ(classes(), changed);
        raise(connection);
    }

    static constexpr std::array items{"Documents", "Documents/a", "Library", "Library/Caches", "tmp", "tmp/b"};
    static constexpr const char* outside = "other";
    const ostrand::DataProtection lowered{.user = 501, .identifier = "a", .protectionClass = 1, .retryIfLocked = true};
};

} // namespace

TEST_F(ClassChangeFaultTest, OneThatFailsLeavesEveryItemOldOrNewAndCanBeMadeAgain) {
    atEveryCall(
        Fault::Kind::fail, [&](auto& connection) { return ostrand::setDataProtection(connection, lowered); },
        [&](auto& connection, const auto& answer) { check(connection, answer); });
}

TEST_F(ClassChangeFaultTest, OneThatWaitedForTheUnlockNoLess) {
    std::uint32_t number = 0;
    atEveryCall(
        Fault::Kind::fail,
        [&](auto& connection) {
            lock(false);
            return connection.receive(number);
        },
        [&](auto& connection, const auto& answer) { check(connection, answer); },
        [&](auto& connection) {
            lock(true);
            number = ostrand::beginSettingDataProtection(connection, lowered).value();
            ASSERT_TRUE(ostrand::metadata(connection, container)); // is answered once the change is parked
        });
}
