#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"

#include "Client/Containers.h"
#include "codesigning/OSTCodeSigningStoreDelegate.h"
#include "store/OSTClientConnection.h"
#include "store/OSTLocks.h"
#include "store/OSTReplaceFile.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <optional>
#include <ostream>
#include <set>
#include <string>
#include <vector>

using namespace ost::test;
using ost::OSTErrorCode;
using ostrand::Container;
using ostrand::ContainerClass;

namespace {

constexpr const char* identifier = "com.example.Installer.Sketches";
constexpr const char* dataName = "data";

/// What a replacement that did not succeed may answer when a file-system call fails.
constexpr std::array expectedCodes{OSTErrorCode::cacheRebuildFailed,    OSTErrorCode::alreadyExists,
                                   OSTErrorCode::dictionaryWriteFailed, OSTErrorCode::moveOldToStagingFailed,
                                   OSTErrorCode::replacingMoveFailed,   OSTErrorCode::replaceFileInvalid,
                                   OSTErrorCode::replaceCleanupFailed,  OSTErrorCode::mappingWriteFailed};

/// Which of the two containers is in the old one's place.
enum class Place { old, replaced };

enum class Through {
    wire,      ///< a request to the daemon: the new one keeps its UUID
    operation, ///< the store's operation, in a process of its own: the new one gets the old one's place and UUID
};

struct Setting {
    const char* name;
    ContainerClass containerClass;
    bool oldIsTransient; ///< the new one is what the old one is not
    Through through;

    friend std::ostream& operator<<(std::ostream& out, const Setting& setting) { return out << setting.name; }
};

/// A container as it was made.
struct Made {
    Container container;
    std::string content; ///< everything in it
};

/// What came of a replacement.
struct Attempt {
    std::optional<ostrand::Result<void>> answer; ///< none when whoever carried it out died
    GatedProcess::Course course;
};

std::string contentOf(const std::filesystem::path& container) {
    return std::filesystem::exists(container / dataName) ? tree(container) + readFile(container / dataName) : "";
}

ostrand::ContainerReference referenceTo(const Container& container, ContainerClass containerClass) {
    return {containerClass, ost::usualUserOf(containerClass), container.identifier, container.uuid};
}

/// Replacements of one container by another of the same identifier, in one boot of one device: each time the two are
/// made anew, something happens to the replacement, the daemon starts again, and the disk must hold one of them in its
/// place.
class ReplacementFaultTest : public GatedDeviceTest, public testing::WithParamInterface<Setting> {
protected:
    void makeBoth() {
        auto connection = device().connect();
        _old = _make(connection, "old", GetParam().oldIsTransient);
        _new = _make(connection, "new", !GetParam().oldIsTransient);
        const auto& oldPath = _old.container.path;
        _destination =
            GetParam().through == Through::operation
                ? std::filesystem::path(oldPath)
                : std::filesystem::path(oldPath).parent_path() / std::filesystem::path(_new.container.path).filename();
        ASSERT_TRUE(ostrand::destroyDeathRow(connection));
    }

    Attempt replace(const Fault& fault) {
        return GetParam().through == Through::wire ? _request(fault) : _operate(fault);
    }

    /// The next start: returns when all that it has to do is done.
    void startAgain() {
        device().startDaemon();
        ASSERT_TRUE(device().waitForFirstPass());
    }

    /// Which of the two is in the old one's place, whole, with the other where it belongs then. None, with the reason
    /// as a failure of the test, when that cannot be said.
    std::optional<Place> inPlace() {
        const auto at = [&](const std::filesystem::path& path) { return contentOf(device().onHost(path)); };
        const auto& oldPath = _old.container.path;
        const auto& newPath = _new.container.path;
        const bool separate = _destination != oldPath;
        if (at(oldPath) == _old.content && at(newPath) == _new.content && (!separate || at(_destination).empty()))
            return Place::old;
        if (at(_destination) == _new.content && at(newPath).empty() && (!separate || at(oldPath).empty()))
            return Place::replaced;
        const auto log = device().onHost("/private/var/root/Library/Logs/Ostrand/ostrandd.log");
        ADD_FAILURE() << "In the old one's place:\n"
                      << at(oldPath) << "\nin the new one's place:\n"
                      << at(newPath) << "\nin the destination:\n"
                      << (separate ? at(_destination) : "the same") << "\nin all:\n"
                      << tree(device().onHost("/private/var")) << "\nlog:\n"
                      << readFile(log);
        return std::nullopt;
    }

