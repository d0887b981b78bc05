#include "platform/ipc/ActivatedSockets.h"

#include "Protocol/OSTServices.h"
#include "support/DeviceTest.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>

namespace ost::platform {
namespace {

constexpr const char* service = "com.tamarok.tests";
const std::string path = std::string(OSTServiceSocketDirectory) + "/" + service;

class ActivatedSocketsTest : public test::DeviceTest {
protected:
    static bool connects(int type) {
        const FileDescriptor client(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
        sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
        path.copy(address.sun_path, sizeof address.sun_path - 1);
        return ::connect(client.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
    }

    /// Hands descriptors over as a service launcher does, from number 3 on.
    static void handOver(const std::vector<int>& descriptors, const char* names, pid_t process = ::getpid()) {
        std::vector<int> copies;
        for (const int descriptor : descriptors)
            copies.push_back(::fcntl(descriptor, F_DUPFD, 100));
        for (std::size_t index = 0; index < copies.size(); ++index) {
            ASSERT_GE(::dup2(copies[index], 3 + static_cast<int>(index)), 0);
            ::close(copies[index]);
        }
        ::setenv("LISTEN_PID", std::to_string(process).c_str(), 1);
        ::setenv("LISTEN_FDS", std::to_string(descriptors.size()).c_str(), 1);
        ::setenv("LISTEN_FDNAMES", names, 1);
    }
};

TEST_F(ActivatedSocketsTest, TakesOverWhatTheLauncherListensOn) {
    auto listener = ActivatedSockets().takeListener(service, SOCK_STREAM).value();
    const FileDescriptor notListening(::socket(AF_UNIX, SOCK_STREAM, 0));
    handOver({listener.get(), notListening.get(), listener.get()}, "com.tamarok.tests:quiet:packets");
    auto sockets = ActivatedSockets::fromEnvironment();
    for (const char* variable : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"})
        EXPECT_EQ(std::getenv(variable), nullptr);

    const auto taken = sockets.takeListener(service, SOCK_STREAM).value();
    EXPECT_EQ(taken.get(), 3);
    EXPECT_EQ(::fcntl(taken.get(), F_GETFD), FD_CLOEXEC);
    EXPECT_NE(::fcntl(taken.get(), F_GETFL) & O_NONBLOCK, 0);
    EXPECT_TRUE(connects(SOCK_STREAM));
    EXPECT_EQ(sockets.takeListener("quiet", SOCK_STREAM).error(), EPROTOTYPE);
    EXPECT_EQ(sockets.takeListener("packets", SOCK_SEQPACKET).error(), EPROTOTYPE);
}

TEST_F(ActivatedSocketsTest, LeavesWhatWasHandedToSomebodyElse) {
    const auto listener = ActivatedSockets().takeListener("other", SOCK_STREAM).value();
    handOver({listener.get()}, service, ::getppid());
    auto sockets = ActivatedSockets::fromEnvironment();
    EXPECT_NE(sockets.takeListener(service, SOCK_STREAM).value().get(), 3);
    EXPECT_GE(::fcntl(3, F_GETFD), 0);
}

TEST_F(ActivatedSocketsTest, BindsWhatWasNotHandedOver) {
    ::umask(077);
    for (const int type : {SOCK_STREAM, SOCK_SEQPACKET}) {
        const auto listener =
            ActivatedSockets().takeListener(service, type).value(); // the second time over a stale one
        EXPECT_TRUE(connects(type));
        const FileDescriptor early(::accept(listener.get(), nullptr, nullptr));
        int passesCredentials = -1;
        socklen_t size = sizeof passesCredentials;
        ::getsockopt(early.get(), SOL_SOCKET, SO_PASSCRED, &passesCredentials, &size);
        EXPECT_EQ(passesCredentials, type == SOCK_SEQPACKET ? 1 : 0)
            << "of a connection that was made before any reader";
        EXPECT_EQ(test::tree(OSTServiceSocketDirectory), "srw-rw-rw- 0:0 com.tamarok.tests\n");
        EXPECT_EQ(ActivatedSockets().takeListener(service, type).error(), EADDRINUSE);
    }
    std::filesystem::remove(path);
    test::writeFile(path, "precious");
    EXPECT_EQ(ActivatedSockets().takeListener(service, SOCK_STREAM).error(), EEXIST);
    EXPECT_EQ(test::readFile(path), "precious");
    EXPECT_EQ(ActivatedSockets().takeListener(std::string(200, 'x'), SOCK_STREAM).error(), ENAMETOOLONG);
    std::filesystem::remove_all(OSTServiceSocketDirectory);
    EXPECT_EQ(ActivatedSockets().takeListener(service, SOCK_STREAM).error(), ENOENT);
}

} // namespace
} // namespace ost::platform
