#include "Client/ErrorCodes.h"

#include <algorithm>
#include <cstring>
#include <string_view>

namespace ostrand {

namespace {

struct CodeMeaning {
    std::uint64_t code;
    std::string_view meaning;
};

constexpr CodeMeaning codeMeanings[] = {
    {0, "the daemon could not read its code-signing file, and did nothing"},
    {1, "success"},
    {4, "an item could not be moved out of the way before removal"},
    {5, "a transient container could not be removed"},
    {6, "a container's sub-directory could not be created"},
    {7, "the staging directory of a new container could not be created"},
    {8, "a staged container could not be moved to its live place"},
    {9, "a staging directory could not be removed"},
    {10, "a container's path is not what was expected"},
    {11, "user, class, identifier or UUID missing or not acceptable"},
    {12, "the metadata file could not be read"},
    {14, "the old container could not be moved to staging"},
    {15, "the replacing move failed"},
    {17, "an item on death row could not be destroyed"},
    {18, "no identifier was given"},
    {21, "no such container"},
    {22, "a container is to be replaced by itself"},
    {23, "the two containers of a replacement differ in class"},
    {24, "the container has no info value for the key"},
    {27, "the destination container already exists"},
    {28, "deletion failed"},
    {29, "the metadata file's content is invalid"},
    {33, "the replace operation's description is incomplete"},
    {34, "a dictionary file could not be written"},
    {35, "the replace file is unreadable or invalid, or its recovery failed"},
    {36, "clean-up after a replacement failed"},
    {38, "invalid parameter"},
    {40, "an exception was caught inside the operation"},
    {41, "an item could not be moved to death row"},
    {43, "a cache could not be rebuilt"},
    {44, "the cache names a container that has no metadata on disk"},
    {45, "a container could not be added to the cache"},
    {46, "a container could not be removed from the cache"},
    {47, "invalid input to the cache"},
    {48, "a container could not be moved to its new UUID directory"},
    {55, "the client is not entitled to the system container it asks for"},
    {56, "the two containers of a replacement belong to different users"},
    {59, "the code-signing mapping file could not be written"},
    {60, "values and identifiers of a mapping update differ in count"},
    {61, "the device was locked and no retry was asked for"},
    {62, "the owner of a bundle container could not be changed"},
    {63, "an access control list could not be built or applied"},
    {2048, "a property-list file could not be read as one"},
};

/// Numbers that no Linux errno reaches; keeps strerror from inventing names.
constexpr std::uint64_t errnoBound = 4096;

} // namespace

std::string meaningOfErrorCode(std::uint64_t code) {
    const auto* const found = std::ranges::lower_bound(codeMeanings, code, {}, &CodeMeaning::code);
    if (found != std::end(codeMeanings) && found->code == code)
        return std::string(found->meaning);
    if (code == 0 || code >= errnoBound || strerrordesc_np(static_cast<int>(code)) == nullptr)
        return "unknown code";
    return std::string("system error: ") + strerrordesc_np(static_cast<int>(code));
}

} // namespace ostrand
