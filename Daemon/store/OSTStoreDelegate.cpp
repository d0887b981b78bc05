#include "store/OSTStoreDelegate.h"

#include <atomic>

namespace ost {

namespace {

class Nobody final : public OSTStoreDelegate {
public:
    bool identifierHasSystemContainer(std::string_view) override { return false; }
    std::optional<std::string> wellknownContainerForId(std::string_view, OSTContainerClass) override {
        return std::nullopt;
    }
    bool containerIdIsWellknown(std::string_view, OSTContainerClass) override { return false; }
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(std::string_view) override {}
    Restoration rememberIdentifierAndItsChildren(std::string_view) override {
        return [] {};
    }
    OSTResult<void> invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view) override { return {}; }
};

constinit std::atomic<OSTStoreDelegate*> joined = nullptr;

} // namespace

OSTStoreDelegate& OSTStoreDelegate::shared() {
    static Nobody nobody;
    OSTStoreDelegate* const delegate = joined;
    return delegate ? *delegate : nobody;
}

void OSTStoreDelegate::join(OSTStoreDelegate& delegate) { joined = &delegate; }

} // namespace ost
