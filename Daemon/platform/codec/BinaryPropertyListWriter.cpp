#include "platform/codec/BinaryPropertyListFormat.h"
#include "platform/codec/PropertyList.h"

#include "platform/base/Assert.h"
#include "platform/base/Unicode.h"

#include <algorithm>
#include <bit>
#include <functional>
#include <limits>

namespace ost::platform {

namespace {

using namespace binaryPropertyList;

/// The least width of 1, 2, 4 and 8 bytes that holds `value`.
constexpr unsigned widthFor(std::uint64_t value) {
    return value <= 0xff ? 1 : value <= 0xffff ? 2 : value <= 0xffff'ffff ? 4 : 8;
}

void appendBigEndian(std::string& out, std::uint64_t value, unsigned width) {
    char bytes[8];
    for (unsigned i = width; i-- > 0; value >>= 8)
        bytes[i] = static_cast<char>(value);
    out.append(bytes, width);
}

void appendMarker(std::string& out, Kind kind, unsigned low) { out += static_cast<char>(kind * 16U + low); }

void appendScalar(std::string& out, std::uint64_t value) {
    // Eight bytes are signed: what does not fit takes sixteen.
    const bool isWide = value > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
    const unsigned width = widthFor(value);
    appendMarker(out, integer, isWide ? 4 : static_cast<unsigned>(std::countr_zero(width)));
    if (isWide)
        appendBigEndian(out, 0, 8);
    appendBigEndian(out, value, width);
}

void appendHeader(std::string& out, Kind kind, std::size_t count) {
    appendMarker(out, kind, static_cast<unsigned>(std::min<std::size_t>(count, countFollows)));
    if (count >= countFollows)
        appendScalar(out, std::uint64_t{count});
}

void appendScalar(std::string& out, std::int64_t value) {
    OST_ASSERT(value < 0);
    appendMarker(out, integer, 3);
    appendBigEndian(out, static_cast<std::uint64_t>(value), 8);
}

void appendScalar(std::string& out, bool value) { out += static_cast<char>(value ? trueMarker : falseMarker); }

void appendScalar(std::string& out, double value) {
    appendMarker(out, real, 3);
    appendBigEndian(out, std::bit_cast<std::uint64_t>(value), 8);
}

void appendScalar(std::string& out, const OSTDate& value) {
    appendMarker(out, date, 3);
    appendBigEndian(out, std::bit_cast<std::uint64_t>(value.secondsSince1970 - epochInSecondsSince1970), 8);
}

void appendScalar(std::string& out, const OSTData& value) {
    appendHeader(out, data, value.bytes.size());
    out += value.bytes;
}

void appendUTF16String(std::string& out, std::string_view text) {
    std::u16string units;
    units.reserve(text.size());
    while (!text.empty()) {
        const char32_t codePoint = takeCodePoint(text).value_or(U'\ufffd');
        if (codePoint >= 0x10000)
            units += static_cast<char16_t>(0xd800 + ((codePoint - 0x10000) >> 10));
        units += static_cast<char16_t>(codePoint < 0x10000 ? codePoint : 0xdc00 + (codePoint & 0x3ff));
    }
    appendHeader(out, utf16String, units.size());
    for (const char16_t unit : units)
        appendBigEndian(out, unit, 2);
}

void appendScalar(std::string& out, const std::string& value) {
    if (!isASCII(value))
        return appendUTF16String(out, value);
    appendHeader(out, asciiString, value.size());
    out += value;
}

/// Finds the object that has the same encoding as a new one. An object's encoding tells where it ends, so two that
/// agree in the length of the one are the same.
class UniqueObjects {
public:
    using Reference = std::uint32_t;

    /// The object of `objects` equal to the one from `begin` to its end; `next`, the one itself, if none is to be
    /// shared.
    Reference find(std::string_view objects, std::size_t begin, Reference next) {
        const auto object = objects.substr(begin);
        const std::uint64_t hash = std::hash<std::string_view>()(object);
        Slot* slot = _probe(
            hash, [&](const Slot& candidate) { return objects.substr(candidate.offset, object.size()) == object; });
        if (!slot)
            return next;
        if (slot->uses > 0 && (object.size() <= longestSharedFreely || slot->uses < usesOfLongObject)) {
            ++slot->uses;
            return slot->reference;
        }
        const bool isNew = slot->uses == 0;
        *slot = {hash, begin, next, 1};
        if (isNew && ++_count * 2 > _slots.size())
            _grow();
        return next;
    }

private:
    struct Slot {
        std::uint64_t hash = 0;
        std::size_t offset = 0;
        Reference reference = 0;
        std::uint32_t uses = 0; ///< 0: empty
    };

