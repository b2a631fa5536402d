#include "host/http/HttpConnection.h"

#include <poll.h>
#include <sys/sendfile.h>
#include <sys/socket.h>

#include <algorithm>
#include <boost/beast/core/flat_buffer.hpp>
#include <boost/beast/http/buffer_body.hpp>
#include <boost/beast/http/parser.hpp>
#include <cerrno>
#include <utility>

namespace cindral {
namespace {

namespace beast = boost::beast;
namespace http = beast::http;

constexpr std::size_t kReceiveBytes = 64 << 10;
constexpr std::size_t kLingerBytesMax = 1 << 20;
constexpr std::chrono::milliseconds kLingerTime{1'000};
constexpr std::size_t kSendFileBytes = 1 << 20;

std::string lowerCase(std::string_view text) {
    std::string lower(text);
    std::ranges::transform(lower, lower.begin(),
                           [](char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; });
    return lower;
}

std::string_view view(beast::string_view text) {
    return {text.data(), text.size()};
}

HttpRequest::Method methodOf(http::verb verb) {
    if (verb == http::verb::get) return HttpRequest::Method::get;
    if (verb == http::verb::head) return HttpRequest::Method::head;
    if (verb == http::verb::post) return HttpRequest::Method::post;
    return HttpRequest::Method::other;
}

}  // namespace

/// What has been received and not yet understood, and the request that is being read.
struct HttpConnection::Parser {
    beast::flat_buffer received{4 * kReceiveBytes};  // Two heads and what was received with them.
    std::optional<http::request_parser<http::buffer_body>> request;
};

HttpConnection::HttpConnection(int socket, int interrupt, const HttpLimits& limits)
    : socket_(socket), interrupt_(interrupt), limits_(limits), parser_(std::make_unique<Parser>()) {}

HttpConnection::~HttpConnection() = default;

// MARK: Reading

HttpConnection::Next HttpConnection::next() {
    const auto now = std::chrono::steady_clock::now();
    parser_->request.emplace();
    parser_->request->header_limit(static_cast<std::uint32_t>(limits_.headBytesMax));
    parser_->request->body_limit(boost::none);  // Whoever reads the body counts.
    if (parser_->received.size() == 0) {
        if (!receive(now + limits_.idle).ok()) return End{};
    }
    const Deadline deadline = std::chrono::steady_clock::now() + limits_.head;
    while (true) {
        beast::error_code error;
        parser_->received.consume(parser_->request->put(parser_->received.data(), error));
        if (!error) {
            if (parser_->request->is_header_done()) return parseHead();
            continue;
        }
        if (error == http::error::header_limit || error == http::error::buffer_overflow)
            return refuse(431, "The head of the request is too long");
        if (error != http::error::need_more) return refuse(400, "That is no request");
        if (parser_->received.size() >= limits_.headBytesMax) return refuse(431, "The head of the request is too long");
        if (const auto got = receive(deadline); !got.ok()) {
            if (got.error().isPosix(ETIMEDOUT)) return refuse(408, "The head of the request did not come");
            return End{};
        }
    }
}

HttpConnection::Next HttpConnection::parseHead() {
    const auto& message = parser_->request->get();
    HttpRequest request;
    request.method = methodOf(message.method());
    const std::string_view target = view(message.target());
    if (!target.starts_with('/')) return refuse(400, "The target of the request is no path");
    const std::size_t question = std::min(target.find('?'), target.size());
    request.path = target.substr(0, question);
    request.query = target.substr(std::min(question + 1, target.size()));
    for (const auto& field : message)
        request.fields.emplace_back(lowerCase(view(field.name_string())), std::string(view(field.value())));
    request.isChunked = parser_->request->chunked();
    if (request.count("transfer-encoding") > 0 && !request.isChunked) return refuse(400, "That encoding is not known");
    if (const auto length = parser_->request->content_length()) request.contentLength = *length;
    // "5, 5" is a length too, and one that others may read otherwise.
    const auto written = request.only("content-length");
    if (request.contentLength && (!written || written->find_first_not_of("0123456789") != std::string_view::npos))
        return refuse(400, "That length is none");
    if (message.version() != 11) return refuse(400, "Only HTTP/1.1 is spoken here");
    // Whoever waits to be asked for the body may as well send it.
    return request;
}

HttpResponse HttpConnection::refuse(int status, std::string_view message) {
    goesOn_ = false;
    return HttpResponse::refusal(status, message);
}

Result<std::size_t> HttpConnection::readBody(std::span<char> buffer) {
    return readBodyUntil(buffer, std::nullopt);
}

Result<std::size_t> HttpConnection::readBodyUntil(std::span<char> buffer, std::optional<Deadline> deadline) {
    auto& request = *parser_->request;
    while (!request.is_done()) {
        auto& body = request.get().body();
        body.data = buffer.data();
        body.size = buffer.size();
        body.more = true;
        beast::error_code error;
        const std::size_t used = request.put(parser_->received.data(), error);
        parser_->received.consume(used);
        const std::size_t got = buffer.size() - body.size;
        if (error && error != http::error::need_more && error != http::error::need_buffer) {
            goesOn_ = false;
            return KsError::posix(EPROTO);
        }
        if (got > 0) return got;
        if (!error && used > 0) continue;
        const Deadline stall = std::chrono::steady_clock::now() + limits_.stall;
        if (auto more = receive(std::min(deadline.value_or(stall), stall)); !more.ok()) {
            goesOn_ = false;
            return std::move(more).error();
        }
    }
    return std::size_t{0};
}

Result<std::string> HttpConnection::readWholeBody(std::size_t max) {
    const Deadline deadline = std::chrono::steady_clock::now() + limits_.body;
    std::string body;
    std::vector<char> buffer(std::min(kReceiveBytes, max + 1));
    while (true) {
        const std::size_t got = TRY(readBodyUntil(buffer, deadline));
        if (got == 0) return body;
        if (body.size() + got > max) return KsError::posix(EMSGSIZE);
        body.append(buffer.data(), got);
    }
}

/// At least one byte more.
Result<void> HttpConnection::receive(Deadline deadline) {
    const auto space = parser_->received.prepare(kReceiveBytes);
    while (true) {
        TRY(waitFor(POLLIN, deadline, /*isInterruptible=*/true));
        const ssize_t got = ::recv(socket_, space.data(), space.size(), 0);
        if (got > 0) {
            parser_->received.commit(static_cast<std::size_t>(got));
            return {};
        }
        if (got == 0) return KsError::posix(ECONNRESET);
        if (errno != EINTR && errno != EAGAIN) return KsError::errorWithPOSIXCode();
    }
}

Result<void> HttpConnection::waitFor(short events, Deadline deadline, bool isInterruptible) const {
    pollfd entries[] = {{socket_, events, 0}, {interrupt_, POLLIN, 0}};
    while (true) {
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) return KsError::posix(ETIMEDOUT);
        const int ready = ::poll(entries, isInterruptible ? 2 : 1, static_cast<int>(left.count()));
        if (ready < 0 && errno != EINTR) return KsError::errorWithPOSIXCode();
        if (ready <= 0) continue;
        if (isInterruptible && entries[1].revents != 0) return KsError::posix(ECANCELED);
        return {};
    }
}

// MARK: Answering

/// A request whose body was not read to its end can't be followed by another.
bool HttpConnection::keepsConnection() const {
    if (!goesOn_ || !parser_->request || !parser_->request->is_header_done()) return false;
    return parser_->request->is_done() && parser_->request->keep_alive();
}

bool HttpConnection::answer(const HttpResponse& response, bool withoutBody) {
    const bool begun = beginAnswer(response, response.body.size());
    if (!begun || withoutBody || response.body.empty()) return begun;
    return send(response.body);
}

bool HttpConnection::beginAnswer(const HttpResponse& response, std::optional<std::uint64_t> length) {
    if (parser_->request && parser_->request->is_header_done() && !parser_->request->is_done()) {
        // Nothing is left to be read of a request without a body; that is known only after a look.
        beast::error_code error;
        parser_->received.consume(parser_->request->put(parser_->received.data(), error));
    }
    goesOn_ = length.has_value() && keepsConnection();
    return send(response.head(length, goesOn_));
}

bool HttpConnection::send(std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t put = ::send(socket_, bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        if (put >= 0) {
            bytes.remove_prefix(static_cast<std::size_t>(put));
            continue;
        }
        if (errno == EINTR) continue;
        if (errno == EAGAIN && waitFor(POLLOUT, std::chrono::steady_clock::now() + limits_.stall, false).ok()) continue;
        goesOn_ = false;
        return false;
    }
    return true;
}

bool HttpConnection::sendFile(int file, std::uint64_t offset, std::uint64_t length) {
    auto position = static_cast<off_t>(offset);
    while (length > 0) {
        if (!waitFor(POLLOUT, std::chrono::steady_clock::now() + limits_.stall, false).ok()) return goesOn_ = false;
        const ssize_t put = ::sendfile(socket_, file, &position, std::min<std::uint64_t>(length, kSendFileBytes));
        if (put > 0) {
            length -= static_cast<std::uint64_t>(put);
            continue;
        }
        if (put < 0 && (errno == EINTR || errno == EAGAIN)) continue;
        // The file has become shorter, or nobody is there: what was announced can't be kept.
        return goesOn_ = false;
    }
    return true;
}

void HttpConnection::linger() {
    ::shutdown(socket_, SHUT_WR);
    const Deadline deadline = std::chrono::steady_clock::now() + kLingerTime;
    std::size_t left = kLingerBytesMax;
    char buffer[4096];
    while (left > 0 && waitFor(POLLIN, deadline, true).ok()) {
        const ssize_t got = ::recv(socket_, buffer, sizeof buffer, MSG_DONTWAIT);
        if (got <= 0) return;
        left -= std::min(left, static_cast<std::size_t>(got));
    }
}

}  // namespace cindral
