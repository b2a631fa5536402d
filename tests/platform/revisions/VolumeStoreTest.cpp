#include "platform/revisions/VolumeStore.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <latch>
#include <limits>
#include <map>
#include <set>
#include <thread>

#include "platform/revisions/HighWaterFile.h"
#include "platform/revisions/NumberSource.h"
#include "platform/revisions/RevisionsNumbers.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::LogCapture;
using test::TemporaryFolder;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

VolumeStoreOptions onRequest() {
    VolumeStoreOptions options;
    options.checkpointsItself = false;
    return options;
}

/// Sightings whose names live as long as they do.
class Page {
public:
    Page& add(std::uint64_t fileID, std::string name, bool wantsDocumentID = true) {
        names_.push_back(std::make_unique<std::string>(std::move(name)));
        sightings_.push_back({.fileID = FileID{fileID},
                              .birthTime = static_cast<std::int64_t>(fileID * 1000),
                              .parent = kRoot,
                              .kind = ObjectKind::file,
                              .name = *names_.back(),
                              .wantsDocumentID = wantsDocumentID});
        return *this;
    }
    static Page of(std::uint64_t firstFileID, std::size_t count) {
        Page page;
        for (std::uint64_t id = firstFileID; id < firstFileID + count; ++id)
            page.add(id, "document-" + std::to_string(id));
        return page;
    }

    std::span<ObjectSighting> all() { return sightings_; }
    ObjectSighting& operator[](std::size_t i) { return sightings_[i]; }
    ObjectSighting& last() { return sightings_.back(); }

private:
    std::vector<std::unique_ptr<std::string>> names_;
    std::vector<ObjectSighting> sightings_;
};

std::string readFile(const std::string& path) {
    std::ifstream stream(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(stream), {}};
}

void writeFile(const std::string& path, const std::string& bytes) {
    std::ofstream stream(path, std::ios::binary | std::ios::trunc);
    stream << bytes;
    ASSERT_TRUE(stream.flush());
}

/// The log file that has something in it.
std::string logIn(const std::string& folder) {
    for (const char* name : {"/log.0", "/log.1"}) {
        if (std::filesystem::exists(folder + name) && std::filesystem::file_size(folder + name) > 0)
            return folder + name;
    }
    return "";
}

std::vector<std::string> filesWith(const std::string& part, const std::string& folder) {
    std::vector<std::string> found;
    for (const auto& entry : std::filesystem::directory_iterator(folder)) {
        if (entry.path().filename().string().find(part) != std::string::npos) found.push_back(entry.path().filename());
    }
    return found;
}

/// Runs the body in a process of its own, which must end by SIGKILL, and gives what it wrote to the descriptor.
std::vector<std::uint32_t> killedChild(const std::function<void(int)>& body, std::size_t killAfterNumbers = 0) {
    int pipe[2];
    if (::pipe(pipe) != 0) std::abort();
    const pid_t child = ::fork();
    if (child == 0) {
        ::close(pipe[0]);
        body(pipe[1]);
        ::_exit(1);
    }
    ::close(pipe[1]);
    std::vector<std::uint32_t> numbers;
    std::uint32_t next = 0;
    while (::read(pipe[0], &next, sizeof next) == sizeof next) {
        numbers.push_back(next);
        if (killAfterNumbers != 0 && numbers.size() == killAfterNumbers) ::kill(child, SIGKILL);
    }
    ::close(pipe[0]);
    int status = 0;
    ::waitpid(child, &status, 0);
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << status;
    return numbers;
}

/// No file of this process may grow beyond so many bytes, as if the disk were full. Needs no privilege.
class FullDisk {
public:
    explicit FullDisk(std::uint64_t bytes) {
        before_ = std::signal(SIGXFSZ, SIG_IGN);
        ::getrlimit(RLIMIT_FSIZE, &limit_);
        rlimit full = limit_;
        full.rlim_cur = bytes;
        ::setrlimit(RLIMIT_FSIZE, &full);
    }
    ~FullDisk() {
        ::setrlimit(RLIMIT_FSIZE, &limit_);
        std::signal(SIGXFSZ, before_);
    }
    FullDisk(const FullDisk&) = delete;
    FullDisk& operator=(const FullDisk&) = delete;

private:
    rlimit limit_{};
    void (*before_)(int);
};

class VolumeStoreTest : public ::testing::Test {
protected:
    void open(const VolumeStoreOptions& options = onRequest()) { store_ = openAt(folder(), options); }
    void reopen(const VolumeStoreOptions& options = onRequest()) {
        store_.reset();
        open(options);
    }
    static std::unique_ptr<VolumeStore> openAt(const std::string& path,
                                               const VolumeStoreOptions& options = onRequest()) {
        auto opened = VolumeStore::open(path, options);
        if (!opened.ok()) {
            ADD_FAILURE() << opened.error().description();
            return nullptr;
        }
        return std::move(opened).value();
    }
    std::string folder() const { return temporary_ / "store"; }
    /// The store's files as a process that was killed now would leave them.
    std::string copyOfFolder(const std::string& name) const {
        const std::string copy = temporary_ / name;
        std::filesystem::remove_all(copy);
        std::filesystem::copy(folder(), copy);
        return copy;
    }

