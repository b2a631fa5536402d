#pragma once

#include <chrono>
#include <cstddef>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// Whether a name is the one that an editor gives to what it is about to replace: the original with an affix such as
/// "~", ".bak" or ".~1~".
bool isBackupName(std::string_view name, std::string_view original);

/// Documents that left their name a moment ago. What is created under such a name now takes the document over: that is
/// how editors save that don't write in place.
///
/// Thread safety: the caller's.
class RecentDepartures {
public:
    using TimePoint = std::chrono::steady_clock::time_point;
    /// How long an editor may take between moving the old file out of the way and creating the new one.
    static constexpr std::chrono::seconds kWindow{2};

    void add(FileID folder, std::string_view name, DocumentID document, TimePoint now);
    /// The document that left the name within the window, once.
    std::optional<DocumentID> take(FileID folder, std::string_view name, TimePoint now);
    /// Of what left a folder that is gone: its number may be another's soon.
    void forgetFolder(FileID folder);
    void forgetOld(TimePoint now);
    std::size_t size() const { return departures_.size(); }

private:
    struct Departure {
        DocumentID document{};
        TimePoint at;
    };
    std::map<std::pair<FileID, std::string>, Departure> departures_;
    TimePoint forgottenAt_{};
};

}  // namespace cindral
