#pragma once

#include "platform/base/UUID.h"

#include <cstddef>
#include <cstdint>
#include <expected>
#include <iterator>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

namespace ost::platform {

/// What an item of the wire's value coding is: the subset of CBOR (RFC 8949) that the IPC service speaks.
enum class CBORType : std::uint8_t {
    unsignedNumber,
    negativeNumber,
    boolean,
    null,
    real,
    text,
    data,
    uuid,
    date,
    array,
    map,
};

/// Why bytes are no message: a reason in words, and the offset of the item at fault.
struct CBORError {
    const char* reason;
    std::size_t offset;
    [[nodiscard]] std::string description() const;
};

class CBORElements;
class CBOREntries;

/// A view of one item inside bytes that `validateCBOR` accepted. Cheap to copy; borrows the bytes, which must outlive
/// it. Each `as...` gives the value when the item is of that type, and is absent otherwise.
class CBORItem {
public:
    [[nodiscard]] CBORType type() const;

    [[nodiscard]] std::optional<std::uint64_t> asUnsigned() const;
    /// Either integer form, when the value fits.
    [[nodiscard]] std::optional<std::int64_t> asSigned() const;
    [[nodiscard]] std::optional<bool> asBoolean() const;
    [[nodiscard]] std::optional<double> asReal() const;
    [[nodiscard]] std::optional<std::string_view> asText() const;
    [[nodiscard]] std::optional<std::string_view> asData() const;
    [[nodiscard]] std::optional<UUID> asUUID() const;
    /// Seconds since 1970.
    [[nodiscard]] std::optional<double> asDate() const;

    /// The number of elements of an array, of entries of a map (those with a null value counted), 0 of anything else.
    [[nodiscard]] std::size_t count() const;
    /// The elements of an array, as a range of `CBORItem`; of anything else none.
    [[nodiscard]] CBORElements elements() const;
    /// The entries of a map, as a range of `CBOREntry`, without those whose value is null; of anything else none.
    [[nodiscard]] CBOREntries entries() const;
    /// The value of `key` in a map; absent when the key is missing, its value is null, or this is no map.
    [[nodiscard]] std::optional<CBORItem> find(std::string_view key) const;

    /// The view of a payload that `validateCBOR` accepted before, for its owner, which may have moved the bytes since.
    [[nodiscard]] static CBORItem ofValid(std::string_view payload) { return CBORItem(payload.data()); }

    /// The item's own encoded bytes.
    [[nodiscard]] std::string_view bytes() const;

private:
    friend class CBORElements;
    friend class CBOREntries;
    friend std::expected<CBORItem, CBORError> validateCBOR(std::string_view);
    explicit CBORItem(const char* head) : _head(head) {}

    const char* _head; ///< the initial byte; validation is why no end is needed
};

struct CBOREntry {
    std::string_view key;
    CBORItem value;
};

/// How deep arrays and maps may lie in each other, the payload's own map being the first: deeper than any message,
/// shallow enough for recursive readers.
inline constexpr std::size_t CBORMaximumDepth = 64;

/// Checks that `payload` is exactly one well-formed map of the wire's subset and gives the view of it: definite
/// lengths, arrays and maps at most `CBORMaximumDepth` deep, unique text keys, valid UTF-8 without NUL, tag 37 around
/// 16 bytes, tag 1 around a number, nothing after the item. Costs time in proportion to the payload (times its
/// logarithm for keys), little memory, and nothing for lengths that are merely claimed.
[[nodiscard]] std::expected<CBORItem, CBORError> validateCBOR(std::string_view payload);

/// The elements of an array, in order. A forward range.
class CBORElements {
public:
    class Iterator {
    public:
        using difference_type = std::ptrdiff_t;
        using value_type = CBORItem;

        Iterator() = default;
        CBORItem operator*() const { return CBORItem(_head); }
        Iterator& operator++();
        Iterator operator++(int) { return std::exchange(*this, std::next(*this)); }
        bool operator==(const Iterator& other) const { return _left == other._left; }

    private:
        friend class CBORElements;
        Iterator(const char* head, std::uint64_t left) : _head(head), _left(left) {}
        const char* _head = nullptr;
        std::uint64_t _left = 0; ///< elements from here on
    };

    [[nodiscard]] Iterator begin() const { return {_first, _count}; }
    [[nodiscard]] Iterator end() const { return {}; }

private:
    friend class CBORItem;
    CBORElements(const char* first, std::uint64_t count) : _first(first), _count(count) {}
    const char* _first;
    std::uint64_t _count;
};

/// The entries of a map, in the order they were written, without those whose value is null. A forward range.
class CBOREntries {
public:
    class Iterator {
    public:
        using difference_type = std::ptrdiff_t;
        using value_type = CBOREntry;

        Iterator() = default;
        CBOREntry operator*() const;
        Iterator& operator++();
        Iterator operator++(int) { return std::exchange(*this, std::next(*this)); }
        bool operator==(const Iterator& other) const { return _left == other._left; }

    private:
        friend class CBOREntries;
        Iterator(const char* head, std::uint64_t left) : _head(head), _left(left) { _skipNulls(); }
        void _skipNulls();
        const char* _head = nullptr; ///< the key
        std::uint64_t _left = 0;     ///< entries from here on
    };

    [[nodiscard]] Iterator begin() const { return {_first, _count}; }
    [[nodiscard]] Iterator end() const { return {}; }

private:
    friend class CBORItem;
    CBOREntries(const char* first, std::uint64_t count) : _first(first), _count(count) {}
    const char* _first;
    std::uint64_t _count;
};

/// Appends items to a string: definite lengths, the shortest form of every integer and length, reals in 64 bits. The
/// caller writes as many items after `beginArray(count)`, and as many pairs of key and value after `beginMap(count)`,
/// as announced, and every key once. Texts must be valid UTF-8 without NUL. Borrows the string.
class CBOREncoder {
public:
    explicit CBOREncoder(std::string& out) : _out(out) {}

    void beginMap(std::uint64_t count);
    void beginArray(std::uint64_t count);
    void key(std::string_view key) { text(key); }

    void unsignedNumber(std::uint64_t value);
    void signedNumber(std::int64_t value);
    void boolean(bool value);
    void null();
    void real(double value);
    void text(std::string_view value);
    void data(std::string_view bytes);
    void uuid(const UUID& value);
    /// Seconds since 1970; written as an integer when it is one.
    void date(double secondsSince1970);
    /// A copy of an item that was received.
    void item(const CBORItem& value) { _out.append(value.bytes()); }

private:
    void _head(unsigned majorType, std::uint64_t argument);

    std::string& _out;
};

} // namespace ost::platform
