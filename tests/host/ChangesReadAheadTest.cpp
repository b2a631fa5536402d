#include "host/ChangesReadAhead.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <string>
#include <thread>
#include <vector>

#include "host/Awaited.h"
#include "host/FakeProvider.h"

namespace cindral {
namespace {

const std::string kFolder = "fid=2";

TesselSyncAnchor anchorOf(std::string_view text) {
    const ByteView bytes = bytesOf(text);
    return {bytes.begin(), bytes.end()};
}

/// A folder whose changes come in batches that are answered as their own anchors.
class ChangesReadAheadTest : public ::testing::Test {
protected:
    using Anchors = std::vector<std::string>;

    ChangesReadAheadTest() {
        provider_->folder(kFolder, "folder");
        provider_->folder("fid=3", "other");
    }

    void script(std::vector<test::FakeProvider::Changes> changes, const std::string& container = kFolder) {
        const MutexLock lock(provider_->changesMutex);
        provider_->changes[container] = std::move(changes);
    }

    static test::FakeProvider::Changes batch(const std::string& anchor, bool moreComing) {
        return {{}, anchor, moreComing, std::nullopt};
    }

    Result<std::string> changes(const std::string& anchor, const std::string& container = kFolder) {
        Awaited<Result<std::string>> answer;
        changes_->enumerateChanges(container, anchorOf(anchor), answer.completion());
        return answer.wait();
    }

    /// What was asked of the provider, once nothing is under way any more.
    Anchors asked() {
        changes_.reset();
        const MutexLock lock(provider_->changesMutex);
        return provider_->askedAnchors;
    }

    void somethingHappens(const std::string& container = kFolder) {
        const MutexLock lock(provider_->changesMutex);
        provider_->anchors[container] += "later";
    }

    /// Until the provider was asked so often.
    void waitUntilAsked(std::size_t count) {
        while (true) {
            {
                const MutexLock lock(provider_->changesMutex);
                if (provider_->askedAnchors.size() >= count) return;
            }
            std::this_thread::yield();
        }
    }

    const std::shared_ptr<test::FakeProvider> provider_ = std::make_shared<test::FakeProvider>();
    ProviderClient client_{provider_};
    std::unique_ptr<ChangesReadAhead> changes_ = std::make_unique<ChangesReadAhead>(
        client_, [](const ChangesBatch& changes) { return std::string(textOf(changes.anchor)); });
};

TEST_F(ChangesReadAheadTest, beginsOnTheNextBatch) {
    script({batch("a", true), batch("b", true), batch("c", false)});
    EXPECT_EQ(changes("given").value(), "a");
    EXPECT_EQ(changes("a").value(), "b");
    EXPECT_EQ(changes("b").value(), "c");
    EXPECT_EQ(asked(), (Anchors{"given", "a", "b"})) << "each once";
}

TEST_F(ChangesReadAheadTest, endsWithTheLast) {
    script({batch("a", false)});
    EXPECT_EQ(changes("given").value(), "a");
    EXPECT_EQ(asked(), (Anchors{"given"}));
}

TEST_F(ChangesReadAheadTest, makesABatchAnewWhenSomethingHasHappened) {
    script({batch("a", true), batch("stale", true), batch("fresh", false)});
    EXPECT_EQ(changes("given").value(), "a");
    waitUntilAsked(2);
    somethingHappens();
    EXPECT_EQ(changes("a").value(), "fresh");
    EXPECT_EQ(asked(), (Anchors{"given", "a", "a"}));
}

TEST_F(ChangesReadAheadTest, makesAnotherBatchThanTheNext) {
    script({batch("a", true), batch("b", false), batch("again", false)});
    EXPECT_EQ(changes("given").value(), "a");
    waitUntilAsked(2);
    EXPECT_EQ(changes("given").value(), "again");
    EXPECT_EQ(asked(), (Anchors{"given", "a", "given"}));
}

TEST_F(ChangesReadAheadTest, keepsNothingForAnotherContainer) {
    script({batch("a", true), batch("b", false)});
    script({batch("other", false)}, "fid=3");
    EXPECT_EQ(changes("given").value(), "a");
    waitUntilAsked(2);
    EXPECT_EQ(changes("a", "fid=3").value(), "other");
    EXPECT_EQ(changes("a").value(), "b");
    EXPECT_EQ(asked(), (Anchors{"given", "a", "a", "a"}));
}

TEST_F(ChangesReadAheadTest, remembersNoErrors) {
    script({batch("a", true), {{}, "", false, KsError::posix(EIO)}, batch("b", false)});
    EXPECT_EQ(changes("given").value(), "a");
    waitUntilAsked(2);
    EXPECT_EQ(changes("a").value(), "b");
}

TEST_F(ChangesReadAheadTest, passesErrorsOn) {
    script({{{}, "", false, KsError::posix(EIO)}});
    EXPECT_EQ(changes("given").error(), KsError::posix(EIO));
    EXPECT_EQ(changes("given", "fid=9").error(), tesselErrorForNonExistentItemWithIdentifier("fid=9"));
    EXPECT_EQ(asked(), (Anchors{"given"}));
}

TEST_F(ChangesReadAheadTest, goesOnWithoutAnAnchor) {
    script({batch("a", true), batch("b", false)}, "fid=noanchor");
    EXPECT_EQ(changes("given", "fid=noanchor").value(), "a");
    EXPECT_EQ(changes("a", "fid=noanchor").value(), "b");
    EXPECT_EQ(asked(), (Anchors{"given", "a"})) << "nothing is begun that couldn't be handed out";
}

}  // namespace
}  // namespace cindral
