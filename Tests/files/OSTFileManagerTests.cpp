#include "files/OSTFileManager.h"

#include "Support/ScratchDirectory.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/device/ProtectionClass.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

namespace ost {
namespace {

namespace fs = std::filesystem;
using test::readFile;
using test::tree;
using test::writeFile;

struct stat statusOf(const std::string& path) {
    struct stat status{};
    EXPECT_EQ(::lstat(path.c_str(), &status), 0) << path << ": " << std::strerror(errno);
    return status;
}

std::string ownerAndMode(const std::string& path) {
    const auto status = statusOf(path);
    return platform::formatMessage("%u:%u ", status.st_uid, status.st_gid) + std::to_string(status.st_mode & 07777);
}

/// The flag that keeps even root from changing or removing a file.
bool setImmutable(const std::string& path, bool immutable) {
    const platform::FileDescriptor file(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
    int flags = 0;
    if (::ioctl(file.get(), FS_IOC_GETFLAGS, &flags) != 0)
        return false;
    flags = immutable ? flags | FS_IMMUTABLE_FL : flags & ~FS_IMMUTABLE_FL;
    return ::ioctl(file.get(), FS_IOC_SETFLAGS, &flags) == 0;
}

/// A file system of its own, mounted for the life of the object.
class Mount {
public:
    explicit Mount(std::string path, const char* options = "") : _path(std::move(path)) {
        fs::create_directories(_path);
        _mounted = ::mount("tmpfs", _path.c_str(), "tmpfs", 0, options) == 0;
    }
    ~Mount() {
        if (_mounted)
            ::umount2(_path.c_str(), MNT_DETACH);
    }
    Mount(const Mount&) = delete;
    Mount& operator=(const Mount&) = delete;
    explicit operator bool() const { return _mounted; }

private:
    std::string _path;
    bool _mounted;
};

/// A directory tree of the given depth, made by descriptor: its path is longer than any system call takes.
void makeDeepTree(const std::string& top, int depth) {
    fs::create_directory(top);
    platform::FileDescriptor directory(::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    for (int level = 0; level < depth; ++level) {
        ASSERT_TRUE(directory);
        ASSERT_EQ(::mkdirat(directory.get(), "level", 0755), 0);
        ASSERT_EQ(::mknodat(directory.get(), "file", S_IFREG | 0644, 0), 0);
        directory.reset(::openat(directory.get(), "level", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    }
}

class OSTFileManagerTest : public testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0)
            GTEST_SKIP() << "Owners and device files need root";
        ::umask(0);
        ASSERT_TRUE(platform::Log::shared().open(platform::LogLevel::notice, {log, 1, 1U << 20U}));
    }

    [[nodiscard]] std::string at(std::string_view name) const { return platform::pathByAppending(scratch, name); }
    [[nodiscard]] std::string logged() const { return readFile(log); }

    /// What a hostile user may have left in the place of a file or directory, each beside a victim it leads to.
    [[nodiscard]] std::vector<std::string> plantObstacles() const {
        writeFile(at("victim/file"), "untouched");
        fs::create_symlink(at("victim"), at("link"));
        fs::create_symlink(at("victim/file"), at("fileLink"));
        fs::create_symlink(at("nowhere"), at("dangling"));
        fs::create_hard_link(at("victim/file"), at("hardLink"));
        EXPECT_EQ(::mkfifo(at("fifo").c_str(), 0666), 0);
        EXPECT_EQ(::mknod(at("device").c_str(), S_IFCHR | 0666, 0x0105), 0); // zeroes without end
        return {"link", "fileLink", "dangling", "hardLink", "fifo", "device"};
    }

    const OSTFileManager& files = OSTFileManager::defaultManager();
    const std::string log = test::makeScratchDirectory() / "log";
    const std::string scratch = test::makeScratchDirectory();
};

int errorOf(const auto& result) { return result ? 0 : static_cast<int>(result.error().code()); }

std::string messageOf(const auto& result) { return result ? "" : result.error().message().value_or(""); }

TEST_F(OSTFileManagerTest, AnItemIsToldFromALaterOneByWhenItWasMade) {
    const auto make = [&] {
        fs::remove(at("item"));
        fs::create_directory(at("item"));
        return OSTFileManager::defaultManager().identityOfItemAtURL(at("item")).value();
    };
    const auto first = make();
    EXPECT_EQ(OSTFileManager::defaultManager().identityOfItemAtURL(at("item")), first);
    auto later = make();
    for (int attempt = 0; attempt < 100'000 && later.made == first.made; ++attempt) // until the clock of files moves on
        later = make();
    later.inode = first.inode;
    EXPECT_NE(later, first);
}

TEST_F(OSTFileManagerTest, CreatesDirectoriesWithModeOwnerAndClass) {
    const struct {
        const char* path;
        OSTDirectoryAttributes attributes;
        const char* ownerAndMode;
        const char* message;
    } cases[] = {
        {"a", {.mode = 0750}, "0:0 488", ""},
        {"a", {.mode = 0700, .owner = 501}, "501:501 488", ""},
        {"a/", {.owner = 501, .protectionClass = 4}, "501:501 488", ""},
        {"b/c/d", {.mode = 0755}, nullptr, "mkdir of %s failed: No such file or directory"},
        {"b/c/d", {.withIntermediateDirectories = true, .mode = 0711, .owner = 33}, "33:33 457", ""},
        {"b/c", {.withIntermediateDirectories = true}, "0:0 457", ""},
        {"zero", {.mode = 0, .owner = 4294967294}, "4294967294:4294967294 0", ""},
    };
    for (const auto& c : cases) {
        const auto path = at(c.path);
        const auto made = files.createDirectoryAtURL(path, c.attributes);
        EXPECT_EQ(messageOf(made), c.message[0] ? std::string(c.message).replace(9, 2, path) : "") << path;
        if (c.ownerAndMode) {
            EXPECT_EQ(ownerAndMode(path), c.ownerAndMode) << path;
        }
    }
    const auto directory = files.openDirectoryAtURL(at("a"));
    ASSERT_TRUE(directory);
    EXPECT_EQ(platform::protectionClass(directory->get(), -1), 4);
}

TEST_F(OSTFileManagerTest, NeverMakesOrChangesADirectoryThroughAnObstacle) {
    for (const auto& name : plantObstacles()) {
        const auto before = tree(scratch);
        for (const bool intermediates : {false, true})
            for (const auto* const below : {"", "/new", "/new/deep"}) {
                const OSTDirectoryAttributes attributes{
                    .withIntermediateDirectories = intermediates, .owner = 501, .protectionClass = 0};
                const int error = errorOf(files.createDirectoryAtURL(at(name) + below, attributes));
                EXPECT_TRUE(error == ENOTDIR || error == ELOOP) << name << below << ": " << std::strerror(error);
            }
        EXPECT_EQ(tree(scratch), before) << name;
    }
    for (const auto* const path : {"", "/", "/..", "a/.."})
        EXPECT_FALSE(files.createTemporaryDirectoryInDirectoryURL(at("victim/file") + path)) << path;
}

TEST_F(OSTFileManagerTest, TemporaryDirectoriesAreUniqueAndPrivate) {
    const auto first = files.createTemporaryDirectoryInDirectoryURL(scratch);
    const auto second = files.createTemporaryDirectoryInDirectoryURL(scratch + "/", 501);
    ASSERT_TRUE(first && second);
    EXPECT_NE(*first, *second);
    EXPECT_TRUE(first->starts_with(at("temp.")));
    EXPECT_EQ(first->size(), at("temp.XXXXXX").size());
    EXPECT_EQ(ownerAndMode(*first), "0:0 448");
    EXPECT_EQ(ownerAndMode(*second), "501:501 448");
    EXPECT_EQ(messageOf(files.createTemporaryDirectoryInDirectoryURL(at("missing"))),
              "Failed to create temp dir at path " + at("missing/temp.XXXXXX") + " : No such file or directory");
}

TEST_F(OSTFileManagerTest, RemovesWhateverIsThereAndNothingElse) {
    EXPECT_EQ(messageOf(files.removeItemAtURL("")), "nil url passed to -removeItemAtURL:error:");
    EXPECT_EQ(errorOf(files.removeItemAtURL("")), EFAULT);
    EXPECT_TRUE(files.removeItemAtURL(at("missing")));
    EXPECT_TRUE(files.removeItemAtURL(at("missing/too")));
    EXPECT_EQ(errorOf(files.removeItemAtURL(scratch + "/..")), EINVAL);

    writeFile(at("tree/.hidden/locked/file"), "x");
    ASSERT_EQ(::chmod(at("tree/.hidden/locked").c_str(), 0), 0);
    writeFile(at("outside/file"), "kept");
    fs::create_directory_symlink(at("outside"), at("tree/link"));
    fs::create_hard_link(at("outside/file"), at("tree/file"));
    ASSERT_EQ(::mkfifo(at("tree/fifo").c_str(), 0600), 0);
    EXPECT_TRUE(files.removeItemAtURL(at("tree/")));
    EXPECT_EQ(tree(scratch), "drwxrwxrwx 0:0 outside\n-rw-r--r-- 0:0 outside/file\n");

    for (const auto& name : plantObstacles()) {
        const auto below = files.removeItemAtURL(at(name) + "/file");
        EXPECT_TRUE(errorOf(below) == ELOOP || errorOf(below) == ENOTDIR) << name;
        EXPECT_EQ(messageOf(below), "sweeptree of " + at(name) + "/file failed: " + std::strerror(errorOf(below)));
        EXPECT_TRUE(files.removeItemAtURL(at(name))) << name;
    }
    EXPECT_EQ(readFile(at("victim/file")), "untouched");
}

TEST_F(OSTFileManagerTest, RemovesATreeDeeperThanPathsAndDescriptorsReach) {
    constexpr int depth = 3000; // a path of 18,000 bytes
    makeDeepTree(at("deep"), depth);
    writeFile(at("deep/level/level/after/the/deep/part"), "x");
    struct rlimit descriptors{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &descriptors), 0);
    const struct rlimit few{.rlim_cur = 60, .rlim_max = descriptors.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &few), 0);
    const auto removed = files.removeItemAtURL(at("deep"));
    ::setrlimit(RLIMIT_NOFILE, &descriptors);
    EXPECT_EQ(messageOf(removed).substr(0, 200), "");
    EXPECT_FALSE(fs::exists(at("deep")));
}

/// Files of which a tree is large enough to be removed by two threads.
void fill(const std::string& directory) {
    for (int number = 0; number < 2000; ++number)
        writeFile(directory + "/" + std::to_string(number), "");
}

TEST_F(OSTFileManagerTest, RemovalClearsImmutableFlagsInTheWay) {
    fill(at("tree/many"));
    writeFile(at("tree/immutable"), "x");
    writeFile(at("tree/directory/file"), "x");
    writeFile(at("tree/both/immutable"), "x");
    fs::create_directory(at("tree/empty"));
    const char* const immutable[] = {"tree/immutable", "tree/directory", "tree/both/immutable",
                                     "tree/both",      "tree/empty",     "tree"};
    for (const auto* const name : immutable)
        if (!setImmutable(at(name), true))
            GTEST_SKIP() << "The file system of " << scratch << " has no immutable flag";
    EXPECT_TRUE(files.removeItemAtURL(at("tree")));
    EXPECT_FALSE(fs::exists(at("tree")));
    EXPECT_NE(logged().find("_sweeptree_error_callback: sweeptree hit error for " + at("tree/immutable") +
                            " : Operation not permitted"),
              std::string::npos);
    for (const auto* const name : immutable)
        EXPECT_NE(logged().find("_sweeptree_error_callback: Unset UF_IMMUTABLE on " + at(name) + "\n"),
                  std::string::npos)
            << name;

    // The directory that holds the item is not the item's.
    writeFile(at("holder/item"), "x");
    ASSERT_TRUE(setImmutable(at("holder"), true));
    EXPECT_EQ(errorOf(files.removeItemAtURL(at("holder/item"))), EPERM);
    EXPECT_TRUE(fs::exists(at("holder/item")));
    ASSERT_TRUE(setImmutable(at("holder"), false));
}

TEST_F(OSTFileManagerTest, RemovalStopsAtMountPointsAndGoesOn) {
    fill(at("tree/a"));
    fill(at("tree/z"));
    const Mount mount(at("tree/m/mounted"));
    if (!mount)
        GTEST_SKIP() << "Nothing can be mounted here";
    writeFile(at("tree/m/mounted/file"), "kept");
    const auto removed = files.removeItemAtURL(at("tree"));
    EXPECT_EQ(errorOf(removed), EXDEV);
    EXPECT_EQ(messageOf(removed), "sweeptree of " + at("tree") + " failed: " + std::strerror(EXDEV));
    EXPECT_EQ(readFile(at("tree/m/mounted/file")), "kept");
    EXPECT_FALSE(fs::exists(at("tree/a")) || fs::exists(at("tree/z")));
    EXPECT_NE(logged().find("sweeptree hit error for " + at("tree/m/mounted") + " : "), std::string::npos);
    EXPECT_EQ(errorOf(files.removeItemAtURL(at("tree/m/mounted"))), EXDEV);
    EXPECT_EQ(readFile(at("tree/m/mounted/file")), "kept");
}

class OSTFileManagerCopyTest : public OSTFileManagerTest {
protected:
    /// One item of every kind, with attributes worth keeping.
    void makeSource(const std::string& top) const {
        writeFile(top + "/script", "echo", 04711);
        writeFile(top + "/locked/file", std::string(100'000, 'x'), 0);
        ASSERT_EQ(::chown((top + "/script").c_str(), 501, 502), 0);
        ASSERT_EQ(::chmod((top + "/script").c_str(), 04711), 0);
        ASSERT_EQ(::setxattr((top + "/script").c_str(), "trusted.note", "kept", 4, 0), 0);
        fs::create_symlink("/etc/passwd", top + "/link");
        ASSERT_EQ(::lchown((top + "/link").c_str(), 33, 33), 0);
        ASSERT_EQ(::mkfifo((top + "/fifo").c_str(), 0620), 0);
        ASSERT_EQ(::mknod((top + "/device").c_str(), S_IFCHR | 0600, 0x0103), 0);
        ASSERT_EQ(::chmod((top + "/locked").c_str(), 0), 0);
        const timespec times[] = {{.tv_sec = 1'000, .tv_nsec = 0}, {.tv_sec = 2'000, .tv_nsec = 5}};
        for (const auto* const name : {"/script", "/link", "/locked", ""})
            ASSERT_EQ(::utimensat(AT_FDCWD, (top + name).c_str(), times, AT_SYMLINK_NOFOLLOW), 0);
    }

    void expectCopy(const std::string& copy, const std::string& lines) const {
        EXPECT_EQ(tree(copy), lines);
        EXPECT_EQ(readFile(copy + "/script"), "echo");
        EXPECT_EQ(fs::file_size(copy + "/locked/file"), 100'000U);
        char note[5]{};
        EXPECT_EQ(::getxattr((copy + "/script").c_str(), "trusted.note", note, sizeof note), 4);
        EXPECT_STREQ(note, "kept");
        for (const auto* const name : {"/script", "/link", "/locked", ""}) {
            const auto status = statusOf(copy + name);
            EXPECT_EQ(status.st_mtim.tv_sec, 2'000) << name;
            EXPECT_EQ(status.st_mtim.tv_nsec, 5) << name;
        }
    }
};

TEST_F(OSTFileManagerCopyTest, CopiesAWholeItem) {
    makeSource(at("source"));
    const auto lines = tree(at("source"));
    EXPECT_EQ(messageOf(files.copyItemAtURL(at("source"), at("copy"))), "");
    expectCopy(at("copy"), lines);
    expectCopy(at("source"), lines);

    EXPECT_TRUE(files.copyItemIfExistsAtURL(at("missing"), at("missing copy")));
    const auto missing = files.copyItemAtURL(at("missing"), at("missing copy"));
    EXPECT_EQ(messageOf(missing),
              "clonetree of " + at("missing") + " to " + at("missing copy") + " failed: No such file or directory");
    EXPECT_EQ(errorOf(missing), ENOENT);

    // A link in the place of the copy is neither followed nor replaced, and nothing half-made stays behind.
    fs::create_directory_symlink(at("source"), at("link"));
    EXPECT_EQ(errorOf(files.copyItemAtURL(at("source/locked"), at("link"))), EEXIST);
    EXPECT_EQ(errorOf(files.copyItemAtURL(at("source/locked"), at("link/inside"))), ENOTDIR);
    EXPECT_EQ(errorOf(files.copyItemIfExistsAtURL(at("link/script"), at("elsewhere"))), ELOOP);
    EXPECT_EQ(std::ranges::distance(fs::directory_iterator(scratch)), 3);

    makeDeepTree(at("deep"), 1000);
    EXPECT_TRUE(files.copyItemAtURL(at("deep"), at("deep copy")));
    EXPECT_TRUE(files.removeItemAtURL(at("deep copy")));
    EXPECT_TRUE(files.removeItemAtURL(at("deep")));
}

TEST_F(OSTFileManagerCopyTest, CopiesTheHolesOfASparseFile) {
    writeFile(at("sparse"), "head");
    ASSERT_EQ(::truncate(at("sparse").c_str(), off_t{1} << 40U), 0);
    ASSERT_TRUE(files.copyItemAtURL(at("sparse"), at("copy")));
    EXPECT_EQ(statusOf(at("copy")).st_size, off_t{1} << 40U);
    EXPECT_EQ(statusOf(at("copy")).st_blocks, statusOf(at("sparse")).st_blocks);
}

TEST_F(OSTFileManagerCopyTest, MovesWithinAndBetweenFileSystems) {
    const Mount elsewhere(at("elsewhere"));
    if (!elsewhere)
        GTEST_SKIP() << "Nothing can be mounted here";
    for (const auto* const destination : {"moved", "elsewhere/moved"}) {
        makeSource(at("source"));
        const auto lines = tree(at("source"));
        fs::create_directory(at(destination)); // an empty directory is replaced, as rename does
        EXPECT_EQ(messageOf(files.moveItemAtURL(at("source"), at(destination))), "");
        EXPECT_FALSE(fs::exists(at("source")));
        expectCopy(at(destination), lines);

        writeFile(at("other/file"), "x");
        EXPECT_EQ(errorOf(files.moveItemAtURL(at("other"), at(destination))), ENOTEMPTY);
        EXPECT_TRUE(fs::exists(at("other/file")));
    }
    EXPECT_EQ(std::ranges::distance(fs::directory_iterator(at("elsewhere"))), 1);

    EXPECT_TRUE(files.moveItemIfExistsAtURL(at("missing"), at("new")));
    const auto missing = files.moveItemAtURL(at("missing"), at("new"));
    EXPECT_EQ(errorOf(missing), ENOENT);
    EXPECT_EQ(messageOf(missing),
              "rename of " + at("missing") + " to " + at("new") + " failed: No such file or directory");
    EXPECT_FALSE(fs::exists(at("new")));
    fs::create_directory_symlink(at("other"), at("link"));
    EXPECT_EQ(messageOf(files.moveItemIfExistsAtURL(at("link/file"), at("new"))),
              "stat of " + at("link/file") + " failed: " + std::strerror(ELOOP));
    EXPECT_TRUE(files.moveItemAtURL(at("link"), at("moved link")));
    EXPECT_TRUE(fs::is_symlink(at("moved link")));
}

TEST_F(OSTFileManagerTest, ListsItemsThatAreNotHidden) {
    fs::create_directory(at("empty"));
    writeFile(at("hidden only/.file"), "");
    writeFile(at("mixed/file"), "");
    writeFile(at("mixed/directory/.file"), "");
    fs::create_symlink(at("mixed"), at("mixed/link"));
    const struct {
        const char* name;
        std::vector<std::string> items;
        int error;
    } cases[] = {
        {"empty", {}, 0},     {"hidden only", {}, 0},      {"mixed", {"directory/", "file", "link"}, 0},
        {"gone", {}, ENOENT}, {"mixed/link", {}, ENOTDIR}, {"mixed/file", {}, ENOTDIR},
    };
    for (const auto& c : cases) {
        const auto listing = files.urlsForItemsInDirectoryAtURL(at(c.name));
        EXPECT_EQ(errorOf(listing), c.error) << c.name;
        const auto text = std::string(std::strerror(c.error));
        if (!listing) {
            EXPECT_EQ(messageOf(listing), "_IterateDirectory for " + at(c.name) + " returned " + text);
            const auto line = "_IterateDirectory: opendir of " + at(c.name) + " failed: " + text;
            EXPECT_EQ(logged().find(line) != std::string::npos, c.error != ENOENT) << c.name;
            continue;
        }
        std::vector<std::string> names;
        for (const auto& item : *listing)
            names.push_back(item.name + (item.isDirectory ? "/" : ""));
        std::ranges::sort(names);
        EXPECT_EQ(names, c.items) << c.name;
    }
}

TEST_F(OSTFileManagerTest, TellsWhetherAnItemExists) {
    writeFile(at("victim/file"), "");
    fs::create_directory_symlink(at("victim"), at("link"));
    fs::create_symlink(at("nowhere"), at("dangling"));
    const struct {
        const char* name;
        bool exists;
        bool doesNotExist;
    } cases[] = {
        {"victim", true, false},     {"victim/", true, false},        {"victim/file", true, false},
        {"dangling", true, false},   {"missing", false, true},        {"missing/too", false, true},
        {"link/file", false, false}, {"victim/file/x", false, false},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(files.itemExistsAtURL(at(c.name)), c.exists) << c.name;
        EXPECT_EQ(files.itemDoesNotExistAtURL(at(c.name)), c.doesNotExist) << c.name;
        EXPECT_EQ(logged().find("Failed to determine if " + at(c.name) + " exists: ") != std::string::npos,
                  !c.exists && !c.doesNotExist)
            << c.name;
    }
}

TEST_F(OSTFileManagerTest, ReadsBoundedRegularFilesOnly) {
    const auto obstacles = plantObstacles();
    writeFile(at("full"), std::string(1000, 'x'));
    writeFile(at("empty"), "");
    EXPECT_EQ(files.readFileAtURL(at("full"), 1000), std::string(1000, 'x'));
    EXPECT_EQ(files.readFileAtURL(at("empty"), 0), "");
    const auto tooLarge = files.readFileAtURL(at("full"), 999);
    EXPECT_EQ(errorOf(tooLarge), EFBIG);
    EXPECT_EQ(messageOf(tooLarge), "read of " + at("full") + " failed: File too large");
    EXPECT_EQ(errorOf(files.readFileAtURL(at("victim"), 1000)), EISDIR);
    EXPECT_EQ(errorOf(files.readFileAtURL(at("link/file"), 1000)), ELOOP);
    EXPECT_EQ(errorOf(files.readFileAtURL(at("missing"), 1000)), ENOENT);
    for (const auto& name : obstacles)
        EXPECT_EQ(errorOf(files.readFileAtURL(at(name), 1000)) != 0, name != "hardLink") << name;

    const auto directory = files.openDirectoryAtURL(scratch);
    ASSERT_TRUE(directory);
    std::string buffer(5000, 'y');
    EXPECT_TRUE(files.readFile(directory->get(), "victim/file", 100, buffer));
    EXPECT_EQ(buffer, "untouched");
    EXPECT_EQ(files.readFile(directory->get(), "link/file", 100, buffer), std::unexpected(ELOOP));
}

TEST_F(OSTFileManagerTest, WritesAtomicallyWithoutFollowingOrLeavingAnything) {
    writeFile(at("target/file"), "old", 0600);
    const platform::FileDescriptor reader(::open(at("target/file").c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_TRUE(files.writeFileAtomicallyAtURL(at("target/file"), "new"));
    char old[4]{};
    EXPECT_EQ(::pread(reader.get(), old, sizeof old, 0), 3);
    EXPECT_STREQ(old, "old"); // who had it open keeps the old content
    EXPECT_EQ(readFile(at("target/file")), "new");
    EXPECT_EQ(tree(at("target")), "-rw-r--r-- 0:0 file\n");
    const platform::FileDescriptor file(::open(at("target/file").c_str(), O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(platform::protectionClass(file.get(), -1), 4);

    fs::create_directory(at("target/directory"));
    EXPECT_EQ(errorOf(files.writeFileAtomicallyAtURL(at("target/directory"), "x")), EISDIR);
    EXPECT_EQ(tree(at("target")), "drwxrwxrwx 0:0 directory\n-rw-r--r-- 0:0 file\n");
    EXPECT_EQ(messageOf(files.writeFileAtomicallyAtURL(at("missing/file"), "x")),
              "write of " + at("missing/file") + " failed: No such file or directory");

    for (const auto& name : plantObstacles()) {
        EXPECT_EQ(errorOf(files.createFileAtURL(at(name), "x")), EEXIST) << name;
        EXPECT_TRUE(files.writeFileAtomicallyAtURL(at(name), name)) << name;
        EXPECT_EQ(readFile(at(name)), name);
    }
    EXPECT_EQ(readFile(at("victim/file")), "untouched");

    if (const Mount small(at("small"), "size=64k"); small) {
        const std::string tooMuch(100'000, 'x');
        EXPECT_EQ(errorOf(files.writeFileAtomicallyAtURL(at("small/file"), tooMuch)), ENOSPC);
        EXPECT_EQ(errorOf(files.createFileAtURL(at("small/file"), tooMuch)), ENOSPC);
        EXPECT_TRUE(fs::is_empty(at("small")));
    }

    auto created = files.createFileAtURL(at("target/new"), "content", {.mode = 0640});
    ASSERT_TRUE(created);
    EXPECT_EQ(readFile(at("target/new")), "content");
    EXPECT_EQ(ownerAndMode(at("target/new")), "0:0 416");
    EXPECT_TRUE(created->makeDurable());
    EXPECT_TRUE(files.makeDirectoryDurable(at("target")));
    EXPECT_EQ(errorOf(files.makeDirectoryDurable(at("target/new"))), ENOTDIR);
}

} // namespace
} // namespace ost
