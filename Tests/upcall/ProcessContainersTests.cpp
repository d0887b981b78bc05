#include "upcall/OSTProcessContainers.h"

#include "codesigning/CodeSigningTest.h"
#include "platform/base/Log.h"
#include "upcall/PackedItems.h"

#include <sys/resource.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>

using namespace std::string_literals;

namespace ost {
namespace {

using test::items::end;
using test::items::header;
using test::items::number;
using test::items::string;
using enum OSTContainerClass;

using Lines = std::vector<std::string>;

class ProcessContainersTest : public test::CodeSigningTest {
protected:
    ProcessContainersTest() {
        EXPECT_TRUE(platform::Log::shared().open(platform::LogLevel::notice, {"/log", 1, 1U << 20U}));
        static_cast<void>(mapping());
        takeLog();
    }

    /// Asks for the containers of a request whose END item is left out here. The items of the answer, or the code.
    static Lines ask(std::string items) { return askWhole(std::move(items) + end); }

    static Lines askWhole(std::string buffer) {
        const auto answer = server_get_process_containers(std::as_writable_bytes(std::span(buffer)));
        if (!answer)
            return {"code " + std::to_string(answer.error())};
        std::string bytes(answer->size, '?');
        EXPECT_EQ(::pread(answer->region.get(), bytes.data(), bytes.size() + 1, 0), ssize_t(bytes.size()));
        return test::items::shown(bytes);
    }

    /// The lines of the upcall since the last call, as "<Level> message".
    static Lines takeLog() {
        Lines lines;
        std::istringstream log(test::readFile("/log"));
        std::filesystem::resize_file("/log", 0);
        constexpr std::string_view function = "server_get_process_containers: ";
        for (std::string line; std::getline(log, line);)
            if (const auto at = line.find(function); at != std::string::npos)
                lines.push_back(line.substr(line.find('<'), line.find('>') - line.find('<') + 2) +
                                line.substr(at + function.size()));
        return lines;
    }

