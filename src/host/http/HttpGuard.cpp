#include "host/http/HttpGuard.h"

#include <fmt/format.h>

#include <algorithm>

namespace cindral {
namespace {

constexpr std::string_view kTokenField = "x-cindral-token";

}  // namespace

HttpGuard::HttpGuard(std::uint16_t port, HttpSessions& sessions)
    : sessions_(sessions),
      hosts_{fmt::format("127.0.0.1:{}", port), fmt::format("localhost:{}", port)},
      cookieName_(fmt::format("cindral-{}", port)) {}

std::optional<HttpResponse> HttpGuard::refuseStranger(const HttpRequest& request) const {
    const auto host = request.only("host");
    if (!host || std::ranges::find(hosts_, *host) == std::end(hosts_))
        return HttpResponse::refusal(421, "That is not the name of this service");
    return std::nullopt;
}

bool HttpGuard::isOwnOrigin(const HttpRequest& request, std::string_view origin) const {
    return origin == fmt::format("http://{}", request.only("host").value_or(""));
}

std::optional<HttpResponse> HttpGuard::refuseCrossSite(const HttpRequest& request) const {
    const auto refusal = HttpResponse::refusal(403, "Another site asks for this");
    // "none" is the person: an address that was typed, a bookmark.
    const auto site = request.only("sec-fetch-site");
    if (request.count("sec-fetch-site") > 0 && site != "same-origin" && site != "none") return refusal;
    const auto origin = request.only("origin");
    if (request.count("origin") > 0 && (!origin || !isOwnOrigin(request, *origin))) return refusal;
    return std::nullopt;
}

std::optional<HttpResponse> HttpGuard::refuseWrite(const HttpRequest& request, const HttpSession* session) const {
    if (request.only("origin") == std::nullopt) return HttpResponse::refusal(403, "A write says where it comes from");
    if (auto refusal = refuseCrossSite(request)) return refusal;
    if (session != nullptr && !HttpSessions::areEqual(request.only(kTokenField).value_or(""), session->token))
        return HttpResponse::refusal(403, "A write shows the session's token");
    return std::nullopt;
}

std::shared_ptr<const HttpSession> HttpGuard::sessionOf(const HttpRequest& request) const {
    for (const std::string_view cookie : request.cookies(cookieName_)) {
        if (auto session = sessions_.find(cookie)) return session;
    }
    return nullptr;
}

std::pair<std::string, std::string> HttpGuard::cookieField(const HttpSession& session) const {
    return {"Set-Cookie", fmt::format("{}={}; Path=/; HttpOnly; SameSite=Strict", cookieName_, session.cookie)};
}

std::pair<std::string, std::string> HttpGuard::noCookieField() const {
    return {"Set-Cookie", fmt::format("{}=; Path=/; HttpOnly; SameSite=Strict; Max-Age=0", cookieName_)};
}

}  // namespace cindral
