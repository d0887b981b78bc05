#include "model/OSTMetadata.h"

#include "files/OSTDictionaryFile.h"
#include "platform/base/Path.h"
#include "platform/codec/PropertyList.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <filesystem>

namespace ost {
namespace {

constexpr const char* container =
    "/private/var/mobile/Containers/Data/Application/6D8EE0B1-0000-4000-8000-000000000001";
constexpr const char* uuid = "0AF3C3F1-93C5-4B9F-9C3E-0123456789AB";

class Metadata : public test::DeviceTest {
protected:
    static OSTDictionary valid() {
        return OSTDictionary({{"OSTMetadataIdentifier", "org.example.app"},
                              {"OSTMetadataUUID", uuid},
                              {"OSTMetadataContentClass", std::uint64_t{2}},
                              {"OSTMetadataPersona", std::uint64_t{501}}});
    }
    static OSTResult<OSTMetadata> read(const OSTDictionary& file, std::uint32_t user = 501,
                                       std::string_view url = container) {
        test::writeFile(platform::pathByAppending(url, OSTMetadataFileName),
                        platform::serializeBinaryPropertyList(file));
        return OSTMetadata::readAndValidateMetadataAtUrl(url, user, OSTCheckClassPath::yes);
    }
};

TEST_F(Metadata, WrittenFileIsReadBack) {
    std::filesystem::create_directories(container);
    OSTMetadata metadata{.uid = 501,
                         .uuid = *platform::UUID::parse(uuid),
                         .containerClass = OSTContainerClass::dataApplication,
                         .identifier = "org.example.\u00e4pp",
                         .url = container};
    ASSERT_TRUE(metadata.writeMetadataToDisk());
    const auto file = OST_dictionaryWithContentsOfURL(metadata.metadataFileURL(), OSTSmallDictionaryFileSize);
    EXPECT_EQ(4U, file->size());

    metadata.info = std::make_shared<const OSTDictionary>(OSTDictionary({{"key", std::uint64_t{7}}}));
    ASSERT_TRUE(metadata.writeMetadataToDisk());
    const auto again = OSTMetadata::readAndValidateMetadataAtUrl(container, 501, OSTCheckClassPath::yes);
    ASSERT_TRUE(again);
    EXPECT_EQ(metadata.identifier, again->identifier);
    EXPECT_EQ(metadata.uuid, again->uuid);
    EXPECT_EQ(*metadata.info, *again->info);
    EXPECT_EQ(metadata.url, again->url);
    EXPECT_EQ(1, std::distance(std::filesystem::directory_iterator(container), {})) << "a temporary file was left";
}

TEST_F(Metadata, WhatCouldNotBeReadAgainIsNotWritten) {
    std::filesystem::create_directories(container);
    const OSTMetadata metadata{.uid = 501,
                               .containerClass = OSTContainerClass::dataApplication,
                               .identifier = std::string(OSTSmallDictionaryFileSize, 'x'),
                               .url = container};
    const auto written = metadata.writeMetadataToDisk();
    ASSERT_FALSE(written);
    EXPECT_TRUE(written.error().is(OSTErrorCode::dictionaryWriteFailed));
    EXPECT_TRUE(std::filesystem::is_empty(container));
}

TEST_F(Metadata, EachInvalidValueIsRefused) {
    struct Case {
        const char* key;
        std::optional<OSTValue> value; ///< none: the key is missing
        const char* message;
    };
    const Case cases[] = {
        {"OSTMetadataIdentifier", {}, "Invalid metadata Identifier: (null) at "},
        {"OSTMetadataIdentifier", OSTValue(std::uint64_t{5}), "Invalid metadata Identifier: 5 at "},
        {"OSTMetadataUUID", OSTValue(true), "Invalid metadata UUID String: 1 at "},
        {"OSTMetadataUUID", OSTValue("nonsense"), "Invalid metadata UUID: (null) at "},
        {"OSTMetadataContentClass", OSTValue("2"), "Invalid metadata Class: 2 at "},
        {"OSTMetadataContentClass", OSTValue(std::uint64_t{0}), "Invalid metadata Content Class: 0 at "},
        {"OSTMetadataContentClass", OSTValue(std::uint64_t{14}), "Invalid metadata Content Class: 14 at "},
        {"OSTMetadataPersona", OSTValue(std::uint64_t{502}),
         "Incorrect UserId: 502, expecting: 501 for org.example.app at "},
        {"OSTMetadataPersona", OSTValue("501"), "Incorrect UserId: 501, expecting: 501 for org.example.app at "},
        {"OSTMetadataInfo", OSTValue(OSTArray{}), "Invalid metadata Info: () at "},
        {"OSTMetadataContentClass", OSTValue(std::uint64_t{4}), "Invalid metadata-URLs should match: "},
    };
    for (const auto& c : cases) {
        auto file = valid();
        file.remove(c.key);
        if (c.value)
            file.set(c.key, *c.value);
        const auto read = Metadata::read(file);
        ASSERT_FALSE(read) << c.message;
        EXPECT_TRUE(read.error().is(OSTErrorCode::metadataInvalid)) << c.message;
        EXPECT_TRUE(read.error().message()->starts_with(c.message)) << *read.error().message();
    }
}

TEST_F(Metadata, FileWithoutAUserBelongsToWhoeverIsExpected) {
    auto file = valid();
    file.remove("OSTMetadataPersona");
    EXPECT_EQ(501U, read(file, 501)->uid);
    EXPECT_EQ(502U, read(file, 502)->uid);
    file.set("OSTMetadataContentClass", std::uint64_t{1});
    EXPECT_EQ(33U, read(file, 33, "/private/var/containers/Bundle/Application/X")->uid);
}

TEST_F(Metadata, WhatIsNoReadableDictionaryFileIsRefusedAtOnce) {
    const auto file = platform::pathByAppending(container, OSTMetadataFileName);
    const std::function<void()> cases[] = {
        [] {},
        [&] { test::writeFile(file, "garbage"); },
        [&] { test::writeFile(file, "<plist><array/></plist>"); },
        [&] {
            test::writeFile(file, "");
            std::filesystem::resize_file(file, std::uintmax_t{10} << 30U);
        },
        [&] { ASSERT_EQ(0, ::mkfifo(file.c_str(), 0666)); },
        [&] { std::filesystem::create_directory(file); },
        [&] {
            test::writeFile("/elsewhere", platform::serializeBinaryPropertyList(valid()));
            std::filesystem::create_symlink("/elsewhere", file);
        },
    };
    for (const auto& place : cases) {
        std::filesystem::remove_all(container);
        std::filesystem::create_directories(container);
        place();
        const auto read = OSTMetadata::readAndValidateMetadataAtUrl(container, 501, OSTCheckClassPath::yes);
        ASSERT_FALSE(read);
        EXPECT_TRUE(read.error().is(OSTErrorCode::metadataUnreadable));
        EXPECT_EQ(std::string("Failed to read metadata at URL ") + container, *read.error().message());
    }
}

} // namespace
} // namespace ost