    static std::string pathOf(OSTContainerClass containerClass, std::string_view identifier) {
        const auto record = cached(containerClass, identifier);
        return record ? record->url : "(none)";
    }
};

TEST_F(ProcessContainersTest, AnswersWithEveryContainerInOrder) {
    const auto request = string(7, "systemgroup.com.example.b") + string(6, "com.example.service") +
                         string(4, "group.b") + number(3, 501) + string(0, "com.example.signed") +
                         string(4, "group.a") + string(1, "com.example.app") + number(5, 0) +
                         string(2, "com.example.application") + string(4, "group.b") +
                         string(7, "systemgroup.com.example.a");
    const auto answer = ask(request);
    const auto data = pathOf(dataApplication, "com.example.app");
    EXPECT_EQ(answer,
              (Lines{"100=/private/var/mobile", "1=" + data, "2=" + data + "/tmp", "3=group.b",
                     "4=" + pathOf(sharedAppGroup, "group.b"), "3=group.a", "4=" + pathOf(sharedAppGroup, "group.a"),
                     "3=group.b", "4=" + pathOf(sharedAppGroup, "group.b"),
                     "101=" + pathOf(dataSystem, "com.example.service"), "102=systemgroup.com.example.b",
                     "103=" + pathOf(sharedSystemGroup, "systemgroup.com.example.b"), "102=systemgroup.com.example.a",
                     "103=" + pathOf(sharedSystemGroup, "systemgroup.com.example.a"), "0=1"}));
    EXPECT_TRUE(std::filesystem::is_directory(data + "/tmp"));
    EXPECT_EQ(pathOf(dataApplication, "com.example.signed"), "(none)");
    const auto before = places();
    EXPECT_EQ(ask(request), answer);
    EXPECT_EQ(places(), before) << "what was there is answered again";
}

TEST_F(ProcessContainersTest, TheCodeSignatureNamesTheContainerWhereNothingElseDoes) {
    const auto data = "1=" + makeContainer(dataApplication, "com.example.signed");
    EXPECT_EQ(ask(string(0, "com.example.signed") + number(3, 501))[1], data);
    const auto empty = ask(string(0, "com.example.signed") + number(3, 501) + string(1, ""));
    EXPECT_EQ(empty[1], "1=" + pathOf(dataApplication, "")) << "an empty identifier is one";
    // The last one of an item that may not repeat counts.
    EXPECT_EQ(ask(string(0, "x") + number(3, 7) + string(0, "com.example.signed") + number(3, 501))[1], data);
}

TEST_F(ProcessContainersTest, TheDataContainersClassFollowsTheMappingAndTheSandbox) {
    struct Case {
        std::optional<std::uint64_t> known;
        std::uint32_t type;
        OSTContainerClass containerClass;
        Lines log;
    };
    constexpr auto invalid = [](const char* number) {
        return "<Error> Invalid data container class for com.example.app: "s + number;
    };
    const std::vector<Case> cases{
        {2, 0, dataApplication, {}},
        {4, 1, dataLoomworkPlugin, {}},
        {2, 1, dataLoomworkPlugin, {"<Notice> SB Type: 1, TY Type: 2.  Declaring this a plugin"}},
        {6, 1, dataLoomworkPlugin, {"<Notice> SB Type: 1, TY Type: 6.  Declaring this a plugin"}},
        {4, 0, dataLoomworkPlugin, {"<Notice> SB type is app, but TY type is 4"}},
        {7, 0, sharedAppGroup, {"<Notice> SB type is app, but TY type is 7"}},
        {11, 0, dataTempDir, {"<Notice> SB type is app, but TY type is 11"}},
        {6, 2, dataVPNPlugin, {}},
        {std::nullopt, 0, dataApplication, {invalid("0"), "<Notice> SB Type: 0, falling back to class: 2"}},
        {std::nullopt, 1, dataLoomworkPlugin, {invalid("0"), "<Notice> SB Type: 1, falling back to class: 4"}},
        {1, 2, dataApplication, {invalid("1"), "<Notice> SB Type: 2, falling back to class: 2"}},
        {12, 1, dataLoomworkPlugin, {invalid("12"), "<Notice> SB Type: 1, falling back to class: 4"}},
        {14, 0, dataApplication, {invalid("14"), "<Notice> SB Type: 0, falling back to class: 2"}},
        {4294967300, 0, dataApplication, {invalid("4294967300"), "<Notice> SB Type: 0, falling back to class: 2"}},
    };
    for (const auto& [known, type, containerClass, log] : cases) {
        ASSERT_EQ(OSTErrorCode::success,
                  known ? registerInfo("com.example.app", OSTDictionary(), {.dataContainerClass = *known})
                        : remove("com.example.app"));
        const auto answer = ask(number(5, type) + string(1, "com.example.app") + number(3, 501));
        EXPECT_EQ(takeLog(), log);
        ASSERT_EQ(answer.size(), 4U);
        EXPECT_EQ(answer[1], "1=" + pathOf(containerClass, "com.example.app")) << known.value_or(0) << ", " << type;
    }
}

TEST_F(ProcessContainersTest, TheHomeIsThatOfTheUser) {
    EXPECT_EQ(ask(""), (Lines{"100=/private/var/root", "0=1"})) << "no user is root";
    EXPECT_EQ(ask(number(3, 0)), (Lines{"100=/private/var/root", "0=1"}));
    EXPECT_EQ(ask(number(3, 501)), (Lines{"100=/private/var/mobile", "0=1"}));
    for (const auto user : {1U, 33U, 499U, 500U, 777U, 4294967295U})
        EXPECT_EQ(ask(number(3, user)), Lines{"0=1"}) << user;
    const auto ofService = ask(string(6, "com.example.service"));
    EXPECT_EQ(ofService, (Lines{"100=/private/var/root", "101=" + pathOf(dataSystem, "com.example.service"), "0=1"}));
}

TEST_F(ProcessContainersTest, WhatCannotBeReadMakesNothing) {
    const auto before = test::tree("/private/var");
    const auto good = number(3, 501) + string(1, "com.example.app");
    struct Case {
        std::string buffer;
        std::string code;
        std::string line;
    };
    const auto text = [](const char* name, int error) {
        return "<Error> failed: to unpack string for "s + name + ". error: " + std::to_string(error);
    };
    const auto unsignedNumber = [](const char* name, int error) {
        return "<Error> failed: to unpack uint32 for "s + name + ". error: " + std::to_string(error);
    };
    const std::string noBuffer = "<Error> sb_packbuff_init() of request data fails";
    const std::vector<Case> cases{
        {"", "9", noBuffer},
        {good + end + "1234", "9", noBuffer},
        {good + number(0, 1) + end, "5", text("VN_KERN_REQUEST_CODE_SIGNATURE_ID", 22)},
        {good + number(1, 1) + end, "5", text("VN_KERN_REQUEST_CONTAINER_ID", 22)},
        {good + number(2, 1) + end, "5", text("VN_KERN_REQUEST_APPLICATION_ID", 22)},
        {good + string(3, "501") + end, "5", unsignedNumber("VN_KERN_REQUEST_PERSONA_ID", 22)},
        {good + number(3, 501), "5", unsignedNumber("VN_KERN_REQUEST_PERSONA_ID", 34)},
        {good + header(3, 4, 0) + end, "5", text("VN_KERN_REQUEST_APP_GROUP_ID", 22)},
        {good + string(5, "1") + end, "5", unsignedNumber("VN_KERN_REQUEST_CONTAINER_TYPE", 22)},
        {good + number(6, 1) + end, "5", text("VN_KERN_REQUEST_CONTAINER_ID", 22)},
        {good + header(4, 7, 0) + end, "5", text("VN_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID", 22)},
        {good, "5", text("VN_KERN_REQUEST_CONTAINER_ID", 34)},
        {good + header(2, 4, 0xffffffff) + end, "5", text("VN_KERN_REQUEST_APP_GROUP_ID", 34)},
        {good + string(4, "a\0b"s) + end, "5", text("VN_KERN_REQUEST_APP_GROUP_ID", 22)},
        {good + string(0, "\xff") + end, "5", text("VN_KERN_REQUEST_CODE_SIGNATURE_ID", 22)},
        {good + number(8, 1) + end, "4", "<Error> unexpected value: 8"},
        {good + string(65535, "x") + end, "4", "<Error> unexpected value: 65535"},
    };
    for (const auto& [buffer, code, line] : cases) {
        EXPECT_EQ(askWhole(buffer), Lines{"code " + code}) << line;
        EXPECT_EQ(takeLog(), Lines{line});
    }
    EXPECT_EQ(test::tree("/private/var"), before);
    EXPECT_EQ(askWhole(number(3, 501) + header(0, 4, 7) + number(8, 1)), (Lines{"100=/private/var/mobile", "0=1"}))
        << "what follows the end is not read";
}

TEST_F(ProcessContainersTest, OneFailedLookUpLeavesOutEveryPath) {
    const auto failedData = "<Error> createOrLookupContainerForUser: Failed with error: 11"s;
    const auto failedGroup = "<Error> createOrLookupGroupContainersForUser: Failed with error: 11"s;
    const auto items = string(1, "com.example.app") + string(6, "com.example.service") + string(4, "group.a") +
                       string(4, "group.b") + string(7, "systemgroup.com.example.a");
    ASSERT_EQ(OSTErrorCode::success, registerInfo("com.example.app", OSTDictionary(), {.dataContainerClass = 2}));
    for (const auto user : {0U, 1U, 500U}) {
        EXPECT_EQ(ask(items + number(3, user)), Lines{"0=0"}) << user;
        EXPECT_EQ(takeLog(), (Lines{failedData, failedGroup, failedGroup}));
    }
    EXPECT_NE(pathOf(dataSystem, "com.example.service"), "(none)") << "the others are made all the same";
    EXPECT_NE(pathOf(sharedSystemGroup, "systemgroup.com.example.a"), "(none)");

    mountOver("/private/var/root/Library/Caches/com.tamarok.ostrandd/Staging", true);
    EXPECT_EQ(ask(number(3, 501) + string(6, "com.example.other") + string(7, "systemgroup.com.example.a") +
                  string(7, "systemgroup.com.example.b")),
              Lines{"0=0"});
    EXPECT_EQ(takeLog(),
              (Lines{"<Error> createOrLookupContainerForUser:(system container) Failed with error: 7",
                     "<Error> createOrLookupContainerForUser:(system group container) Failed with error: 7"}));
}

TEST_F(ProcessContainersTest, WhoAlsoAsksUnderAnEndlessIdentifierGetsNothingMade) {
    EXPECT_EQ(
        ask(number(3, 501) + string(1, "com.example.app") + string(4, "group.a") + string(4, std::string(1025, 'g'))),
        Lines{"0=0"});
    EXPECT_EQ(pathOf(dataApplication, "com.example.app"), "(none)");
    EXPECT_EQ(pathOf(sharedAppGroup, "group.a"), "(none)");
}

TEST_F(ProcessContainersTest, AnAnswerMayBeLong) {
    std::string request = number(3, 501);
    Lines expected{"100=/private/var/mobile"};
    for (int group = 0; group < 200; ++group) {
        const auto identifier = "group." + std::to_string(group % 3);
        request += string(4, identifier);
        expected.push_back("3=" + identifier);
        expected.push_back("4=" + makeContainer(sharedAppGroup, identifier));
    }
    expected.push_back("0=1");
    EXPECT_EQ(ask(request), expected);
}

TEST_F(ProcessContainersTest, WithoutMemoryForTheAnswerTheCodeSaysWhy) {
    rlimit before{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
    const rlimit none{.rlim_cur = 3, .rlim_max = before.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
    const auto answer = ask(number(3, 0));
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_EQ(answer, Lines{"code 24"});
}

} // namespace
} // namespace ost
