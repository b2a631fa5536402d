#include "host/http/ZipWriter.h"

#include <sys/stat.h>
#include <zlib.h>

#include <algorithm>
#include <cstring>
#include <ctime>
#include <limits>
#include <utility>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Utf8.h"

namespace cindral {
namespace {

constexpr std::uint32_t kLocalSignature = 0x04034b50;
constexpr std::uint32_t kCentralSignature = 0x02014b50;
constexpr std::uint32_t kDescriptorSignature = 0x08074b50;
constexpr std::uint32_t kEndSignature = 0x06054b50;
constexpr std::uint32_t kEnd64Signature = 0x06064b50;
constexpr std::uint32_t kEnd64LocatorSignature = 0x07064b50;

constexpr std::uint16_t kZipVersion = 45;      // That of ZIP64.
constexpr std::uint16_t kMadeOnUnix = 3 << 8;  // The upper half of the attributes is a mode.
constexpr std::uint16_t kSizesFollow = 1 << 3;
constexpr std::uint16_t kNamesAreUtf8 = 1 << 11;
constexpr std::uint16_t kStored = 0;
constexpr std::uint16_t kDeflated = 8;
constexpr std::uint16_t kZip64Field = 0x0001;
constexpr std::uint16_t kTimeField = 0x5455;
constexpr std::uint32_t kIn64 = 0xFFFFFFFF;  // "Look in the field of the longer numbers."
constexpr std::uint16_t kCountIn64 = 0xFFFF;
// Packing makes what can't be packed a little longer: 5 bytes in 16 kB at most.
constexpr std::uint64_t kShortSizeMax = 0xFFF00000;
constexpr std::size_t kPackedBytes = 64 << 10;

void append16(std::string& out, std::uint16_t value) {
    out += static_cast<char>(value & 0xFF);
    out += static_cast<char>(value >> 8);
}

void append32(std::string& out, std::uint32_t value) {
    append16(out, static_cast<std::uint16_t>(value & 0xFFFF));
    append16(out, static_cast<std::uint16_t>(value >> 16));
}

void append64(std::string& out, std::uint64_t value) {
    append32(out, static_cast<std::uint32_t>(value & 0xFFFFFFFF));
    append32(out, static_cast<std::uint32_t>(value >> 32));
}

/// Date and time of day in 32 bits, as the person's clock shows them: from 1980 to 2107, every other second.
std::uint32_t calendarTime(const KsDate& date) {
    const auto seconds = static_cast<std::time_t>(date.seconds);
    std::tm time{};
    constexpr std::uint32_t kEarliest = (1 << 21) | (1 << 16);
    if (::localtime_r(&seconds, &time) == nullptr || time.tm_year < 80) return kEarliest;
    if (time.tm_year > 207) return 0xFF9FBF7D;
    const auto bits = [](int value, int shift) { return static_cast<std::uint32_t>(value) << shift; };
    return bits(time.tm_year - 80, 25) | bits(time.tm_mon + 1, 21) | bits(time.tm_mday, 16) | bits(time.tm_hour, 11) |
           bits(time.tm_min, 5) | bits(std::min(time.tm_sec, 59) / 2, 0);
}

constexpr std::string_view kBackslash = "\\";
constexpr std::string_view kWideBackslash = "\uFF3C";

std::string writtenPath(std::string_view path) {
    std::string written;
    written.reserve(path.size());
    for (const char c : path) {
        if (c == kBackslash.front()) {
            written += kWideBackslash;
        } else {
            written += c;
        }
    }
    return written;
}

}  // namespace

/// One stream of packed bytes after the other.
class ZipWriter::Packer {
public:
    Packer() {
        // Raw: the archive has heads and sums of its own.
        if (::deflateInit2(&stream_, Z_BEST_SPEED, Z_DEFLATED, -MAX_WBITS, MAX_MEM_LEVEL - 1, Z_DEFAULT_STRATEGY) !=
            Z_OK)
            fatal("out of memory");
    }
    ~Packer() { ::deflateEnd(&stream_); }
    Packer(const Packer&) = delete;
    Packer& operator=(const Packer&) = delete;

