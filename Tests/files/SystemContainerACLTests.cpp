#include "files/OSTFileManager.h"

#include "platform/base/Log.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <grp.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>

namespace ost {
namespace {

namespace fs = std::filesystem;
using test::readFile;
using test::tree;
using test::writeFile;

constexpr const char* metadataName = ".com.tamarok.ostrand.metadata.plist";
constexpr const char* container = "/private/var/containers/Data/System/one";
constexpr uid_t serviceUser = 271;

gid_t systemGroup() {
    const auto groups = readFile("/etc/group");
    const auto line = groups.find("systemusers:");
    return static_cast<gid_t>(std::stoul(groups.substr(groups.find(':', groups.find(':', line) + 1) + 1)));
}

/// Calls `attempt` in a process of an unprivileged user, in the system group or not, and returns the errno it answers.
template<typename Attempt>
int asService(bool inSystemGroup, Attempt attempt) {
    const gid_t group = systemGroup();
    const pid_t child = ::fork();
    if (child == 0) {
        const bool dropped = ::setgroups(inSystemGroup ? 1 : 0, &group) == 0 &&
                             ::setresgid(serviceUser, serviceUser, serviceUser) == 0 &&
                             ::setresuid(serviceUser, serviceUser, serviceUser) == 0;
        ::_exit(dropped ? attempt() : 255);
    }
    int status = 0;
    ::waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 254;
}

int openFile(const std::string& path, int flags) {
    const platform::FileDescriptor file(::open(path.c_str(), flags | O_CLOEXEC, 0666));
    return file ? 0 : errno;
}

int errnoOf(int result) { return result == 0 ? 0 : errno; }

int makeDirectory(const std::string& path) { return errnoOf(::mkdir(path.c_str(), 0777)); }

class SystemContainerACLTest : public test::DeviceTest {
protected:
    void SetUp() override {
        ::umask(0);
        ASSERT_TRUE(platform::Log::shared().open(platform::LogLevel::notice, {"/log", 1, 1U << 20U}));
    }

    /// A system container as creation makes it: the top with its ACL first, then the sub-directories.
    void makeContainer(const std::string& path) const {
        ASSERT_TRUE(files.createDirectoryAtURL(path, {.withIntermediateDirectories = true}));
        ASSERT_TRUE(files.writeFileAtomicallyAtURL(path + "/" + metadataName, "metadata"));
        const auto set = files.setTopLevelSystemContainerACLAtURL(path);
        ASSERT_TRUE(set) << set.error().description();
        for (const auto* const name : {"Library", "Library/Caches"})
            ASSERT_TRUE(files.createDirectoryAtURL(path + "/" + name, {.mode = 0, .owner = 4294967294}));
    }

    void expectServiceAccess(const std::string& directory) const {
        for (const bool member : {true, false}) {
            const int expected = member ? 0 : EACCES;
            EXPECT_EQ(asService(member, [&] { return openFile(directory, O_RDONLY | O_DIRECTORY); }), expected);
            EXPECT_EQ(asService(member, [&] { return openFile(directory + "/file", O_RDWR | O_CREAT); }), expected);
            EXPECT_EQ(asService(member, [&] { return openFile(directory + "/file", O_RDWR); }), expected);
            EXPECT_EQ(asService(member, [&] { return makeDirectory(directory + "/made"); }), expected);
            EXPECT_EQ(asService(member, [&] { return openFile(directory + "/made/file", O_RDWR | O_CREAT); }),
                      expected);
        }
    }

    [[nodiscard]] static bool logged(const std::string& text) {
        return readFile("/log").find(text) != std::string::npos;
    }

