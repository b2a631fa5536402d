#pragma once

#include <string>
#include <string_view>

#include "host/PresentedPaths.h"
#include "platform/tessel/TesselItem.h"

namespace cindral {

/// Writes items as the host interface has them: JSON objects, absent values as absent keys.
///
/// Written straight into the answer's text, because a listing is mostly this. Items of one folder share the folder's
/// part of the URL, which is encoded once.
///
/// Thread safety: for one thread at a time.
class ItemWriter {
public:
    /// `paths` is borrowed for life.
    explicit ItemWriter(const PresentedPaths& paths) : paths_(paths) {}

    /// Makes room for that many items of ordinary length, and a little more. Growing a page's text on the way costs
    /// more than writing it.
    static void reserve(std::string& out, std::size_t items);

    void append(std::string& out, const TesselItem& item);
    std::string text(const TesselItem& item);

private:
    void appendFileURL(std::string& out, const KsURL& url);

    const PresentedPaths& paths_;
    std::string folder_;     ///< as presented, with its trailing slash; empty before the first
    std::string folderURL_;  ///< the same as clients see it
};

}  // namespace cindral
