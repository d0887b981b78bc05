#include "support/InsideImage.h"

#include "Support/ChildProcess.h"
#include "platform/base/FileDescriptor.h"
#include "support/Require.h"

#include <fcntl.h>
#include <unistd.h>

namespace ost::benchmarks {

double secondsInside(const std::filesystem::path& image, const std::function<double()>& work) {
    int ends[2];
    require(::pipe2(ends, O_CLOEXEC) == 0, "pipe");
    const platform::FileDescriptor result(ends[0]);
    platform::FileDescriptor writer(ends[1]);
    test::ChildProcess process([&] {
        if (::chroot(image.c_str()) != 0 || ::chdir("/") != 0)
            return 1;
        const double seconds = work();
        return ::write(writer.get(), &seconds, sizeof seconds) == sizeof seconds ? 0 : 1;
    });
    writer.reset();
    double seconds = 0;
    require(::read(result.get(), &seconds, sizeof seconds) == sizeof seconds && process.wait() == 0, image);
    return seconds;
}

} // namespace ost::benchmarks
