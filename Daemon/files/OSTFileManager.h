#pragma once

#include "files/OSTTreeWalk.h"
#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/OSTError.h"

#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <expected>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace ost {

/// The file directly inside every container directory that says what the container is.
inline constexpr std::string_view OSTMetadataFileName = ".com.tamarok.ostrand.metadata.plist";

/// The protection class argument that leaves the class alone.
inline constexpr std::int32_t OSTKeepProtectionClass = -1;
/// The protection class of what must stay readable while the device is locked.
inline constexpr std::int32_t OSTNoProtectionClass = 4;

struct OSTDirectoryAttributes {
    bool withIntermediateDirectories = false; ///< missing parents are made too, with the same mode
    mode_t mode = 0755;
    std::uint32_t owner = 0; ///< user and group; 0 leaves the owner unchanged
    std::int32_t protectionClass = OSTKeepProtectionClass;
    bool durable = false; ///< each new directory is on disk in its parent, or is not made
};

struct OSTFileAttributes {
    mode_t mode = 0644;
    std::int32_t protectionClass = OSTNoProtectionClass;
};

/// What a file is to hold.
struct OSTFileContent {
    std::string path;
    std::string bytes;
};

/// Where a file is while it is being written: in its own directory, or in the one that holds that.
enum class OSTWorkshop : bool { ownDirectory, directoryAbove };

/// What an item is whatever its path. A later item that gets its number is told apart by the time at which it was made,
/// where the file system keeps that.
struct OSTItemIdentity {
    dev_t device;
    ino_t inode;
    std::chrono::nanoseconds made;
    friend bool operator==(const OSTItemIdentity&, const OSTItemIdentity&) = default;
};

/// Decides from the class that an item has whether it gets another one.
using OSTClassPredicate = std::function<bool(std::int32_t itemClass)>;

class OSTOwnFiles;

/// One item of a directory listing; its path is that of the directory and the name.
struct OSTDirectoryItem {
    std::string name;
    bool isDirectory;
};

/// A new file that is complete but may be lost in a power cut until `makeDurable` was called. Move-only; owns the
/// descriptors of the file and of its directory.
class OSTNewFile {
public:
    /// Waits until the file, its name and whatever else was made in its directory in the meantime are on disk.
    [[nodiscard]] OSTResult<void> makeDurable();

private:
    friend class OSTFileManager;
    OSTNewFile(std::string path, platform::FileDescriptor file, platform::FileDescriptor directory)
        : _path(std::move(path)), _file(std::move(file)), _directory(std::move(directory)) {}

    std::string _path;
    platform::FileDescriptor _file;
    platform::FileDescriptor _directory;
};

/// The store's single door to the file system for whole items.
///
/// Users own the directories in which the daemon, as root, works. So a path is absolute and passes no symbolic link
/// (ELOOP, ENOTDIR), an item is reached through the descriptor of the directory that holds it and is never followed
/// when it is a link, owners and modes are changed through descriptors, and nothing waits for what a user may have put
/// in a file's place.
///
/// Errors are of the POSIX domain, with the errno as code, unless a function says otherwise; they are not logged.
///
/// Threads: any. There is no state and no lock; callers that work on the same items hold a lock of the store. One
/// shared instance.
class OSTFileManager {
public:
    static const OSTFileManager& defaultManager();

    // Directories

    /// Makes the directory at `path`, or takes the one that is there, and applies class and owner to it. The mode is
    /// that of a new directory only; a failure to change the owner is ignored. In a directory whose ACL is handed down,
    /// mode 0 takes nothing from the entries inherited. Fails with ENOTDIR when something else is in the place.
    [[nodiscard]] OSTResult<void> createDirectoryAtURL(std::string_view path,
                                                       const OSTDirectoryAttributes& attributes = {}) const;
    /// Opens the directory at `path` for the functions that take a path relative to one.
    [[nodiscard]] OSTResult<platform::FileDescriptor> openDirectoryAtURL(std::string_view path) const;
    /// Makes a directory with a unique name, "temp." and six characters, and mode 0700. Returns its path.
    [[nodiscard]] OSTResult<std::string> createTemporaryDirectoryInDirectoryURL(std::string_view path,
                                                                                std::uint32_t owner = 0) const;
    /// Waits until the names in the directory at `path` are on disk, and so what was last moved there.
    [[nodiscard]] OSTResult<void> makeDirectoryDurable(std::string_view path) const;

