#include "Client/Attributes.h"
#include "Client/CodeSigning.h"
#include "Client/Containers.h"
#include "Client/Maintenance.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "files/OSTTreeCopy.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
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

constexpr std::array classes{dataApplication, bundleApplication, sharedAppGroup};

/// What has reached the disk when the power fails.
enum class Reached {
    least, ///< what was waited for, and nothing else
    most,  ///< everything that was done
};

/// A command, and what has to be there for it.
struct Command {
    const char* name;
    std::function<bool(Connection&)> run;
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
    /// What would be found if the power failed now.
    void copyTo(const fs::path& directory, const std::string& name) const {
        const auto open = [](const fs::path& path) {
            return FileDescriptor(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        };
        const auto from = open(_file.parent_path()), to = open(directory);
        mustWork(ost::OSTCopyTree(from.get(), _file.filename().c_str(), to.get(), name.c_str()).has_value(),
                 "copy a disk");
    }

private:
    fs::path _file, _place;
};

/// The sandbox knows of no other place.
void expectItem(const GatedDevice& device, const std::string& identifier, const std::string& path) {
    const auto item = device.onHost("/private/var/db/sandbox-state/501/1") / identifier;
    if (fs::is_symlink(item)) {
        EXPECT_EQ(fs::read_symlink(item), path);
    }
}

/// What clients are told of a device, and what they find there.
std::string viewOf(const GatedDevice& device) {
    auto connection = device.connect();
    std::string view;
    for (const auto containerClass : classes) {
        const auto user = ost::usualUserOf(containerClass);
        const auto listed = listedContainers(connection, containerClass, false);
        for (const auto& [identifier, uuid] : listed) {
            const ostrand::ContainerReference reference{containerClass, user, identifier,
                                                        *ost::platform::UUID::parse(uuid)};
            const auto found = ostrand::metadata(connection, reference);
            mustWork(found.has_value(), "no metadata of " + identifier);
            const auto value = ostrand::infoValue(connection, reference, "k");
            const auto place = device.onHost(found->path);
            view += found->path;
            for (const auto& part : {identifier, uuid, value ? value->description() : "", tree(place)})
                view.append(" ").append(part);
            EXPECT_EQ(containersOnDisk(place.parent_path()), listed);
            if (containerClass == dataApplication)
                expectItem(device, identifier, found->path);
        }
    }
    const auto registered = ostrand::codeSigningInfo(connection, "b");
    return view + (registered ? registered->description() : "nothing registered");
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
        _device->startDaemon({}, [this](const GatedCall& call) { beforeEach(call); });
        mustWork(_device->waitForFirstPass(), "start");
    }

    /// Runs the command and keeps the disk as it was at each moment of it.
    void run(const Command& command) {
        _disk->settle();
        const auto before = viewOf(*_device);
        follow(true);
        auto connection = _device->connect();
        EXPECT_TRUE(command.run(connection)) << command.name;
        follow(false);
        const auto after = viewOf(*_device);
        for (unsigned number = 0; number < _kept; ++number) {
            SCOPED_TRACE(std::string(command.name) + ", moment " + std::to_string(number) + " of " +
                         std::to_string(_kept));
            const auto found = viewAfterPowerCut(_scratch / nameOf(number));
            const bool answered = number + 1 == _kept;
            EXPECT_TRUE(found == after || (!answered && found == before)) << "before:\n"
                                                                          << before << "\nafter:\n"
                                                                          << after << "\nfound:\n"
                                                                          << found;
            fs::remove(_scratch / nameOf(number));
        }
        states += std::exchange(_kept, 0U);
    }

    unsigned states = 0;

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

    std::string viewAfterPowerCut(const fs::path& file) {
        const Disk copy(file, _scratch / "after");
        GatedDevice booted(copy.place() / "device");
        booted.startDaemon();
        mustWork(booted.waitForFirstPass(), "start after a power cut");
        const auto view = viewOf(booted);
        EXPECT_EQ(leftovers(booted.image()), std::vector<std::string>());
        return view;
    }

    const fs::path _scratch = makeScratchDirectory(0755);
    std::optional<Disk> _disk;
    std::optional<GatedDevice> _device;
    std::mutex _mutex; ///< guards the rest
    bool _isRunning = false, _hasWaited = false;
    unsigned _kept = 0;
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

} // namespace

TEST_P(CrashStateTest, WhatWasAnsweredIsThereOnceAndWhole) {
    const auto data = named(dataApplication, "a"), bundle = named(bundleApplication, "b");
    const Command commands[] = {
        {"create", [&](auto& c) { return find(c, data).identifier == "a"; }},
        {"create a group", [&](auto& c) { return find(c, named(sharedAppGroup, "group.a")).identifier == "group.a"; }},
        {"create a bundle", [&](auto& c) { return find(c, bundle).identifier == "b"; }},
        // Before it is registered: a replacement that does not come to its end leaves the registration marked as stale.
        {"replace a bundle", [&](auto& c) { return replaceByTransient(c, bundleApplication, "b"); }},
        {"register", [&](auto& c) { return registerB(c, 1); }},
        {"set an info value",
         [&](auto& c) { return ostrand::setInfoValue(c, find(c, data), "k", OSTValue(std::uint64_t{1})).has_value(); }},
        {"change an info value",
         [&](auto& c) { return ostrand::setInfoValue(c, find(c, data), "k", OSTValue(std::uint64_t{2})).has_value(); }},
        {"regenerate", [&](auto& c) { return ostrand::regenerateDirectoryUUID(c, find(c, data)).has_value(); }},
        {"replace", [&](auto& c) { return replaceByTransient(c, dataApplication, "a"); }},
        {"wipe", [&](auto& c) { return ostrand::wipe(c, data).has_value(); }},
        {"register anew", [&](auto& c) { return registerB(c, 2); }},
        {"remove a registration", [&](auto& c) { return ostrand::removeCodeSigning(c, "b").has_value(); }},
        {"stage for deletion", [&](auto& c) { return ostrand::stageForDeletion(c, {find(c, bundle)}).has_value(); }},
        {"delete", [&](auto& c) { return ostrand::deleteContainer(c, data).has_value(); }},
        {"place where nothing is",
         [&](auto& c) { return ostrand::replace(c, {}, find(c, named(dataApplication, "a", true))).has_value(); }},
        {"delete what was placed", [&](auto& c) { return ostrand::deleteContainer(c, data).has_value(); }},
    };
    for (const auto& command : commands) {
        run(command);
        if (HasFailure())
            return;
    }
    std::cout << states << " states\n";
}

INSTANTIATE_TEST_SUITE_P(, CrashStateTest, testing::Values(Reached::least, Reached::most),
                         [](const auto& test) { return test.param == Reached::least ? "Least" : "Most"; });
