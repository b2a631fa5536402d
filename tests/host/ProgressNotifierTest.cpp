#include "host/ProgressNotifier.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <vector>

namespace cindral {
namespace {

using nlohmann::json;
using ::testing::IsEmpty;
using ::testing::SizeIs;

/// A request that keeps what it is told.
class ToldReply final : public JsonRpcReply {
public:
    void result(const std::function<void(std::string& out)>& /*append*/) override {}
    void error(JsonRpcCode /*code*/, std::string_view /*message*/, std::string_view /*data*/) override {}
    const std::string& id() const override { return id_; }
    void notify(std::string_view line) override { lines.emplace_back(line); }
    void setCancellation(std::function<void()> given) override { cancellation = std::move(given); }

    std::vector<std::string> lines;
    std::function<void()> cancellation;

private:
    const std::string id_ = "\"seven\"";
};

class ProgressNotifierTest : public ::testing::Test {
protected:
    ProgressNotifierTest() {
        ProgressNotifier::follow(progress_, reply_, [this] { return now_; });
    }

    const std::shared_ptr<TesselProgress> progress_ = std::make_shared<TesselProgress>();
    std::shared_ptr<ToldReply> reply_ = std::make_shared<ToldReply>();
    std::chrono::steady_clock::time_point now_;
};

TEST_F(ProgressNotifierTest, tellsOfMuchWorkAtOnce) {
    progress_->setTotal(1 << 20, 1);
    ASSERT_THAT(reply_->lines, SizeIs(1));
    EXPECT_TRUE(reply_->lines[0].ends_with("}\n"));
    EXPECT_EQ(json::parse(reply_->lines[0]),
              json::parse(R"({"jsonrpc":"2.0","method":"progress","params":{"request":"seven","completedBytes":0,
                              "totalBytes":1048576,"completedItems":0,"totalItems":1}})"));
}

TEST_F(ProgressNotifierTest, tellsNoMoreThanTenTimesASecond) {
    progress_->setTotal(0, 1000);
    for (int i = 0; i < 1000; ++i) {
        now_ += std::chrono::milliseconds(1);
        progress_->advance(0, 1);
    }
    ASSERT_THAT(reply_->lines, SizeIs(11));  // At the beginning, and at the end of each tenth.
    EXPECT_EQ(json::parse(reply_->lines.back())["params"]["completedItems"], 1000);
}

TEST_F(ProgressNotifierTest, tellsOfLittleWorkOnlyWhenItTakesItsTime) {
    progress_->setTotal(1000, 2);
    progress_->advance(1000, 1);
    EXPECT_THAT(reply_->lines, IsEmpty());
    now_ += std::chrono::milliseconds(100);
    progress_->advance(0, 1);
    EXPECT_THAT(reply_->lines, SizeIs(1));
}

TEST_F(ProgressNotifierTest, cancels) {
    reply_->cancellation();
    EXPECT_TRUE(progress_->isCancelled());
}

TEST_F(ProgressNotifierTest, keepsNeitherSide) {
    const std::weak_ptr<ToldReply> reply = reply_;
    reply_.reset();
    EXPECT_TRUE(reply.expired());
    progress_->setTotal(1 << 20, 1);
    ProgressNotifier::follow(nullptr, nullptr);
}

// What had been counted before anybody looked is told then.
TEST(TesselProgress, tellsWhoComesLate) {
    TesselProgress progress;
    progress.setTotal(10, 2);
    progress.advance(4, 1);
    std::vector<std::uint64_t> told;
    progress.setObserver([&](const TesselProgress::Counts& counts) { told.push_back(counts.completedBytes); });
    progress.advance(6, 1);
    progress.setObserver(nullptr);
    progress.advance(1, 1);
    EXPECT_THAT(told, ::testing::ElementsAre(4, 10));
    EXPECT_TRUE(progress.check().ok());
    progress.cancel();
    EXPECT_TRUE(progress.check().error().isPosix(ECANCELED));
}

}  // namespace
}  // namespace cindral
