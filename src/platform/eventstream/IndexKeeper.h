#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/eventstream/EventSource.h"
#include "platform/eventstream/SafeSave.h"
#include "platform/eventstream/SeenFiles.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/Sys.h"
#include "platform/revisions/VolumeIndex.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// Keeps the directory index what the tree is, and journals the difference.
///
/// Events of the kernel only say where to look. What is journalled is what was found there: an object is what statx
/// says it is, under the name by which it was reached, and the same as one in the index when file number and birth
/// time are.
///
/// Work is done in rounds. A round looks at everything that is dirty, and finds objects that came, moved or changed,
/// and names that lost their object. A lost one is only given up when everything that was dirty by then has been
/// looked at as well: until then it may turn up elsewhere, and was only moved.
///
/// Thread safety: the caller's.
class IndexKeeper {
public:
    using Journal = IndexChanges::Journal;

    struct Options {
        std::function<std::chrono::steady_clock::time_point()> now = std::chrono::steady_clock::now;
        std::function<KsDate()> wallClock = KsDate::now;
        /// Asked between folders of a long comparison; true makes it stop with ECANCELED.
        std::function<bool()> isStopping = [] { return false; };
        /// Told of each file that a hint led to. Borrowed for life; null: nobody.
        SeenFiles* seenFiles = nullptr;
    };
    /// `store` is borrowed for life.
    IndexKeeper(VolumeStore& store, Options options);
    ~IndexKeeper();

    /// A root that hints come from `source` for; null: nothing tells of its changes, it is compared each time.
    struct Root {
        std::shared_ptr<const RootDirectory> directory;
        std::shared_ptr<EventSource> source;
        bool stampsAreDistinct = false;  ///< sys::FileSystemTraits
        FileID fileID() const { return FileID{directory->status.fileID}; }
    };
    /// What the new roots hold is found with the next compareEverything() or compare().
    void setRoots(std::vector<Root> roots);
    const std::vector<Root>& roots() const { return roots_; }
    std::span<const FileID> rootIDs() const { return rootIDs_; }

    /// Compares the whole tree with the index. ECANCELED when it was told to stop.
    Result<void> compareEverything(Journal journal);
    /// Compares a folder and everything below it with the index.
    Result<void> compareTree(FileID folder);
    /// Compares what is directly in a folder, and answers its subfolders; none when it can't be opened. Without news
    /// from any source it tells what nothing else does: what a memory map wrote.
    Result<std::vector<FileID>> compareFolder(FileID folder);
    /// Takes the sources' hints up to now and works off what they mean. When it returns, everything that was complete
    /// before the call is in the index. After an error it is done again by the next call.
    Result<void> settle();
    /// Forgets what is recorded below a folder, and the folder, as if it were gone.
    Result<void> removeTree(FileID folder);

    /// Folders that are compared at each settle(), because they can't be watched.
    const std::set<FileID>& unwatchedFolders() const { return unwatched_; }
    /// Whether the sources' watches ran out.
    bool reachedWatchLimit() const { return reachedWatchLimit_; }
    /// Folders that can't be read.
    const std::set<FileID>& closedFolders() const { return closed_; }
    /// Whether something is left to be done: more came than one call takes, or it failed.
    bool isBehind() const { return isDirty() || !departures_.empty(); }
    /// Changes of the index that were made since the start.
    std::uint64_t changeCount() const { return changeCount_; }

private:
    struct OpenFolder;
    struct FolderDirt {
        std::unordered_set<std::string> names;
        int attempts = 0;  ///< to open the folder, which may be on its way to another place
    };
    struct Known;        // an object of the index, with its name
    struct Departure;    // a name that lost its object
    struct Replacement;  // a newcomer under a name that a document had
    struct Vacancy;      // a name that a document had, and whoever is there now
    struct Context;      // what a folder's place means for what is in it

    // Hints.
    Result<void> takeHints();
    void note(const EventHint& hint);
    bool isDirty() const {
        return !dirtyFolders_.empty() || !dirtyObjects_.empty() || !toScan_.empty() || !unreached_.empty() ||
               everythingIsDirty_;
    }

    // Rounds.
    Result<void> workOff();
    Result<void> rounds();
    Result<void> lookAtDirt();
    Result<void> lookAtDirtyFolder(FileID fileID, FolderDirt dirt);
    void lookAgainLater(FileID fileID, FolderDirt dirt);
    void waitForRenames();
    Result<void> lookAtObject(FileID fileID);
    Result<void> endRound(bool isQuiet, bool isLast);
    Result<void> giveUp(const Departure& departure);
    Result<void> takeOverFrom(const Known& leaving);
    bool mayHaveOtherNames(FileID fileID, bool hadWhenSeen) const;
    bool keepUnderOtherName(FileID fileID, FileID leaving);
    void recordUnderName(const Known& known, const VolumeStore::Name& name);
    bool leadsToRoot(FileID folder, FileID other) const;
    Result<void> resolveReplacements();
    Result<void> flush();
    Result<void> flushWhenFull();
    IndexChanges& changes();

    // Looking.
    Result<void> look(OpenFolder& folder, const std::string& name);
    Result<void> see(OpenFolder& folder, std::string_view name, const FileStatus& status, bool isHinted);
    Result<void> seeKnown(OpenFolder& folder, std::string_view name, const FileStatus& status, const Known& known,
                          bool isHinted);
    Result<void> seeMoved(OpenFolder& folder, std::string_view name, const FileStatus& status, const Known& known,
                          bool isClosed);
    Result<void> seeOtherName(OpenFolder& folder, std::string_view name, const FileStatus& status, const Known& known);
    Result<void> keepAsFormer(const Known& folder);
    Result<void> seeNew(OpenFolder& folder, std::string_view name, const FileStatus& status,
                        const std::optional<Known>& formerHolder);
    void noteSeen(const OpenFolder& folder, const std::string& name, const FileStatus& status);
    void lost(FileID parent, std::string_view name, const Known& known, std::optional<FileID> newcomer);
    void noteClosed(FileID folder, bool isClosed);
    void lookAtFolderItself(OpenFolder& folder);
    void put(FileID parent, std::string_view name, const FileStatus& status, bool isClosed);
    void rememberAttributes(const OpenFolder& folder, std::string_view name, const Known& known);

