#pragma once

#include <map>
#include <memory>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/Dispatch.h"
#include "provider/ProviderFixture.h"
#include "provider/ScriptedHistory.h"
#include "provider/fs/FSChangeToken.h"

namespace cindral::test {

/// What an observer of changes got, in the order in which it came: "u" and the item's name, or "d" and the identifier.
struct GivenChanges {
    std::vector<std::pair<char, std::string>> log;
    TesselItems updated;
    std::vector<TesselItemIdentifier> deleted;
    std::optional<TesselSyncAnchor> anchor;
    bool moreComing = false;
    std::optional<KsError> error;

    std::vector<std::string> updatedNames() const;
    FSChangeToken token() const { return *FSChangeToken::decode(*anchor); }
};

class RecordingChangeObserver : public TesselChangeObserver {
public:
    void didUpdateItems(TesselItems items) override;
    void didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) override;
    void finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) override;
    void finishEnumeratingWithError(const KsError& error) override;

    /// Once it is finished.
    const GivenChanges& wait();
    int finishes() const { return finishes_; }

    GivenChanges given;

private:
    std::atomic<int> finishes_ = 0;
    DispatchSemaphore finished_{0};
};

/// A storage whose events the test says, as a recorder would: what happened is said after it happened.
class HistoryTest : public ProviderTest {
protected:
    HistoryTest();
    ~HistoryTest() override;

    std::uint64_t fileID(std::string_view name) const;
    TesselItemIdentifier identifier(std::string_view name) const;
    DocumentID documentID(std::string_view name) const;

    /// Records where the object is now, as listings do, and a recorder.
    void record(std::string_view name);
    /// The object is to be looked at, where it is now.
    std::uint64_t changed(std::string_view name);
    ObjectKind kindOf(std::string_view name) const;
    /// What had the numbers left the place.
    std::uint64_t left(std::string_view name, std::uint64_t fileID, ObjectKind kind = ObjectKind::other,
                       DocumentID documentID = {});
    std::uint64_t documentWent(DocumentID document, std::uint64_t source, std::uint64_t target);
    /// The folder that holds the object has changed, too.
    void folderChanged(std::string_view name);
    /// rename(), recorded and told.
    void move(std::string_view from, std::string_view to);
    /// A file or folder that was just made, recorded and told.
    void made(std::string_view name);
    /// unlink() or rmdir(), told.
    void remove(std::string_view name);

    /// One request for changes.
    static GivenChanges changes(TesselEnumerator& enumerator, const TesselSyncAnchor& anchor);
    /// Until no more is coming; fails the test when it ends with an error.
    static GivenChanges allChanges(TesselEnumerator& enumerator, TesselSyncAnchor anchor);
    static TesselSyncAnchor anchorOf(TesselEnumerator& enumerator);

    std::shared_ptr<ScriptedHistory> history_;
    LogCapture log_;
};

/// A client's view of a container: it lists once, and from then on applies changes.
class ClientView {
public:
    ClientView(TesselItems items, TesselSyncAnchor anchor);
    void apply(const GivenChanges& changes);
    const TesselSyncAnchor& anchor() const { return anchor_; }
    /// Equal when every item has the same identifier, parent, name, sizes and version.
    std::map<TesselItemIdentifier, std::string> contents() const;
    static std::map<TesselItemIdentifier, std::string> contentsOf(const TesselItems& items);

private:
    void takeOut(const TesselItemIdentifier& identifier);
    std::map<TesselItemIdentifier, std::shared_ptr<const TesselItem>> items_;
    TesselSyncAnchor anchor_;
};

}  // namespace cindral::test
