// Staging for deletion, destruction and replacement, beside the same moves, writes and removals without a daemon.

#include "Client/Containers.h"
#include "Support/BootedDevice.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "platform/base/UUID.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/JournaledFileSystem.h"
#include "support/LargeTree.h"
#include "support/OneProcessor.h"
#include "support/Require.h"
#include "support/Stopwatch.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <future>
#include <stdexcept>
#include <string>
#include <vector>

namespace ost::benchmarks {

using test::BootedDevice;
using test::ChildProcess;
using test::makeScratchDirectory;

namespace {

using ostrand::ContainerClass;
using platform::FileDescriptor;
using platform::UUID;

/// Few enough that a turn is short against the drift of the disk.
constexpr unsigned containersInTurn = 24;

std::string newIdentifier() {
    static unsigned number = 0;
    return "com.example.Sketches." + std::to_string(++number);
}

ostrand::ContainerReference referenceTo(const ostrand::Container& container) {
    return {
        .containerClass = ContainerClass::dataApplication, .identifier = container.identifier, .uuid = container.uuid};
}

FileDescriptor openDirectory(const std::filesystem::path& path) {
    std::filesystem::create_directories(path);
    FileDescriptor directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    require(static_cast<bool>(directory), path);
    return directory;
}

/// The directories between which containers move, without a daemon.
class BareStore {
public:
    explicit BareStore(const std::filesystem::path& path)
        : _live(openDirectory(path / "live")), _staging(openDirectory(path / "staging")),
          _dead(openDirectory(path / "dead")), _replace(openDirectory(path / "replace")),
          _sandbox(openDirectory(path / "sandbox")) {}

    /// Something to be moved about, as deep as a container.
    [[nodiscard]] std::string make() const {
        const auto name = UUID::generate().string();
        require(::mkdirat(_live.get(), name.c_str(), 0755) == 0, name);
        require(::symlinkat("/", _sandbox.get(), name.c_str()) == 0, name);
        return name;
    }

    /// What is there is on disk, as a daemon's containers are.
    void settle() const { require(::syncfs(_live.get()) == 0, "syncfs"); }

    /// In a way that a power cut does not undo.
    void stageForDeletion(const std::vector<std::string>& names) const {
        for (const auto& name : names) {
            _move(_live, name, _dead);
            require(::unlinkat(_sandbox.get(), name.c_str(), 0) == 0, name);
        }
        require(::fsync(_live.get()) == 0, "wait for what was staged");
    }

