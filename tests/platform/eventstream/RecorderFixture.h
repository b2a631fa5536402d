#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/eventstream/Recorder.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/revisions/VolumeIndex.h"
#include "platform/revisions/VolumeStore.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {

/// A storage, a store and a recorder that works only when it is asked to.
class RecorderTest : public ::testing::TestWithParam<Recorder::Choice> {
protected:
    RecorderTest();
    explicit RecorderTest(const std::string& place);
    ~RecorderTest() override;

    // The recorder.
    void start();
    void stop();
    void restart() {
        stop();
        start();
    }
    /// Closes the store, too, as the end of the process does.
    void restartAll();
    Recorder& recorder() { return *recorder_; }
    VolumeStore& store() { return *store_; }
    void letTimePass(std::chrono::milliseconds time) { now_ = now_.load() + time; }

    // What programs do. Names are below the storage; those of `outside` beside it.
    std::string path(std::string_view name) const { return storage_ + "/" + std::string(name); }
    std::string outside(std::string_view name) const { return folder_ / ("outside/" + std::string(name)); }
    void write(std::string_view name, std::string_view contents = "x");
    void append(std::string_view name, std::string_view contents);
    void makeFolder(std::string_view name);
    void remove(std::string_view name);
    void removeTree(std::string_view name);
    void rename(std::string_view from, std::string_view to);
    void renamePaths(const std::string& from, const std::string& to);
    void exchange(std::string_view a, std::string_view b);
    void link(std::string_view from, std::string_view to);
    void setTag(std::string_view name, std::string_view value);
    std::string tag(std::string_view name) const;

    /// Drains, and acts before the system call of that number, from 1 on. False when there were fewer.
    bool drainAndAct(int moment, const std::function<void()>& act);

    // What clients do.
    /// Lists a file or folder: it is given its identifier. Answers its document ID, if it is one.
    DocumentID list(std::string_view name);
    /// The documents of so many files "doc0", "doc1", ..., which are written before it starts to record.
    std::vector<DocumentID> startWithDocuments(int count);
    FileID fileID(std::string_view name) const;
    /// The document of the file as the index has it now.
    DocumentID document(std::string_view name);

    /// Paths below the storage that are to be looked at since the last call, and with "- " those that something left.
    std::set<std::string> changes();
    /// The document-ID changes since the last call: "DOCUMENT: SOURCE -> TARGET", by the names given to files here.
    struct DocumentChange {
        DocumentID document{};
        FileID source{};
        FileID target{};
        friend bool operator==(const DocumentChange&, const DocumentChange&) = default;
    };
    std::vector<DocumentChange> documentChanges();
    /// As a look does that came while its names were being counted; with the stamp that it has then, where it is another.
    void recordAsWithOneName(std::string_view name, std::optional<std::int64_t> changeTime = {});
    /// The index has exactly what the tree has.
    void expectIndexIsTree();

    TemporaryFolder folder_;
    TemporaryFolder state_;
    std::string storage_;
    std::shared_ptr<VolumeStore> store_;
    std::shared_ptr<Recorder> recorder_;
    std::shared_ptr<const RootDirectory> root_;
    /// Asked for by the recorder's thread.
    std::atomic<std::chrono::steady_clock::time_point> now_ = std::chrono::steady_clock::now();
    std::uint64_t seenEvents_ = 0;
    std::uint64_t seenDocumentEvents_ = 0;
};

}  // namespace cindral::test
