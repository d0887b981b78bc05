#include "platform/codec/OSTPackBuffer.h"

#include "platform/base/FileDescriptor.h"
#include "support/Sanitized.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

using namespace std::string_literals;

namespace ost {

namespace {

using Error = OSTPackBufferError;

const std::string endItem(8, '\0');

std::string heldBy(const sb_packbuff& buffer) {
    return {reinterpret_cast<const char*>(sb_packbuff_get_bytes(buffer)), sb_packbuff_get_size(buffer)};
}

OSTPackBufferPointer wrapped(std::string& bytes) {
    return sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true, OSTPackBufferDeallocType::none);
}

std::string printed(const sb_packbuff& buffer) {
    char* text = nullptr;
    std::size_t size = 0;
    auto* const stream = ::open_memstream(&text, &size);
    sb_packbuff_print(buffer, stream);
    std::fclose(stream);
    std::string result(text, size);
    std::free(text);
    return result;
}

/// `pattern` with each "%p" replaced by the next of `addresses`.
std::string withAddresses(std::string pattern, std::initializer_list<const void*> addresses) {
    std::size_t position = 0;
    for (const auto* address : addresses) {
        char text[32];
        std::snprintf(text, sizeof text, "%p", address);
        position = pattern.find("%p", position);
        pattern.replace(position, 2, text);
    }
    return pattern;
}

} // namespace

TEST(PackBuffer, PacksItemsByteForByte) {
    const auto buffer = sb_packbuff_new_with_tag(4096);
    EXPECT_EQ(heldBy(*buffer), endItem);
    EXPECT_EQ(sb_packbuff_get_item_value_type(*buffer), std::nullopt);

    ASSERT_TRUE(sb_packbuff_pack_uint32(*buffer, 3, 0x01020304));
    ASSERT_TRUE(sb_packbuff_pack_string(*buffer, 0x0201, "notes", 5));
    ASSERT_TRUE(sb_packbuff_pack_string(*buffer, 1, "notes.a", 7));
    ASSERT_TRUE(sb_packbuff_pack_string(*buffer, 1, "notes.ab", 8));
    ASSERT_TRUE(sb_packbuff_pack_bytes(*buffer, 9, "\x01\x02\x03", 3));
    ASSERT_TRUE(sb_packbuff_pack_bytes(*buffer, 9, nullptr, 0));
    ASSERT_TRUE(sb_packbuff_pack_key_with_string_value(*buffer, 102, "g", 103, ""));
    EXPECT_EQ(heldBy(*buffer), "\1\0\3\0\4\3\2\1"s
                               "\2\0\1\2\6\0\0\0notes\0\0\0"s
                               "\2\0\1\0\x08\0\0\0notes.a\0"s
                               "\2\0\1\0\x09\0\0\0notes.ab\0\0\0\0\0\0\0\0"s
                               "\3\0\x09\0\3\0\0\0\1\2\3\0\0\0\0\0"s
                               "\3\0\x09\0\0\0\0\0"s
                               "\2\0\x66\0\2\0\0\0g\0\0\0\0\0\0\0"s
                               "\2\0\x67\0\1\0\0\0\0\0\0\0\0\0\0\0"s +
                                   endItem);
}

TEST(PackBuffer, RefusesStringsWithoutTheirNULAndDataThatNoItemHolds) {
    const auto buffer = sb_packbuff_new(64);
    EXPECT_EQ(sb_packbuff_pack_string(*buffer, 1, "notes", 4).error(), Error::invalidArgument);
    EXPECT_EQ(sb_packbuff_pack_string(*buffer, 1, "notes", std::numeric_limits<std::size_t>::max()).error(),
              Error::invalidArgument);
    for (const auto length : {std::size_t{1} << 32, std::numeric_limits<std::size_t>::max()})
        EXPECT_EQ(sb_packbuff_pack_bytes(*buffer, 1, "x", length).error(), Error::outOfRange) << length;
    EXPECT_EQ(heldBy(*buffer), endItem);
}