    /// With what a crash must find, and what a power cut must not forget.
    void replace(const std::string& oldName, const std::string& newName) const {
        const auto token = UUID::generate().string();
        const FileDescriptor file(::openat(_replace.get(), "new", O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        const std::string paths(500, 'x');
        require(::write(file.get(), paths.data(), paths.size()) == static_cast<ssize_t>(paths.size()), token);
        require(::fdatasync(file.get()) == 0, token);
        require(::renameat(_replace.get(), "new", _replace.get(), token.c_str()) == 0, token);
        require(::fsync(_replace.get()) == 0, token);
        require(::renameat(_live.get(), oldName.c_str(), _staging.get(), token.c_str()) == 0, oldName);
        require(::fsync(_staging.get()) == 0 && ::fsync(_live.get()) == 0, oldName);
        require(::renameat(_live.get(), newName.c_str(), _live.get(), oldName.c_str()) == 0, newName);
        require(::symlinkat("/", _sandbox.get(), token.c_str()) == 0, token);
        require(::renameat(_sandbox.get(), token.c_str(), _sandbox.get(), newName.c_str()) == 0, token);
        require(::fsync(_sandbox.get()) == 0 && ::fsync(_live.get()) == 0, newName);
        _move(_staging, token, _newDirectoryOfDead());
        _move(_replace, token, _newDirectoryOfDead());
    }

private:
    static void _move(const FileDescriptor& from, const std::string& name, const FileDescriptor& to) {
        require(::renameat(from.get(), name.c_str(), to.get(), name.c_str()) == 0, name);
    }
    [[nodiscard]] FileDescriptor _newDirectoryOfDead() const {
        const auto name = UUID::generate().string();
        require(::mkdirat(_dead.get(), name.c_str(), 0700) == 0, name);
        return FileDescriptor(::openat(_dead.get(), name.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    }

    FileDescriptor _live, _staging, _dead, _replace, _sandbox;
};

void staging(benchmark::State& state) {
    const OneProcessor oneProcessor;
    const JournaledFileSystem disk;
    const BootedDevice device(disk.path() / "device");
    auto connection = connectTo(device);
    const BareStore bare(disk.path() / "bare");
    const auto daemon = [&] {
        std::vector<ostrand::ContainerReference> containers;
        for (unsigned made = 0; made < containersInTurn; ++made)
            containers.push_back(referenceTo(createContainer(connection, newIdentifier())));
        return secondsOf([&] { require(ostrand::stageForDeletion(connection, containers), "stage for deletion"); }) /
               containersInTurn;
    };
    const auto baseline = [&] {
        std::vector<std::string> names;
        for (unsigned made = 0; made < containersInTurn; ++made)
            names.push_back(bare.make());
        return secondsOf([&] { bare.stageForDeletion(names); }) / containersInTurn;
    };
    Comparison{
        .unit = Unit::seconds, .target = {Target::Kind::ratioAtMost, 1.5}, .daemon = daemon, .baseline = baseline}
        .run(state);
}

void replacement(benchmark::State& state) {
    const JournaledFileSystem disk;
    const BootedDevice device(disk.path() / "device");
    auto connection = connectTo(device);
    const BareStore bare(disk.path() / "bare");
    const auto daemon = [&] {
        double seconds = 0;
        for (unsigned made = 0; made < containersInTurn; ++made) {
            const auto identifier = newIdentifier();
            const auto oldContainer = createContainer(connection, identifier);
            const auto newContainer = createContainer(connection, identifier, true);
            seconds += secondsOf([&] {
                require(ostrand::replace(connection, referenceTo(oldContainer), referenceTo(newContainer)), "replace");
            });
        }
        return seconds / containersInTurn;
    };
    const auto baseline = [&] {
        double seconds = 0;
        for (unsigned made = 0; made < containersInTurn; ++made) {
            const auto oldName = bare.make(), newName = bare.make();
            bare.settle();
            seconds += secondsOf([&] { bare.replace(oldName, newName); });
        }
        return seconds / containersInTurn;
    };
    Comparison{
        .unit = Unit::seconds, .target = {Target::Kind::ratioAtMost, 1.5}, .daemon = daemon, .baseline = baseline}
        .run(state);
}

/// A device on which a container with a large tree waits on death row, each time anew.
class DeviceWithWaste {
public:
    ostrand::Connection& connection() { return _connection; }

    void makeWaste() {
        const auto container = createContainer(_connection, newIdentifier());
        makeLargeTree(_device.onHost(container.path) / "Documents/tree");
        require(ostrand::stageForDeletion(_connection, {referenceTo(container)}), "stage for deletion");
    }
    void destroyWaste() const {
        auto connection = connectTo(_device);
        require(ostrand::destroyDeathRow(connection), "destroy what is on death row");
    }

private:
    BootedDevice _device{makeScratchDirectory(0711) / "device"};
    ostrand::Connection _connection = connectTo(_device);
};

void destruction(benchmark::State& state) {
    DeviceWithWaste device;
    const auto bare = makeScratchDirectory(0711);
    const auto daemon = [&] {
        device.makeWaste();
        return secondsOf([&] { device.destroyWaste(); });
    };
    const auto baseline = [&] {
        makeLargeTree(bare / "tree");
        return secondsOf([&] {
            if (ChildProcess({"rm", "-rf", bare / "tree"}).wait() != 0)
                throw std::runtime_error("rm fails");
        });
    };
    Comparison{
        .unit = Unit::seconds, .target = {Target::Kind::ratioAtMost, 0.8}, .daemon = daemon, .baseline = baseline}
        .run(state);
}

/// Look-ups while a large tree is destroyed, beside look-ups while nothing else happens.
void lookUpsMeanwhile(benchmark::State& state) {
    constexpr std::chrono::milliseconds duration{300};
    DeviceWithWaste device;
    createContainer(device.connection(), "com.example.found");
    const auto secondsEach = [&](const std::function<bool()>& goesOn) {
        unsigned count = 0;
        const auto seconds = secondsOf([&] {
            for (; goesOn(); ++count)
                createContainer(device.connection(), "com.example.found");
        });
        return seconds / std::max(1U, count);
    };
    const auto daemon = [&] {
        device.makeWaste();
        auto destroyed = std::async(std::launch::async, [&] { device.destroyWaste(); });
        const auto seconds =
            secondsEach([&] { return destroyed.wait_for(std::chrono::seconds(0)) != std::future_status::ready; });
        destroyed.get();
        return seconds;
    };
    const auto baseline = [&] {
        const auto end = Clock::now() + duration;
        return secondsEach([&] { return Clock::now() < end; });
    };
    Comparison{
        .unit = Unit::seconds, .target = {Target::Kind::ratioAtMost, 1.5}, .daemon = daemon, .baseline = baseline}
        .run(state);
}

[[maybe_unused]] const int stagings = registerComparison("staging a container for deletion", 31, staging);
[[maybe_unused]] const int replacements = registerComparison("replacement", 15, replacement);
[[maybe_unused]] const int destructions = registerComparison("destruction of 100,000 files", 7, destruction);
[[maybe_unused]] const int beside = registerComparison("look-up while they are destroyed", 7, lookUpsMeanwhile);

} // namespace

} // namespace ost::benchmarks
