#pragma once

#include "files/OSTTreeCursor.h"
#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <cstdint>
#include <string>
#include <string_view>

namespace ost {

/// What a shared walk does with what it finds. Two threads call it at once. An exception ends the walk.
class OSTTreeVisitor {
public:
    enum class Next : std::uint8_t { goOn, enter, stop };

    /// An item of a directory, the cursor's current one. Answers whether it is a directory that is to be entered.
    [[nodiscard]] virtual Next visitItem(const OSTTreeCursor& cursor) = 0;
    /// A directory that has been opened, the top one included, before its first item.
    virtual void visitDirectory([[maybe_unused]] int directory, [[maybe_unused]] const std::string& path) {}
    /// A directory that cannot be opened.
    [[nodiscard]] virtual Next cannotOpen(const std::string& path, platform::Errno error) = 0;
    /// A directory that cannot be read on; `number` counts the items that were read.
    [[nodiscard]] virtual Next cannotRead(const std::string& path, std::uint64_t number, platform::Errno error) = 0;

protected:
    ~OSTTreeVisitor() = default;
};

/// Visits everything below the directory `top`, open for reading, to any depth; paths begin with `path`. A second
/// thread takes part in a large tree, so directories come in no order; an item comes after its directory. Neither
/// symbolic links nor mount points are entered. Both threads together hold a few dozen descriptors.
void OSTWalkShared(platform::FileDescriptor top, std::string_view path, OSTTreeVisitor& visitor);

} // namespace ost
