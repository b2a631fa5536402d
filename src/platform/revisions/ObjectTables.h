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
    HighWaterMarks marks;            ///< a second copy of the high-water file's
    std::uint64_t appliedBatch = 0;  ///< the last batch of the log that the tables hold
    DocumentID settledDocument{};    ///< documents above it are of a checkpoint that was not finished
};

/// The code of an error that says: what is on the disk is not what was written there.
inline constexpr int kDamageCode = EUCLEAN;

/// The store's tables in an LMDB file: objects by file ID, documents by document ID, and a head.
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
    /// Names the state of the file: the same number, the same contents.
    std::uint64_t lastTransaction() const;

    /// A moment of the tables. What it gave lives as long as it.
    class Snapshot {
    public:
        explicit Snapshot(const ObjectTables& tables);
        ~Snapshot();
        Snapshot(const Snapshot&) = delete;
        Snapshot& operator=(const Snapshot&) = delete;

        std::optional<PackedRecord> object(FileID fileID) const;
        std::optional<DocumentRecord> document(DocumentID documentID) const;
        /// Many objects at once, several times faster than one after the other.
        Result<void> objects(std::span<tablepages::Lookup> lookups) const;

    private:
        std::optional<tablepages::Tree> objectTree(const std::byte** map) const;
        const ObjectTables& tables_;
        MDB_txn* transaction_ = nullptr;
        Result<void> status_;
    };

    /// Called after each of the transactions that one write takes. For tests.
    using StepObserver = std::function<void()>;

    /// Writes all of the overlay, then the head. On the disk when it returns.
    ///
    /// Takes several transactions, of about `pagesMax` changed pages, which are in memory until it ends; each leaves
    /// tables that are good, and doing it
    /// again from the start ends the same. Documents come first: an object never names a document that is missing.
    Result<void> write(const Overlay& overlay, const TablesHead& head, std::size_t pagesMax,
                       const StepObserver& observer);

    /// Takes back the documents above the settled one whose object was not written with them.
    Result<void> removeUnsettledDocuments();

private:
    ObjectTables() = default;

    /// Answers a code of the library, 0 for "commit".
    using Body = std::function<int(MDB_txn*)>;
    Result<void> inTransaction(const Body& body);
    int inTransactionOnce(const Body& body);
    class Putter;
    Result<void> sync();
    std::uint64_t entriesOf(MDB_dbi table) const;

    Result<void> openEnvironment(const std::string& path, std::size_t mapBytes);
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
