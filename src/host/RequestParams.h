#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "host/JsonRpcMessage.h"
#include "host/JsonRpcServer.h"
#include "platform/foundation/Data.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/KsURL.h"
#include "platform/tessel/TesselTypes.h"

namespace cindral {

/// The parameters of one request. A value that is not what it should be is answered at once, and none comes back.
///
/// Thread safety: for one thread at a time.
class RequestParams {
public:
    /// Both borrowed for life.
    RequestParams(const Json& params, JsonRpcReply& reply) : params_(params), reply_(reply) {}

    bool has(const char* name) const { return params_.contains(name); }
    bool isNull(const char* name) const { return has(name) && params_.at(name).is_null(); }

    std::optional<std::string> string(const char* name) const;
    std::optional<std::vector<std::string>> strings(const char* name) const;
    /// A file's name: "name", or "encodedName", percent-encoded, which holds any bytes.
    std::optional<std::string> filename() const;
    std::optional<KsDate> date(const char* name) const;
    std::optional<std::int64_t> integer(const char* name) const;
    /// The bytes of a page or an anchor. What they say is the provider's to judge.
    std::optional<Bytes> base64(const char* name) const;
    std::optional<KsURL> urlOrPath() const;
    /// Where a listing begins: the page that was handed out, or the first one in the order asked for.
    std::optional<TesselPage> page() const;

    /// A value that may be absent or null. False when it is neither that nor what it should be.
    bool optionalString(const char* name, std::optional<std::string>& value) const;
    bool optionalFilename(std::optional<std::string>& value) const;
    bool optionalBoolean(const char* name, bool& value) const;

private:
    std::nullopt_t refuse(std::string_view message) const;
    std::optional<KsURL> url() const;
    std::optional<KsURL> path() const;

    const Json& params_;
    JsonRpcReply& reply_;
};

}  // namespace cindral