    /// Waits until an item is on disk where it was moved, and then until it has left the directory that it came from: a
    /// power cut meanwhile may leave it in both places, but never in none.
    [[nodiscard]] OSTResult<void> makeMoveDurable(std::string_view source, std::string_view destination) const;

    /// Waits until everything that was changed on the file system of the directory at `path` is on disk.
    [[nodiscard]] OSTResult<void> makeFileSystemDurable(std::string_view path) const;

    // Removal

    /// Removes the item at `path` with everything below it; an item that is missing is success. Immutable flags are
    /// cleared where they are in the way; mount points are left alone. Goes on after a failure, which is logged; the
    /// first one is the result. An empty path is EFAULT.
    [[nodiscard]] OSTResult<void> removeItemAtURL(std::string_view path) const;

    // Copying and moving

    /// Copies an item with everything below it: data, mode, owner, times, extended attributes and ACLs. Nothing may be
    /// at the destination (EEXIST), where the copy appears when it is complete. A missing source is ENOENT, or success
    /// where the name says so.
    [[nodiscard]] OSTResult<void> copyItemAtURL(std::string_view source, std::string_view destination) const;
    [[nodiscard]] OSTResult<void> copyItemIfExistsAtURL(std::string_view source, std::string_view destination) const;

    /// Renames an item. To another file system it is copied and then removed; what then is left of it is logged.
    [[nodiscard]] OSTResult<void> moveItemAtURL(std::string_view source, std::string_view destination) const;
    [[nodiscard]] OSTResult<void> moveItemIfExistsAtURL(std::string_view source, std::string_view destination) const;

    // Looking

    /// The items of a directory in the directory's own order, without those whose name begins with a dot.
    [[nodiscard]] OSTResult<std::vector<OSTDirectoryItem>> urlsForItemsInDirectoryAtURL(std::string_view path) const;

    /// Whether anything is at `path`. What cannot be found out is logged and false in both questions.
    [[nodiscard]] bool itemExistsAtURL(std::string_view path) const;
    [[nodiscard]] bool itemDoesNotExistAtURL(std::string_view path) const;

    /// The same for a path relative to `directory`, where many items are looked at. A link or a file on the way says as
    /// well that nothing is there.
    [[nodiscard]] bool itemDoesNotExist(int directory, std::string_view relativePath) const;

    /// The bytes that everything below the directory at `path` takes on disk, each file once however many names it has.
    /// Directories themselves count nothing, links are not followed, other file systems are left out. What cannot be
    /// read is logged and left out; 0 when nothing could be measured.
    [[nodiscard]] std::uint64_t diskUsageForURL(std::string_view path) const;

    /// Writes the items of the tree at `path` to the log, the first `maximumLines` of them and a line that says so.
    void printDirectoryStructureAtURL(std::string_view path, std::size_t maximumLines) const;

    /// What lies at `path` now.
    [[nodiscard]] OSTResult<OSTItemIdentity> identityOfItemAtURL(std::string_view path) const;
    [[nodiscard]] OSTResult<uid_t> ownerOfItemAtURL(std::string_view path) const;

    // Reading and writing files

    /// Reads a regular file of at most `maximumSize` bytes. Anything else in its place fails at once: EFBIG for a
    /// larger file, ELOOP for a link, EISDIR for a directory, EINVAL for the rest.
    [[nodiscard]] OSTResult<std::string> readFileAtURL(std::string_view path, std::size_t maximumSize) const;
    /// The same into `buffer`, for a path relative to `directory`, where many files are read. Fails with the bare
    /// errno.
    [[nodiscard]] std::expected<void, platform::Errno> readFile(int directory, std::string_view relativePath,
                                                                std::size_t maximumSize, std::string& buffer) const;

