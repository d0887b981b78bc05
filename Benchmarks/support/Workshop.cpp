#include "support/Workshop.h"

#include "platform/base/OSTValue.h"
#include "platform/device/CodeSignature.h"
#include "support/Require.h"

#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <array>
#include <filesystem>
#include <string>

namespace ost::benchmarks {

namespace {

/// Memory already on the host; nobody else sees what is mounted over it.
constexpr const char* scratch = "/dev/shm";
/// As many files as fit.
constexpr const char* scratchOptions = "mode=0711,size=80%,nr_inodes=0";

constexpr const char* self = "/proc/self/exe";

bool isSigned() {
    std::array<char, platform::maximumCodeSignature> buffer;
    const auto program = require(platform::openProgram(std::filesystem::read_symlink(self)), self);
    return !require(platform::readCodeSignature(program.get(), buffer), self).bytes.empty();
}

void sign(const std::filesystem::path& path) {
    OSTDictionary entitlements;
    entitlements.set("com.tamarok.private.Ostrand.allowed", true);
    OSTDictionary signature;
    signature.set("Identifier", "com.tamarok.ostrand.benchmark");
    signature.set("Entitlements", std::move(entitlements));
    const auto program = require(platform::openProgram(path), path);
    require(platform::writeCodeSignature(program.get(), signature), "sign " + path.string());
}

} // namespace

void enterWorkshop(char** arguments) {
    if (isSigned())
        return;
    require(::unshare(CLONE_NEWNS) == 0, "enter a mount namespace");
    require(::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0, "make mounts private");
    require(::mount("tmpfs", scratch, "tmpfs", 0, scratchOptions) == 0, "mount memory");

    const auto directory = std::filesystem::path(scratch) / "program";
    std::filesystem::create_directory(directory);
    std::filesystem::permissions(directory, std::filesystem::perms::owner_all);
    const auto copy = directory / std::filesystem::read_symlink(self).filename();
    std::filesystem::copy_file(self, copy);
    std::filesystem::permissions(copy, std::filesystem::perms::owner_all);
    sign(copy);
    ::execv(copy.c_str(), arguments);
    require(false, copy);
}

} // namespace ost::benchmarks
