#include <fcntl.h>
#include <fmt/chrono.h>
#include <pthread.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <ctime>

#include "platform/foundation/Log.h"
#include "platform/foundation/SetAside.h"
#include "platform/foundation/Sys.h"
#include "platform/revisions/TablePages.h"
#include "platform/revisions/VolumeStoreImplementation.h"

// How a store opens and closes: the lock, the state in which the last holder left it, and what the logs still hold.

namespace cindral {

namespace {

constexpr const char* kTablesName = "volume";
constexpr std::array<const char*, 2> kLogNames = {"log.0", "log.1"};

}  // namespace

VolumeStore::Implementation::Implementation(std::string folder, VolumeStoreOptions options)
    : folder_(std::move(folder)), options_(std::move(options)) {}

Result<void> VolumeStore::Implementation::open() {
    TRY(makeFolders(folder_));
    folderFd_ = TRY(sys::open(folder_.c_str(), O_RDONLY | O_DIRECTORY));
    lock_ = TRY(StoreLock::acquire(folderFd_.get(), folder_));
    HighWaterFile numbersFile = TRY(HighWaterFile::open(folderFd_.get()));
    if (numbersFile.marks() && !hasTables()) {
        logError("the volume store in {} has lost its tables; a new one begins", folder_);
    }
    Result<HighWaterMarks> next = openState(numbersFile.marks());
    if (!next.ok() && next.error().isPosix(kDamageCode)) {
        TRY(setAside(next.error()));
        next = openState(numbersFile.marks());
    }
    TRY(Result<HighWaterMarks>(next));
    numbers_ = std::make_unique<NumberSource>(std::move(numbersFile), *next);
    TRY(numbers_->repairFile());
    {
        const MutexLock lock(mutex_);
        counts_ = {
            .objects = tables_->objectCount(), .documents = tables_->documentCount(), .events = tables_->eventCount()};
        hasHistory_ = tables_->head().hasHistory;
        forgottenEvent_ = tables_->head().forgottenEvent;
    }
    {
        const MutexLock lock(writerMutex_);
        const auto marks = TRY(ObjectTables::Snapshot(*tables_).timeMarks());
        if (!marks.empty()) lastTimeMark_ = TimeMark{marks.back().first, marks.back().second};
    }
    // A store without objects is about to be told of some. Where that can't be written now, the first to be given says
    // so.
    if (tables_->objectCount() == 0) (void)numbers_->reserveAhead().ok();
    opened_ = true;
    checkpointThread_ = std::thread([this] { writeCheckpointsWhenDue(); });
    ::pthread_setname_np(checkpointThread_.native_handle(), "volume-store");
    return {};
}

/// What the logs hold beyond the tables. A checkpoint that was begun is done again by itself: half of it may be in the
/// tables, and only the very same makes it whole.
struct VolumeStore::Implementation::Replayed {
    Overlay unfinished;
    std::uint64_t unfinishedLastBatch = 0;
    Overlay rest;
};

/// Tables and logs as the last holder left them, put together. Answers the first numbers that nobody can have been
/// given.
Result<HighWaterMarks> VolumeStore::Implementation::openState(const std::optional<HighWaterMarks>& marks) {
    TRY(openTables(marks));
    Replayed replayed;
    TRY(readLogs(replayed));
    HighWaterMarks next = HighWaterMarks::highest(marks.value_or(HighWaterMarks{}), tables_->head().marks);
    // Only when the file of marks was lost can the logs know more.
    for (const Overlay* unsaved : {&replayed.unfinished, &replayed.rest}) {
        next.event = std::max({next.event, unsaved->lastEvent() + 1, unsaved->historyBegin() + 1});
        if (unsaved->documents().empty()) continue;
        const auto last = static_cast<std::uint32_t>(unsaved->documents().back().first);
        next.document = std::max(next.document, std::uint64_t{last} + 1);
    }
    TRY(saveReplayed(replayed, next));
    return next;
}

// MARK: The tables

bool VolumeStore::Implementation::hasTables() const {
    return ::faccessat(folderFd_.get(), kTablesName, F_OK, AT_SYMLINK_NOFOLLOW) == 0 || errno != ENOENT;
}

Result<void> VolumeStore::Implementation::openTables(const std::optional<HighWaterMarks>& marks) {
    TRY(hasTables() ? checkTables() : createTables(marks));
    tables_ = TRY(ObjectTables::open(pathOf(kTablesName), options_.mapBytes));
    nameHashKey_ = tables_->head().nameHashKey;
    const MutexLock lock(mutex_);
    uuid_ = tables_->head().uuid;
    return {};
}

/// Tables of a store that begins, under a UUID of its own, behind every number that one before it in this folder may
/// have given.
Result<void> VolumeStore::Implementation::createTables(const std::optional<HighWaterMarks>& marks) {
    TablesHead head;
    head.uuid = KsUUID::random();
    head.nameHashKey = randomNameHashKey();
    head.marks = marks.value_or(HighWaterMarks{});
    return ObjectTables::create(pathOf(kTablesName), head);
}

/// Looks at every page unless the last holder closed the store and nothing happened to the file since.
Result<void> VolumeStore::Implementation::checkTables() {
    if (TRY(closedNote()) == lock_.noteOfLastHolder()) return {};
    const UniqueFd file = TRY(sys::openat(folderFd_.get(), kTablesName, O_RDONLY | O_NOFOLLOW));
    if (auto found = TRY(tablepages::findDamage(file.get()))) {
        return KsError::posix(kDamageCode).with("message", std::move(*found));
    }
    return {};
}

/// The state of the tables' file, as a note for whoever opens it next.
Result<std::string> VolumeStore::Implementation::closedNote() const {
    struct stat status {};
    if (::fstatat(folderFd_.get(), kTablesName, &status, AT_SYMLINK_NOFOLLOW) != 0)
        return KsError::errorWithPOSIXCode();
    return fmt::format("closed {} {}.{:09}", status.st_size, status.st_mtim.tv_sec, status.st_mtim.tv_nsec);
}

Result<void> VolumeStore::Implementation::setAside(const KsError& damage) {
    tables_.reset();
    const std::string suffix = fmt::format(".damaged-{:%Y%m%dT%H%M%S}", fmt::gmtime(std::time(nullptr)));
    for (const char* name : {kTablesName, kLogNames[0], kLogNames[1]}) {
        std::string target = name + suffix;
        // A second time within the second.
        for (int i = 2; ::faccessat(folderFd_.get(), target.c_str(), F_OK, AT_SYMLINK_NOFOLLOW) == 0; ++i) {
            target = fmt::format("{}{}-{}", name, suffix, i);
        }
        if (::renameat(folderFd_.get(), name, folderFd_.get(), target.c_str()) != 0 && errno != ENOENT) {
            return KsError::posix(errno, pathOf(name));
        }
    }
    TRY(syncFolder(folderFd_.get()));
    const auto message = damage.userInfo().find("message");
    replacement_ =
        fmt::format("the volume store in {} is damaged ({}); it was set aside as {}{} and a new one begins", folder_,
                    message != damage.userInfo().end() ? message->second : damage.reason(), kTablesName, suffix);
    logError("{}", replacement_);
    return {};
}

Result<std::vector<std::string>> VolumeStore::Implementation::setAsideWhatStops(const std::string& folder) {
    std::vector<std::string> aside;
    const auto setAside = [&](const std::string& path, ExpectedKind kind) -> Result<void> {
        if (auto renamed = TRY(setAsideUnless(path, kind))) aside.push_back(*std::move(renamed));
        return {};
    };
    TRY(setAside(folder, ExpectedKind::folder));
    for (const char* name : {kTablesName, kLogNames[0], kLogNames[1], StoreLock::kName, HighWaterFile::kName})
        TRY(setAside(folder + "/" + name, ExpectedKind::file));
    // LMDB's own, which it makes anew.
    TRY(setAside(fmt::format("{}/{}-lock", folder, kTablesName), ExpectedKind::file));
    return aside;
}

// MARK: The logs

/// Reads what the logs hold beyond the tables: their batches in the order of their numbers, up to the first that is
/// missing or torn.
Result<void> VolumeStore::Implementation::readLogs(Replayed& replayed) {
    const MutexLock writerLock(writerMutex_);
    std::array<Bytes, 2> bytes;
    std::array<std::vector<volumelog::Batch>, 2> batches;
    for (std::size_t i = 0; i < logs_.size(); ++i) {
        logs_[i] = LogFile(TRY(StoreFile::open(folderFd_.get(), kLogNames[i])));
        bytes[i] = TRY(logs_[i].readAll());
        batches[i] = volumelog::decode(bytes[i], uuid());
    }
    const auto firstNumber = [](const auto& log) { return log.empty() ? 0 : log.front().sequence; };
    std::ranges::sort(batches, {}, firstNumber);
    nextBatch_ = tables_->head().appliedBatch + 1;
    for (const auto& log : batches) {
        for (const auto& batch : log) {
            if (batch.sequence != nextBatch_) continue;  // In the tables already, or behind one that is lost.
            const bool isUnfinished = batch.sequence <= tables_->head().begunBatch;
            replay(batch, isUnfinished ? replayed.unfinished : replayed.rest);
            if (isUnfinished) replayed.unfinishedLastBatch = batch.sequence;
            ++nextBatch_;
        }
    }
    return {};
}

void VolumeStore::Implementation::replay(const volumelog::Batch& batch, Overlay& unsaved) const {
    const std::uint64_t forgotten = tables_->head().forgottenEvent;
    for (const LogRecord& logged : volumelog::records(batch)) {
        switch (logged.type) {
            case LogRecordType::object:
            case LogRecordType::objectWithDocument: {
                const PackedRecord record = *PackedRecord::decode(logged.value);
                unsaved.put(logged.fileID(), record, nameHash(nameHashKey_, record.name), record.eventID > forgotten);
                if (logged.type == LogRecordType::objectWithDocument)
                    unsaved.addDocument(record.documentID, {logged.fileID(), record.birthTime});
                break;
            }
            case LogRecordType::objectGone: unsaved.putGone(logged.fileID()); break;
            case LogRecordType::documentGiven:
                unsaved.addDocument(logged.documentID(), *decodeDocument(logged.value));
                break;
            case LogRecordType::documentHandedOver:
                unsaved.handOver(logged.documentID(), *decodeDocument(logged.value));
                break;
            case LogRecordType::otherName: unsaved.putName(logged.nameKey(), std::string(logged.otherName())); break;
            case LogRecordType::otherNameGone: unsaved.putName(logged.nameKey(), std::nullopt); break;
            case LogRecordType::departure: unsaved.addDeparture(logged.key, logged.value); break;
            case LogRecordType::documentChange:
                unsaved.addDocumentChange(logged.key, *DocumentChange::decode(logged.value));
                break;
            case LogRecordType::attributes: unsaved.putAttributes(logged.documentID(), logged.value); break;
            case LogRecordType::timeMark: unsaved.addTimeMark(logged.key, logged.time()); break;
            case LogRecordType::historyBegin: unsaved.beginHistory(logged.key); break;
        }
    }
}

Result<void> VolumeStore::Implementation::saveReplayed(const Replayed& replayed, const HighWaterMarks& next) {
    const MutexLock checkpointLock(checkpointMutex_);
    const MutexLock writerLock(writerMutex_);
    TRY(tables_->removeUnsettledDocuments());
    const std::uint64_t lastBatch = nextBatch_ - 1;
    // A checkpoint that was not finished had batches that the logs have lost.
    if (tables_->head().begunBatch > lastBatch) TRY(tables_->rebuildChildren());
    for (const auto& [unsaved, last] :
         {std::pair(&replayed.unfinished, replayed.unfinishedLastBatch), std::pair(&replayed.rest, lastBatch)}) {
        if (unsaved->empty()) continue;
        TRY(tables_->write(*unsaved, headFor(*unsaved, last, next), options_.checkpointPagesMax,
                           options_.onCheckpointStep));
    }
    // On the disk, because numbers go on here: a batch of the tail that was cut off shall never follow one that is new.
    for (LogFile& log : logs_) TRY(log.clearDurably());
    const MutexLock lock(mutex_);
    savedBatch_ = lastBatch;
    return {};
}

// MARK: Closing

// In order: the thread, what is unsaved, the numbers that were not given, the note for the next holder, the files.
VolumeStore::Implementation::~Implementation() {
    if (checkpointThread_.joinable()) {
        {
            const MutexLock lock(mutex_);
            stopping_ = true;
        }
        dueChanged_.notifyAll();
        checkpointThread_.join();
    }
    if (opened_) close();
}

void VolumeStore::Implementation::close() {
    bool isClean = checkpoint().ok() && !isSuspect_;
    // What can't be given back is skipped by the next holder.
    if (numbers_->giveBackTheRest().ok() && isClean) isClean = saveHead().ok();
    tables_.reset();
    if (!isClean) return;
    const Result<std::string> note = closedNote();
    if (note.ok()) lock_.leaveNote(*note);
}

/// Lowers the tables' copy of the marks, which would otherwise make the next holder skip what was given back.
Result<void> VolumeStore::Implementation::saveHead() {
    const MutexLock checkpointLock(checkpointMutex_);
    TablesHead head = tables_->head();
    if (head.marks == numbers_->reserved()) return {};
    head.marks = numbers_->reserved();
    return tables_->write(Overlay(), head, options_.checkpointPagesMax, {});
}

}  // namespace cindral
