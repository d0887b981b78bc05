#include "files/OSTDictionaryFile.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Path.h"
#include "platform/codec/PropertyList.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"
#include "store/OSTStoreDelegate.h"
#include "support/DeviceTest.h"
#include "support/StoreTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <barrier>
#include <filesystem>
#include <future>
#include <set>

namespace ost {
namespace {

namespace fs = std::filesystem;
using enum OSTContainerClass;

constexpr const char* classDirectory = "/private/var/mobile/Containers/Data/Application";
constexpr const char* stagingDirectory = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Staging";

class ContainerStore : public test::DeviceTest {
protected:
    ContainerStore() { ::umask(0); }

    /// Lets several threads create the same containers at the same time, one after the other. Their answers, by thread.
    static std::vector<std::vector<OSTMetadataRecord>> createInParallel(std::size_t containers, bool transient);

    static auto lookUp(std::string_view identifier, bool create, bool transient = false) {
        return store().createOrLookupContainerForUser(
            {.name = {501, dataApplication, identifier, transient}, .createIfNecessary = create});
    }
    static auto create(std::uint32_t userId, OSTContainerClass containerClass, std::string_view identifier) {
        return store().createOrLookupContainerForUser(
            {.name = {userId, containerClass, identifier}, .createIfNecessary = true});
    }
    static OSTClientConnection& store() { return OSTClientConnection::sharedClientConnection(); }

    /// Waits until death row has been emptied.
    static std::int64_t passCode() {
        std::promise<std::int64_t> code;
        store().deleteContainersOnDeathRowWithCompletion([&](std::int64_t value) { code.set_value(value); });
        return code.get_future().get();
    }
    static bool isEmpty(const fs::path& directory) { return !fs::exists(directory) || fs::is_empty(directory); }

