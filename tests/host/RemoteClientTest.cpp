#include "host/RemoteClient.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <cerrno>
#include <csignal>
#include <future>
#include <mutex>
#include <optional>
#include <thread>

#include "host/Descriptor.h"
#include "host/FakeProvider.h"
#include "host/FakeSearch.h"
#include "host/HostError.h"
#include "host/ItemWriter.h"
#include "host/RemoteError.h"
#include "host/RemoteItem.h"
#include "host/RpcConnection.h"

namespace cindral {
namespace {

using test::FakeItem;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

// Storage and presentation are the same for a command of the daemon's.
const PresentedPaths kPaths("/data/Documents", "/data/Documents", "/data/Documents");

std::string writtenAndReadBack(const FakeItem& item) {
    const auto read = itemFromJson(Json::parse(ItemWriter(kPaths).text(item)));
    return read.ok() ? ItemWriter(kPaths).text(**read) : messageOf(read.error());
}

TEST(RemoteItem, isWhatWasWritten) {
    FakeItem item;
    EXPECT_EQ(writtenAndReadBack(item), ItemWriter(kPaths).text(item)) << "with nothing that may be absent";
    item.type = "com.vemra.folio.document";
    item.can = static_cast<TesselItemCapabilities>(63);
    item.trashed = item.ubiquitous = item.appLibrary = true;
    item.size = 18'446'744'073'709'551'615U;
    item.created = KsDate{-1, 999'999'999};
    item.modified = KsDate{1'795'168'320, 1};
    item.children = 0;
    item.version = Bytes(300, std::byte{0xFF});
    item.lastUsed = KsDate{0, 0};
    item.tagList = std::vector<std::string>{"red", "", "\u00e9 \" \\ \n"};
    item.rank = -9'223'372'036'854'775'807;
    item.file = 4'294'967'296;
    item.document = 4'294'967'295;
    item.url = KsURL::fileURL("/data/Documents/a b%/\xFF");
    item.bundle = "org.example.App";
    EXPECT_EQ(writtenAndReadBack(item), ItemWriter(kPaths).text(item));
}

TEST(RemoteItem, hasTheNamesOwnBytes) {
    FakeItem item;
    item.name =
        "a\xFF\xFE"
        "b";
    item.url = KsURL::fileURL(
        "/data/Documents/a\xFF\xFE"
        "b");
    EXPECT_EQ((*itemFromJson(Json::parse(ItemWriter(kPaths).text(item))))->filename(), item.name);
    item.name = "\uFFFD";
    item.url = KsURL::fileURL("/data/Documents/\uFFFD");
    EXPECT_EQ((*itemFromJson(Json::parse(ItemWriter(kPaths).text(item))))->filename(), item.name);
    // An application is called otherwise than its folder.
    item.name = "An\uFFFD\xFF";
    item.url = KsURL::fileURL("/data/org.example.App/Documents");
    EXPECT_EQ((*itemFromJson(Json::parse(ItemWriter(kPaths).text(item))))->filename(), "An\uFFFD\uFFFD");
}

TEST(RemoteItem, isNoItemWithoutIdentifierAndName) {
    for (const char* text :
         {"{}", "[]", "7", "null", R"({"identifier":"did=1"})", R"({"identifier":1,"filename":"a"})"})
        EXPECT_FALSE(itemFromJson(Json::parse(text)).ok()) << text;
}

/// A daemon's connection over a fake provider, and a command's client at its other end.
class RemoteClientTest : public ::testing::Test {
protected:
    RemoteClientTest() {
        std::signal(SIGPIPE, SIG_IGN);
        int fds[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) std::abort();
        daemonEnd_ = fds[1];
        serving_ = std::thread([this, fd = UniqueFd(fds[1])] {
            (void)serveRpc(
                fd.get(), fd.get(),
                {provider_, kPaths, daemonSignals_, [] { return std::string("{\"b\":1,\"a\":2}"); }, search_});
        });
        client_.emplace(UniqueFd(fds[0]), signals_);
    }
    ~RemoteClientTest() override {
        client_.reset();
        serving_.join();
    }
    void loseDaemon() { ::shutdown(daemonEnd_, SHUT_RDWR); }

    const std::shared_ptr<test::FakeProvider> fake_ = std::make_shared<test::FakeProvider>();
    const std::shared_ptr<TesselExtension> provider_ = fake_;
    SignalDispatcher daemonSignals_;
    SignalDispatcher signals_;
    test::FakeSearch search_;
    std::thread serving_;
    int daemonEnd_ = -1;
    std::optional<RemoteClient> client_;
};

TEST_F(RemoteClientTest, listsPageByPage) {
    fake_->folder("fid=2", "many");
    fake_->documents(test::FakeProvider::kPageItems + 1, "fid=2");
    const auto first = client_->itemsOnPage("fid=2", tesselInitialPageSortedByName());
    ASSERT_TRUE(first.ok());
    EXPECT_EQ(first->items.size(), test::FakeProvider::kPageItems);
    const auto second = client_->itemsOnPage("fid=2", *first->nextPage);
    ASSERT_TRUE(second.ok());
    EXPECT_EQ(second->items.size(), 1U);
    EXPECT_EQ(second->nextPage, std::nullopt);
}

TEST_F(RemoteClientTest, searchesAcrossFolders) {
    using Kind = SearchQuery::Kind;
    const auto item = std::make_shared<FakeItem>();
    item->identifier = "did=7";
    item->name = "report.txt";
    search_.pages = {{{item}, Bytes{std::byte{0xFF}, std::byte{0}}}, {{}, std::nullopt}};
    const auto first = client_->search().find({Kind::names, "rep"}, std::nullopt, 5);
    ASSERT_TRUE(first.ok());
    ASSERT_EQ(first->items.size(), 1U);
    EXPECT_EQ(first->items[0]->itemIdentifier(), "did=7");
    const auto second = client_->search().find({Kind::names, "rep"}, first->nextPage, 5);
    ASSERT_TRUE(second.ok());
    EXPECT_EQ(second->nextPage, std::nullopt);
    for (const Kind kind : {Kind::recents, Kind::favorites, Kind::trashed})
        EXPECT_TRUE(client_->search().find({kind, ""}, std::nullopt, 200).ok());
    EXPECT_TRUE(client_->search().find({Kind::tagged, "red"}, std::nullopt, 200).ok());
    using Asked = test::FakeSearch::Asked;
    EXPECT_EQ(search_.asked, (std::vector<Asked>{{Kind::names, "rep", "", 5},
                                                 {Kind::names, "rep", std::string("\xFF\0", 2), 5},
                                                 {Kind::recents, "", "", 200},
                                                 {Kind::favorites, "", "", 200},
                                                 {Kind::trashed, "", "", 200},
                                                 {Kind::tagged, "red", "", 200}}));
    EXPECT_TRUE(client_->search().find({Kind::children, "fid=2"}, std::nullopt, 5).error().isPosix(ENOTSUP));
}

TEST_F(RemoteClientTest, asksForOrdersAndTags) {
    search_.sortedPage = {{std::make_shared<FakeItem>()}, 18'446'744'073'709'551'615U};
    const auto sorted = client_->search().sorted({"fid=2", SortedQuery::Order::size, true, 40, 20});
    ASSERT_TRUE(sorted.ok());
    EXPECT_EQ(sorted->items.size(), 1U);
    EXPECT_EQ(sorted->total, 18'446'744'073'709'551'615U);
    ASSERT_EQ(search_.askedSorted.size(), 1U);
    EXPECT_EQ(search_.askedSorted[0].container, "fid=2");
    EXPECT_EQ(search_.askedSorted[0].order, SortedQuery::Order::size);
    EXPECT_TRUE(search_.askedSorted[0].isDescending);
    EXPECT_EQ(search_.askedSorted[0].offset, 40U);
    EXPECT_EQ(search_.askedSorted[0].limit, 20U);

    search_.tagCounts = {{"red", 2}, {"\u00e9", 1}};
    const auto tags = client_->search().tags();
    ASSERT_TRUE(tags.ok());
    ASSERT_EQ(tags->size(), 2U);
    EXPECT_EQ((*tags)[1].tag, "\u00e9");
    EXPECT_EQ((*tags)[0].count, 2U);
    search_.error = KsError::posix(EIO);
    EXPECT_TRUE(client_->search().tags().error().isPosix(EIO));
}

TEST_F(RemoteClientTest, handsErrorsOn) {
    const auto none = client_->itemsOnPage("fid=9", tesselInitialPageSortedByName());
    ASSERT_FALSE(none.ok());
    EXPECT_TRUE(none.error().is(kTesselErrorDomain, static_cast<std::int64_t>(TesselErrorCode::noSuchItem)));
    EXPECT_EQ(none.error().userInfo().at("identifier"), "fid=9");
    EXPECT_TRUE(isNoSuchItem(client_->provider().itemForIdentifier("did=9").error()));
    EXPECT_FALSE(client_->anchor("fid=9").ok());
    const auto noAnchor = client_->anchor("fid=noanchor");
    ASSERT_TRUE(noAnchor.ok());
    EXPECT_EQ(*noAnchor, std::nullopt);
    // The path's own bytes.
    fake_->folder("fid=2", "locked");
    fake_->listingErrors.emplace("fid=2", KsError::posix(EACCES, "/data/Documents/\xFF"));
    const auto refused = client_->itemsOnPage("fid=2", tesselInitialPageSortedByName());
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().isPosix(EACCES));
    EXPECT_EQ(refused.error().userInfo().at("path"), "/data/Documents/\xFF");
    EXPECT_EQ(messageOf(refused.error()), "Permission denied");
}

TEST(RemoteError, holdsTheItemInTheWay) {
    const Json json = Json::parse(R"({"code":-32000,"message":"x","data":{"domain":"TesselErrorDomain","code":-1003,
        "item":{"identifier":"did=7","filename":"a"}}})");
    const auto item = collidingItem(errorFromJson(json));
    ASSERT_NE(item, nullptr);
    EXPECT_EQ(item->itemIdentifier(), "did=7");
}