    void restart(bool isPacked) {
        ::deflateReset(&stream_);
        ::deflateParams(&stream_, isPacked ? Z_BEST_SPEED : Z_NO_COMPRESSION, Z_DEFAULT_STRATEGY);
    }

    /// Gives what comes out to `put`, until it says no.
    template <typename Put>
    bool pack(std::string_view bytes, bool isEnd, const Put& put) {
        do {
            // No more at a time than the library counts.
            const auto part = std::min<std::size_t>(bytes.size(), std::numeric_limits<uInt>::max());
            stream_.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));
            stream_.avail_in = static_cast<uInt>(part);
            bytes.remove_prefix(part);
            int state = Z_OK;
            do {
                stream_.next_out = reinterpret_cast<Bytef*>(buffer_.data());
                stream_.avail_out = static_cast<uInt>(buffer_.size());
                state = ::deflate(&stream_, isEnd && bytes.empty() ? Z_FINISH : Z_NO_FLUSH);
                if (!put(std::string_view(buffer_).substr(0, buffer_.size() - stream_.avail_out))) return false;
            } while (stream_.avail_out == 0 && state != Z_STREAM_END);
        } while (!bytes.empty());
        return true;
    }

private:
    z_stream stream_{};
    std::string buffer_ = std::string(kPackedBytes, '\0');
};

struct ZipWriter::Entry {
    std::string path;
    KsDate changed;
    mode_t mode = 0;
    std::uint16_t method = kStored;
    bool isLong = false;  ///< sizes are of 64 bits
    std::uint64_t position = 0;
    std::uint64_t size = 0;
    std::uint64_t packedSize = 0;
    std::uint32_t sum = 0;

    std::uint16_t flags() const {
        return static_cast<std::uint16_t>((method == kDeflated ? kSizesFollow : 0) |
                                          (isUtf8(path) ? kNamesAreUtf8 : 0));
    }
    /// Seconds since 1970, where they fit.
    std::string timeField() const {
        std::string field;
        if (changed.seconds < 0 || changed.seconds > std::numeric_limits<std::int32_t>::max()) return field;
        append16(field, kTimeField);
        append16(field, 5);
        field += '\x01';
        append32(field, static_cast<std::uint32_t>(changed.seconds));
        return field;
    }
    /// What both heads have in common, from the flags to the sizes.
    void appendCommon(std::string& out, bool isKnown) const {
        append16(out, flags());
        append16(out, method);
        append32(out, calendarTime(changed));
        append32(out, isKnown ? sum : 0);
        append32(out, isLong ? kIn64 : static_cast<std::uint32_t>(isKnown ? packedSize : 0));
        append32(out, isLong ? kIn64 : static_cast<std::uint32_t>(isKnown ? size : 0));
        append16(out, static_cast<std::uint16_t>(path.size()));
    }
};

ZipWriter::ZipWriter(Sink sink) : sink_(std::move(sink)), packer_(std::make_unique<Packer>()) {}

ZipWriter::~ZipWriter() = default;

bool ZipWriter::canHold(std::string_view path) {
    const auto wide = static_cast<std::size_t>(std::ranges::count(path, kBackslash.front()));
    // With the "/" that folders end with.
    return path.size() + wide * (kWideBackslash.size() - 1) < kPathBytesMax;
}

bool ZipWriter::put(std::string_view bytes) {
    if (isOver_) return false;
    position_ += bytes.size();
    if (!bytes.empty() && !sink_(bytes)) isOver_ = true;
    return !isOver_;
}

void ZipWriter::begin(Entry entry) {
    entry.position = position_;
    std::string extra = entry.timeField();
    if (entry.isLong) {
        append16(extra, kZip64Field);
        append16(extra, 16);
        append64(extra, 0);
        append64(extra, 0);
    }
    std::string head;
    append32(head, kLocalSignature);
    append16(head, kZipVersion);
    entry.appendCommon(head, /*isKnown=*/false);
    append16(head, static_cast<std::uint16_t>(extra.size()));
    put(head + entry.path + extra);
    current_ = std::make_unique<Entry>(std::move(entry));
}

