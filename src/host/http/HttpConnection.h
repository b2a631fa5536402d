#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string_view>
#include <variant>

#include "host/http/HttpRequest.h"
#include "host/http/HttpResponse.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// What a connection may cost, and how long may be waited for its other end.
struct HttpLimits {
    std::size_t headBytesMax = 16 << 10;
    std::chrono::milliseconds idle{75'000};   ///< until the first byte of the next request
    std::chrono::milliseconds head{10'000};   ///< from there to the end of its head
    std::chrono::milliseconds stall{30'000};  ///< in a body without a byte, either way
    std::chrono::milliseconds body{30'000};   ///< for the whole of a body that is kept in memory
};

/// One connection of a browser: requests one after the other, and their answers in that order.
///
/// What is no HTTP is refused, not guessed at: a length that is none, a length and chunks at once, a head beyond its
/// limit. After that, and after an answer to a request whose body was not read to its end, the connection ends.
///
/// Thread safety: for one thread at a time.
class HttpConnection {
public:
    /// `socket` does not wait by itself. `interrupt`, when it can be read, ends the waiting for a request or for more
    /// of a body. Both are borrowed for life.
    HttpConnection(int socket, int interrupt, const HttpLimits& limits);
    ~HttpConnection();
    HttpConnection(const HttpConnection&) = delete;
    HttpConnection& operator=(const HttpConnection&) = delete;

    struct End {};
    /// The next request, or what to answer instead, after which the connection ends.
    using Next = std::variant<HttpRequest, HttpResponse, End>;
    Next next();

    /// Bytes of the body, at least one; 0 at its end. EPROTO for what is no body, ECONNRESET where it ends before its
    /// end, ETIMEDOUT where nothing comes.
    Result<std::size_t> readBody(std::span<char> buffer);
    /// All of it. EMSGSIZE where it is longer, ETIMEDOUT where it takes too long, and as readBody().
    Result<std::string> readWholeBody(std::size_t max);

    /// Sends the answer with its own body. False when the connection has ended by it.
    bool answer(const HttpResponse& response, bool withoutBody = false);
    /// Sends the head of an answer whose body follows by send().
    bool beginAnswer(const HttpResponse& response, std::optional<std::uint64_t> length);
    bool send(std::string_view bytes);
    /// The kernel copies from a file of that many bytes and more, from `offset` on.
    bool sendFile(int file, std::uint64_t offset, std::uint64_t length);

    /// Whether another request can come.
    bool goesOn() const { return goesOn_; }
    /// Says that nothing more is sent, and takes what is still on its way, for a moment: the other end then reads the
    /// answer before it hears that the connection is gone.
    void linger();

private:
    using Deadline = std::chrono::steady_clock::time_point;
    struct Parser;
    bool keepsConnection() const;
    Result<std::size_t> readBodyUntil(std::span<char> buffer, std::optional<Deadline> deadline);
    Result<void> receive(Deadline deadline);
    Result<void> waitFor(short events, Deadline deadline, bool isInterruptible) const;
    Next parseHead();
    HttpResponse refuse(int status, std::string_view message);

    const int socket_;
    const int interrupt_;
    const HttpLimits limits_;
    std::unique_ptr<Parser> parser_;
    bool goesOn_ = true;
};

}  // namespace cindral