    /// A reader gives every byte of a file 64 bytes of memory. A short object may be shared by any number of
    /// references, each of at least one byte; a long one is written anew in time, and so pays for its references.
    static constexpr std::size_t longestSharedFreely = 16;
    static constexpr std::uint32_t usesOfLongObject = 32;
    /// Strings made to collide cost no more than this many comparisons each: what is not found by then is written
    /// twice.
    static constexpr std::size_t longestProbe = 128;
    static constexpr std::size_t initialSlots = 32;

    Slot* _probe(std::uint64_t hash, const auto& isSame) {
        for (std::size_t i = 0; i < longestProbe; ++i) {
            Slot& slot = _slots[(hash + i) & (_slots.size() - 1)];
            if (slot.uses == 0 || (slot.hash == hash && isSame(slot)))
                return &slot;
        }
        return nullptr;
    }

    void _grow() {
        std::vector<Slot> old(_slots.size() * 4);
        old.swap(_slots);
        for (const Slot& slot : old)
            if (slot.uses > 0)
                if (Slot* place = _probe(slot.hash, [](const Slot&) { return false; }))
                    *place = slot;
    }

    std::vector<Slot> _slots = std::vector<Slot>(initialSlots); ///< a power of two, at most half of them used
    std::size_t _count = 0;
};

/// Scalars are written as they are met; arrays and dictionaries follow, when the number of objects tells how wide a
/// reference has to be.
class Writer {
public:
    std::string write(const OSTDictionary& root) {
        constexpr std::size_t smallFile = 512;
        _out.reserve(smallFile);
        _out += magic;
        _add(root);
        const unsigned referenceWidth = widthFor(_offsets.size() - 1);
        for (const auto& container : _containers)
            _appendContainer(container, referenceWidth);
        _appendTableAndTrailer(referenceWidth);
        return std::move(_out);
    }

private:
    using Reference = UniqueObjects::Reference;

    struct Container {
        Kind kind;
        Reference object;
        std::size_t count;
        std::size_t firstReference; ///< into `_references`
        std::size_t referenceCount;
    };

    /// Makes room for an object whose offset is still to come, and for its references.
    Container _addContainer(Kind kind, std::size_t count, std::size_t referenceCount) {
        const Container container{kind, _nextReference(), count, _references.size(), referenceCount};
        _offsets.push_back(0);
        _references.resize(_references.size() + referenceCount);
        _containers.push_back(container);
        return container;
    }

    Reference _add(const OSTDictionary& entries) {
        const auto container = _addContainer(dictionary, entries.size(), 2 * entries.size());
        auto at = container.firstReference;
        for (const auto& [key, value] : entries) {
            _references[at] = _add(key);
            _references[at + container.count] = _add(value);
            ++at;
        }
        return container.object;
    }

    Reference _add(const OSTArray& values) {
        const auto container = _addContainer(array, values.size(), values.size());
        auto at = container.firstReference;
        for (const auto& value : values)
            _references[at++] = _add(value);
        return container.object;
    }

    Reference _add(const OSTValue& value) {
        return std::visit([this](const auto& content) { return _add(content); }, value.variant());
    }

    Reference _add(const std::shared_ptr<const OSTArray>& values) { return _add(*values); }
    Reference _add(const std::shared_ptr<const OSTDictionary>& entries) { return _add(*entries); }

    template<typename Scalar>
    Reference _add(const Scalar& scalar) {
        const auto begin = _out.size();
        appendScalar(_out, scalar);
        const Reference next = _nextReference();
        const Reference reference = _unique.find(_out, begin, next);
        if (reference == next)
            _offsets.push_back(begin);
        else
            _out.resize(begin);
        return reference;
    }

    [[nodiscard]] Reference _nextReference() const {
        OST_ASSERT(_offsets.size() < std::numeric_limits<Reference>::max());
        return static_cast<Reference>(_offsets.size());
    }

    void _appendContainer(const Container& container, unsigned referenceWidth) {
        _offsets[container.object] = _out.size();
        appendHeader(_out, container.kind, container.count);
        for (std::size_t i = 0; i < container.referenceCount; ++i)
            appendBigEndian(_out, _references[container.firstReference + i], referenceWidth);
    }

    void _appendTableAndTrailer(unsigned referenceWidth) {
        const auto tableOffset = _out.size();
        const unsigned offsetWidth = widthFor(std::ranges::max(_offsets));
        for (const auto offset : _offsets)
            appendBigEndian(_out, offset, offsetWidth);
        _out.append(trailerPadding, '\0');
        appendBigEndian(_out, offsetWidth, 1);
        appendBigEndian(_out, referenceWidth, 1);
        appendBigEndian(_out, _offsets.size(), 8);
        appendBigEndian(_out, 0, 8); // the root was added first
        appendBigEndian(_out, tableOffset, 8);
    }

    std::string _out;
    std::vector<std::uint64_t> _offsets; ///< by reference
    std::vector<Container> _containers;
    std::vector<Reference> _references;
    UniqueObjects _unique;
};

} // namespace

std::string serializeBinaryPropertyList(const OSTDictionary& root) { return Writer().write(root); }

} // namespace ost::platform
