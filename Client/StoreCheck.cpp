#include "Client/StoreCheck.h"

#include "Client/Containers.h"
#include "Client/DeviceFiles.h"
#include "Protocol/OSTSandboxItem.h"
#include "platform/base/Errno.h"
#include "platform/base/FileName.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"
#include "platform/base/UUID.h"
#include "platform/device/Accounts.h"
#include "platform/device/SandboxUserState.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <map>
#include <optional>
#include <set>

namespace ostrand {

using ost::OSTDictionary;
using ost::platform::Errno;
using ost::platform::pathByAppending;
using ost::platform::UUID;

namespace {

constexpr const char* sharedContainers = "/private/var/containers";
constexpr const char* caches = "/private/var/root/Library/Caches/com.tamarok.ostrandd";
constexpr const char* library = "/private/var/root/Library/Ostrand";
constexpr const char* mappingFile = "/private/var/root/Library/Ostrand/ost_code_signing_info.plist";
constexpr const char* applicationGroups = "com.tamarok.security.application-groups";

constexpr std::size_t largestMapping = std::size_t{64} << 20U;

/// All containers of one class and user.
struct ClassDirectory {
    ContainerClass containerClass;
    std::uint32_t user;
    std::string path;
};

class Check {
public:
    Check(Connection& connection, DeviceFiles files, std::string device)
        : _connection(connection), _files(std::move(files)), _device(std::move(device)) {}

    [[nodiscard]] Result<StoreReport> run() {
        for (const auto& directory : _classDirectories())
            OST_TRY(_checkClass(directory));
        _checkSandboxItems();
        _checkMapping();
        _lookAtWaiting();
        return std::move(_report);
    }

private:
    struct Container {
        std::string path;
        std::string identifier;
        UUID uuid;
    };

    [[nodiscard]] std::vector<ClassDirectory> _classDirectories() {
        std::vector<ClassDirectory> directories;
        for (std::uint64_t number = 1; ost::isValidContainerClass(static_cast<ContainerClass>(number)); ++number) {
            const auto containerClass = static_cast<ContainerClass>(number);
            const auto component = pathComponentForContainerClass(containerClass);
            if (!ost::isPerUserClass(containerClass)) {
                const auto user = static_cast<std::uint32_t>(usualUserOf(containerClass));
                directories.push_back({containerClass, user, pathByAppending(sharedContainers, component)});
                continue;
            }
            for (const auto& account : _accounts())
                directories.push_back({containerClass, account.uid,
                                       pathByAppending(pathByAppending(account.home, "Containers"), component)});
        }
        return directories;
    }

    [[nodiscard]] std::vector<ost::platform::Account> _accounts() {
        std::vector<ost::platform::Account> accounts;
        const auto collect = [&](const ost::platform::Account& account) {
            if (account.uid > ost::OSTHighestSystemUserId)
                accounts.push_back(account);
            return false;
        };
        if (const auto read = ost::platform::accountMatching(collect, _device); read.error() != ENOENT)
            _cannotRead("/etc/passwd", read.error());
        return accounts;
    }

    [[nodiscard]] Result<void> _checkClass(const ClassDirectory& directory) {
        const auto names = _files.names(directory.path);
        if (!names) {
            _cannotRead(directory.path, names.error());
            return {};
        }
        std::map<std::string, std::vector<Container>> onDisk;
        for (const auto& name : *names)
            if (auto container = _checkItem(directory, pathByAppending(directory.path, name)))
                onDisk[container->identifier].push_back(*std::move(container));
        for (const auto& [identifier, containers] : onDisk)
            if (containers.size() > 1)
                _find(containers.back().path,
                      "one of " + std::to_string(containers.size()) + " containers of " + identifier,
                      "the daemon serves one of them; which one may change when it starts",
                      "look which one has the data, and delete the others as root while the daemon is down");
        _checkItemsOf(directory, onDisk);
        if (directory.containerClass == ContainerClass::sharedAppGroup)
            for (const auto& [identifier, containers] : onDisk)
                _groups.emplace(identifier, containers.front().path);
        _report.containers += onDisk.size();
        return _compareWithListing(directory, onDisk);
    }

