#include "RecorderFixture.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/foundation/Sys.h"
#include "platform/foundation/SysFaults.h"
#include "platform/revisions/ObjectFinder.h"

namespace cindral::test {

namespace fs = std::filesystem;

RecorderTest::RecorderTest() : RecorderTest(::testing::TempDir()) {}

RecorderTest::RecorderTest(const std::string& place) : folder_(place), storage_(folder_.folder("Documents")) {
    folder_.folder("outside");
    store_ = *VolumeStore::open(state_ / "store");
    root_ = *RootDirectories::shared().add(storage_, RootPolicy::storage);
}

RecorderTest::~RecorderTest() {
    stop();
    RootDirectories::shared().remove(storage_);
}

void RecorderTest::start() {
    Recorder::Options options;
    options.choice = GetParam();
    options.recordsByItself = false;
    options.now = [this] { return now_.load(); };
    recorder_ = Recorder::start(store_, {root_}, std::move(options));
    const Result<void> drained = recorder_->drain();
    ASSERT_TRUE(drained.ok()) << drained.error().description();
    if (seenEvents_ == 0) seenEvents_ = seenDocumentEvents_ = recorder_->currentEventID();
}

void RecorderTest::stop() {
    if (recorder_) recorder_->stop();
    recorder_.reset();
}

void RecorderTest::restartAll() {
    stop();
    store_.reset();
    auto store = VolumeStore::open(state_ / "store");
    ASSERT_TRUE(store.ok()) << store.error().description();
    store_ = *std::move(store);
    start();
}

void RecorderTest::write(std::string_view name, std::string_view contents) {
    std::ofstream out(path(name), std::ios::binary);
    out << contents;
    ASSERT_TRUE(out.good()) << name;
}

void RecorderTest::append(std::string_view name, std::string_view contents) {
    std::ofstream out(path(name), std::ios::binary | std::ios::app);
    out << contents;
    ASSERT_TRUE(out.good()) << name;
}

void RecorderTest::makeFolder(std::string_view name) {
    ASSERT_EQ(::mkdir(path(name).c_str(), 0755), 0) << name;
}

void RecorderTest::remove(std::string_view name) {
    ASSERT_EQ(::remove(path(name).c_str()), 0) << name;
}

void RecorderTest::removeTree(std::string_view name) {
    fs::remove_all(path(name));
}

void RecorderTest::rename(std::string_view from, std::string_view to) {
    renamePaths(path(from), path(to));
}

void RecorderTest::renamePaths(const std::string& from, const std::string& to) {
    ASSERT_EQ(::rename(from.c_str(), to.c_str()), 0) << from;
}

void RecorderTest::exchange(std::string_view a, std::string_view b) {
    ASSERT_EQ(::renameat2(AT_FDCWD, path(a).c_str(), AT_FDCWD, path(b).c_str(), RENAME_EXCHANGE), 0);
}

void RecorderTest::link(std::string_view from, std::string_view to) {
    ASSERT_EQ(::link(path(from).c_str(), path(to).c_str()), 0);
}

void RecorderTest::setTag(std::string_view name, std::string_view value) {
    ASSERT_EQ(::setxattr(path(name).c_str(), "user.com.vemra.tags", value.data(), value.size(), 0), 0)
        << KsError::errorWithPOSIXCode().description();
}

std::string RecorderTest::tag(std::string_view name) const {
    char value[256];
    const ssize_t size = ::getxattr(path(name).c_str(), "user.com.vemra.tags", value, sizeof value);
    return size < 0 ? "" : std::string(value, static_cast<std::size_t>(size));
}

DocumentID RecorderTest::list(std::string_view name) {
    const std::string full = path(name);
    const FileStatus status = *sys::statx(AT_FDCWD, full.c_str());
    const FileStatus parent = *sys::statx(AT_FDCWD, fs::path(full).parent_path().c_str());
    const std::string last = fs::path(full).filename();
    ObjectSighting sighting;
    sighting.fileID = FileID{status.fileID};
    sighting.birthTime = status.birthStamp();
    sighting.parent = FileID{parent.fileID};
    sighting.kind = objectKindOf(status, status.isDirectory() && last.ends_with(".folio"));
    sighting.name = last;
    sighting.wantsDocumentID = sighting.kind == ObjectKind::file || sighting.kind == ObjectKind::package;
    EXPECT_TRUE(store_->identify({&sighting, 1}).ok());
    return sighting.documentID;
}

bool RecorderTest::drainAndAct(int moment, const std::function<void()>& act) {
    int calls = 0;
    const sys::FaultInjection faults([&](const char* /*call*/) {
        if (++calls == moment) act();
        return 0;
    });
    EXPECT_TRUE(recorder().drain().ok());
    return calls >= moment;
}

std::vector<DocumentID> RecorderTest::startWithDocuments(int count) {
    for (int i = 0; i < count; ++i) write("doc" + std::to_string(i), "old");
    start();
    std::vector<DocumentID> documents;
    for (int i = 0; i < count; ++i) documents.push_back(list("doc" + std::to_string(i)));
    return documents;
}

FileID RecorderTest::fileID(std::string_view name) const {
    return FileID{sys::statx(AT_FDCWD, path(name).c_str())->fileID};
}

DocumentID RecorderTest::document(std::string_view name) {
    DocumentID found{};
    store_->indexed(fileID(name), [&](const IndexedObject& object) { found = object.documentID; });
    return found;
}

std::set<std::string> RecorderTest::changes() {
    EXPECT_TRUE(recorder_->drain().ok());
    std::set<std::string> out;
    while (true) {
        const auto batch = recorder_->pathEvents(seenEvents_, 64);
        EXPECT_TRUE(batch.ok());
        if (!batch.ok()) return out;
        for (const Event& event : batch->events) {
            EXPECT_TRUE(event.path.starts_with(storage_ + "/")) << event.path;
            const bool isGone = event.flags & EventFlags::removed;
            out.insert((isGone ? "- " : "") + event.path.substr(storage_.size() + 1));
        }
        seenEvents_ = batch->upTo;
        if (batch->isLast) return out;
    }
}

std::vector<RecorderTest::DocumentChange> RecorderTest::documentChanges() {
    EXPECT_TRUE(recorder_->drain().ok());
    std::vector<DocumentChange> out;
    const auto found = store_->documentEvents(seenDocumentEvents_, 1'000);
    EXPECT_TRUE(found.ok());
    for (const JournalEvent& event : *found) {
        out.push_back({event.documentID, event.fileID, event.target});
        seenDocumentEvents_ = event.id;
    }
    return out;
}

void RecorderTest::recordAsWithOneName(std::string_view name, std::optional<std::int64_t> changeTime) {
    IndexChanges seen(IndexChanges::Journal::no);
    ASSERT_TRUE(store_->indexed(fileID(name), [&](IndexedObject object) {
        object.name = name.substr(name.rfind('/') + 1);
        object.changeTime = changeTime.value_or(object.changeTime);
        object.hasOtherNames = false;
        seen.put(object);
    }));
    const FileID rootID{root_->status.fileID};
    ASSERT_TRUE(store_->apply(seen, {&rootID, 1}).ok());
}

void RecorderTest::expectIndexIsTree() {
    ASSERT_TRUE(recorder_->drain().ok());
    std::uint64_t count = 0;
    const auto check = [&](const auto& self, const fs::path& folder) -> void {
        const FileID parent{sys::statx(AT_FDCWD, folder.c_str())->fileID};
        std::set<std::string> inIndex, inTree;
        EXPECT_TRUE(
            store_->children(parent, [&](const IndexedObject& object) { inIndex.insert(std::string(object.name)); })
                .ok());
        for (const auto& entry : fs::directory_iterator(folder)) inTree.insert(entry.path().filename().string());
        for (const std::string& name : inTree) {
            const FileStatus status = *sys::statx(AT_FDCWD, (folder / name).c_str());
            if (!status.isDirectory() && status.names > 1) continue;
            EXPECT_TRUE(inIndex.contains(name)) << folder << " " << name << " is not in the index";
            if (status.isDirectory()) self(self, folder / name);
        }
        for (const std::string& name : inIndex)
            EXPECT_TRUE(inTree.contains(name)) << folder << " " << name << " is stale";
        EXPECT_EQ(store_->childCount(parent), inIndex.size());
        count += inIndex.size();
    };
    check(check, storage_);
    // And the root itself.
    EXPECT_EQ(store_->counts().objects, count + 1);
}

}  // namespace cindral::test
