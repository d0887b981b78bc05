#include "support/ServedFileSystem.h"

#include "Support/ScratchDirectory.h"

#include <fcntl.h>
#include <linux/fuse.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <iterator>
#include <system_error>

namespace ost::test {

namespace {

constexpr std::uint64_t programNode = 2;

std::string contentOf(const std::filesystem::path& path) {
    std::ifstream file(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
}

void require(bool succeeded, const char* what) {
    if (!succeeded)
        throw std::system_error(errno, std::generic_category(), what);
}

fuse_attr attributesOf(std::uint64_t node, std::size_t programSize) {
    fuse_attr attributes{};
    attributes.ino = node;
    attributes.nlink = 1;
    attributes.mode = node == programNode ? S_IFREG | 0755U : S_IFDIR | 0755U;
    attributes.size = node == programNode ? programSize : 0;
    attributes.blksize = 4096;
    return attributes;
}

template<typename T>
T bodyOf(const std::string& request) {
    T body{};
    std::memcpy(&body, request.data() + sizeof(fuse_in_header),
                std::min(sizeof body, request.size() - sizeof(fuse_in_header)));
    return body;
}

} // namespace

ServedFileSystem::ServedFileSystem(const std::filesystem::path& program, bool mountedByUser)
    : _content(contentOf(program)), _directory(makeScratchDirectory(0755)),
      _device(::open("/dev/fuse", O_RDWR | O_CLOEXEC)), _stop(::eventfd(0, EFD_CLOEXEC)) {
    require(static_cast<bool>(_device), "open /dev/fuse");
    const auto options = "fd=" + std::to_string(_device.get()) + ",rootmode=40000,user_id=0,group_id=0,allow_other";
    require(::mount("test", _directory.c_str(), "fuse", mountedByUser ? MS_NOSUID | MS_NODEV : 0, options.c_str()) == 0,
            "mount");
    _server = std::thread([this] { _serve(); });
}

ServedFileSystem::~ServedFileSystem() {
    stopAnswering();
    ::umount2(_directory.c_str(), MNT_FORCE);
    ::umount2(_directory.c_str(), MNT_DETACH);
    // Closing the device is what ends the waits for answers.
}

void ServedFileSystem::stopAnswering() {
    if (!_server.joinable())
        return;
    ::eventfd_write(_stop.get(), 1);
    _server.join();
}

void ServedFileSystem::detach() const { require(::umount2(_directory.c_str(), MNT_DETACH) == 0, "umount"); }

void ServedFileSystem::_serve() {
    std::string request(FUSE_MIN_READ_BUFFER + (std::size_t{128} << 10), '\0');
    for (;;) {
        pollfd ready[] = {{.fd = _stop.get(), .events = POLLIN, .revents = 0},
                          {.fd = _device.get(), .events = POLLIN, .revents = 0}};
        ::poll(ready, std::size(ready), -1);
        if (ready[0].revents != 0)
            return;
        const auto count = ::read(_device.get(), request.data(), request.size());
        if (count < 0 && errno == ENODEV)
            return;
        if (count > 0)
            _answer(request.substr(0, static_cast<std::size_t>(count)));
    }
}

void ServedFileSystem::_answer(const std::string& request) {
    fuse_in_header head{};
    std::memcpy(&head, request.data(), sizeof head);
    switch (head.opcode) {
    case FUSE_INIT: {
        fuse_init_out out{};
        out.major = FUSE_KERNEL_VERSION;
        out.minor = 31;
        out.max_write = 4096;
        return _reply(head.unique, 0, &out, sizeof out);
    }
    case FUSE_LOOKUP: {
        fuse_entry_out out{};
        out.nodeid = programNode;
        out.attr = attributesOf(programNode, _content.size());
        return _reply(head.unique, 0, &out, sizeof out);
    }
    case FUSE_GETATTR: {
        // Valid for no time at all: the next question about it goes to us again.
        fuse_attr_out out{};
        out.attr = attributesOf(head.nodeid, _content.size());
        return _reply(head.unique, 0, &out, sizeof out);
    }
    case FUSE_OPEN: {
        fuse_open_out out{};
        out.open_flags = FOPEN_KEEP_CACHE;
        return _reply(head.unique, 0, &out, sizeof out);
    }
    case FUSE_READ: {
        const auto wanted = bodyOf<fuse_read_in>(request);
        const auto offset = std::min<std::size_t>(wanted.offset, _content.size());
        return _reply(head.unique, 0, _content.data() + offset,
                      std::min<std::size_t>(wanted.size, _content.size() - offset));
    }
    case FUSE_STATFS: {
        fuse_statfs_out out{};
        out.st.namelen = 255;
        return _reply(head.unique, 0, &out, sizeof out);
    }
    case FUSE_RELEASE:
    case FUSE_FLUSH:
        return _reply(head.unique, 0, nullptr, 0);
    case FUSE_FORGET:
    case FUSE_BATCH_FORGET:
    case FUSE_INTERRUPT:
        return;
    default:
        return _reply(head.unique, -ENOSYS, nullptr, 0);
    }
}

void ServedFileSystem::_reply(std::uint64_t unique, int error, const void* body, std::size_t size) const {
    fuse_out_header head{
        .len = static_cast<std::uint32_t>(sizeof(fuse_out_header) + size), .error = error, .unique = unique};
    iovec parts[] = {{.iov_base = &head, .iov_len = sizeof head},
                     {.iov_base = const_cast<void*>(body), .iov_len = size}};
    [[maybe_unused]] const auto written = ::writev(_device.get(), parts, size > 0 ? 2 : 1);
}

} // namespace ost::test
