#pragma once

#include <lmdb.h>

#include <cerrno>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/foundation/KsUUID.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/Result.h"
#include "platform/revisions/HighWaterFile.h"
#include "platform/revisions/Overlay.h"
#include "platform/revisions/TablePages.h"

namespace cindral {

/// What the tables say of themselves, written anew with every checkpoint.
struct TablesHead {
    KsUUID uuid;
    HighWaterMarks marks;              ///< a second copy of the high-water file's
    std::uint64_t appliedBatch = 0;    ///< the last batch of the log that the tables hold
    DocumentID settledDocument{};      ///< documents above it are of a checkpoint that was not finished
    std::uint64_t begunBatch = 0;      ///< the last batch of the newest checkpoint, finished or not
    std::uint64_t forgottenEvent = 0;  ///< no event up to it is there any more
    bool hasHistory = false;           ///< what happened after it is in the journal
    NameHashKey nameHashKey{};
};

/// The code of an error that says: what is on the disk is not what was written there.
inline constexpr int kDamageCode = EUCLEAN;

/// The store's tables in an LMDB file: objects by file ID and by folder, documents, events, and a head.
///
/// Which objects are in a folder, and which events of objects are still good, follows from the objects' records; whoever
/// reads it looks at the record.
///
/// Every commit is on the disk before the next one may need it, in the order that the library's promise of whole
/// transactions over a power cut rests on. Format: docs/volume-store.md.
///
/// Thread safety: reading from any thread at any time; one writer at a time.
class ObjectTables {
public:
    /// Makes a file with empty tables and puts it, whole, in the place of `path`.
    static Result<void> create(const std::string& path, const TablesHead& head);
    /// Error of kDamageCode, with a "message", when what is there can't be the tables. `mapBytes` of address space
    /// are asked for, less where the process may not have so much.
    static Result<std::unique_ptr<ObjectTables>> open(const std::string& path, std::size_t mapBytes);
    ~ObjectTables();
    ObjectTables(const ObjectTables&) = delete;
    ObjectTables& operator=(const ObjectTables&) = delete;

    const TablesHead& head() const { return head_; }
    std::uint64_t objectCount() const;
    std::uint64_t documentCount() const;
    std::uint64_t eventCount() const;
    /// Names the state of the file: the same number, the same contents.
    std::uint64_t lastTransaction() const;

    /// A moment of the tables. What it gave lives as long as it.
    class Snapshot {
    public:
        explicit Snapshot(const ObjectTables& tables);
        ~Snapshot();
        Snapshot(const Snapshot&) = delete;
        Snapshot& operator=(const Snapshot&) = delete;

        /// Reading answers "nothing" where the tables could not be opened; this tells.
        const Result<void>& status() const { return status_; }

        std::optional<PackedRecord> object(FileID fileID) const;
        std::optional<DocumentRecord> document(DocumentID documentID) const;
        /// Many objects at once, several times faster than one after the other.
        Result<void> objects(std::span<tablepages::Lookup> lookups) const;

        /// Calls back with the objects from an ID on, in the order of their IDs, until it answers false.
        Result<void> allObjects(std::uint64_t from,
                                const std::function<bool(FileID, const PackedRecord&)>& receive) const;

        std::uint64_t childCount(FileID parent) const;
        /// Objects in the folder whose names have the hash.
        Result<std::vector<FileID>> childrenWithHash(FileID parent, std::uint32_t hash) const;
        /// Every object in the folder, some at a time.
        Result<void> children(FileID parent, const std::function<void(std::span<const FileID>)>& receive) const;

        bool hasNames() const;
        Result<std::vector<std::pair<NameKey, std::string>>> names(FileID fileID) const;
        Result<std::vector<NameKey>> namesWithHash(FileID parent, std::uint32_t hash) const;
        std::optional<std::string_view> name(const NameKey& key) const;
        std::optional<ByteView> attributes(DocumentID documentID) const;

        /// Calls back with events after the ID in their order, until it answers false.
        using EventReceiver = std::function<bool(std::uint64_t, ByteView)>;
        Result<void> events(std::uint64_t after, const EventReceiver& receive) const;
        Result<void> documentChanges(std::uint64_t after, const EventReceiver& receive) const;
        /// Moments at which events were journalled, in the order of the events.
        Result<std::vector<std::pair<std::uint64_t, std::int64_t>>> timeMarks() const;

