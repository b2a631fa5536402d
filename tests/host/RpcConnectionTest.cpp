#include "host/RpcConnection.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <map>
#include <thread>

#include "host/Descriptor.h"
#include "host/FakeProvider.h"
#include "host/FakeSearch.h"
#include "host/JsonRpcMessage.h"
#include "platform/foundation/Base64.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::FakeItem;
using ::testing::ElementsAre;

struct Pipe {
    Pipe() {
        int fds[2];
        if (::pipe2(fds, O_CLOEXEC) != 0) std::abort();
        readEnd.reset(fds[0]);
        writeEnd.reset(fds[1]);
    }
    UniqueFd readEnd;
    UniqueFd writeEnd;
};

std::string readToEnd(int fd) {
    std::string text;
    std::vector<char> buffer(65'536);
    while (true) {
        const auto got = descriptor::read(fd, buffer);
        if (!got.ok() || *got == 0) return text;
        text.append(buffer.data(), *got);
    }
}

/// A client of a fake provider, whose storage "data" is presented as "Documents" elsewhere.
class RpcConnectionTest : public ::testing::Test {
protected:
    RpcConnectionTest() {
        std::signal(SIGPIPE, SIG_IGN);
        std::filesystem::create_directory(real_);
        item("fid=2", "folder").type = "inode/directory";
        item("did=3", "a b.txt");
    }

    FakeItem& item(const std::string& identifier, const std::string& name) {
        FakeItem& made = fake_->document(identifier, name);
        made.url = KsURL::fileURL(presented_ + "/" + name);
        return made;
    }

    /// What is answered to the lines, by id.
    std::map<std::string, Json> answersTo(const std::string& lines) {
        std::map<std::string, Json> answers;
        const std::string text = exchange(lines);
        for (std::size_t start = 0; start < text.size();) {
            const std::size_t end = text.find('\n', start);
            if (end == std::string::npos) {
                ADD_FAILURE() << "half a line: " << text.substr(start, 200);
                break;
            }
            const Json answer = Json::parse(text.substr(start, end - start));
            EXPECT_TRUE(answers.emplace(answer["id"].dump(), answer).second) << answer["id"] << " was answered twice";
            start = end + 1;
        }
        return answers;
    }
    std::string exchange(const std::string& lines) {
        Pipe input;
        Pipe output;
        std::string text;
        std::thread writer([&] {
            EXPECT_TRUE(descriptor::writeAll(input.writeEnd.get(), lines).ok());
            input.writeEnd.reset();
        });
        std::thread reader([&] { text = readToEnd(output.readEnd.get()); });
        served_ = serveRpc(input.readEnd.get(), output.writeEnd.get(), service());
        output.writeEnd.reset();
        writer.join();
        reader.join();
        return text;
    }
    RpcService service() {
        return {provider_, paths_, signals_, [] { return std::string(R"({"version":"x"})"); }, search_, greeting_};
    }
    Json answer(const std::string& method, const Json& params) {
        const Json request{{"jsonrpc", "2.0"}, {"id", 1}, {"method", method}, {"params", params}};
        return answersTo(request.dump() + "\n")["1"];
    }
    Json result(const std::string& method, const Json& params) { return answer(method, params)["result"]; }
    Json error(const std::string& method, const Json& params) { return answer(method, params)["error"]; }
    void expectInvalid(const std::string& method, const Json& params) {
        EXPECT_EQ(error(method, params)["code"], -32602) << method << params;
    }

    const test::TemporaryFolder folder_;
    const std::string root_ = std::filesystem::canonical(folder_.path()).string();
    const std::string real_ = root_ + "/data";
    const std::string presented_ = "/nowhere/Documents";
    const PresentedPaths paths_{real_, real_, presented_};
    const std::shared_ptr<test::FakeProvider> fake_ = std::make_shared<test::FakeProvider>();
    const std::shared_ptr<TesselExtension> provider_ = fake_;
    SignalDispatcher signals_;
    test::FakeSearch search_;
    std::function<std::string(bool endsSoon)> greeting_ = [](bool) { return std::string("{}"); };
    Result<void> served_;
};

// However quick it was: nobody could have followed it before the call returned.
TEST_F(RpcConnectionTest, tellsOfMuchWorkBeforeItsAnswer) {
    fake_->itemsDeletedAtOnce = 1000;
    const std::string said =
        exchange(R"({"jsonrpc":"2.0","id":1,"method":"deleteItem","params":{"identifier":"did=3"}})"
                 "\n");
    const std::size_t end = said.find('\n');
    ASSERT_NE(end, std::string::npos);
    EXPECT_EQ(Json::parse(said.substr(0, end))["params"]["completedItems"], 1000);
    EXPECT_EQ(Json::parse(said.substr(end + 1))["result"], Json::object());
}

TEST_F(RpcConnectionTest, findsAnItem) {
    const Json item = result("itemForIdentifier", {{"identifier", "did=3"}});
    EXPECT_EQ(item["filename"], "a b.txt");
    EXPECT_EQ(item["fileURL"], "file://" + real_ + "/a%20b.txt");
}

TEST_F(RpcConnectionTest, tellsOfAnUnknownItem) {
    const Json error = this->error("itemForIdentifier", {{"identifier", "did=999"}});
    EXPECT_EQ(error["code"], -32000);
    EXPECT_EQ(error["message"], "No such item");
    EXPECT_EQ(error["data"], (Json{{"domain", "CindralProvider.LocalTesselKitError"}, {"code", 0}}));
}

TEST_F(RpcConnectionTest, tellsOfAnUnknownContainer) {
    const Json error = this->error("enumerateItems", {{"container", "fid=999"}});
    EXPECT_EQ(error["data"], (Json{{"domain", "TesselErrorDomain"}, {"code", -1001}, {"identifier", "fid=999"}}));
}

TEST_F(RpcConnectionTest, tellsPathsOfErrorsAsClientsKnowThem) {
    fake_->listingErrors.emplace("fid=2", KsError::posix(EACCES, presented_ + "/folder"));
    const Json error = this->error("enumerateItems", {{"container", "fid=2"}});
    EXPECT_EQ(error["data"], (Json{{"domain", "KsPOSIXErrorDomain"}, {"code", EACCES}, {"path", real_ + "/folder"}}));
    EXPECT_EQ(error["message"], "Permission denied");
}

TEST_F(RpcConnectionTest, findsTheURLOfAnItem) {
    EXPECT_EQ(result("URLForItem", {{"identifier", "did=3"}}), (Json{{"url", "file://" + real_ + "/a%20b.txt"}}));
    EXPECT_EQ(result("URLForItem", {{"identifier", "did=999"}}), (Json{{"url", nullptr}}));
}

TEST_F(RpcConnectionTest, findsTheIdentifierAtAURLOrPath) {
    const Json expected{{"identifier", "did=3"}};
    EXPECT_EQ(result("identifierForItemAtURL", {{"url", "file://" + real_ + "/a%20b.txt"}}), expected);
    EXPECT_EQ(result("identifierForItemAtURL", {{"path", real_ + "/a b.txt"}}), expected);
    EXPECT_EQ(result("identifierForItemAtURL", {{"path", presented_ + "/a b.txt"}}), expected);
    EXPECT_EQ(result("identifierForItemAtURL", {{"path", real_ + "/none"}}), (Json{{"identifier", nullptr}}));
    EXPECT_EQ(result("identifierForItemAtURL", {{"url", "https://example.com/x"}}), (Json{{"identifier", nullptr}}));
}

TEST_F(RpcConnectionTest, refusesPathsAndURLsThatNameNoFileHere) {
    expectInvalid("identifierForItemAtURL", {{"path", "relative"}});
    expectInvalid("identifierForItemAtURL", {{"path", ""}});
    expectInvalid("identifierForItemAtURL", {{"path", std::string("/a\0b", 4)}});
    expectInvalid("identifierForItemAtURL", {{"path", 7}});
    expectInvalid("identifierForItemAtURL", {{"url", "file:///a%00b"}});
    expectInvalid("identifierForItemAtURL", {{"url", "file:///a%2"}});
    expectInvalid("identifierForItemAtURL", {{"url", "/a"}, {"path", "/a"}});
    expectInvalid("identifierForItemAtURL", Json::object());
}

TEST_F(RpcConnectionTest, listsAContainerPageByPage) {
    fake_->folder("fid=20", "many");
    fake_->documents(7, "fid=20");
    std::vector<std::string> names;
    Json params{{"container", "fid=20"}};
    while (true) {
        const Json page = result("enumerateItems", params);
        for (const Json& item : page["items"]) names.push_back(item["filename"]);
        if (page["nextPage"].is_null()) break;
        params = {{"container", "fid=20"}, {"page", page["nextPage"]}};
    }
    EXPECT_THAT(names, ElementsAre("0000.txt", "0001.txt", "0002.txt", "0003.txt", "0004.txt", "0005.txt", "0006.txt"));
}

TEST_F(RpcConnectionTest, takesTheOrderOfTheFirstPage) {
    EXPECT_EQ(result("enumerateItems", {{"container", "fid=2"}, {"sort", "name"}})["items"], Json::array());
    EXPECT_EQ(result("enumerateItems", {{"container", "fid=2"}, {"sort", "date"}})["items"], Json::array());
    expectInvalid("enumerateItems", {{"container", "fid=2"}, {"sort", "size"}});
    expectInvalid("enumerateItems", {{"container", "fid=2"}, {"sort", 1}});
    expectInvalid("enumerateItems", {{"container", "fid=2"}, {"sort", "name"}, {"page", "MA=="}});
}

TEST_F(RpcConnectionTest, refusesPagesThatAreNotBase64) {
    for (const char* page : {"!", "MA", "MA=", "M A==", "MB==", "-_==", "\n"})
        expectInvalid("enumerateItems", {{"container", "fid=2"}, {"page", page}});
    expectInvalid("enumerateItems", {{"container", "fid=2"}, {"page", nullptr}});
    expectInvalid("enumerateItems", {{"page", "MA=="}});
}

TEST_F(RpcConnectionTest, tellsOfAnExpiredPage) {
    fake_->expiries = 1;
    EXPECT_EQ(error("enumerateItems", {{"container", "fid=2"}, {"page", "Mw=="}})["data"],
              (Json{{"domain", "TesselErrorDomain"}, {"code", -1002}}));
}

TEST_F(RpcConnectionTest, findsTheAnchorOfAContainer) {
    EXPECT_EQ(result("currentSyncAnchor", {{"container", "fid=2"}}),
              (Json{{"anchor", base64Encode(bytesOf("fid=2"))}}));
    EXPECT_EQ(result("currentSyncAnchor", {{"container", "fid=noanchor"}}), (Json{{"anchor", nullptr}}));
    EXPECT_EQ(error("currentSyncAnchor", {{"container", "x"}})["data"]["code"], -1001);
    expectInvalid("currentSyncAnchor", Json::object());
}

TEST_F(RpcConnectionTest, findsAnApplicationsContainer) {
    fake_->document("#com.example.notes", "Notes");
    EXPECT_EQ(result("defaultContainer", {{"bundleIdentifier", "com.example.notes"}})["identifier"],
              "#com.example.notes");
    const Json error = this->error("defaultContainer", {{"bundleIdentifier", "none"}});
    EXPECT_EQ(error["data"],
              (Json{{"domain", "TSErrorDomain"}, {"code", 1}, {"parameter", "bundleIdentifier"}, {"value", "none"}}));
}

TEST_F(RpcConnectionTest, enumeratesChanges) {
    fake_->changes["fid=2"] = {{{"d did=9", "u did=3", "u fid=2", "d fid=\x01"}, "\xff next", true, std::nullopt}};
    const Json changes =
        result("enumerateChanges", {{"container", "fid=2"}, {"anchor", base64Encode(bytesOf("given"))}});
    EXPECT_EQ(fake_->askedAnchors, (std::vector<std::string>{"given"}));
    ASSERT_EQ(changes["updated"].size(), 2U);
    EXPECT_EQ(changes["updated"][0], result("itemForIdentifier", {{"identifier", "did=3"}}));
    EXPECT_EQ(changes["updated"][1]["identifier"], "fid=2");
    EXPECT_EQ(changes["deleted"], (Json{"did=9", "fid=\x01"}));
    EXPECT_EQ(changes["log"], Json::parse(R"([["d","did=9"],["u","did=3"],["u","fid=2"],["d","fid=\u0001"]])"));
    EXPECT_EQ(changes["anchor"], base64Encode(bytesOf("\xff next")));
    EXPECT_EQ(changes["moreComing"], true);
    EXPECT_EQ(changes.size(), 5U);
}

TEST_F(RpcConnectionTest, enumeratesNoChanges) {
    fake_->changes["fid=2"] = {{{}, "next", false, std::nullopt}};
    EXPECT_EQ(result("enumerateChanges", {{"container", "fid=2"}, {"anchor", ""}}),
              (Json{{"updated", Json::array()},
                    {"deleted", Json::array()},
                    {"anchor", base64Encode(bytesOf("next"))},
                    {"moreComing", false},
                    {"log", Json::array()}}));
}

TEST_F(RpcConnectionTest, refusesAnchorsThatAreNone) {
    for (const Json& anchor : {Json("!"), Json("MA"), Json(nullptr), Json(1)})
        expectInvalid("enumerateChanges", {{"container", "fid=2"}, {"anchor", anchor}});
    expectInvalid("enumerateChanges", {{"container", "fid=2"}});
    expectInvalid("enumerateChanges", {{"anchor", "MA=="}});
    EXPECT_EQ(error("enumerateChanges", {{"container", "fid=2"}, {"anchor", "MA=="}})["data"],
              (Json{{"domain", "TesselErrorDomain"}, {"code", -1002}}));
    EXPECT_EQ(error("enumerateChanges", {{"container", "fid=9"}, {"anchor", "MA=="}})["data"]["code"], -1001);
}

TEST_F(RpcConnectionTest, answersMonitoring) {
    EXPECT_EQ(result("startMonitoring", {{"container", "fid=2"}}), Json::object());
    EXPECT_EQ(result("stopMonitoring", {{"container", "fid=2"}}), Json::object()) << "also of what is not monitored";
    EXPECT_EQ(error("startMonitoring", {{"container", "fid=9"}})["data"]["code"], -1001);
    expectInvalid("startMonitoring", Json::object());
    expectInvalid("stopMonitoring", {{"container", 1}});
    EXPECT_EQ(fake_->enumeratorsInvalidated, fake_->enumeratorsMade) << "it ends with the connection";
}

// A client that is connected for as long as the test wants.
class LiveConnection {
public:
    explicit LiveConnection(RpcService service)
        : server_(
              [this, service] { EXPECT_TRUE(serveRpc(input_.readEnd.get(), output_.writeEnd.get(), service).ok()); }) {}
    ~LiveConnection() {
        input_.writeEnd.reset();
        server_.join();
    }
    void send(const std::string& method, const std::string& container) {
        const Json request{{"jsonrpc", "2.0"}, {"id", 1}, {"method", method}, {"params", {{"container", container}}}};
        EXPECT_TRUE(descriptor::writeAll(input_.writeEnd.get(), request.dump() + "\n").ok());
    }
    Json receive() {
        std::string line;
        char c = 0;
        while (*descriptor::read(output_.readEnd.get(), {&c, 1}) == 1 && c != '\n') line += c;
        return Json::parse(line);
    }

private:
    Pipe input_;
    Pipe output_;
    std::thread server_;
};

TEST_F(RpcConnectionTest, tellsOfSignalsWhileAContainerIsMonitored) {
    LiveConnection client(service());
    LiveConnection other(service());
    const auto signal = [&](const std::string& container) {
        bool isCompleted = false;
        signals_.signalEnumerator(container, [&](const std::optional<KsError>& error) { isCompleted = !error; });
        EXPECT_TRUE(isCompleted) << "at once";
    };
    client.send("startMonitoring", "fid=2");
    client.send("startMonitoring", "fid=2");
    for (int i = 0; i < 2; ++i) EXPECT_EQ(client.receive()["result"], Json::object());
    other.send("startMonitoring", kTesselRootContainerItemIdentifier);
    EXPECT_EQ(other.receive()["result"], Json::object());
    const Json told{{"jsonrpc", "2.0"}, {"method", "signal"}, {"params", {{"container", "fid=2"}}}};
    signal("fid=2");
    EXPECT_EQ(client.receive(), told);
    signal(kTesselRootContainerItemIdentifier);
    EXPECT_EQ(other.receive()["params"]["container"], kTesselRootContainerItemIdentifier);
    client.send("stopMonitoring", "fid=2");
    EXPECT_EQ(client.receive()["result"], Json::object());
    signal("fid=2");
    client.send("status", "");
    EXPECT_TRUE(client.receive().contains("result")) << "nothing came in between";
}

TEST_F(RpcConnectionTest, answersStatus) {
    EXPECT_EQ(result("status", Json::object()), (Json{{"version", "x"}}));
}

TEST_F(RpcConnectionTest, saysWhatTheProviderDoesNotOffer) {
    const auto refused = error("renameItem", {{"identifier", "did=3"}, {"name", "new"}});
    EXPECT_EQ(refused["code"], -32000);
    EXPECT_EQ(refused["data"], (Json{{"domain", "KsPOSIXErrorDomain"}, {"code", ENOTSUP}}));
}

TEST_F(RpcConnectionTest, takesNamesOfAnyBytes) {
    for (const char* method : {"createDirectory", "renameItem", "reparentItem"}) {
        const Json params{{"identifier", "did=3"}, {"parent", "fid=2"}};
        const auto with = [&](const Json& more) {
            Json all = params;
            all.update(more);
            return error(method, all)["code"];
        };
        EXPECT_EQ(with({{"encodedName", "a%FF"}}), -32000) << method << ": what the provider doesn't offer";
        EXPECT_EQ(with({{"encodedName", "a"}, {"name", "a"}}), -32602) << method;
        for (const Json& wrong : {Json("%"), Json("%f"), Json("%0g"), Json(7), Json()})
            EXPECT_EQ(with({{"encodedName", wrong}}), -32602) << method << wrong;
    }
}

TEST_F(RpcConnectionTest, tellsPathsOfAnyBytes) {
    fake_->listingErrors.emplace("fid=2", KsError::posix(EACCES, presented_ + "/\xFF"));
    const auto data = error("enumerateItems", {{"container", "fid=2"}})["data"];
    EXPECT_EQ(data["path"], real_ + "/\uFFFD");
    EXPECT_EQ(data["pathURL"], "file://" + real_ + "/%FF");
    fake_->listingErrors.clear();
    fake_->listingErrors.emplace("fid=2", KsError::posix(EACCES, presented_ + "/a"));
    EXPECT_FALSE(error("enumerateItems", {{"container", "fid=2"}})["data"].contains("pathURL"));
}

TEST_F(RpcConnectionTest, isGreetedByWhoEndsSoonAndWhoDoesNot) {
    std::vector<bool> told;
    greeting_ = [&](bool endsSoon) {
        told.push_back(endsSoon);
        return std::string(R"({"process":1})");
    };
    for (const Json& params :
         {Json::object(), Json{{"endsSoon", true}}, Json{{"endsSoon", false}}, Json{{"endsSoon", 1}}})
        EXPECT_EQ(result("hello", params), (Json{{"process", 1}}));
    EXPECT_THAT(told, ElementsAre(false, true, false, false));
}

TEST_F(RpcConnectionTest, answersThumbnailsInTheOrderOfTheIdentifiers) {
    const auto none = [](const char* identifier) { return Json{{"identifier", identifier}, {"png", nullptr}}; };
    EXPECT_EQ(result("fetchThumbnails", {{"identifiers", {"did=2", "#a", "did=1"}}, {"size", 64}}),
              (Json{{"thumbnails", {none("did=2"), none("#a"), none("did=1")}}}));
    EXPECT_EQ(result("fetchThumbnails", {{"identifiers", Json::array()}, {"size", 1}}),
              (Json{{"thumbnails", Json::array()}}));
}

TEST_F(RpcConnectionTest, refusesThumbnailsOfNoSizeAndOfNothing) {
    for (const Json& params :
         {Json{{"identifiers", {"a"}}}, Json{{"size", 1}}, Json{{"identifiers", "a"}, {"size", 1}},
          Json{{"identifiers", {7}}, {"size", 1}}, Json{{"identifiers", {"a"}}, {"size", 0}},
          Json{{"identifiers", {"a"}}, {"size", -1}}, Json{{"identifiers", {"a"}}, {"size", "1"}}}) {
        EXPECT_EQ(error("fetchThumbnails", params)["code"], -32602) << params;
    }
}

TEST_F(RpcConnectionTest, refusesMethodsThatAreNotThere) {
    for (const char* method : {"fetchThumbnail", "Cancel", "", "itemforidentifier"}) {
        EXPECT_EQ(error(method, Json::object())["code"], -32601) << method;
    }
}

TEST_F(RpcConnectionTest, takesIdentifiersOfAnyLength) {
    const std::string identifier(100'000, 'x');
    EXPECT_EQ(error("enumerateItems", {{"container", identifier}})["data"]["identifier"], identifier);
}

TEST_F(RpcConnectionTest, livesOnAfterLinesThatAreNoRequests) {
    const std::string longLine =
        R"({"jsonrpc":"2.0","id":0,"method":")" + std::string(kJsonRpcLineBytesMax, 'x') + "\"}\n";
    const auto answers = answersTo(longLine + R"({"jsonrpc":"2.0","id":1,"method":"status"})" + "\n");
    EXPECT_EQ(answers.at("null")["error"]["code"], -32600);
    EXPECT_EQ(answers.at("1")["result"]["version"], "x");

    const std::string deep = std::string(10'000, '[') + std::string(10'000, ']') + "\n";
    const auto afterDeep = answersTo(deep + R"({"jsonrpc":"2.0","id":1,"method":"status"})" + "\n");
    EXPECT_EQ(afterDeep.at("null")["error"]["code"], -32600);
    EXPECT_EQ(afterDeep.at("1")["result"]["version"], "x");
}

TEST_F(RpcConnectionTest, answersWhatIsUnderWayAtTheEndOfInput) {
    fake_->isAsynchronous = true;
    std::string lines;
    for (int i = 0; i < 500; ++i) {
        lines += fmt::format(R"({{"jsonrpc":"2.0","id":{},"method":"enumerateItems","params":{{"container":"{}"}}}})",
                             i, i % 2 == 0 ? "fid=2" : "TesselRootContainerItemIdentifier");
        if (i + 1 < 500) lines += '\n';  // The last line has no newline.
    }
    EXPECT_EQ(answersTo(lines).size(), 500U);
    EXPECT_TRUE(served_.ok());
    EXPECT_EQ(fake_->enumeratorsInvalidated, fake_->enumeratorsMade);
    EXPECT_EQ(fake_->enumeratorsMade, 251);
}

TEST_F(RpcConnectionTest, endsQuietlyWhenNobodyReadsAnswers) {
    Pipe input;
    Pipe output;
    output.readEnd.reset();
    // The input stays open: the client went away without closing it.
    const std::string line = R"({"jsonrpc":"2.0","id":1,"method":"status"})"
                             "\n";
    ASSERT_TRUE(descriptor::writeAll(input.writeEnd.get(), line).ok());
    EXPECT_TRUE(serveRpc(input.readEnd.get(), output.writeEnd.get(), service()).ok());
}

TEST_F(RpcConnectionTest, tellsOfOutputThatCannotBeWritten) {
    Pipe input;
    const UniqueFd full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
    const std::string line = R"({"jsonrpc":"2.0","id":1,"method":"status"})"
                             "\n";
    ASSERT_TRUE(descriptor::writeAll(input.writeEnd.get(), line).ok());
    const auto served = serveRpc(input.readEnd.get(), full.get(), service());
    ASSERT_FALSE(served.ok());
    EXPECT_TRUE(served.error().isPosix(ENOSPC));
}

}  // namespace
}  // namespace cindral
