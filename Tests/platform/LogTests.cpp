#include "platform/base/Log.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <poll.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>

namespace ost::platform {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

class LogTest : public testing::Test {
protected:
    void open(unsigned files, std::uint64_t size, std::chrono::milliseconds userTime = 10min) {
        ASSERT_TRUE(Log::shared().open(LogLevel::notice, {path, files, size, userTime}));
    }

    [[nodiscard]] std::string content(const std::string& suffix = "") const {
        std::ifstream file(path.native() + suffix);
        return {std::istreambuf_iterator<char>(file), {}};
    }

    [[nodiscard]] bool has(const std::string& text) const { return content().find(text) != std::string::npos; }

    const fs::path directory = test::makeScratchDirectory();
    const fs::path path = directory / "log";
};

/// A user's lines until at least one of them was left out.
void fill(uid_t user, std::size_t bytes) {
    const LogOrigin origin(user);
    for (std::size_t written = 0; written <= bytes; written += 100)
        logError("%@ of user %u", std::string(80, 'x'), user);
}

TEST_F(LogTest, RotatesAtEitherSizeAndKeepsAsManyFilesAsItShould) {
    for (const auto& [files, size] : {std::pair{1U, 102400U}, std::pair{4U, 262144U}}) {
        for (const auto& entry : fs::directory_iterator(directory))
            fs::remove(entry);
        open(files, size);
        for (std::size_t written = 0; written < (files + 2) * std::size_t{size}; written += 1000)
            logNotice("%@", std::string(1000, 'x'));
        EXPECT_EQ(std::distance(fs::directory_iterator(directory), {}), files);
        for (const auto& entry : fs::directory_iterator(directory))
            EXPECT_LE(entry.file_size(), size) << entry.path();
        if (files > 1) {
            EXPECT_GT(fs::file_size(path.native() + ".1"), size - 2000);
        }
    }
}

TEST_F(LogTest, ABatchKeepsTheOrderAndTheSizeAndHoldsNoErrorBack) {
    constexpr std::uint64_t size = 20'000;
    open(3, size);
    const auto numbered = [](int number) { return "line " + std::to_string(number) + ";"; };
    {
        const LogBatch batch;
        logNotice("%@", numbered(1));
        EXPECT_FALSE(has(numbered(1)));
        logError("%@", numbered(2));
        EXPECT_LT(content().find(numbered(1)), content().find(numbered(2)));
        logNotice("%@", numbered(3));
        std::thread([&] { logNotice("%@", numbered(4)); }).join();
        EXPECT_LT(content().find(numbered(3)), content().find(numbered(4)));
        for (int number = 5; number < 300; ++number)
            logNotice("%@", numbered(number));
    }
    const auto all = content(".2") + content(".1") + content();
    std::size_t at = 0;
    for (int number = 1; number < 300; ++number, ++at)
        ASSERT_NE(at = all.find(numbered(number), at), std::string::npos) << number;
    for (const auto& entry : fs::directory_iterator(directory))
        EXPECT_LE(entry.file_size(), size) << entry.path();
}

TEST_F(LogTest, AUsersLinesPushNobodyElsesOut) {
    constexpr std::uint64_t size = 20'000;
    open(1, size);
    logError("%s", "the daemon's own");
    for (const uid_t user : {501U, 502U})
        fill(user, size);
    EXPECT_TRUE(has("the daemon's own"));
    EXPECT_TRUE(has("of user 501") && has("of user 502"));
    EXPECT_LE(content().size(), size / 2 + 1000);
    fill(0, size / 4);
    EXPECT_GT(content().size(), size / 2 + size / 4) << "root's are never left out";

    Log::shared().sayWhatWasLeftOut(Log::LeftOut::whereTimeIsOver);
    EXPECT_FALSE(has("were left out")) << "not yet";
    Log::shared().sayWhatWasLeftOut(Log::LeftOut::everywhere);
    EXPECT_TRUE(has("lines that user 501 caused were left out"));
    EXPECT_TRUE(has("lines that user 502 caused were left out"));
}

TEST_F(LogTest, WhatWasLeftOutIsSaidWhenTheTimeIsOver) {
    open(1, 4000, 500ms);
    fill(501, 4000);
    pollfd ready{.fd = Log::shared().leftOutDescriptor(), .events = POLLIN, .revents = 0};
    ASSERT_EQ(::poll(&ready, 1, 60'000), 1);
    Log::shared().sayWhatWasLeftOut(Log::LeftOut::whereTimeIsOver);
    EXPECT_TRUE(has("lines that user 501 caused were left out"));
    EXPECT_EQ(::poll(&ready, 1, 0), 0);
    fill(501, 100);
    EXPECT_EQ(content().substr(content().rfind("of user")), "of user 501\n") << "its time has begun anew";
}

} // namespace
} // namespace ost::platform
