// What is done with whole trees and whole stores: disk usage, the repair of owners, a start among many containers.

#include "Client/Containers.h"
#include "Client/Maintenance.h"
#include "Support/BootedDevice.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "files/OSTFileManager.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/LargeTree.h"
#include "support/Require.h"
#include "support/Stopwatch.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>

namespace ost::benchmarks {

using test::BootedDevice;
using test::ChildProcess;
using test::makeScratchDirectory;

namespace {

using ostrand::ContainerClass;
using platform::FileDescriptor;

ostrand::Container create(ostrand::Connection& connection, const std::string& identifier) {
    return require(ostrand::createOrLookup(
                       connection, {.containerClass = ContainerClass::dataApplication, .identifier = identifier},
                       ostrand::WhenMissing::create),
                   "create a container");
}

void diskUsage(benchmark::State& state) {
    const BootedDevice device(makeScratchDirectory(0711) / "device");
    auto connection = connectTo(device);
    const auto container = create(connection, "com.example.Sketches");
    makeLargeTree(device.onHost(container.path) / "Documents/tree");
    const ostrand::ContainerReference reference{
        .containerClass = ContainerClass::dataApplication, .identifier = container.identifier, .uuid = container.uuid};
    const auto daemon = [&] {
        return secondsOf([&] { require(ostrand::diskUsage(connection, reference), "measure the disk usage"); });
    };
    const auto baseline = [&] {
        return secondsOf([&] {
            ChildProcess measuring({"du", "-s", device.onHost(container.path)});
            if (measuring.readAll().empty() || measuring.wait() != 0)
                throw std::runtime_error("du fails");
        });
    };
    Comparison{
        .unit = Unit::seconds, .target = {Target::Kind::ratioAtMost, 0.5}, .daemon = daemon, .baseline = baseline}
        .run(state);
}

/// The bare walk: every item is given away relative to its directory.
void giveAway(FileDescriptor top, uid_t owner) {
    const auto close = [](DIR* stream) { ::closedir(stream); };
    const std::unique_ptr<DIR, decltype(close)> stream(::fdopendir(top.get()));
    require(static_cast<bool>(stream), "fdopendir");
    const int directory = top.release();
    while (const dirent* const entry = ::readdir(stream.get())) {
        const std::string_view name = entry->d_name;
        if (name == "." || name == "..")
            continue;
        require(::fchownat(directory, entry->d_name, owner, owner, AT_SYMLINK_NOFOLLOW) == 0, entry->d_name);
        if (entry->d_type == DT_DIR)
            giveAway(
                FileDescriptor(::openat(directory, entry->d_name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC)),
                owner);
    }
}

void ownershipRepair(benchmark::State& state) {
    constexpr uid_t before = 501, after = 33;
    const auto tree = makeScratchDirectory(0711) / "tree";
    makeLargeTree(tree);
    const auto giveAllAway = [&](uid_t owner) {
        giveAway(FileDescriptor(::open(tree.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)), owner);
    };
    const auto daemon = [&] {
        giveAllAway(before);
        return secondsOf([&] {
            require(OSTFileManager::defaultManager().standardizeOwnershipAtURL(tree.native(), after, after),
                    "repair the ownership");
        });
    };
    const auto baseline = [&] {
        giveAllAway(before);
        return secondsOf([&] { giveAllAway(after); });
    };
    Comparison{
        .unit = Unit::seconds, .target = {Target::Kind::ratioAtMost, 1.3}, .daemon = daemon, .baseline = baseline}
        .run(state);
}

/// A device whose daemon is ended and started again.
class RestartingDevice {
public:
    explicit RestartingDevice(unsigned containers) {
        auto connection = connectTo(_device);
        for (unsigned number = 0; number < containers; ++number)
            create(connection, identifierOf(number));
    }

    /// From the end of one daemon to what the next one answers first, in a class that has no containers.
    double secondsToFirstAnswer() {
        std::this_thread::sleep_for(launcherWait);
        return secondsOf([&] {
            _device.killDaemon();
            auto connection = connectTo(_device);
            const auto answer = ostrand::createOrLookup(
                connection, {.containerClass = ContainerClass::dataVPNPlugin, .identifier = "com.example.missing"},
                ostrand::WhenMissing::fail);
            if (answer || answer.error() != ostrand::Error::failed(notFound))
                throw std::runtime_error("The daemon does not answer");
        });
    }

private:
    static constexpr std::uint64_t notFound = 21;
    static std::string identifierOf(unsigned number) { return "com.example.Sketches." + std::to_string(number); }
    /// A daemon that ends sooner than this after its start is started again later.
    static constexpr std::chrono::milliseconds launcherWait{1100};

    BootedDevice _device{makeScratchDirectory(0711) / "device"};
};

void start(benchmark::State& state) {
    constexpr unsigned many = 10'000;
    RestartingDevice crowded(many);
    RestartingDevice empty(0);
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::valueAtMost, 0.020},
               .daemon = [&] { return crowded.secondsToFirstAnswer(); },
               .baseline = [&] { return empty.secondsToFirstAnswer(); }}
        .run(state);
}

[[maybe_unused]] const int usage = registerComparison("disk usage of 100,000 files", 7, diskUsage);
[[maybe_unused]] const int repair = registerComparison("ownership repair of 100,000 files", 7, ownershipRepair);
[[maybe_unused]] const int starts = registerComparison("restart to first answer, 10,000 containers", 7, start);

} // namespace

} // namespace ost::benchmarks
