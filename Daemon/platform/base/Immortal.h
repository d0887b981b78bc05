#pragma once

#include <concepts>
#include <cstddef>
#include <functional>
#include <new>
#include <type_traits>

namespace ost::platform {

/// An object that is made once and never destroyed, for a static variable that other threads may still use while the
/// process ends: `static Immortal log([] { return Log(); });`.
template<typename Object>
class Immortal {
public:
    template<std::invocable Make>
    explicit Immortal(Make make) {
        ::new (static_cast<void*>(_storage)) Object(make());
    }
    Immortal(const Immortal&) = delete;
    Immortal& operator=(const Immortal&) = delete;

    [[nodiscard]] Object& operator*() noexcept { return *std::launder(reinterpret_cast<Object*>(_storage)); }

private:
    alignas(Object) std::byte _storage[sizeof(Object)];
};

template<std::invocable Make>
Immortal(Make) -> Immortal<std::invoke_result_t<Make>>;

} // namespace ost::platform
