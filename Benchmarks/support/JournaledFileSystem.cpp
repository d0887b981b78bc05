#include "support/JournaledFileSystem.h"

#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "support/Require.h"

#include <fcntl.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <unistd.h>

#include <stdexcept>
#include <string>

namespace ost::benchmarks {

using platform::FileDescriptor;
using test::ChildProcess;
using test::makeScratchDirectory;

namespace {

/// On disk on every system, which /tmp is not.
constexpr const char* disk = "/var/tmp";
constexpr off_t size = off_t{2} << 30;
constexpr std::uint32_t blockSize = 4096;

struct LoopDevice {
    std::string path;
    FileDescriptor device;
};

/// A loop device that is taken apart with its last user. Others may take the free one that the kernel names first.
LoopDevice attach(int file) {
    const FileDescriptor control(::open("/dev/loop-control", O_RDWR | O_CLOEXEC));
    require(static_cast<bool>(control), "/dev/loop-control");
    loop_config configuration{};
    configuration.fd = static_cast<std::uint32_t>(file);
    configuration.block_size = blockSize;
    configuration.info.lo_flags = LO_FLAGS_AUTOCLEAR | LO_FLAGS_DIRECT_IO;
    for (;;) {
        const int number = ::ioctl(control.get(), LOOP_CTL_GET_FREE);
        require(number >= 0, "find a loop device");
        LoopDevice loop{.path = "/dev/loop" + std::to_string(number), .device = {}};
        loop.device.reset(::open(loop.path.c_str(), O_RDWR | O_CLOEXEC));
        require(static_cast<bool>(loop.device), loop.path);
        if (::ioctl(loop.device.get(), LOOP_CONFIGURE, &configuration) == 0)
            return loop;
        require(errno == EBUSY, "attach " + loop.path);
    }
}

} // namespace

JournaledFileSystem::JournaledFileSystem() : _path(makeScratchDirectory(0711)) {
    const FileDescriptor file(::open(disk, O_TMPFILE | O_RDWR | O_CLOEXEC, 0600));
    require(file && ::ftruncate(file.get(), size) == 0, std::string("make a file in ") + disk);
    const auto loop = attach(file.get());
    // Nothing is left to be initialised in the background while the benchmark runs, and the journal is as large, for a
    // few thousand containers, as that of an ordinary disk: one that is always full makes every change wait.
    const auto made = ChildProcess({"mkfs.ext4", "-q", "-b", std::to_string(blockSize), "-O", "has_journal", "-J",
                                    "size=256", "-E", "lazy_itable_init=0,lazy_journal_init=0,nodiscard", loop.path})
                          .wait();
    if (made != 0)
        throw std::runtime_error("mkfs.ext4 fails");
    require(::mount(loop.path.c_str(), _path.c_str(), "ext4", 0, nullptr) == 0, "mount " + loop.path);
}

JournaledFileSystem::~JournaledFileSystem() { ::umount2(_path.c_str(), MNT_DETACH); }

} // namespace ost::benchmarks
