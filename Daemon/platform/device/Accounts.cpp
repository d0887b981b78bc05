#include "platform/device/Accounts.h"

#include "platform/base/SmallFile.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <array>
#include <cerrno>
#include <charconv>
#include <cstdint>
#include <optional>
#include <set>

namespace ost::platform {

namespace {

constexpr const char* passwdFile = "/etc/passwd";
constexpr const char* groupFile = "/etc/group";
constexpr std::size_t databaseLimit = 4 << 20; // far above what fits a device, far below what hurts

struct Group {
    std::string name;
    gid_t gid;
    std::string members; ///< names, separated by commas
};

/// Cuts a line into exactly `count` fields at its colons.
template<std::size_t count>
std::optional<std::array<std::string_view, count>> fieldsOf(std::string_view line) {
    std::array<std::string_view, count> fields;
    for (std::size_t index = 0; index < count; ++index) {
        const auto colon = line.find(':');
        if ((colon == std::string_view::npos) != (index == count - 1))
            return std::nullopt;
        fields[index] = line.substr(0, colon);
        line.remove_prefix(index == count - 1 ? line.size() : colon + 1);
    }
    return fields;
}

std::optional<Account> parseAccount(std::string_view line) {
    const auto fields = fieldsOf<7>(line); // name, password, user id, group id, comment, home, shell
    if (!fields)
        return std::nullopt;
    const auto uid = numberIn<std::uint32_t>((*fields)[2]);
    const auto gid = numberIn<std::uint32_t>((*fields)[3]);
    if ((*fields)[0].empty() || !uid || !gid)
        return std::nullopt;
    return Account{std::string((*fields)[0]), *uid, *gid, std::string((*fields)[5])};
}

std::optional<Group> parseGroup(std::string_view line) {
    const auto fields = fieldsOf<4>(line); // name, password, group id, members
    if (!fields)
        return std::nullopt;
    const auto gid = numberIn<std::uint32_t>((*fields)[2]);
    if ((*fields)[0].empty() || !gid)
        return std::nullopt;
    return Group{std::string((*fields)[0]), *gid, std::string((*fields)[3])};
}

bool hasMember(std::string_view members, std::string_view name) {
    return ("," + std::string(members) + ",").contains("," + std::string(name) + ",");
}

template<typename Record>
std::expected<void, Errno> forEachRecord(const std::string& file, std::optional<Record> (*parse)(std::string_view),
                                         const auto& visit) {
    const auto content = OST_TRY(readSmallFile(file.c_str(), databaseLimit, FinalLink::follow));
    for (std::string_view rest = content; !rest.empty();) {
        const auto line = takeUntil(rest, '\n');
        if (auto record = parse(line))
            visit(*record);
    }
    return {};
}

template<typename Record>
std::expected<Record, Errno> find(const std::string& file, std::optional<Record> (*parse)(std::string_view),
                                  const auto& matches) {
    std::optional<Record> found;
    OST_TRY(forEachRecord(file, parse, [&](Record& record) {
        if (!found && matches(record))
            found = std::move(record);
    }));
    if (!found)
        return std::unexpected(ENOENT);
    return *std::move(found);
}

} // namespace

std::expected<Account, Errno> accountForName(std::string_view name, const std::string& image) {
    return find(image + passwdFile, parseAccount, [&](const Account& account) { return account.name == name; });
}

std::expected<Account, Errno> accountForUserId(uid_t uid, const std::string& image) {
    return find(image + passwdFile, parseAccount, [&](const Account& account) { return account.uid == uid; });
}

std::expected<Account, Errno> accountMatching(const std::function<bool(const Account&)>& matches,
                                              const std::string& image) {
    return find(image + passwdFile, parseAccount, matches);
}

std::expected<gid_t, Errno> groupForName(std::string_view name) {
    return OST_TRY(find(groupFile, parseGroup, [&](const Group& group) { return group.name == name; })).gid;
}

std::expected<std::string, Errno> groupForId(gid_t gid) {
    return OST_TRY(find(groupFile, parseGroup, [&](const Group& group) { return group.gid == gid; })).name;
}

std::expected<std::vector<gid_t>, Errno> groupsOf(const Account& account, const std::string& image) {
    std::set<gid_t> others;
    OST_TRY(forEachRecord(image + groupFile, parseGroup, [&](const Group& group) {
        if (hasMember(group.members, account.name))
            others.insert(group.gid);
    }));
    others.erase(account.gid);
    std::vector<gid_t> groups{account.gid};
    groups.insert(groups.end(), others.begin(), others.end());
    return groups;
}

} // namespace ost::platform
