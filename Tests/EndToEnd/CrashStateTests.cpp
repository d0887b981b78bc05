#include "Client/Attributes.h"
#include "Client/CodeSigning.h"
#include "Client/Containers.h"
#include "Client/Maintenance.h"
#include "Client/Upcall.h"
#include "EndToEnd/DeviceView.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "files/OSTTreeCopy.h"
#include "platform/codec/PropertyList.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <iostream>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

using namespace ost::test;
using ost::OSTDictionary;
using ost::OSTValue;
using ost::platform::FileDescriptor;
using ostrand::Connection;
using enum ost::OSTContainerClass;

namespace {

namespace fs = std::filesystem;

/// What has reached the disk when the power fails.
enum class Reached {
    least, ///< what was waited for, and nothing else
    most,  ///< everything that was done
};

/// A command. It is given a connection and the device's directory on the host.
struct Command {
    const char* name;
    std::function<bool(Connection&, const fs::path&)> run;
    Leaves leaves = Leaves::oneOfTwo;
};

void mustWork(bool worked, const std::string& what) {
    if (!worked)
        throw std::runtime_error(what);
}

/// A file that holds an ext4 with a journal, mounted, which writes nothing to it that nobody waits for.
class Disk {
public:
    Disk(fs::path file, fs::path place) : _file(std::move(file)), _place(std::move(place)) {
        fs::create_directories(_place);
        mustWork(ChildProcess({"mount", "-o", "loop,commit=600", _file, _place}, "/dev/null").wait() == 0, "mount");
    }
    Disk(const Disk&) = delete;
    Disk& operator=(const Disk&) = delete;
    ~Disk() { ::umount2(_place.c_str(), MNT_DETACH); }

