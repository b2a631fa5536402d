#pragma once

#include <lmdb.h>

#include <array>
#include <bit>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>

#include "platform/foundation/Result.h"
#include "platform/revisions/NameHash.h"
#include "platform/revisions/ObjectTables.h"
#include "platform/revisions/PackedRecord.h"

// Keys and values as the tables' library takes them.

namespace cindral::tablekeys {

inline MDB_val valueOf(ByteView bytes) {
    return {bytes.size(),
            const_cast<std::byte*>(bytes.data())};  // NOLINT: the library takes no const, and does not write.
}

inline ByteView viewOf(const MDB_val& value) {
    return {static_cast<const std::byte*>(value.mv_data), value.mv_size};
}

/// A number as the library's integer keys want it: in the machine's own order.
template <typename Number>
class IntegerKey {
public:
    explicit IntegerKey(Number number) : number_(number) {}
    MDB_val* value() { return &value_; }

private:
    Number number_;
    MDB_val value_{sizeof number_, &number_};
};

inline bool isDamage(int code) {
    return code == MDB_INVALID || code == MDB_CORRUPTED || code == MDB_PAGE_NOTFOUND || code == MDB_VERSION_MISMATCH ||
           code == MDB_INCOMPATIBLE || code == MDB_NOTFOUND || code == MDB_CURSOR_FULL || code == MDB_PAGE_FULL;
}

inline KsError errorOf(int code) {
    if (code > 0) return KsError::posix(code);
    if (code == MDB_MAP_FULL) return KsError::posix(ENOSPC);
    return KsError::posix(isDamage(code) ? kDamageCode : EIO).with("message", mdb_strerror(code));
}

inline KsError damage(std::string message) {
    return KsError::posix(kDamageCode).with("message", std::move(message));
}

/// Closes itself. Made for a transaction that is good.
class Cursor {
public:
    Cursor(MDB_txn* transaction, MDB_dbi table) { code_ = mdb_cursor_open(transaction, table, &cursor_); }
    ~Cursor() {
        if (cursor_ != nullptr) mdb_cursor_close(cursor_);
    }
    Cursor(const Cursor&) = delete;
    Cursor& operator=(const Cursor&) = delete;

    MDB_cursor* get() const { return cursor_; }
    int code() const { return code_; }
    int get(MDB_val* key, MDB_val* value, MDB_cursor_op operation) const {
        return code_ != 0 ? code_ : mdb_cursor_get(cursor_, key, value, operation);
    }
    int put(MDB_val* key, MDB_val* value, unsigned flags) const {
        return code_ != 0 ? code_ : mdb_cursor_put(cursor_, key, value, flags);
    }
    int remove() const { return code_ != 0 ? code_ : mdb_cursor_del(cursor_, 0); }

private:
    MDB_cursor* cursor_ = nullptr;
    int code_ = 0;
};

/// Numbers whose bytes are in the order of the numbers.
template <typename Integer>
void storeOrdered(std::byte* to, Integer value) {
    for (std::size_t i = 0; i < sizeof value; ++i) {
        to[i] = static_cast<std::byte>(value >> (8 * (sizeof value - 1 - i)));
    }
}

template <typename Integer>
Integer loadOrdered(const std::byte* from) {
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < sizeof(Integer); ++i) value = (value << 8) | static_cast<std::uint64_t>(from[i]);
    return static_cast<Integer>(value);
}

// A value of `children`: hash of the name, file ID.
inline constexpr std::size_t kChildBytes = 4 + 8;

inline std::array<std::byte, kChildBytes> encodeChild(std::uint32_t hash, FileID fileID) {
    std::array<std::byte, kChildBytes> bytes{};
    storeOrdered(bytes.data(), hash);
    storeOrdered(bytes.data() + 4, static_cast<std::uint64_t>(fileID));
    return bytes;
}

inline std::uint32_t hashOfChild(ByteView bytes) {
    return loadOrdered<std::uint32_t>(bytes.data());
}

inline FileID fileIDOfChild(ByteView bytes) {
    return FileID{loadOrdered<std::uint64_t>(bytes.data() + 4)};
}

// Keys of `names`: by object, whose value is the name, and by place, whose value is empty. Written to disk: never change
// one.
inline constexpr std::byte kByObject{1};
inline constexpr std::byte kByPlace{2};
inline constexpr std::size_t kNameKeyBytes = 1 + 8 + 8 + 4 + 2;
using NameKeyBytes = std::array<std::byte, kNameKeyBytes>;

inline NameKeyBytes encodeNameKey(const NameKey& key) {
    NameKeyBytes bytes{kByObject};
    storeOrdered(bytes.data() + 1, static_cast<std::uint64_t>(key.fileID));
    storeOrdered(bytes.data() + 9, static_cast<std::uint64_t>(key.parent));
    storeOrdered(bytes.data() + 17, key.hash);
    storeOrdered(bytes.data() + 21, key.index);
    return bytes;
}

inline std::optional<NameKey> decodeNameKey(ByteView bytes) {
    if (bytes.size() != kNameKeyBytes || bytes[0] != kByObject) return std::nullopt;
    return NameKey{.fileID = FileID{loadOrdered<std::uint64_t>(bytes.data() + 1)},
                   .parent = FileID{loadOrdered<std::uint64_t>(bytes.data() + 9)},
                   .hash = loadOrdered<std::uint32_t>(bytes.data() + 17),
                   .index = loadOrdered<std::uint16_t>(bytes.data() + 21)};
}

inline NameKeyBytes encodeNamePlace(const NameKey& key) {
    NameKeyBytes bytes{kByPlace};
    storeOrdered(bytes.data() + 1, static_cast<std::uint64_t>(key.parent));
    storeOrdered(bytes.data() + 9, key.hash);
    storeOrdered(bytes.data() + 13, static_cast<std::uint64_t>(key.fileID));
    storeOrdered(bytes.data() + 21, key.index);
    return bytes;
}

inline std::optional<NameKey> decodeNamePlace(ByteView bytes) {
    if (bytes.size() != kNameKeyBytes || bytes[0] != kByPlace) return std::nullopt;
    return NameKey{.fileID = FileID{loadOrdered<std::uint64_t>(bytes.data() + 13)},
                   .parent = FileID{loadOrdered<std::uint64_t>(bytes.data() + 1)},
                   .hash = loadOrdered<std::uint32_t>(bytes.data() + 9),
                   .index = loadOrdered<std::uint16_t>(bytes.data() + 21)};
}

}  // namespace cindral::tablekeys
