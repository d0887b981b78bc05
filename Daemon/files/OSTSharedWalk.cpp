#include "files/OSTSharedWalk.h"

#include "files/OSTPathResolution.h"
#include "platform/base/Mutex.h"
#include "platform/threads/Aside.h"

#include <atomic>
#include <cerrno>
#include <climits>
#include <future>
#include <optional>
#include <utility>
#include <vector>

namespace ost {

using platform::FileDescriptor;
using Next = OSTTreeVisitor::Next;

namespace {

/// A thread costs about as much as so many items.
constexpr std::uint64_t itemsOfLargeTree = 256;

/// As many directories wait for the other thread; further ones are entered by the thread that finds them, as are those
/// whose path the kernel does not take at once.
constexpr std::size_t maximumWaiting = 64;
constexpr std::size_t longestPath = PATH_MAX - 1;

class SharedWalk {
public:
    SharedWalk(FileDescriptor top, std::string_view path, OSTTreeVisitor& visitor)
        : _top(std::move(top)), _path(path), _visitor(visitor) {
        while (_path.ends_with('/'))
            _path.pop_back();
    }

    void run() {
        _work();
        if (_aside.valid())
            _aside.get();
    }

private:
    /// A directory that is being walked, and may still bring others to light.
    class Turn {
    public:
        explicit Turn(SharedWalk& walk) : _walk(walk) {}
        Turn(const Turn&) = delete;
        Turn& operator=(const Turn&) = delete;
        ~Turn() {
            const platform::MutexLock lock(_walk._mutex);
            if (!_isDone)
                _walk._stopped = true;
            if (--_walk._turns == 0 || _walk._stopped)
                _walk._changed.notifyAll();
        }
        void done(Next next) { _isDone = next != Next::stop; }

    private:
        SharedWalk& _walk;
        bool _isDone = false;
    };

    void _work() {
        while (const auto directory = _take()) {
            Turn turn(*this);
            turn.done(_walkFrom(*directory));
        }
    }

    /// The next directory, or none when the walk is over. What is taken is given back with a `Turn`.
    [[nodiscard]] std::optional<std::string> _take() {
        platform::MutexLock lock(_mutex);
        _changed.wait(lock, [this]() OST_REQUIRES(_mutex) { return _stopped || !_waiting.empty() || _turns == 0; });
        if (_stopped || _waiting.empty())
            return std::nullopt;
        std::optional directory = std::move(_waiting.back());
        _waiting.pop_back();
        ++_turns;
        return directory;
    }

    /// Leaves the cursor's current item to whichever thread is the first to have nothing to do, if it can wait.
    [[nodiscard]] bool _leaveToOthers(const OSTTreeCursor& cursor) {
        if (cursor.path().size() - _path.size() - 1 > longestPath)
            return false;
        const platform::MutexLock lock(_mutex);
        if (_waiting.size() == maximumWaiting)
            return false;
        _waiting.push_back(cursor.path().substr(_path.size() + 1));
        _changed.notifyOne();
        return true;
    }

    /// Walks a directory and what below it is not left to others.
    [[nodiscard]] Next _walkFrom(const std::string& relative) {
        const auto path = relative.empty() ? _path : _path + "/" + relative;
        auto opened = OSTOpenSubdirectory(_top.get(), relative.empty() ? "." : relative);
        if (!opened)
            return _cannotOpen(path, opened.error());
        OSTTreeCursor cursor(*std::move(opened), path);
        _visitor.visitDirectory(cursor.directory(), path);
        while (!_stopped) {
            const auto found = cursor.next();
            if (found && *found) {
                if (_visit(cursor) == Next::stop)
                    return Next::stop;
                continue;
            }
            if (!found && _visitor.cannotRead(cursor.directoryPath(), cursor.number(), found.error()) == Next::stop)
                return Next::stop;
            if (cursor.depth() == 0)
                return Next::goOn;
            if (const auto left = cursor.leave(); !left) // and no way back to the rest
                return _visitor.cannotOpen(cursor.path(), left.error());
        }
        return Next::stop;
    }

    [[nodiscard]] Next _visit(OSTTreeCursor& cursor) {
        _countItem();
        const auto next = _visitor.visitItem(cursor);
        if (next != Next::enter || _leaveToOthers(cursor))
            return next;
        if (const auto entered = cursor.enter(); !entered)
            return _cannotOpen(cursor.path(), entered.error());
        _visitor.visitDirectory(cursor.directory(), cursor.directoryPath());
        return Next::goOn;
    }

    [[nodiscard]] Next _cannotOpen(const std::string& path, platform::Errno error) {
        return error == EXDEV ? Next::goOn : _visitor.cannotOpen(path, error);
    }

    void _countItem() {
        if (_isLarge || ++_items < itemsOfLargeTree)
            return;
        _isLarge = true; // before there is another thread to read it
        _aside = platform::startAside([this] { _work(); });
    }

    const FileDescriptor _top;
    std::string _path;
    OSTTreeVisitor& _visitor;

    // Of the first thread, as long as it is alone.
    std::uint64_t _items = 0;
    bool _isLarge = false;

    platform::Mutex _mutex;
    platform::Condition _changed;
    std::vector<std::string> _waiting OST_GUARDED_BY(_mutex){std::string()}; // relative to the top
    std::size_t _turns OST_GUARDED_BY(_mutex) = 0;
    std::atomic<bool> _stopped = false;

    std::future<void> _aside; // last: waits for the thread
};

} // namespace

void OSTWalkShared(FileDescriptor top, std::string_view path, OSTTreeVisitor& visitor) {
    SharedWalk(std::move(top), path, visitor).run();
}

} // namespace ost
