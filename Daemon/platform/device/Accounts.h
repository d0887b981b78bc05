#pragma once

#include "platform/base/Errno.h"

#include <sys/types.h>

#include <expected>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace ost::platform {

/// The users and groups of the device, read from /etc/passwd and /etc/group at each call; a program that is linked
/// statically has no name service. Lines that are not well-formed do not count, the first of several matching ones
/// does. `image` is the device's directory as this process sees it.
///
/// Threads: any. Errors: ENOENT when nobody has the name or number, otherwise the errno of reading the file.

struct Account {
    std::string name;
    uid_t uid;
    gid_t gid;
    std::string home;

    friend bool operator==(const Account&, const Account&) = default;
};

[[nodiscard]] std::expected<Account, Errno> accountForName(std::string_view name, const std::string& image = "");
[[nodiscard]] std::expected<Account, Errno> accountForUserId(uid_t uid, const std::string& image = "");
/// The first account for which `matches` gives true.
[[nodiscard]] std::expected<Account, Errno> accountMatching(const std::function<bool(const Account&)>& matches,
                                                            const std::string& image = "");
[[nodiscard]] std::expected<gid_t, Errno> groupForName(std::string_view name);
[[nodiscard]] std::expected<std::string, Errno> groupForId(gid_t gid);

/// All groups of an account, each once: its own first, then those that list its name among their members.
[[nodiscard]] std::expected<std::vector<gid_t>, Errno> groupsOf(const Account& account, const std::string& image = "");

} // namespace ost::platform
