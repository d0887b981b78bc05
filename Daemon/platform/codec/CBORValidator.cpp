#include "platform/base/MessageFormat.h"
#include "platform/base/Unicode.h"
#include "platform/codec/CBOR.h"
#include "platform/codec/CBORFormat.h"

#include <algorithm>
#include <array>
#include <functional>
#include <limits>
#include <memory_resource>
#include <span>
#include <vector>

namespace ost::platform {

using namespace cbor;

namespace {

/// The check of one payload: one pass, with a stack of the arrays and maps that are open.
class Validator {
public:
    explicit Validator(std::string_view bytes)
        : _begin(bytes.data()), _at(_begin), _end(_begin + bytes.size()), _keys(&_memory) {
        _keys.reserve(keysOnStack / 2);
    }

    std::expected<void, CBORError> run() {
        if (!_root())
            return std::unexpected(_error);
        return {};
    }

private:
    static constexpr std::size_t keysOnStack = 64; ///< no ordinary request has more, so checking it allocates nothing
    static constexpr std::size_t fewKeys = 16;     ///< up to here, comparing each with each is the fastest

    struct Level {
        std::uint64_t itemsLeft; ///< keys and values counted each
        std::size_t firstKey;    ///< index into _keys
        bool isMap;
    };

    /// A key is kept as 32 bits of hash above its 32-bit offset: small, and equal keys sort side by side.
    using Key = std::uint64_t;
    [[nodiscard]] std::string_view _text(Key key) const { return stringAt(_begin + static_cast<std::uint32_t>(key)); }
    [[nodiscard]] static std::uint64_t _hash(Key key) { return key >> 32; }

    // Each check gives whether all is well; what is not is in _error. A message has many items, and this is what costs
    // least.
    [[nodiscard]] bool _fail(const char* at, const char* reason) {
        _error = {reason, static_cast<std::size_t>(at - _begin)};
        return false;
    }
    [[nodiscard]] std::size_t _left() const { return static_cast<std::size_t>(_end - _at); }

    [[nodiscard]] bool _root() {
        if (static_cast<std::size_t>(_end - _begin) > std::numeric_limits<std::uint32_t>::max())
            return _fail(_begin, "too long");
        if (_at == _end || static_cast<std::uint8_t>(*_at) >> 5 != mapItem)
            return _fail(_at, "not a map");
        do {
            if (!_item() || !_closeFinishedLevels())
                return false;
        } while (_depth > 0);
        return _at == _end || _fail(_at, "bytes after the item");
    }

    [[nodiscard]] bool _readHead(Head& head) {
        if (_at == _end)
            return _fail(_at, "ends early");
        const unsigned information = static_cast<std::uint8_t>(*_at) & 0x1fU;
        if (information > eightByteArgument)
            return _fail(_at, "indefinite length or reserved encoding");
        if (_left() < 1 + argumentWidth(information))
            return _fail(_at, "ends early");
        head = readHead(_at);
        _at = head.next;
        return true;
    }

    /// Checks one item, opening a level for an array or map.
    [[nodiscard]] bool _item() {
        const char* const start = _at;
        Head head;
        if (!_readHead(head))
            return false;
        if (_depth > 0) {
            auto& level = _levels[_depth - 1];
            const bool isKey = level.isMap && level.itemsLeft % 2 == 0;
            --level.itemsLeft;
            if (isKey)
                return _key(start, head);
        }
        switch (head.major) {
        case byteString:
        case textString:
            return _string(start, head);
        case arrayItem:
        case mapItem:
            return _open(start, head);
        case tag:
            return _tagged(start, head);
        case simple:
            return _simple(start, head);
        default:
            return true;
        }
    }

    [[nodiscard]] bool _simple(const char* start, const Head& head) {
        const bool isFloat = head.information >= halfFloat;
        const bool isKnown = head.information >= falseValue && head.information <= nullValue;
        return isFloat || isKnown || _fail(start, "unknown simple value");
    }

