#pragma once

#include "Client/Connection.h"
#include "platform/base/OSTValue.h"

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace ostrand {

// What identifiers are entitled to. All of these ask for full access.

/// How code-signing information is registered.
struct Registration {
    std::string identifier;
    ost::OSTDictionary info; ///< its "com.tamarok.Ostrand.Entitlements" holds the entitlements
    ost::OSTDictionary options = {};
};

/// The options of a registration by their meaning.
struct RegistrationOptions {
    std::uint64_t dataContainerClass = 0; ///< the class of the identifier's data container
    std::optional<std::string> parent = std::nullopt;
    bool placeholder = false;
    bool byCaller = false; ///< not from a signed bundle, and so valid without one

    [[nodiscard]] ost::OSTDictionary dictionary() const;
};

/// Registers code-signing information in place of what is registered under the identifier. What the identifier is
/// entitled to no more is deleted: its system container, and the group containers that nobody else references. Fails
/// with 59 when the daemon cannot write it to disk, and with 0 when the daemon could not read what is there.
[[nodiscard]] Result<void> registerCodeSigning(Connection& connection, const Registration& registration);

/// Removes what is registered under the identifier, with the same consequences; nothing there is no failure.
[[nodiscard]] Result<void> removeCodeSigning(Connection& connection, const std::string& identifier);

/// What is registered under an identifier. Fails with 21 when there is nothing, or nothing that counts: a placeholder's
/// registration or one that was invalidated.
[[nodiscard]] Result<ost::OSTDictionary> codeSigningInfo(Connection& connection, const std::string& identifier);

/// Invalidates everything that was registered from a signed bundle whose container is gone. Fails with 59 as above.
[[nodiscard]] Result<void> invalidateCodeSigningWithoutBundle(Connection& connection);

// Where group and system containers lie. An identifier that is absent is the caller's own, from its signature.

/// Paths of the device, by group identifier.
using GroupPaths = std::map<std::string, std::string>;

/// The containers of the application groups of an identifier, which are made when they are not there. Any signed
/// program may ask, as may for the ones below. Fails with 38 for a user that has no application groups.
[[nodiscard]] Result<GroupPaths> groupContainerPaths(Connection& connection, std::uint64_t user,
                                                     const std::optional<std::string>& identifier = {});

/// The same with system groups, which belong to no user.
[[nodiscard]] Result<GroupPaths> systemGroupContainerPaths(Connection& connection,
                                                           const std::optional<std::string>& identifier = {});

/// The application groups of an identifier. Asks for full access. Fails with 38 as above.
[[nodiscard]] Result<std::vector<std::string>> groupIdentifiers(Connection& connection, std::uint64_t user,
                                                                const std::optional<std::string>& identifier = {});

/// The path of an identifier's system container, which is made when it is not there. Fails with 55 for an identifier
/// that is not entitled to one.
[[nodiscard]] Result<std::string> systemContainerPath(Connection& connection,
                                                      const std::optional<std::string>& identifier = {});

/// The path of a system group's container, which is made when it is not there: one of a group that the caller is
/// entitled to, or of a well-known one. Fails with 55 for any other group, with 21 when the identifier is not entitled
/// to it.
[[nodiscard]] Result<std::string> systemGroupContainerPath(Connection& connection, const std::string& group,
                                                           const std::optional<std::string>& identifier = {});

} // namespace ostrand
