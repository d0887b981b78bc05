#include "files/OSTFileManager.h"
#include "platform/base/FileDescriptor.h"
#include "platform/device/Applications.h"
#include "platform/device/DeviceLockState.h"
#include "platform/threads/Transactions.h"
#include "protection/OSTDataProtectionManager.h"
#include "protection/OSTLockStateQueue.h"
#include "store/OSTLocks.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <future>
#include <initializer_list>
#include <map>
#include <memory>
#include <thread>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;

constexpr auto record = test::recordProtectionClass;

/// "-" when none is recorded.
std::string recorded(const fs::path& item) { return test::recordedProtectionClass(item).value_or("-"); }

bool setImmutable(const fs::path& file, bool immutable) {
    const platform::FileDescriptor opened(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
    const long flags = immutable ? FS_IMMUTABLE_FL : 0;
    return ::ioctl(opened.get(), FS_IOC_SETFLAGS, &flags) == 0;
}

class DataProtection : public test::StoreTest {
protected:
    /// The code of a change that ends at once.
    int change(std::int32_t protectionClass, bool outsideDeveloper = false, bool retryIfLocked = false) {
        auto code = begin(protectionClass, outsideDeveloper, retryIfLocked);
        return isReady(code) ? code.get() : -1;
    }
    std::future<int> begin(std::int32_t protectionClass, bool outsideDeveloper, bool retryIfLocked) {
        std::promise<int> code;
        auto future = code.get_future();
        OSTDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
            {.container = {OSTDefaultUserId, dataApplication, "a"},
             .dataProtectionClass = protectionClass,
             .isSecondOrThirdPartyApp = outsideDeveloper,
             .retryIfLocked = retryIfLocked},
            [code = std::move(code)](OSTErrorCode value) mutable { code.set_value(static_cast<int>(value)); });
        return future;
    }
    static bool isReady(const std::future<int>& code) {
        return code.wait_for(std::chrono::seconds(0)) == std::future_status::ready;
    }

    static void lockDevice(bool locked) {
        ASSERT_TRUE(platform::writeDeviceLockState(locked ? platform::deviceLocked : platform::deviceUnlocked));
        brevind_notification_callback();
    }

    /// The recorded class of the container, "-" when there is none.
    std::string recordedClass() const {
        const auto now = cached(dataApplication, "a");
        const auto* const value = now && now->info ? now->info->find(OSTContentProtectionClassKey) : nullptr;
        return value ? value->description() : "-";
    }
    void setRecordedClass(const OSTValue& value) const {
        ASSERT_TRUE(store().setInfoValue(value, OSTContentProtectionClassKey, {container->name(), container->uuid}));
    }

    const OSTMetadataRecord container = make(dataApplication, "a");
    const fs::path url = container->url;
};

TEST_F(DataProtection, WhatWaitsForAnUnlockFollowsTheStateHoweverOftenItIsSeen) {
    const auto see = [](std::initializer_list<int> states) {
        for (const int state : states) {
            ASSERT_TRUE(platform::writeDeviceLockState(state));
            brevind_notification_callback();
        }
    };
    const auto runs = [&] {
        auto ran = std::make_shared<std::promise<int>>();
        run_when_unlocked([ran] { ran->set_value(0); });
        return ran->get_future();
    };
    for (int turn = 0; turn < 2; ++turn) {
        see({1, 1, 2});
        const auto waiting = runs();
        see({1, 2});
        EXPECT_FALSE(isReady(waiting));
        see({0, 0, 2});
        EXPECT_EQ(waiting.wait_for(std::chrono::minutes(1)), std::future_status::ready);
        EXPECT_EQ(runs().wait_for(std::chrono::minutes(1)), std::future_status::ready) << "in no known state";
    }
}

