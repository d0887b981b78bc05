#include "Client/Confinement.h"
#include "Support/ScratchDirectory.h"
#include "platform/device/Applications.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <sstream>

using namespace ost::test;
using ost::platform::FileDescriptor;

namespace fs = std::filesystem;

namespace {

constexpr const char* app = "com.example.App";
constexpr const char* group = "group.com.example.App";

/// How a run ended, and what it said.
struct RunResult {
    int status;
    std::string output, errors;
};

class RunTest : public testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0)
            GTEST_SKIP() << "needs root";
        if (ostrand::Confinement::version() == 0)
            GTEST_SKIP() << "this kernel has no Landlock, which confines programs";
        device.emplace();
    }

    [[nodiscard]] std::vector<std::string> commandLine(std::vector<std::string> words) const {
        words.insert(words.begin(), {builtProgram("ostrandctl"), "--device", device->image(), "run"});
        return words;
    }
    RunResult run(std::vector<std::string> words) {
        ChildProcess child(commandLine(std::move(words)), scratch / "errors");
        child.closeInput();
        RunResult result{};
        result.output = child.readAll();
        result.status = child.wait();
        result.errors = readFile(scratch / "errors");
        return result;
    }
    /// Runs a line of shell as an application.
    RunResult shell(const std::string& line, const std::string& identifier = app) {
        return run({"--identifier", identifier, "--", "/bin/sh", "-c", line});
    }

    /// A copy of a built program, with a signature that names an identifier and a group.
    std::string signedCopy(const std::string& program, const std::string& identifier) {
        auto copy = scratch / identifier;
        fs::copy_file(program, copy);
        std::vector<std::string> words{
            builtProgram("ostrandctl"), "sign", copy, "--identifier", identifier, "--entitlements",
            scratch / "entitlements"};
        writeFile(scratch / "entitlements",
                  std::string("<plist version=\"1.0\"><dict><key>com.tamarok.security.application-groups</key>"
                              "<array><string>") +
                      group + "</string></array></dict></plist>");
        EXPECT_EQ(ChildProcess(words, scratch / "errors").wait(), 0) << readFile(scratch / "errors");
        return copy;
    }

    /// The data containers that there are.
    [[nodiscard]] std::vector<fs::path> containers() const {
        std::error_code none;
        const auto directory = device->onHost("/private/var/mobile/Containers/Data/Application");
        return {fs::directory_iterator(directory, none), fs::directory_iterator()};
    }
    [[nodiscard]] fs::path records() const { return device->onHost(ost::platform::applicationsDirectory); }

    const fs::path scratch = makeScratchDirectory(0755);
    std::optional<ScratchDevice> device;
};

TEST_F(RunTest, AProgramHasItsContainersAndNothingOfTheCallers) {
    ASSERT_EQ(::setenv("SECRET", "x", 1), 0);
    ASSERT_EQ(::setenv("LC_TIME", "C", 1), 0);
    const auto result = shell("env | sort; id -u; id -G; pwd; touch file tmp/file; grep -E '^(Cap|NoNew|SigBlk)' "
                              "/proc/self/status; ls /proc/self/fd | wc -l; exit 7");
    EXPECT_EQ(result.status, 7) << result.errors;
    ASSERT_EQ(containers().size(), 1U);
    const auto container = containers().front().string();
    for (const auto& line :
         {"HOME=" + container, "TMPDIR=" + container + "/tmp", "OSTRAND_DATA_CONTAINER=" + container,
          std::string("LC_TIME=C"), std::string("USER=mobile"), std::string("LOGNAME=mobile"), std::string("501\n501"),
          container, std::string("NoNewPrivs:\t1"), std::string("CapEff:\t0000000000000000"),
          std::string("CapBnd:\t0000000000000000"), std::string("SigBlk:\t0000000000000000"),
          std::string("4") /* the three and that of the directory */})
        EXPECT_NE(("\n" + result.output).find("\n" + line + "\n"), std::string::npos) << line << "\n" << result.output;
    EXPECT_EQ(result.output.find("SECRET"), std::string::npos);
    EXPECT_TRUE(fs::exists(containers().front() / "tmp/file"));
    EXPECT_EQ(tree(records()), "") << "it cleans up after itself";
}

