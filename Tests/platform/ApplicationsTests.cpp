#include "platform/device/Applications.h"

#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <functional>
#include <thread>

namespace ost::platform {
namespace {

namespace fs = std::filesystem;

constexpr const char* app = "com.example.App";

/// A process that waits to be ended, or runs `work` and ends.
class Process {
public:
    explicit Process(const std::function<void()>& work = [] { ::pause(); }) : _pid(::fork()) {
        if (_pid == 0) {
            work();
            ::_exit(0);
        }
    }
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;
    ~Process() { reap(); }

    [[nodiscard]] pid_t pid() const { return _pid; }
    [[nodiscard]] ProcessInstance instance() const { return processInstance(_pid).value(); }
    /// Ends it without waiting for it, so that its number stays taken.
    void kill() const {
        ::kill(_pid, SIGKILL);
        siginfo_t ended{};
        ::waitid(P_PID, static_cast<id_t>(_pid), &ended, WEXITED | WNOWAIT);
    }
    void reap() {
        if (std::exchange(_reaped, true))
            return;
        kill();
        ::waitpid(_pid, nullptr, 0);
    }

private:
    pid_t _pid;
    bool _reaped = false;
};

class Applications : public test::DeviceTest {
protected:
    Applications() { fs::create_directories("/private/var/run"); }
    static fs::path entry(const std::string& name) { return fs::path(applicationsDirectory) / app / name; }
    static std::vector<ProcessInstance> processes() { return applicationProcesses(app).value(); }
    using Processes = std::vector<ProcessInstance>;
};

TEST_F(Applications, AreRecordedWhileTheyRun) {
    EXPECT_EQ(Processes{}, processes());
    const Process one, two;
    {
        const auto first = registerApplication(app, one.instance());
        const auto second = registerApplication(app, two.instance());
        ASSERT_TRUE(first && second);
        EXPECT_EQ(std::to_string(one.instance().startTime), test::readFile(entry(std::to_string(one.pid()))));
        EXPECT_EQ(2U, processes().size());
        EXPECT_EQ(fs::perms::owner_all, fs::status(entry("")).permissions()) << "who can open it can lock it";
        EXPECT_EQ(Processes{}, applicationProcesses("com.example.Other").value());
        one.kill();
        EXPECT_EQ(Processes{two.instance()}, processes())
            << "one that ended runs no more, even if it was not waited for";
    }
    EXPECT_EQ("", test::tree(applicationsDirectory));
}

TEST_F(Applications, AStaleRecordIsToldFromALiveOneAndRemoved) {
    const Process live, reused;
    Process gone;
    const auto number = std::to_string(gone.pid());
    gone.reap();
    test::writeFile(entry(number), "12345");
    test::writeFile(entry(std::to_string(reused.pid())), std::to_string(reused.instance().startTime + 1));
    test::writeFile(entry(std::to_string(live.pid())), "");
    test::writeFile(entry("no number"), "1");
    EXPECT_EQ(Processes{live.instance()}, processes()) << "an empty record means any process of its number";

    const Process next;
    const auto record = registerApplication(app, next.instance());
    EXPECT_FALSE(fs::exists(entry(number)));
    EXPECT_FALSE(fs::exists(entry(std::to_string(reused.pid()))));
    EXPECT_EQ(2U, processes().size());
}

TEST_F(Applications, WhoIsKilledWhileWritingARecordLeavesNone) {
    const Process launched;
    const Process launcher([&] {
        const rlimit nothing{0, 0};
        ::setrlimit(RLIMIT_FSIZE, &nothing); // Writing is deadly.
        [[maybe_unused]] const auto record = registerApplication(app, launched.instance());
    });
    siginfo_t ended{};
    ASSERT_EQ(0, ::waitid(P_PID, static_cast<id_t>(launcher.pid()), &ended, WEXITED | WNOWAIT));
    ASSERT_EQ(SIGXFSZ, ended.si_status);
    EXPECT_EQ(Processes{}, processes()) << "whatever gets its number later is no application";
    EXPECT_TRUE(registerApplication(app, launched.instance()));
    EXPECT_EQ("", test::tree(applicationsDirectory));
}

TEST_F(Applications, IsOneUntilItsLastThreadEnds) {
    int ready[2];
    ASSERT_EQ(0, ::pipe(ready));
    const Process process([&] {
        std::thread([&] {
            while (test::readFile("/proc/self/stat").find(") Z ") == std::string::npos)
                ::sched_yield();
            EXPECT_EQ(1, ::write(ready[1], "x", 1));
            ::pause();
        }).detach();
        ::syscall(SYS_exit, 0); // of this thread alone
    });
    char byte = 0;
    ASSERT_EQ(1, ::read(ready[0], &byte, 1));
    EXPECT_TRUE(isRunning(process.instance()).value());
    process.kill();
    EXPECT_EQ(ESRCH, processInstance(process.pid()).error());
}

TEST_F(Applications, AnAssertionHoldsUntilItGoesOrItsHolderDoes) {
    const auto held = [] { return terminationAssertion(app).value(); };
    EXPECT_EQ(std::nullopt, held());
    {
        const auto first = recordTerminationAssertion(app, "critical");
        const auto second = recordTerminationAssertion(app, "critical");
        ASSERT_TRUE(first && second);
        EXPECT_EQ("critical", held());
        EXPECT_EQ(std::nullopt, terminationAssertion("com.example.Other").value());
    }
    EXPECT_EQ(std::nullopt, held());
    EXPECT_EQ("", test::tree(assertionsDirectory));

    const auto file = fs::path(assertionsDirectory) / app / "any name";
    Process holder;
    const auto number = std::to_string(holder.pid());
    const auto start = holder.instance().startTime;
    const struct {
        std::string content;
        std::optional<std::string> reason;
    } rows[] = {
        {"installation\n" + number + " " + std::to_string(start) + "\n", "installation"},
        {"installation\n" + number + " " + std::to_string(start + 1) + "\n", std::nullopt},
        {"installation\n", "installation"},
        {"", ""},
    };
    for (const auto& [content, reason] : rows) {
        test::writeFile(file, content);
        EXPECT_EQ(reason, held()) << content;
    }
    test::writeFile(file, rows[0].content);
    holder.reap();
    EXPECT_EQ(std::nullopt, held()) << "its holder has died";
    fs::rename(file, file.parent_path() / ".unfinished");
    test::writeFile(file.parent_path() / ".unfinished", "");
    EXPECT_EQ(std::nullopt, held());
}

TEST_F(Applications, WhatCannotBeLookedAtIsAFailure) {
    EXPECT_EQ(EINVAL, registerApplication("", {1, 1}).error());
    EXPECT_EQ(ENAMETOOLONG, registerApplication(std::string(86, '/'), {1, 1}).error());
    const auto file = fs::path(assertionsDirectory) / app;
    test::writeFile(file, "");
    EXPECT_EQ(ENOTDIR, terminationAssertion(app).error());
    fs::remove(file);
    fs::create_directory_symlink("/tmp", file);
    EXPECT_EQ(ENOTDIR, terminationAssertion(app).error());
    EXPECT_EQ(ENOTDIR, recordTerminationAssertion(app, "critical").error());
}

TEST_F(Applications, ADirectoryThatComesAndGoesFailsNobody) {
    std::vector<std::jthread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([] {
            for (int i = 0; i < 300; ++i)
                EXPECT_TRUE(recordTerminationAssertion(app, "critical"));
        });
    threads.clear();
    EXPECT_EQ("", test::tree(assertionsDirectory));
}

} // namespace
} // namespace ost::platform