    void identify(Page& page) { identify(page.all()); }
    void identify(std::span<ObjectSighting> sightings) {
        const auto done = store_->identify(sightings);
        ASSERT_TRUE(done.ok()) << done.error().description();
    }
    DocumentID documentOf(std::uint64_t fileID, const std::string& name) {
        Page page;
        page.add(fileID, name);
        identify(page);
        return page[0].documentID;
    }
    std::string pathOf(std::uint64_t fileID, std::vector<FileID> roots = {kRoot}) {
        const auto path = store_->recordedPath(FileID{fileID}, roots);
        return path ? path->path : "(none)";
    }
    void folderRecord(std::uint64_t fileID, std::uint64_t parent, std::string name) {
        Page page;
        page.add(fileID, std::move(name), false).last().parent = FileID{parent};
        page.last().kind = ObjectKind::folder;
        identify(page);
    }

    TemporaryFolder temporary_;
    std::unique_ptr<VolumeStore> store_;
};

// MARK: Identity

TEST_F(VolumeStoreTest, givesDocumentsLastingIDsInTheOrderOfThePage) {
    open();
    Page page;
    page.add(30, "c").add(10, "a").add(20, "b");
    identify(page);
    EXPECT_EQ(page[0].documentID, DocumentID{1});
    EXPECT_EQ(page[1].documentID, DocumentID{2});
    EXPECT_EQ(page[2].documentID, DocumentID{3});
    reopen();
    EXPECT_EQ(documentOf(10, "a"), DocumentID{2});
    EXPECT_EQ(store_->transactionCount(), 0U);
    EXPECT_EQ(documentOf(40, "d"), DocumentID{4});
}

TEST_F(VolumeStoreTest, givesNoIDToWhatWantsNone) {
    open();
    Page page;
    page.add(10, "folder", false);
    identify(page);
    EXPECT_EQ(page[0].documentID, DocumentID{});
    EXPECT_EQ(store_->counts().documents, 0U);
    EXPECT_EQ(store_->counts().objects, 1U);
}