    [[nodiscard]] bool _string(const char* start, const Head& head) {
        if (head.argument > _left())
            return _fail(start, "ends early");
        if (head.major == textString && !isValidText({_at, head.argument}))
            return _fail(start, "invalid text");
        _at += head.argument;
        return true;
    }

    [[nodiscard]] bool _key(const char* start, const Head& head) {
        if (head.major != textString)
            return _fail(start, "a key that is no text");
        if (!_string(start, head))
            return false;
        const std::uint64_t hash = std::hash<std::string_view>{}({head.next, head.argument});
        _keys.push_back(hash << 32 | static_cast<std::uint32_t>(start - _begin));
        return true;
    }

    [[nodiscard]] bool _open(const char* start, const Head& head) {
        const bool isMap = head.major == mapItem;
        // Every item takes a byte at least, so a claim beyond that is refused before anything is done for it.
        if (head.argument > _left() / (isMap ? 2 : 1))
            return _fail(start, "ends early");
        if (_depth == CBORMaximumDepth)
            return _fail(start, "nested too deeply");
        _levels[_depth++] = {head.argument * (isMap ? 2 : 1), _keys.size(), isMap};
        return true;
    }

    [[nodiscard]] bool _tagged(const char* start, const Head& head) {
        Head content;
        if (!_readHead(content))
            return false;
        if (head.argument == uuidTag) {
            if (content.major != byteString || content.argument != UUID::size)
                return _fail(start, "a UUID that is not 16 bytes");
            return _string(start, content);
        }
        if (head.argument != dateTag)
            return _fail(start, "unknown tag");
        return content.major <= negativeInteger || realValue(content) || _fail(start, "a date that is no number");
    }

    [[nodiscard]] bool _closeFinishedLevels() {
        while (_depth > 0 && _levels[_depth - 1].itemsLeft == 0) {
            const auto first = _levels[--_depth].firstKey;
            if (const auto twice = _keyStandingTwice(std::span(_keys).subspan(first)))
                return _fail(_begin + static_cast<std::uint32_t>(*twice), "a key stands twice");
            _keys.resize(first);
        }
        return true;
    }

    [[nodiscard]] std::optional<Key> _keyStandingTwice(std::span<Key> keys) const {
        if (keys.size() > fewKeys)
            return _keyStandingTwiceAmongMany(keys);
        for (std::size_t i = 1; i < keys.size(); ++i)
            for (std::size_t j = 0; j < i; ++j)
                if (_hash(keys[i]) == _hash(keys[j]) && _text(keys[i]) == _text(keys[j]))
                    return keys[i];
        return std::nullopt;
    }

    /// Sorts by hash, then keys of equal hash by text, so that no choice of keys costs more than sorting does.
    [[nodiscard]] std::optional<Key> _keyStandingTwiceAmongMany(std::span<Key> keys) const {
        std::ranges::sort(keys);
        for (auto run = keys.begin(); run != keys.end();) {
            const auto end = std::find_if(run, keys.end(), [&](Key key) { return _hash(key) != _hash(*run); });
            if (end - run > 1) {
                const auto text = [&](Key key) { return _text(key); };
                std::ranges::sort(run, end, {}, text);
                if (const auto twice = std::ranges::adjacent_find(run, end, {}, text); twice != end)
                    return *twice;
            }
            run = end;
        }
        return std::nullopt;
    }

    const char* const _begin;
    const char* _at;
    const char* const _end;
    CBORError _error{};
    std::size_t _depth = 0;
    std::array<Level, CBORMaximumDepth> _levels; // the first _depth are in use
    std::array<std::byte, keysOnStack * sizeof(Key)> _storage;
    std::pmr::monotonic_buffer_resource _memory{_storage.data(), _storage.size()};
    std::pmr::vector<Key> _keys; ///< of all open maps, those of an inner one behind those of the outer
};

} // namespace

std::string CBORError::description() const { return formatMessage("%s at byte %llu", reason, offset); }

std::expected<CBORItem, CBORError> validateCBOR(std::string_view payload) {
    if (const auto valid = Validator(payload).run(); !valid)
        return std::unexpected(valid.error());
    return CBORItem(payload.data());
}

} // namespace ost::platform
