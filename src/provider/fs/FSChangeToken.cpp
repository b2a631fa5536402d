#include "provider/fs/FSChangeToken.h"

#include <fmt/format.h>

#include <cerrno>

#include "platform/foundation/Log.h"
#include "platform/foundation/PropertyList.h"
#include "platform/foundation/Result.h"

namespace cindral {

namespace {

// Names of the fields in the encoded form: never change one.
constexpr const char* kVersionKey = "version";
constexpr const char* kDeviceUUIDKey = "deviceUUID";
constexpr const char* kStreamEventIDKey = "streamEventID";
constexpr const char* kOffsetKey = "offset";
constexpr const char* kAppLibraryVersionTokenKey = "appLibraryVersionToken";
constexpr const char* kIsForFollowerKey = "isForFollower";

KsError undecodable(std::string message) {
    return {kKsPOSIXErrorDomain, EINVAL, {{"message", std::move(message)}}};
}

Result<std::uint64_t> integer(const PropertyList& list, const char* key) {
    const PropertyList* value = list.find(key);
    if (!value) return undecodable(fmt::format("no value for \"{}\"", key));
    // Booleans, reals and negative integers are other types.
    if (!value->unsignedInteger()) return undecodable(fmt::format("no unsigned integer for \"{}\"", key));
    return *value->unsignedInteger();
}

Result<KsUUID> uuid(const PropertyList& list, const char* key) {
    const PropertyList* value = list.find(key);
    if (!value) return undecodable(fmt::format("no value for \"{}\"", key));
    const std::optional<KsUUID> parsed = value->string() ? KsUUID::parse(*value->string()) : std::nullopt;
    if (!parsed) return undecodable(fmt::format("no UUID for \"{}\"", key));
    return *parsed;
}

Result<FSChangeToken> tokenFrom(ByteView bytes) {
    if (bytes.size() > FSChangeToken::kEncodedSizeMax) return undecodable("too large for a token");
    const PropertyList list = TRY(PropertyList::decodeBinary(bytes));
    const FSChangeToken token{
        .version = TRY(integer(list, kVersionKey)),
        .deviceUUID = TRY(uuid(list, kDeviceUUIDKey)),
        .streamEventID = TRY(integer(list, kStreamEventIDKey)),
        .offset = TRY(integer(list, kOffsetKey)),
        .appLibraryVersionToken = TRY(integer(list, kAppLibraryVersionTokenKey)),
        .isForFollower = list.find(kIsForFollowerKey) != nullptr,
    };
    return token;
}

std::string textOf(const KsError& error) {
    const auto message = error.userInfo().find("message");
    return message == error.userInfo().end() ? error.description()
                                             : fmt::format("{}: {}", error.description(), message->second);
}

}  // namespace

Bytes FSChangeToken::encode() const {
    PropertyList::Dictionary fields{
        {kVersionKey, version},
        {kDeviceUUIDKey, deviceUUID.string()},
        {kStreamEventIDKey, streamEventID},
        {kOffsetKey, offset},
        {kAppLibraryVersionTokenKey, appLibraryVersionToken},
    };
    if (isForFollower) fields.emplace(kIsForFollowerKey, std::uint64_t{1});
    return PropertyList(std::move(fields)).encodeBinary();
}

std::optional<FSChangeToken> FSChangeToken::decode(ByteView bytes) {
    const Result<FSChangeToken> token = tokenFrom(bytes);
    if (token) return *token;
    logError("can't decode token from provided data; {}", textOf(token.error()));
    return std::nullopt;
}

std::string FSChangeToken::description() const {
    return fmt::format(
        "<FSChangeToken version: {}, deviceUUID: {}, streamEventID: {}, offset: {}, appLibraryVersionToken: {}>",
        version, deviceUUID.string(), streamEventID, offset, appLibraryVersionToken);
}

}  // namespace cindral
