#include "Client/PublicValues.h"

#include "platform/base/UUID.h"

#include <cerrno>

namespace ostrand {

namespace {

struct ToPrivate {
    template<typename T>
    ost::OSTValue operator()(const T& value) const {
        return ost::OSTValue(value);
    }
    ost::OSTValue operator()(const v1::Value::Data& value) const { return ost::OSTData{value.bytes}; }
    ost::OSTValue operator()(const v1::Value::Date& value) const { return ost::OSTDate{value.secondsSince1970}; }
    ost::OSTValue operator()(const v1::Value::Array& value) const {
        ost::OSTArray array;
        for (const auto& element : value)
            array.push_back(privateValue(element));
        return array;
    }
    ost::OSTValue operator()(const v1::Dictionary& value) const { return privateDictionary(value); }
};

struct ToPublic {
    template<typename T>
    v1::Value operator()(const T& value) const {
        return {value};
    }
    v1::Value operator()(const ost::OSTData& value) const { return {v1::Value::Data{value.bytes}}; }
    v1::Value operator()(const ost::OSTDate& value) const { return {v1::Value::Date{value.secondsSince1970}}; }
    v1::Value operator()(const std::shared_ptr<const ost::OSTArray>& value) const {
        v1::Value::Array array;
        for (const auto& element : *value)
            array.push_back(publicValue(element));
        return {std::move(array)};
    }
    v1::Value operator()(const std::shared_ptr<const ost::OSTDictionary>& value) const {
        return {publicDictionary(*value)};
    }
};

ContainerClass privateClass(v1::ContainerClass containerClass) {
    return static_cast<ContainerClass>(static_cast<std::uint64_t>(containerClass));
}

} // namespace

ost::OSTValue privateValue(const v1::Value& value) { return std::visit(ToPrivate{}, value.of); }

ost::OSTDictionary privateDictionary(const v1::Dictionary& dictionary) {
    std::vector<ost::OSTDictionary::Entry> entries;
    for (const auto& [key, value] : dictionary)
        entries.emplace_back(key, privateValue(value));
    return ost::OSTDictionary(std::move(entries));
}

v1::Value publicValue(const ost::OSTValue& value) { return std::visit(ToPublic{}, value.variant()); }

v1::Dictionary publicDictionary(const ost::OSTDictionary& dictionary) {
    v1::Dictionary out;
    for (const auto& [key, value] : dictionary)
        out.emplace(key, publicValue(value));
    return out;
}

ContainerRequest privateRequest(const v1::ContainerName& name) {
    return {privateClass(name.containerClass), name.user, name.identifier, name.transient};
}

Result<ContainerReference> privateReference(const v1::ContainerReference& container) {
    const auto uuid = ost::platform::UUID::parse(container.uuid);
    if (!uuid)
        return std::unexpected(Error::transport(EINVAL));
    return ContainerReference{privateClass(container.containerClass), container.user, container.identifier, *uuid};
}

v1::Error publicError(const Error& error) { return {static_cast<v1::Error::Kind>(error.kind), error.code}; }

} // namespace ostrand
