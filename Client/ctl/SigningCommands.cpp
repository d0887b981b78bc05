#include "Client/ctl/Commands.h"
#include "Client/ctl/Values.h"
#include "Protocol/OSTEntitlements.h"
#include "Protocol/OSTKeys.h"
#include "platform/base/Try.h"
#include "platform/device/CodeSignature.h"

#include <cerrno>
#include <sys/stat.h>

namespace ostrand::ctl {

namespace {

using ost::OSTDictionary;
using ost::platform::FileDescriptor;

constexpr Operand fileOperand{"FILE", "the program's executable file, a path of the host"};
constexpr Option identifierOption{"identifier", "ID", "the program's code-signing identifier"};
constexpr Option entitlementsOption{"entitlements", "PLIST",
                                    "a property list with the entitlements; - is standard input"};
constexpr Option entitlementOption{"entitlement", "KEY", "an entitlement that is true", Option::Count::repeated};
constexpr Option forceOption{"force", "", "give private entitlements even to a program that others may execute"};

std::expected<OSTDictionary, Failure> entitlementsOf(const Arguments& arguments) {
    OSTDictionary entitlements;
    if (const auto path = arguments.value(entitlementsOption.name))
        entitlements = OST_TRY(dictionaryIn(*path, ost::platform::maximumCodeSignature * 16));
    for (auto& key : arguments.values(entitlementOption.name))
        entitlements.set(std::move(key), true);
    return entitlements;
}

std::expected<OSTDictionary, Failure> signatureOf(const Arguments& arguments) {
    OSTDictionary signature;
    if (auto identifier = arguments.value(identifierOption.name))
        signature.set(ost::signatureKey::identifier, *std::move(identifier));
    if (arguments.has(entitlementsOption.name) || arguments.has(entitlementOption.name)) {
        auto entitlements = OST_TRY(entitlementsOf(arguments));
        signature.set(ost::signatureKey::entitlements, std::move(entitlements));
    }
    if (signature.empty())
        return std::unexpected(Failure::usage("neither an identifier nor entitlements to sign with"));
    return signature;
}

/// Why a signature on the file would not count, or would give rights away; empty when it is fine.
std::string objectionTo(const struct stat& file, const OSTDictionary& signature, bool force) {
    if (file.st_uid != 0)
        return "its owner is not root, so its signature would not count";
    if (file.st_mode & (S_IWGRP | S_IWOTH))
        return "group or others may write it, so its signature would not count";
    const auto* const entitlements = signature.find(ost::signatureKey::entitlements);
    if (force || !entitlements || !(file.st_mode & S_IXOTH))
        return {};
    for (const auto& [key, value] : *entitlements->asDictionary())
        if (key.starts_with(ost::OSTEntitlementPrefix))
            return "others may execute it and would have the rights of " + escaped(key) +
                   "; take their permission away, or use --force";
    return {};
}

Outcome sign(const Arguments& arguments) {
    const auto path = *arguments.value(fileOperand.name);
    const auto signature = OST_TRY(signatureOf(arguments));
    const auto program = ost::platform::openProgram(path);
    struct stat status{};
    if (!program)
        return std::unexpected(program.error() == EINVAL || program.error() == ELOOP
                                   ? Failure::local(escaped(path) + " is no regular file")
                                   : Failure::system("cannot open " + path, program.error()));
    if (fstat(program->get(), &status) != 0)
        return std::unexpected(Failure::system("cannot examine " + path, errno));
    if (const auto objection = objectionTo(status, signature, arguments.has(forceOption.name)); !objection.empty())
        return std::unexpected(Failure::local(escaped(path) + ": " + objection));
    if (const auto written = ost::platform::writeCodeSignature(program->get(), signature); !written)
        return std::unexpected(Failure::system("cannot sign " + path, written.error()));

    Report report;
    report.text = escaped(path) + " is signed\n";
    report.json.set("file", path);
    report.json.set("signature", signature);
    return report;
}

} // namespace

std::vector<Command> signingCommands() {
    return {{"sign",
             "signs a program, replacing the signature that it has",
             {fileOperand},
             {identifierOption, entitlementsOption, entitlementOption, forceOption},
             "A signature counts as long as the file belongs to root and neither group nor others may write it.\n"
             "Everybody who may execute a program has its entitlements: those that begin with\n"
             "\"com.tamarok.private.Ostrand.\" are refused to a program that others may execute.",
             sign,
             R"({"file": "string", "signature": {"Identifier?": "string", "Entitlements?": {"*": "any"}}})"}};
}

} // namespace ostrand::ctl
