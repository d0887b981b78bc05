#include "platform/ipc/PeerIdentity.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <functional>
#include <string>
#include <thread>
#include <utility>

namespace ost::platform {
namespace {

namespace fs = std::filesystem;

/// A child process that has connected to us and runs `program` with the connection as its input: one that reads until
/// the end, or a shell, which executes `next` in its place once a byte arrives.
class Peer {
public:
    explicit Peer(const fs::path& program, const fs::path& next = {}) {
        const FileDescriptor listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        socklen_t size = sizeof address.sun_family; // the kernel chooses a name
        EXPECT_EQ(::bind(listener.get(), reinterpret_cast<sockaddr*>(&address), size), 0);
        EXPECT_EQ(::listen(listener.get(), 1), 0);
        size = sizeof address;
        EXPECT_EQ(::getsockname(listener.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
        _process = ::fork();
        if (_process == 0)
            _runChild(address, size, program, next);
        _socket.reset(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
        _awaitProgram(program);
    }
    ~Peer() { end(); }

    [[nodiscard]] int socket() const { return _socket.get(); }
    [[nodiscard]] pid_t processId() const { return _process; }

    void executeNext(const fs::path& next) {
        EXPECT_EQ(::write(socket(), "x", 1), 1);
        _awaitProgram(next);
    }

    void end() {
        if (_process <= 0)
            return;
        ::shutdown(socket(), SHUT_WR);
        ::waitpid(std::exchange(_process, -1), nullptr, 0);
    }

private:
    [[noreturn]] static void _runChild(const sockaddr_un& address, socklen_t size, const fs::path& program,
                                       const fs::path& next) {
        const int connection = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (::connect(connection, reinterpret_cast<const sockaddr*>(&address), size) != 0)
            ::_exit(1);
        ::dup2(connection, STDIN_FILENO);
        const std::string script = "read -r -N 1 byte; exec " + next.string();
        if (next.empty())
            ::execl(program.c_str(), "cat", nullptr);
        else
            ::execl(program.c_str(), "bash", "-c", script.c_str(), nullptr);
        ::_exit(1);
    }

    void _awaitProgram(const fs::path& program) const {
        const auto link = "/proc/" + std::to_string(_process) + "/exe";
        std::error_code error;
        while (fs::read_symlink(link, error) != fs::canonical(program))
            ASSERT_EQ(::waitpid(_process, nullptr, WNOHANG), 0) << "the child has ended";
    }

    pid_t _process = -1;
    FileDescriptor _socket;
};

class PeerIdentityTest : public testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0)
            GTEST_SKIP() << "only root signs programs";
    }

    /// A copy of a program in the scratch directory.
    fs::path copy(const fs::path& program, const std::string& name) {
        const auto path = _directory / name;
        fs::copy_file(fs::canonical(program), path);
        return path;
    }

    static void sign(const fs::path& program, const OSTDictionary& signature) {
        const auto file = openProgram(program);
        ASSERT_TRUE(file);
        ASSERT_TRUE(writeCodeSignature(file->get(), signature));
    }

    static OSTDictionary signature(const std::string& identifier) {
        return OSTDictionary({{"Identifier", OSTValue(identifier)},
                              {"Entitlements", OSTValue(OSTDictionary({{"right", OSTValue(true)}}))}});
    }

