#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "host/http/HttpConnection.h"
#include "host/http/HttpRequest.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// Documents' bytes for a browser.
///
/// A document is somebody else's: it may be a page that would act in the person's name. So what a browser would run is
/// handed over as something to be saved; what it shows, it shows walled off from everything else, under a policy that
/// allows nothing.
///
/// Thread safety: all operations, from any thread.
class HttpDocuments {
public:
    /// Borrowed for life.
    explicit HttpDocuments(TesselExtension& provider) : provider_(provider) {}

    /// Answers with the bytes of the document, all or the range that is asked for. `saves`: to be saved, whatever it is.
    void answer(HttpConnection& connection, const HttpRequest& request, const TesselItemIdentifier& identifier,
                bool saves) const;
    /// The picture that stands for an item.
    HttpResponse thumbnail(const TesselItemIdentifier& identifier, unsigned pixels) const;

private:
    struct Opened;
    Result<Opened> open(const TesselItemIdentifier& identifier) const;
    Result<Opened> openOnce(const TesselItemIdentifier& identifier) const;

    TesselExtension& provider_;
};

/// How a document of a type is served.
struct ServedType {
    std::string contentType;
    bool isShown;  ///< else it is to be saved
    static ServedType of(std::string_view typeIdentifier);
};

/// A part of something.
struct ByteRange {
    std::uint64_t offset = 0;
    std::uint64_t length = 0;

    /// What a Range field asks of that many bytes: all where it is none that is known, none where it lies beyond the end.
    static std::optional<ByteRange> parse(std::string_view field, std::uint64_t size);
};

}  // namespace cindral
