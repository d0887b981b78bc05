#include "Client/ctl/LogFollower.h"
#include "Client/ctl/LogLine.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

using namespace ostrand::ctl;

namespace {

using Lines = std::vector<std::string>;

TEST(LogLine, IsTakenApartAndWeighsMostWhenItCannotBe) {
    const auto line = LogLine::parse("2026-11-22T19:46:01.123456Z <Notice> [7:8] main: a <Error> [b] c");
    EXPECT_EQ(line.level, LogLevel::notice);
    EXPECT_EQ(line.time + "|" + line.thread + "|" + line.message,
              "2026-11-22T19:46:01.123456Z|7:8|main: a <Error> [b] c");
    for (const auto* const strange : {"", "no line", "time <Fatal> [7:8] x", "time <Error> 7:8 x"}) {
        const auto parsed = LogLine::parse(strange);
        EXPECT_EQ(parsed.level, LogLevel::error) << strange;
        EXPECT_EQ(parsed.message, strange);
    }
}

TEST(LogFollower, ReadsEachLineOnceWhateverHappensToTheFile) {
    const auto device = ost::test::makeScratchDirectory();
    const auto directory = device / "private/var/root/Library/Logs/Ostrand", log = directory / "ostrandd.log";
    EXPECT_EQ(LogFollower::open(device).error(), ENOENT);
    std::filesystem::create_directories(directory);
    auto follower = LogFollower::open(device).value();
    EXPECT_EQ(follower.read(), Lines()) << "the file may come later";
    const auto write = [&](const char* text, std::ios::openmode mode) {
        std::ofstream(log, mode) << text << std::flush;
        EXPECT_TRUE(follower.wait());
        return follower.read();
    };
    EXPECT_EQ(write("one\ntwo\nthr", std::ios::app), Lines({"one", "two"}));
    EXPECT_EQ(write("ee\n", std::ios::app), Lines({"three"}));
    EXPECT_EQ(write("anew\n", std::ios::trunc), Lines({"anew"})) << "the daemon's log starts again empty";
    std::ofstream(log, std::ios::app) << "last\n" << std::flush;
    std::filesystem::rename(log, directory / "ostrandd.log.1");
    EXPECT_EQ(write("next\n", std::ios::app), Lines({"last", "next"})) << "what the old file still got is not lost";
}

} // namespace
