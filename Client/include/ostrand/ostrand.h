#pragma once

// The container daemon's client library. This header needs nothing but the standard library (C++23).
//
//     ostrand::v1::Client client;
//     const auto container = client.create({.identifier = "com.example.a"}); // of the class dataApplication
//     if (!container)
//         std::cerr << container.error().description() << '\n';
//
// What the daemon may answer to each request, `docs/protocol.md` says. Nothing here throws.

#include <chrono>
#include <cstdint>
#include <expected>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

namespace ostrand::v1 {

/// Why a request gave no result.
struct Error {
    enum class Kind : std::uint8_t {
        refused,   ///< the daemon closed the connection: the program may not ask that
        failed,    ///< the daemon carried it out and it failed; `code` is its answer
        transport, ///< the daemon could not be reached or understood, or the request not be made; `code` is an errno
    };

    Kind kind = Kind::transport;
    std::uint64_t code = 0; ///< 0 when refused

    /// The error in words; empty when there is no memory for them.
    [[nodiscard]] std::string description() const noexcept;
    friend bool operator==(const Error&, const Error&) = default;
};

template<typename T>
using Result = std::expected<T, Error>;

/// The kinds of container.
enum class ContainerClass : std::uint64_t {
    bundleApplication = 1,
    dataApplication = 2,
    bundleLoomworkPlugin = 3,
    dataLoomworkPlugin = 4,
    bundleVPNPlugin = 5,
    dataVPNPlugin = 6,
    sharedAppGroup = 7,
    bundleFramework = 8,
    dataVexelService = 9,
    dataInternalDaemon = 10,
    dataTempDir = 11,
    dataSystem = 12,
    sharedSystemGroup = 13,
};

/// In the place of a user id: the caller's own when it is above 500, else the device's user.
inline constexpr std::uint64_t currentUser = 1;

/// A property-list value.
struct Value {
    struct Data {
        std::string bytes;
        friend bool operator==(const Data&, const Data&) = default;
    };
    struct Date {
        double secondsSince1970 = 0;
        friend bool operator==(const Date&, const Date&) = default;
    };
    using Array = std::vector<Value>;
    using Dictionary = std::map<std::string, Value>;

    /// Integers that are not negative come as unsigned ones.
    std::variant<bool, std::int64_t, std::uint64_t, double, std::string, Data, Date, Array, Dictionary> of;

    friend bool operator==(const Value&, const Value&) = default;
};
using Dictionary = Value::Dictionary;

/// A container by name.
struct ContainerName {
    ContainerClass containerClass = ContainerClass::dataApplication;
    std::uint64_t user = currentUser;
    std::optional<std::string> identifier = {}; ///< absent, where that is allowed: the program's own
    bool transient = false;
};

/// A container as it is found.
struct Container {
    std::string identifier;
    std::string uuid; ///< "30EE8F2B-1C83-4E0A-96B4-0D6D9B6B3A43"
    std::string path; ///< of the device; the host finds it below the device's directory
    bool existed = false;
};

struct ListedContainer {
    std::string identifier, uuid;
};

/// One container for certain.
struct ContainerReference {
    ContainerClass containerClass = ContainerClass::dataApplication;
    std::uint64_t user = currentUser;
    std::string identifier;
    std::string uuid;
};

struct Metadata {
    std::string path;
    bool transient = false;
    Dictionary info;
};

struct Registration {
    std::string identifier;
    Dictionary info;    ///< its "com.tamarok.Ostrand.Entitlements" holds the entitlements
    Dictionary options; ///< such as "com.tamarok.Ostrand.DataContainerClass"
};

struct DataProtection {
    ContainerClass containerClass = ContainerClass::dataApplication;
    std::uint64_t user = currentUser;
    std::string identifier;
    std::int64_t protectionClass = 0;
    bool outsideDeveloper = false;
    bool retryIfLocked = false;
};

using GroupPaths = std::map<std::string, std::string>;

/// A client of one device's daemon.
///
/// It connects when it is first asked for something, and anew when the daemon has ended since. Requests that change
/// nothing when they are made twice are made again when the daemon ends before it answers; of the others the caller
/// learns that the answer never came (`refused`, or `transport` with ECONNRESET), and looks what was done.
///
/// Every function waits for its answer, or for the time limit (`transport` with ETIMEDOUT), after which the connection
/// is given up. Threads: one at a time. An identifier that is absent is the program's own. A UUID that is none is
/// `transport` with EINVAL; want of memory is `transport` with ENOMEM.
class Client {
public:
    struct Options {
        std::string device = "/"; ///< the device's directory
        std::optional<std::chrono::milliseconds> timeout = {};
    };