    static void plant(const fs::path& item, std::string_view identifier) {
        test::writeFile(item / OSTMetadataFileName, platform::serializeBinaryPropertyList(OSTDictionary(
                                                        {{"OSTMetadataIdentifier", std::string(identifier)},
                                                         {"OSTMetadataUUID", platform::UUID::generate().string()},
                                                         {"OSTMetadataContentClass", std::uint64_t{2}},
                                                         {"OSTMetadataPersona", std::uint64_t{501}}})));
    }
};

TEST_F(ContainerStore, MakesEveryClassAsItShouldBe) {
    const std::string data = "drwxr-xr-x 501:501 Documents\ndrwxr-xr-x 501:501 Library\n"
                             "drwxr-xr-x 501:501 Library/Caches\ndrwxr-xr-x 501:501 Library/Preferences\n"
                             "drwxr-xr-x 501:501 tmp\n";
    const std::string group = "drwxr-xr-x 501:501 Library\ndrwxr-xr-x 501:501 Library/Caches\n";
    const std::string metadata = "-rw-r--r-- 0:0 .com.tamarok.ostrand.metadata.plist\n";
    struct Case {
        std::uint32_t user;
        OSTContainerClass containerClass;
        const char* directory;
        unsigned owner;
        std::string content;
    };
    const Case cases[] = {
        {33, bundleApplication, "/private/var/containers/Bundle/Application", 33, ""},
        {33, bundleLoomworkPlugin, "/private/var/containers/Bundle/LoomworkPlugin", 33, ""},
        {33, bundleVPNPlugin, "/private/var/containers/Bundle/VPNPlugin", 33, ""},
        {33, bundleFramework, "/private/var/containers/Bundle/Framework", 33, ""},
        {501, dataApplication, "/private/var/mobile/Containers/Data/Application", 501, data},
        {501, dataLoomworkPlugin, "/private/var/mobile/Containers/Data/LoomworkPlugin", 501, data},
        {501, dataVPNPlugin, "/private/var/mobile/Containers/Data/VPNPlugin", 501, data},
        {501, sharedAppGroup, "/private/var/mobile/Containers/Shared/AppGroup", 501, group},
        {501, dataVexelService, "/private/var/mobile/Containers/Data/VexelService", 501, data},
        {501, dataInternalDaemon, "/private/var/mobile/Containers/Data/InternalDaemon", 501, data},
        {501, dataTempDir, "/private/var/mobile/Containers/Data/TempDir", 501, data},
    };
    for (const auto& c : cases) {
        const auto made = create(c.user, c.containerClass, "org.example.app");
        ASSERT_TRUE(made) << c.directory;
        EXPECT_FALSE((*made)->existed);
        EXPECT_EQ(c.directory, fs::path((*made)->url).parent_path());
        EXPECT_TRUE(platform::UUID::parse(platform::lastPathComponent((*made)->url)));
        EXPECT_NE((*made)->uuid.string(), platform::lastPathComponent((*made)->url))
            << "the internal UUID is another one";
        EXPECT_EQ(metadata + c.content, test::tree((*made)->url)) << c.directory;
        struct stat status{};
        ASSERT_EQ(0, ::stat((*made)->url.c_str(), &status));
        EXPECT_EQ(c.owner, status.st_uid);
        EXPECT_EQ(c.owner, status.st_gid);
        EXPECT_EQ(isSystemClass(c.containerClass) ? 01755U : 0755U, status.st_mode & 07777U);

        const auto found = create(c.user, c.containerClass, "org.example.app");
        ASSERT_TRUE(found);
        EXPECT_TRUE((*found)->existed);
        EXPECT_EQ((*made)->url, (*found)->url);
        EXPECT_EQ((*made)->uuid, (*found)->uuid);
    }
    EXPECT_TRUE(isEmpty(stagingDirectory));
}

TEST_F(ContainerStore, SystemContainersBelongToNobodyAndUseWellknownNames) {
    class Delegate final : public test::StoreDelegate {
        bool identifierHasSystemContainer(std::string_view identifier) override { return identifier == "entitled"; }
        std::optional<std::string> wellknownContainerForId(std::string_view identifier, OSTContainerClass) override {
            return identifier == "well.known" ? std::optional<std::string>("known.name") : std::nullopt;
        }
    };
    static Delegate delegate;
    OSTStoreDelegate::join(delegate);
    const auto known = create(499, dataSystem, "well.known");
    ASSERT_TRUE(known);
    EXPECT_EQ("/private/var/containers/Data/System/known.name", (*known)->url);
    for (const auto* name : {"/Documents", "/Library/Caches", "/tmp"}) {
        struct stat status{};
        ASSERT_EQ(0, ::stat(((*known)->url + name).c_str(), &status)) << name;
        EXPECT_EQ(4294967294U, status.st_uid);
        EXPECT_EQ(4294967294U, status.st_gid);
        EXPECT_EQ(0U, status.st_mode & 0707U) << "group bits are the access list's mask";
    }

    const OSTClientConnection stranger(OSTClientIdentity{.clientBundleIdentifier = "me", .clientUserId = 501});
    OSTContainerLookup lookup{.name = {499, dataSystem}, .createIfNecessary = true};
    lookup.name.identifier = "me";
    EXPECT_EQ(OSTErrorCode::notEntitled, stranger.createOrLookupContainerForUser(lookup).error());
    lookup.name.identifier = "entitled";
    EXPECT_TRUE(stranger.createOrLookupContainerForUser(lookup));
    lookup.name.containerClass = sharedSystemGroup;
    lookup.name.identifier = "me";
    EXPECT_TRUE(stranger.createOrLookupContainerForUser(lookup)) << "no other class asks for an entitlement";
}

TEST_F(ContainerStore, RefusesWhatFitsNoContainerBeforeAnyLock) {
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    struct Case {
        std::uint32_t user;
        std::uint64_t containerClass;
        std::optional<std::string_view> identifier;
    };
    for (const auto& c : {Case{501, 2, {}}, Case{501, 0, "a"}, Case{501, 14, "a"}, Case{501, 1, "a"}, Case{500, 2, "a"},
                          Case{501, 12, "a"}, Case{501, std::uint64_t{1} << 32U | 2U, "a"}})
        EXPECT_EQ(OSTErrorCode::invalidObject,
                  store()
                      .createOrLookupContainerForUser(
                          {.name = {c.user, static_cast<OSTContainerClass>(c.containerClass), c.identifier},
                           .createIfNecessary = true})
                      .error());
}

TEST_F(ContainerStore, NothingIsMadeOrSetUnderAnEndlessName) {
    const std::string longest(1024, 'a'), endless(1025, 'b');
    const fs::path planted = fs::path(classDirectory) / "planted";
    fs::create_directories(planted);
    ASSERT_TRUE((OSTMetadata{.uid = 501,
                             .uuid = platform::UUID::generate(),
                             .containerClass = OSTContainerClass::dataApplication,
                             .identifier = std::string(2000, 'c'),
                             .url = planted}
                     .writeMetadataToDisk()));
    EXPECT_TRUE(lookUp(std::string(2000, 'c'), true)) << "one that is there is found";
    const auto made = lookUp(longest, true);
    ASSERT_TRUE(made);
    for (const bool transient : {false, true})
        EXPECT_EQ(OSTErrorCode::invalidObject, lookUp(endless, true, transient).error());
    EXPECT_EQ(OSTErrorCode::notFound, lookUp(endless, false).error());
    EXPECT_EQ(2, std::distance(fs::directory_iterator(classDirectory), {}));
    EXPECT_TRUE(isEmpty(stagingDirectory));

    const OSTContainerReference container{.name = {501, OSTContainerClass::dataApplication, longest},
                                          .uuid = (*made)->uuid};
    EXPECT_TRUE(store().setInfoValue(OSTValue(true), longest, container));
    EXPECT_EQ(OSTErrorCode::invalidParameter, store().setInfoValue(OSTValue(true), endless, container).error());
}

TEST_F(ContainerStore, LooksUpWithoutMaking) {
    EXPECT_EQ(OSTErrorCode::notFound, lookUp("org.example.none", false).error());
    EXPECT_TRUE(isEmpty(classDirectory));
    EXPECT_TRUE(isEmpty(stagingDirectory));
}

TEST_F(ContainerStore, TransientContainersAreNeverReused) {
    const auto first = lookUp("org.example.app", true, true);
    ASSERT_TRUE(first);
    EXPECT_TRUE(
        (*first)->url.starts_with("/private/var/mobile/Library/Caches/com.tamarok.ostrandd/Temp/Data/Application/"));
    const auto second = lookUp("org.example.app", true, true);
    ASSERT_TRUE(second);
    EXPECT_FALSE((*second)->existed);
    EXPECT_NE((*first)->url, (*second)->url);
    EXPECT_NE((*first)->uuid, (*second)->uuid);
    EXPECT_FALSE(fs::exists((*first)->url));
    EXPECT_EQ(1, passCode());
    EXPECT_TRUE(isEmpty("/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead"));

    EXPECT_EQ(OSTErrorCode::notFound, lookUp("org.example.app", false, true).error());
    EXPECT_FALSE(fs::exists((*second)->url)) << "looking a transient container up throws it away";
    EXPECT_EQ(OSTErrorCode::cacheInconsistent, lookUp("org.example.app", false, true).error()) << "its record stays";
    EXPECT_EQ(OSTErrorCode::notFound, lookUp("org.example.app", false).error()) << "the live table is another";
}

TEST_F(ContainerStore, HostileItemsOfAClassDirectoryArePassedOver) {
    const fs::path directory = classDirectory;
    plant(directory / "GOOD-1", "good.1");
    plant(directory / "GOOD-2", "good.2");
    fs::create_directories("/outside");
    plant("/outside", "outside");
    ASSERT_EQ(0, ::mkfifo((directory / "fifo").c_str(), 0666));
    ASSERT_EQ(0, ::mknod((directory / "device").c_str(), S_IFCHR | 0666, ::makedev(5, 0)));
    fs::create_directory_symlink("/outside", directory / "link");
    test::writeFile(directory / "file", "");
    fs::create_directories(directory / "empty");
    fs::create_directories(directory / "fifo-inside");
    ASSERT_EQ(0, ::mkfifo((directory / "fifo-inside" / OSTMetadataFileName).c_str(), 0666));
    fs::create_directories(directory / "link-inside");
    fs::create_symlink(fs::path("/outside") / OSTMetadataFileName, directory / "link-inside" / OSTMetadataFileName);
    plant(directory / "giant", "giant");
    plant(directory / "not\xffUTF-8", "unutterable.path");
    fs::resize_file(directory / "giant" / OSTMetadataFileName, std::uintmax_t{10} << 30U);

    const auto listed = store().containersForUser(501, dataApplication, false);
    ASSERT_TRUE(listed);
    std::vector<std::string> identifiers;
    for (const auto& record : *listed)
        identifiers.push_back(record->identifier);
    std::ranges::sort(identifiers);
    EXPECT_EQ((std::vector<std::string>{"good.1", "good.2"}), identifiers);
    EXPECT_EQ(OSTErrorCode::notFound, lookUp("outside", false).error());
}

TEST_F(ContainerStore, ForgedMetadataDoesNotTakeTheNameOfAnotherContainer) {
    const fs::path directory = classDirectory;
    for (const auto* const name : {"forged-1", "genuine", "forged-2", "alone"}) { // whichever is listed first
        plant(directory / name, name == std::string("alone") ? "org.example.alone" : "org.example.app");
        const uid_t owner = name == std::string("genuine") ? 0 : 501;
        ASSERT_EQ(0, ::chown((directory / name / OSTMetadataFileName).c_str(), owner, owner));
    }
    const auto found = lookUp("org.example.app", false);
    ASSERT_TRUE(found);
    EXPECT_EQ((*found)->url, directory / "genuine");
    EXPECT_TRUE(lookUp("org.example.alone", false)) << "what was restored under another owner is found";
}

TEST_F(ContainerStore, LinkInPlaceOfADirectoryLeadsNowhere) {
    struct Case {
        const char* place;
        OSTErrorCode code;
    };
    const Case cases[] = {
        {"/private/var/mobile/Containers/Data/Application", OSTErrorCode::cacheRebuildFailed},
        {"/private/var/mobile/Containers/Data", OSTErrorCode::cacheRebuildFailed},
        {"/private/var/mobile/Containers", OSTErrorCode::cacheRebuildFailed},
    };
    for (const auto& c : cases) {
        fs::remove_all("/private/var/mobile/Containers");
        fs::create_directories(fs::path(c.place).parent_path());
        fs::create_directories("/victim/Data/Application");
        fs::create_directory_symlink("/victim", c.place);
        const auto before = test::tree("/victim");
        EXPECT_EQ(c.code, lookUp("org.example.app", true).error()) << c.place;
        EXPECT_EQ(c.code, store().containersForUser(501, dataApplication, false).error());
        EXPECT_EQ(before, test::tree("/victim")) << c.place;
        EXPECT_TRUE(create(33, bundleApplication, "others.are.served")) << c.place;
    }
    fs::remove_all("/private/var/mobile/Containers");
    EXPECT_TRUE(lookUp("org.example.app", true)) << "a failed scan is tried again";

    // The class directory changes into a link after its table was read.
    fs::rename(classDirectory, "/private/var/mobile/moved");
    fs::create_directory_symlink("/victim", classDirectory);
    const auto before = test::tree("/victim");
    EXPECT_EQ(OSTErrorCode::moveToLiveFailed, lookUp("org.example.other", true).error());
    EXPECT_EQ(before, test::tree("/victim"));
    EXPECT_EQ(1, passCode());
    EXPECT_TRUE(isEmpty(stagingDirectory)) << "a failed creation leaves nothing";
    EXPECT_EQ(OSTErrorCode::cacheInconsistent, lookUp("org.example.app", false).error());
}

TEST_F(ContainerStore, StagingLeftByACrashIsDestroyedAtTheNextStart) {
    fs::create_directories(fs::path(stagingDirectory) / "HALF-MADE" / "Library");
    test::writeFile(fs::path(stagingDirectory) / "file", "x");
    test::writeFile(fs::path(stagingDirectory) / ".temp.a1b2c3/HALF-COPIED/file", "x");
    store().containerManagerCleanup();
    EXPECT_EQ(1, passCode());
    EXPECT_TRUE(isEmpty(stagingDirectory));
    EXPECT_TRUE(isEmpty("/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead"));
}

TEST_F(ContainerStore, CacheReportsWhatGoneBehindItsBack) {
    const auto made = lookUp("org.example.app", true);
    ASSERT_TRUE(made);
    ASSERT_TRUE(lookUp("org.example.other", true));
    fs::remove(fs::path((*made)->url) / OSTMetadataFileName);
    EXPECT_EQ(OSTErrorCode::cacheInconsistent, lookUp("org.example.app", true).error());
    EXPECT_EQ(1U, store().containersForUser(501, dataApplication, false)->size());

    const auto wrongUser = OSTContainerCache::sharedInstance().containerForUser({501, dataSystem, "a"});
    ASSERT_FALSE(wrongUser);
    EXPECT_TRUE(wrongUser.error().is(OSTErrorCode::cacheRebuildFailed));
    EXPECT_TRUE(wrongUser.error().underlyingError()->is(OSTErrorCode::invalidCacheInput));
}

TEST_F(ContainerStore, UserIsServedAsSoonAsTheAccountAndTheHomeAreThere) {
    const auto code = [] {
        const auto made = create(502, dataApplication, "org.example.app");
        return made ? OSTErrorCode::success : made.error();
    };
    EXPECT_EQ(OSTErrorCode::cacheRebuildFailed, code());
    test::writeFile("/etc/passwd", test::readFile("/etc/passwd") + "second:x:502:502::/private/var/second:/bin/sh\n");
    EXPECT_EQ(OSTErrorCode::cacheRebuildFailed, code());
    fs::create_directories("/private/var/second");
    EXPECT_EQ(OSTErrorCode::success, code());
}

TEST_F(ContainerStore, CacheTellsLiveAndTransientContainersApart) {
    auto& cache = OSTContainerCache::sharedInstance();
    const auto live = *lookUp("org.example.app", true);
    const auto transient = *lookUp("org.example.app", true, true);
    const OSTContainerName name = live->name();
    EXPECT_EQ(live->url, (*cache.containerForUser(name, live->uuid))->url);
    const auto found = *cache.containerForUser(name, transient->uuid);
    EXPECT_EQ(transient->url, found->url);
    EXPECT_TRUE(found->transient);
    EXPECT_FALSE(*cache.containerForUser(name, platform::UUID::generate()));

    ASSERT_TRUE(cache.removeContainerForUser(transient->name()));
    ASSERT_TRUE(cache.removeContainerForUser(transient->name())) << "absent is no error";
    EXPECT_TRUE(cache.allContainerIdentifiersForUser(501, dataApplication, true)->empty());
    EXPECT_EQ(std::vector<std::string>{"org.example.app"},
              *cache.allContainerIdentifiersForUser(501, dataApplication, false));
}

/// As long as it may be, so that several who want the container are building it before one of them has finished.
std::string longIdentifier(std::size_t number) { return std::to_string(number).append(1000, 'x'); }

std::vector<std::vector<OSTMetadataRecord>> ContainerStore::createInParallel(std::size_t containers, bool transient) {
    constexpr std::ptrdiff_t threads = 8;
    std::barrier together(threads);
    std::vector<std::future<std::vector<OSTMetadataRecord>>> results;
    for (std::ptrdiff_t t = 0; t < threads; ++t)
        results.push_back(std::async(std::launch::async, [&, containers, transient] {
            std::vector<OSTMetadataRecord> records;
            for (std::size_t i = 0; i < containers; ++i) {
                together.arrive_and_wait();
                records.push_back(*lookUp(longIdentifier(i), true, transient));
            }
            return records;
        }));
    std::vector<std::vector<OSTMetadataRecord>> answers;
    for (auto& result : results)
        answers.push_back(result.get());
    return answers;
}

TEST_F(ContainerStore, ParallelCreationMakesEachContainerOnce) {
    constexpr std::size_t containers = 10;
    const auto answers = createInParallel(containers, false);
    for (std::size_t i = 0; i < containers; ++i) {
        std::set<std::string> all;
        std::size_t makers = 0;
        for (const auto& ofThread : answers) {
            makers += ofThread[i]->existed ? 0 : 1;
            all.insert(ofThread[i]->url + ofThread[i]->uuid.string());
        }
        EXPECT_EQ(1U, makers);
        EXPECT_EQ(1U, all.size());
    }
    EXPECT_EQ(containers, std::distance(fs::directory_iterator(classDirectory), {}));
    EXPECT_TRUE(isEmpty(stagingDirectory));
    EXPECT_EQ(1, passCode());
}

TEST_F(ContainerStore, ParallelCreationOfATransientContainerLeavesTheLastOne) {
    constexpr std::size_t containers = 10;
    std::set<std::string> urls;
    std::size_t answered = 0;
    for (const auto& ofThread : createInParallel(containers, true))
        for (const auto& record : ofThread) {
            EXPECT_FALSE(record->existed);
            urls.insert(record->url);
            ++answered;
        }
    EXPECT_EQ(answered, urls.size());
    const auto left = store().containersForUser(501, dataApplication, true);
    ASSERT_TRUE(left);
    EXPECT_EQ(containers, left->size());
    const auto directory = fs::path(left->front()->url).parent_path();
    EXPECT_EQ(containers, std::distance(fs::directory_iterator(directory), {}));
    EXPECT_TRUE(isEmpty(stagingDirectory));
}

} // namespace
} // namespace ost
