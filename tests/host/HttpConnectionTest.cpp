#include "host/http/HttpConnection.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include "host/Descriptor.h"
#include "host/http/HttpDocuments.h"
#include "host/http/HttpSessions.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

constexpr std::chrono::milliseconds kNoTime{0};

class HttpConnectionTest : public ::testing::Test {
protected:
    HttpConnectionTest() {
        int fds[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, fds) != 0) std::abort();
        ours_.reset(fds[0]);
        clients_.reset(fds[1]);
        auto interrupt = descriptor::makeInterrupt();
        if (!interrupt.ok()) std::abort();
        interrupt_ = *std::move(interrupt);
    }

    void clientSends(std::string_view bytes) { ASSERT_TRUE(descriptor::writeAll(clients_.get(), bytes).ok()); }
    HttpConnection connection(const HttpLimits& limits = {}) { return {ours_.get(), interrupt_.get(), limits}; }

    static int statusOf(const HttpConnection::Next& next) {
        const auto* refusal = std::get_if<HttpResponse>(&next);
        return refusal != nullptr ? refusal->status : 0;
    }

    UniqueFd ours_;
    UniqueFd clients_;
    UniqueFd interrupt_;
};

TEST_F(HttpConnectionTest, readsOneRequestAfterTheOther) {
    clientSends("GET /a?b=%20c HTTP/1.1\r\nHost: x\r\n\r\nPOST /d HTTP/1.1\r\nContent-Length: 3\r\n\r\nefg");
    auto connection = this->connection();
    const auto first = connection.next();
    ASSERT_TRUE(std::holds_alternative<HttpRequest>(first));
    EXPECT_EQ(std::get<HttpRequest>(first).path, "/a");
    EXPECT_EQ(std::get<HttpRequest>(first).parameter("b"), " c");
    EXPECT_EQ(std::get<HttpRequest>(first).only("host"), "x");
    EXPECT_TRUE(connection.answer(HttpResponse::json("{}")));
    EXPECT_TRUE(connection.goesOn());
    const auto second = connection.next();
    ASSERT_TRUE(std::holds_alternative<HttpRequest>(second));
    EXPECT_EQ(*connection.readWholeBody(3), "efg");
    EXPECT_TRUE(connection.answer(HttpResponse::json("{}")));
    EXPECT_TRUE(connection.goesOn());
}

TEST_F(HttpConnectionTest, endsAfterAnAnswerToABodyThatWasNotRead) {
    clientSends("POST / HTTP/1.1\r\nContent-Length: 3\r\n\r\n");
    auto connection = this->connection();
    (void)connection.next();
    EXPECT_TRUE(connection.answer(HttpResponse::refusal(403, "No")));
    EXPECT_FALSE(connection.goesOn());
}

TEST_F(HttpConnectionTest, refusesABodyThatIsTooLong) {
    clientSends("POST / HTTP/1.1\r\nContent-Length: 4\r\n\r\nabcd");
    auto connection = this->connection();
    (void)connection.next();
    EXPECT_TRUE(connection.readWholeBody(3).error().isPosix(EMSGSIZE));
}

TEST_F(HttpConnectionTest, waitsForAHeadNoLongerThanItsPatience) {
    HttpLimits limits;
    limits.head = kNoTime;
    clientSends("GET / HTTP/1.1\r\nHost");
    EXPECT_EQ(statusOf(connection(limits).next()), 408);
}

TEST_F(HttpConnectionTest, waitsForARequestNoLongerThanItsPatience) {
    HttpLimits limits;
    limits.idle = kNoTime;
    EXPECT_TRUE(std::holds_alternative<HttpConnection::End>(connection(limits).next()));
}

TEST_F(HttpConnectionTest, waitsForABodyNoLongerThanItsPatience) {
    HttpLimits limits;
    limits.stall = kNoTime;
    clientSends("POST / HTTP/1.1\r\nContent-Length: 4\r\n\r\nab");
    auto connection = this->connection(limits);
    (void)connection.next();
    EXPECT_TRUE(connection.readWholeBody(10).error().isPosix(ETIMEDOUT));
}

