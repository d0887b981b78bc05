#include "support/BareWalk.h"

#include "platform/base/FileDescriptor.h"
#include "support/Require.h"

#include <dirent.h>
#include <fcntl.h>

#include <memory>
#include <string_view>

namespace ost::benchmarks {

namespace {

void walk(const BareWalk& what, int parent, const char* name) {
    platform::FileDescriptor opened(::openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    require(static_cast<bool>(opened), name);
    what.directory(opened.get());
    const auto close = [](DIR* stream) { ::closedir(stream); };
    const std::unique_ptr<DIR, decltype(close)> stream(::fdopendir(opened.get()));
    require(static_cast<bool>(stream), "fdopendir");
    const int directory = opened.release();
    while (const dirent* const entry = ::readdir(stream.get())) {
        const std::string_view item = entry->d_name;
        if (item == "." || item == "..")
            continue;
        if (entry->d_type == DT_DIR)
            walk(what, directory, entry->d_name);
        else
            what.item(directory, entry->d_name);
    }
}

} // namespace

BareWalk BareWalk::opening(const std::function<void(int item)>& toFile,
                           const std::function<void(int directory)>& toDirectory) {
    return {.item =
                [=](int directory, const char* name) {
                    const platform::FileDescriptor item(::openat(directory, name, O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
                    require(static_cast<bool>(item), name);
                    toFile(item.get());
                },
            .directory = toDirectory};
}

void BareWalk::run(const std::filesystem::path& top) const { walk(*this, AT_FDCWD, top.c_str()); }

} // namespace ost::benchmarks