TEST_F(VolumeStoreTest, remembersWhatItSawBeforeAndAfterACheckpoint) {
    open();
    const DocumentID id = documentOf(10, "report");
    for (int round = 0; round < 2; ++round) {
        const auto object = store_->object(FileID{10});
        ASSERT_TRUE(object.has_value());
        EXPECT_EQ(object->name, "report");
        EXPECT_EQ(object->parent, kRoot);
        EXPECT_EQ(object->birthTime, 10'000);
        EXPECT_EQ(object->kind, ObjectKind::file);
        EXPECT_EQ(object->documentID, id);
        const auto document = store_->document(id);
        ASSERT_TRUE(document.has_value());
        EXPECT_EQ(document->fileID, FileID{10});
        EXPECT_EQ(document->birthTime, 10'000);
        EXPECT_FALSE(store_->object(FileID{11}).has_value());
        EXPECT_FALSE(store_->document(DocumentID{number(id) + 1}).has_value());
        EXPECT_FALSE(store_->document(DocumentID{}).has_value());
        ASSERT_TRUE(store_->checkpoint().ok());
    }
}

TEST_F(VolumeStoreTest, writesOneTransactionForAPageHoweverLongAndNoneForARepetition) {
    open();
    Page page = Page::of(1000, 5000);
    identify(page);
    EXPECT_EQ(store_->transactionCount(), 1U);
    identify(page);
    ASSERT_TRUE(store_->checkpoint().ok());
    identify(page);
    EXPECT_EQ(store_->transactionCount(), 1U);
    EXPECT_EQ(store_->counts().objects, 5000U);
    EXPECT_EQ(store_->counts().documents, 5000U);
    store_->identify({}).value();
}

TEST_F(VolumeStoreTest, keepsTheDocumentThroughRenameMoveAndChangeOfKind) {
    open();
    const DocumentID id = documentOf(10, "before");
    Page page;
    page.add(10, "after", false).last().parent = FileID{77};
    page.last().kind = ObjectKind::package;
    identify(page);
    EXPECT_EQ(page[0].documentID, id);
    EXPECT_EQ(store_->transactionCount(), 2U);
    ASSERT_TRUE(store_->checkpoint().ok());
    EXPECT_EQ(store_->object(FileID{10})->name, "after");
    EXPECT_EQ(store_->object(FileID{10})->parent, FileID{77});
    EXPECT_EQ(store_->object(FileID{10})->kind, ObjectKind::package);
    EXPECT_EQ(store_->counts().documents, 1U);
}

TEST_F(VolumeStoreTest, takesAnotherBirthForAnotherObject) {
    open();
    const DocumentID old = documentOf(10, "same name");
    for (int round = 0; round < 2; ++round) {
        Page page;
        page.add(10, "same name").last().birthTime = 99 + round;
        identify(page);
        EXPECT_GT(number(page[0].documentID), number(old));
        EXPECT_EQ(store_->document(page[0].documentID)->birthTime, 99 + round);
        // The old document is answered with the birth of the object that is gone.
        EXPECT_EQ(store_->document(old)->birthTime, 10'000);
        ASSERT_TRUE(store_->checkpoint().ok());
    }
    Page unwanted;
    unwanted.add(10, "same name", false).last().birthTime = 5;
    identify(unwanted);
    EXPECT_EQ(unwanted[0].documentID, DocumentID{});
    EXPECT_EQ(store_->object(FileID{10})->documentID, DocumentID{});
    EXPECT_EQ(store_->counts().objects, 1U);
    EXPECT_EQ(store_->counts().documents, 3U);
}

TEST_F(VolumeStoreTest, givesTwoNamesOfOneFileInAPageOneID) {
    open();
    Page page;
    page.add(10, "one").add(11, "other").add(10, "two");
    identify(page);
    EXPECT_EQ(page[0].documentID, page[2].documentID);
    EXPECT_NE(page[0].documentID, page[1].documentID);
    EXPECT_EQ(store_->object(FileID{10})->name, "two");
    EXPECT_EQ(store_->counts().objects, 2U);
    EXPECT_EQ(store_->counts().documents, 2U);
}

TEST_F(VolumeStoreTest, tellsApartTwoObjectsThatHadOneNumberWithinAPage) {
    open();
    Page page;
    page.add(10, "gone").add(10, "new").last().birthTime = 77;
    identify(page);
    EXPECT_NE(page[0].documentID, page[1].documentID);
    reopen();
    EXPECT_EQ(store_->document(page[0].documentID)->birthTime, 10'000);
    EXPECT_EQ(store_->document(page[1].documentID)->birthTime, 77);
    EXPECT_EQ(store_->object(FileID{10})->documentID, page[1].documentID);
}

TEST_F(VolumeStoreTest, takesNamesOfAnyBytesAndRefusesWhatNoFileHas) {
    open();
    Page good;
    good.add(10, "\xFF\xFE\n\x01").add(11, std::string(1023, 'n')).add(12, "");
    identify(good);
    ASSERT_TRUE(store_->checkpoint().ok());
    EXPECT_EQ(store_->object(FileID{10})->name, "\xFF\xFE\n\x01");
    EXPECT_EQ(store_->object(FileID{11})->name, std::string(1023, 'n'));
    for (const std::string& name : {std::string(1024, 'n'), std::string("a/b"), std::string("a\0b", 3)}) {
        Page bad;
        bad.add(20, "good").add(21, name);
        const auto done = store_->identify(bad.all());
        ASSERT_FALSE(done.ok());
        EXPECT_TRUE(done.error().isPosix(EINVAL));
        EXPECT_FALSE(store_->object(FileID{20}).has_value());
    }
}

TEST_F(VolumeStoreTest, endsWithAnErrorWhenTheLastDocumentIDWasGiven) {
    std::filesystem::create_directory(folder());
    constexpr std::uint32_t kLast = NumberSource::kLastDocumentID;
    const Bytes slot = encodeHighWaterSlot({.document = kLast - 1, .event = 1});
    writeFile(folder() + "/ids", std::string(textOf(slot)));
    open();
    EXPECT_EQ(documentOf(10, "a"), DocumentID{kLast - 1});
    Page two;
    two.add(11, "b").add(12, "c");
    const auto refused = store_->identify(two.all());
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().isPosix(ENOSPC));
    EXPECT_EQ(two[0].documentID, DocumentID{});
    EXPECT_EQ(documentOf(11, "b"), DocumentID{kLast});
    reopen();
    Page one;
    one.add(12, "c");
    EXPECT_FALSE(store_->identify(one.all()).ok());
    Page folderOnly;
    folderOnly.add(13, "folder", false);
    EXPECT_TRUE(store_->identify(folderOnly.all()).ok());
    EXPECT_EQ(documentOf(10, "a"), DocumentID{kLast - 1});
}

// MARK: Paths

TEST_F(VolumeStoreTest, joinsTheNamesUpToTheRoot) {
    open();
    folderRecord(2, 1, "Documents");
    folderRecord(3, 2, "letters");
    ASSERT_TRUE(store_->checkpoint().ok());  // A chain half in the tables.
    folderRecord(4, 3, "2024");
    Page page;
    page.add(10, "to mother").last().parent = FileID{4};
    identify(page);
    EXPECT_EQ(pathOf(10), "letters/2024/to mother");
    EXPECT_EQ(store_->recordedPath(FileID{10}, {&kRoot, 1})->birthTime, 10'000);
    EXPECT_EQ(pathOf(10, {FileID{99}, FileID{4}}), "to mother");
    EXPECT_EQ(store_->recordedPath(FileID{10}, std::vector<FileID>{FileID{99}, FileID{4}})->rootIndex, 1U);
    EXPECT_EQ(pathOf(2), "");
    EXPECT_EQ(store_->recordedPath(kRoot, {&kRoot, 1})->birthTime, 2000);
    folderRecord(4, 3, "2025");
    EXPECT_EQ(pathOf(10), "letters/2025/to mother");
}

TEST_F(VolumeStoreTest, hasNoPathForWhatDoesNotLeadToARoot) {
    open();
    folderRecord(3, 4, "a");
    folderRecord(4, 3, "b");
    folderRecord(5, 5, "self");
    folderRecord(6, 777, "orphan");
    folderRecord(7, 2, "..");
    folderRecord(8, 7, "below");
    for (const std::uint64_t id : {3, 4, 5, 6, 7, 8, 9}) EXPECT_EQ(pathOf(id), "(none)") << id;
    EXPECT_EQ(pathOf(3, {}), "(none)");
    // A root that was never recorded is one all the same.
    EXPECT_EQ(pathOf(1000, {FileID{1000}}), "");
}

TEST_F(VolumeStoreTest, endsAChainThatIsTooLong) {
    open();
    constexpr std::size_t kDepth = 5000;
    Page page;
    for (std::uint64_t i = 0; i < kDepth; ++i)
        page.add(100 + i, std::string(255, 'n'), false).last().parent = FileID{99 + i};
    page[0].parent = kRoot;
    identify(page);
    EXPECT_EQ(pathOf(100 + 4000).size(), 4001U * 256 - 1);
    EXPECT_EQ(pathOf(100 + kDepth - 1), "(none)");
}

// MARK: Event IDs

TEST_F(VolumeStoreTest, countsEventIDsFromOneOnAndOverReopening) {
    open();
    EXPECT_EQ(store_->currentEventID(), 0U);
    for (std::uint64_t i = 1; i <= 3000; ++i) ASSERT_EQ(*store_->advanceEventID(), i);
    EXPECT_EQ(store_->currentEventID(), 3000U);
    reopen();
    EXPECT_EQ(store_->currentEventID(), 3000U);
    EXPECT_EQ(*store_->advanceEventID(), 3001U);
    const std::string copy = copyOfFolder("cut");
    const auto after = openAt(copy);
    EXPECT_GE(after->currentEventID(), 3001U);
    EXPECT_GT(*after->advanceEventID(), 3001U);
}

// MARK: One process at a time

TEST_F(VolumeStoreTest, refusesASecondOpenerAndNamesTheHolder) {
    open();
    const auto second = VolumeStore::open(folder());
    ASSERT_FALSE(second.ok());
    EXPECT_TRUE(second.error().isPosix(EBUSY));
    EXPECT_EQ(second.error().userInfo().at("holder"), std::to_string(::getpid()));
    EXPECT_EQ(second.error().userInfo().at("path"), folder());
    reopen();
    EXPECT_NE(store_, nullptr);
}

TEST_F(VolumeStoreTest, refusesAnotherProcessAndComesFreeWhenTheHolderIsKilled) {
    int ready[2], finish[2];
    ASSERT_EQ(::pipe(ready), 0);
    ASSERT_EQ(::pipe(finish), 0);
    const pid_t child = ::fork();
    if (child == 0) {
        const auto held = VolumeStore::open(folder());
        const char answer = held.ok() ? 'y' : 'n';
        (void)!::write(ready[1], &answer, 1);
        char byte = 0;
        (void)!::read(finish[0], &byte, 1);
        ::_exit(0);
    }
    char answer = 0;
    ASSERT_EQ(::read(ready[0], &answer, 1), 1);
    EXPECT_EQ(answer, 'y');
    const auto refused = VolumeStore::open(folder());
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().isPosix(EBUSY));
    EXPECT_EQ(refused.error().userInfo().at("holder"), std::to_string(child));
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
    open();
    EXPECT_NE(store_, nullptr);
    for (const int fd : {ready[0], ready[1], finish[0], finish[1]}) ::close(fd);
}

TEST_F(VolumeStoreTest, leavesNothingOpenToAProgramThatIsStarted) {
    open();
    std::size_t open = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        std::error_code gone;
        if (!std::filesystem::read_symlink(entry.path(), gone).string().starts_with(folder())) continue;
        ++open;
        EXPECT_TRUE((::fcntl(std::stoi(entry.path().filename()), F_GETFD) & FD_CLOEXEC) != 0);
    }
    EXPECT_GE(open, 5U);  // The folder, the lock, the tables, two logs, the numbers.
}

TEST_F(VolumeStoreTest, keepsItsFilesToTheirOwner) {
    const mode_t before = ::umask(0);
    open();
    documentOf(10, "a");
    ASSERT_TRUE(store_->checkpoint().ok());
    ::umask(before);
    EXPECT_EQ(std::filesystem::status(folder()).permissions(), std::filesystem::perms{0700});
    std::size_t files = 0;
    for (const auto& entry : std::filesystem::directory_iterator(folder())) {
        EXPECT_EQ(entry.status().permissions(), std::filesystem::perms{0600}) << entry.path();
        ++files;
    }
    EXPECT_GE(files, 5U);
}

TEST_F(VolumeStoreTest, makesTheFoldersAboveItAndTellsWhyItCanNot) {
    EXPECT_NE(openAt(temporary_ / "a/b/c"), nullptr);
    temporary_.file("file", "no folder");
    const auto failed = VolumeStore::open(temporary_ / "file/store");
    ASSERT_FALSE(failed.ok());
    EXPECT_TRUE(failed.error().isPosix(ENOTDIR));
}

// MARK: The death of the process

TEST_F(VolumeStoreTest, findsEveryAnsweredIDAfterBeingKilledAtAnyMoment) {
    for (const std::size_t killAfter : {1, 2, 19, 20, 21, 60, 150, 333, 700, 1500}) {
        SCOPED_TRACE(killAfter);
        const std::string path = temporary_ / ("killed-" + std::to_string(killAfter));
        const auto answered = killedChild(
            [&](int out) {
                VolumeStoreOptions options;  // Its own checkpoints, as often as can be.
                options.unsavedRecordsMax = 100;
                auto store = std::move(VolumeStore::open(path, options)).value();
                for (std::uint64_t first = 1000;; first += 20) {
                    Page page = Page::of(first, 20);
                    if (!store->identify(page.all()).ok()) ::_exit(2);
                    for (const ObjectSighting& sighting : page.all()) {
                        const std::uint32_t id = number(sighting.documentID);
                        (void)!::write(out, &id, sizeof id);
                    }
                }
            },
            killAfter);
        ASSERT_GE(answered.size(), killAfter);
        const auto store = openAt(path);
        std::uint64_t fileID = 1000;
        for (const std::uint32_t id : answered) {
            ASSERT_EQ(store->document(DocumentID{id}).value().fileID, FileID{fileID});
            ASSERT_EQ(store->object(FileID{fileID}).value().documentID, DocumentID{id});
            ++fileID;
        }
        Page more = Page::of(900'000'000, 1);
        ASSERT_TRUE(store->identify(more.all()).ok());
        EXPECT_GT(number(more[0].documentID), answered.back());
    }
}

TEST_F(VolumeStoreTest, findsEverythingAfterBeingKilledWithinACheckpoint) {
    for (int dieAt = 1; dieAt <= 4; ++dieAt) {
        SCOPED_TRACE(dieAt);
        const std::string path = temporary_ / ("killed-" + std::to_string(dieAt));
        killedChild([&](int) {
            int step = 0;
            VolumeStoreOptions options = onRequest();
            options.checkpointPagesMax = 20;
            options.onCheckpointStep = [&] {
                if (++step == dieAt) ::raise(SIGKILL);
            };
            auto store = std::move(VolumeStore::open(path, options)).value();
            Page page = Page::of(1000, 7000);  // More than four transactions.
            (void)store->identify(page.all());
            (void)store->checkpoint();
        });
        const auto store = openAt(path);
        EXPECT_EQ(store->counts().objects, 7000U);
        EXPECT_EQ(store->counts().documents, 7000U);
        for (std::uint32_t i = 0; i < 7000; ++i) {
            ASSERT_EQ(store->object(FileID{1000 + i}).value().documentID, DocumentID{i + 1});
            ASSERT_EQ(store->document(DocumentID{i + 1}).value().fileID, FileID{1000 + i});
        }
    }
}

// A log cut short at any byte of its last batch holds all batches before, and of that one nothing.
TEST_F(VolumeStoreTest, takesALogCutShortAnywhereUpToItsLastWholeBatch) {
    open();
    Page kept = Page::of(10, 1), cut = Page::of(20, 1);
    identify(kept);
    const std::string logName = std::filesystem::path(logIn(folder())).filename();
    const auto keptBytes = std::filesystem::file_size(logIn(folder()));
    identify(cut);
    const auto allBytes = std::filesystem::file_size(logIn(folder()));
    ASSERT_GT(allBytes, keptBytes);
    for (auto bytes = keptBytes; bytes <= allBytes; ++bytes) {
        const std::string copy = copyOfFolder("cut");
        std::filesystem::resize_file(copy + "/" + logName, bytes);
        const auto store = openAt(copy);
        EXPECT_EQ(store->object(FileID{10}).value().documentID, kept[0].documentID);
        EXPECT_EQ(store->object(FileID{20}).has_value(), bytes == allBytes);
        EXPECT_EQ(store->document(cut[0].documentID).has_value(), bytes == allBytes);
        Page more = Page::of(30, 1);
        ASSERT_TRUE(store->identify(more.all()).ok());
        EXPECT_GT(number(more[0].documentID), number(cut[0].documentID));
    }
}

TEST_F(VolumeStoreTest, believesNothingOfABatchWithAFlippedBit) {
    open();
    Page kept = Page::of(10, 1), flipped = Page::of(20, 1);
    identify(kept);
    const std::string logName = std::filesystem::path(logIn(folder())).filename();
    const auto keptBytes = std::filesystem::file_size(logIn(folder()));
    identify(flipped);
    const std::string log = readFile(logIn(folder()));
    for (std::size_t at = keptBytes; at < log.size(); at += 7) {
        std::string bad = log;
        bad[at] = static_cast<char>(bad[at] ^ (1 << (at % 8)));
        const std::string copy = copyOfFolder("flipped");
        writeFile(copy + "/" + logName, bad);
        const auto store = openAt(copy);
        EXPECT_TRUE(store->object(FileID{10}).has_value());
        EXPECT_FALSE(store->object(FileID{20}).has_value());
    }
}

TEST_F(VolumeStoreTest, takesNeitherAnOldLogThatComesBackNorOneOfAnotherStore) {
    open();
    const DocumentID old = documentOf(10, "before");
    const std::string oldLog = readFile(logIn(folder()));
    const std::string logName = std::filesystem::path(logIn(folder())).filename();
    ASSERT_TRUE(store_->checkpoint().ok());
    Page reborn;
    reborn.add(10, "after").last().birthTime = 4;
    identify(reborn);
    store_.reset();
    writeFile(folder() + "/" + logName, oldLog);
    open();
    EXPECT_EQ(store_->object(FileID{10})->name, "after");
    EXPECT_EQ(store_->object(FileID{10})->documentID, reborn[0].documentID);
    EXPECT_NE(reborn[0].documentID, old);

    auto other = openAt(temporary_ / "other");
    other.reset();
    writeFile(temporary_ / "other/log.0", oldLog);
    EXPECT_FALSE(openAt(temporary_ / "other")->object(FileID{10}).has_value());
}

TEST_F(VolumeStoreTest, opensWhereACrashLeftItHalfMade) {
    std::filesystem::create_directory(folder());
    writeFile(folder() + "/volume.new", "half");
    writeFile(folder() + "/volume-lock", "junk");
    writeFile(folder() + "/lock", "junk without end");
    LogCapture log;
    open();
    documentOf(10, "a");
    reopen();
    EXPECT_TRUE(store_->object(FileID{10}).has_value());
    EXPECT_EQ(log.count("[ERROR]"), 0U);
}

// MARK: Power cuts

TEST_F(VolumeStoreTest, neverGivesAnIDAgainThatAPowerCutTookBack) {
    std::set<std::uint32_t> given;
    open();
    std::uint64_t fileID = 1000;
    for (int cut = 0; cut < 20; ++cut) {
        Page saved = Page::of(fileID, 30), lost = Page::of(fileID + 500, 700);
        fileID += 5000;
        identify(saved);
        ASSERT_TRUE(store_->checkpoint().ok());
        identify(lost);
        for (auto* page : {&saved, &lost}) {
            for (const ObjectSighting& sighting : page->all()) {
                EXPECT_TRUE(given.insert(number(sighting.documentID)).second) << number(sighting.documentID);
            }
        }
        const std::string copy = copyOfFolder("cut");
        std::filesystem::remove(copy + "/log.0");
        std::filesystem::remove(copy + "/log.1");
        store_.reset();
        std::filesystem::remove_all(folder());
        std::filesystem::rename(copy, folder());
        open();
        for (const ObjectSighting& sighting : saved.all()) {
            EXPECT_EQ(store_->object(sighting.fileID).value().documentID, sighting.documentID);
        }
        EXPECT_FALSE(store_->object(lost[0].fileID).has_value());
    }
}

// Wherever within a checkpoint the power goes, objects and documents agree afterwards.
TEST_F(VolumeStoreTest, keepsObjectsAndDocumentsInStepOverAPowerCutWithinACheckpoint) {
    int step = 0;
    VolumeStoreOptions options = onRequest();
    options.checkpointPagesMax = 40;
    options.onCheckpointStep = [&] {
        const std::string copy = copyOfFolder("step-" + std::to_string(++step));
        std::filesystem::remove(copy + "/log.0");
        std::filesystem::remove(copy + "/log.1");
    };
    open(options);
    Page page = Page::of(1000, 40'000);
    identify(page);
    ASSERT_TRUE(store_->checkpoint().ok());
    ASSERT_GT(step, 10);
    for (int at = 1; at <= step; at += at < 4 || at > step - 3 ? 1 : 5) {
        SCOPED_TRACE(at);
        const auto store = openAt(temporary_ / ("step-" + std::to_string(at)));
        std::size_t objects = 0, documents = 0;
        for (const ObjectSighting& sighting : page.all()) {
            const auto object = store->object(sighting.fileID);
            const auto document = store->document(sighting.documentID);
            objects += object ? 1 : 0;
            documents += document ? 1 : 0;
            ASSERT_EQ(object.has_value(), document.has_value());
        }
        EXPECT_EQ(store->counts().objects, objects);
        EXPECT_EQ(store->counts().documents, documents);
        EXPECT_EQ(objects == 40'000, at == step);
        Page more = Page::of(900'000, 1);
        ASSERT_TRUE(store->identify(more.all()).ok());
        EXPECT_GT(number(more[0].documentID), 40'000U);
    }
}

TEST_F(VolumeStoreTest, losesAsFewIDsAsItGaveWhenKilled) {
    open();
    for (std::uint64_t id = 0; id < 20; ++id) {
        documentOf(1000 + id, "a");
        const std::string copy = copyOfFolder("killed");
        store_.reset();
        std::filesystem::remove_all(folder());
        std::filesystem::rename(copy, folder());
        open();
    }
    EXPECT_LE(number(documentOf(5000, "a")), 20U * 65'537 + 1);  // A block each time, and what was given of it.
    const std::uint32_t before = number(documentOf(5001, "a"));
    reopen();
    EXPECT_EQ(number(documentOf(5002, "a")), before + 1);  // Nothing is lost when it is closed.
}

// MARK: Full disks

TEST_F(VolumeStoreTest, recordsNothingOfAPageThatTheDiskHasNoRoomFor) {
    open();
    const DocumentID before = documentOf(10, "a");
    const auto logBytes = std::filesystem::file_size(logIn(folder()));
    Page page = Page::of(20, 50);
    for (const std::uint64_t room : {0, 1, 100}) {
        const FullDisk full(logBytes + room);
        const auto done = store_->identify(page.all());
        ASSERT_FALSE(done.ok());
        EXPECT_TRUE(done.error().isPosix(EFBIG));
        EXPECT_EQ(page[0].documentID, DocumentID{});
        EXPECT_FALSE(store_->object(FileID{20}).has_value());
        EXPECT_EQ(std::filesystem::file_size(logIn(folder())), logBytes);
        EXPECT_EQ(documentOf(10, "a"), before);  // Reading goes on.
    }
    EXPECT_EQ(store_->transactionCount(), 1U);
    identify(page);
    EXPECT_EQ(number(page[0].documentID), number(before) + 1);
    const auto copy = openAt(copyOfFolder("killed"));
    EXPECT_EQ(copy->object(FileID{69}).value().documentID, page[49].documentID);
}

TEST_F(VolumeStoreTest, givesNoIDThatItCanNotReserve) {
    open();
    Page earlier = Page::of(100, 1);
    identify(earlier);
    reopen();  // A store that has objects reserves only when it must.
    Page page = Page::of(20, 1);
    {
        const FullDisk full(4096);  // One slot of the numbers' file, but not the other.
        EXPECT_FALSE(store_->identify(page.all()).ok());
        EXPECT_FALSE(store_->advanceEventID().ok());
    }
    EXPECT_EQ(page[0].documentID, DocumentID{});
    EXPECT_EQ(store_->currentEventID(), 0U);
    identify(page);
    EXPECT_EQ(page[0].documentID, DocumentID{2});
    EXPECT_EQ(*store_->advanceEventID(), 1U);
}

TEST_F(VolumeStoreTest, keepsWhatACheckpointHadNoRoomForAndSavesItLater) {
    VolumeStoreOptions options;
    options.unsavedRecordsMax = 2000;
    open(options);
    Page first = Page::of(1000, 1000), second = Page::of(5000, 1000), third = Page::of(9000, 1);
    LogCapture log;
    {
        const FullDisk full(112 * 1024);  // Room for the log of a thousand, but not for the tables.
        identify(first);
        identify(second);
        const auto refused = store_->identify(third.all());
        ASSERT_FALSE(refused.ok());
        // The library reports a write that was cut short as EIO.
        EXPECT_TRUE(refused.error().isPosix(EFBIG) || refused.error().isPosix(EIO)) << refused.error().description();
        EXPECT_FALSE(store_->checkpoint().ok());
        EXPECT_EQ(store_->object(FileID{1000}).value().documentID, first[0].documentID);
        EXPECT_EQ(log.count("can't save"), 1U);
    }
    ASSERT_TRUE(store_->checkpoint().ok());
    identify(third);
    reopen();
    for (auto* page : {&first, &second, &third}) {
        for (const ObjectSighting& sighting : page->all()) {
            ASSERT_EQ(store_->object(sighting.fileID).value().documentID, sighting.documentID);
        }
    }
}

// MARK: Damage

class DamagedVolumeStoreTest : public VolumeStoreTest {
protected:
    void SetUp() override {
        open();
        Page page = Page::of(1000, 600);
        identify(page);
        last_ = number(page.last().documentID);
        uuid_ = store_->uuid();
        store_.reset();
        tables_ = readFile(folder() + "/volume");
    }

    void writeTables(const std::string& bytes) { writeFile(folder() + "/volume", bytes); }

    void expectNewStore() {
        LogCapture log;
        open();
        ASSERT_NE(store_, nullptr);
        EXPECT_NE(store_->uuid(), uuid_);
        EXPECT_EQ(store_->counts().objects, 0U);
        EXPECT_EQ(log.count("[ERROR]"), 1U);
        EXPECT_EQ(log.count("is damaged"), 1U);
        EXPECT_EQ(filesWith("volume.damaged-", folder()).size(), 1U);
        EXPECT_NE(store_->replacement().find("is damaged"), std::string::npos);
        EXPECT_GT(number(documentOf(1, "new")), last_);
    }

    /// Opens whatever is there, uses all of it, and tells whether it was taken for good.
    bool survives() {
        open();
        if (store_ == nullptr) return false;
        const bool isOld = store_->uuid() == uuid_;
        std::vector<FileID> roots = {kRoot};
        for (std::uint64_t id = 1000; id < 1600; ++id) {
            (void)store_->object(FileID{id});
            (void)store_->recordedPath(FileID{id}, roots);
        }
        for (std::uint32_t id = 1; id <= 600; ++id) (void)store_->document(DocumentID{id});
        Page page = Page::of(1000, 700);
        (void)store_->identify(page.all());
        (void)store_->checkpoint();
        store_.reset();
        return isOld;
    }

    std::uint32_t last_ = 0;
    KsUUID uuid_;
    std::string tables_;
};

TEST_F(DamagedVolumeStoreTest, beginsANewStoreWhereTheTablesAreEmpty) {
    writeTables("");
    expectNewStore();
}

TEST_F(DamagedVolumeStoreTest, beginsANewStoreWhereTheTablesAreNoTables) {
    writeTables(std::string(100'000, 'x'));
    expectNewStore();
}

TEST_F(DamagedVolumeStoreTest, beginsANewStoreWhereTheFormatIsUnknown) {
    const std::string uuid(reinterpret_cast<const char*>(uuid_.bytes.data()), 16);
    std::size_t changed = 0;
    for (std::size_t at = tables_.find(uuid); at != std::string::npos; at = tables_.find(uuid, at + 1), ++changed) {
        tables_[at - 4] = 99;
    }
    ASSERT_GT(changed, 0U);
    writeTables(tables_);
    expectNewStore();
}

TEST_F(DamagedVolumeStoreTest, beginsANewStoreAfterATruncation) {
    for (std::size_t bytes = 0; bytes < tables_.size(); bytes = bytes == 0 ? 1 : bytes * 3 / 2 + 100) {
        SCOPED_TRACE(bytes);
        std::filesystem::remove_all(folder());
        uuid_ = {};
        SetUp();
        writeTables(tables_.substr(0, bytes));
        LogCapture log;
        const bool isOld = survives();
        // Only where nothing but free pages was cut off can the store have lived on.
        EXPECT_EQ(log.count("is damaged"), isOld ? 0U : 1U);
        EXPECT_EQ(filesWith("volume.damaged-", folder()).size(), isOld ? 0U : 1U);
        if (bytes < tables_.size() / 2) {
            EXPECT_FALSE(isOld);
        }
    }
}

TEST_F(DamagedVolumeStoreTest, survivesZeroedBlocks) {
    std::size_t found = 0;
    for (std::size_t at = 0; at + 4096 <= tables_.size(); at += 4096) {
        SCOPED_TRACE(at);
        std::filesystem::remove_all(folder());
        std::filesystem::create_directory(folder());
        std::string bytes = tables_;
        bytes.replace(at, 4096, 4096, '\0');
        writeTables(bytes);
        if (!survives()) ++found;
    }
    EXPECT_GT(found, tables_.size() / 4096 / 2);
}

TEST_F(DamagedVolumeStoreTest, looksAtEverythingAfterACrashOnly) {
    // A flip that leaves size and times alone, as a bad disk does, is met by the library; but once the process has
    // ended without closing the store, the next one finds it.
    for (std::size_t at = 2 * 4096; at < tables_.size(); at += 4096) tables_[at + 10] = 0x40;
    writeTables(tables_);
    writeFile(folder() + "/lock", "4711\n");
    expectNewStore();
}

TEST_F(DamagedVolumeStoreTest, goesOnWithItsNumbersWhenTheirFileIsLost) {
    std::filesystem::remove(folder() + "/ids");
    open();
    EXPECT_EQ(store_->uuid(), uuid_);
    EXPECT_EQ(number(documentOf(1, "new")), last_ + 1);
}

TEST_F(DamagedVolumeStoreTest, goesOnWithItsNumbersFromEitherSlot) {
    for (const std::size_t slot : {0, 4096}) {
        std::string ids = readFile(folder() + "/ids");
        ids.replace(slot, 28, 28, '\0');
        writeFile(folder() + "/ids", ids);
        std::filesystem::remove(folder() + "/volume");
        LogCapture log;
        open();
        EXPECT_EQ(log.count("has lost its tables"), 1U);
        EXPECT_NE(store_->uuid(), uuid_);
        const std::uint32_t next = number(documentOf(1, "new"));
        EXPECT_GT(next, last_);
        last_ = next;
        store_.reset();
    }
}

// MARK: Threads

TEST_F(VolumeStoreTest, givesThreadsThatMeetAFileTogetherOneID) {
    VolumeStoreOptions options;
    options.unsavedRecordsMax = 64;  // Checkpoints all the time.
    open(options);
    constexpr std::size_t kThreads = 4, kPages = 60, kPageSize = 10;
    std::vector<std::vector<DocumentID>> answers(kThreads);
    std::atomic<bool> failed = false;
    {
        std::latch start(kThreads);
        std::vector<std::jthread> threads;
        for (std::size_t t = 0; t < kThreads; ++t) {
            threads.emplace_back([&, t] {
                start.arrive_and_wait();
                for (std::size_t p = 0; p < kPages; ++p) {
                    Page page = Page::of(1000 + p * kPageSize, kPageSize);
                    if (!store_->identify(page.all()).ok()) failed = true;
                    for (const ObjectSighting& sighting : page.all()) {
                        answers[t].push_back(sighting.documentID);
                        const auto object = store_->object(sighting.fileID);
                        if (!object || object->documentID != sighting.documentID) failed = true;
                        const auto document = store_->document(sighting.documentID);
                        if (!document || document->fileID != sighting.fileID) failed = true;
                        const auto path = store_->recordedPath(sighting.fileID, {&kRoot, 1});
                        if (!path || path->path != sighting.name) failed = true;
                    }
                    if (!store_->advanceEventID().ok()) failed = true;
                }
            });
        }
    }
    EXPECT_FALSE(failed);
    for (std::size_t t = 1; t < kThreads; ++t) EXPECT_EQ(answers[t], answers[0]);
    EXPECT_EQ(std::set<DocumentID>(answers[0].begin(), answers[0].end()).size(), kPages * kPageSize);
    EXPECT_EQ(store_->counts().documents, kPages * kPageSize);
    EXPECT_EQ(store_->currentEventID(), kThreads * kPages);
}

TEST_F(VolumeStoreTest, readsAndRecordsWhileACheckpointIsBeingWritten) {
    std::latch within(1), goOn(1);
    std::atomic<bool> stopped = false;
    VolumeStoreOptions options = onRequest();
    options.onCheckpointStep = [&] {
        if (stopped.exchange(true)) return;
        within.count_down();
        goOn.wait();
    };
    open(options);
    Page page = Page::of(1000, 5000);
    identify(page);
    {
        std::jthread checkpoint([&] { EXPECT_TRUE(store_->checkpoint().ok()); });
        within.wait();
        EXPECT_EQ(store_->object(FileID{5999}).value().documentID, page[4999].documentID);
        EXPECT_EQ(store_->document(page[4999].documentID).value().fileID, FileID{5999});
        identify(page);
        EXPECT_EQ(pathOf(5000), "document-5000");
        EXPECT_EQ(number(documentOf(10, "new")), 5001U);
        EXPECT_EQ(store_->object(FileID{10})->name, "new");
        goOn.count_down();
    }
    EXPECT_EQ(store_->object(FileID{10})->name, "new");
    reopen();
    EXPECT_EQ(store_->object(FileID{10})->name, "new");
    EXPECT_EQ(store_->counts().objects, 5001U);
}

TEST_F(VolumeStoreTest, letsWhoBringsMoreThanFitsWaitForTheCheckpoint) {
    VolumeStoreOptions options = onRequest();
    options.unsavedRecordsMax = 20;
    open(options);
    std::atomic<bool> done = false;
    std::jthread writer([&] {
        for (std::uint64_t i = 0; i < 100; ++i) {
            Page page = Page::of(1000 + i * 10, 10);
            EXPECT_TRUE(store_->identify(page.all()).ok());
        }
        done = true;
    });
    std::size_t checkpoints = 0;
    while (!done) {
        ASSERT_TRUE(store_->checkpoint().ok());
        ++checkpoints;
        std::this_thread::yield();
    }
    writer.join();
    EXPECT_GT(checkpoints, 1U);
    EXPECT_EQ(store_->transactionCount(), 100U);
    EXPECT_EQ(store_->counts().objects, 1000U);
    for (std::uint64_t id = 1000; id < 2000; ++id) EXPECT_TRUE(store_->object(FileID{id}).has_value());
}

// MARK: Room

TEST_F(VolumeStoreTest, growsItsMapAsItFills) {
    VolumeStoreOptions options = onRequest();
    options.mapBytes = 1 << 20;
    open(options);
    for (std::uint64_t first = 1000; first < 60'000; first += 10'000) {
        Page page = Page::of(first, 10'000);
        identify(page);
        ASSERT_TRUE(store_->checkpoint().ok());
        EXPECT_TRUE(store_->object(FileID{first}).has_value());
    }
    EXPECT_GT(std::filesystem::file_size(folder() + "/volume"), 2U << 20);
    reopen(options);
    EXPECT_EQ(store_->counts().objects, 60'000U);
    Page again = Page::of(1000, 60'000);
    identify(again);
    EXPECT_EQ(store_->transactionCount(), 0U);
}

TEST_F(VolumeStoreTest, asksForLessAddressSpaceWhereThereIsLess) {
    VolumeStoreOptions options = onRequest();
    options.mapBytes = std::numeric_limits<std::size_t>::max() / 4 / 65536 * 65536;
    open(options);
    ASSERT_NE(store_, nullptr);
    EXPECT_EQ(documentOf(10, "a"), DocumentID{1});
}

}  // namespace
}  // namespace cindral
