#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/revisions/VolumeStore.h"

// The directory index and the event journal: what the recorder keeps in the volume store.

namespace cindral {

/// What the recorder saw of an object when it last looked.
///
/// Thread safety: a value; `name` is borrowed from whoever gave it.
struct IndexedObject {
    FileID fileID{};
    std::int64_t birthTime = 0;  ///< ns since 1970, 0 where the file system has none
    FileID parent{};
    std::string_view name = {};
    ObjectKind kind = ObjectKind::other;
    std::int64_t changeTime = 0;  ///< ns since 1970; 0: listed before the recorder ever looked at it
    std::uint64_t size = 0;       ///< bytes; of a folder 0
    bool isClosed = false;        ///< a folder that could not be read
    bool hasOtherNames = false;   ///< more than one hard link

    // The store's own: recording an object leaves them as they are.
    DocumentID documentID{};
    bool isListed = false;      ///< somebody was given its identifier
    std::uint64_t eventID = 0;  ///< of its event; 0 for none
};

/// One event of the journal.
struct JournalEvent {
    enum class Kind : std::uint8_t {
        present = 1,   ///< the object is to be looked at where it is now: `parent`, `name` and `objectKind` are today's
        departed = 2,  ///< the object left the place `parent`, `name`; see `goesOn`
        document = 3,  ///< `documentID` went from `fileID` to `target`
    };
    std::uint64_t id = 0;
    Kind kind = Kind::present;
    FileID fileID{};
    DocumentID documentID{};  ///< that the object has, or had when it departed
    FileID parent{};
    std::string name = {};
    ObjectKind objectKind = ObjectKind::other;
    std::string path = {};  ///< departed only: where it was below its root when it left, should `parent` be gone, too
    FileID root{};          ///< departed only: the root that `path` is below
    bool goesOn = false;    ///< departed only: it was listed as the same object elsewhere after it
    FileID target{};        ///< document only; 0: the document no longer exists
    // Present only: as in IndexedObject.
    std::int64_t birthTime = 0;
    std::int64_t changeTime = 0;
    std::uint64_t size = 0;
};

/// Changes of the index, collected in order, that VolumeStore::apply() carries out in one transaction together with
/// the events that they mean.
///
/// Thread safety: the caller's.
class IndexChanges {
public:
    /// Whether what is recorded becomes an event. `no` for the first reading of a new store.
    enum class Journal { no, yes };
    explicit IndexChanges(Journal journal = Journal::yes) : journal_(journal) {}

    /// Records an object that is there. It gets a new event in place of its old one. When it was recorded elsewhere
    /// (same birth time), it departs from there; when another object had its number, that one is removed first.
    void put(const IndexedObject& object);
    /// Forgets an object: it departs, and its document with it. Not its children: remove them first, or don't have any.
    void remove(FileID fileID);
    /// Gives the object a new event, and changes nothing.
    void touch(FileID fileID);
    /// One more name of an object that is recorded under another, and the end of one.
    void addName(FileID fileID, FileID parent, std::string_view name);
    void removeName(FileID fileID, FileID parent, std::string_view name);
    /// The object is no longer what it was in the folder, although it did not move: the folder is another than the one
    /// that it is in, and has taken that one's document over.
    void leave(FileID fileID, FileID folder);
    /// `to`, which must be recorded, takes the document over from whatever has it. A document that `to` had before is
    /// reported as gone.
    void handOver(DocumentID document, FileID to);

    bool empty() const { return operations_.empty(); }
    std::size_t size() const { return operations_.size(); }
    Journal journal() const { return journal_; }

    struct Operation {
        enum class Kind { put, remove, touch, addName, removeName, leave, handOver };
        Kind kind = Kind::put;
        IndexedObject object;  ///< its name points into `names`, by offset until it is read: nameOf()
        DocumentID document{};
        std::size_t nameBegin = 0;
        std::size_t nameSize = 0;
    };
    const std::vector<Operation>& operations() const { return operations_; }
    std::string_view nameOf(const Operation& operation) const {
        return std::string_view(names_).substr(operation.nameBegin, operation.nameSize);
    }

private:
    void add(Operation operation, std::string_view name);
    const Journal journal_;
    std::vector<Operation> operations_;
    std::string names_;
};

}  // namespace cindral
