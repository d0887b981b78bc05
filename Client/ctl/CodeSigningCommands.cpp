#include "Client/CodeSigning.h"
#include "Client/ctl/Commands.h"
#include "Client/ctl/Values.h"
#include "Protocol/OSTErrorCode.h"
#include "platform/base/Try.h"

#include <algorithm>
#include <array>

namespace ostrand::ctl {

namespace {

constexpr Operand identifierOperand{"ID", "the code-signing identifier"};
constexpr Option infoOption{"info", "PLIST", "a property list with the information; - is standard input",
                            Option::Count::required};
constexpr Option optionsOption{"options", "PLIST", "a property list with all options, instead of those below"};
constexpr Option classOption{"class", "C", "the class of its data container: a number or a name"};
constexpr Option parentOption{"parent", "ID", "the identifier whose plug-in it is"};
constexpr Option placeholderOption{"placeholder", "", "the application is still being installed"};
constexpr Option byCallerOption{"by-caller", "", "it comes from no signed bundle, and stays valid without one"};

constexpr Option userOption{"user", "U", "the user: a number, or the name of one of the device's accounts"};
constexpr Option ofIdentifierOption{"identifier", "ID", "the identifier; without it, the program's own"};
constexpr Option systemOption{"system", "", "system groups, which belong to no user, instead of application groups"};
constexpr Option groupOption{"group", "GROUP", "the container of that system group instead"};

constexpr std::string_view propertyLists = "Property lists are read in both encodings, binary and XML.";
constexpr std::string_view ofInformation =
    "The information is a dictionary; its \"com.tamarok.Ostrand.Entitlements\" holds the entitlements.";
constexpr std::string_view inJSON =
    "With --json, data is a string of hexadecimal digits and a date the number of seconds "
    "since 1970.";

std::expected<ost::OSTDictionary, Failure> optionsOf(const Arguments& arguments) {
    const auto path = arguments.value(optionsOption.name);
    const auto isGiven = [&](const Option& option) { return arguments.has(option.name); };
    if (path && std::ranges::any_of(std::array{classOption, parentOption, placeholderOption, byCallerOption}, isGiven))
        return std::unexpected(Failure::usage("--options already names all options"));
    if (path && *path == "-" && arguments.value(infoOption.name) == path)
        return std::unexpected(Failure::usage("standard input holds one property list only"));
    if (path)
        return dictionaryIn(*path);
    RegistrationOptions options{.parent = arguments.value(parentOption.name),
                                .placeholder = isGiven(placeholderOption),
                                .byCaller = isGiven(byCallerOption)};
    if (const auto text = arguments.value(classOption.name))
        options.dataContainerClass = static_cast<std::uint64_t>(OST_TRY(classNamed(*text)));
    return options.dictionary();
}

/// What a command that only does something says: the text, with the identifier behind it.
Report reportOn(const char* done, const std::string& identifier) {
    Report report;
    report.text = std::string(done) + " " + escaped(identifier) + "\n";
    report.json.set(done, identifier);
    return report;
}

Outcome registerInfo(const Arguments& arguments) {
    auto options = OST_TRY(optionsOf(arguments));
    const Registration registration{.identifier = *arguments.value(identifierOperand.name),
                                    .info = OST_TRY(dictionaryIn(*arguments.value(infoOption.name))),
                                    .options = std::move(options)};
    auto connection = OST_TRY(connectToDevice(arguments));
    OST_TRY(orFailure(registerCodeSigning(connection, registration)));
    return reportOn("registered", registration.identifier);
}

Outcome remove(const Arguments& arguments) {
    const auto identifier = *arguments.value(identifierOperand.name);
    auto connection = OST_TRY(connectToDevice(arguments));
    OST_TRY(orFailure(removeCodeSigning(connection, identifier)));
    return reportOn("removed", identifier);
}

Failure whyNothingIsShown(const Error& error, const std::string& identifier) {
    if (error != Error::failed(static_cast<std::uint64_t>(ost::OSTErrorCode::notFound)))
        return Failure::of(error);
    return Failure::of(error, "nothing that counts is registered for " + escaped(identifier),
                       "Placeholders do not count, nor what was invalidated: ostrandctl codesign register ID --info "
                       "PLIST.");
}

Outcome show(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto identifier = *arguments.value(identifierOperand.name);
    const auto info = codeSigningInfo(connection, identifier);
    if (!info)
        return std::unexpected(whyNothingIsShown(info.error(), identifier));
    return Report{.text = treeText(*info), .json = *info};
}

Outcome invalidate(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    OST_TRY(orFailure(invalidateCodeSigningWithoutBundle(connection)));
    return Report{.text = "what has lost its bundle is invalid now\n",
                  .json = ost::OSTDictionary({{"invalidated", ost::OSTValue(true)}})};
}

std::expected<std::uint64_t, Failure> userOf(const Arguments& arguments) {
    const auto text = arguments.value(userOption.name);
    return text ? userNamed(*text, deviceDirectory(arguments)) : ost::OSTCurrentUserPlaceholder;
}

Outcome groupPaths(const Arguments& arguments) {
    const bool system = arguments.has(systemOption.name);
    if (system && arguments.has(userOption.name))
        return std::unexpected(Failure::usage("system groups belong to no user"));
    const auto identifier = arguments.value(ofIdentifierOption.name);
    const auto user = OST_TRY(userOf(arguments));
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto paths = OST_TRY(orFailure(system ? systemGroupContainerPaths(connection, identifier)
                                                : groupContainerPaths(connection, user, identifier)));
    Report report;
    Table table;
    ost::OSTDictionary json;
    for (const auto& [group, path] : paths) {
        table.add({escaped(group), escaped(path)});
        json.set(group, path);
    }
    report.text = table.text();
    report.json.set("paths", std::move(json));
    return report;
}

Outcome groupIds(const Arguments& arguments) {
    const auto user = OST_TRY(userOf(arguments));
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto groups =
        OST_TRY(orFailure(groupIdentifiers(connection, user, arguments.value(ofIdentifierOption.name))));
    Report report;
    for (const auto& group : groups)
        report.text += escaped(group) + "\n";
    report.json.set("groups", ost::OSTArray(groups.begin(), groups.end()));
    return report;
}

Outcome systemPath(const Arguments& arguments) {
    const auto identifier = arguments.value(ofIdentifierOption.name);
    const auto group = arguments.value(groupOption.name);
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto path = OST_TRY(orFailure(group ? systemGroupContainerPath(connection, *group, identifier)
                                              : systemContainerPath(connection, identifier)));
    Report report;
    report.text = escaped(path) + "\n";
    report.json.set("path", path);
    return report;
}

std::string paragraph(std::initializer_list<std::string_view> lines) {
    std::string text;
    for (const auto line : lines)
        text.append(text.empty() ? "" : "\n").append(line);
    return text;
}

} // namespace

std::vector<Command> codeSigningCommands() {
    static const std::string aboutRegistering = paragraph({ofInformation, propertyLists});
    static const std::string aboutShowing = paragraph({ofInformation, inJSON});
    return {
        {"codesign register",
         "registers what an identifier is entitled to",
         {identifierOperand},
         {infoOption, optionsOption, classOption, parentOption, placeholderOption, byCallerOption},
         aboutRegistering,
         registerInfo,
         R"({"registered": "string"})"},
        {"codesign show",
         "shows what is registered and counts",
         {identifierOperand},
         {},
         aboutShowing,
         show,
         R"({"*": "any"})"},
        {"codesign remove",
         "removes what is registered",
         {identifierOperand},
         {},
         "",
         remove,
         R"({"removed": "string"})"},
        {"codesign invalidate",
         "invalidates what has lost its bundle container",
         {},
         {},
         "",
         invalidate,
         R"({"invalidated": "boolean"})"},
        {"groups paths",
         "finds or makes the group containers of an identifier",
         {},
         {userOption, ofIdentifierOption, systemOption},
         "",
         groupPaths,
         R"({"paths": {"*": "string"}})"},
        {"groups ids",
         "lists the application groups of an identifier",
         {},
         {userOption, ofIdentifierOption},
         "",
         groupIds,
         R"({"groups": ["string"]})"},
        {"system path",
         "finds or makes the system container of an identifier",
         {},
         {ofIdentifierOption, groupOption},
         "",
         systemPath,
         R"({"path": "string"})"},
    };
}

} // namespace ostrand::ctl
