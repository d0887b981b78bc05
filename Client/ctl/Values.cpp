#include "Client/ctl/Values.h"

#include "Client/ctl/Suggestion.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"
#include "platform/codec/PropertyList.h"

#include <cerrno>
#include <cstdio>
#include <memory>
#include <optional>
#include <pwd.h>
#include <strings.h>

namespace ostrand::ctl {

namespace {

using ost::platform::numberIn;
using File = std::unique_ptr<FILE, int (*)(FILE*)>;

/// How deep a property list may be to go into a request, which is a level of its own.
constexpr std::size_t deepestValue = 63;

/// The class of that name, in any case.
std::optional<ContainerClass> containerClassNamed(std::string_view name) {
    const auto isNamed = [&](std::uint64_t number) {
        const auto candidate = ost::OSTContainerClassPathComponents[number];
        return candidate.size() == name.size() && strncasecmp(candidate.data(), name.data(), name.size()) == 0;
    };
    for (std::uint64_t number = 0; number < ost::OSTContainerClassPathComponents.size(); ++number)
        if (const auto named = static_cast<ContainerClass>(number); isValidContainerClass(named) && isNamed(number))
            return named;
    return std::nullopt;
}

/// What a person knows the file by.
std::string nameOf(const std::string& path) { return path == "-" ? "standard input" : escaped(path); }

std::expected<std::string, Failure> contentOf(const std::string& path, std::size_t largest) {
    const File file(path == "-" ? stdin : std::fopen(path.c_str(), "re"), &std::fclose);
    std::string content;
    char buffer[1U << 16U];
    while (file && content.size() <= largest) {
        const auto count = std::fread(buffer, 1, sizeof buffer, file.get());
        if (count == 0)
            break;
        content.append(buffer, count);
    }
    if (!file || std::ferror(file.get()))
        return std::unexpected(Failure::system("cannot read " + path, errno));
    if (content.size() > largest)
        return std::unexpected(Failure::local(nameOf(path) + " is too large"));
    return content;
}

std::expected<ost::OSTValue, Failure> propertyListIn(const std::string& path, std::size_t largest, const char* kind) {
    const auto content = OST_TRY(contentOf(path, largest));
    auto value = ost::platform::parsePropertyList(content, {.depth = deepestValue, .objectCount = content.size()});
    if (!value)
        return std::unexpected(Failure::local(nameOf(path) + " is no " + kind + ": " + escaped(value.error().reason)));
    return *std::move(value);
}

} // namespace

std::vector<std::string> classNames() {
    std::vector<std::string> names;
    for (std::uint64_t number = 1; isValidContainerClass(static_cast<ContainerClass>(number)); ++number)
        names.emplace_back(ost::OSTContainerClassPathComponents[number]);
    return names;
}

std::expected<ContainerClass, Failure> classNamed(const std::string& text) {
    if (const auto number = numberIn<std::uint64_t>(text))
        return static_cast<ContainerClass>(*number);
    if (const auto named = containerClassNamed(text))
        return *named;
    return std::unexpected(
        Failure::usage("no container class is called \"" + escaped(text) + "\"" + didYouMean(text, classNames())));
}

std::expected<std::uint64_t, Failure> userNamed(const std::string& text, const std::string& device) {
    if (const auto number = numberIn<std::uint64_t>(text))
        return *number;
    const std::string path = device + "/etc/passwd";
    const File accounts(std::fopen(path.c_str(), "re"), &std::fclose);
    if (!accounts)
        return std::unexpected(Failure::system("cannot read " + path, errno));
    std::vector<std::string> names;
    while (const passwd* account = fgetpwent(accounts.get())) {
        if (text == account->pw_name)
            return account->pw_uid;
        names.emplace_back(account->pw_name);
    }
    return std::unexpected(
        Failure::usage("the device has no account \"" + escaped(text) + "\"" + didYouMean(text, names)));
}

std::expected<ost::OSTValue, Failure> propertyListIn(const std::string& path) {
    return propertyListIn(path, largestPropertyList, "property list");
}

std::expected<ost::OSTDictionary, Failure> dictionaryIn(const std::string& path, std::size_t largest) {
    constexpr const char* kind = "property-list dictionary";
    const auto value = OST_TRY(propertyListIn(path, largest, kind));
    if (!value.asDictionary())
        return std::unexpected(Failure::local(nameOf(path) + " is no " + kind));
    return *value.asDictionary();
}

} // namespace ostrand::ctl
