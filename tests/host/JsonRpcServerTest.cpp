#include "host/JsonRpcServer.h"

#include <fmt/format.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <set>
#include <thread>

#include "platform/foundation/Dispatch.h"

namespace cindral {
namespace {

using Reply = std::shared_ptr<JsonRpcReply>;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;

class JsonRpcServerTest : public ::testing::Test {
protected:
    /// The lines that the server answers to those received.
    std::vector<std::string> answersTo(const std::vector<std::string>& received) {
        {
            JsonRpcServer server(methods_, [this](std::string_view line) {
                const MutexLock lock(mutex_);
                EXPECT_TRUE(line.ends_with('\n'));
                lines_.emplace_back(line.substr(0, line.size() - 1));
            });
            for (const std::string& line : received) server.receiveLine(line);
        }
        const MutexLock lock(mutex_);
        return std::move(lines_);
    }

    static std::string call(std::string_view method, std::string_view id, std::string_view params = "{}") {
        return fmt::format(R"({{"jsonrpc":"2.0","id":{},"method":"{}","params":{}}})", id, method, params);
    }
    static std::string fault(int code, std::string_view message, std::string_view id = "null") {
        return fmt::format(R"({{"jsonrpc":"2.0","id":{},"error":{{"code":{},"message":"{}"}}}})", id, code, message);
    }

