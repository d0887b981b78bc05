// Registrations among many registered identifiers: one more, beside the bare rewriting of the file that they lie in;
// one that changes nothing, beside a look-up; and the counting of group references, beside a bare loop over the groups.

#include "Client/CodeSigning.h"
#include "Client/Containers.h"
#include "Client/Maintenance.h"
#include "Support/BootedDevice.h"
#include "Support/ScratchDirectory.h"
#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTGroupManager.h"
#include "files/OSTDictionaryFile.h"
#include "platform/codec/IPCValue.h"
#include "platform/codec/PropertyList.h"
#include "platform/ipc/IPCFrame.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/InsideImage.h"
#include "support/JournaledFileSystem.h"
#include "support/OneProcessor.h"
#include "support/Require.h"
#include "support/RoundTrips.h"
#include "support/Stopwatch.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <string>
#include <unordered_map>
#include <vector>

namespace ost::benchmarks {

using test::BootedDevice;
using test::makeScratchDirectory;

namespace {

using ostrand::ContainerClass;
using platform::CBOREncoder;
using platform::FileDescriptor;
using platform::IPCFrameHeader;

constexpr unsigned identifiers = 10'000;
constexpr const char* mappingFile = "/private/var/root/Library/Ostrand/ost_code_signing_info.plist";

std::string identifierOf(unsigned number) { return "com.example.benchmark.application." + std::to_string(number); }

std::vector<std::string> groupsOf(unsigned number) {
    return {"group.com.example.benchmark.shared." + std::to_string(number % 100),
            "group.com.example.benchmark.own." + std::to_string(number)};
}

/// What an installer registers for an application of the usual kind.
OSTDictionary infoOf(unsigned number) {
    const auto identifier = identifierOf(number);
    const auto groups = groupsOf(number);
    return OSTDictionary(
        {{OSTEntitlementsKey, OSTDictionary({{"application-identifier", "TEAM123456." + identifier},
                                             {"com.tamarok.developer.team-identifier", "TEAM123456"},
                                             {OSTGroupKeys::application.key, OSTArray(groups.begin(), groups.end())},
                                             {"com.tamarok.security.network.client", true},
                                             {"keychain-access-groups", OSTArray{"TEAM123456." + identifier}}})},
         {"CodeDirectoryHash", OSTData{std::string(20, static_cast<char>(number))}},
         {"SignerIdentity", "Example Distribution"},
         {"SigningTime", OSTDate{1.79e9 + number}}});
}

OSTDictionary mappingOf(unsigned count) {
    std::vector<OSTDictionary::Entry> entries;
    for (unsigned number = 0; number < count; ++number)
        entries.emplace_back(
            identifierOf(number),
            OSTCodeSigningEntry{.codeSigningInfo = std::make_shared<const OSTDictionary>(infoOf(number)),
                                .dataContainerClass = 2}
                .serialize());
    return OSTDictionary(std::move(entries));
}

void writeWhole(const FileDescriptor& file, std::string_view bytes) {
    require(::write(file.get(), bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()), "write");
}

/// Gives the image, which has been booted before, so many registered identifiers.
void plantMapping(const std::filesystem::path& image) {
    {
        const BootedDevice device(image);
    }
    const auto path = image / std::filesystem::path(mappingFile).relative_path();
    const FileDescriptor file(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
    require(file.get() >= 0, path);
    writeWhole(file, platform::serializeBinaryPropertyList(mappingOf(identifiers)));
}

/// An image that has the identifiers, and the daemon in it.
class CrowdedDevice {
public:
    explicit CrowdedDevice(const std::filesystem::path& image) : _device((plantMapping(image), image)) {}
    [[nodiscard]] const BootedDevice& device() const { return _device; }

private:
    BootedDevice _device;
};

/// The same dictionary serialised, written, made durable and put in place of the one before.
double secondsOfRewriting(const OSTDictionary& dictionary, const std::filesystem::path& directory) {
    const auto start = Clock::now();
    const auto bytes = platform::serializeBinaryPropertyList(dictionary);
    const auto unfinished = directory / "unfinished";
    {
        const FileDescriptor file(::open(unfinished.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        writeWhole(file, bytes);
        require(::fdatasync(file.get()) == 0, unfinished);
    }
    const FileDescriptor parent(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    require(::rename(unfinished.c_str(), (directory / "finished").c_str()) == 0 && ::fsync(parent.get()) == 0,
            directory);
    return secondsSince(start);
}

void oneMore(benchmark::State& state) {
    const JournaledFileSystem disk;
    const CrowdedDevice crowded(disk.path() / "device");
    const auto bare = disk.path() / "bare";
    std::filesystem::create_directory(bare);
    auto connection = connectTo(crowded.device());
    const auto file = require(
        OST_dictionaryWithContentsOfURL(crowded.device().onHost(mappingFile).native(), OSTLargeDictionaryFileSize),
        "read the mapping");
    unsigned number = identifiers;
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 3.0},
               .daemon =
                   [&] {
                       const ostrand::Registration registration{.identifier = identifierOf(number),
                                                                .info = infoOf(number)};
                       ++number;
                       const auto start = Clock::now();
                       require(ostrand::registerCodeSigning(connection, registration), "register");
                       return secondsSince(start);
                   },
               .baseline = [&] { return secondsOfRewriting(file, bare); }}
        .run(state);
}

/// What a release before the mapping file left.
std::string legacyFile() {
    std::vector<OSTDictionary::Entry> entries;
    for (unsigned number = 0; number < identifiers; ++number)
        entries.emplace_back(identifierOf(number), *infoOf(number).find(OSTEntitlementsKey));
    return platform::serializeBinaryPropertyList(OSTDictionary(std::move(entries)));
}

/// Boots an image without a mapping but with the legacy file, and migrates it.
double secondsOfMigration(const std::filesystem::path& image, const std::string& legacy) {
    const auto mapping = image / std::filesystem::path(mappingFile).relative_path();
    std::filesystem::remove(mapping);
    const auto path = mapping.parent_path() / "ost_entitlements.plist";
    writeWhole(FileDescriptor(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644)), legacy);
    const BootedDevice device(image);
    auto connection = connectTo(device);
    const auto seconds = secondsOf([&] { require(ostrand::migrate(connection), "migrate"); });
    if (std::filesystem::exists(path) || !std::filesystem::exists(mapping))
        throw std::runtime_error("The legacy file is not migrated");
    return seconds;
}

void migration(benchmark::State& state) {
    const JournaledFileSystem disk;
    const auto image = disk.path() / "device", bare = disk.path() / "bare";
    std::filesystem::create_directory(bare);
    plantMapping(image);
    const auto legacy = legacyFile();
    secondsOfMigration(image, legacy); // What is done once for a device is done now.
    const auto file = mappingOf(identifiers);
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 3.0},
               .daemon = [&] { return secondsOfMigration(image, legacy); },
               .baseline = [&] { return secondsOfRewriting(file, bare); }}
        .run(state);
}

std::string registrationOf(unsigned number) {
    return requestWith(4, [&](CBOREncoder& encoder) {
        encoder.key("Command");
        encoder.unsignedNumber(18);
        encoder.key("Identifier");
        encoder.text(identifierOf(number));
        encoder.key("CodeSigningInfo");
        platform::encodePropertyListValue(encoder, infoOf(number));
        encoder.key("OptionsDictionary");
        platform::encodePropertyListValue(encoder, ostrand::RegistrationOptions{.dataContainerClass = 2}.dictionary());
    });
}

std::string lookUpOf(unsigned number) {
    return requestWith(5, [&](CBOREncoder& encoder) {
        encoder.key("Command");
        encoder.unsignedNumber(0);
        encoder.key("ContainerClass");
        encoder.unsignedNumber(static_cast<std::uint64_t>(ContainerClass::dataApplication));
        encoder.key("UserID");
        encoder.unsignedNumber(ost::OSTCurrentUserPlaceholder);
        encoder.key("Identifier");
        encoder.text(identifierOf(number));
        encoder.key("CreateIfNecessary");
        encoder.boolean(true);
    });
}

void unchanged(benchmark::State& state) {
    const OneProcessor oneProcessor;
    constexpr unsigned roundTrips = 2000;
    const CrowdedDevice crowded(makeScratchDirectory(0711) / "device");
    const auto& device = crowded.device();
    RoundTrips registrations(device.socket(), registrationOf(identifiers / 2));
    RoundTrips lookUps(device.socket(), lookUpOf(identifiers / 2));
    lookUps.once(); // Makes it.
    const auto written = [&] { return std::filesystem::last_write_time(device.onHost(mappingFile)); };
    const auto before = written();
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.2},
               .daemon = [&] { return registrations.secondsEach(roundTrips); },
               .baseline = [&] { return lookUps.secondsEach(roundTrips); }}
        .run(state);
    if (written() != before)
        throw std::runtime_error("a registration that changes nothing writes the file");
}

