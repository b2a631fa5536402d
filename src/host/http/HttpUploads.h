#pragma once

#include <cstdint>
#include <string>

#include "host/PresentedPaths.h"
#include "host/http/HttpConnection.h"
#include "host/http/HttpRequest.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// Takes documents that a browser sends.
///
/// The bytes go into a folder of the upload's own in the storage's temporary folder, as they come; when all are there,
/// the document is moved to its place. One that breaks off leaves nothing behind, and nobody ever sees a part of one.
///
/// Thread safety: all operations, from any thread.
class HttpUploads {
public:
    /// The first two are borrowed for life.
    HttpUploads(TesselExtension& provider, const PresentedPaths& paths, std::uint64_t bytesMax)
        : provider_(provider), paths_(paths), bytesMax_(bytesMax) {}

    /// Answers with the item, or the error, in the form of a JSON-RPC answer: `parent` and `name` are the request's
    /// parameters, its body is the document.
    HttpResponse receive(HttpConnection& connection, const HttpRequest& request) const;

private:
    using ItemResult = Result<std::shared_ptr<const TesselItem>>;
    ItemResult put(HttpConnection& connection, const std::string& parent, const std::string& name) const;
    Result<void> copyBody(HttpConnection& connection, int file) const;

    TesselExtension& provider_;
    const PresentedPaths& paths_;
    const std::uint64_t bytesMax_;
};

}  // namespace cindral