    /// What an item of a class directory says that it is; none when it is no container.
    [[nodiscard]] std::optional<Container> _checkItem(const ClassDirectory& directory, const std::string& path) {
        const auto bytes = _files.content(pathByAppending(path, metadataName), largestMetadata);
        if (!bytes && bytes.error() != ENOENT && bytes.error() != ENOTDIR && bytes.error() != ELOOP) {
            _cannotRead(pathByAppending(path, metadataName), bytes.error());
            return std::nullopt;
        }
        const auto metadata = bytes ? dictionaryIn(*bytes) : std::nullopt;
        if (!metadata) {
            _find(path, "no readable metadata file", "the daemon does not see it as a container",
                  bytes ? "restore the metadata file, or remove the item" : "nothing: it goes at the next boot");
            return std::nullopt;
        }
        const auto* const identifier = metadata->find("OSTMetadataIdentifier");
        const auto* const uuid = metadata->find("OSTMetadataUUID");
        const auto parsed = uuid && uuid->asString() ? UUID::parse(*uuid->asString()) : std::nullopt;
        if (!identifier || !identifier->asString() || !parsed || !_agrees(directory, *metadata)) {
            _find(path, "metadata that does not fit its place", "the daemon does not see it as a container",
                  "restore the metadata file, or move the container to where it belongs while the daemon is down");
            return std::nullopt;
        }
        _checkOwner(directory, path);
        return Container{path, *identifier->asString(), *parsed};
    }

    [[nodiscard]] static bool _agrees(const ClassDirectory& directory, const OSTDictionary& metadata) {
        const auto numberUnder = [&](const char* key) {
            const auto* const value = metadata.find(key);
            return value ? value->unsignedValue() : std::nullopt;
        };
        const auto user = numberUnder("OSTMetadataPersona");
        return numberUnder("OSTMetadataContentClass") == static_cast<std::uint64_t>(directory.containerClass) &&
               (!user || user == directory.user);
    }

    void _checkOwner(const ClassDirectory& directory, const std::string& path) {
        const auto status = _files.status(path);
        if (!status)
            return _cannotRead(path, status.error());
        const auto owner = ost::isSystemClass(directory.containerClass) ? ost::OSTRootUserId : directory.user;
        if (status->st_uid != owner)
            _find(path, "belongs to user " + std::to_string(status->st_uid) + " instead of " + std::to_string(owner),
                  "its application may not be able to use it", "chown the directory");
        if ((status->st_mode & (S_IWGRP | S_IWOTH)) != 0 && !ost::isSystemClass(directory.containerClass))
            _find(path, "can be written by others than its owner", "others may put things into it",
                  "chmod 755 the directory");
    }

    [[nodiscard]] Result<void> _compareWithListing(const ClassDirectory& directory,
                                                   const std::map<std::string, std::vector<Container>>& onDisk) {
        std::set<std::string> listed;
        for (const auto& container :
             OST_TRY(list(_connection, {directory.containerClass, directory.user, {}, false}))) {
            listed.insert(container.identifier);
            const auto found = onDisk.find(container.identifier);
            if (found == onDisk.end() ||
                std::ranges::find(found->second, container.uuid, &Container::uuid) == found->second.end())
                _find(directory.path,
                      "no container of " + container.identifier + " with UUID " + container.uuid.string(),
                      "the daemon lists a container that is not on disk as it says",
                      "restart the daemon, which reads the directory again");
        }
        for (const auto& [identifier, containers] : onDisk)
            if (!listed.contains(identifier))
                _find(containers.front().path, "the daemon does not list " + identifier,
                      "it came into the directory behind the daemon's back",
                      "restart the daemon, which reads the directory again");
        return {};
    }

    void _checkSandboxItems() {
        const std::string top = ost::platform::sandboxStateDirectory;
        for (const auto& user : _namesOrReport(top))
            for (const auto& type : _namesOrReport(pathByAppending(top, user))) {
                const auto directory = pathByAppending(pathByAppending(top, user), type);
                for (const auto& name : _namesOrReport(directory))
                    _checkSandboxItem(pathByAppending(directory, name));
            }
    }

    void _checkSandboxItem(const std::string& item) {
        const auto target = _files.linkTarget(item);
        const auto found = target && target->starts_with('/') ? _files.status(*target) : std::unexpected(ENOENT);
        if (found && S_ISDIR(found->st_mode))
            return;
        _find(item, "points at no container", "the sandbox takes a process to a place that is not there",
              "nothing: it is set again with the container's next move, or remove it");
    }