TEST_F(DataProtection, RefusesWhatCannotBeMeant) {
    const auto codeFor = [](const OSTContainerName& name, std::int32_t protectionClass) {
        int code = 0;
        OSTDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
            {.container = name, .dataProtectionClass = protectionClass},
            [&](OSTErrorCode value) { code = static_cast<int>(value); });
        return code;
    };
    EXPECT_EQ(codeFor({501, dataApplication, std::nullopt}, 1), 11);
    for (const auto containerClass : {undefined, bundleApplication, dataSystem, sharedSystemGroup, max})
        EXPECT_EQ(codeFor({501, containerClass, "a"}, 1), 11);
    EXPECT_EQ(codeFor({501, dataApplication, "b"}, 1), 21);
    make(dataApplication, "t", true);
    EXPECT_EQ(codeFor({501, dataApplication, "t"}, 1), 21) << "a transient one";

    EXPECT_EQ(change(3), 1) << "what it counts as";
    EXPECT_EQ(recordedClass(), "-");
    EXPECT_EQ(change(2), 38);
    for (const std::int32_t refused : {-1, 2, 4, 5})
        EXPECT_EQ(change(refused, true), 38) << refused;
    EXPECT_EQ(recordedClass(), "-");
    setRecordedClass(OSTValue(std::uint64_t{2}));
    EXPECT_EQ(change(2), 1) << "the class that it has";
    setRecordedClass(OSTValue("2"));
    EXPECT_EQ(change(3), 1) << "what is no number counts as 3";
}

TEST_F(DataProtection, ChangesTheItemsThatTheTypeOfTheChangeSays) {
    struct Case {
        const char *current, *requested; ///< of the container
        const char *file, *expectedFile; ///< "-": none is recorded
        const char *directory, *expectedDirectory;
    };
    // A lower class, or one with keys in the place of none, is for files too, and never raises theirs.
    const Case cases[] = {
        {"3", "1", "3", "1", "3", "1"}, {"3", "1", "-", "1", "-", "1"}, {"3", "1", "0", "0", "0", "1"},
        {"3", "1", "2", "2", "2", "2"}, {"3", "1", "4", "1", "4", "1"}, {"3", "0", "3", "3", "3", "0"},
        {"3", "0", "4", "3", "4", "0"}, {"1", "3", "1", "1", "1", "3"}, {"1", "3", "2", "2", "2", "2"},
        {"0", "1", "3", "1", "0", "1"}, {"0", "3", "4", "4", "0", "3"}, {"3", "4", "3", "3", "3", "4"},
    };
    const auto file = url / "Documents/directory/file";
    const auto directory = file.parent_path();
    for (const auto& [current, requested, hasFile, expectedFile, hasDirectory, expectedDirectory] : cases) {
        fs::remove_all(directory);
        test::writeFile(file, "");
        setRecordedClass(OSTValue(static_cast<std::int64_t>(std::atoi(current))));
        for (const auto& [item, has] : std::map<fs::path, std::string>{{file, hasFile}, {directory, hasDirectory}})
            if (has != "-")
                record(item, has);
        const auto name = std::string(current) + " to " + requested + ", file " + hasFile;
        EXPECT_EQ(change(std::atoi(requested)), 1) << name;
        EXPECT_EQ(recorded(file), expectedFile) << name;
        EXPECT_EQ(recorded(directory), expectedDirectory) << name;
        EXPECT_EQ(recordedClass(), requested) << name;
    }
}

TEST_F(DataProtection, TouchesNothingButTheDataItems) {
    test::writeFile("/victim/file", "");
    test::writeFile("/private/var/mobile/file", "");
    test::writeFile(url / "Other/file", "");
    fs::remove_all(url / "Library");
    fs::create_symlink("/victim", url / "Library");
    fs::create_symlink("/victim/file", url / "Documents/link");
    fs::create_hard_link("/private/var/mobile/file", url / "Documents/name");
    ASSERT_EQ(::mkfifo((url / "Documents/fifo").c_str(), 0666), 0);
    test::writeFile(url / "Documents/twice", "");
    fs::create_hard_link(url / "Documents/twice", url / "tmp/again");
    for (const auto* const name : {"tmp/mount", "Quibbet"}) {
        fs::create_directory(url / name);
        mountOver(url / name);
        test::writeFile(url / name / "file", "");
    }

    EXPECT_EQ(change(1), 1);
    for (const fs::path& item : {fs::path("/victim"), fs::path("/victim/file"), fs::path("/private/var/mobile/file"),
                                 url / "Other", url / "Other/file", url / "Documents/fifo", url / "tmp/mount",
                                 url / "tmp/mount/file", url / "Quibbet", url / "Quibbet/file", url / "Library"})
        EXPECT_EQ(recorded(item), "-") << item;
    EXPECT_EQ(recorded(url), "0") << "the container itself";
    EXPECT_EQ(recorded(url / OSTMetadataFileName), "4");
    EXPECT_EQ(recorded(url / "tmp/again"), "1") << "all of its names are data";
    EXPECT_EQ(recorded(url / "Documents"), "1");
}

