// What is done with whole trees and whole stores: disk usage, the repair of owners and ACLs, a start among many
// containers.

#include "Client/Containers.h"
#include "Client/Maintenance.h"
#include "Support/BootedDevice.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "files/OSTFileManager.h"
#include "support/BareWalk.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/InsideImage.h"
#include "support/LargeTree.h"
#include "support/Require.h"
#include "support/Stopwatch.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <stdexcept>
#include <string>
#include <thread>

namespace ost::benchmarks {

using test::BootedDevice;
using test::ChildProcess;
using test::makeScratchDirectory;

namespace {

using ostrand::ContainerClass;

void diskUsage(benchmark::State& state) {
    const BootedDevice device(makeScratchDirectory(0711) / "device");
    auto connection = connectTo(device);
    const auto container = createContainer(connection, "com.example.Sketches");
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

/// Every item is given away, relative to its directory where it is not open anyway.
void giveAway(const std::filesystem::path& tree, uid_t owner) {
    BareWalk{.item =
                 [=](int directory, const char* name) {
                     require(::fchownat(directory, name, owner, owner, AT_SYMLINK_NOFOLLOW) == 0, name);
                 },
             .directory = [=](int directory) { require(::fchown(directory, owner, owner) == 0, "fchown"); }}
        .run(tree);
}

void ownershipRepair(benchmark::State& state) {
    constexpr uid_t before = 501, after = 33;
    const auto tree = makeScratchDirectory(0711) / "tree";
    makeLargeTree(tree);
    const auto daemon = [&] {
        giveAway(tree, before);
        return secondsOf([&] {
            require(OSTFileManager::defaultManager().standardizeOwnershipAtURL(tree.native(), after, after),
                    "repair the ownership");
        });
    };
    const auto baseline = [&] {
        giveAway(tree, before);
        return secondsOf([&] { giveAway(tree, after); });
    };
    Comparison{
        .unit = Unit::seconds, .target = {Target::Kind::ratioAtMost, 1.3}, .daemon = daemon, .baseline = baseline}
        .run(state);
}

constexpr std::array aclAttributes{"system.posix_acl_access", "system.posix_acl_default"};

/// Owner and ACLs of an item.
struct Permissions {
    struct stat status;
    std::array<std::string, aclAttributes.size()> acls; ///< empty where there is none

    static Permissions of(const std::filesystem::path& path) {
        Permissions permissions{};
        require(::lstat(path.c_str(), &permissions.status) == 0, path);
        for (std::size_t i = 0; i < aclAttributes.size(); ++i) {
            std::array<char, 256> value;
            const auto size = ::lgetxattr(path.c_str(), aclAttributes[i], value.data(), value.size());
            permissions.acls[i].assign(value.data(), size > 0 ? static_cast<std::size_t>(size) : 0);
        }
        return permissions;
    }

    /// With the fewest calls: an ACL brings the mode along.
    void give(int item) const {
        require(::fchown(item, status.st_uid, status.st_gid) == 0, "fchown");
        for (std::size_t i = 0; i < aclAttributes.size(); ++i)
            if (!acls[i].empty())
                require(::fsetxattr(item, aclAttributes[i], acls[i].data(), acls[i].size(), 0) == 0, aclAttributes[i]);
    }
    /// The same for an item that may have other ACLs.
    void restore(int item) const {
        for (const auto* const attribute : aclAttributes)
            static_cast<void>(::fremovexattr(item, attribute));
        give(item);
        require(::fchmod(item, status.st_mode) == 0, "fchmod");
    }
};

void aclRepair(benchmark::State& state) {
    const auto image = makeScratchDirectory(0711) / "device";
    {
        const BootedDevice device(image); // which makes the group
    }
    const auto tree = image / "tree", directory = tree / "0", file = directory / "0";
    makeLargeTree(tree);
    const auto repair = [&] {
        return secondsInside(image, [] {
            return secondsOf([] {
                require(OSTFileManager::defaultManager().standardizeACLsForSystemContainerAtURL("/tree"),
                        "repair the ACLs");
            });
        });
    };
    const auto fileBefore = Permissions::of(file), directoryBefore = Permissions::of(directory);
    repair();
    const auto fileAfter = Permissions::of(file), directoryAfter = Permissions::of(directory);
    require(!fileAfter.acls[0].empty() && !directoryAfter.acls[1].empty(), "The ACLs are not set");
    const auto restore = [&] {
        BareWalk::opening([&](int item) { fileBefore.restore(item); }, [&](int item) { directoryBefore.restore(item); })
            .run(tree);
    };
    const auto giveAll = [&] {
        BareWalk::opening([&](int item) { fileAfter.give(item); }, [&](int item) { directoryAfter.give(item); })
            .run(tree);
    };
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.3},
               .daemon = [&] { return restore(), repair(); },
               .baseline = [&] { return restore(), secondsOf(giveAll); }}
        .run(state);
}

/// A device whose daemon is ended and started again.
class RestartingDevice {
public:
    explicit RestartingDevice(unsigned containers) {
        auto connection = connectTo(_device);
        for (unsigned number = 0; number < containers; ++number)
            createContainer(connection, identifierOf(number));
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
[[maybe_unused]] const int acls = registerComparison("ACL repair of 100,000 files", 7, aclRepair);
[[maybe_unused]] const int starts = registerComparison("restart to first answer, 10,000 containers", 7, start);

} // namespace

} // namespace ost::benchmarks
