#include "support/BootedDevice.h"

#include "platform/device/CodeSignature.h"
#include "support/DeviceTest.h"
#include "support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <poll.h>
#include <sched.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <charconv>
#include <chrono>
#include <fstream>
#include <stdexcept>

namespace ost::test {

using platform::FileDescriptor;

namespace {

constexpr std::chrono::seconds patience{30};

pid_t parentOf(pid_t process) {
    std::ifstream status("/proc/" + std::to_string(process) + "/status");
    for (std::string word; status >> word;)
        if (pid_t parent = 0; word == "PPid:" && status >> parent)
            return parent;
    return 0;
}

bool runsDaemon(pid_t process) {
    std::error_code gone;
    return std::filesystem::read_symlink("/proc/" + std::to_string(process) + "/exe", gone).filename() == "ostrandd";
}

/// The daemon that a launcher has started, held so that its number cannot mean another process any more.
struct Daemon {
    pid_t id = 0;
    FileDescriptor handle;
};

Daemon findDaemonOf(pid_t launcher) {
    for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
        const std::string name = entry.path().filename();
        pid_t process = 0;
        if (std::from_chars(name.data(), name.data() + name.size(), process).ec != std::errc{} ||
            parentOf(process) != launcher || !runsDaemon(process))
            continue;
        FileDescriptor handle(static_cast<int>(::syscall(SYS_pidfd_open, process, 0)));
        if (handle && parentOf(process) == launcher)
            return {process, std::move(handle)};
    }
    return {};
}

/// The launcher may be just about to start it.
Daemon awaitDaemonOf(pid_t launcher) {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    for (;;) {
        if (auto daemon = findDaemonOf(launcher); daemon.id != 0)
            return daemon;
        if (std::chrono::steady_clock::now() > deadline)
            throw std::runtime_error("There is no daemon");
        ::sched_yield();
    }
}

} // namespace

std::string builtProgram(const char* name) { return std::string(OSTRAND_BIN_DIR "/") + name; }

BootedDevice::BootedDevice()
    : _scratch(makeScratchDirectory(0755)), _image(_scratch / "device"), _client(_makeSignedClient()) {
    _boot();
}

BootedDevice::~BootedDevice() { shutDown(); }

std::filesystem::path BootedDevice::socket() const { return onHost("/private/var/run/com.tamarok.ostrandd"); }

std::filesystem::path BootedDevice::onHost(const std::filesystem::path& devicePath) const {
    return _image / devicePath.relative_path();
}

void BootedDevice::_boot() {
    // The command says that the device serves, and keeps it up for as long as its standard input is open.
    _launcher.emplace(std::vector<std::string>{builtProgram("ostrand-device"), "boot", "--image", _image, "--", "sh",
                                               "-c", "echo serving; exec cat"},
                      _scratch / "complaints");
    if (_launcher->readLine() != "serving")
        throw std::runtime_error("The device does not boot: " + complaints());
}

std::filesystem::path BootedDevice::_makeSignedClient() const {
    const auto place = _scratch / "bin"; // for root only: whoever may execute the program has its rights
    std::filesystem::create_directory(place);
    std::filesystem::permissions(place, std::filesystem::perms::owner_all);
    auto client = place / "ostrandctl";
    std::filesystem::copy_file(builtProgram("ostrandctl"), client);
    OSTDictionary entitlements;
    entitlements.set("com.tamarok.private.Ostrand.allowed", true);
    OSTDictionary signature;
    signature.set("Identifier", "com.tamarok.ostrandctl");
    signature.set("Entitlements", std::move(entitlements));
    const auto program = platform::openProgram(client);
    if (!program || !platform::writeCodeSignature(program->get(), signature))
        throw std::runtime_error("A copy of the client cannot be signed");
    return client;
}

BootedDevice::Outcome BootedDevice::ostrandctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), _client);
    arguments.insert(arguments.end(), {"--device", _image});
    ChildProcess client(std::move(arguments), _scratch / "client-complaints");
    std::string output = client.readAll();
    return {client.wait(), std::move(output)};
}

pid_t BootedDevice::daemonId() const { return awaitDaemonOf(_launcher->id()).id; }

void BootedDevice::killDaemon(int signal) {
    const auto daemon = awaitDaemonOf(_launcher->id());
    ::syscall(SYS_pidfd_send_signal, daemon.handle.get(), signal, nullptr, 0);
    pollfd ended{daemon.handle.get(), POLLIN, 0};
    ::poll(&ended, 1, -1);
}

void BootedDevice::reboot() {
    shutDown();
    _boot();
}

void BootedDevice::shutDown() {
    if (!_launcher)
        return;
    _launcher->closeInput();
    EXPECT_EQ(_launcher->wait(), 0);
    _launcher.reset();
    const std::string text = complaints();
    for (const char* fault : {"Assertion failed", "Sanitizer:", "runtime error:"})
        EXPECT_EQ(text.find(fault), std::string::npos) << text;
}

void BootedDeviceTest::SetUp() {
    if (::geteuid() != 0)
        GTEST_SKIP() << "A device can be booted by root only";
    _device.emplace();
}

std::string BootedDevice::complaints() const { return readFile(_scratch / "complaints"); }

} // namespace ost::test
