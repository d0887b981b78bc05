#include "service/OSTDaemon.h"

#include <sys/stat.h>

#include <csignal>
#include <cstdlib>

namespace {

constexpr int startUpFailed = 255;

/// Every thread inherits what is set here, so it comes before the first one.
void setUpProcess() {
    ::umask(0);
    ::signal(SIGPIPE, SIG_IGN);
    sigset_t ending;
    ::sigemptyset(&ending);
    ::sigaddset(&ending, SIGTERM);
    ::sigaddset(&ending, SIGINT);
    ::pthread_sigmask(SIG_BLOCK, &ending, nullptr);
}

} // namespace

int main() {
    setUpProcess();
    ost::OSTDaemon daemon;
    if (!daemon.start())
        return startUpFailed;
    daemon.run();
    return EXIT_SUCCESS;
}