/// The median of some turns, without the first, which reads the file.
double secondsOfCounting() {
    // Nobody else is in the group that is left, and it has no container: counting is all that happens.
    const auto count = [] {
        const auto start = Clock::now();
        OSTGroupManager::defaultManager().handleChangeFromOldGroupContainerIds(
            std::vector<std::string>{"group.com.example.benchmark.left"}, std::nullopt, OSTGroupType::application);
        return secondsSince(start);
    };
    count();
    std::vector<double> seconds;
    for (int turn = 0; turn < 5; ++turn)
        seconds.push_back(count());
    std::ranges::sort(seconds);
    return seconds[seconds.size() / 2];
}

double secondsOfBareCounting(const std::vector<std::vector<std::string>>& lists) {
    const auto start = Clock::now();
    std::unordered_map<std::string_view, unsigned> counts;
    for (const auto& groups : lists)
        for (const auto& group : groups)
            ++counts[group];
    require(counts.size() == identifiers + 100, "count");
    return secondsSince(start);
}

void counting(benchmark::State& state) {
    const auto image = makeScratchDirectory(0711) / "device";
    plantMapping(image);
    std::vector<std::vector<std::string>> lists;
    for (unsigned number = 0; number < identifiers; ++number)
        lists.push_back(groupsOf(number));
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::valueAtMost, 0.010},
               .daemon = [&] { return secondsInside(image, secondsOfCounting); },
               .baseline = [&] { return secondsOfBareCounting(lists); }}
        .run(state);
}

[[maybe_unused]] const int more = registerComparison("registration of one more among 10,000", 31, oneMore);
[[maybe_unused]] const int migrations = registerComparison("migration of 10,000 entitlements", 7, migration);
[[maybe_unused]] const int same = registerComparison("registration that changes nothing", 51, unchanged);
[[maybe_unused]] const int counts = registerComparison("reference counts of 10,000 identifiers", 11, counting);

} // namespace

} // namespace ost::benchmarks
