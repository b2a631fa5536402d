#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/foundation/Data.h"
#include "platform/foundation/KsUUID.h"

namespace cindral {

/// A client's place in an enumeration: which changes it has seen, on which volume, and how far its listing came.
///
/// It is the content of every page and every sync anchor that the provider hands out. A page carries the event ID of
/// the moment at which its listing began and the offset that it reached; an anchor carries the current event ID and
/// offset 0.
///
/// Encoded form: docs/change-token.md. Equal tokens have equal bytes.
///
/// Thread safety: a value; copy it freely.
struct FSChangeToken {
    /// Clients keep tokens for as long as they like: add numbers, never change one.
    static constexpr std::uint64_t kCurrentVersion = 1;
    /// Bytes that are worth looking at. A token has about 200; a client may send megabytes.
    static constexpr std::size_t kEncodedSizeMax = 16'384;

    std::uint64_t version = kCurrentVersion;
    KsUUID deviceUUID;                         ///< volume that streamEventID belongs to
    std::uint64_t streamEventID = 0;           ///< changes after this event are still to be read
    std::uint64_t offset = 0;                  ///< directory entries consumed by the gather phase
    std::uint64_t appLibraryVersionToken = 0;  ///< app-library list that was reported; 0 where none takes part
    bool isForFollower = false;                ///< of a listing that began with tesselInitialPageForFollowers()

    /// Never fails.
    Bytes encode() const;
    /// Reads what encode() wrote.
    ///
    /// Returns none, after one error line, when the bytes are no property list, lack a key, hold a value of another
    /// type or a text that is no UUID, are more than kEncodedSizeMax, or are a token of another version. Keys beyond
    /// these are ignored.
    static std::optional<FSChangeToken> decode(ByteView bytes);

    /// All fields, for log lines.
    std::string description() const;

    friend bool operator==(const FSChangeToken&, const FSChangeToken&) = default;
};

}  // namespace cindral