    private:
        std::optional<tablepages::Tree> objectTree(const std::byte** map) const;
        Result<void> readEvents(MDB_dbi table, std::uint64_t after, const EventReceiver& receive) const;
        const ObjectTables& tables_;
        MDB_txn* transaction_ = nullptr;
        Result<void> status_;
    };

    /// Called after each of the transactions that one write takes. For tests.
    using StepObserver = std::function<void()>;

    /// Writes all of the overlay, then the head. On the disk when it returns.
    ///
    /// Takes several transactions, of about `pagesMax` changed pages, which are in memory until it ends; each leaves
    /// tables that are good, and doing it again from the start ends the same. Documents and events come first: an object
    /// never names one that is missing. Where it was not done to the end, and is not done again, only the list of
    /// children can be wrong: `begunBatch` tells.
    Result<void> write(const Overlay& overlay, const TablesHead& head, std::size_t pagesMax,
                       const StepObserver& observer);

    /// Takes back the documents above the settled one whose object was not written with them.
    Result<void> removeUnsettledDocuments();
    /// Makes the list of the folders' children anew from the objects.
    Result<void> rebuildChildren();

    /// Forgets every event, and writes the head, in one transaction.
    Result<void> forgetEvents(const TablesHead& head);
    /// The ID of the last event to be forgotten so that so many remain; 0 where there are no more.
    Result<std::uint64_t> lastEventBeyond(std::uint64_t eventsMax) const;
    /// Writes the head, and then forgets the events up to its `forgottenEvent`. Answers how many.
    Result<std::uint64_t> forgetEventsAsSaid(const TablesHead& head);
    Result<void> writeHead(const TablesHead& head);

private:
    ObjectTables() = default;

    /// Answers a code of the library, 0 for "commit".
    using Body = std::function<int(MDB_txn*)>;
    Result<void> inTransaction(const Body& body);
    int inTransactionOnce(const Body& body);
    class Writer;
    struct Child;
    struct Work;
    Result<std::vector<Child>> changedChildren(const std::vector<Overlay::Object>& objects) const;
    Result<std::vector<Child>> childrenFrom(std::optional<std::uint64_t>& from) const;
    Result<void> addChanges(std::span<const Overlay::Object> objects, std::vector<Child>& changes) const;
    Result<std::uint64_t> forgetSome(MDB_dbi table, std::uint64_t upTo);
    Result<void> sync();
    std::uint64_t entriesOf(MDB_dbi table) const;

    Result<void> openEnvironment(const std::string& path, std::size_t mapBytes);
    struct TableToOpen {
        const char* name = nullptr;
        unsigned flags = 0;
        MDB_dbi* table = nullptr;
    };
    Result<void> openTables(bool create, std::span<const TableToOpen> tables);
    Result<void> openHead(bool create);
    Result<void> openTables(bool create);
    Result<void> loadHead();
    Result<void> growMap();
    static int putHead(MDB_txn* transaction, MDB_dbi table, const TablesHead& head);

    Result<MDB_txn*> takeReader() const;
    void giveBackReader(MDB_txn* transaction) const;

    // Constant once open.
    MDB_env* environment_ = nullptr;
    MDB_dbi tableOfTables_ = 0;
    MDB_dbi meta_ = 0;
    MDB_dbi objects_ = 0;
    MDB_dbi documents_ = 0;
    MDB_dbi children_ = 0;
    MDB_dbi names_ = 0;
    MDB_dbi attributes_ = 0;
    MDB_dbi events_ = 0;
    MDB_dbi documentChanges_ = 0;
    MDB_dbi timeMarks_ = 0;
    std::size_t pageBytes_ = 0;
    bool pagesAreKnown_ = false;

    // The writer's.
    TablesHead head_;

    mutable Mutex readersMutex_;
    mutable Condition readersChanged_;
    mutable std::vector<MDB_txn*> idleReaders_ GUARDED_BY(readersMutex_);
    mutable std::size_t busyReaders_ GUARDED_BY(readersMutex_) = 0;
    bool mapMoves_ GUARDED_BY(readersMutex_) = false;
};

}  // namespace cindral