void ZipWriter::list(const Entry& entry) {
    const bool isFar = entry.position >= kIn64;
    std::string extra = entry.timeField();
    if (entry.isLong || isFar) {
        append16(extra, kZip64Field);
        append16(extra, static_cast<std::uint16_t>((entry.isLong ? 16 : 0) + (isFar ? 8 : 0)));
        if (entry.isLong) {
            append64(extra, entry.size);
            append64(extra, entry.packedSize);
        }
        if (isFar) append64(extra, entry.position);
    }
    append32(central_, kCentralSignature);
    append16(central_, kMadeOnUnix | kZipVersion);
    append16(central_, kZipVersion);
    entry.appendCommon(central_, /*isKnown=*/true);
    append16(central_, static_cast<std::uint16_t>(extra.size()));
    append16(central_, 0);  // Comment.
    append16(central_, 0);  // Disk.
    append16(central_, 0);  // Whether it is text.
    append32(central_, static_cast<std::uint32_t>(entry.mode) << 16);
    append32(central_, isFar ? kIn64 : static_cast<std::uint32_t>(entry.position));
    central_ += entry.path;
    central_ += extra;
    ++entries_;
}

bool ZipWriter::addFolder(std::string_view path, const KsDate& changed) {
    Entry entry;
    entry.path = writtenPath(path) + "/";
    entry.changed = changed;
    entry.mode = S_IFDIR | 0755;
    begin(std::move(entry));
    list(*current_);
    current_.reset();
    return !isOver_;
}

bool ZipWriter::beginDocument(const Document& document) {
    Entry entry;
    entry.path = writtenPath(document.path);
    entry.changed = document.changed;
    entry.mode = S_IFREG | (document.isExecutable ? 0755 : 0644);
    // Also what is not packed goes through the packer: only so can the end of a document be found from its beginning.
    entry.method = kDeflated;
    entry.isLong = document.size > kShortSizeMax;
    packer_->restart(document.isPacked);
    begin(std::move(entry));
    return !isOver_;
}

bool ZipWriter::append(std::string_view bytes) {
    current_->size += bytes.size();
    current_->sum = static_cast<std::uint32_t>(
        ::crc32_z(current_->sum, reinterpret_cast<const Bytef*>(bytes.data()), bytes.size()));
    return packer_->pack(bytes, /*isEnd=*/false, [this](std::string_view packed) {
        current_->packedSize += packed.size();
        return put(packed);
    });
}

bool ZipWriter::endDocument() {
    packer_->pack({}, /*isEnd=*/true, [this](std::string_view packed) {
        current_->packedSize += packed.size();
        return put(packed);
    });
    std::string descriptor;
    append32(descriptor, kDescriptorSignature);
    append32(descriptor, current_->sum);
    const auto appendSize = [&](std::uint64_t size) {
        if (current_->isLong) return append64(descriptor, size);
        append32(descriptor, static_cast<std::uint32_t>(size));
    };
    appendSize(current_->packedSize);
    appendSize(current_->size);
    put(descriptor);
    list(*current_);
    current_.reset();
    return !isOver_;
}

bool ZipWriter::finish() {
    const std::uint64_t begin = position_;
    put(central_);
    const std::uint64_t size = position_ - begin;
    const std::uint64_t end = position_;
    const bool isLong = entries_ >= kCountIn64 || begin >= kIn64 || size >= kIn64;
    std::string tail;
    if (isLong) {
        append32(tail, kEnd64Signature);
        append64(tail, 44);  // Bytes of it that follow.
        append16(tail, kMadeOnUnix | kZipVersion);
        append16(tail, kZipVersion);
        append32(tail, 0);
        append32(tail, 0);
        append64(tail, entries_);
        append64(tail, entries_);
        append64(tail, size);
        append64(tail, begin);
        append32(tail, kEnd64LocatorSignature);
        append32(tail, 0);
        append64(tail, end);
        append32(tail, 1);
    }
    const auto count = static_cast<std::uint16_t>(std::min<std::uint64_t>(entries_, kCountIn64));
    append32(tail, kEndSignature);
    append16(tail, 0);
    append16(tail, 0);
    append16(tail, count);
    append16(tail, count);
    append32(tail, static_cast<std::uint32_t>(std::min<std::uint64_t>(size, kIn64)));
    append32(tail, static_cast<std::uint32_t>(std::min<std::uint64_t>(begin, kIn64)));
    append16(tail, 0);
    return put(tail);
}

}  // namespace cindral