    /// The disk holds the two, or the one, and nothing else, and the daemon says the same.
    void expectOrder(Place place) {
        auto connection = device().connect();
        for (const bool transient : {false, true}) {
            const bool ofTheOld = transient == GetParam().oldIsTransient;
            const auto& path = ofTheOld ? _old.container.path : _new.container.path;
            const auto onDisk = containersOnDisk(device().onHost(path).parent_path());
            EXPECT_EQ(listedContainers(connection, GetParam().containerClass, transient), onDisk);
            EXPECT_EQ(onDisk.size(), ofTheOld || place == Place::old ? 1U : 0U);
        }
    }

    void expectNothingLeft() { EXPECT_EQ(leftovers(device().image()), std::vector<std::string>()); }

    /// Makes the device as it was before, for the next round.
    void removeBoth() {
        auto connection = device().connect();
        // The new one may have been given the old one's UUID without having taken its place.
        auto newWithOldUUID = _new.container;
        newWithOldUUID.uuid = _old.container.uuid;
        for (const auto& container : {_old.container, _new.container, newWithOldUUID})
            ASSERT_TRUE(ostrand::stageForDeletion(connection, {referenceTo(container, GetParam().containerClass)}));
        ASSERT_TRUE(ostrand::destroyDeathRow(connection));
        for (const auto& path : {_old.container.path, _new.container.path})
            ASSERT_EQ(namesIn(device().onHost(path).parent_path()), std::vector<std::string>());
    }

    /// The disk as it is when a replacement was cut off after so many of its two moves. The daemon must be down.
    void cutOffAfterMoves(unsigned moves) {
        const std::string token = "0F0F0F0F-1111-4222-8333-444444444444";
        const auto onHost = [&](const std::string& path) { return device().onHost(path); };
        const std::string staging = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Staging/" + token;
        const auto file = onHost("/private/var/root/Library/Ostrand/Replace/" + token + ".plist");
        ASSERT_TRUE((ost::OSTReplaceFile{.oldURL = _old.container.path,
                                         .newURL = _new.container.path,
                                         .stagingURL = staging,
                                         .destinationURL = _destination}
                         ._writeToDiskReplaceAt(file)));
        if (moves > 0)
            std::filesystem::rename(onHost(_old.container.path), onHost(staging));
        if (moves > 1)
            std::filesystem::rename(onHost(_new.container.path), onHost(_destination));
    }

private:
    Made _make(ostrand::Connection& connection, const std::string& data, bool transient) {
        const auto made = ostrand::createOrLookup(connection,
                                                  {.containerClass = GetParam().containerClass,
                                                   .user = ost::usualUserOf(GetParam().containerClass),
                                                   .identifier = identifier,
                                                   .transient = transient},
                                                  ostrand::WhenMissing::create);
        if (!made || made->existed)
            throw std::runtime_error("No new container: " + (made ? made->path : made.error().description()));
        const auto path = device().onHost(made->path);
        writeFile(path / dataName, data);
        return {*made, contentOf(path)};
    }

    Attempt _request(const Fault& fault) {
        auto connection = device().connect();
        const auto containerClass = GetParam().containerClass;
        static_cast<void>(listedContainers(connection, containerClass, false)); // It knows the caller now.
        const auto openFiles = device().openFilesOfDaemon();
        device().daemon().prepare(fault);
        const auto answer = ostrand::replace(connection, referenceTo(_old.container, containerClass),
                                             referenceTo(_new.container, containerClass));
        Attempt attempt{.answer = {}, .course = device().daemon().conclude()};
        if (fault.kind == Fault::Kind::kill && !attempt.course.faultedCall.empty()) {
            // It may have answered before it died.
            if (answer)
                attempt.answer = answer;
            return attempt;
        }
        attempt.answer = answer;
        EXPECT_TRUE(device().daemonIsUp());
        EXPECT_EQ(device().openFilesOfDaemon(), openFiles);
        return attempt;
    }

