#pragma once

#include <chrono>
#include <cstdint>
#include <expected>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace ostrand {

/// What the kernel's sandbox tells of a process that is about to start in a container. Identifiers hold no NUL.
struct ProcessDescription {
    std::optional<std::string> codeSigningIdentifier = std::nullopt;
    std::optional<std::string> containerIdentifier = std::nullopt; ///< absent: the code-signing identifier
    std::uint32_t user = 0;
    bool isPlugin = false;
    std::vector<std::string> groups = {}; ///< identifiers of application groups
    std::optional<std::string> systemContainer = std::nullopt;
    std::vector<std::string> systemGroups = {};
};

/// Where the containers of such a process lie: paths of the device.
struct ProcessContainers {
    using Groups = std::vector<std::pair<std::string, std::string>>; ///< identifier and path, in the order asked for

    std::optional<std::string> home, data, temporary;
    Groups groups = {};
    std::optional<std::string> system = std::nullopt;
    Groups systemGroups = {};
};

/// Why there is no answer.
struct UpcallError {
    enum class Kind : std::uint8_t {
        transport, ///< the daemon could not be reached or understood; `code` is an errno
        refused,   ///< the daemon's return code
        notFound,  ///< a container could not be looked up or made; the daemon's log says which, and why
    };

    Kind kind;
    std::int64_t code = 0;

    [[nodiscard]] std::string description() const;
    friend bool operator==(const UpcallError&, const UpcallError&) = default;
};

/// Asks a device's daemon, as the kernel does, for the containers of a process; those that are missing are made.
/// `device` is the device's directory as this process sees it. Only root gets an answer. Waits for it at most `timeout`
/// (absent: without limit), then fails with ETIMEDOUT; the daemon may make the containers later all the same.
[[nodiscard]] std::expected<ProcessContainers, UpcallError>
processContainers(const std::string& device, const ProcessDescription& process,
                  std::optional<std::chrono::milliseconds> timeout = {});

} // namespace ostrand
