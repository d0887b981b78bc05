#include "EndToEnd/DeviceView.h"

#include "Client/Attributes.h"
#include "Client/CodeSigning.h"
#include "Client/Containers.h"
#include "EndToEnd/StoreView.h"
#include "platform/codec/PropertyList.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <filesystem>
#include <stdexcept>

namespace ost::test {

using enum OSTContainerClass;
using ostrand::Connection;

namespace {

namespace fs = std::filesystem;

constexpr std::array classes{dataApplication, bundleApplication, bundleFramework,
                             sharedAppGroup,  dataSystem,        sharedSystemGroup};
constexpr const char* recordSuffix = ", its values";

/// The sandbox knows of no other place.
void expectItem(const GatedDevice& device, const std::string& identifier, const std::string& path) {
    const auto item = device.onHost("/private/var/db/sandbox-state/501/1") / identifier;
    if (fs::is_symlink(item)) {
        EXPECT_EQ(fs::read_symlink(item), path);
    }
}

/// Returns where it lies.
fs::path lookAtContainer(DeviceView& view, const GatedDevice& device, Connection& connection,
                         const ostrand::ContainerReference& container) {
    const auto& identifier = container.identifier;
    const auto found = ostrand::metadata(connection, container);
    if (!found)
        throw std::runtime_error("No metadata of " + identifier + ": " + found.error().description());
    const auto place = device.onHost(found->path);
    const auto name = std::string(OSTContainerClassPathComponents[static_cast<unsigned>(container.containerClass)])
                          .append(" ")
                          .append(identifier);
    view[name] = found->path + " " + container.uuid.string() + "\n" + tree(place);
    view[name + recordSuffix] = found->info.description();
    for (const auto& entry : fs::recursive_directory_iterator(place))
        view[name + ", the class of " + entry.path().lexically_relative(place).string()] =
            recordedProtectionClass(entry).value_or("");
    if (container.containerClass == dataApplication)
        expectItem(device, identifier, found->path);
    return place;
}

std::string valueIn(const DeviceView& view, const std::string& what) {
    const auto found = view.find(what);
    return found == view.end() ? "nothing" : found->second;
}

bool isPartly(const DeviceView& found, const DeviceView& before, const DeviceView& after) {
    DeviceView all = found;
    all.insert(before.begin(), before.end());
    all.insert(after.begin(), after.end());
    for (const auto& [what, anything] : all) {
        const auto value = valueIn(found, what), old = valueIn(before, what), fresh = valueIn(after, what);
        const bool isRecordedAnew = what.ends_with(recordSuffix) && before.contains(what) && value != old;
        if ((value != old && value != fresh) || (isRecordedAnew && found != after))
            return false;
    }
    return true;
}

bool hasLostNothing(const DeviceView& found, const DeviceView& before, const DeviceView& after) {
    return std::ranges::all_of(before, [&](const auto& thing) {
        const auto& [what, old] = thing;
        return valueIn(after, what) == old ? valueIn(found, what) == old
                                           : !after.contains(what) || found.contains(what);
    });
}

} // namespace

DeviceView viewOf(const GatedDevice& device) {
    auto connection = device.connect();
    DeviceView view;
    for (const auto containerClass : classes) {
        const auto listed = listedContainers(connection, containerClass, false);
        fs::path place;
        for (const auto& [identifier, uuid] : listed)
            place = lookAtContainer(
                view, device, connection,
                {containerClass, usualUserOf(containerClass), identifier, *platform::UUID::parse(uuid)});
        EXPECT_EQ(containersOnDisk(place.parent_path()), listed);
    }
    const auto registered = ostrand::codeSigningInfo(connection, "b");
    view["what is registered for b"] = registered ? registered->description() : "nothing";
    const auto library = device.onHost("/private/var/root/Library/Ostrand");
    const auto mapping = platform::parsePropertyList(readFile(library / "ost_code_signing_info.plist"));
    view["the mapping"] = mapping ? mapping->description() : "not readable";
    for (const auto& name : namesIn(library))
        view["library"] += name + "\n";
    return view;
}

std::string textOf(const DeviceView& view) {
    std::string text;
    for (const auto& [what, found] : view)
        text.append(what).append(": ").append(found).append("\n");
    return text;
}

bool mayBeLeft(Leaves leaves, const DeviceView& found, const DeviceView& before, const DeviceView& after) {
    return found == after || (leaves == Leaves::oneOfTwo && found == before) ||
           (leaves == Leaves::parts && isPartly(found, before, after)) ||
           (leaves == Leaves::aTask && hasLostNothing(found, before, after));
}

} // namespace ost::test
