#include "codesigning/OSTCodeSigningEntry.h"

#include "platform/base/MessageFormat.h"

namespace ost {

namespace {

constexpr const char* codeSigningInfoKey = "CodeSigningInfo";
constexpr const char* childBundleIdsKey = "ChildBundleIds";
constexpr const char* invalidKey = "Invalid";
constexpr const char* placeholderKey = "Placeholder";
constexpr const char* registeredByCallerKey = "RegisteredByCaller";
constexpr const char* dataContainerClassKey = "DataContainerClass";

bool truthValue(const OSTDictionary& dictionary, const char* key) {
    const OSTValue* const value = dictionary.find(key);
    return value && value->truthValue();
}

char yesOrNo(bool value) { return value ? 'Y' : 'N'; }

} // namespace

OSTCodeSigningEntry OSTCodeSigningEntry::withSerializedDictionary(const OSTDictionary& dictionary) {
    OSTCodeSigningEntry entry;
    if (const OSTValue* const info = dictionary.find(codeSigningInfoKey))
        entry.codeSigningInfo = info->sharedDictionary();
    if (const OSTValue* const children = dictionary.find(childBundleIdsKey); children && children->asArray()) {
        entry.childBundleIdentifiers.emplace();
        for (const auto& child : *children->asArray())
            if (const auto* const identifier = child.asString())
                entry.childBundleIdentifiers->push_back(*identifier);
    }
    entry.invalid = truthValue(dictionary, invalidKey);
    entry.placeholder = truthValue(dictionary, placeholderKey);
    entry.registeredByCaller = truthValue(dictionary, registeredByCallerKey);
    if (const OSTValue* const containerClass = dictionary.find(dataContainerClassKey))
        entry.dataContainerClass = containerClass->unsignedValue().value_or(0);
    return entry;
}

OSTCodeSigningEntry OSTCodeSigningEntry::withCachedInfo(const OSTDictionary& cached, std::uint64_t dataContainerClass) {
    OSTDictionary info = cached;
    if (const auto* const entitlements = cached.find("Entitlements"))
        info.set(OSTEntitlementsKey, OSTValue(*entitlements));
    else
        info.remove(OSTEntitlementsKey);
    return {.codeSigningInfo = std::make_shared<const OSTDictionary>(std::move(info)),
            .dataContainerClass = dataContainerClass};
}

OSTDictionary OSTCodeSigningEntry::serialize() const {
    std::vector<OSTDictionary::Entry> entries;
    entries.reserve(6);
    if (codeSigningInfo)
        entries.emplace_back(codeSigningInfoKey, codeSigningInfo);
    if (childBundleIdentifiers)
        entries.emplace_back(childBundleIdsKey,
                             OSTArray(childBundleIdentifiers->begin(), childBundleIdentifiers->end()));
    entries.emplace_back(invalidKey, invalid);
    entries.emplace_back(placeholderKey, placeholder);
    entries.emplace_back(registeredByCallerKey, registeredByCaller);
    entries.emplace_back(dataContainerClassKey, dataContainerClass);
    return OSTDictionary(std::move(entries));
}

const OSTDictionary* OSTCodeSigningEntry::entitlements() const {
    const OSTValue* const value = codeSigningInfo ? codeSigningInfo->find(OSTEntitlementsKey) : nullptr;
    return value ? value->asDictionary() : nullptr;
}

std::string OSTCodeSigningEntry::description() const {
    return platform::formatMessage(
        "<%@ invalid: %c, placeholder: %c, regByCaller: %c, dataClass: %llu, childBundles: %@, CSinfo: %@>",
        "OSTCodeSigningEntry", yesOrNo(invalid), yesOrNo(placeholder), yesOrNo(registeredByCaller), dataContainerClass,
        childBundleIdentifiers, codeSigningInfo);
}

bool operator==(const OSTCodeSigningEntry& a, const OSTCodeSigningEntry& b) {
    const bool sameInfo = a.codeSigningInfo == b.codeSigningInfo ||
                          (a.codeSigningInfo && b.codeSigningInfo && *a.codeSigningInfo == *b.codeSigningInfo);
    return sameInfo && a.childBundleIdentifiers == b.childBundleIdentifiers && a.invalid == b.invalid &&
           a.placeholder == b.placeholder && a.registeredByCaller == b.registeredByCaller &&
           a.dataContainerClass == b.dataContainerClass;
}

} // namespace ost