TEST(PackBuffer, AnOwnedBufferGrowsByBlocks) {
    for (const auto& [blockSize, length, allocated] : std::vector<std::array<std::size_t, 3>>{
             {0, 240, 256}, // the last that fits: its header, itself, the END item
             {0, 241, 512}, //
             {7, 241, 512}, // too small a block is none
             {12, 0, 24},   // blocks need not be aligned
             {16, 24, 64},  // one block leaves too little: 16 + 16 + 32
             {16, 1000, 1040},
         }) {
        const auto buffer = sb_packbuff_new(blockSize);
        const std::string data(length, 'x');
        ASSERT_TRUE(sb_packbuff_pack_bytes(*buffer, 1, data.data(), length));
        EXPECT_EQ(buffer->bytes_allocated, allocated) << length;
        EXPECT_EQ(buffer->bytes_used, 16 + (length + 7) / 8 * 8);
        EXPECT_EQ(buffer->bytes_remaining, allocated - buffer->bytes_used);
        EXPECT_EQ(buffer->item, buffer->item_buffer + buffer->bytes_used - 8);
    }
}

TEST(PackBuffer, AWrappedBufferKeepsItsSize) {
    std::string bytes(16, '\xff');
    const auto buffer =
        sb_packbuff_init_with_buffer_and_tag(bytes.data(), bytes.size(), false, OSTPackBufferDeallocType::none);
    ASSERT_TRUE(sb_packbuff_pack_uint32(*buffer, 3, 1));
    EXPECT_EQ(sb_packbuff_pack_uint32(*buffer, 3, 1).error(), Error::notSupported);
    EXPECT_EQ(bytes, "\1\0\3\0\1\0\0\0"s + endItem);

    const auto full = wrapped(bytes);
    EXPECT_EQ(sb_packbuff_get_size(*full), 16);
    EXPECT_EQ(sb_packbuff_pack_uint32(*full, 3, 1).error(), Error::notSupported);
    sb_packbuff_set_size(*full, 8);
    EXPECT_EQ(full->bytes_remaining, 8);

    for (const auto size : {0, 1, 7, 12})
        EXPECT_FALSE(sb_packbuff_init_with_buffer(bytes.data(), static_cast<std::size_t>(size), true,
                                                  OSTPackBufferDeallocType::none))
            << size;
}

TEST(PackBuffer, ReadsWhatWasPackedAtAnyAddress) {
    const auto packed = sb_packbuff_new(8);
    ASSERT_TRUE(sb_packbuff_pack_uint32(*packed, 3, 501));
    ASSERT_TRUE(sb_packbuff_pack_bytes(*packed, 9, "a\0b", 3));
    ASSERT_TRUE(sb_packbuff_pack_key_with_string_value(*packed, 3, "group", 4, "/path"));
    const auto unaligned = "?" + heldBy(*packed);
    std::vector<char> copy(unaligned.begin(), unaligned.end());
    const auto buffer =
        sb_packbuff_init_with_buffer(copy.data() + 1, copy.size() - 1, true, OSTPackBufferDeallocType::none);

    EXPECT_EQ(sb_packbuff_get_item_value_type(*buffer), 3);
    EXPECT_EQ(sb_packbuff_unpack_string(*buffer).error(), Error::invalidArgument);
    EXPECT_EQ(sb_packbuff_unpack_uint32(*buffer), 501U);
    const auto bytes = sb_packbuff_unpack_bytes(*buffer);
    ASSERT_EQ(bytes.value().size(), 3U);
    EXPECT_EQ(std::memcmp(bytes->data(), "a\0b", 3), 0);
    const auto pair = sb_packbuff_unpack_key_with_string_value(*buffer);
    ASSERT_TRUE(pair);
    EXPECT_EQ(pair->key, "group");
    EXPECT_EQ(pair->valueType, 4);
    EXPECT_EQ(pair->value, "/path");
    EXPECT_EQ(sb_packbuff_get_item_value_type(*buffer), std::nullopt);
    EXPECT_EQ(sb_packbuff_unpack_uint32(*buffer).error(), Error::invalidArgument);
}

