#include "Client/Attributes.h"
#include "Client/CodeSigning.h"
#include "Client/Maintenance.h"
#include "Client/PublicValues.h"
#include "platform/base/Try.h"

#include <cerrno>
#include <new>

namespace ostrand::v1 {

namespace lib = ostrand;

namespace {

/// Whether a request may be made again when nobody knows whether it was carried out.
enum class Repeatable : bool { no, yes };

/// Whether the answer never came, as far as can be told: a refusal looks the same.
bool mayBeLost(const lib::Error& error) {
    return error.kind == lib::Error::Kind::refused || error == lib::Error::transport(ECONNRESET);
}

} // namespace

struct Client::State {
    Options options;
    std::optional<Connection> connection;

    /// Makes a request, given as a function of the connection, and turns what comes of it into what callers see.
    template<typename Ask>
    auto ask(Repeatable repeatable, const Ask& request) -> decltype(request(*connection)) {
        const bool isFresh = !connection || connection->isClosed();
        if (isFresh)
            OST_TRY(_connect());
        auto answer = request(*connection);
        if (!answer && answer.error().kind != lib::Error::Kind::failed)
            connection.reset(); // what still comes on it is no answer to the next request
        // Nobody learns from a second refusal what the first has not said.
        if (answer || isFresh || repeatable == Repeatable::no || !mayBeLost(answer.error()))
            return answer;
        OST_TRY(_connect());
        return request(*connection);
    }

private:
    lib::Result<void> _connect() {
        connection.reset();
        connection = OST_TRY(Connection::open(options.device, options.timeout));
        return {};
    }
};

namespace {

/// What a function that may throw gives to callers that never see an exception.
template<typename T, typename Function>
Result<T> guarded(const Function& function) noexcept {
    try {
        auto result = function();
        if (!result)
            return std::unexpected(publicError(result.error()));
        if constexpr (std::is_void_v<T>)
            return {};
        else
            return *std::move(result);
    } catch (const std::bad_alloc&) {
        return std::unexpected(Error{Error::Kind::transport, ENOMEM});
    } catch (...) {
        return std::unexpected(Error{Error::Kind::transport, EIO});
    }
}

template<typename T, typename State, typename Request>
Result<T> asked(State* state, Repeatable repeatable, const Request& request) noexcept {
    return guarded<T>([&]() -> decltype(state->ask(repeatable, request)) {
        if (!state)
            return std::unexpected(lib::Error::transport(ENOMEM));
        return state->ask(repeatable, request);
    });
}

Container publicContainer(const lib::Container& container) {
    return {container.identifier, container.uuid.string(), container.path, container.existed};
}

lib::Result<Container> found(Connection& connection, const ContainerName& name, WhenMissing whenMissing) {
    return publicContainer(OST_TRY(lib::createOrLookup(connection, privateRequest(name), whenMissing)));
}

} // namespace

std::string Error::description() const noexcept {
    try {
        return lib::Error{static_cast<lib::Error::Kind>(kind), code}.description();
    } catch (...) {
        return {};
    }
}

Client::Client() noexcept : Client(Options()) {}

Client::Client(const Options& options) noexcept {
    try {
        _state = std::make_unique<State>(options);
    } catch (...) {
        _state = nullptr;
    }
}

Client::Client(Client&&) noexcept = default;
Client& Client::operator=(Client&&) noexcept = default;
Client::~Client() = default;

Result<Container> Client::create(const ContainerName& name) noexcept {
    return asked<Container>(_state.get(), name.transient ? Repeatable::no : Repeatable::yes,
                            [&](auto& connection) { return found(connection, name, WhenMissing::create); });
}

/// Looking a transient container up throws it away.
Result<Container> Client::lookUp(const ContainerName& name) noexcept {
    return asked<Container>(_state.get(), name.transient ? Repeatable::no : Repeatable::yes,
                            [&](auto& connection) { return found(connection, name, WhenMissing::fail); });
}

Result<std::vector<ListedContainer>> Client::list(ContainerClass containerClass, std::uint64_t user,
                                                  bool transient) noexcept {
    using Listing = std::vector<ListedContainer>;
    return asked<Listing>(_state.get(), Repeatable::yes, [&](auto& connection) -> lib::Result<Listing> {
        Listing listing;
        for (auto& each : OST_TRY(lib::list(connection, privateRequest({containerClass, user, {}, transient}))))
            listing.push_back({std::move(each.identifier), each.uuid.string()});
        return listing;
    });
}

Result<void> Client::remove(const ContainerName& name) noexcept {
    return asked<void>(_state.get(), Repeatable::no,
                       [&](auto& connection) { return lib::deleteContainer(connection, privateRequest(name)); });
}

Result<void> Client::stageForDeletion(const std::vector<ContainerReference>& containers) noexcept {
    return asked<void>(_state.get(), Repeatable::yes, [&](auto& connection) -> lib::Result<void> {
        std::vector<lib::ContainerReference> references;
        for (const auto& container : containers)
            references.push_back(OST_TRY(privateReference(container)));
        return lib::stageForDeletion(connection, references);
    });
}

Result<void> Client::destroyDeathRow() noexcept {
    return asked<void>(_state.get(), Repeatable::yes,
                       [](auto& connection) { return lib::destroyDeathRow(connection); });
}

Result<void> Client::replace(const std::optional<ContainerReference>& oldContainer,
                             const ContainerReference& newContainer) noexcept {
    return asked<void>(_state.get(), Repeatable::no, [&](auto& connection) -> lib::Result<void> {
        std::optional<lib::ContainerReference> old;
        if (oldContainer)
            old = OST_TRY(privateReference(*oldContainer));
        return lib::replace(connection, old, OST_TRY(privateReference(newContainer)));
    });
}

Result<void> Client::wipe(const ContainerName& name) noexcept {
    return asked<void>(_state.get(), Repeatable::no,
                       [&](auto& connection) { return lib::wipe(connection, privateRequest(name)); });
}

Result<void> Client::wipePlugIn(const std::string& identifier, std::uint64_t user) noexcept {
    return asked<void>(_state.get(), Repeatable::no,
                       [&](auto& connection) { return lib::wipePlugIn(connection, identifier, user); });
}

namespace {

/// A request about one container that is there for certain.
template<typename T, typename State, typename Request>
Result<T> askedOf(State* state, Repeatable repeatable, const ContainerReference& container,
                  const Request& request) noexcept {
    return asked<T>(state, repeatable,
                    [&](auto& connection) -> decltype(request(connection, lib::ContainerReference())) {
                        return request(connection, OST_TRY(privateReference(container)));
                    });
}

} // namespace

Result<Value> Client::infoValue(const ContainerReference& container, const std::string& key) noexcept {
    return askedOf<Value>(_state.get(), Repeatable::yes, container,
                          [&](auto& connection, const auto& reference) -> lib::Result<Value> {
                              return publicValue(OST_TRY(lib::infoValue(connection, reference, key)));
                          });
}

Result<void> Client::setInfoValue(const ContainerReference& container, const std::string& key,
                                  const std::optional<Value>& value) noexcept {
    return askedOf<void>(_state.get(), Repeatable::yes, container, [&](auto& connection, const auto& reference) {
        return lib::setInfoValue(connection, reference, key,
                                 value ? std::optional(privateValue(*value)) : std::nullopt);
    });
}

Result<Metadata> Client::metadata(const ContainerReference& container) noexcept {
    return askedOf<Metadata>(_state.get(), Repeatable::yes, container,
                             [](auto& connection, const auto& reference) -> lib::Result<Metadata> {
                                 const auto found = OST_TRY(lib::metadata(connection, reference));
                                 return Metadata{found.path, found.transient, publicDictionary(found.info)};
                             });
}

Result<void> Client::restoreStructure(const ContainerReference& container) noexcept {
    return askedOf<void>(_state.get(), Repeatable::yes, container, [](auto& connection, const auto& reference) {
        return lib::recreateDefaultStructure(connection, reference);
    });
}

Result<void> Client::renameDirectory(const ContainerReference& container) noexcept {
    return askedOf<void>(_state.get(), Repeatable::no, container, [](auto& connection, const auto& reference) {
        return lib::regenerateDirectoryUUID(connection, reference);
    });
}

Result<std::uint64_t> Client::diskUsage(const ContainerReference& container) noexcept {
    return askedOf<std::uint64_t>(
        _state.get(), Repeatable::yes, container,
        [](auto& connection, const auto& reference) { return lib::diskUsage(connection, reference); });
}

Result<void> Client::setDataProtection(const DataProtection& change) noexcept {
    return asked<void>(_state.get(), Repeatable::yes, [&](auto& connection) {
        return lib::setDataProtection(connection, {privateRequest({change.containerClass}).containerClass, change.user,
                                                   change.identifier, change.protectionClass, change.outsideDeveloper,
                                                   change.retryIfLocked});
    });
}

Result<void> Client::registerCodeSigning(const Registration& registration) noexcept {
    return asked<void>(_state.get(), Repeatable::yes, [&](auto& connection) {
        return lib::registerCodeSigning(connection, {registration.identifier, privateDictionary(registration.info),
                                                     privateDictionary(registration.options)});
    });
}

Result<void> Client::removeCodeSigning(const std::string& identifier) noexcept {
    return asked<void>(_state.get(), Repeatable::yes,
                       [&](auto& connection) { return lib::removeCodeSigning(connection, identifier); });
}

Result<Dictionary> Client::codeSigningInfo(const std::string& identifier) noexcept {
    return asked<Dictionary>(_state.get(), Repeatable::yes, [&](auto& connection) -> lib::Result<Dictionary> {
        return publicDictionary(OST_TRY(lib::codeSigningInfo(connection, identifier)));
    });
}

Result<void> Client::invalidateCodeSigningWithoutBundle() noexcept {
    return asked<void>(_state.get(), Repeatable::yes,
                       [](auto& connection) { return lib::invalidateCodeSigningWithoutBundle(connection); });
}

Result<GroupPaths> Client::groupContainerPaths(std::uint64_t user,
                                               const std::optional<std::string>& identifier) noexcept {
    return asked<GroupPaths>(_state.get(), Repeatable::yes,
                             [&](auto& connection) { return lib::groupContainerPaths(connection, user, identifier); });
}

Result<std::vector<std::string>> Client::groupIdentifiers(std::uint64_t user,
                                                          const std::optional<std::string>& identifier) noexcept {
    return asked<std::vector<std::string>>(_state.get(), Repeatable::yes, [&](auto& connection) {
        return lib::groupIdentifiers(connection, user, identifier);
    });
}

Result<std::string> Client::systemContainerPath(const std::optional<std::string>& identifier) noexcept {
    return asked<std::string>(_state.get(), Repeatable::yes,
                              [&](auto& connection) { return lib::systemContainerPath(connection, identifier); });
}

Result<GroupPaths> Client::systemGroupContainerPaths(const std::optional<std::string>& identifier) noexcept {
    return asked<GroupPaths>(_state.get(), Repeatable::yes,
                             [&](auto& connection) { return lib::systemGroupContainerPaths(connection, identifier); });
}

Result<std::string> Client::systemGroupContainerPath(const std::string& group,
                                                     const std::optional<std::string>& identifier) noexcept {
    return asked<std::string>(_state.get(), Repeatable::yes, [&](auto& connection) {
        return lib::systemGroupContainerPath(connection, group, identifier);
    });
}

Result<void> Client::migrate() noexcept {
    return asked<void>(_state.get(), Repeatable::yes, [](auto& connection) { return lib::migrate(connection); });
}

Result<void> Client::retryTest(std::uint64_t crashes, std::uint64_t user) noexcept {
    return asked<void>(_state.get(), Repeatable::no,
                       [&](auto& connection) { return lib::retryTest(connection, user, crashes); });
}

} // namespace ostrand::v1
