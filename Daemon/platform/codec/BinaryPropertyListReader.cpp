#include "platform/codec/BinaryPropertyListReader.h"

#include "platform/base/Try.h"
#include "platform/base/Unicode.h"
#include "platform/codec/BigEndian.h"
#include "platform/codec/BinaryPropertyListFormat.h"

#include <algorithm>
#include <bit>
#include <optional>

namespace ost::platform {

namespace {

using namespace binaryPropertyList;

template<typename T>
using Result = std::expected<T, PropertyListError>;

/// What the tree of a file may take in memory: so much for each of its bytes, and an allowance for small files that
/// refer to one long string many times. Every reference is charged where it stands, which also ends bombs of nested
/// references and tables whose offsets all lead to the same array, without keeping note of what has been seen.
constexpr std::size_t memoryPerByte = 64;
constexpr std::size_t memoryAllowance = std::size_t{1} << 20;

std::unexpected<PropertyListError> malformed(const char* what) {
    return std::unexpected(PropertyListError{std::string("Malformed binary property list: ") + what});
}

class Reader {
public:
    Reader(std::string_view bytes, const PropertyListLimits& limits)
        : _bytes(bytes), _depthLimit(limits.depth), _objectsLeft(limits.objectCount),
          _memoryLeft(memoryAllowance + bytes.size() * memoryPerByte) {}

    Result<OSTValue> read() {
        const auto root = OST_TRY(_readTrailer());
        OST_TRY(_chargeObjects(1));
        return _value(root, 1);
    }

private:
    /// An object taken apart. The count is what the marker says and not yet checked against the rest of the file.
    struct Object {
        std::uint8_t kind;
        std::uint8_t marker;
        std::uint64_t count;
        std::string_view rest;

        /// The object's body, `count` items of `width` bytes.
        [[nodiscard]] std::optional<std::string_view> body(std::size_t width) const {
            if (count > rest.size() / width)
                return std::nullopt;
            return rest.substr(0, static_cast<std::size_t>(count) * width);
        }
        [[nodiscard]] std::optional<std::string_view> fixedBody(std::size_t width) const {
            return width <= rest.size() ? std::optional(rest.substr(0, width)) : std::nullopt;
        }
    };

    /// Finds table and objects; gives the index of the root.
    Result<std::uint64_t> _readTrailer() {
        if (_bytes.size() < magic.size() + trailerSize)
            return malformed("shorter than its trailer");
        const auto trailer = _bytes.substr(_bytes.size() - trailerSize);
        const auto beforeTrailer = _bytes.substr(0, _bytes.size() - trailerSize);
        _offsetWidth = static_cast<unsigned char>(trailer[trailerPadding]);
        _referenceWidth = static_cast<unsigned char>(trailer[trailerPadding + 1]);
        if (_offsetWidth < 1 || _offsetWidth > 8 || _referenceWidth < 1 || _referenceWidth > 8)
            return malformed("width of offsets or references out of range");
        const auto objectCount = bigEndian(trailer.substr(8, 8));
        const auto root = bigEndian(trailer.substr(16, 8));
        const auto tableOffset = bigEndian(trailer.substr(24, 8));
        if (tableOffset < magic.size() || tableOffset > beforeTrailer.size())
            return malformed("offset table outside the file");
        _objects = beforeTrailer.substr(0, static_cast<std::size_t>(tableOffset));
        const auto table = beforeTrailer.substr(_objects.size());
        if (objectCount > table.size() / _offsetWidth)
            return malformed("offset table shorter than its count");
        _table = table.substr(0, static_cast<std::size_t>(objectCount) * _offsetWidth);
        return root;
    }

    Result<void> _chargeObjects(std::size_t count) {
        if (count > _objectsLeft)
            return malformed("too many objects");
        _objectsLeft -= count;
        return _chargeMemory(count * sizeof(OSTValue));
    }

    Result<void> _chargeMemory(std::size_t size) {
        if (size > _memoryLeft)
            return malformed("objects referred to too often");
        _memoryLeft -= size;
        return {};
    }

    Result<Object> _object(std::uint64_t index) const {
        if (index >= _table.size() / _offsetWidth)
            return malformed("reference to an object outside the table");
        const auto offset = bigEndian(_table.substr(static_cast<std::size_t>(index) * _offsetWidth, _offsetWidth));
        if (offset < magic.size() || offset >= _objects.size())
            return malformed("object outside the file");
        auto rest = _objects.substr(static_cast<std::size_t>(offset));
        const auto marker = static_cast<std::uint8_t>(rest.front());
        rest.remove_prefix(1);
        Object object{static_cast<std::uint8_t>(marker >> 4), marker, marker & 0xfU, rest};
        if (object.kind >= data && object.count == countFollows)
            OST_TRY(_readCount(object));
        return object;
    }

    static Result<void> _readCount(Object& object) {
        const auto marker = object.rest.empty() ? std::uint8_t{0} : static_cast<std::uint8_t>(object.rest.front());
        const std::size_t width = std::size_t{1} << (marker & 0xfU);
        if (marker >> 4 != integer || width > 8 || object.rest.size() <= width)
            return malformed("bad count");
        object.count = bigEndian(object.rest.substr(1, width));
        object.rest.remove_prefix(1 + width);
        return {};
    }

