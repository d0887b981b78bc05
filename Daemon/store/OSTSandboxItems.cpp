#include "store/OSTSandboxItems.h"

#include "Protocol/OSTSandboxItem.h"
#include "files/OSTFileManager.h"
#include "platform/base/Log.h"
#include "platform/device/SandboxUserState.h"

namespace ost {

void OSTNoteSandboxItem(const OSTMetadata& container) {
    const auto item = OSTSandboxItemOf(container.uid, container.containerClass);
    if (!item)
        return;
    const auto directory = OSTFileManager::defaultManager().openDirectoryAtURL(container.url);
    const auto noted =
        directory
            ? platform::noteSandboxUserStateItem(item->userId, static_cast<std::uint64_t>(item->type), directory->get())
            : std::unexpected(platform::Errno(static_cast<int>(directory.error().code())));
    if (!noted)
        platform::logError("Failed to note the sandbox's item of %@ on %@ : %s", container.identifier, container.url,
                           noted.error());
}

void OSTRestoreSandboxItems(std::uint32_t userId, OSTContainerClass containerClass,
                            const std::vector<OSTMetadataRecord>& containers) {
    const auto item = OSTSandboxItemOf(userId, containerClass);
    if (!item)
        return;
    const auto type = static_cast<std::uint64_t>(item->type);
    const auto keys = platform::keysOfSandboxUserStateItems(item->userId, type);
    if (!keys)
        return; // nobody was ever moved
    for (const auto& container : containers) {
        if (keys->contains(container->identifier))
            continue;
        const auto directory = OSTFileManager::defaultManager().openDirectoryAtURL(container->url);
        if (!directory || !platform::hasNoteOfSandboxUserStateItem(directory->get()))
            continue;
        platform::logNotice("Restoring the sandbox's item of %@: %@", container->identifier, container->url);
        const auto set = platform::setSandboxUserStateItem(item->userId, type, container->identifier, container->url);
        if (!set)
            platform::logError("Failed to restore the sandbox's item of %@: %s", container->identifier, set.error());
    }
}

} // namespace ost