TEST_F(RunTest, AProgramReachesNothingButItsOwn) {
    const auto probe = scratch / "probe";
    fs::copy_file(builtProgram("run-probe"), probe);
    fs::permissions(probe, fs::perms::set_uid | fs::perms::set_gid | fs::perms(0755));
    ASSERT_EQ(shell("echo secret > secret; chmod 666 secret", "com.example.Neighbour").status, 0);
    const auto neighbour = containers().front().string();

    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = "\0run-tests"};
    const FileDescriptor listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_EQ(::bind(listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(sa_family_t) + 10), 0);
    ASSERT_EQ(::listen(listener.get(), 1), 0);
    const auto secret = neighbour + "/secret";
    const FileDescriptor open(::open(secret.c_str(), O_RDWR | O_CLOEXEC));
    ASSERT_EQ(::dup2(open.get(), 9), 9) << "a descriptor that the program inherits unless it is taken away";

    // A process of the same user, in the neighbour's container, with its file as standard input.
    const pid_t other = ::fork();
    if (other == 0) {
        const bool ready = ::dup2(open.get(), 0) == 0 && ::chdir(neighbour.c_str()) == 0 && ::setgid(501) == 0 &&
                           ::setuid(501) == 0 && ::execl("/bin/sleep", "sleep", "100", nullptr) == 0;
        ::_exit(ready ? 0 : 1);
    }
    const auto result = run({"--identifier", app, "--", probe, "reach", neighbour, std::to_string(other)});
    ::close(9);
    EXPECT_EQ(::waitpid(other, nullptr, WNOHANG), 0) << "it still runs";
    ::kill(other, SIGKILL);
    ::waitpid(other, nullptr, 0);

    const bool hasScopes = ostrand::Confinement::version() >= 6;
    std::istringstream lines(result.output);
    std::size_t count = 0;
    for (auto [name, error] = std::pair(std::string(), 0); lines >> name >> error; ++count) {
        if (!hasScopes && (name == "signal" || name == "abstract-socket"))
            continue;
        const bool isAllowed = name.starts_with("own-") && name != "own-root";
        EXPECT_EQ(error == 0, isAllowed) << name << " " << error;
    }
    EXPECT_EQ(count, 31U) << result.output << result.errors;
    EXPECT_EQ(readFile(secret), "secret\n");
}