    static void make(const fs::path& file) {
        const FileDescriptor made(::open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
        mustWork(made && ::ftruncate(made.get(), off_t{64} << 20) == 0, "make a disk");
        mustWork(
            ChildProcess({"mkfs.ext4", "-q", "-O", "has_journal", "-E", "lazy_itable_init=0,lazy_journal_init=0", file},
                         "/dev/null")
                    .wait() == 0,
            "mkfs.ext4");
    }
    [[nodiscard]] const fs::path& place() const { return _place; }
    void settle() const {
        const FileDescriptor top(::open(_place.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        mustWork(::syncfs(top.get()) == 0, "syncfs");
    }
    /// What would be found if the power failed now. A copy of that name is replaced.
    void copyTo(const fs::path& directory, const std::string& name) const { copy(_file, directory, name); }
    static void copy(const fs::path& file, const fs::path& directory, const std::string& name) {
        const auto open = [](const fs::path& path) {
            return FileDescriptor(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        };
        const auto from = open(file.parent_path()), to = open(directory);
        fs::remove(directory / name);
        mustWork(ost::OSTCopyTree(from.get(), file.filename().c_str(), to.get(), name.c_str()).has_value(),
                 "copy a disk");
    }

private:
    fs::path _file, _place;
};

/// The device of a disk, with a daemon that has just started. It is the first one since a boot of the device.
struct BootedDisk {
    BootedDisk(const fs::path& file, const fs::path& place, GatedCallWatcher watcher = {})
        : disk(file, place), device(disk.place() / "device") {
        device.startDaemon({}, std::move(watcher));
        mustWork(device.waitForFirstPass(), "start");
    }
    bool run(const Command& command) {
        auto connection = device.connect();
        return command.run(connection, device.image());
    }
    /// The same where the daemon may be killed, or the command has been done.
    void attempt(const Command& command) {
        try {
            run(command);
        } catch (const std::runtime_error&) {
            // The connection has ended.
        }
    }

    Disk disk;
    GatedDevice device;
};

bool changes(int call) {
    constexpr std::array calls{SYS_renameat, SYS_renameat2, SYS_unlinkat, SYS_mkdirat, SYS_symlinkat, SYS_write};
    return std::ranges::find(calls, call) != calls.end();
}

/// A device on such a disk. Runs only when it is asked for: it needs loop devices and some minutes.
class CrashStateTest : public testing::TestWithParam<Reached> {
protected:
    void SetUp() override {
        if (::getenv("OSTRAND_CRASH_STATES") == nullptr)
            GTEST_SKIP() << "tools/crash-states runs it";
        mustWork(::unshare(CLONE_NEWNS) == 0 && ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0,
                 "unshare");
        Disk::make(_scratch / "disk");
        _disk.emplace(_scratch / "disk", _scratch / "mounted");
        _device.emplace(_disk->place() / "device");
        start();
    }
    void TearDown() override {
        if (!IsSkipped())
            std::cout << _states << " states\n";
    }

    [[nodiscard]] GatedDevice& device() { return *_device; }
    void start() {
        _device->startDaemon({}, [this](const GatedCall& call) { beforeEach(call); });
        mustWork(_device->waitForFirstPass(), "start");
    }

    /// Runs the command and looks what a power cut leaves at each moment of it.
    void run(const Command& command) {
        _disk->settle();
        const auto before = viewOf(*_device);
        follow(true);
        auto connection = _device->connect();
        EXPECT_TRUE(command.run(connection, _device->image())) << command.name;
        follow(false);
        judge(command, before, viewOf(*_device));
    }

    /// The same with a start after a boot, which comes to the same end wherever it is cut.
    void runStart(const char* name, const DeviceView& expected) {
        _device->killDaemon();
        fs::remove(_device->onHost("/dev/shm/sem.ostrandd.fb_check"));
        _disk->settle();
        follow(true);
        start();
        follow(false);
        judge({name, {}}, expected, expected);
    }

    /// Kills the daemon after each change that it makes for the command, gives the next daemon the same command, and
    /// cuts the power as soon as that has answered.
    void killAndAskAgain(const Command& command) {
        _device->killDaemon();
        _disk->settle();
        _disk->copyTo(_scratch, "before");
        for (const unsigned call : changesOf(command)) {
            SCOPED_TRACE(std::string(command.name) + ", killed at call " + std::to_string(call));
            Disk::copy(_scratch / "before", _scratch, "killed");
            BootedDisk killed(_scratch / "killed", _scratch / "working");
            killed.device.daemon().prepare({.kind = Fault::Kind::kill, .call = call});
            killed.attempt(command);
            if (killed.device.daemon().conclude().faultedCall.empty())
                continue; // It has made fewer calls this time.
            killed.device.startDaemon();
            mustWork(killed.device.waitForFirstPass(), "start after a kill");
            killed.attempt(command); // It may have been done already.
            killed.disk.copyTo(_scratch, "cut");
            const auto told = viewOf(killed.device);
            const auto found = viewOf(BootedDisk(_scratch / "cut", _scratch / "after").device);
            ++_states;
            ASSERT_EQ(textOf(told), textOf(found));
        }
        start();
    }

private:
    static std::string nameOf(unsigned number) { return "state" + std::to_string(number); }

    void keep() {
        if (GetParam() == Reached::most)
            _disk->settle();
        _disk->copyTo(_scratch, nameOf(_kept++));
        _hasWaited = false;
    }
    /// Begins to keep what a power cut would leave, or ends it with what it leaves after the answer.
    void follow(bool begin) {
        const std::lock_guard lock(_mutex);
        _isRunning = begin;
        if (!begin)
            keep();
    }
    void beforeEach(const GatedCall& call) {
        const std::lock_guard lock(_mutex);
        // Without a wait the disk is as it was.
        if (_isRunning && (_hasWaited || GetParam() == Reached::most))
            keep();
        _hasWaited |= call.number == SYS_fsync || call.number == SYS_fdatasync || call.number == SYS_syncfs;
    }

    void judge(const Command& command, const DeviceView& before, const DeviceView& after) {
        for (unsigned number = 0; number < _kept; ++number) {
            SCOPED_TRACE(std::string(command.name) + ", moment " + std::to_string(number) + " of " +
                         std::to_string(_kept));
            const bool answered = number + 1 == _kept;
            BootedDisk booted(_scratch / nameOf(number), _scratch / "after");
            const auto found = viewOf(booted.device);
            EXPECT_EQ(leftovers(booted.device.image()), std::vector<std::string>());
            EXPECT_TRUE(found == after || (!answered && mayBeLeft(command.leaves, found, before, after)))
                << "before:\n"
                << textOf(before) << "\nafter:\n"
                << textOf(after) << "\nfound:\n"
                << textOf(found);
            if (command.leaves == Leaves::aTask) {
                EXPECT_TRUE(booted.run(command));
                EXPECT_EQ(textOf(viewOf(booted.device)), textOf(after));
            }
            fs::remove(_scratch / nameOf(number));
        }
        _states += std::exchange(_kept, 0U);
    }

    /// The calls right after those with which the daemon changes something for the command.
    std::vector<unsigned> changesOf(const Command& command) {
        Disk::copy(_scratch / "before", _scratch, "tried");
        std::vector<unsigned> found;
        std::atomic<bool> counts = false;
        unsigned number = 0;
        BootedDisk tried(_scratch / "tried", _scratch / "working", [&](const GatedCall& call) {
            if (counts && (++number, changes(call.number)))
                found.push_back(number + 1);
        });
        counts = true;
        EXPECT_TRUE(tried.run(command)) << command.name;
        tried.device.killDaemon(); // before what watches it
        return found;
    }

    const fs::path _scratch = makeScratchDirectory(0755);
    std::optional<Disk> _disk;
    std::optional<GatedDevice> _device;
    std::mutex _mutex; ///< guards the rest
    bool _isRunning = false, _hasWaited = false;
    unsigned _kept = 0, _states = 0;
};

ostrand::ContainerRequest named(ost::OSTContainerClass containerClass, const std::string& identifier,
                                bool transient = false) {
    return {containerClass, ost::usualUserOf(containerClass), identifier, transient};
}

ostrand::ContainerReference find(Connection& connection, const ostrand::ContainerRequest& request) {
    const auto found = ostrand::createOrLookup(connection, request, ostrand::WhenMissing::create);
    mustWork(found.has_value(), "no container");
    return {request.containerClass, request.user, found->identifier, found->uuid};
}

bool replaceByTransient(Connection& connection, ost::OSTContainerClass containerClass, const std::string& identifier) {
    const auto old = find(connection, named(containerClass, identifier));
    return ostrand::replace(connection, old, find(connection, named(containerClass, identifier, true))).has_value();
}

bool registerB(Connection& connection, std::uint64_t number) {
    return ostrand::registerCodeSigning(
               connection, {.identifier = "b",
                            .info = OSTDictionary(
                                {{"com.tamarok.Ostrand.Entitlements", OSTDictionary({{"number", OSTValue(number)}})}})})
        .has_value();
}

const Command upcall{"an upcall",
                     [](auto&, const fs::path& image) {
                         return ostrand::processContainers(image, {.containerIdentifier = "com.tamarok.pellord",
                                                                   .user = 501,
                                                                   .groups = {"group.x", "group.y"},
                                                                   .systemContainer = "com.tamarok.pellord"})
                             .has_value();
                     },
                     Leaves::parts};

const auto data = named(dataApplication, "a");
const Command creation{"create", [](auto& c, auto&) { return find(c, data).identifier == "a"; }};
const Command settingAValue{
    "set an info value", [](auto& c, auto&) {
        return ostrand::setInfoValue(c, find(c, data), "k", OSTValue(std::uint64_t{1})).has_value();
    }};
const Command regeneration{
    "regenerate", [](auto& c, auto&) { return ostrand::regenerateDirectoryUUID(c, find(c, data)).has_value(); }};
const Command replacement{"replace", [](auto& c, auto&) { return replaceByTransient(c, dataApplication, "a"); }};
const Command wipe{"wipe", [](auto& c, auto&) { return ostrand::wipe(c, data).has_value(); }};
const Command registrationAnew{"register anew", [](auto& c, auto&) { return registerB(c, 2); }};
const Command deletion{"delete", [](auto& c, auto&) { return ostrand::deleteContainer(c, data).has_value(); }};
const Command migration{"migrate", [](auto& c, auto&) { return ostrand::migrate(c).has_value(); }, Leaves::aTask};

/// Entitlements as older releases kept them: in a bundle, in data containers and in a file; and a group of nobody.
void prepareMigration(const GatedDevice& device) {
    auto connection = device.connect();
    const auto carry = [&](ost::OSTContainerClass containerClass, const char* identifier, const char* key,
                           const OSTValue& value) {
        mustWork(ostrand::setInfoValue(connection, find(connection, named(containerClass, identifier)), key, value)
                     .has_value(),
                 key);
    };
    const auto from = [](const char* where) { return OSTDictionary({{"from", OSTValue(std::string(where))}}); };
    carry(bundleApplication, "cached", "com.tamarok.Tessaly.CachedCodeSigningInfo",
          OSTDictionary({{"Entitlements", from("bundle")}}));
    for (const auto* const identifier : {"cached", "legacy", "grouped"})
        carry(dataApplication, identifier, "com.tamarok.Tessaly.GroupContainerIDs",
              ost::OSTArray{OSTValue(std::string("group.kept"))});
    for (const auto& container : {named(sharedAppGroup, "group.kept"), named(sharedAppGroup, "group.of-nobody"),
                                  named(dataSystem, "com.tamarok.pellord")})
        find(connection, container);
    writeFile(device.onHost("/private/var/root/Library/Ostrand/ost_entitlements.plist"),
              ost::platform::serializeBinaryPropertyList(
                  OSTDictionary({{"cached", from("legacy")}, {"legacy", from("legacy")}})));
}

} // namespace

TEST_P(CrashStateTest, WhatWasAnsweredIsThereOnceAndWhole) {
    const auto bundle = named(bundleApplication, "b");
    const Command commands[] = {
        creation,
        {"create a group",
         [&](auto& c, auto&) { return find(c, named(sharedAppGroup, "group.a")).identifier == "group.a"; }},
        {"create a bundle", [&](auto& c, auto&) { return find(c, bundle).identifier == "b"; }},
        // Before it is registered: a replacement that does not come to its end leaves the registration marked as stale.
        {"replace a bundle", [&](auto& c, auto&) { return replaceByTransient(c, bundleApplication, "b"); }},
        {"register", [&](auto& c, auto&) { return registerB(c, 1); }},
        settingAValue,
        {"change an info value",
         [&](auto& c, auto&) {
             return ostrand::setInfoValue(c, find(c, data), "k", OSTValue(std::uint64_t{2})).has_value();
         }},
        regeneration,
        replacement,
        wipe,
        registrationAnew,
        {"remove a registration", [&](auto& c, auto&) { return ostrand::removeCodeSigning(c, "b").has_value(); }},
        {"stage for deletion",
         [&](auto& c, auto&) { return ostrand::stageForDeletion(c, {find(c, bundle)}).has_value(); }},
        deletion,
        {"place where nothing is",
         [&](auto& c, auto&) {
             return ostrand::replace(c, {}, find(c, named(dataApplication, "a", true))).has_value();
         }},
        {"delete what was placed", [&](auto& c, auto&) { return ostrand::deleteContainer(c, data).has_value(); }},
    };
    for (const auto& command : commands) {
        run(command);
        if (HasFailure())
            return;
    }
}

TEST_P(CrashStateTest, AClassThatChangesIsRecordedWhenAllItemsHaveIt) {
    auto connection = device().connect();
    const auto container = find(connection, data);
    const auto place = device().onHost(ostrand::metadata(connection, container)->path);
    for (const char* file : {"Documents/a/note", "Documents/b", "Library/c"})
        writeFile(place / file, "a person's");
    for (const std::int64_t protectionClass : {1, 4})
        run({"change the class",
             [&](auto& c, auto&) {
                 return ostrand::setDataProtection(c, {dataApplication, 501, "a", protectionClass}).has_value();
             },
             Leaves::parts});
}

TEST_P(CrashStateTest, AnUpcallMakesWholeContainers) { run(upcall); }

TEST_P(CrashStateTest, AMigrationLosesNothingAndIsMadeGoodByTheNext) {
    prepareMigration(device());
    run(migration);
}

TEST_P(CrashStateTest, AStartAfterAnUpgradeLosesNothing) {
    auto connection = device().connect();
    for (const auto& container : {named(bundleApplication, "b"), named(bundleFramework, "f"),
                                  named(dataApplication, "a"), named(dataSystem, "com.tamarok.pellord")})
        find(connection, container);
    const auto expected = viewOf(device());
    const auto var = device().onHost("/private/var");
    const auto old = var / "mobile/Containers/Bundle";
    fs::create_directories(old / "Framework");
    // One class as a whole, and one container into a class that is there.
    fs::rename(var / "containers/Bundle/Application", old / "Application");
    for (const auto& name : namesIn(var / "containers/Bundle/Framework"))
        fs::rename(var / "containers/Bundle/Framework" / name, old / "Framework" / name);
    fs::rename(var / "containers/Data/System/com.tamarok.pellord",
               var / "containers/Data/System/0F0F0F0F-1111-4222-8333-444444444444");
    runStart("start after an upgrade", expected);
    EXPECT_FALSE(fs::exists(old));
    EXPECT_TRUE(fs::exists(var / "containers/Data/System/com.tamarok.pellord/tmp"));
}

TEST_P(CrashStateTest, WhatADaemonAnswersAfterAKilledOneIsThere) {
    if (GetParam() == Reached::most)
        GTEST_SKIP() << "Nothing can be missing";
    ASSERT_NO_FATAL_FAILURE(killAndAskAgain(creation));
    auto connection = device().connect();
    find(connection, data);
    mustWork(registerB(connection, 1), "register");
    prepareMigration(device());
    const Command commands[] = {
        settingAValue,
        regeneration,
        replacement,
        {"replace a bundle", [&](auto& c, auto&) { return replaceByTransient(c, bundleApplication, "cached"); }},
        wipe,
        registrationAnew,
        deletion,
        {"change the class",
         [&](auto& c, auto&) { return ostrand::setDataProtection(c, {dataApplication, 501, "a", 1}).has_value(); }},
        upcall,
        migration,
    };
    for (const auto& command : commands)
        ASSERT_NO_FATAL_FAILURE(killAndAskAgain(command));
}

INSTANTIATE_TEST_SUITE_P(, CrashStateTest, testing::Values(Reached::least, Reached::most),
                         [](const auto& test) { return test.param == Reached::least ? "Least" : "Most"; });