TEST_F(DataProtection, AContainerWithoutDataGetsTheClassAllTheSame) {
    for (const auto* const name : {"Documents", "Library", "tmp"})
        fs::remove_all(url / name);
    EXPECT_EQ(change(1), 1);
    EXPECT_EQ(recordedClass(), "1");
}

TEST_F(DataProtection, ALockedDeviceIsAFailureOrAReasonToWait) {
    const auto file = url / "Documents/file";
    test::writeFile(file, "");
    record(file, "4");
    lockDevice(true);
    EXPECT_EQ(change(1), 61);
    EXPECT_EQ(recordedClass(), "-");
    auto first = begin(1, false, true), second = begin(0, false, true);
    EXPECT_FALSE(isReady(first));
    EXPECT_EQ(platform::Transactions::shared().describeOpen(), "com.tamarok.ostrandd.lockstate (2)");
    lockDevice(false);
    EXPECT_EQ(first.get(), 1);
    EXPECT_EQ(second.get(), 1);
    EXPECT_EQ(recordedClass(), "0") << "in the order in which they were asked for";
    EXPECT_FALSE(fs::exists(std::string(platform::assertionsDirectory) + "/a")) << "the assertion has gone";
}

TEST_F(DataProtection, AParkedChangeIsCancelledWhenTheContainerIsAnotherOne) {
    const OSTContainerReference reference{container->name(), container->uuid};
    const auto codeAfter = [&](const auto& meanwhile) {
        lockDevice(true);
        auto code = begin(1, false, true);
        EXPECT_FALSE(isReady(code));
        meanwhile();
        lockDevice(false);
        return code.get();
    };
    EXPECT_EQ(codeAfter([&] { ASSERT_TRUE(store().regenerateDirectoryUUIDForUser(reference)); }), 10);
    const auto wipe = [&] { // another directory under the old one's name and UUID
        const auto fresh = make(dataApplication, "a", true);
        ASSERT_TRUE(store().replaceContainer(
            {.oldContainer = reference, .newContainer = {fresh->name(), fresh->uuid}, .preserveOldUUID = true}));
    };
    EXPECT_EQ(codeAfter(wipe), 10);
    EXPECT_EQ(codeAfter([&] { ASSERT_TRUE(store().deleteContainerForUser(container->name())); }), 21);
}

TEST_F(DataProtection, OfTwoChangesAtTheSameTimeOneHasTheItemsAndTheRecord) {
    for (int directory = 0; directory < 50; ++directory)
        fs::create_directory(url / "Documents" / std::to_string(directory));
    const auto has = [&](const std::string& protectionClass) {
        return std::ranges::all_of(fs::directory_iterator(url / "Documents"),
                                   [&](const fs::path& item) { return recorded(item) == protectionClass; });
    };
    for (int round = 0; round < 20 && !HasFailure(); ++round) {
        auto other = std::async(std::launch::async, [&] { return change(4); });
        EXPECT_EQ(change(1), 1);
        EXPECT_EQ(other.get(), 1);
        EXPECT_TRUE(has(recordedClass())) << recordedClass();
        EXPECT_EQ(change(0), 1);
    }
}

TEST_F(DataProtection, AContainerThatIsWipedWhenItWasChangedHasNoClassOnRecord) {
    const auto last = url / "Quibbet", aside = fs::path("/aside");
    fs::create_directory(last);
    std::future<int> code;
    {
        const OSTIdentifierLock beforeTheRecord({container->uuid.string()}, OSTLockKind::reading);
        code = std::async(std::launch::async, [&] { return change(1); });
        while (recorded(last) != "1")
            std::this_thread::yield();
        fs::rename(url, aside);
        fs::copy(aside, url, fs::copy_options::recursive);
    }
    EXPECT_EQ(code.get(), 1);
    EXPECT_EQ(recordedClass(), "-");
}

TEST_F(DataProtection, AnItemThatMayNotBeChangedEndsTheChange) {
    const auto file = url / "Documents/file";
    test::writeFile(file, "");
    if (!setImmutable(file, true))
        GTEST_SKIP() << "the file system knows no immutable files: " << std::strerror(errno);
    EXPECT_EQ(change(1, false, true), 1) << "errno 1, which ends it";
    ASSERT_TRUE(setImmutable(file, false));
    EXPECT_EQ(recordedClass(), "-");
}

} // namespace
} // namespace ost
