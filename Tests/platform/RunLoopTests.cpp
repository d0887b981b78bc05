#include "platform/threads/RunLoop.h"

#include <gtest/gtest.h>

#include <sys/epoll.h>
#include <unistd.h>

#include <memory>
#include <optional>
#include <string>
#include <thread>

namespace ost::platform {
namespace {

struct Pipe {
    Pipe() {
        int ends[2];
        EXPECT_EQ(::pipe(ends), 0);
        reading.reset(ends[0]);
        writing.reset(ends[1]);
    }
    void write() const { EXPECT_EQ(::write(writing.get(), "x", 1), 1); }
    void read() const {
        char byte = 0;
        EXPECT_EQ(::read(reading.get(), &byte, 1), 1);
    }
    FileDescriptor reading;
    FileDescriptor writing;
};

TEST(RunLoop, RunsWorkOfAllThreadsInOrder) {
    auto loop = RunLoop::create().value();
    const auto loopThread = std::this_thread::get_id();
    std::string order;
    loop->async([&] { order += "a"; });
    std::jthread([&] {
        loop->async([&] {
            EXPECT_EQ(std::this_thread::get_id(), loopThread);
            order += "b";
            loop->async([&] {
                order += "d";
                loop->stop();
            });
        });
        loop->async([&] { order += "c"; });
    }).join();
    loop->run();
    EXPECT_EQ(order, "abcd");
}

TEST(RunLoop, ServesADescriptorUntilItsSourceGoes) {
    auto loop = RunLoop::create().value();
    const Pipe pipe;
    int calls = 0;
    std::optional<RunLoop::Source> source;
    source = loop->addSource(pipe.reading.get(), EPOLLIN,
                             [&, held = std::make_unique<int>(3)](std::uint32_t events) {
                                 EXPECT_EQ(events, static_cast<std::uint32_t>(EPOLLIN));
                                 if (++calls == *held) {
                                     source.reset();
                                     EXPECT_EQ(*held, 3) << "a handler outlives the removal of its own source";
                                     loop->async([&] { loop->stop(); });
                                 }
                             })
                 .value();
    pipe.write();
    loop->run();
    EXPECT_EQ(calls, 3);
    EXPECT_EQ(loop->addSource(-1, EPOLLIN, [](std::uint32_t) {}).error(), EBADF);
}

TEST(RunLoop, ForgetsEventsOfASourceRemovedInTheSameRound) {
    auto loop = RunLoop::create().value();
    const Pipe pipes[2];
    int calls = 0;
    RunLoop::Source sources[2];
    for (const int index : {0, 1})
        sources[index] = loop->addSource(pipes[index].reading.get(), EPOLLIN,
                                         [&, index](std::uint32_t) {
                                             ++calls;
                                             pipes[index].read();
                                             sources[1 - index].remove();
                                             loop->async([&] { loop->stop(); });
                                         })
                             .value();
    pipes[0].write();
    pipes[1].write();
    loop->run();
    EXPECT_EQ(calls, 1);
}

TEST(RunLoop, PausesASourceWithoutEvents) {
    auto loop = RunLoop::create().value();
    const Pipe pipe;
    int calls = 0;
    auto source = loop->addSource(pipe.reading.get(), EPOLLIN,
                                  [&](std::uint32_t) {
                                      pipe.read();
                                      ++calls;
                                      loop->stop();
                                  })
                      .value();
    source.setEvents(0);
    pipe.write();
    loop->async([&] { loop->stop(); });
    loop->run();
    EXPECT_EQ(calls, 0);
    source.setEvents(EPOLLIN);
    loop->run();
    EXPECT_EQ(calls, 1);
}

TEST(RunLoop, StopsBeforeTheNextPieceOfWork) {
    auto loop = RunLoop::create().value();
    int ran = 0;
    loop->stop();
    loop->async([&] {
        ++ran;
        loop->stop();
    });
    loop->async([&] {
        ++ran;
        loop->stop();
    });
    for (const int expected : {0, 1, 2}) {
        loop->run();
        EXPECT_EQ(ran, expected);
    }
}

} // namespace
} // namespace ost::platform