    const OSTFileManager& files = OSTFileManager::defaultManager();
};

TEST_F(SystemContainerACLTest, OnlySystemServicesGetIntoANewContainer) {
    makeContainer(container);
    expectServiceAccess(std::string(container) + "/Library");
    expectServiceAccess(std::string(container) + "/Library/Caches");

    EXPECT_EQ(asService(true, [] { return makeDirectory(std::string(container) + "/added"); }), 0);
    EXPECT_EQ(asService(true, [] { return errnoOf(::unlink((std::string(container) + "/" + metadataName).c_str())); }),
              EPERM);
    EXPECT_EQ(asService(true,
                        [] {
                            const auto library = std::string(container) + "/Library";
                            return errnoOf(::rename(library.c_str(), (library + "2").c_str()));
                        }),
              EPERM);
    EXPECT_EQ(asService(true, [] { return errnoOf(::rmdir((std::string(container) + "/added").c_str())); }), 0)
        << "it is its own";
    EXPECT_EQ(asService(false, [] { return makeDirectory(std::string(container) + "/refused"); }), EACCES);
    // The metadata file is everybody's to read and root's to write, also when it is written again below the ACL.
    const auto metadata = std::string(container) + "/" + metadataName;
    for (const bool rewritten : {false, true}) {
        if (rewritten) {
            ASSERT_TRUE(files.writeFileAtomicallyAtURL(metadata, "new metadata"));
        }
        for (const bool member : {true, false}) {
            EXPECT_EQ(asService(member, [&] { return openFile(metadata, O_RDWR); }), EACCES);
            EXPECT_EQ(asService(member, [&] { return openFile(metadata, O_RDONLY); }), 0);
        }
    }

    EXPECT_TRUE(files.setTopLevelSystemContainerACLAtURL("/missing").error().is(OSTErrorCode::accessControlListFailed));
    fs::create_directory_symlink(container, "/link");
    EXPECT_EQ(files.setTopLevelSystemContainerACLAtURL("/link").error().message(),
              "Failed to set ACL on /link: Not a directory");
}

TEST_F(SystemContainerACLTest, StandardizesAWholeContainerAndNothingOutside) {
    makeContainer(container);
    fs::current_path(container);
    ASSERT_EQ(::chown(".", 33, 34), 0);
    writeFile("Library/tool", "x", 0755);
    writeFile("Library/Caches/deep/file", "x", 0600);
    ASSERT_EQ(::chown("Library/Caches/deep/file", 501, 501), 0);
    ASSERT_EQ(::mkfifo("Library/fifo", 0666), 0);
    writeFile("/outside/secret", "kept", 0600);
    writeFile("/outside/reachable", "kept", 0600);
    fs::create_symlink("/outside/secret", "Library/link");
    fs::create_hard_link("/outside/reachable", "Library/planted");
    fs::create_hard_link("Library/tool", "Library/Caches/tool");
    fs::create_directory("Library/mounted");
    const bool mounted = ::mount("tmpfs", "Library/mounted", "tmpfs", 0, "mode=0755") == 0;
    const auto outside = tree("/outside");

    EXPECT_TRUE(files.standardizeACLsForSystemContainerAtURL(container));

    if (mounted) {
        EXPECT_EQ(::umount2("Library/mounted", MNT_DETACH), 0);
    }
    EXPECT_EQ(tree("/outside"), outside);
    EXPECT_TRUE(logged(std::string("Could not chown ") + container + "/Library/planted: Too many links"));
    ASSERT_TRUE(fs::remove("Library/planted") && fs::remove("Library/mounted"));
    // What the group bits show is the mask of the entry for the system group.
    const std::string nobody = " 4294967294:4294967294 ";
    EXPECT_EQ(
        tree("."),
        std::string("-rw-r--r-- 0:0 ") + metadataName + "\n"                                                         //
            + "d---rwx---" + nobody + "Library\n"                                                                    //
            + "d---rwx---" + nobody + "Library/Caches\n"                                                             //
            + "d---rwx---" + nobody + "Library/Caches/deep\n" + "----rwx---" + nobody + "Library/Caches/deep/file\n" //
            + "----rwx---" + nobody + "Library/Caches/tool\n" + "?---rwx---" + nobody + "Library/fifo\n"             //
            + "lrwxrwxrwx" + nobody + "Library/link -> /outside/secret\n" + "----rwx---" + nobody + "Library/tool\n");
    struct stat top{};
    ASSERT_EQ(::stat(".", &top), 0);
    EXPECT_EQ(top.st_uid, 33U);
    EXPECT_EQ(top.st_gid, 34U);
    expectServiceAccess(std::string(container) + "/Library");
    expectServiceAccess(std::string(container) + "/Library/Caches/deep");
    EXPECT_EQ(asService(false, [] { return openFile("Library/tool", O_RDONLY); }), EACCES);
}

TEST_F(SystemContainerACLTest, StandardizesAllContainersOfADirectory) {
    EXPECT_TRUE(files.standardizeAllSystemContainerACLsAtURL("/missing"));
    fs::create_directory("/empty");
    EXPECT_TRUE(files.standardizeAllSystemContainerACLsAtURL("/empty"));
    EXPECT_FALSE(logged("Potential containers"));
    writeFile("/file", "x");
    EXPECT_TRUE(files.standardizeAllSystemContainerACLsAtURL("/file").error().isPOSIX(ENOTDIR));
    EXPECT_TRUE(logged("Failed to get items at URL/file : "));

    fs::create_directory("/all");
    for (const auto* const name : {"/all/a", "/all/b"})
        writeFile(std::string(name) + "/Library/file", "x");
    EXPECT_TRUE(files.standardizeAllSystemContainerACLsAtURL("/all"));
    EXPECT_TRUE(logged("standardizeAllSystemContainerACLsAtURL: Potential containers requiring ACL migration: (/all/"));
    expectServiceAccess("/all/a/Library");
    expectServiceAccess("/all/b/Library");

    // Without the group nothing can be built, and every container fails.
    writeFile("/etc/group", "root:x:0:\n");
    const auto failed = files.standardizeAllSystemContainerACLsAtURL("/all");
    ASSERT_FALSE(failed);
    EXPECT_TRUE(failed.error().is(OSTErrorCode::accessControlListFailed));
    EXPECT_EQ(failed.error().message(), "groupuuid_resolve() failed: No such file or directory");
    for (const auto* const name : {"/all/a", "/all/b"})
        EXPECT_TRUE(logged(std::string("Failed to set system container ACL at ") + name + ": ")) << name;
}

TEST_F(SystemContainerACLTest, StandardizesOwnership) {
    writeFile("/bundle/tool", "x", 0711);
    writeFile("/bundle/Resources/data", "x", 0666);
    writeFile(std::string("/bundle/") + metadataName, "x", 0600);
    ASSERT_EQ(::chmod("/bundle/Resources", 0700), 0);
    ASSERT_EQ(::chown("/bundle/Resources/data", 33, 501), 0);
    writeFile("/outside", "kept", 04755);
    fs::create_symlink("/outside", "/bundle/link");
    fs::create_hard_link("/outside", "/bundle/planted");
    EXPECT_TRUE(files.standardizeOwnershipAtURL("/bundle", 33, 33));
    EXPECT_EQ(tree("/bundle"), std::string("-rw------- 0:0 ") + metadataName + "\n" + //
                                   "drwxr-xr-x 33:33 Resources\n"
                                   "-rw-r--r-- 33:33 Resources/data\n"
                                   "lrwxrwxrwx 33:33 link -> /outside\n"
                                   "-rwsr-xr-x 0:0 planted\n"
                                   "-rwxr-xr-x 33:33 tool\n");
    struct stat top{};
    ASSERT_EQ(::stat("/bundle", &top), 0);
    EXPECT_EQ(top.st_uid, 33U);
    EXPECT_EQ(top.st_mode & 07777U, 0755U);

    EXPECT_TRUE(files.standardizeOwnershipAtURL("/bundle/planted", 33, 33));
    EXPECT_EQ(tree("/bundle").find("33:33 planted"), std::string::npos);
    const auto missing = files.standardizeOwnershipAtURL("/missing", 33, 33);
    EXPECT_EQ(missing.error().message(), "Could not stat /missing: No such file or directory");
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
}

TEST_F(SystemContainerACLTest, ALargeTreeIsChangedWholeWhateverIsRightAlready) {
    writeFile("/outside", "kept");
    for (int directory = 0; directory < 100; ++directory) { // more than one thread works on at a time, some nested
        const auto name = "/bundle/" + std::to_string(directory % 10) + "/" + std::to_string(directory);
        for (int file = 0; file < 5; ++file)
            writeFile(name + "/" + std::to_string(file), "x", file % 2 == 0 ? 0644 : 04644);
        ASSERT_EQ(::chown((name + "/2").c_str(), 33, 33), 0);
        fs::create_hard_link("/bundle/0/0/0", name + "/inside");
    }
    fs::create_hard_link("/outside", "/bundle/9/planted");
    std::string deep = "/bundle/9";
    for (int depth = 0; depth < 100; ++depth)
        deep += "/d";
    writeFile(deep + "/file", "x", 0600);

    EXPECT_TRUE(files.standardizeOwnershipAtURL("/bundle", 33, 33));
    for (const auto& item : fs::recursive_directory_iterator("/bundle")) {
        struct stat status{};
        ASSERT_EQ(::lstat(item.path().c_str(), &status), 0);
        const bool planted = item.path().filename() == "planted";
        ASSERT_EQ(status.st_uid, planted ? 0U : 33U) << item;
        ASSERT_EQ(status.st_mode & 07777U, item.is_directory() ? 0755U : 0644U) << item;
    }
    EXPECT_TRUE(logged("Could not chown /bundle/9/planted: Too many links"));
    EXPECT_FALSE(logged("inside: Too many links"));
}

} // namespace
} // namespace ost
