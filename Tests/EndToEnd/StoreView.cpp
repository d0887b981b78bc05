#include "EndToEnd/StoreView.h"

#include "files/OSTDictionaryFile.h"
#include "model/OSTMetadata.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <stdexcept>

namespace ost::test {

Containers listedContainers(ostrand::Connection& connection, ostrand::ContainerClass containerClass, bool transient) {
    const auto list = ostrand::list(connection, {.containerClass = containerClass,
                                                 .user = ost::usualUserOf(containerClass),
                                                 .identifier = {},
                                                 .transient = transient});
    if (!list)
        throw std::runtime_error("No list: " + list.error().description());
    Containers containers;
    for (const auto& [identifier, uuid] : *list)
        EXPECT_TRUE(containers.emplace(identifier, uuid.string()).second) << identifier << " is listed twice";
    return containers;
}

Containers containersOnDisk(const std::filesystem::path& classDirectory) {
    Containers containers;
    for (const auto& name : namesIn(classDirectory)) {
        const auto file = classDirectory / name / OSTMetadataFileName;
        const auto metadata = OST_dictionaryWithContentsOfURL(file.native(), OSTSmallDictionaryFileSize);
        EXPECT_TRUE(metadata) << file;
        const auto text = [&](const char* key) {
            const auto* const value = metadata ? metadata->find(key) : nullptr;
            return value && value->asString() ? *value->asString() : std::string();
        };
        EXPECT_TRUE(containers.emplace(text("OSTMetadataIdentifier"), text("OSTMetadataUUID")).second)
            << file << ": " << text("OSTMetadataIdentifier") << " has two containers";
    }
    return containers;
}

std::vector<std::string> namesIn(const std::filesystem::path& directory) {
    std::vector<std::string> names;
    std::error_code missing;
    for (const auto& entry : std::filesystem::directory_iterator(directory, missing))
        names.push_back(entry.path().filename());
    std::ranges::sort(names);
    return names;
}

std::vector<std::string> leftovers(const std::filesystem::path& image) {
    std::vector<std::string> items;
    const auto home = image / "private/var/root/Library";
    for (const auto& directory : {home / "Caches/com.tamarok.ostrandd/Staging",
                                  home / "Caches/com.tamarok.ostrandd/Dead", home / "Ostrand/Replace"})
        for (const auto& name : namesIn(directory))
            items.push_back(directory.filename() / name);
    return items;
}

} // namespace ost::test
