#include "service/OSTRequestDispatcher.h"

#include "Protocol/OSTEntitlements.h"
#include "Protocol/OSTKeys.h"
#include "codesigning/OSTCodeSigningMapping.h"
#include "model/OSTFailureReport.h"
#include "platform/base/Log.h"

#include <cerrno>
#include <cstring>
#include <string_view>

namespace ost {

namespace {

using platform::logError;

/// The table's row for the command that a request names; null, with the reason in the log, when there is none to run.
const OSTCommandEntry* commandOf(const platform::IPCRequest& request) {
    const auto index = request.unsignedValue(requestKey::command);
    if (index >= OSTCommandTable.size()) {
        platform::logAs(platform::LogLevel::error, "OSTProcessVexelEvent", "Invalid command index: %lld", index);
        return nullptr;
    }
    const auto& entry = OSTCommandTable[index];
    if (entry.command != static_cast<OSTCommand>(index)) {
        platform::logAs(platform::LogLevel::error, "OSTProcessVexelEvent", "Invalid command at index %llu", index);
        return nullptr;
    }
    if (!entry.handler) {
        platform::logAs(platform::LogLevel::error, "OSTProcessVexelEvent", "Command %llu is not available", index);
        return nullptr;
    }
    return &entry;
}

bool isTrue(const OSTDictionary& entitlements, std::string_view key) {
    const auto* const value = entitlements.find(key);
    return value && value->isBoolean() && value->truthValue();
}

/// What the entitlements give a client that runs a command.
struct Grant {
    bool entitled = false;
    bool allowOtherIdLookup = false;
    std::optional<std::vector<std::string>> entitledWipeIdentifiers;
};

std::vector<std::string> stringsOf(const OSTArray& array) {
    std::vector<std::string> strings;
    for (const auto& element : array)
        if (const auto* const string = element.asString())
            strings.push_back(*string);
    return strings;
}

Grant grantFor(const OSTDictionary& entitlements, std::string_view required) {
    Grant grant;
    grant.entitled = isTrue(entitlements, OSTEntitlementAllowed);
    grant.allowOtherIdLookup = grant.entitled || isTrue(entitlements, OSTEntitlementOtherIdLookup);
    if (required == OSTEntitlementWipeContainer) {
        const auto* const value = entitlements.find(required);
        if (value && value->asArray()) {
            grant.entitledWipeIdentifiers = stringsOf(*value->asArray());
            grant.entitled = true;
        } else {
            platform::logAs(platform::LogLevel::error, "checkEntitlementsAndInitClientObject",
                            "No entitled containers to wipe");
        }
    } else if (!grant.entitled) {
        grant.entitled = required == OSTEntitlementNone || isTrue(entitlements, required);
    }
    return grant;
}

/// A caller that nobody has registered, or that has registered itself before, is known by the entitlements it carries.
void registerCaller(const platform::CodeSigningIdentity& caller) {
    auto& mapping = OSTCodeSigningMapping::sharedInstance();
    const auto& identifier = caller.identifier;
    if (identifier && !mapping.callerIsToBeRegistered(*identifier, caller.entitlements))
        return;
    if (const auto done = mapping.processCallerRegisteredEntitlements(caller.entitlements, identifier); !done)
        platform::logAs(platform::LogLevel::error, "checkEntitlementsAndInitClientObject",
                        "Error processing entitlements for %@ : %llu", identifier, done.error());
}

/// Sends the reply with the handler's code, or with the reason why there is no more to it than a code.
void answer(platform::IPCReply& reply, const OSTResult<OSTErrorCode>& code) {
    if (!code) // an exception may have left half an entry
        reply.clear();
    reply.set(replyKey::error, static_cast<std::uint64_t>(code ? *code : code.error().code()));
    if (!reply.fits()) {
        logError("A reply is too long to be sent");
        reply.clear();
        reply.set(replyKey::error, std::uint64_t{EMSGSIZE});
    }
    reply.send();
}

} // namespace

std::optional<OSTClientConnection> checkEntitlementsAndInitClientObject(platform::PeerIdentity& peer,
                                                                        const OSTCommandEntry& command) {
    const auto required = command.entitlement;
    const platform::CodeSigningIdentity nobody;
    const auto identity = peer.codeSigningIdentity();
    if (!identity)
        logError("Failed to copy signing ID for pid %d : %@", peer.processId(), identity.error());
    const auto& caller = identity ? **identity : nobody;
    if (caller.entitlements && !caller.identifier)
        logError("Failed to copy signing ID for pid %d : %@", peer.processId(), "its signature has none");

    if (!caller.entitlements && required == OSTEntitlementNone)
        return std::nullopt;
    Grant grant;
    if (caller.entitlements)
        grant = grantFor(*caller.entitlements, required);
    if (!grant.entitled) {
        logError("connection attempt from pid %d (%@) missing required entitlement: %s", peer.processId(),
                 caller.identifier, required);
        return std::nullopt;
    }
    registerCaller(caller);
    return OSTClientConnection({.clientBundleIdentifier = caller.identifier,
                                .clientUserId = peer.effectiveUserId(),
                                .allowOtherIdLookup = grant.allowOtherIdLookup,
                                .entitledWipeIdentifiers = std::move(grant.entitledWipeIdentifiers)});
}

void OSTProcessVexelEvent(const std::shared_ptr<platform::IPCConnection>& connection, platform::IPCRequest request) {
    const auto* const command = commandOf(request);
    if (!command)
        return connection->cancel();
    auto client = checkEntitlementsAndInitClientObject(connection->peer(), *command);
    if (!client)
        return connection->cancel();
    auto reply = connection->createReply(request);
    if (!reply) {
        logError("Dictionary does not have reply context");
        return connection->cancel();
    }
    const auto code = OSTGuarded([&]() -> OSTResult<OSTErrorCode> {
        const auto done = command->handler(request, *reply, *client);
        return done ? OSTErrorCode::success : done.error();
    });
    if (command->replyBy == OSTReplyBy::dispatcher)
        answer(*reply, code);
    else if (!code) // the handler took the reply with it
        connection->cancel();
}

} // namespace ost
