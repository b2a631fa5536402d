#include "provider/EditsFixture.h"

#include <sys/xattr.h>

#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <latch>
#include <thread>

#include "platform/foundation/ThreadPool.h"
#include "platform/tessel/TesselTags.h"

namespace cindral::test {

EditsTest::EditsTest() : provider_(LocalTesselKit::init()) {}

struct HeldPool::State {
    explicit State(std::ptrdiff_t threads) : held(threads) {}
    std::latch held;
    std::latch released{1};
};

HeldPool::HeldPool()
    : state_(std::make_shared<State>(std::max<std::ptrdiff_t>(2, std::thread::hardware_concurrency()))) {
    const std::ptrdiff_t threads = std::max<std::ptrdiff_t>(2, std::thread::hardware_concurrency());
    for (std::ptrdiff_t i = 0; i < threads; ++i) {
        // Not told to the pool, which would let another run instead.
        ThreadPool::shared().submit([state = state_] {
            state->held.count_down();
            state->released.wait();
        });
    }
    state_->held.wait();
}

HeldPool::~HeldPool() {
    state_->released.count_down();
}

EditsTest::ItemResult EditsTest::awaitItem(const std::function<void(TesselExtension::ItemCompletion)>& call,
                                           const std::function<void()>& meanwhile) {
    struct Answer {
        DispatchSemaphore given{0};
        std::optional<ItemResult> result;
        std::atomic<int> times = 0;
    };
    const auto answer = std::make_shared<Answer>();
    call([answer](ItemResult result) {
        ++answer->times;
        answer->result = std::move(result);
        answer->given.signal();
    });
    if (meanwhile) meanwhile();
    answer->given.wait();
    EXPECT_EQ(answer->times, 1);
    return *answer->result;
}

EditsTest::ItemResult EditsTest::overtaken(const std::function<void(TesselExtension::ItemCompletion)>& edit,
                                           const std::function<void()>& changes) {
    provider_->waitUntilReady();
    std::optional<HeldPool> pool(std::in_place);
    return awaitItem(edit, [&] {
        changes();
        pool.reset();
    });
}

std::optional<KsError> EditsTest::deletionOvertaken(const TesselItemIdentifier& identifier,
                                                    const std::function<void()>& changes) {
    provider_->waitUntilReady();
    std::optional<HeldPool> pool(std::in_place);
    return awaitEnd([&](auto completion) { provider_->deleteItemWithIdentifier(identifier, std::move(completion)); },
                    [&] {
                        changes();
                        pool.reset();
                    });
}

std::optional<KsError> EditsTest::awaitEnd(const std::function<void(TesselExtension::Completion)>& call,
                                           const std::function<void()>& meanwhile) {
    struct Answer {
        DispatchSemaphore given{0};
        std::optional<KsError> error;
    };
    const auto answer = std::make_shared<Answer>();
    call([answer](std::optional<KsError> error) {
        answer->error = std::move(error);
        answer->given.signal();
    });
    if (meanwhile) meanwhile();
    answer->given.wait();
    return answer->error;
}

EditsTest::ItemResult EditsTest::import(const std::string& path, const TesselItemIdentifier& parent) {
    return awaitItem(
        [&](auto completion) { provider_->importDocumentAtURL(KsURL::fileURL(path), parent, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::createDirectory(const std::string& name, const TesselItemIdentifier& parent) {
    return awaitItem([&](auto completion) { provider_->createDirectoryWithName(name, parent, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::rename(const TesselItemIdentifier& identifier, const std::string& name) {
    return awaitItem(
        [&](auto completion) { provider_->renameItemWithIdentifier(identifier, name, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::reparent(const TesselItemIdentifier& identifier, const TesselItemIdentifier& parent,
                                          const std::optional<std::string>& name) {
    return awaitItem([&](auto completion) {
        provider_->reparentItemWithIdentifier(identifier, parent, name, std::move(completion));
    });
}

std::optional<KsError> EditsTest::remove(const TesselItemIdentifier& identifier) {
    return awaitEnd([&](auto completion) { provider_->deleteItemWithIdentifier(identifier, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::trash(const TesselItemIdentifier& identifier) {
    return awaitItem([&](auto completion) { provider_->trashItemWithIdentifier(identifier, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::untrash(const TesselItemIdentifier& identifier,
                                         const std::optional<TesselItemIdentifier>& parent) {
    return awaitItem(
        [&](auto completion) { provider_->untrashItemWithIdentifier(identifier, parent, std::move(completion)); });
}

std::optional<KsError> EditsTest::sweep(const KsDate& date) {
    return awaitEnd([&](auto completion) { provider_->removeTrashedItemsOlderThanDate(date, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::setLastUsedDate(const TesselItemIdentifier& identifier,
                                                 const std::optional<KsDate>& date) {
    return awaitItem([&](auto completion) { provider_->setLastUsedDate(date, identifier, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::setTags(const TesselItemIdentifier& identifier, const std::vector<std::string>& tags) {
    std::vector<TSTag> records;
    for (const std::string& tag : tags) records.push_back({tag});
    return awaitItem(
        [&](auto completion) { provider_->setTagData(tsTagsData(records), identifier, std::move(completion)); });
}

EditsTest::ItemResult EditsTest::setFavoriteRank(const TesselItemIdentifier& identifier,
                                                 std::optional<std::int64_t> rank) {
    return awaitItem([&](auto completion) { provider_->setFavoriteRank(rank, identifier, std::move(completion)); });
}

TesselItemIdentifier EditsTest::identifier(std::string_view name) {
    const auto found = provider_->persistentIdentifierForItemAtURL(url(name));
    EXPECT_TRUE(found) << name;
    return found.value_or("");
}

bool EditsTest::exists(std::string_view name) const {
    return std::filesystem::exists(std::filesystem::symlink_status(storage_ / name));
}

std::string EditsTest::contents(std::string_view name) const {
    std::ifstream stream(storage_ / name, std::ios::binary);
    return {std::istreambuf_iterator<char>(stream), {}};
}

std::optional<Bytes> EditsTest::attribute(std::string_view name, std::string_view attribute) const {
    std::array<std::byte, 65'536> value{};
    const std::string full = "user." + std::string(attribute);
    const ssize_t size = ::lgetxattr((storage_ / name).c_str(), full.c_str(), value.data(), value.size());
    if (size < 0) return std::nullopt;
    return Bytes(value.begin(), value.begin() + size);
}

void EditsTest::setAttribute(std::string_view name, std::string_view attribute, ByteView value) const {
    const std::string full = "user." + std::string(attribute);
    if (::lsetxattr((storage_ / name).c_str(), full.c_str(), value.data(), value.size(), 0) != 0) std::abort();
}

std::string EditsTest::errorOf(const ItemResult& result) {
    return result.ok() ? "" : errorOf(std::optional(result.error()));
}

std::string EditsTest::errorOf(const std::optional<KsError>& error) {
    return error ? std::string(error->domain()) + " " + std::to_string(error->code()) : "";
}

}  // namespace cindral::test
