// What containers carry: info values, which survive a power cut when they are answered, and changes of the protection
// class of a large container.

#include "Client/Attributes.h"
#include "Support/BootedDevice.h"
#include "Support/ScratchDirectory.h"
#include "support/BareWalk.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/JournaledFileSystem.h"
#include "support/LargeTree.h"
#include "support/OneProcessor.h"
#include "support/Require.h"
#include "support/RoundTrips.h"
#include "support/Stopwatch.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <functional>
#include <future>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace ost::benchmarks {

using test::BootedDevice;
using test::makeScratchDirectory;

namespace {

using ostrand::ContainerClass;
using platform::FileDescriptor;

constexpr std::uint64_t user = 501;
constexpr const char* key = "com.example.Sketches.LastOpened";

/// A connection and a container, which is made when it is not there.
class Owner {
public:
    Owner(const BootedDevice& device, const std::string& identifier) : _connection(connectTo(device)) {
        const auto made = createContainer(_connection, identifier);
        container = {ContainerClass::dataApplication, user, identifier, made.uuid};
        path = device.onHost(made.path);
    }

    void setInfoValues(unsigned count) {
        for (unsigned i = 0; i < count; ++i)
            require(ostrand::setInfoValue(_connection, container, key, OSTValue(std::uint64_t{++_value})), "set");
    }
    /// Gives the container another class, from the one that a new container counts as.
    void setProtectionClass(std::int64_t protectionClass) {
        require(ostrand::setInfoValue(_connection, container, ostrand::protectionClassKey, std::nullopt), "reset");
        require(
            ostrand::setDataProtection(
                _connection, {.user = user, .identifier = container.identifier, .protectionClass = protectionClass}),
            "change the class");
    }

    ostrand::ContainerReference container;
    std::filesystem::path path;

private:
    ostrand::Connection _connection;
    std::uint64_t _value = 0;
};

/// The fewest system calls that replace a file so that it survives a power cut.
void replaceFile(int directory, const std::string& content) {
    const FileDescriptor file(::openat(directory, "new", O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
    require(::write(file.get(), content.data(), content.size()) == static_cast<ssize_t>(content.size()), "write");
    require(::fdatasync(file.get()) == 0, "fdatasync");
    require(::renameat(directory, "new", directory, "file") == 0 && ::fsync(directory) == 0, "rename");
}

void settingOne(benchmark::State& state) {
    constexpr unsigned sets = 24;
    const JournaledFileSystem disk;
    const BootedDevice device(disk.path() / "device");
    Owner owner(device, "com.example.Sketches");
    owner.setInfoValues(1);
    const std::string content(std::filesystem::file_size(owner.path / ".com.tamarok.ostrand.metadata.plist"), 'x');
    std::filesystem::create_directory(disk.path() / "bare");
    const FileDescriptor bare(::open((disk.path() / "bare").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.4},
               .daemon = [&] { return secondsOf([&] { owner.setInfoValues(sets); }) / sets; },
               .baseline =
                   [&] {
                       return secondsOf([&] {
                                  for (unsigned i = 0; i < sets; ++i)
                                      replaceFile(bare.get(), content);
                              }) /
                              sets;
                   }}
        .run(state);
}

void settingFromEight(benchmark::State& state) {
    constexpr unsigned owners = 8, sets = 24;
    const JournaledFileSystem disk;
    const BootedDevice device(disk.path() / "device");
    std::vector<std::unique_ptr<Owner>> all;
    for (unsigned i = 0; i < owners; ++i)
        all.push_back(std::make_unique<Owner>(device, "com.example.Sketches." + std::to_string(i)));
    const auto setFromAll = [&] {
        std::vector<std::future<void>> work;
        for (auto& owner : all)
            work.push_back(std::async(std::launch::async, [&] { owner->setInfoValues(sets); }));
        for (auto& one : work)
            one.get();
    };
    Comparison{.unit = Unit::perSecond,
               .target = {Target::Kind::ratioAtLeast, 2.5},
               .daemon = [&] { return owners * sets / secondsOf(setFromAll); },
               .baseline = [&] { return sets / secondsOf([&] { all.front()->setInfoValues(sets); }); }}
        .run(state);
}

std::string requestAbout(const ostrand::ContainerReference& container, std::uint64_t command) {
    constexpr std::uint64_t lookUp = 0;
    return requestWith(command == lookUp ? 4 : 6, [&](platform::CBOREncoder& encoder) {
        encoder.key("Command");
        encoder.unsignedNumber(command);
        encoder.key("ContainerClass");
        encoder.unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
        encoder.key("UserID");
        encoder.unsignedNumber(container.user);
        encoder.key("Identifier");
        encoder.text(container.identifier);
        if (command == lookUp)
            return;
        encoder.key("UUID");
        encoder.uuid(container.uuid);
        encoder.key("Key");
        encoder.text(key);
    });
}

void gettingOne(benchmark::State& state) {
    constexpr unsigned roundTrips = 2000;
    const OneProcessor oneProcessor;
    const BootedDevice device(makeScratchDirectory(0711) / "device");
    Owner owner(device, "com.example.Sketches");
    owner.setInfoValues(1);
    RoundTrips get(device.socket(), requestAbout(owner.container, 6));
    RoundTrips lookUp(device.socket(), requestAbout(owner.container, 0));
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.2},
               .daemon = [&] { return get.secondsEach(roundTrips); },
               .baseline = [&] { return lookUp.secondsEach(roundTrips); }}
        .run(state);
}

constexpr const char* classAttribute = "trusted.ostrand.protection-class";

/// Reads the attribute of an item and gives it another value.
void changeAttribute(int item, const std::string& value) {
    std::array<char, 16> before;
    static_cast<void>(::fgetxattr(item, classAttribute, before.data(), before.size()));
    require(::fsetxattr(item, classAttribute, value.data(), value.size(), 0) == 0, classAttribute);
}

/// A container with a large tree, whose class goes to and fro.
struct LargeContainer {
    std::filesystem::path scratch = makeScratchDirectory(0711);
    BootedDevice device{scratch / "device"};
    Owner owner{device, "com.example.Sketches"};
    std::array<std::filesystem::path, 3> items{owner.path / "Documents", owner.path / "Library", owner.path / "tmp"};

