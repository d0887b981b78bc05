#include "support/LargeTree.h"

#include "platform/base/FileDescriptor.h"
#include "support/Require.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <string>

namespace ost::benchmarks {

void makeLargeTree(const std::filesystem::path& path) {
    for (unsigned number = 0; number < directoriesOfLargeTree; ++number) {
        const auto name = path / std::to_string(number);
        std::filesystem::create_directories(name);
        const platform::FileDescriptor directory(::open(name.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        for (unsigned file = 0; file < filesOfLargeTree / directoriesOfLargeTree; ++file)
            require(::mknodat(directory.get(), std::to_string(file).c_str(), S_IFREG | 0644, 0) == 0, name);
    }
}

} // namespace ost::benchmarks
