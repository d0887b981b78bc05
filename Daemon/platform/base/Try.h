#pragma once

#include <expected>
#include <utility>

/// Yields the value of an `std::expected`, or returns its error from the enclosing function.
#define OST_TRY(...)                                                                                                   \
    __extension__({                                                                                                    \
        auto ostResult_ = (__VA_ARGS__);                                                                               \
        if (!ostResult_) [[unlikely]]                                                                                  \
            return std::unexpected(std::move(ostResult_).error());                                                     \
        *std::move(ostResult_);                                                                                        \
    })