    LargeContainer() { makeLargeTree(items[0]); }

    void changeBare(const std::string& value) const {
        const auto change = [&](int item) { changeAttribute(item, value); };
        const auto bare = BareWalk::opening(change, change);
        for (const auto& item : items)
            bare.run(item);
    }
};

void classChange(benchmark::State& state) {
    LargeContainer container;
    const auto fromThree = [&](const auto& change) {
        container.changeBare("3");
        return secondsOf(change);
    };
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.5},
               .daemon = [&] { return fromThree([&] { container.owner.setProtectionClass(1); }); },
               .baseline = [&] { return fromThree([&] { container.changeBare("1"); }); }}
        .run(state);
}

/// Look-ups while a large container changes its class, beside look-ups while nothing else happens.
void lookUpsMeanwhile(benchmark::State& state) {
    constexpr unsigned roundTrips = 1000;
    LargeContainer container;
    const Owner other(container.device, "com.example.Notes");
    RoundTrips lookUp(container.device.socket(), requestAbout(other.container, 0));
    const auto duringChange = [&] {
        container.changeBare("3");
        std::atomic<bool> isChanging = true;
        const std::jthread changing([&] {
            container.owner.setProtectionClass(1);
            isChanging = false;
        });
        double seconds = 0;
        unsigned count = 0;
        for (; isChanging || count == 0; ++count)
            seconds += lookUp.secondsEach(roundTrips / 100);
        return seconds / count;
    };
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.5},
               .daemon = duringChange,
               .baseline = [&] { return lookUp.secondsEach(roundTrips); }}
        .run(state);
}

[[maybe_unused]] const int one = registerComparison("info value, set by one client", 31, settingOne);
[[maybe_unused]] const int eight = registerComparison("info values, 8 connections beside 1", 15, settingFromEight);
[[maybe_unused]] const int got = registerComparison("info value, got, beside a look-up", 51, gettingOne);
[[maybe_unused]] const int change = registerComparison("class change of 100,000 files", 7, classChange);
[[maybe_unused]] const int beside = registerComparison("look-up while the class is changed", 7, lookUpsMeanwhile);

} // namespace

} // namespace ost::benchmarks
