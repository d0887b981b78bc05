#pragma once

#include "EndToEnd/GatedProcess.h"
#include "platform/base/FileDescriptor.h"

#include <filesystem>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ost::test {

/// Follows what a daemon changes on its device and what it waits for, on a disk that keeps no order: a change that was
/// not waited for, of a directory, a file or an attribute, may be lost in a power cut on its own.
///
/// What is thrown away, the log, and owners of the layout's directories, which are set at each access, do not count. An
/// item that the sandbox no longer has may come back, and so may unfinished files: a start removes them. The note of an
/// item may be lost, because the item itself is on disk.
///
/// Threads: any.
class DiskOrder {
public:
    /// `image` is the device's directory on the host.
    explicit DiskOrder(std::filesystem::path image) : _image(std::move(image)) {}

    void operator()(const GatedCall& call);

    /// The paths of the device that a power cut might leave otherwise now, with the reason.
    [[nodiscard]] std::vector<std::string> notOnDisk();
    /// Steps that were taken before one on which they rely was on disk.
    [[nodiscard]] std::vector<std::string> takenTooEarly();
    /// The paths that were waited for. One that stood for its file system is there with `ofFileSystem` behind it, too.
    [[nodiscard]] std::set<std::string> waitedFor();
    static constexpr const char* ofFileSystem = " and all with it";
    /// Forgets all that happened. `isSuccessor`: what the daemon finds was left by another one that was killed.
    void forget(bool isSuccessor = false);

private:
    /// A file or directory, wherever it is moved.
    using Identity = std::pair<dev_t, ino_t>;
    enum class Kind {
        attributes, ///< or content
        names,      ///< of a directory
        received,   ///< a directory into which another one was moved
        parked,     ///< out of which, or into which, a container was put aside
    };
    struct Change {
        platform::FileDescriptor item;
        std::set<Kind> kinds = {};
        std::string reason = {};
    };
    /// A name in a directory.
    struct Place {
        platform::FileDescriptor directory;
        std::string name;
    };

    [[nodiscard]] Place _place(const GatedCall& call, unsigned directory, unsigned path) const;
    [[nodiscard]] std::string _pathOf(int item) const;
    [[nodiscard]] platform::FileDescriptor _itemAt(const Place& place) const;

    void _lookAtWhatIsNew();
    void _mark(int item, const std::set<Kind>& kinds, const std::string& reason);
    void _markNames(const Place& place, std::set<Kind> kinds, const std::string& reason);
    void _makesFile(Place place);
    void _removes(const Place& place);
    void _moves(const Place& from, const Place& to);
    void _judgeContainer(const std::string& from, const std::string& to);
    void _judgeDiscard(const std::string& name);
    void _waits(int item, bool wholeFileSystem);
    [[nodiscard]] bool _counts(const Change& change) const;
    /// Records that `step` was taken while something of this kind was not on disk.
    void _requireOnDisk(const std::string& step, const auto& isNeeded);

    const std::filesystem::path _image;
    std::mutex _mutex; ///< guards the rest
    std::map<Identity, Change> _changes;
    std::vector<Place> _new; ///< about to be made
    std::vector<std::string> _tooEarly;
    std::set<std::string> _waitedFor;
    bool _isSuccessor = false;
};

} // namespace ost::test
