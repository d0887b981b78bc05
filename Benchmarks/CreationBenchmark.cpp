// Creation of containers that survive a power cut, beside a loop that makes the same directories and files.

#include "Client/Containers.h"
#include "Support/BootedDevice.h"
#include "platform/base/UUID.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/JournaledFileSystem.h"
#include "support/Require.h"
#include "support/Stopwatch.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <string>
#include <vector>

namespace ost::benchmarks {

using test::BootedDevice;

namespace {

using platform::FileDescriptor;
using platform::UUID;

/// Few enough that a turn is short against the drift of the disk.
constexpr unsigned creationsInTurn = 24;
constexpr unsigned turns = 31;

/// Creates containers through the client library, each under a name of its own.
class Creator {
public:
    explicit Creator(const BootedDevice& device) : _connection(connectTo(device)) {}

    ostrand::Container create() {
        static std::atomic<unsigned> number{0};
        const auto container = createContainer(_connection, "com.example.Sketches." + std::to_string(++number));
        require(!container.existed, "create a container that was not there");
        return container;
    }

    void createMany(unsigned count) {
        for (unsigned made = 0; made < count; ++made)
            create();
    }

private:
    ostrand::Connection _connection;
};

/// The fewest system calls that leave on disk what the daemon leaves there, taken from a container that it made: the
/// same directories and file, owners, attributes and content, nothing visible before it is complete and durable.
class BareCreator {
public:
    BareCreator(const std::filesystem::path& model, const std::filesystem::path& directory)
        : _staging(_openNew(directory / "staging")), _live(_openNew(directory / "live")) {
        struct stat status{};
        require(::stat(model.c_str(), &status) == 0, model);
        _owner = status.st_uid;
        _class = _attributeOf(model);
        for (const auto& item : std::filesystem::recursive_directory_iterator(model)) {
            if (item.is_directory()) {
                _subDirectories.push_back(item.path().lexically_relative(model));
                continue;
            }
            _fileName = item.path().filename();
            _fileClass = _attributeOf(item.path());
            _content.assign(item.file_size(), 'x');
        }
    }

    void create() const {
        const auto name = UUID::generate().string();
        require(::mkdirat(_staging.get(), name.c_str(), 0755) == 0, name);
        const FileDescriptor directory(::openat(_staging.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        _setAttribute(directory.get(), _class);
        require(::fchown(directory.get(), _owner, _owner) == 0, name);

        const FileDescriptor file(
            ::openat(directory.get(), _fileName.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
        _setAttribute(file.get(), _fileClass);
        require(::write(file.get(), _content.data(), _content.size()) == static_cast<ssize_t>(_content.size()), name);
        for (const auto& subDirectory : _subDirectories)
            require(::mkdirat(directory.get(), subDirectory.c_str(), 0755) == 0 &&
                        ::fchownat(directory.get(), subDirectory.c_str(), _owner, _owner, AT_SYMLINK_NOFOLLOW) == 0,
                    subDirectory);
        require(::fsync(file.get()) == 0 && ::fsync(directory.get()) == 0, name);
        for (const auto& subDirectory : _subDirectories) {
            const FileDescriptor open(
                ::openat(directory.get(), subDirectory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
            require(::fsync(open.get()) == 0, subDirectory);
        }

        require(::renameat(_staging.get(), name.c_str(), _live.get(), name.c_str()) == 0, name);
        require(::fsync(_live.get()) == 0, name);
    }

private:
    static constexpr const char* _attribute = "trusted.ostrand.protection-class";

    static FileDescriptor _openNew(const std::filesystem::path& path) {
        std::filesystem::create_directories(path);
        return FileDescriptor(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    }

    static std::string _attributeOf(const std::filesystem::path& item) {
        std::string value(16, '\0');
        const auto size = ::getxattr(item.c_str(), _attribute, value.data(), value.size());
        require(size > 0, item);
        value.resize(static_cast<std::size_t>(size));
        return value;
    }

    static void _setAttribute(int item, const std::string& value) {
        require(::fsetxattr(item, _attribute, value.data(), value.size(), XATTR_CREATE) == 0, _attribute);
    }

    FileDescriptor _staging;
    FileDescriptor _live;
    uid_t _owner = 0;
    std::string _class;
    std::vector<std::string> _subDirectories; ///< parents first
    std::string _fileName;
    std::string _fileClass;
    std::string _content;
};

void oneClient(benchmark::State& state) {
    const JournaledFileSystem disk;
    const BootedDevice device(disk.path() / "device");
    Creator daemon(device);
    const BareCreator bare(device.onHost(daemon.create().path), disk.path() / "bare");
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.4},
               .daemon = [&] { return secondsOf([&] { daemon.createMany(creationsInTurn); }) / creationsInTurn; },
               .baseline =
                   [&] {
                       return secondsOf([&] {
                                  for (unsigned made = 0; made < creationsInTurn; ++made)
                                      bare.create();
                              }) /
                              creationsInTurn;
                   }}
        .run(state);
}

void eightConnections(benchmark::State& state) {
    constexpr unsigned connections = 8;
    const JournaledFileSystem disk;
    const BootedDevice device(disk.path() / "device");
    std::vector<Creator> creators;
    for (unsigned made = 0; made < connections; ++made)
        creators.emplace_back(device);
    const auto createFromAll = [&] {
        std::vector<std::future<void>> all;
        for (auto& creator : creators)
            all.push_back(std::async(std::launch::async, [&] { creator.createMany(creationsInTurn / 2); }));
        for (auto& one : all)
            one.get();
    };
    Comparison{
        .unit = Unit::perSecond,
        .target = {Target::Kind::ratioAtLeast, 2.5},
        .daemon = [&] { return connections * (creationsInTurn / 2) / secondsOf(createFromAll); },
        .baseline = [&] { return creationsInTurn / secondsOf([&] { creators.front().createMany(creationsInTurn); }); }}
        .run(state);
}

[[maybe_unused]] const int one = registerComparison("creation, one client", turns, oneClient);
[[maybe_unused]] const int eight = registerComparison("creations, 8 connections beside 1", turns, eightConnections);

} // namespace

} // namespace ost::benchmarks
