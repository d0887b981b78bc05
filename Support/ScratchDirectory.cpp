#include "Support/ScratchDirectory.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <system_error>

namespace ost::test {

namespace {

void require(bool succeeded, const char* what) {
    if (!succeeded)
        throw std::system_error(errno, std::generic_category(), what);
}

/// Memory, unless it is too small or programs may not be executed there, as in some containers.
std::string scratchPlace() {
    constexpr std::uint64_t wanted = 512ULL << 20;
    struct statvfs memory{};
    struct statfs type{};
    if (::statfs("/dev/shm", &type) == 0 && type.f_type == TMPFS_MAGIC && ::statvfs("/dev/shm", &memory) == 0 &&
        (memory.f_flag & (ST_NOEXEC | ST_RDONLY)) == 0 && memory.f_bavail * memory.f_frsize >= wanted)
        return "/dev/shm";
    return std::filesystem::temp_directory_path();
}

/// Waits in a process of its own until the last copy of `lifeline` is closed. A process can be killed before it cleans
/// up; this one outlives it, in a session of its own, with nothing open that anybody waits for.
[[noreturn]] void removeAfterwards(const std::string& directory, int lifeline) {
    ::setsid();
    for (const int signal : {SIGINT, SIGTERM, SIGHUP})
        ::signal(signal, SIG_IGN);
    const int nowhere = ::open("/dev/null", O_RDWR | O_CLOEXEC);
    for (const int standard : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO})
        ::dup2(nowhere, standard);
    // A reader that waits for the end of another pipe of this program would wait for this process.
    constexpr int first = STDERR_FILENO + 1;
    lifeline = ::dup2(lifeline, first);
    ::close_range(first + 1, ~0U, 0);
    char nothing = 0;
    while (::read(lifeline, &nothing, 1) < 0 && errno == EINTR)
        continue;
    ::execlp("rm", "rm", "-rf", "--one-file-system", "--", directory.c_str(), nullptr);
    ::_exit(127);
}

} // namespace

std::filesystem::path makeScratchDirectory(unsigned mode) {
    std::string directory = scratchPlace() + "/ostrand-XXXXXX";
    require(::mkdtemp(directory.data()) != nullptr, directory.c_str());

    int lifeline[2]; // The writing end stays open until this process ends.
    require(::pipe2(lifeline, O_CLOEXEC) == 0, "pipe");
    const pid_t cleaner = ::fork();
    require(cleaner >= 0, "fork");
    if (cleaner == 0) {
        ::close(lifeline[1]);
        removeAfterwards(directory, lifeline[0]);
    }
    ::close(lifeline[0]);
    // Out of the way of tests that choose the numbers of their descriptors.
    constexpr int high = 500;
    require(::fcntl(lifeline[1], F_DUPFD_CLOEXEC, high) >= 0, "fcntl");
    ::close(lifeline[1]);

    require(::chmod(directory.c_str(), mode) == 0, directory.c_str());
    return directory;
}

} // namespace ost::test
