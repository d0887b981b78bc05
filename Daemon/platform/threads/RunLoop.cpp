#include "platform/threads/RunLoop.h"

#include "platform/base/Assert.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <span>

namespace ost::platform {

namespace {

constexpr std::uint64_t wakeUpId = 0;
constexpr std::size_t eventsPerWait = 32; // bounds how long enqueued work waits for busy descriptors

} // namespace

RunLoop::Source& RunLoop::Source::operator=(Source&& other) noexcept {
    if (this != &other) {
        remove();
        _loop = std::exchange(other._loop, nullptr);
        _id = other._id;
    }
    return *this;
}

void RunLoop::Source::setEvents(std::uint32_t events) {
    OST_ASSERT(_loop);
    _loop->_setEvents(_id, events);
}

void RunLoop::Source::remove() noexcept {
    if (auto* loop = std::exchange(_loop, nullptr))
        loop->_remove(_id);
}

std::expected<std::unique_ptr<RunLoop>, Errno> RunLoop::create() {
    FileDescriptor epoll(::epoll_create1(EPOLL_CLOEXEC));
    FileDescriptor wakeUp(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    epoll_event event{.events = EPOLLIN, .data = {.u64 = wakeUpId}};
    if (!epoll || !wakeUp || ::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, wakeUp.get(), &event) != 0)
        return std::unexpected(errno);
    return std::unique_ptr<RunLoop>(new RunLoop(std::move(epoll), std::move(wakeUp)));
}

std::expected<RunLoop::Source, Errno> RunLoop::addSource(int fd, std::uint32_t events, Handler handler) {
    OST_ASSERT(_thread == std::this_thread::get_id());
    const auto id = ++_lastId;
    epoll_event event{.events = events, .data = {.u64 = id}};
    if (::epoll_ctl(_epoll.get(), EPOLL_CTL_ADD, fd, &event) != 0)
        return std::unexpected(errno);
    Source source(*this, id);
    _sources.emplace(id, std::make_shared<Registration>(fd, std::move(handler)));
    return source;
}

void RunLoop::_setEvents(std::uint64_t id, std::uint32_t events) {
    OST_ASSERT(_thread == std::this_thread::get_id());
    epoll_event event{.events = events, .data = {.u64 = id}};
    const auto changed = ::epoll_ctl(_epoll.get(), EPOLL_CTL_MOD, _sources.at(id)->fd, &event);
    OST_ASSERT(changed == 0);
}

void RunLoop::_remove(std::uint64_t id) noexcept {
    OST_ASSERT(_thread == std::this_thread::get_id());
    const auto found = _sources.find(id);
    if (found == _sources.end())
        return;
    ::epoll_ctl(_epoll.get(), EPOLL_CTL_DEL, found->second->fd, nullptr);
    // The handler may own what removes it, so it goes when the table no longer knows it.
    const auto removed = std::move(found->second);
    _sources.erase(found);
}

void RunLoop::async(Work work) {
    {
        const MutexLock lock(_mutex);
        _work.push_back(std::move(work));
    }
    _wake();
}

void RunLoop::stop() {
    _stopping = true;
    _wake();
}

void RunLoop::_wake() {
    const std::uint64_t one = 1;
    // A counter that is full wakes the loop just as well.
    [[maybe_unused]] const auto written = ::write(_wakeUp.get(), &one, sizeof one);
}

void RunLoop::run() {
    OST_ASSERT(_thread == std::this_thread::get_id());
    std::array<epoll_event, eventsPerWait> events;
    while (!_stopping) {
        const int count = ::epoll_wait(_epoll.get(), events.data(), eventsPerWait, -1);
        OST_ASSERT(count >= 0 || errno == EINTR);
        bool hasWork = false;
        for (const auto& event : std::span(events).first(static_cast<std::size_t>(std::max(count, 0)))) {
            if (event.data.u64 == wakeUpId)
                hasWork = true;
            else if (!_stopping)
                _serve(event.data.u64, event.events);
        }
        if (hasWork && !_stopping)
            _runWork();
    }
    _stopping = false;
}

void RunLoop::_runWork() {
    // Cleared before the work is taken: work that comes later sets it again.
    std::uint64_t wakeUps = 0;
    [[maybe_unused]] const auto read = ::read(_wakeUp.get(), &wakeUps, sizeof wakeUps);
    std::vector<Work> taken;
    {
        const MutexLock lock(_mutex);
        taken.swap(_work);
    }
    for (auto work = taken.begin(); work != taken.end(); ++work) {
        (*work)();
        *work = nullptr;
        if (_stopping) {
            // What was taken but not run keeps its place for the next run.
            const MutexLock lock(_mutex);
            _work.insert(_work.begin(), std::make_move_iterator(work + 1), std::make_move_iterator(taken.end()));
            _wake();
            return;
        }
    }
}

void RunLoop::_serve(std::uint64_t id, std::uint32_t events) {
    const auto found = _sources.find(id);
    if (found == _sources.end())
        return;
    // Kept alive: a handler may remove its own source.
    const auto registration = found->second;
    registration->handler(events);
}

} // namespace ost::platform