    Client() noexcept;
    explicit Client(const Options& options) noexcept;
    Client(Client&&) noexcept;
    Client& operator=(Client&&) noexcept;
    ~Client();

    // Containers
    [[nodiscard]] Result<Container> create(const ContainerName& name) noexcept;
    [[nodiscard]] Result<Container> lookUp(const ContainerName& name) noexcept;
    [[nodiscard]] Result<std::vector<ListedContainer>>
    list(ContainerClass containerClass, std::uint64_t user = currentUser, bool transient = false) noexcept;
    [[nodiscard]] Result<void> remove(const ContainerName& name) noexcept;
    [[nodiscard]] Result<void> stageForDeletion(const std::vector<ContainerReference>& containers) noexcept;
    [[nodiscard]] Result<void> destroyDeathRow() noexcept;
    [[nodiscard]] Result<void> replace(const std::optional<ContainerReference>& oldContainer,
                                       const ContainerReference& newContainer) noexcept;
    [[nodiscard]] Result<void> wipe(const ContainerName& name) noexcept;
    /// Of those that the program's entitlement lists.
    [[nodiscard]] Result<void> wipePlugIn(const std::string& identifier, std::uint64_t user = currentUser) noexcept;

    // What a container carries
    [[nodiscard]] Result<Value> infoValue(const ContainerReference& container, const std::string& key) noexcept;
    /// Without a value, the key is removed.
    [[nodiscard]] Result<void> setInfoValue(const ContainerReference& container, const std::string& key,
                                            const std::optional<Value>& value) noexcept;
    [[nodiscard]] Result<Metadata> metadata(const ContainerReference& container) noexcept;
    [[nodiscard]] Result<void> restoreStructure(const ContainerReference& container) noexcept;
    [[nodiscard]] Result<void> renameDirectory(const ContainerReference& container) noexcept;
    /// The bytes that it takes on disk.
    [[nodiscard]] Result<std::uint64_t> diskUsage(const ContainerReference& container) noexcept;
    [[nodiscard]] Result<void> setDataProtection(const DataProtection& change) noexcept;

    // Code signing and groups
    [[nodiscard]] Result<void> registerCodeSigning(const Registration& registration) noexcept;
    [[nodiscard]] Result<void> removeCodeSigning(const std::string& identifier) noexcept;
    [[nodiscard]] Result<Dictionary> codeSigningInfo(const std::string& identifier) noexcept;
    [[nodiscard]] Result<void> invalidateCodeSigningWithoutBundle() noexcept;
    [[nodiscard]] Result<GroupPaths> groupContainerPaths(std::uint64_t user = currentUser,
                                                         const std::optional<std::string>& identifier = {}) noexcept;
    [[nodiscard]] Result<std::vector<std::string>>
    groupIdentifiers(std::uint64_t user = currentUser, const std::optional<std::string>& identifier = {}) noexcept;
    [[nodiscard]] Result<std::string> systemContainerPath(const std::optional<std::string>& identifier = {}) noexcept;
    [[nodiscard]] Result<GroupPaths>
    systemGroupContainerPaths(const std::optional<std::string>& identifier = {}) noexcept;
    [[nodiscard]] Result<std::string>
    systemGroupContainerPath(const std::string& group, const std::optional<std::string>& identifier = {}) noexcept;

    // Maintenance
    [[nodiscard]] Result<void> migrate() noexcept;
    /// Of internal builds alone.
    [[nodiscard]] Result<void> retryTest(std::uint64_t crashes, std::uint64_t user = currentUser) noexcept;

private:
    struct State;
    std::unique_ptr<State> _state; ///< empty for want of memory
};

} // namespace ostrand::v1