TEST(PackBuffer, AnItemThatCannotBeReadStaysTheCurrentOne) {
    constexpr auto number = [](sb_packbuff& buffer) { return sb_packbuff_unpack_uint32(buffer).error(); };
    constexpr auto string = [](sb_packbuff& buffer) { return sb_packbuff_unpack_string(buffer).error(); };
    constexpr auto bytes = [](sb_packbuff& buffer) { return sb_packbuff_unpack_bytes(buffer).error(); };
    constexpr auto pair = [](sb_packbuff& buffer) { return sb_packbuff_unpack_key_with_string_value(buffer).error(); };
    struct Case {
        std::string items;
        Error (*unpack)(sb_packbuff&);
        Error error;
    };
    for (auto [items, unpack, error] : std::vector<Case>{
             {"\2\0\1\0\6\0\0\0notes\0\0\0"s + endItem, number, Error::invalidArgument},
             {"\1\0\1\0\6\0\0\0"s + endItem, bytes, Error::invalidArgument},
             {"\4\0\1\0\0\0\0\0"s + endItem, bytes, Error::invalidArgument},
             {"\0\0\1\0\6\0\0\0"s + endItem, number, Error::invalidArgument},
             {"\1\0\1\0\6\0\0\0"s, number, Error::outOfRange},                        // nothing follows
             {"\2\0\1\0\6\0\0\0notes\0\0\0"s, string, Error::outOfRange},             // nothing follows
             {"\2\0\1\0\x09\0\0\0notes\0\0\0"s + endItem, string, Error::outOfRange}, // up to the end
             {"\2\0\1\0\x11\0\0\0notes\0\0\0"s + endItem, string, Error::outOfRange}, // past the end
             {"\3\0\1\0\xf9\xff\xff\xff"s + endItem, bytes, Error::outOfRange},
             {"\3\0\1\0\xff\xff\xff\xff"s + endItem, bytes, Error::outOfRange},
             {"\2\0\1\0\0\0\0\0"s + endItem, string, Error::invalidArgument},
             {"\2\0\1\0\0\0\0\0"s, string, Error::outOfRange}, // the range is judged first
             {"\2\0\1\0\5\0\0\0notes\0\0\0"s + endItem, string, Error::invalidArgument},
             {"\2\0\1\0\x08\0\0\0notnull."s + endItem, string, Error::invalidArgument},
             {"\2\0\1\0\2\0\0\0g\0\0\0\0\0\0\0"s + endItem, pair, Error::invalidArgument},
             {"\2\0\1\0\2\0\0\0g\0\0\0\0\0\0\0\1\0\1\0\0\0\0\0"s + endItem, pair, Error::invalidArgument},
         }) {
        std::vector<char> exact(items.begin(), items.end()); // so that a sanitizer sees who reads on
        const auto buffer =
            sb_packbuff_init_with_buffer(exact.data(), exact.size(), true, OSTPackBufferDeallocType::none);
        EXPECT_EQ(unpack(*buffer), error) << ::testing::PrintToString(items);
        EXPECT_EQ(buffer->item, buffer->item_buffer) << ::testing::PrintToString(items);
    }
}

TEST(PackBuffer, AStringMayHoldNULs) {
    auto items = "\2\0\1\0\4\0\0\0a\0b\0\0\0\0\0"s + endItem;
    EXPECT_EQ(sb_packbuff_unpack_string(*wrapped(items)), std::string_view("a\0b", 3));
}

TEST(PackBuffer, WithoutMemoryAnOwnedBufferLosesWhatItHolds) {
    if (test::isSanitized)
        GTEST_SKIP() << "the sanitizer needs more memory than the limit";
    const auto buffer = sb_packbuff_new(std::size_t{1} << 28);
    const rlimit limit{.rlim_cur = std::size_t{1} << 28, .rlim_max = RLIM_INFINITY};
    ASSERT_TRUE(buffer);
    ASSERT_EQ(::setrlimit(RLIMIT_AS, &limit), 0);
    sb_packbuff_set_size(*buffer, buffer->bytes_allocated);
    EXPECT_EQ(sb_packbuff_pack_uint32(*buffer, 3, 1).error(), Error::outOfMemory);
    EXPECT_EQ(sb_packbuff_pack_uint32(*buffer, 3, 1).error(), Error::notSupported);
    EXPECT_EQ(sb_packbuff_get_size(*buffer), 0);
    EXPECT_FALSE(sb_packbuff_new(std::numeric_limits<std::size_t>::max()));
}

