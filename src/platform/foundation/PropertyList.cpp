#include "platform/foundation/PropertyList.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <cmath>
#include <limits>

#include "platform/foundation/Fatal.h"

namespace cindral {

namespace {

constexpr std::string_view kBinaryHeader = "bplist00";
constexpr std::size_t kTrailerSize = 32;

// First bytes of objects: a kind in the high half; in the low half a length, the logarithm of one, or a further kind.
// Written to disk, and shared with every other reader of the format: never change one.
constexpr unsigned kFalse = 0x08;
constexpr unsigned kTrue = 0x09;
constexpr unsigned kIntegerKind = 0x1;
constexpr unsigned kRealKind = 0x2;
constexpr unsigned kFloat = 0x22;
constexpr unsigned kDouble = 0x23;
constexpr unsigned kDate = 0x33;
constexpr unsigned kDataKind = 0x4;
constexpr unsigned kASCIIKind = 0x5;
constexpr unsigned kUTF16Kind = 0x6;
constexpr unsigned kArrayKind = 0xA;
constexpr unsigned kDictionaryKind = 0xD;
constexpr unsigned kLengthFollows = 0xF;

// --- Dates -----------------------------------------------------------------------------------------------------------

constexpr std::int64_t kSecondsFrom1970To2001 = 978'307'200;

// Bounds of the dates that are read: 292 billion years from now, some decades inside of what 64 bits of seconds hold,
// so that the change of epoch can't overflow. Dates beyond are written as the nearest bound.
constexpr double kDateMin = -0x1p63;
constexpr double kDateMax = 0x1p63 - 0x1p30;
static_assert(0x1p30 > kSecondsFrom1970To2001);

double secondsSince2001(const KsDate& date) {
    // Both parts are rounded once at most before they are added, so the sum is the double nearest to the date wherever
    // doubles lie more than a nanosecond apart, and within half a nanosecond of it elsewhere. Either way a date that
    // was read is written as what reads as the same date.
    constexpr std::int64_t kSecondsMin = std::numeric_limits<std::int64_t>::min() + kSecondsFrom1970To2001;
    const std::int64_t whole = std::max(date.seconds, kSecondsMin) - kSecondsFrom1970To2001;
    return std::min(static_cast<double>(whole) + date.nanoseconds / 1e9, kDateMax);
}

std::optional<KsDate> dateFrom(double secondsSince2001) {
    if (!(secondsSince2001 >= kDateMin && secondsSince2001 <= kDateMax)) return std::nullopt;  // Not a number, too.
    const double whole = std::floor(secondsSince2001);
    const auto nanoseconds = static_cast<std::uint32_t>(std::llround((secondsSince2001 - whole) * 1e9));
    const auto seconds = static_cast<std::int64_t>(whole) + kSecondsFrom1970To2001;
    if (nanoseconds == 1'000'000'000) return KsDate{.seconds = seconds + 1, .nanoseconds = 0};
    return KsDate{.seconds = seconds, .nanoseconds = nanoseconds};
}

// --- Texts -----------------------------------------------------------------------------------------------------------

// A byte that belongs to no valid UTF-8 stands in UTF-16 as this code unit plus its value: 0xDC80 to 0xDCFF. Alone,
// these are halves of pairs that no text holds, so that names of files, which are any bytes, are never changed or lost.
constexpr char32_t kStrayByte = 0xDC00;

bool isASCII(std::string_view text) {
    return std::ranges::all_of(text, [](char c) { return static_cast<unsigned char>(c) < 0x80; });
}

struct CodePoint {
    char32_t value;
    std::size_t bytes;
};

/// The first code point of a text that is not empty, or its first byte as a stray one.
CodePoint firstCodePoint(std::string_view text) {
    const auto byte = [&](std::size_t i) { return static_cast<unsigned char>(text[i]); };
    const auto stray = CodePoint{.value = kStrayByte + byte(0), .bytes = 1};
    if (byte(0) < 0x80) return {.value = byte(0), .bytes = 1};
    const std::size_t length = byte(0) >= 0xF0 ? 4 : byte(0) >= 0xE0 ? 3 : 2;
    if (byte(0) < 0xC2 || byte(0) > 0xF4 || text.size() < length) return stray;
    char32_t value = byte(0) & (0x7FU >> length);
    for (std::size_t i = 1; i < length; ++i) {
        if ((byte(i) & 0xC0) != 0x80) return stray;
        value = value << 6 | (byte(i) & 0x3FU);
    }
    // Longer than needed, half of a surrogate pair, or beyond the last code point.
    constexpr std::array<char32_t, 5> kLeast{0, 0, 0x80, 0x800, 0x10000};
    if (value < kLeast[length] || (value >= 0xD800 && value <= 0xDFFF) || value > 0x10FFFF) return stray;
    return {.value = value, .bytes = length};
}

std::u16string utf16From(std::string_view text) {
    std::u16string units;
    units.reserve(text.size());
    while (!text.empty()) {
        const CodePoint point = firstCodePoint(text);
        text.remove_prefix(point.bytes);
        if (point.value < 0x10000) {
            units.push_back(static_cast<char16_t>(point.value));
        } else {
            units.push_back(static_cast<char16_t>(0xD7C0 + (point.value >> 10)));
            units.push_back(static_cast<char16_t>(0xDC00 + (point.value & 0x3FF)));
        }
    }
    return units;
}

void appendUTF8(std::string& text, char32_t value) {
    if (value < 0x80) {
        text.push_back(static_cast<char>(value));
        return;
    }
    if (value < 0x800) {
        text.push_back(static_cast<char>(0xC0 | value >> 6));
    } else {
        if (value < 0x10000) {
            text.push_back(static_cast<char>(0xE0 | value >> 12));
        } else {
            text.push_back(static_cast<char>(0xF0 | value >> 18));
            text.push_back(static_cast<char>(0x80 | (value >> 12 & 0x3F)));
        }
        text.push_back(static_cast<char>(0x80 | (value >> 6 & 0x3F)));
    }
    text.push_back(static_cast<char>(0x80 | (value & 0x3F)));
}

// --- Numbers of 1 to 8 bytes, highest first --------------------------------------------------------------------------

std::uint64_t readBigEndian(ByteView bytes) {
    std::uint64_t value = 0;
    for (const std::byte byte : bytes) value = value << 8 | std::to_integer<std::uint64_t>(byte);
    return value;
}

/// 1, 2, 4 or 8: as many bytes as a number needs.
constexpr std::size_t bytesFor(std::uint64_t value) {
    return value <= 0xFF ? 1 : value <= 0xFFFF ? 2 : value <= 0xFFFF'FFFF ? 4 : 8;
}

// --- Writing ---------------------------------------------------------------------------------------------------------

class Writer {
public:
    explicit Writer(const PropertyList& root);
    Bytes write() &&;

private:
    struct Object {
        const std::string* key;  // A key of a dictionary, or null
        const PropertyList* value;
        std::uint64_t offset;
    };

    void addChildren(const PropertyList& value);
    void writeObject(const Object& object);
    void writeMarker(unsigned kind, std::uint64_t length);
    void writeInteger(std::uint64_t value);
    void writeNegativeInteger(std::int64_t value);
    void writeReal(double value);
    void writeBits(unsigned marker, double value);
    void writeString(std::string_view text);
    void writeReferences(std::size_t count);
    void writeTable();
    void append(ByteView bytes) { out_.insert(out_.end(), bytes.begin(), bytes.end()); }
    void appendByte(unsigned byte) { out_.push_back(static_cast<std::byte>(byte)); }
    void appendBigEndian(std::uint64_t value, std::size_t size);

    std::vector<Object> objects_;  // Level by level; the children of one value lie together
    std::size_t nextChild_ = 1;    // Number of the next object that no reference was written to
    std::size_t referenceSize_ = 1;
    Bytes out_;
};

Writer::Writer(const PropertyList& root) {
    objects_.reserve(16);
    objects_.push_back({.key = nullptr, .value = &root, .offset = 0});
    std::size_t levelEnd = 1;
    unsigned depth = 1;
    for (std::size_t i = 0; i < objects_.size(); ++i) {
        if (i == levelEnd) {
            levelEnd = objects_.size();
            if (++depth > kPropertyListDepthMax) fatal("a property list has too many levels to be encoded");
        }
        if (objects_[i].value) addChildren(*objects_[i].value);
    }
    referenceSize_ = bytesFor(objects_.size() - 1);
}

void Writer::addChildren(const PropertyList& value) {
    if (const auto* array = value.array()) {
        for (const PropertyList& element : *array) objects_.push_back({.key = nullptr, .value = &element, .offset = 0});
    } else if (const auto* dictionary = value.dictionary()) {
        for (const auto& entry : *dictionary) objects_.push_back({.key = &entry.first, .value = nullptr, .offset = 0});
        for (const auto& entry : *dictionary) objects_.push_back({.key = nullptr, .value = &entry.second, .offset = 0});
    }
}

Bytes Writer::write() && {
    out_.reserve(kBinaryHeader.size() + kTrailerSize + objects_.size() * 20);
    append(bytesOf(kBinaryHeader));
    for (Object& object : objects_) {
        object.offset = out_.size();
        writeObject(object);
    }
    writeTable();
    return std::move(out_);
}

void Writer::writeObject(const Object& object) {
    if (object.key) return writeString(*object.key);
    const PropertyList& value = *object.value;
    if (const auto* boolean = value.boolean()) return appendByte(*boolean ? kTrue : kFalse);
    if (const auto* integer = value.unsignedInteger()) return writeInteger(*integer);
    if (const auto* integer = value.negativeInteger()) return writeNegativeInteger(*integer);
    if (const auto* real = value.real()) return writeReal(*real);
    if (const auto* date = value.date()) return writeBits(kDate, secondsSince2001(*date));
    if (const auto* string = value.string()) return writeString(*string);
    if (const auto* data = value.data()) {
        writeMarker(kDataKind, data->size());
        return append(*data);
    }
    if (const auto* array = value.array()) {
        writeMarker(kArrayKind, array->size());
        return writeReferences(array->size());
    }
    const auto& dictionary = *value.dictionary();
    writeMarker(kDictionaryKind, dictionary.size());
    writeReferences(2 * dictionary.size());
}

void Writer::writeMarker(unsigned kind, std::uint64_t length) {
    if (length < kLengthFollows) return appendByte(kind << 4 | static_cast<unsigned>(length));
    appendByte(kind << 4 | kLengthFollows);
    writeInteger(length);
}

void Writer::writeInteger(std::uint64_t value) {
    // Integers of eight bytes are signed, so that the upper half of 64 bits takes sixteen.
    if (value > std::uint64_t{std::numeric_limits<std::int64_t>::max()}) {
        appendByte(kIntegerKind << 4 | 4);
        appendBigEndian(0, 8);
        return appendBigEndian(value, 8);
    }
    const std::size_t size = bytesFor(value);
    appendByte(kIntegerKind << 4 | static_cast<unsigned>(std::countr_zero(size)));
    appendBigEndian(value, size);
}

void Writer::writeNegativeInteger(std::int64_t value) {
    appendByte(kIntegerKind << 4 | 3);
    appendBigEndian(static_cast<std::uint64_t>(value), 8);
}

void Writer::writeReal(double value) {
    // Zeros of both signs are equal, and equal values have equal bytes. What is not a number says nothing by its bits.
    if (value == 0) value = 0;
    if (std::isnan(value)) value = std::numeric_limits<double>::quiet_NaN();
    writeBits(kDouble, value);
}

void Writer::writeBits(unsigned marker, double value) {
    appendByte(marker);
    appendBigEndian(std::bit_cast<std::uint64_t>(value), 8);
}

void Writer::writeString(std::string_view text) {
    if (isASCII(text)) {
        writeMarker(kASCIIKind, text.size());
        return append(bytesOf(text));
    }
    const std::u16string units = utf16From(text);
    writeMarker(kUTF16Kind, units.size());
    for (const char16_t unit : units) appendBigEndian(unit, 2);
}

void Writer::writeReferences(std::size_t count) {
    for (std::size_t i = 0; i < count; ++i) appendBigEndian(nextChild_++, referenceSize_);
}

void Writer::writeTable() {
    const std::uint64_t table = out_.size();
    const std::size_t offsetSize = bytesFor(table);
    for (const Object& object : objects_) appendBigEndian(object.offset, offsetSize);
    appendBigEndian(0, 6);
    appendByte(static_cast<unsigned>(offsetSize));
    appendByte(static_cast<unsigned>(referenceSize_));
    appendBigEndian(objects_.size(), 8);
    appendBigEndian(0, 8);  // The number of the top object.
    appendBigEndian(table, 8);
}

void Writer::appendBigEndian(std::uint64_t value, std::size_t size) {
    std::array<std::byte, 8> bytes;
    for (std::size_t i = 0; i < size; ++i) bytes[i] = static_cast<std::byte>(value >> 8 * (size - 1 - i));
    append(ByteView(bytes).first(size));
}

// --- Reading ---------------------------------------------------------------------------------------------------------

KsError malformed(const char* message) {
    return {kKsPOSIXErrorDomain, EINVAL, {{"message", message}}};
}

class Reader {
public:
    explicit Reader(ByteView bytes)
        : bytes_(bytes), allowance_(std::max<std::uint64_t>(kPropertyListValuesMax, bytes.size())) {}
    Result<PropertyList> read();

private:
    // One object: its marker, taken apart, and what follows the marker up to the end of all objects.
    struct Object {
        unsigned marker;
        unsigned kind;
        unsigned low;
        ByteView rest;
    };

    Result<void> readTrailer();
    Result<void> checkTable() const;
    std::uint64_t offset(std::uint64_t number) const;
    Object object(std::uint64_t number) const;
    Result<std::uint64_t> reference(ByteView references, std::uint64_t index) const;
    /// The contents of an object of so many elements as its marker says, each of that size.
    Result<ByteView> contents(const Object& object, std::size_t elementSize) const;
    /// Takes from what the whole list may unfold to.
    Result<void> charge(std::uint64_t values);
    Result<void> chargeBytes(std::size_t bytes) { return charge(bytes / 16); }

    Result<PropertyList> value(std::uint64_t number, unsigned depth);
    static Result<PropertyList> integer(const Object& object);
    static Result<PropertyList> realOrDate(const Object& object);
    Result<PropertyList> data(const Object& object);
    Result<std::string> string(const Object& object);
    Result<PropertyList> array(const Object& object, unsigned depth);
    Result<PropertyList> dictionary(const Object& object, unsigned depth);

    ByteView bytes_;
    std::uint64_t allowance_;
    std::size_t offsetSize_ = 0;
    std::size_t referenceSize_ = 0;
    std::uint64_t objectCount_ = 0;
    std::uint64_t topObject_ = 0;
    std::size_t table_ = 0;  // Where the objects end and the table of their offsets begins
};

Result<PropertyList> Reader::read() {
    TRY(readTrailer());
    TRY(checkTable());
    TRY(charge(1));
    return value(topObject_, 1);
}

Result<void> Reader::readTrailer() {
    if (bytes_.size() < kBinaryHeader.size() + kTrailerSize) return malformed("too short for a property list");
    if (textOf(bytes_.first(kBinaryHeader.size())) != kBinaryHeader) return malformed("not a binary property list");
    const ByteView trailer = bytes_.last(kTrailerSize);
    if (readBigEndian(trailer.first(6)) != 0) return malformed("unknown fields in the trailer");
    offsetSize_ = std::to_integer<std::size_t>(trailer[6]);
    referenceSize_ = std::to_integer<std::size_t>(trailer[7]);
    objectCount_ = readBigEndian(trailer.subspan(8, 8));
    topObject_ = readBigEndian(trailer.subspan(16, 8));
    const std::uint64_t table = readBigEndian(trailer.subspan(24, 8));
    if (offsetSize_ < 1 || offsetSize_ > 8) return malformed("offsets of an impossible size");
    if (referenceSize_ < 1 || referenceSize_ > 8) return malformed("references of an impossible size");
    if (topObject_ >= objectCount_) return malformed("no top object");
    const std::size_t tableEnd = bytes_.size() - kTrailerSize;
    if (table < kBinaryHeader.size() || table > tableEnd) return malformed("offset table outside of the file");
    // Exactly between objects and trailer. The division, because a count near 2^64 would overflow a product.
    const std::uint64_t tableSize = tableEnd - table;
    if (tableSize % offsetSize_ != 0 || tableSize / offsetSize_ != objectCount_)
        return malformed("offset table of another size");
    table_ = static_cast<std::size_t>(table);
    return {};
}

Result<void> Reader::checkTable() const {
    for (std::uint64_t number = 0; number < objectCount_; ++number) {
        const std::uint64_t at = offset(number);
        if (at < kBinaryHeader.size() || at >= table_) return malformed("object outside of the objects");
    }
    return {};
}

std::uint64_t Reader::offset(std::uint64_t number) const {
    return readBigEndian(bytes_.subspan(table_ + number * offsetSize_, offsetSize_));
}

Reader::Object Reader::object(std::uint64_t number) const {
    const ByteView from = bytes_.first(table_).subspan(offset(number));
    const auto marker = std::to_integer<unsigned>(from[0]);
    return {.marker = marker, .kind = marker >> 4, .low = marker & 0xF, .rest = from.subspan(1)};
}

Result<std::uint64_t> Reader::reference(ByteView references, std::uint64_t index) const {
    const std::uint64_t number = readBigEndian(references.subspan(index * referenceSize_, referenceSize_));
    if (number >= objectCount_) return malformed("reference to no object");
    return number;
}

Result<ByteView> Reader::contents(const Object& object, std::size_t elementSize) const {
    std::uint64_t count = object.low;
    ByteView rest = object.rest;
    if (object.low == kLengthFollows) {
        const unsigned marker = rest.empty() ? 0 : std::to_integer<unsigned>(rest[0]);
        if (marker >> 4 != kIntegerKind || (marker & 0xF) > 3) return malformed("no length where one must be");
        const std::size_t size = std::size_t{1} << (marker & 0xF);
        if (rest.size() - 1 < size) return malformed("object cut short");
        count = readBigEndian(rest.subspan(1, size));
        rest = rest.subspan(1 + size);
    }
    if (count > rest.size() / elementSize) return malformed("object cut short");
    return rest.first(count * elementSize);
}

Result<void> Reader::charge(std::uint64_t values) {
    if (values > allowance_) return malformed("more values than the file has room for");
    allowance_ -= values;
    return {};
}

Result<PropertyList> Reader::value(std::uint64_t number, unsigned depth) {
    // Also what ends a container that holds itself.
    if (depth > kPropertyListDepthMax) return malformed("nested too deep");
    const Object at = object(number);
    switch (at.kind) {
        case kIntegerKind: return integer(at);
        case kRealKind:
        case kDate >> 4: return realOrDate(at);
        case kDataKind: return data(at);
        case kASCIIKind:
        case kUTF16Kind: return PropertyList(TRY(string(at)));
        case kArrayKind: return array(at, depth);
        case kDictionaryKind: return dictionary(at, depth);
        default: break;
    }
    if (at.marker == kTrue || at.marker == kFalse) return PropertyList(at.marker == kTrue);
    return malformed("object of an unknown kind");
}

Result<PropertyList> Reader::integer(const Object& object) {
    if (object.low > 4) return malformed("integer of an impossible size");
    const std::size_t size = std::size_t{1} << object.low;
    if (object.rest.size() < size) return malformed("object cut short");
    if (size < 8) return PropertyList(readBigEndian(object.rest.first(size)));
    const std::uint64_t low = readBigEndian(object.rest.subspan(size - 8, 8));
    const bool negative = static_cast<std::int64_t>(low) < 0;
    if (size == 8) return PropertyList(static_cast<std::int64_t>(low));
    const std::uint64_t high = readBigEndian(object.rest.first(8));
    if (high == 0) return PropertyList(low);
    if (high == ~std::uint64_t{0} && negative) return PropertyList(static_cast<std::int64_t>(low));
    return malformed("integer of more than 64 bits");
}

Result<PropertyList> Reader::realOrDate(const Object& object) {
    if (object.marker == kFloat) {
        if (object.rest.size() < 4) return malformed("object cut short");
        const auto bits = static_cast<std::uint32_t>(readBigEndian(object.rest.first(4)));
        return PropertyList(double{std::bit_cast<float>(bits)});
    }
    if (object.marker != kDouble && object.marker != kDate) return malformed("real or date of an impossible size");
    if (object.rest.size() < 8) return malformed("object cut short");
    const auto number = std::bit_cast<double>(readBigEndian(object.rest.first(8)));
    if (object.marker == kDouble) return PropertyList(number);
    const std::optional<KsDate> date = dateFrom(number);
    if (!date) return malformed("date out of range");
    return PropertyList(*date);
}

Result<PropertyList> Reader::data(const Object& object) {
    const ByteView bytes = TRY(contents(object, 1));
    TRY(chargeBytes(bytes.size()));
    return PropertyList(Bytes(bytes.begin(), bytes.end()));
}

Result<std::string> Reader::string(const Object& object) {
    if (object.kind == kASCIIKind) {
        const std::string_view text = textOf(TRY(contents(object, 1)));
        TRY(chargeBytes(text.size()));
        if (!isASCII(text)) return malformed("text that is not ASCII where it must be");
        return std::string(text);
    }
    if (object.kind != kUTF16Kind) return malformed("key that is no text");
    const ByteView units = TRY(contents(object, 2));
    TRY(chargeBytes(units.size() / 2 * 3));  // A unit takes up to three bytes in UTF-8.
    const auto unit = [&](std::size_t i) { return static_cast<char32_t>(readBigEndian(units.subspan(i, 2))); };
    std::string text;
    text.reserve(units.size());
    for (std::size_t i = 0; i < units.size(); i += 2) {
        const char32_t first = unit(i);
        if (first < 0xD800 || first > 0xDFFF) {
            appendUTF8(text, first);
        } else if (first >= kStrayByte + 0x80 && first <= kStrayByte + 0xFF) {
            text.push_back(static_cast<char>(first - kStrayByte));
        } else {
            const char32_t second = i + 2 < units.size() ? unit(i + 2) : 0;
            if (first > 0xDBFF || second < 0xDC00 || second > 0xDFFF) return malformed("text that is not UTF-16");
            appendUTF8(text, 0x10000 + ((first - 0xD800) << 10) + (second - 0xDC00));
            i += 2;
        }
    }
    return text;
}

Result<PropertyList> Reader::array(const Object& object, unsigned depth) {
    const ByteView references = TRY(contents(object, referenceSize_));
    const std::size_t count = references.size() / referenceSize_;
    TRY(charge(count));  // Before room is made for them.
    PropertyList::Array array;
    array.reserve(count);
    for (std::size_t i = 0; i < count; ++i) {
        const std::uint64_t element = TRY(reference(references, i));
        array.push_back(TRY(value(element, depth + 1)));
    }
    return PropertyList(std::move(array));
}

Result<PropertyList> Reader::dictionary(const Object& object, unsigned depth) {
    const ByteView references = TRY(contents(object, 2 * referenceSize_));
    const std::size_t count = references.size() / referenceSize_ / 2;
    TRY(charge(2 * count));
    PropertyList::Dictionary dictionary;
    for (std::size_t i = 0; i < count; ++i) {
        const std::uint64_t keyNumber = TRY(reference(references, i));
        const std::uint64_t valueNumber = TRY(reference(references, count + i));
        std::string key = TRY(string(this->object(keyNumber)));
        dictionary.emplace_hint(dictionary.end(), std::move(key), TRY(value(valueNumber, depth + 1)));
        if (dictionary.size() != i + 1) return malformed("two values for one key");
    }
    return PropertyList(std::move(dictionary));
}

}  // namespace

PropertyList::PropertyList(std::int64_t value) {
    if (value < 0) {
        value_ = value;
    } else {
        value_ = static_cast<std::uint64_t>(value);
    }
}

const PropertyList* PropertyList::find(std::string_view key) const {
    const Dictionary* entries = dictionary();
    if (!entries) return nullptr;
    const auto found = entries->find(key);
    return found == entries->end() ? nullptr : &found->second;
}

Bytes PropertyList::encodeBinary() const {
    return Writer(*this).write();
}

Result<PropertyList> PropertyList::decodeBinary(ByteView bytes) {
    return Reader(bytes).read();
}

}  // namespace cindral
