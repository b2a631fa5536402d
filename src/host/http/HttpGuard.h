#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "host/http/HttpRequest.h"
#include "host/http/HttpResponse.h"
#include "host/http/HttpSessions.h"

namespace cindral {

/// Who may ask for what: the checks that every request passes before anything is done for it.
///
/// A request is for us when it names us, once, by one of our own names: a name of somebody else's that leads to this
/// machine is not ours. It is the page's own when the browser says that it comes from no other site, nor from another
/// port of this one. Whoever writes shows where they come from and the session's token, which only the page can read.
///
/// Thread safety: all operations, from any thread.
class HttpGuard {
public:
    /// `sessions` is borrowed for life.
    HttpGuard(std::uint16_t port, HttpSessions& sessions);

    /// The address that people are given.
    std::string origin() const { return "http://" + hosts_[0]; }

    /// What to answer to a request that is not for us, or asks for what nobody is given; none where it is well.
    std::optional<HttpResponse> refuseStranger(const HttpRequest& request) const;
    /// The same of a request that another site makes in the person's browser.
    std::optional<HttpResponse> refuseCrossSite(const HttpRequest& request) const;
    /// The same of a write without the token. `session` is null before there is one.
    std::optional<HttpResponse> refuseWrite(const HttpRequest& request, const HttpSession* session) const;

    /// The session that the request belongs to; null where there is none.
    std::shared_ptr<const HttpSession> sessionOf(const HttpRequest& request) const;
    /// The fields that give a browser its session, or take it.
    std::pair<std::string, std::string> cookieField(const HttpSession& session) const;
    std::pair<std::string, std::string> noCookieField() const;

private:
    bool isOwnOrigin(const HttpRequest& request, std::string_view origin) const;

    HttpSessions& sessions_;
    const std::string hosts_[2];
    const std::string cookieName_;  ///< of the port's own: cookies are shared by all ports of a machine
};

}  // namespace cindral