    /// Writes a file in one step: who opens `path`, now or after a power cut, finds the old content or all of the
    /// new. The new file is on disk when this returns. A crash may leave an unfinished file in the workshop.
    [[nodiscard]] OSTResult<void> writeFileAtomicallyAtURL(std::string_view path, std::string_view bytes,
                                                           const OSTFileAttributes& attributes = {},
                                                           OSTWorkshop workshop = OSTWorkshop::ownDirectory) const;
    /// The same for many files, with a wait for the file system before they take their places and one afterwards; they
    /// are unfinished in the directories above their own. The results are in the order of the files.
    [[nodiscard]] std::vector<OSTResult<void>>
    writeFilesAtomicallyAtURLs(const std::vector<OSTFileContent>& files) const;
    /// The paths of the unfinished files and copies that an earlier process left in a directory; none when it cannot be
    /// listed.
    [[nodiscard]] std::vector<std::string> unfinishedItemsInDirectoryURL(std::string_view path) const;
    /// Removes them.
    void removeUnfinishedItemsInDirectoryURL(std::string_view path) const;
    /// Writes a file that must not exist yet (EEXIST), in a directory that nobody else looks into, and leaves the wait
    /// for the disk to the caller.
    [[nodiscard]] OSTResult<OSTNewFile> createFileAtURL(std::string_view path, std::string_view bytes,
                                                        const OSTFileAttributes& attributes = {}) const;

    // Data-protection classes (OSTFileManager+ProtectionClasses.cpp).
    // The item is opened like any file and never followed. EPERM stands for a locked device, or for an item that may
    // not be changed; EBADF for one that carries no class.

    /// The class of an item.
    [[nodiscard]] OSTResult<std::int32_t> dataProtectionClassOfItemAtURL(std::string_view path) const;
    /// Sets the class of an item, unless the predicate declines.
    [[nodiscard]] OSTResult<void> setDataProtectionClassOfItemAtURL(std::string_view path, std::int32_t toClass,
                                                                    const OSTClassPredicate& ifPredicate = {}) const;
    /// The same for the item to which a walk has come. An item that has become one of another kind meanwhile is left
    /// alone, and so is a file that is not the tree's own.
    [[nodiscard]] OSTResult<void> setDataProtectionClassOfItem(const OSTTreeEntry& entry, OSTOwnFiles& ownFiles,
                                                               std::int32_t toClass,
                                                               const OSTClassPredicate& ifPredicate) const;
    /// Whether nobody may change the item to which a walk has come: it is immutable or append-only.
    [[nodiscard]] bool itemIsFixed(const OSTTreeEntry& entry) const;
    /// The file mode of that item, 0 when it cannot be read.
    [[nodiscard]] mode_t modeOfItem(const OSTTreeEntry& entry) const;

    // Access control lists and owners of whole containers (OSTFileManager+SystemContainerACLs.cpp).
    // Metadata files are left alone. An item that cannot be changed is logged and the next one follows; a file with a
    // name outside the tree is such an item, because it may be anybody's.

    /// Gives the top directory of a system container the ACL that hands "systemusers" full access down to new items.
    /// Fails with code 63.
    [[nodiscard]] OSTResult<void> setTopLevelSystemContainerACLAtURL(std::string_view path) const;
    /// Sets the ACLs of a whole system container; everything below the top gets mode 0 and the owner -2.
    /// Fails with code 63, or with the errno of an item without readable status.
    [[nodiscard]] OSTResult<void> standardizeACLsForSystemContainerAtURL(std::string_view path) const;
    /// The same for every item of the directory at `path`, which may be missing. Goes on after a failure, which is
    /// logged; the last one is the result.
    [[nodiscard]] OSTResult<void> standardizeAllSystemContainerACLsAtURL(std::string_view path) const;
    /// Gives a tree one owner and the modes 0755 for directories and executables, 0644 for the rest.
    [[nodiscard]] OSTResult<void> standardizeOwnershipAtURL(std::string_view path, std::uint32_t userId,
                                                            std::uint32_t groupId) const;

private:
    enum class MissingSource : bool { isSuccess, fails };

    OSTFileManager() = default;

    [[nodiscard]] OSTResult<void> _waitForDirectory(std::string_view path, int (*synchronise)(int)) const;
    [[nodiscard]] OSTResult<void> _copyItemAtURL(std::string_view source, std::string_view destination,
                                                 MissingSource missingSource) const;
    [[nodiscard]] OSTResult<void> _moveItemAtURL(std::string_view source, std::string_view destination,
                                                 MissingSource missingSource) const;
};

} // namespace ost