    /// Containers that the sandbox has been told of, as a note on each says, and knows nothing of.
    void _checkItemsOf(const ClassDirectory& directory, const std::map<std::string, std::vector<Container>>& onDisk) {
        const auto item = ost::OSTSandboxItemOf(directory.user, directory.containerClass);
        if (!item)
            return;
        const auto top = std::string(ost::platform::sandboxStateDirectory) + "/" + std::to_string(item->userId) + "/" +
                         std::to_string(static_cast<std::uint64_t>(item->type));
        for (const auto& [identifier, containers] : onDisk) {
            const auto& path = containers.front().path;
            const auto container = _files.open(path, O_RDONLY | O_DIRECTORY);
            if (container && ost::platform::hasNoteOfSandboxUserStateItem(container->get()) &&
                !_files.linkTarget(pathByAppending(top, ost::platform::fileNameForKey(identifier))))
                _find(path, "no item of the sandbox says where " + identifier + " is",
                      "a process that runs in it may be kept out of it",
                      "restart the daemon, which sets the item again when it first reads the directory");
        }
    }

    void _checkMapping() {
        const auto bytes = _files.content(mappingFile, largestMapping);
        if (!bytes && bytes.error() == ENOENT)
            return;
        const auto mapping = bytes ? dictionaryIn(*bytes) : std::nullopt;
        if (!mapping) {
            _find(mappingFile, "cannot be read", "no entitlement is known, and none can be registered",
                  "restore the file, or remove it and register everything anew; then restart the daemon");
            return;
        }
        std::set<std::string> referenced;
        for (const auto& [identifier, entry] : *mapping)
            _collectGroups(identifier, entry, referenced);
        for (const auto& [group, path] : _groups)
            if (!referenced.contains(group))
                _find(path, "a group container that nobody references: " + group, "nobody is entitled to it any more",
                      "\"ostrandctl migrate\" removes such containers");
    }

    void _collectGroups(const std::string& identifier, const ost::OSTValue& entry, std::set<std::string>& referenced) {
        const auto member = [](const ost::OSTValue* value, const char* key) {
            const auto* const dictionary = value ? value->asDictionary() : nullptr;
            return dictionary ? dictionary->find(key) : nullptr;
        };
        if (!entry.asDictionary())
            _find(mappingFile, "the entry of " + identifier + " is no dictionary", "it counts for nothing",
                  "register " + identifier + " anew");
        const auto* const groups =
            member(member(member(&entry, "CodeSigningInfo"), "com.tamarok.Ostrand.Entitlements"), applicationGroups);
        if (groups && groups->asString())
            referenced.insert(*groups->asString());
        if (groups && groups->asArray())
            for (const auto& group : *groups->asArray())
                if (group.asString())
                    referenced.insert(*group.asString());
    }

    void _lookAtWaiting() {
        const std::pair<std::string, const char*> places[] = {
            {pathByAppending(caches, "Staging"), "being built or put aside"},
            {pathByAppending(library, "Replace"), "replacements to be finished at the next start"},
            {deathRowDirectory, "to be destroyed by the next pass"}};
        for (const auto& [path, what] : places)
            if (const auto count = _namesOrReport(path).size(); count > 0)
                _report.waiting.push_back(std::to_string(count) + " in " + path + ": " + what);
        const auto parked = _namesOrReport("/tmp");
        const auto count = std::ranges::count_if(
            parked, [](const std::string& name) { return UUID::parse(name) || name.starts_with("temp."); });
        if (count > 0)
            _report.waiting.push_back(std::to_string(count) + " in /tmp: parked, because they could not be destroyed");
    }

    [[nodiscard]] std::vector<std::string> _namesOrReport(const std::string& path) {
        auto names = _files.names(path);
        if (!names)
            _cannotRead(path, names.error());
        return names ? *std::move(names) : std::vector<std::string>();
    }

    void _find(std::string path, std::string what, std::string meaning, std::string repair) {
        _report.findings.push_back({std::move(path), std::move(what), std::move(meaning), std::move(repair)});
    }
    void _cannotRead(const std::string& path, Errno error) {
        _report.unreadable.push_back(path + ": " + error.description());
    }

    StoreReport _report;
    std::map<std::string, std::string> _groups; ///< application groups with a container, and its path
    Connection& _connection;
    DeviceFiles _files;
    std::string _device;
};

} // namespace

Result<StoreReport> checkStore(Connection& connection, const std::string& device) {
    auto files = DeviceFiles::of(device);
    if (!files)
        return std::unexpected(Error::transport(files.error()));
    return Check(connection, *std::move(files), device).run();
}

} // namespace ostrand