    // Saves.
    void vacated(const Known& known);
    void fillVacancies();
    std::int64_t birthOf(FileID folder) const;
    void movedAway(const Known& known, FileID newParent, std::string_view newName);
    void arrived(FileID parent, std::string_view name, FileID newcomer);
    Result<void> takeOver(DocumentID document, FileID parent, const std::string& name, FileID newcomer);
    Result<void> replaceContents(DocumentID document, FileID newcomer);
    bool mayTakeOver(const Known& newcomer) const;
    void restoreAttributes(DocumentID document, FileID parent, const std::string& name, FileID newcomer);

    // Comparing.
    struct Subfolder {
        FileID fileID{};
        std::string path;  // below the root
    };
    struct BatchEntry;
    struct Batch;
    struct Comparison;
    class TreeWalk;
    class ReadAhead;
    Result<void> compareUnwatched();
    Result<void> scanPending();
    Result<void> scan(FileID folder);
    Result<void> compareWalk(TreeWalk& walk);
    void scanLater(FileID folder);
    Result<void> compareEntries(OpenFolder& folder, std::vector<Subfolder>* subfolders);
    static void readNames(Batch& batch);
    static void lookAtEntries(Batch& batch);
    static bool lookAt(Batch& batch, BatchEntry& entry);
    Result<void> compareBatch(Comparison& comparison, Batch& batch);
    Result<void> seeCompared(OpenFolder& folder, const BatchEntry& entry);
    Result<void> findLost(OpenFolder& folder, std::vector<std::uint64_t>& seen);
    void watch(const OpenFolder& folder);
    Result<void> startWatching(const OpenFolder& folder) const EXCLUDES(sourcesMutex_);
    void noteWatched(const OpenFolder& folder, const Result<void>& watched);
    void watchNames(const OpenFolder& folder, std::string_view name, const FileStatus& status);
    void forgetWatch(FileID fileID);

    // Subtrees.
    Result<void> removeBelow(FileID folder);
    Result<void> touchBelow(FileID folder);
    /// From the leaves up.
    struct Below {
        FileID fileID{};
        bool isFolder = false;
        bool hasOtherNames = false;
    };
    Result<void> forEachBelow(FileID folder, const std::function<Result<void>(const Below&)>& use);

    // The index, with what is not written yet.
    std::optional<Known> find(FileID fileID) const;
    std::vector<Known> findAt(FileID parent, std::string_view name) const;
    const Context& contextOf(FileID folder);
    Context contextInside(FileID parent, std::string_view name, ObjectKind kind);
    void packagesChanged(FileID folder);
    void entriesChanged(FileID folder);

    // The tree.
    std::shared_ptr<OpenFolder> openFolder(FileID folder);
    void noteOpenFailure(const KsError& error);
    Result<std::shared_ptr<OpenFolder>> open(FileID folder, std::string_view path, const Root& root) const;
    bool holds(FileID parent, const std::string& name, FileID fileID, std::int64_t birthTime);
    std::optional<FileStatus> statusAt(FileID parent, const std::string& name);
    const Root* rootWithID(FileID fileID) const;

    // Constant.
    VolumeStore& store_;
    const Options options_;

    std::vector<Root> roots_;
    std::vector<FileID> rootIDs_;
    std::vector<std::shared_ptr<EventSource>> sources_;
    /// Held while a source is called: the thread that reads ahead has folders watched. `sources_` itself stays meanwhile.
    mutable Mutex sourcesMutex_;

    // What is to be looked at.
    std::unordered_map<FileID, FolderDirt> dirtyFolders_;
    std::unordered_set<FileID> dirtyObjects_;
    bool everythingIsDirty_ = false;
    std::unordered_map<FileID, int> unreached_;  // Folders to be compared that were not where they were looked for.
    std::vector<FileID> toScan_;                 // Folders whose contents are to be compared, and what is below them.
    std::set<FileID> unwatched_;                 // Folders that no source tells about.
    bool reachedWatchLimit_ = false;
    std::unordered_set<FileID>* forgotten_ = nullptr;  // While a tree is read: whose watches ended meanwhile.

    // The round's.
    std::unique_ptr<IndexChanges> changes_;
    Journal journal_ = Journal::yes;
    std::unordered_map<FileID, Known> placed_;  // Puts that are not written yet, of folders and objects that moved.
    std::vector<Departure> departures_;
    std::multimap<DocumentID, Replacement> replacements_;
    std::vector<Vacancy> vacancies_;
    std::uint64_t formers_ = 0;  // Numbers that former folders were given.
    std::uint64_t roundNumber_ = 0;
    bool placedFolder_ = false;  // In this round: what could not be reached may be below it.
    std::unordered_map<FileID, Context> contexts_;
    std::unordered_set<FileID> touchedFolders_;
    std::unordered_map<FileID, std::shared_ptr<OpenFolder>> openFolders_;

    RecentDepartures recent_;
    std::uint64_t changeCount_ = 0;
    std::optional<KsError> openFailure_;  // Of this round.
    std::set<FileID> closed_;
};

}  // namespace cindral
