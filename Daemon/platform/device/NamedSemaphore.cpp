#include "platform/device/NamedSemaphore.h"

#include "platform/base/PassingReason.h"

#include <fcntl.h>
#include <semaphore.h>

#include <cerrno>

namespace ost::platform {

std::expected<bool, Errno> namedSemaphoreExists(const std::string& name) {
    auto* semaphore = ::sem_open(("/" + name).c_str(), 0);
    if (semaphore == SEM_FAILED && speaksOfTheItem(errno))
        return false;
    if (semaphore == SEM_FAILED)
        return std::unexpected(errno);
    ::sem_close(semaphore);
    return true;
}

std::expected<void, Errno> createNamedSemaphore(const std::string& name, mode_t mode, unsigned initialValue) {
    auto* semaphore = ::sem_open(("/" + name).c_str(), O_CREAT, mode, initialValue);
    if (semaphore == SEM_FAILED)
        return std::unexpected(errno);
    ::sem_close(semaphore);
    return {};
}

} // namespace ost::platform