    JsonRpcServer::Methods methods_{
        {"echo", [](const Json& params,
                    const Reply& reply) { reply->result([&](std::string& out) { out += params.dump(); }); }},
        {"fail",
         [](const Json&, const Reply& reply) {
             reply->error(JsonRpcCode::operationFailed, "no \"way\"", R"({"domain":"D"})");
         }},
        {"drop", [](const Json&, const Reply&) {}},
        {"twice",
         [](const Json&, const Reply& reply) {
             reply->result([](std::string& out) { out += '1'; });
             reply->result([](std::string& out) { out += '2'; });
             reply->error(JsonRpcCode::internalError, "three", {});
         }},
        {"later",
         [](const Json&, const Reply& reply) {
             std::thread([reply] { reply->result([](std::string& out) { out += "true"; }); }).detach();
         }},
    };
    Mutex mutex_;
    std::vector<std::string> lines_ GUARDED_BY(mutex_);
};

TEST_F(JsonRpcServerTest, answersAResult) {
    EXPECT_THAT(answersTo({call("echo", "7", R"({"a":"b"})")}),
                ElementsAre(R"({"jsonrpc":"2.0","id":7,"result":{"a":"b"}})"));
}

TEST_F(JsonRpcServerTest, answersAnErrorWithItsData) {
    EXPECT_THAT(
        answersTo({call("fail", "\"x\"")}),
        ElementsAre(
            R"({"jsonrpc":"2.0","id":"x","error":{"code":-32000,"message":"no \"way\"","data":{"domain":"D"}}})"));
}

TEST_F(JsonRpcServerTest, answersOnAnyThread) {
    EXPECT_THAT(answersTo({call("later", "1")}), ElementsAre(R"({"jsonrpc":"2.0","id":1,"result":true})"));
}

TEST_F(JsonRpcServerTest, answersOnceWhateverTheMethodDoes) {
    EXPECT_THAT(answersTo({call("twice", "1")}), ElementsAre(R"({"jsonrpc":"2.0","id":1,"result":1})"));
    EXPECT_THAT(answersTo({call("drop", "1")}), ElementsAre(fault(-32603, "The request was dropped", "1")));
}

TEST_F(JsonRpcServerTest, refusesAnUnknownMethodAndParamsByPosition) {
    EXPECT_THAT(answersTo({call("no", "1")}), ElementsAre(fault(-32601, "There is no such method", "1")));
    EXPECT_THAT(answersTo({call("no", "1", "[1]")}), ElementsAre(fault(-32601, "There is no such method", "1")));
    EXPECT_THAT(answersTo({call("echo", "1", "[1]")}), ElementsAre(fault(-32602, "Parameters are given by name", "1")));
    EXPECT_THAT(answersTo({call("echo", "1", "[]")}), ElementsAre(fault(-32602, "Parameters are given by name", "1")));
}

TEST_F(JsonRpcServerTest, answersWhatIsNoRequest) {
    EXPECT_THAT(answersTo({"{"}), ElementsAre(fault(-32700, "The line is not JSON")));
    EXPECT_THAT(answersTo({"3"}), ElementsAre(fault(-32600, "A request is an object")));
    EXPECT_THAT(answersTo({"[]"}), ElementsAre(fault(-32600, "The batch is empty")));
    EXPECT_THAT(answersTo({"", " \r"}), IsEmpty());
}

TEST_F(JsonRpcServerTest, answersALongLine) {
    std::vector<std::string> lines;
    JsonRpcServer({}, [&](std::string_view line) { lines.emplace_back(line); }).receiveLongLine();
    EXPECT_THAT(lines, ElementsAre(fault(-32600, "The line is longer than 16 MiB") + "\n"));
}

TEST_F(JsonRpcServerTest, doesNotAnswerNotifications) {
    for (const char* method : {"echo", "fail", "drop", "no", "later"}) {
        EXPECT_THAT(answersTo({fmt::format(R"({{"jsonrpc":"2.0","method":"{}"}})", method)}), IsEmpty()) << method;
    }
    EXPECT_THAT(answersTo({R"({"jsonrpc":"2.0","method":"echo","params":[1]})"}), IsEmpty());
}

TEST_F(JsonRpcServerTest, answersABatchInOneLine) {
    const auto lines = answersTo({"[" + call("echo", "1") + "," + call("later", "2") + ",3," + call("fail", "4") + "," +
                                  call("no", "5") + R"(,{"jsonrpc":"2.0","method":"echo"}])"});
    ASSERT_EQ(lines.size(), 1U);
    const Json answers = Json::parse(lines.front());
    std::vector<std::string> ids;
    for (const Json& answer : answers) ids.push_back(answer["id"].dump());
    EXPECT_THAT(ids, UnorderedElementsAre("1", "2", "null", "4", "5"));
}

TEST_F(JsonRpcServerTest, doesNotAnswerABatchOfNotifications) {
    EXPECT_THAT(answersTo({R"([{"jsonrpc":"2.0","method":"echo"},{"jsonrpc":"2.0","method":"later"}])"}), IsEmpty());
}

// Everything received is answered before the server goes, though nobody waited in between.
TEST_F(JsonRpcServerTest, answersAThousandRequestsEachOnce) {
    std::vector<std::string> requests;
    for (int i = 0; i < 1000; ++i) requests.push_back(call(i % 2 == 0 ? "echo" : "later", std::to_string(i)));
    std::set<int> ids;
    for (const std::string& line : answersTo(requests)) {
        const Json answer = Json::parse(line);
        EXPECT_TRUE(answer.contains("result"));
        EXPECT_TRUE(ids.insert(answer["id"].get<int>()).second);
    }
    EXPECT_EQ(ids.size(), 1000U);
}

TEST_F(JsonRpcServerTest, runsRequestsBesideOthers) {
    // Each waits for the other: one after the other they would never end.
    DispatchSemaphore first(0);
    DispatchSemaphore second(0);
    methods_["a"] = [&](const Json&, const Reply& reply) {
        first.signal();
        second.wait();
        reply->result([](std::string& out) { out += '1'; });
    };
    methods_["b"] = [&](const Json&, const Reply& reply) {
        second.signal();
        first.wait();
        reply->result([](std::string& out) { out += '1'; });
    };
    EXPECT_EQ(answersTo({call("a", "1"), call("b", "2")}).size(), 2U);
}

TEST_F(JsonRpcServerTest, stopsReceivingWhileTooMuchIsUnderWay) {
    DispatchSemaphore gate(0);
    std::atomic<std::size_t> started = 0;
    std::atomic<std::size_t> startedAtMost = 0;
    std::atomic<std::size_t> ended = 0;
    methods_["wait"] = [&](const Json&, const Reply& reply) {
        const std::size_t underWay = ++started - ended;
        for (std::size_t most = startedAtMost;
             underWay > most && !startedAtMost.compare_exchange_weak(most, underWay);) {
        }
        gate.wait();
        ++ended;
        reply->result([](std::string& out) { out += '1'; });
    };
    std::vector<std::string> requests;
    for (std::size_t i = 0; i < JsonRpcServer::kRequestsInFlightMax * 2; ++i)
        requests.push_back(call("wait", std::to_string(i)));
    std::thread opener([&] {
        for (std::size_t i = 0; i < requests.size(); ++i) gate.signal();
    });
    EXPECT_EQ(answersTo(requests).size(), requests.size());
    opener.join();
    EXPECT_LE(startedAtMost, JsonRpcServer::kRequestsInFlightMax);
}

TEST_F(JsonRpcServerTest, boundsWhatABatchCosts) {
    methods_["large"] = [](const Json&, const Reply& reply) {
        reply->result(
            [](std::string& out) { out += '"' + std::string(JsonRpcServer::kBatchAnswerBytesMax / 4, 'x') + '"'; });
    };
    std::string batch;
    for (int i = 0; i < 6; ++i) batch += (i == 0 ? "[" : ",") + call("large", std::to_string(i));
    const auto lines = answersTo({batch + "]"});
    ASSERT_EQ(lines.size(), 1U);
    EXPECT_LE(lines.front().size(), JsonRpcServer::kBatchAnswerBytesMax + 1000);
    std::size_t refused = 0;
    for (std::size_t at = 0; (at = lines.front().find("-32603", at)) != std::string::npos; ++at) ++refused;
    EXPECT_EQ(refused, 3U);
}

TEST_F(JsonRpcServerTest, cancelsARequestUnderWay) {
    methods_.emplace("wait", [](const Json&, const Reply& reply) {
        auto cancelled = std::make_shared<DispatchSemaphore>(0);
        reply->setCancellation([cancelled] { cancelled->signal(); });
        cancelled->wait();
        reply->error(JsonRpcCode::operationFailed, "cancelled", {});
    });
    EXPECT_THAT(answersTo({call("wait", "7"), call("cancel", "8", R"({"request":7})")}),
                UnorderedElementsAre(fault(-32000, "cancelled", "7"), R"({"jsonrpc":"2.0","id":8,"result":{}})"));
}

// A request may be cancelled before it has begun: it is told as soon as it wants to know.
TEST_F(JsonRpcServerTest, cancelsARequestThatHasNotBegun) {
    auto mayBegin = std::make_shared<DispatchSemaphore>(0);
    methods_.emplace("late", [mayBegin](const Json&, const Reply& reply) {
        mayBegin->wait();
        bool isCancelled = false;
        reply->setCancellation([&] { isCancelled = true; });
        reply->result([&](std::string& out) { out += isCancelled ? "true" : "false"; });
    });
    std::vector<std::string> answers;
    {
        JsonRpcServer server(methods_, [&](std::string_view line) {
            const MutexLock lock(mutex_);
            answers.emplace_back(line.substr(0, line.size() - 1));
        });
        server.receiveLine(call("late", R"("a")"));
        server.receiveLine(call("late", R"("b")"));
        server.receiveLine(call("cancel", "1", R"({"request":"a"})"));
        mayBegin->signal();
        mayBegin->signal();
    }
    EXPECT_THAT(answers, UnorderedElementsAre(R"({"jsonrpc":"2.0","id":1,"result":{}})",
                                              R"({"jsonrpc":"2.0","id":"a","result":true})",
                                              R"({"jsonrpc":"2.0","id":"b","result":false})"));
}

TEST_F(JsonRpcServerTest, cancellingAnythingElseIsNothing) {
    EXPECT_THAT(
        answersTo({call("cancel", "1", R"({"request":99})"), call("cancel", "2", R"({"request":2})"),
                   call("cancel", "3", R"({"request":null})")}),
        UnorderedElementsAre(R"({"jsonrpc":"2.0","id":1,"result":{}})", R"({"jsonrpc":"2.0","id":2,"result":{}})",
                             R"({"jsonrpc":"2.0","id":3,"result":{}})"));
    for (const char* params : {"{}", R"({"request":[]})", R"({"request":true})", R"({"request":1e300})"}) {
        EXPECT_THAT(answersTo({call("cancel", "4", params)}),
                    ElementsAre(fault(-32602, "\\\"request\\\" is not the id of a request", "4")));
    }
    EXPECT_THAT(answersTo({call("cancel", "5", "[]")}),
                ElementsAre(fault(-32602, "Parameters are given by name", "5")));
}

TEST_F(JsonRpcServerTest, notifiesUntilItHasAnswered) {
    methods_.emplace("tell", [](const Json&, const Reply& reply) {
        reply->notify("about " + reply->id() + "\n");
        reply->result([](std::string& out) { out += "1"; });
        reply->notify("too late\n");
        bool isCalled = false;
        reply->setCancellation([&] { isCalled = true; });
        EXPECT_FALSE(isCalled);
    });
    EXPECT_THAT(answersTo({call("tell", "7")}), ElementsAre("about 7", R"({"jsonrpc":"2.0","id":7,"result":1})"));
    EXPECT_THAT(answersTo({R"({"jsonrpc":"2.0","method":"tell"})"}), IsEmpty());
}

}  // namespace
}  // namespace cindral
