#include "Support/BootedDevice.h"

#include "platform/base/OSTValue.h"
#include "platform/device/CodeSignature.h"

#include <poll.h>
#include <sched.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <utility>

namespace ost::test {

using platform::FileDescriptor;

namespace {

constexpr std::chrono::seconds patience{30};

constexpr const char* complaintsSuffix = ".complaints";
constexpr const char* clientSuffix = ".bin/ostrandctl";

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

std::string builtProgram(const char* name) {
    const char* const installed = std::getenv("OSTRAND_PROGRAMS");
    return std::string(installed ? installed : OSTRAND_BIN_DIR).append("/").append(name);
}

BootedDevice::BootedDevice(std::filesystem::path image, FaultReport report)
    : _image(std::move(image)), _report(std::move(report)) {
    _boot();
}

BootedDevice::~BootedDevice() { shutDown(); }

std::filesystem::path BootedDevice::socket() const { return onHost("/private/var/run/com.tamarok.ostrandd"); }

std::filesystem::path BootedDevice::onHost(const std::filesystem::path& devicePath) const {
    return _image / devicePath.relative_path();
}

std::filesystem::path BootedDevice::_beside(const char* suffix) const { return _image.string() + suffix; }

void BootedDevice::_boot() {
    // The command says that the device serves, and keeps it up for as long as its standard input is open.
    _launcher.emplace(std::vector<std::string>{builtProgram("ostrand-device"), "boot", "--image", _image, "--", "sh",
                                               "-c", "echo serving; exec cat"},
                      _beside(complaintsSuffix));
    if (_launcher->readLine() != "serving")
        throw std::runtime_error("The device does not boot: " + complaints());
}

void BootedDevice::_makeSignedClient() const {
    const auto client = _beside(clientSuffix);
    const auto place = client.parent_path(); // for root only: who may execute the program has its rights
    std::filesystem::create_directory(place);
    std::filesystem::permissions(place, std::filesystem::perms::owner_all);
    std::filesystem::copy_file(builtProgram("ostrandctl"), client, std::filesystem::copy_options::overwrite_existing);
    OSTDictionary entitlements;
    entitlements.set("com.tamarok.private.Ostrand.allowed", true);
    OSTDictionary signature;
    signature.set("Identifier", "com.tamarok.ostrandctl");
    signature.set("Entitlements", std::move(entitlements));
    const auto program = platform::openProgram(client);
    if (!program || !platform::writeCodeSignature(program->get(), signature))
        throw std::runtime_error("A copy of the client cannot be signed");
}

BootedDevice::Outcome BootedDevice::ostrandctl(std::vector<std::string> arguments) {
    std::call_once(_clientMade, [this] { _makeSignedClient(); });
    arguments.insert(arguments.begin(), _beside(clientSuffix));
    arguments.insert(arguments.end(), {"--device", _image});
    ChildProcess client(std::move(arguments), _beside(".client-complaints"));
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
    const int status = _launcher->wait();
    _launcher.reset();
    if (status != 0)
        _report("The launcher ended with " + std::to_string(status));
    const std::string text = complaints();
    for (const char* fault : {"Assertion failed", "Sanitizer:", "runtime error:"})
        if (text.contains(fault))
            _report(text);
}

std::string BootedDevice::complaints() const {
    std::ifstream file;
    file.exceptions(std::ios::failbit | std::ios::badbit);
    file.open(_beside(complaintsSuffix));
    return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
}

void BootedDevice::printFault(const std::string& fault) { std::fprintf(stderr, "%s\n", fault.c_str()); }

} // namespace ost::test
