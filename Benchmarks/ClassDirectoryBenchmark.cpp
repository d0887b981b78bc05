// The first look-up in a large class directory, which reads every container's metadata file, beside a loop that only
// reads the files; and what the containers cost in memory.

#include "Client/Containers.h"
#include "Support/BootedDevice.h"
#include "Support/ScratchDirectory.h"
#include "model/OSTMetadata.h"
#include "platform/codec/PropertyList.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/Require.h"
#include "support/Stopwatch.h"

#include <dirent.h>
#include <fcntl.h>
#include <malloc.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdio>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

namespace ost::benchmarks {

using test::BootedDevice;
using test::makeScratchDirectory;

namespace {

using platform::FileDescriptor;
using platform::UUID;

constexpr unsigned containers = 100'000;
constexpr unsigned turns = 9;

/// 40 bytes, as identifiers usually are about.
std::string identifierOf(unsigned number) {
    std::array<char, 64> text;
    std::snprintf(text.data(), text.size(), "com.example.benchmark.container.%08u", number);
    return text.data();
}

/// A device image with many containers of one class, made by hand as the daemon makes them.
class CrowdedImage {
public:
    CrowdedImage() {
        _classDirectory = _findClassDirectory();
        for (unsigned number = 1; number < containers; ++number)
            _makeContainer(number);
    }

    [[nodiscard]] const std::filesystem::path& path() const { return _image; }
    [[nodiscard]] const std::filesystem::path& classDirectory() const { return _classDirectory; }

private:
    [[nodiscard]] std::filesystem::path _findClassDirectory() const;
    void _makeContainer(unsigned number) const;

    std::filesystem::path _image = makeScratchDirectory(0711) / "device";
    std::filesystem::path _classDirectory;
};

ostrand::Container lookUp(ostrand::Connection& connection, ostrand::ContainerClass containerClass, unsigned number) {
    return require(ostrand::createOrLookup(connection,
                                           {.containerClass = containerClass, .identifier = identifierOf(number)},
                                           ostrand::WhenMissing::create),
                   "look a container up");
}

ostrand::Container lookUp(ostrand::Connection& connection, unsigned number) {
    return lookUp(connection, ostrand::ContainerClass::dataApplication, number);
}

/// Where the daemon puts the first one.
std::filesystem::path CrowdedImage::_findClassDirectory() const {
    const BootedDevice device(_image);
    auto connection = connectTo(device);
    return device.onHost(lookUp(connection, 0).path).parent_path();
}

void CrowdedImage::_makeContainer(unsigned number) const {
    struct stat owner{};
    require(::stat(_classDirectory.c_str(), &owner) == 0, _classDirectory);
    const OSTMetadata metadata{.uid = owner.st_uid,
                               .uuid = UUID::generate(),
                               .containerClass = OSTContainerClass::dataApplication,
                               .identifier = identifierOf(number),
                               .url = _classDirectory / UUID::generate().string()};
    require(::mkdir(metadata.url.c_str(), 0755) == 0, metadata.url);
    const FileDescriptor file(
        ::open(metadata.metadataFileURL().c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
    const auto bytes = platform::serializeBinaryPropertyList(metadata.dictionary());
    require(::write(file.get(), bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()), metadata.url);
}

const CrowdedImage& crowdedImage() {
    static const CrowdedImage image;
    return image;
}

/// The daemon that has just been started, one look-up in another class behind it.
struct FreshDaemon {
    BootedDevice device{crowdedImage().path()};
    ostrand::Connection connection = connectTo(device);

    FreshDaemon() { lookUp(connection, ostrand::ContainerClass::dataTempDir, 0); }
};

double secondsOfFirstLookUp() {
    FreshDaemon daemon;
    const auto start = Clock::now();
    lookUp(daemon.connection, containers / 2);
    return secondsSince(start);
}

/// The same files opened, read and closed, by names of two levels in the directory's own order.
double secondsOfReading() {
    const auto start = Clock::now();
    const auto& path = crowdedImage().classDirectory();
    const std::unique_ptr<DIR, int (*)(DIR*)> directory(::opendir(path.c_str()), &::closedir);
    require(directory != nullptr, path);
    std::array<char, 4096> bytes;
    unsigned found = 0;
    while (const dirent* const entry = ::readdir(directory.get())) {
        if (entry->d_name[0] == '.')
            continue;
        std::array<char, 512> name;
        std::snprintf(name.data(), name.size(), "%s/%s", entry->d_name, OSTMetadataFileName.data());
        const int file = ::openat(::dirfd(directory.get()), name.data(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
        require(file >= 0 && ::read(file, bytes.data(), bytes.size()) > 0, name.data());
        ::close(file);
        ++found;
    }
    require(found == containers, "find all containers");
    return secondsSince(start);
}

void firstLookUp(benchmark::State& state) {
    crowdedImage();
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.4},
               .daemon = secondsOfFirstLookUp,
               .baseline = secondsOfReading}
        .run(state);
}

double bytesOfCachedContainer() {
    FreshDaemon daemon;
    const auto before = residentBytes(daemon.device);
    lookUp(daemon.connection, containers / 2);
    const auto after = residentBytes(daemon.device);
    return static_cast<double>(after - before) / containers;
}

/// What a hash table takes that maps the same identifiers to nothing but UUID and path.
double bytesOfPlainTable() {
    struct Place {
        UUID uuid;
        std::string path;
    };
    const auto inUse = [] {
        const auto heap = ::mallinfo2();
        return heap.uordblks + heap.hblkhd;
    };
    const std::string directory = crowdedImage().classDirectory().lexically_relative(crowdedImage().path());
    const auto before = inUse();
    std::unordered_map<std::string, Place> table;
    for (unsigned number = 0; number < containers; ++number)
        table.emplace(identifierOf(number),
                      Place{.uuid = UUID(), .path = "/" + directory + "/" + UUID::generate().string()});
    return static_cast<double>(inUse() - before) / containers;
}

void memory(benchmark::State& state) {
    crowdedImage();
    Comparison{.unit = Unit::bytes,
               .target = {Target::Kind::valueAtMost, 1000},
               .daemon = bytesOfCachedContainer,
               .baseline = bytesOfPlainTable}
        .run(state);
}

[[maybe_unused]] const int first = registerComparison("first look-up among 100,000 containers", turns, firstLookUp);
[[maybe_unused]] const int each = registerComparison("memory of a cached container", 3, memory);

} // namespace

} // namespace ost::benchmarks
