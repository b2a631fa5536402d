#include "platform/tessel/TesselManager.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <thread>

namespace cindral {
namespace {

using ::testing::ElementsAre;

/// Notes what it is asked for, and answers with the error it is given.
class FakeHost : public TesselManager::Host {
public:
    void signalEnumerator(const TesselItemIdentifier& container, TesselManager::Completion completion) override {
        signals.push_back(container);
        completion(answer);
    }
    void deleteSearchableItems(const std::vector<std::string>& domains, TesselManager::Completion completion) override {
        deletions.push_back(domains);
        completion(answer);
    }

    std::optional<KsError> answer;
    std::vector<TesselItemIdentifier> signals;
    std::vector<std::vector<std::string>> deletions;
};

class TesselManagerTest : public ::testing::Test {
protected:
    /// The completion's calls, each with its error's code or 0.
    TesselManager::Completion note() {
        return [this](const std::optional<KsError>& error) { completions_.push_back(error ? error->code() : 0); };
    }

    TesselManager manager_;
    std::shared_ptr<FakeHost> host_ = std::make_shared<FakeHost>();
    std::vector<std::int64_t> completions_;
};

TEST_F(TesselManagerTest, answersSignalsWithoutAHost) {
    manager_.signalEnumeratorForContainerItemIdentifier(kTesselRootContainerItemIdentifier, note());
    manager_.deleteSearchableItemsWithDomainIdentifiers({"a"}, note());
    EXPECT_THAT(completions_, ElementsAre(0, 0));
}

TEST_F(TesselManagerTest, passesSignalsOnToTheHost) {
    manager_.setHost(host_);
    manager_.signalEnumeratorForContainerItemIdentifier("fid=7", note());
    host_->answer = KsError::posix(EIO);
    manager_.signalEnumeratorForContainerItemIdentifier(kTesselWorkingSetContainerItemIdentifier, note());
    EXPECT_THAT(host_->signals, ElementsAre("fid=7", kTesselWorkingSetContainerItemIdentifier));
    EXPECT_THAT(completions_, ElementsAre(0, EIO));
}

TEST_F(TesselManagerTest, passesDeletionsOnToTheHost) {
    manager_.setHost(host_);
    manager_.deleteSearchableItemsWithDomainIdentifiers({"a", "b"}, note());
    EXPECT_THAT(host_->deletions, ElementsAre(ElementsAre("a", "b")));
    EXPECT_THAT(completions_, ElementsAre(0));
}

TEST_F(TesselManagerTest, takesACompletionThatIsEmpty) {
    manager_.signalEnumeratorForContainerItemIdentifier("fid=7", nullptr);
    manager_.deleteSearchableItemsWithDomainIdentifiers({"a"}, nullptr);
    manager_.setHost(host_);
    manager_.signalEnumeratorForContainerItemIdentifier("fid=7", nullptr);
    manager_.deleteSearchableItemsWithDomainIdentifiers({"a"}, nullptr);
    EXPECT_THAT(host_->signals, ElementsAre("fid=7"));
}

TEST_F(TesselManagerTest, letsGoOfTheHost) {
    manager_.setHost(host_);
    manager_.setHost(nullptr);
    EXPECT_EQ(host_.use_count(), 1);
    manager_.signalEnumeratorForContainerItemIdentifier("fid=7", note());
    EXPECT_TRUE(host_->signals.empty());
    EXPECT_THAT(completions_, ElementsAre(0));
}

// A host that ends takes its leave of the manager, and a signal that it is told of may lead back here.
TEST_F(TesselManagerTest, mayBeUsedByTheHostItCalls) {
    class ReentrantHost : public FakeHost {
    public:
        explicit ReentrantHost(TesselManager& itsManager) : manager(itsManager) {}
        ~ReentrantHost() override { manager.setHost(nullptr); }
        void signalEnumerator(const TesselItemIdentifier&, TesselManager::Completion completion) override {
            manager.setHost(nullptr);
            completion(std::nullopt);
        }
        TesselManager& manager;
    };
    manager_.setHost(std::make_shared<ReentrantHost>(manager_));
    manager_.signalEnumeratorForContainerItemIdentifier("fid=7", note());
    manager_.setHost(std::make_shared<ReentrantHost>(manager_));
    manager_.setHost(nullptr);
    EXPECT_THAT(completions_, ElementsAre(0));
}

// A host that is taken away while it is being signalled lives until it has answered.
TEST_F(TesselManagerTest, keepsAHostWhileItIsCalled) {
    class CountingHost : public TesselManager::Host {
    public:
        void signalEnumerator(const TesselItemIdentifier&, TesselManager::Completion completion) override {
            ++count;
            completion(std::nullopt);
        }
        void deleteSearchableItems(const std::vector<std::string>&, TesselManager::Completion completion) override {
            completion(std::nullopt);
        }
        std::atomic<int> count = 0;
    };
    std::atomic<bool> ends = false;
    std::atomic<std::uint64_t> answers = 0;
    std::thread signaller([&] {
        while (!ends) {
            manager_.signalEnumeratorForContainerItemIdentifier("fid=7",
                                                                [&](const std::optional<KsError>&) { ++answers; });
        }
    });
    for (int i = 0; i < 100; ++i) {
        manager_.setHost(std::make_shared<CountingHost>());
        const std::uint64_t before = answers;
        while (answers == before) std::this_thread::yield();
        manager_.setHost(nullptr);
    }
    ends = true;
    signaller.join();
    EXPECT_GE(answers, 100U);
}

TEST_F(TesselManagerTest, handsOutTheStorageURL) {
    manager_.setDocumentStorageURL(KsURL::fileURL("/storage/Documents"));
    EXPECT_EQ(manager_.documentStorageURL(), KsURL::fileURL("/storage/Documents"));
    manager_.setDocumentStorageURL(KsURL::fileURL("/other/Documents"));
    EXPECT_EQ(manager_.documentStorageURL().path(), "/other/Documents");
}

TEST_F(TesselManagerTest, thereIsOneDefaultManager) {
    EXPECT_EQ(&TesselManager::defaultManager(), &TesselManager::defaultManager());
}

TEST(TesselManagerDeathTest, abortsWhenTheHostHasNotSetTheStorage) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const TesselManager manager;
    EXPECT_DEATH(manager.documentStorageURL(), "document storage was asked for before the host has set it");
}

}  // namespace
}  // namespace cindral