    /// With the daemon down, because two may not work on one store.
    Attempt _operate(const Fault& fault) {
        device().killDaemon();
        GatedProcess process([this] { return _operateInProcess(); }, fault);
        const int status = process.wait();
        Attempt attempt{.answer = {}, .course = process.conclude()};
        if (status == static_cast<int>(OSTErrorCode::success))
            attempt.answer.emplace();
        else if (status != 128 + SIGKILL)
            attempt.answer.emplace(std::unexpected(ostrand::Error::failed(static_cast<std::uint64_t>(status))));
        return attempt;
    }

    int _operateInProcess() {
        ::umask(0);
        device().enter();
        ost::OSTCodeSigningStoreDelegate codeSigning;
        ost::OSTStoreDelegate::join(codeSigning);
        const auto containerClass = static_cast<ost::OSTContainerClass>(GetParam().containerClass);
        const auto side = [&](const Container& container) {
            return ost::OSTContainerReference{
                {ost::isBundleClass(containerClass) ? 33U : 501U, containerClass, container.identifier},
                container.uuid};
        };
        const auto result = ost::OSTClientConnection::sharedClientConnection().replaceContainer(
            {.oldContainer = side(_old.container), .newContainer = side(_new.container), .preserveOldUUID = true});
        if (ost::OSTHoldsAllIdentifiersLock())
            return EXIT_SUCCESS; // which is no code
        return static_cast<int>(result ? OSTErrorCode::success : result.error());
    }

    Made _old, _new;
    std::filesystem::path _destination;
};

/// A code that the operation may end with; or no answer, and then nothing was done.
void expectTruth(const ostrand::Result<void>& answer, Place place) {
    if (answer) {
        EXPECT_EQ(place, Place::replaced);
    } else if (answer.error().kind == ostrand::Error::Kind::failed) {
        EXPECT_NE(std::ranges::find(expectedCodes, static_cast<OSTErrorCode>(answer.error().code)), expectedCodes.end())
            << answer.error().description();
    } else {
        EXPECT_EQ(place, Place::old) << answer.error().description();
    }
}

std::string describe(const Fault& fault, const GatedProcess::Course& course) {
    constexpr std::array kinds{"undisturbed", "killed", "failed", "failed for good"};
    return std::string(kinds[static_cast<std::size_t>(fault.kind)]) + " at call " + std::to_string(fault.call) + ", " +
           course.faultedCall + ", errno " + std::to_string(fault.error);
}

class RecoveryFaultTest : public ReplacementFaultTest {
protected:
    /// Something happens to every call of the start after a replacement that was cut off; the start after that must
    /// find `expected` in place.
    void disturbRecovery(unsigned moves, Place expected) {
        const struct {
            Fault fault;
            unsigned step; ///< A disk that fails for good fails alike from one call to the next.
        } rows[] = {{{.kind = Fault::Kind::kill}, 1},
                    {{.kind = Fault::Kind::fail, .error = EIO}, 1},
                    {{.kind = Fault::Kind::failForGood, .error = EIO}, 4}};
        for (auto [fault, step] : rows) {
            ASSERT_NO_FATAL_FAILURE(makeBoth());
            for (bool done = false; !done;) {
                fault.call += step * toNextCall;
                device().killDaemon();
                ASSERT_NO_FATAL_FAILURE(cutOffAfterMoves(moves));
                device().startDaemon(fault);
                static_cast<void>(device().waitForFirstPass()); // It may have ended early, or serve nobody.
                const auto course = device().daemon().conclude();
                done = course.faultedCall.empty();
                SCOPED_TRACE(describe(fault, course));
                ASSERT_NO_FATAL_FAILURE(startAgain());
                ASSERT_EQ(inPlace(), expected);
                expectOrder(expected);
                expectNothingLeft();
                ASSERT_FALSE(HasFailure());
                if (expected == Place::replaced) {
                    ASSERT_NO_FATAL_FAILURE(removeBoth());
                    ASSERT_NO_FATAL_FAILURE(makeBoth());
                }
            }
            ASSERT_NO_FATAL_FAILURE(removeBoth());
        }
    }
};

} // namespace

TEST_P(ReplacementFaultTest, AKillAtAnyMomentLeavesOneOfTheTwo) {
    std::set<Place> seen;
    for (unsigned call = 1;; call += toNextCall) {
        ASSERT_NO_FATAL_FAILURE(makeBoth());
        const Fault fault{.kind = Fault::Kind::kill, .call = call};
        const auto attempt = replace(fault);
        SCOPED_TRACE(describe(fault, attempt.course));
        ASSERT_NO_FATAL_FAILURE(startAgain());
        const auto place = inPlace();
        ASSERT_TRUE(place);
        seen.insert(*place);
        EXPECT_TRUE(!attempt.answer || (*attempt.answer && place == Place::replaced));
        expectOrder(*place);
        expectNothingLeft();
        if (HasFailure() || attempt.course.faultedCall.empty())
            break;
        ASSERT_NO_FATAL_FAILURE(removeBoth());
    }
    EXPECT_EQ(seen, (std::set{Place::old, Place::replaced}));
}

