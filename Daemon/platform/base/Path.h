#pragma once

#include <string>
#include <string_view>

namespace ost::platform {

/// `base` and `component` with exactly one slash between them.
[[nodiscard]] inline std::string pathByAppending(std::string_view base, std::string_view component) {
    while (base.ends_with('/'))
        base.remove_suffix(1);
    std::string path;
    path.reserve(base.size() + 1 + component.size());
    return path.append(base).append("/").append(component);
}

/// The name behind the last slash.
[[nodiscard]] inline std::string_view lastPathComponent(std::string_view path) {
    while (path.size() > 1 && path.ends_with('/'))
        path.remove_suffix(1);
    return path.substr(path.rfind('/') + 1);
}

/// The path without its last component and the slash before it; empty when nothing is left.
[[nodiscard]] inline std::string_view pathByDeletingLastComponent(std::string_view path) {
    while (path.size() > 1 && path.ends_with('/'))
        path.remove_suffix(1);
    const auto slash = path.rfind('/');
    return slash == std::string_view::npos ? std::string_view() : path.substr(0, slash);
}

[[nodiscard]] inline bool isAtOrBelow(std::string_view path, std::string_view place) {
    return path.starts_with(place) && (path.size() == place.size() || path[place.size()] == '/');
}

} // namespace ost::platform