TEST_F(RunTest, AnApplicationSharesItsGroupsContainerWithItsPlugin) {
    const auto application = signedCopy("/bin/dash", "com.example.Sketches");
    const auto plugin = signedCopy("/bin/dash", "com.example.Sketches.Brushes");
    const std::string toGroup = R"(cd "${OSTRAND_GROUP_CONTAINERS#*=}" && )";
    EXPECT_EQ(run({"--", application, "-c", toGroup + "echo shared > note"}).status, 0);
    EXPECT_EQ(run({"--plugin", "--", plugin, "-c", toGroup + "cat note"}).output, "shared\n");
    EXPECT_EQ(
        run({"--", application, "-c", "echo \"$OSTRAND_GROUP_CONTAINERS\""}).output,
        std::string(group) + "=" +
            fs::directory_iterator(device->onHost("/private/var/mobile/Containers/Shared/AppGroup"))->path().string() +
            "\n");
    const auto printed = run({"--plugin", "--print", "--json", "--", plugin}).output;
    EXPECT_NE(printed.find(R"("groups": {"group.com.example.App": "/private/var/mobile/Containers/Shared/AppGroup/)"),
              std::string::npos)
        << printed;
    EXPECT_NE(printed.find(R"("data": "/private/var/mobile/Containers/Data/LoomworkPlugin/)"), std::string::npos)
        << printed;
}

TEST_F(RunTest, WhatCannotBeRunMakesNothing) {
    const auto assertion = ost::platform::recordTerminationAssertion("com.example.Held", "critical", device->image());
    writeFile(scratch / "text", "text", 0755);
    writeFile(scratch / "data", "data", 0644);
    const struct {
        std::vector<std::string> words;
        std::string complaint;
        bool makesContainers;
    } rows[] = {
        {{"--identifier", app, "--", "/bin/none"}, "No such file or directory", false},
        {{"--identifier", app, "--", scratch / "data"}, "Permission denied", false},
        {{"--identifier", app, "--", scratch}, "Permission denied", false},
        {{"--", "/bin/true"}, "is not signed with an identifier", false},
        {{"--identifier", "", "--", "/bin/true"}, "an identifier of 0 bytes", false},
        {{"--identifier", std::string(256, 'a'), "--", "/bin/true"}, "an identifier of 256 bytes", false},
        {{"--identifier", app, "--user", "502", "--", "/bin/true"}, "no account of user 502", false},
        {{"--identifier", app, "--user", "4294967797", "--", "/bin/true"}, "no account of user", false},
        {{"--identifier", app, "--user", "root", "--", "/bin/true"}, "the daemon's log says which", false},
        {{"--identifier", "com.example.Held", "--", "/bin/true"}, "reason: critical", true},
        {{"--identifier", app, "--", scratch / "text"}, "cannot execute the program: Exec format error", true},
    };
    std::size_t expected = 0;
    for (const auto& [words, complaint, makesContainers] : rows) {
        const auto result = run(words);
        expected += makesContainers ? 1 : 0;
        EXPECT_EQ(result.status, 1) << complaint;
        EXPECT_NE(result.errors.find(complaint), std::string::npos) << result.errors;
        EXPECT_EQ(containers().size(), expected) << complaint;
    }
    EXPECT_EQ(tree(records()), "");
}

TEST_F(RunTest, ADaemonThatDoesNotAnswerIsNotWaitedForWithoutEnd) {
    const std::vector<std::string> words{"--identifier", app, "--timeout", "1", "--", "/bin/true"};
    ::kill(device->daemonId(), SIGSTOP);
    const auto result = run(words);
    ::kill(device->daemonId(), SIGCONT);
    EXPECT_EQ(result.status, 1);
    EXPECT_NE(result.errors.find("the daemon has not said for 1 s"), std::string::npos) << result.errors;
    EXPECT_FALSE(fs::exists(records()));
    EXPECT_EQ(run(words).status, 0);
    EXPECT_EQ(run({"--identifier", app, "--timeout", "0", "--", "/bin/true"}).status, 2);
}

TEST_F(RunTest, WhatStandsInTheWayOfTemporaryFilesIsLeftAlone) {
    ASSERT_EQ(shell("rmdir tmp && ln -s /etc tmp").status, 0);
    EXPECT_EQ(shell("echo $TMPDIR; ls -ld tmp; touch tmp/x 2>&1 || echo refused").output.substr(0, 1), "/");
    EXPECT_FALSE(fs::exists("/etc/x"));
    ASSERT_EQ(shell("rm tmp && mkfifo tmp").status, 0);
    EXPECT_EQ(shell("test -p tmp").status, 0) << "nobody waits for the other end";
}

TEST_F(RunTest, SignalsAreForTheProgramAndItsEndIsTold) {
    EXPECT_EQ(shell("kill -KILL $$").status, 128 + SIGKILL);
    ChildProcess launcher(commandLine({"--identifier", app, "--", builtProgram("run-probe"), "await"}),
                          scratch / "errors");
    ASSERT_EQ(launcher.readLine(), "waiting") << readFile(scratch / "errors");
    const auto processes = ost::platform::applicationProcesses(app, device->image()).value();
    ASSERT_EQ(processes.size(), 1U);
    EXPECT_NE(processes[0].pid, launcher.id());
    launcher.signal(SIGTERM);
    EXPECT_EQ(launcher.wait(), 42);
}

TEST_F(RunTest, WhatAProgramHasStartedIsContinuedWithIt) {
    const auto* const line = "sh -c 'kill -STOP $$; exit 7' & "
                             "until grep -q 'State:.T' /proc/$!/status; do :; done; echo stopped; wait $!";
    ChildProcess launcher(commandLine({"--identifier", app, "--", "/bin/sh", "-c", line}), scratch / "errors");
    ASSERT_EQ(launcher.readLine(), "stopped") << readFile(scratch / "errors");
    launcher.signal(SIGCONT);
    EXPECT_EQ(launcher.wait(), 7);
}

TEST_F(RunTest, ARecordThatAKilledLauncherLeavesIsToldAndRemoved) {
    pid_t program = 0;
    {
        ChildProcess launcher(commandLine({"--identifier", app, "--", builtProgram("run-probe"), "await"}),
                              scratch / "errors");
        ASSERT_EQ(launcher.readLine(), "waiting") << readFile(scratch / "errors");
        program = ost::platform::applicationProcesses(app, device->image()).value().at(0).pid;
        launcher.signal(SIGKILL);
        launcher.wait();
    }
    const auto record = records() / app / std::to_string(program);
    EXPECT_EQ(ost::platform::applicationProcesses(app, device->image()).value().size(), 1U) << "the program goes on";
    const FileDescriptor handle(static_cast<int>(::syscall(SYS_pidfd_open, program, 0)));
    ::kill(program, SIGTERM);
    pollfd ended{handle.get(), POLLIN, 0};
    ASSERT_EQ(::poll(&ended, 1, -1), 1);
    EXPECT_TRUE(ost::platform::applicationProcesses(app, device->image()).value().empty());
    EXPECT_TRUE(fs::exists(record)) << "what nobody cleaned up tells that it is stale";
    ASSERT_EQ(shell("true").status, 0);
    EXPECT_FALSE(fs::exists(record));
}

TEST_F(RunTest, AProgramOfAServiceHasTheGroupsOfTheDevice) {
    const auto result = run({"--identifier", app, "--user", "system", "--print", "--", "/bin/true"});
    EXPECT_EQ(result.status, 1) << "its user has no data containers";
    writeFile(device->onHost("/etc/group"), "mobile:x:501:\nsystemusers:x:500:system,mobile\nother:x:600:mobil\n");
    EXPECT_EQ(shell("id -G").output, "501 500\n");

    std::string more;
    for (int number = 0; number <= 65536; ++number) // one more than the kernel takes
        more += "more:x:" + std::to_string(1000 + number) + ":mobile\n";
    writeFile(device->onHost("/etc/group"), more);
    const auto refused = shell("echo started");
    EXPECT_EQ(refused.output, "");
    EXPECT_NE(refused.errors.find("cannot take the user's groups"), std::string::npos) << refused.errors;
    EXPECT_EQ(tree(records()), "") << "what was not started is on no record";
}

} // namespace