    const fs::path _directory = test::makeScratchDirectory(0755);
};

TEST_F(PeerIdentityTest, ReadsTheSignatureOfThePeersProgramAfresh) {
    const auto program = copy("/bin/cat", "program");
    sign(program, signature("com.example.first"));
    const Peer child(program);
    auto peer = PeerIdentity::ofSocket(child.socket());
    ASSERT_TRUE(peer);
    EXPECT_EQ(peer->processId(), child.processId());
    EXPECT_EQ(peer->effectiveUserId(), ::geteuid());

    auto identity = peer->codeSigningIdentity();
    ASSERT_TRUE(identity);
    EXPECT_EQ((*identity)->identifier, "com.example.first");
    const auto entitlements = (*identity)->entitlements;
    ASSERT_TRUE(entitlements);
    EXPECT_TRUE(entitlements->find("right")->truthValue());

    identity = peer->codeSigningIdentity();
    EXPECT_EQ((*identity)->entitlements, entitlements) << "equal signatures share their entitlements";

    sign(program, signature("com.example.second"));
    identity = peer->codeSigningIdentity();
    EXPECT_EQ((*identity)->identifier, "com.example.second");
}

TEST_F(PeerIdentityTest, SeesThatAProgramHasChangedAfterAWhile) {
    const auto program = copy("/bin/cat", "program");
    sign(program, signature("com.example.first"));
    const Peer child(program);
    auto peer = PeerIdentity::ofSocket(child.socket());
    ASSERT_TRUE(peer);
    const auto identifier = [&] { return (*peer->codeSigningIdentity())->identifier; };
    std::this_thread::sleep_for(std::chrono::seconds(4)); // only time makes a file old
    EXPECT_EQ(identifier(), "com.example.first");
    for (const char* next : {"com.example.second", "com.example.third"}) {
        sign(program, signature(next));
        EXPECT_EQ(identifier(), next);
    }
    fs::permissions(program, fs::perms::group_write, fs::perm_options::add);
    EXPECT_EQ(identifier(), std::nullopt);
}

TEST_F(PeerIdentityTest, FollowsThePeerToTheProgramItExecutes) {
    const auto shell = copy("/bin/bash", "shell");
    const auto program = copy("/bin/cat", "program");
    sign(shell, signature("com.example.shell"));
    sign(program, signature("com.example.program"));
    Peer child(shell, program);
    auto peer = PeerIdentity::ofSocket(child.socket());
    ASSERT_TRUE(peer);
    EXPECT_EQ((*peer->codeSigningIdentity())->identifier, "com.example.shell");
    child.executeNext(program);
    EXPECT_EQ((*peer->codeSigningIdentity())->identifier, "com.example.program");
}

TEST_F(PeerIdentityTest, CountsNothingButAProgramThatOnlyRootCanHaveWritten) {
    const auto setBytes = [](const fs::path& path, std::string_view bytes) {
        ASSERT_EQ(::setxattr(path.c_str(), codeSignatureAttribute, bytes.data(), bytes.size(), 0), 0);
    };
    const struct {
        const char* what;
        std::function<void(const fs::path&)> prepare;
    } cases[] = {
        {"unsigned", [](const fs::path& path) { ::removexattr(path.c_str(), codeSignatureAttribute); }},
        {"group may write", [](const fs::path& path) { ::chmod(path.c_str(), 0775); }},
        {"others may write", [](const fs::path& path) { ::chmod(path.c_str(), 0757); }},
        {"of a user", [](const fs::path& path) { ASSERT_EQ(::chown(path.c_str(), 501, 0), 0); }},
        {"no property list", [&](const fs::path& path) { setBytes(path, "bplist00 and nonsense"); }},
        {"of other types",
         [](const fs::path& path) {
             sign(path, OSTDictionary({{"Identifier", OSTValue(true)}, {"Entitlements", OSTValue("all")}}));
         }},
    };
    for (const auto& [what, prepare] : cases) {
        SCOPED_TRACE(what);
        const auto program = copy("/bin/cat", what);
        sign(program, signature("com.example.program"));
        prepare(program);
        const Peer child(program);
        auto peer = PeerIdentity::ofSocket(child.socket());
        ASSERT_TRUE(peer);
        const auto identity = peer->codeSigningIdentity();
        ASSERT_TRUE(identity);
        EXPECT_FALSE((*identity)->identifier);
        EXPECT_FALSE((*identity)->entitlements);
    }
}

TEST_F(PeerIdentityTest, KnowsNoProgramOfAProcessThatHasEnded) {
    Peer child("/bin/cat");
    auto pinned = PeerIdentity::ofSocket(child.socket());
    ASSERT_TRUE(pinned);
    EXPECT_TRUE(pinned->codeSigningIdentity());
    child.end();
    EXPECT_EQ(pinned->codeSigningIdentity().error(), ESRCH);
    auto late = PeerIdentity::ofSocket(child.socket());
    ASSERT_TRUE(late);
    EXPECT_FALSE(late->codeSigningIdentity());
}

TEST_F(PeerIdentityTest, SignsOnlyRegularFiles) {
    fs::create_symlink("/bin/cat", _directory / "link");
    ASSERT_EQ(::mkfifo((_directory / "fifo").c_str(), 0600), 0);
    EXPECT_EQ(openProgram(_directory / "link").error(), ELOOP);
    EXPECT_EQ(openProgram(_directory / "fifo").error(), EINVAL);
    EXPECT_EQ(openProgram(_directory).error(), EINVAL);
    EXPECT_EQ(openProgram(_directory / "missing").error(), ENOENT);
}

} // namespace
} // namespace ost::platform
