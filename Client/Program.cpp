#include "Client/Program.h"

#include "Protocol/OSTEntitlements.h"
#include "platform/base/Path.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdlib>
#include <filesystem>

namespace ostrand {

using ost::platform::Errno;
using ost::platform::FileDescriptor;

namespace {

/// The strings of an entitlement that is one string or a list of them.
std::vector<std::string> stringsOf(const ost::OSTDictionary& entitlements, std::string_view key) {
    const auto* const value = entitlements.find(key);
    if (value && value->asString())
        return {*value->asString()};
    std::vector<std::string> strings;
    if (value && value->asArray())
        for (const auto& element : *value->asArray()) {
            if (!element.asString())
                return {};
            strings.push_back(*element.asString());
        }
    return strings;
}

std::vector<std::string> systemGroupsOf(const ost::OSTDictionary& entitlements) {
    auto groups = stringsOf(entitlements, ost::OSTSystemGroupsKey);
    if (groups.empty())
        groups = stringsOf(entitlements, ost::OSTSystemGroupsFallbackKey);
    std::erase_if(groups, [](const std::string& group) { return !group.starts_with(ost::OSTSystemGroupPrefix); });
    return groups;
}

} // namespace

std::expected<Program, Errno> Program::find(const std::string& name) {
    if (name.contains('/'))
        return _open(name);
    const char* const directories = std::getenv("PATH");
    int reason = ENOENT;
    for (std::string_view rest = directories ? directories : ""; !rest.empty();) {
        const auto directory = ost::platform::takeUntil(rest, ':');
        // What a relative directory means changes with the caller's.
        if (!directory.starts_with('/'))
            continue;
        auto program = _open(ost::platform::pathByAppending(directory, name));
        if (program)
            return program;
        if (program.error() != ENOENT && program.error() != ENOTDIR)
            reason = program.error();
    }
    return std::unexpected(reason);
}

std::expected<Program, Errno> Program::_open(const std::string& path) {
    std::error_code error;
    auto absolute = std::filesystem::absolute(path, error);
    if (error)
        return std::unexpected(error.value());
    FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (!file)
        return std::unexpected(errno);
    Program program(std::move(file), std::move(absolute));
    OST_TRY(program._examine());
    return program;
}

std::expected<void, Errno> Program::_examine() {
    struct stat status{};
    if (::fstat(_file.get(), &status) != 0)
        return std::unexpected(errno);
    if (!S_ISREG(status.st_mode) || (status.st_mode & (S_IXUSR | S_IXGRP | S_IXOTH)) == 0)
        return std::unexpected(EACCES);
    std::array<char, 2> magic{};
    if (::pread(_file.get(), magic.data(), magic.size(), 0) < 0)
        return std::unexpected(errno);
    _isScript = magic == std::array{'#', '!'};
    if (ost::platform::signatureFileSystem(_file.get()).ofUser)
        return {};
    std::array<char, ost::platform::maximumCodeSignature> buffer;
    const auto signature = OST_TRY(ost::platform::readCodeSignature(_file.get(), status, buffer));
    _identity = ost::platform::parseCodeSignature(signature.bytes);
    return {};
}

ProcessDescription descriptionOf(const ost::platform::CodeSigningIdentity& identity) {
    ProcessDescription process{.codeSigningIdentifier = identity.identifier};
    if (!identity.entitlements)
        return process;
    const auto& entitlements = *identity.entitlements;
    process.groups = stringsOf(entitlements, ost::OSTApplicationGroupsKey);
    process.systemGroups = systemGroupsOf(entitlements);
    const auto* const system = entitlements.find(ost::OSTSystemContainerKey);
    if (system && system->truthValue())
        process.systemContainer = identity.identifier;
    return process;
}

} // namespace ostrand