    Result<OSTValue> _value(std::uint64_t index, std::size_t depth) {
        const auto object = OST_TRY(_object(index));
        switch (object.kind) {
        case simple:
            return _boolean(object);
        case integer:
            return _integer(object);
        case real:
            return _real(object);
        case date:
            return _date(object);
        case data:
            return _data(object);
        case asciiString:
        case utf16String:
            return _string(object);
        case array:
            return _array(object, depth);
        case dictionary:
            return _dictionary(object, depth);
        default:
            return malformed("object of an unknown or unsupported kind");
        }
    }

    static Result<OSTValue> _boolean(const Object& object) {
        if (object.marker != falseMarker && object.marker != trueMarker)
            return malformed("null or fill object");
        return OSTValue(object.marker == trueMarker);
    }

    static Result<OSTValue> _integer(const Object& object) {
        constexpr unsigned widestExponent = 4;
        const auto body =
            object.count <= widestExponent ? object.fixedBody(std::size_t{1} << object.count) : std::nullopt;
        if (!body)
            return malformed("bad integer");
        const auto number = bigEndian(body->substr(body->size() <= 8 ? 0 : 8));
        if (body->size() == 8)
            return OSTValue(static_cast<std::int64_t>(number));
        if (body->size() > 8 && bigEndian(body->substr(0, 8)) != 0)
            return malformed("integer outside 64 bits");
        return OSTValue(number);
    }

    static Result<OSTValue> _real(const Object& object) {
        const bool isShort = object.count == 2;
        const auto body = isShort || object.count == 3 ? object.fixedBody(isShort ? 4 : 8) : std::nullopt;
        if (!body)
            return malformed("bad real");
        const auto bits = bigEndian(*body);
        return OSTValue(isShort ? double{std::bit_cast<float>(static_cast<std::uint32_t>(bits))}
                                : std::bit_cast<double>(bits));
    }

    static Result<OSTValue> _date(const Object& object) {
        const auto body = object.count == 3 ? object.fixedBody(8) : std::nullopt;
        if (!body)
            return malformed("bad date");
        return OSTValue(OSTDate{std::bit_cast<double>(bigEndian(*body)) + epochInSecondsSince1970});
    }

    Result<OSTValue> _data(const Object& object) {
        const auto body = object.body(1);
        if (!body)
            return malformed("data beyond the end");
        OST_TRY(_chargeMemory(body->size()));
        return OSTValue(OSTData{std::string(*body)});
    }

    Result<std::string> _string(const Object& object) {
        const auto body = object.body(object.kind == utf16String ? 2 : 1);
        if (!body)
            return malformed("string beyond the end");
        OST_TRY(_chargeMemory(body->size()));
        std::string text;
        if (object.kind == utf16String) {
            if (!appendUTF16BE(text, *body))
                return malformed("half a surrogate pair in a string");
        } else {
            if (!isASCII(*body))
                return malformed("byte outside ASCII in a string");
            text = *body;
        }
        if (text.find('\0') != std::string::npos)
            return malformed("NUL in a string");
        return text;
    }

    Result<std::string> _key(std::uint64_t index) {
        const auto object = OST_TRY(_object(index));
        if (object.kind != asciiString && object.kind != utf16String)
            return malformed("key that is no string");
        return _string(object);
    }

    /// The references of an array or dictionary, once depth and charge allow for what they lead to.
    Result<std::string_view> _references(const Object& object, std::size_t perItem, std::size_t depth) {
        if (depth > _depthLimit)
            return malformed("nested too deeply, or an object that holds itself");
        const auto body = object.body(_referenceWidth * perItem);
        if (!body)
            return malformed("array or dictionary beyond the end");
        OST_TRY(_chargeObjects(body->size() / _referenceWidth));
        return *body;
    }

    [[nodiscard]] std::uint64_t _reference(std::string_view references, std::size_t index) const {
        return bigEndian(references.substr(index * _referenceWidth, _referenceWidth));
    }

    Result<OSTValue> _array(const Object& object, std::size_t depth) {
        const auto references = OST_TRY(_references(object, 1, depth));
        const auto count = static_cast<std::size_t>(object.count);
        OSTArray values;
        values.reserve(count);
        for (std::size_t i = 0; i < count; ++i)
            values.push_back(OST_TRY(_value(_reference(references, i), depth + 1)));
        return OSTValue(std::move(values));
    }

    Result<OSTValue> _dictionary(const Object& object, std::size_t depth) {
        const auto references = OST_TRY(_references(object, 2, depth));
        const auto count = static_cast<std::size_t>(object.count);
        std::vector<OSTDictionary::Entry> entries;
        entries.reserve(count);
        for (std::size_t i = 0; i < count; ++i) {
            auto key = OST_TRY(_key(_reference(references, i)));
            entries.emplace_back(std::move(key), OST_TRY(_value(_reference(references, count + i), depth + 1)));
        }
        return OSTValue(OSTDictionary(std::move(entries)));
    }

    const std::string_view _bytes;
    const std::size_t _depthLimit;
    std::size_t _objectsLeft;
    std::size_t _memoryLeft;

    // From the trailer.
    std::string_view _objects; ///< from the file's first byte to the table, so that offsets count from its beginning
    std::string_view _table;
    std::size_t _offsetWidth = 0;
    std::size_t _referenceWidth = 0;
};

} // namespace

std::expected<OSTValue, PropertyListError> readBinaryPropertyList(std::string_view bytes,
                                                                  const PropertyListLimits& limits) {
    return Reader(bytes, limits).read();
}

} // namespace ost::platform