TEST(RemoteError, canBeReadFromAnything) {
    EXPECT_EQ(messageOf(errorFromJson(Json::parse(R"({"code":-32601,"message":"There is no such method"})"))),
              "the daemon refuses the request: There is no such method");
    for (const char* text :
         {"7", "null", R"({"data":{}})", R"({"data":{"domain":1,"code":2}})", R"({"data":{"domain":"a"}})"})
        EXPECT_EQ(messageOf(errorFromJson(Json::parse(text))), "the daemon's answer can't be read") << text;
}

TEST_F(RemoteClientTest, readsChangesInTheirOrder) {
    fake_->document("did=1", "a");
    fake_->document("did=2", "b");
    fake_->changes["fid=2"] = {{{"u did=2", "d fid=7", "u did=1"}, "next", true, std::nullopt}};
    fake_->folder("fid=2", "folder");
    const auto batch = client_->changesSince("fid=2", Bytes(3, std::byte{0}));
    ASSERT_TRUE(batch.ok());
    std::vector<std::string> log;
    for (const auto& entry : batch->log)
        log.push_back((entry.item ? "u " + entry.item->filename() + " " : "d ") + entry.identifier);
    EXPECT_THAT(log, ElementsAre("u b did=2", "d fid=7", "u a did=1"));
    EXPECT_EQ(textOf(batch->anchor), "next");
    EXPECT_TRUE(batch->moreComing);
    EXPECT_EQ(fake_->askedAnchors, std::vector<std::string>{std::string(3, '\0')});
}

