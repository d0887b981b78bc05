#include "JSONForm.h"

#include "Client/ctl/Commands.h"
#include "Client/ctl/JSON.h"

namespace ost::test {

namespace {

std::string typeOf(const OSTValue& value) {
    if (value.asString())
        return "string";
    if (std::holds_alternative<bool>(value.variant()))
        return "boolean";
    return value.asDictionary() || value.asArray() ? "container" : "number";
}

std::string faultOf(const OSTValue& value, const OSTValue& form);

std::string faultOfDictionary(const OSTDictionary& dictionary, const OSTDictionary& form) {
    const auto formOf = [&](const std::string& key) {
        for (const auto& spelling : {key, key + "?", std::string("*")})
            if (const auto* const found = form.find(spelling))
                return found;
        return static_cast<const OSTValue*>(nullptr);
    };
    for (const auto& [key, value] : dictionary) {
        const auto* const expected = formOf(key);
        if (const auto fault = expected ? faultOf(value, *expected) : "not promised"; !fault.empty())
            return key + ": " + fault;
    }
    for (const auto& [key, expected] : form)
        if (key != "*" && !key.ends_with('?') && !dictionary.find(key))
            return key + ": missing";
    return {};
}

std::string faultOf(const OSTValue& value, const OSTValue& form) {
    if (const auto* const type = form.asString())
        return *type == "any" || *type == typeOf(value) ? "" : typeOf(value) + " instead of " + *type;
    if (const auto* const dictionary = form.asDictionary())
        return value.asDictionary() ? faultOfDictionary(*value.asDictionary(), *dictionary) : "no dictionary";
    if (!value.asArray())
        return "no array";
    for (const auto& element : *value.asArray())
        if (auto fault = faultOf(element, form.asArray()->front()); !fault.empty())
            return fault;
    return {};
}

} // namespace

std::string faultOfJSON(const std::vector<std::string>& words, const std::string& output) {
    using namespace ostrand::ctl;
    const std::vector<std::string_view> views(words.begin(), words.end());
    const auto parsed = parseCommandLine(commandTable(), views);
    const auto form = parseJSON(std::get<Invocation>(parsed).command->json);
    for (std::size_t begin = 0, end = 0; (end = output.find('\n', begin)) != output.npos; begin = end + 1) {
        const auto value = parseJSON(output.substr(begin, end - begin));
        if (const auto fault = value ? faultOf(*value, *form) : "no JSON"; !fault.empty())
            return fault;
    }
    return {};
}

} // namespace ost::test
