#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/fs/FSChangeToken.h"

namespace cindral {

/// Entries that one page of a listing consumes.
inline constexpr std::uint64_t kGatherPageEntriesMax = 200;

/// Lists what is in one or several folders, a page at a time, and says where a client stands.
///
/// A page is consumed in directory order, also where the host asks for another: both initial pages list alike. A page
/// that follows is served only while it is proven that nothing changed since the first; otherwise the listing expires,
/// and the host begins again.
///
/// What each container lists: the working set everything below its folders, not descending into packages; all
/// directories the plain folders among that; every other container the direct children of its folders. Never an entry
/// named ".Trash".
///
/// Thread safety: all operations, from any thread. Pages are served on the caller's thread.
class LocalFileEnumerator : public TesselEnumerator {
public:
    /// An empty list of URLs is a programming error and stops the process.
    static std::shared_ptr<LocalFileEnumerator> initWithContainer(TesselItemIdentifier container,
                                                                  std::vector<KsURL> urls);

    const TesselItemIdentifier& container() const { return container_; }
    const std::vector<KsURL>& urls() const { return urls_; }

    void enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                   const TesselPage& page) override;
    /// No event history is kept: after the checks of the anchor, every anchor is answered as expired, never as "no
    /// changes".
    void enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                     const TesselSyncAnchor& anchor) override;
    void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<TesselSyncAnchor>)> completion) override;
    void invalidate() override {}

private:
    /// What the items of one folder have in common.
    struct FolderContext;
    class FolderContexts;

    LocalFileEnumerator(TesselItemIdentifier container, std::vector<KsURL> urls);
    std::string enumeratedItemName() const;
    void gather(TesselEnumerationObserver& observer, FSChangeToken token);
    /// None when the observer has been finished.
    std::optional<FSChangeToken> gatherToken(TesselEnumerationObserver& observer, FSChangeToken token);
    bool mayResume(TesselEnumerationObserver& observer, const FSChangeToken& token) const;
    Result<void> witness(FSChangeToken& token, const std::vector<KsURL>& entries, bool isFull) const;
    Result<TesselItems> itemsOf(std::vector<KsURL> entries) const;

    const TesselItemIdentifier container_;
    const std::optional<KsURL> enumeratedItemURL_;  ///< where a single folder is listed
    const std::vector<KsURL> urls_;
};

}  // namespace cindral