TEST(PackBuffer, PrintsEveryItem) {
    auto items = "\1\0\3\0\xf5\1\0\0"s
                 "\2\0\1\0\6\0\0\0notes\0\0\0"s
                 "\3\0\x09\0\3\0\0\0\1\2\3\0\0\0\0\0"s
                 "\5\0\7\0\1\0\0\0"s +
                 endItem;
    const auto buffer = wrapped(items);
    ASSERT_TRUE(sb_packbuff_unpack_uint32(*buffer));
    const auto* const first = buffer->item_buffer;
    EXPECT_EQ(printed(*buffer), withAddresses("packbuff: %p\n"
                                              "  block_size:      0\n"
                                              "  dealloc_type:    None\n"
                                              "  bytes_allocated: 56\n"
                                              "  bytes_used:      56\n"
                                              "  bytes_remaining: 0\n"
                                              "  item_buffer %p, item: %p\n"
                                              "\n"
                                              "   0:%p -- value type 3 --inline value: 501\n"
                                              "*  1:%p -- value type 1 --string (%p, 2 pad bytes, size: 6): \n"
                                              "     `notes'\n"
                                              "   2:%p -- value type 9 --bytes (%p, 5 pad bytes, size: 3)\n"
                                              "   3:%p -- value type 7 --*Unknown item type* 5\n"
                                              "   4: %p -- END\n",
                                              {buffer.get(), first, first + 8, first, first + 8, first + 16, first + 24,
                                               first + 32, first + 40, first + 48}));
    EXPECT_NE(printed(*sb_packbuff_new(8)).find("  dealloc_type:    free()\n"), std::string::npos);
}

TEST(PackBuffer, PrintingStopsAtTheEndOfTheBuffer) {
    for (auto items : {"\2\0\1\0\xff\xff\xff\xffnotnull."s, "\1\0\1\0\6\0\0\0"s}) {
        const auto text = printed(*wrapped(items));
        EXPECT_TRUE(text.ends_with("\n>> item pointer exceeds end of buffer. <<")) << text;
    }
}

TEST(PackBuffer, ReleasesARegionAndReportsOneThatIsNone) {
    const platform::FileDescriptor memory(::memfd_create("region", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    ASSERT_EQ(::ftruncate(memory.get(), 4096), 0);
    auto* const region = ::mmap(nullptr, 4096, PROT_READ | PROT_WRITE, MAP_SHARED, memory.get(), 0);
    ASSERT_NE(::fcntl(memory.get(), F_ADD_SEALS, F_SEAL_WRITE), 0)
        << "writing can be forbidden while a region may write";
    auto mapped = sb_packbuff_init_with_buffer(region, 4096, false, OSTPackBufferDeallocType::region);
    EXPECT_NE(printed(*mapped).find("  dealloc_type:    munmap()\n"), std::string::npos);
    ::testing::internal::CaptureStdout();
    mapped.reset();
    EXPECT_EQ(::testing::internal::GetCapturedStdout(), "");
    // The address says nothing: another thread may have mapped something there since.
    EXPECT_EQ(::fcntl(memory.get(), F_ADD_SEALS, F_SEAL_WRITE), 0) << "the region is still mapped";

    alignas(8) static char none[16];
    auto unmapped = sb_packbuff_init_with_buffer(none + 8, 8, false, OSTPackBufferDeallocType::region);
    ::testing::internal::CaptureStdout();
    unmapped.reset();
    EXPECT_EQ(::testing::internal::GetCapturedStdout(), withAddresses("failed: munmap(%p, 8)\n", {none + 8}));
}

} // namespace ost