TEST_F(RemoteClientTest, passesSignalsOnUntilTheDaemonIsLost) {
    const UniqueFd news = *descriptor::makeInterrupt();
    const auto subscription = signals_.subscribe([&](const std::string& container) {
        EXPECT_EQ(container, kTesselRootContainerItemIdentifier);
        descriptor::interrupt(news);
    });
    const auto awaitNews = [&] {
        ASSERT_TRUE(descriptor::waitForInput(news.get(), news.get(), news.get()).ok());
        descriptor::clearInterrupt(news);
    };
    EXPECT_FALSE(client_->startMonitoring("fid=9").ok());
    ASSERT_TRUE(client_->startMonitoring(kTesselRootContainerItemIdentifier).ok());
    daemonSignals_.signalEnumerator(kTesselRootContainerItemIdentifier, nullptr);
    awaitNews();
    loseDaemon();
    awaitNews();
    EXPECT_EQ(messageOf(client_->anchor("fid=2").error()), "the connection to the daemon was lost");
    client_->stopMonitoring(kTesselRootContainerItemIdentifier);
    signals_.unsubscribe(subscription);
}

TEST_F(RemoteClientTest, answersWhatIsUnderWayWhenTheDaemonIsLost) {
    fake_->dropsObservers = false;
    fake_->folder("fid=2", "folder");
    fake_->document("did=1", "a", "fid=2");
    fake_->beforePage = [&](const auto&, auto) { loseDaemon(); };
    const auto page = client_->itemsOnPage("fid=2", tesselInitialPageSortedByName());
    ASSERT_FALSE(page.ok());
    EXPECT_EQ(messageOf(page.error()), "the connection to the daemon was lost");
}

TEST_F(RemoteClientTest, followsProgress) {
    fake_->itemsDeletedAtOnce = 1000;
    std::promise<void> done;
    std::mutex mutex;
    std::uint64_t told = 0;
    const auto progress = client_->provider().deleteItemWithIdentifier("did=1", [&](const auto& error) {
        EXPECT_FALSE(error);
        done.set_value();
    });
    progress->setObserver([&](const TesselProgress::Counts& counts) {
        const std::lock_guard lock(mutex);
        told = counts.completedItems;
    });
    done.get_future().wait();
    progress->setObserver(nullptr);
    EXPECT_EQ(progress->counts().completedItems, 1000U);
    EXPECT_EQ(told, 1000U);
}

TEST_F(RemoteClientTest, printsTheStatusAsItWasWritten) {
    EXPECT_EQ(*client_->statusText(), R"({"b":1,"a":2})");
}

TEST_F(RemoteClientTest, onceCancelledAnswersNobody) {
    client_->connection().cancelAll();
    bool isAnswered = false;
    client_->connection().send("status", {}, [&](const Result<Json>&) { isAnswered = true; });
    client_.reset();
    EXPECT_FALSE(isAnswered);
    client_.emplace(UniqueFd(), signals_);
}

}  // namespace
}  // namespace cindral
