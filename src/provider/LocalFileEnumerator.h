#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/fs/FSChangeToken.h"

namespace cindral {

class ChangesAhead;
class FSChangesEnumerator;
class FSChangesNotifier;

/// Entries that one page of a listing consumes.
inline constexpr std::uint64_t kGatherPageEntriesMax = 200;

/// Lists what is in one or several folders, a page at a time, says where a client stands, and tells what has changed
/// since.
///
/// A page is consumed in directory order, also where the host asks for another: both initial pages list alike. A page
/// that follows is served only while it is proven that nothing was deleted since the first; otherwise the listing
/// expires, and the host begins again. Where the client follows the changes anyway (tesselInitialPageForFollowers), a
/// listing of direct children goes on: it goes back by as many entries as went. A listing waits for nothing that is not yet recorded, except that the first page
/// of several waits until what happened before it is; an anchor and changes wait for all that was complete before they
/// were asked for.
///
/// While a client reads a batch of changes that is not the last, an enumerator that reads ahead begins on the next.
///
/// What each container lists: ContainerContents.h.
///
/// Thread safety: all operations, from any thread. Pages are served on the caller's thread, changes on a queue; what was
/// read ahead, on the caller's thread as well.
class LocalFileEnumerator : public TesselEnumerator, public std::enable_shared_from_this<LocalFileEnumerator> {
public:
    /// To read ahead is for one that lives from one request to the next.
    enum class ReadsAhead { no, yes };
    /// An empty list of URLs is a programming error and stops the process. Where there can be no live updates, an error
    /// line says so, and everything else works.
    static std::shared_ptr<LocalFileEnumerator> initWithContainer(TesselItemIdentifier container,
                                                                  std::vector<KsURL> urls,
                                                                  ReadsAhead readsAhead = ReadsAhead::no);
    ~LocalFileEnumerator() override;

    const TesselItemIdentifier& container() const { return container_; }
    const std::vector<KsURL>& urls() const { return urls_; }
    /// Null where there are no live updates.
    const std::shared_ptr<FSChangesNotifier>& notifier() const { return notifier_; }

    std::optional<KsURL> enumeratedItemURL() const override { return enumeratedItemURL_; }
    void enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                   const TesselPage& page) override;
    void enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                     const TesselSyncAnchor& anchor) override;
    void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<TesselSyncAnchor>)> completion) override;
    /// Lets go of a change enumeration that has ended.
    void removeEnumerator(const std::shared_ptr<FSChangesEnumerator>& enumerator);

    void start() override;
    void stop() override;
    void invalidate() override;

private:
    LocalFileEnumerator(TesselItemIdentifier container, std::vector<KsURL> urls, ReadsAhead readsAhead);
    std::string enumeratedItemName() const;
    void hostEnumerates() const;
    void gather(TesselEnumerationObserver& observer, FSChangeToken token);
    /// None when the observer has been finished.
    std::optional<FSChangeToken> gatherToken(TesselEnumerationObserver& observer, FSChangeToken token);
    bool mayResume(TesselEnumerationObserver& observer, const FSChangeToken& token) const;
    /// One page's scan of the folders.
    struct Gathered;
    Result<Gathered> gatherEntries(const FSChangeToken& token) const;
    bool settle(FSChangeToken& token) const;
    Result<void> witness(FSChangeToken& token, const Gathered& gathered) const;
    /// Whether what is deleted meanwhile makes the listing go back instead of expire.
    bool canGoBack(const FSChangeToken& token) const;
    /// Where the listing goes on, and since when deletions count; none: it is over.
    Result<std::optional<FSChangeToken>> followingPage(const FSChangeToken& token, const Gathered& gathered) const;
    Result<TesselItems> itemsOf(Gathered gathered) const;

    /// Begins an enumeration of changes.
    void fetchChanges(std::shared_ptr<TesselChangeObserver> observer, const FSChangeToken& token, bool isAhead);
    /// Passes changes on, and reads ahead when they have been.
    class ReadingAhead;
    std::shared_ptr<ChangesAhead> makeAhead(const TesselSyncAnchor& anchor);
    /// Gives the observer what was read ahead, or what is found now.
    /// `stops` is how often enumerations had been stopped when the observer came.
    void handOver(ChangesAhead& ahead, const std::shared_ptr<TesselChangeObserver>& observer, std::uint64_t stops);
    std::uint64_t stops() const;

    // Constant after construction.
    const TesselItemIdentifier container_;
    const std::optional<KsURL> enumeratedItemURL_;  ///< where a single folder is listed
    const std::vector<KsURL> urls_;
    const std::shared_ptr<FSChangesNotifier> notifier_;
    const bool shouldUpdateFileIDInPalimp_;
    const bool readsAhead_;

    mutable Mutex mutex_;
    std::set<std::shared_ptr<FSChangesEnumerator>> enumerators_ GUARDED_BY(mutex_);
    std::shared_ptr<ChangesAhead> ahead_ GUARDED_BY(mutex_);  ///< for the next who asks, under way or done
    int aheadsToPassOver_ GUARDED_BY(mutex_) = 0;             ///< batches after which nothing is read ahead
    std::uint64_t stops_ GUARDED_BY(mutex_) = 0;
    bool isInvalidated_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