TEST_F(HttpConnectionTest, waitsForWhoReadsNothingNoLongerThanItsPatience) {
    HttpLimits limits;
    limits.stall = kNoTime;
    clientSends("GET / HTTP/1.1\r\n\r\n");
    auto connection = this->connection(limits);
    (void)connection.next();
    EXPECT_FALSE(connection.answer(HttpResponse::json(std::string(10 << 20, 'x'))));
    EXPECT_FALSE(connection.goesOn());
}

TEST_F(HttpConnectionTest, endsWhenItIsInterrupted) {
    descriptor::interrupt(interrupt_);
    EXPECT_TRUE(std::holds_alternative<HttpConnection::End>(connection().next()));
}

TEST(HttpRequest, decodesOnce) {
    EXPECT_EQ(percentDecode("a%2Fb%252f%00"), std::string("a/b%2f\0", 7));
    EXPECT_EQ(percentDecode("+"), "+");
    for (const char* broken : {"%", "%2", "%zz", "a%2", "%-1"})
        EXPECT_EQ(percentDecode(broken), std::nullopt) << broken;
}

TEST(HttpRequest, hasNoValueForWhatStandsTwice) {
    HttpRequest request;
    request.query = "a=1&b=2&a=3&&c&=d";
    request.fields = {{"x", "1"}, {"y", "2"}, {"x", "1"}, {"cookie", "a=1; b=2;a=3"}, {"cookie", "a=4"}};
    EXPECT_EQ(request.parameter("a"), std::nullopt);
    EXPECT_EQ(request.parameter("b"), "2");
    EXPECT_EQ(request.parameter("c"), "");
    EXPECT_EQ(request.parameter("d"), std::nullopt);
    EXPECT_EQ(request.only("x"), std::nullopt);
    EXPECT_EQ(request.only("y"), "2");
    EXPECT_THAT(request.cookies("a"), ::testing::ElementsAre("1", "3", "4"));
}

TEST(HttpSessions, endWithTheirTime) {
    HttpSessions sessions;
    const auto now = HttpSessions::Clock::now();
    const auto session = sessions.trade(sessions.makeLink(), now);
    ASSERT_NE(session, nullptr);
    EXPECT_EQ(sessions.find(session->cookie, now + HttpSessions::kLifetime - std::chrono::seconds(1)), session);
    EXPECT_EQ(sessions.find(session->cookie, now + HttpSessions::kLifetime), nullptr);
}

TEST(HttpSessions, forgetTheOldestBeyondTheirNumber) {
    HttpSessions sessions;
    const std::string oldLink = sessions.makeLink();
    const auto oldest = sessions.trade(sessions.makeLink());
    for (std::size_t i = 0; i < HttpSessions::kSessionsMax; ++i)
        EXPECT_NE(sessions.trade(sessions.makeLink()), nullptr);
    EXPECT_EQ(sessions.find(oldest->cookie), nullptr);
    for (std::size_t i = 0; i < HttpSessions::kLinksMax; ++i) (void)sessions.makeLink();
    EXPECT_EQ(sessions.trade(oldLink), nullptr);
}

TEST(HttpResponse, keepsItsFieldsApart) {
    const std::string head = HttpResponse::refusal(404, "No \"such\"\r\nthing").head(3, true);
    EXPECT_THAT(head, StartsWith("HTTP/1.1 404 Not Found\r\nContent-Type: application/json\r\nContent-Length: 3\r\n"));
    EXPECT_THAT(head, HasSubstr("\r\nX-Content-Type-Options: nosniff\r\n"));
    EXPECT_THAT(head, ::testing::EndsWith("\r\n\r\n"));
}

TEST(ServedType, showsOnlyWhatNobodyRuns) {
    EXPECT_TRUE(ServedType::of("image/png").isShown);
    EXPECT_EQ(ServedType::of("audio/x-flac").contentType, "audio/flac");
    EXPECT_EQ(ServedType::of("text/x-python").contentType, "text/plain; charset=utf-8");
    for (const char* type : {"text/html", "application/xhtml+xml", "image/svg+xml", "text/xml", "application/xml", "",
                             "text/javascript", "multipart/related", "com.vemra.package"})
        EXPECT_FALSE(ServedType::of(type).isShown) << type;
}

}  // namespace
}  // namespace cindral
