#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "host/http/HttpConnection.h"
#include "host/http/HttpRequest.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/UniqueFd.h"
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
    /// Under which a document is shown, and everything else that is not the page's own: nothing is loaded, nothing
    /// runs, and whose it is, is nobody's.
    static constexpr std::string_view kPolicy =
        "sandbox; default-src 'none'; style-src 'unsafe-inline'; frame-ancestors 'self'";

    /// Borrowed for life.
    explicit HttpDocuments(TesselExtension& provider) : provider_(provider) {}

    /// Answers with the bytes of the document, all or the range that is asked for. `saves`: to be saved, whatever it
    /// is.
    void answer(HttpConnection& connection, const HttpRequest& request, const TesselItemIdentifier& identifier,
                bool saves) const;
    /// The picture that stands for an item.
    HttpResponse thumbnail(const TesselItemIdentifier& identifier, unsigned pixels) const;

    /// A document as it is right now.
    struct Opened {
        UniqueFd fd;
        std::uint64_t size;
        KsDate changed;
        bool isExecutable;
        std::string name;
        std::string typeIdentifier;
    };
    /// The very document of that identifier, whatever stands under its name: a link leads nowhere, and nothing that
    /// would have to be waited for is opened.
    Result<Opened> open(const TesselItemIdentifier& identifier) const;

    /// Whether it is one as the provider writes them. The provider itself takes a number for what it begins with.
    static bool isIdentifier(std::string_view text);
    /// What to answer to an error.
    static int statusOf(const KsError& error);
    /// The field that says how a document is called, and whether it is to be saved.
    static std::string dispositionOf(std::string_view name, bool isShown);

private:
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

    /// What a Range field asks of that many bytes: all where it is none that is known, none where it lies beyond the
    /// end.
    static std::optional<ByteRange> parse(std::string_view field, std::uint64_t size);
};

}  // namespace cindral