TEST_P(ReplacementFaultTest, ACallThatFailsIsAnsweredTruly) {
    const bool overWire = GetParam().through == Through::wire;
    for (const int error : overWire ? std::vector{EIO, ENOSPC, EACCES} : std::vector{EIO}) {
        for (unsigned call = 1;; call += toNextCall) {
            ASSERT_NO_FATAL_FAILURE(makeBoth());
            const Fault fault{.kind = Fault::Kind::fail, .call = call, .error = error};
            const auto attempt = replace(fault);
            SCOPED_TRACE(describe(fault, attempt.course));
            const auto place = inPlace();
            ASSERT_TRUE(place);
            ASSERT_TRUE(attempt.answer);
            expectTruth(*attempt.answer, *place);
            // It would put the old one back when the new one is deleted before the next start.
            EXPECT_EQ(namesIn(device().onHost("/private/var/root/Library/Ostrand/Replace")),
                      std::vector<std::string>());
            if (overWire)
                expectOrder(*place);
            ASSERT_NO_FATAL_FAILURE(startAgain());
            EXPECT_EQ(inPlace(), place);
            expectOrder(*place);
            expectNothingLeft();
            if (HasFailure() || attempt.course.faultedCall.empty())
                break;
            ASSERT_NO_FATAL_FAILURE(removeBoth());
        }
        if (HasFailure())
            break;
        ASSERT_NO_FATAL_FAILURE(removeBoth());
    }
}

TEST_P(ReplacementFaultTest, WhatAFailingDiskLeavesTheNextStartPutsRight) {
    for (unsigned call = 1;; call += toNextCall) {
        ASSERT_NO_FATAL_FAILURE(makeBoth());
        const Fault fault{.kind = Fault::Kind::failForGood, .call = call, .error = EIO};
        const auto attempt = replace(fault);
        SCOPED_TRACE(describe(fault, attempt.course));
        ASSERT_TRUE(attempt.answer);
        ASSERT_NO_FATAL_FAILURE(startAgain());
        const auto place = inPlace();
        ASSERT_TRUE(place);
        expectTruth(*attempt.answer, *place);
        expectOrder(*place);
        expectNothingLeft();
        if (HasFailure() || attempt.course.faultedCall.empty())
            break;
        ASSERT_NO_FATAL_FAILURE(removeBoth());
    }
}

TEST_P(RecoveryFaultTest, ARecoveryThatIsDisturbedLeavesTheOldOneToTheNext) { disturbRecovery(1, Place::old); }

TEST_P(RecoveryFaultTest, ARecoveryThatIsDisturbedLeavesTheNewOneInPlace) { disturbRecovery(2, Place::replaced); }

namespace {

constexpr Setting liveData{"LiveData", ContainerClass::dataApplication, false, Through::wire};
constexpr Setting transientData{"TransientData", ContainerClass::dataApplication, true, Through::wire};
constexpr Setting liveBundle{"LiveBundle", ContainerClass::bundleApplication, false, Through::wire};
constexpr Setting transientBundle{"TransientBundle", ContainerClass::bundleApplication, true, Through::wire};
constexpr Setting preservedData{"PreservedData", ContainerClass::dataApplication, false, Through::operation};
constexpr Setting preservedBundle{"PreservedBundle", ContainerClass::bundleApplication, false, Through::operation};

std::string nameOf(const testing::TestParamInfo<Setting>& setting) { return setting.param.name; }

} // namespace

INSTANTIATE_TEST_SUITE_P(, ReplacementFaultTest,
                         testing::Values(liveData, transientData, liveBundle, transientBundle, preservedData,
                                         preservedBundle),
                         nameOf);
// A recovery looks at nothing but paths, of which these are all kinds.
INSTANTIATE_TEST_SUITE_P(, RecoveryFaultTest, testing::Values(liveData, transientBundle, preservedData), nameOf);
