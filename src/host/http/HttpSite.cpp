#include "host/http/HttpSite.h"

#include <algorithm>
#include <cerrno>
#include <charconv>

#include "host/JsonText.h"
#include "host/http/WebAssets.h"

namespace cindral {
namespace {

constexpr std::size_t kMessageBytesMax = 4 << 20;
constexpr std::size_t kLinkBytesMax = 1 << 10;
constexpr unsigned kThumbnailPixelsUsual = 128;
constexpr unsigned kPageThumbnailPixelsMax = 1024;

std::string tokenText(const HttpSession& session) {
    return R"({"token":)" + jsonString(session.token) + "}\n";
}

/// The identifier that a route ends with.
std::optional<TesselItemIdentifier> identifierOf(std::string_view encoded) {
    auto identifier = percentDecode(encoded);
    return identifier && HttpDocuments::isIdentifier(*identifier) ? identifier : std::nullopt;
}

/// What to answer for a body that can't be taken; none where there is nobody to answer.
HttpResponse bodyRefusal(const KsError& error) {
    if (error.isPosix(EMSGSIZE)) return HttpResponse::refusal(413, "The message is too long");
    if (error.isPosix(EPROTO)) return HttpResponse::refusal(400, "That is no body");
    return HttpResponse::refusal(408, "The message did not come to its end");
}

}  // namespace

struct HttpSite::Route {
    HttpRequest::Method method;  ///< "get" also for the head alone
    std::string_view path;       ///< one that ends with "/" begins others
    void (HttpSite::*serve)(const Call&);
};

constexpr HttpSite::Route HttpSite::kRoutes[] = {
    {HttpRequest::Method::get, "/session", &HttpSite::sayToken},
    {HttpRequest::Method::post, "/logout", &HttpSite::logOut},
    {HttpRequest::Method::post, "/rpc", &HttpSite::answerRpc},
    {HttpRequest::Method::get, "/events", &HttpSite::streamEvents},
    {HttpRequest::Method::get, "/file/", &HttpSite::sendDocument},
    {HttpRequest::Method::get, "/thumbnail/", &HttpSite::sendThumbnail},
    {HttpRequest::Method::post, "/archive", &HttpSite::prepareArchive},
    {HttpRequest::Method::get, "/archive/", &HttpSite::sendArchive},
    {HttpRequest::Method::post, "/upload", &HttpSite::receiveUpload},
};

HttpSite::HttpSite(const RpcService& service, HttpSessions& sessions, std::uint16_t port, std::uint64_t uploadBytesMax,
                   std::function<void()> didTrade)
    : service_(service),
      sessions_(sessions),
      guard_(port, sessions),
      clients_(service),
      documents_(*service.provider),
      archives_(service.provider, documents_),
      uploads_(*service.provider, service.paths, uploadBytesMax),
      didTrade_(std::move(didTrade)) {}

void HttpSite::serve(HttpConnection& connection, const HttpRequest& request, int socket, int stop) {
    const auto refuse = [&](const HttpResponse& response) {
        connection.answer(response, request.method == HttpRequest::Method::head);
    };
    if (const auto refusal = guard_.refuseStranger(request)) return refuse(*refusal);
    if (serveAsset(connection, request)) return;
    if (request.method == HttpRequest::Method::post && request.path == "/session")
        return openSession(connection, request);

    const auto route = std::ranges::find_if(kRoutes, [&](const Route& each) {
        return each.path.ends_with('/') ? request.path.starts_with(each.path) : request.path == each.path;
    });
    if (route == std::end(kRoutes)) return refuse(HttpResponse::refusal(404, "There is nothing there"));
    const bool isRead = request.method == HttpRequest::Method::get || request.method == HttpRequest::Method::head;
    if (isRead ? route->method != HttpRequest::Method::get : request.method != route->method)
        return refuse(HttpResponse::refusal(405, "That can't be asked there"));
    if (const auto refusal = guard_.refuseCrossSite(request)) return refuse(*refusal);
    const auto session = guard_.sessionOf(request);
    if (session == nullptr) return refuse(HttpResponse::refusal(401, "Open the link that the program has printed"));
    if (!isRead) {
        if (const auto refusal = guard_.refuseWrite(request, session.get())) return refuse(*refusal);
    }
    (this->*route->serve)(
        {connection, request, session, std::string_view(request.path).substr(route->path.size()), socket, stop});
}

/// The page is the same for everybody.
bool HttpSite::serveAsset(HttpConnection& connection, const HttpRequest& request) {
    if (request.method != HttpRequest::Method::get && request.method != HttpRequest::Method::head) return false;
    for (const WebAsset& asset : webAssets()) {
        if (asset.path != request.path) continue;
        HttpResponse response;
        response.contentType = asset.contentType;
        response.body = asset.contents;
        connection.answer(response, request.method == HttpRequest::Method::head);
        return true;
    }
    return false;
}

void HttpSite::openSession(HttpConnection& connection, const HttpRequest& request) {
    if (const auto refusal = guard_.refuseWrite(request, nullptr)) {
        connection.answer(*refusal);
        return;
    }
    const auto link = connection.readWholeBody(kLinkBytesMax);
    if (!link.ok()) {
        connection.answer(bodyRefusal(link.error()));
        return;
    }
    const auto session = sessions_.trade(*link);
    if (session == nullptr) {
        connection.answer(HttpResponse::refusal(401, "That link was used before, or never made"));
        return;
    }
    HttpResponse response = HttpResponse::json(tokenText(*session));
    response.fields = {guard_.cookieField(*session)};
    connection.answer(response);
    didTrade_();
}

void HttpSite::sayToken(const Call& call) {
    call.connection.answer(HttpResponse::json(tokenText(*call.session)),
                           call.request.method == HttpRequest::Method::head);
}

void HttpSite::logOut(const Call& call) {
    sessions_.end(*call.session);
    clients_.end(*call.session);
    HttpResponse response = HttpResponse::noContent();
    response.fields = {guard_.noCookieField()};
    call.connection.answer(response);
}

/// None once the request is answered.
std::optional<std::string> HttpSite::readMessage(const Call& call) {
    const auto type = call.request.only("content-type");
    if (!type || !type->starts_with("application/json")) {
        call.connection.answer(HttpResponse::refusal(415, "A message is JSON"));
        return std::nullopt;
    }
    auto message = call.connection.readWholeBody(kMessageBytesMax);
    if (message.ok()) return *std::move(message);
    call.connection.answer(bodyRefusal(message.error()));
    return std::nullopt;
}

void HttpSite::answerRpc(const Call& call) {
    const auto message = readMessage(call);
    if (!message) return;
    std::string answer;
    const std::string_view client = call.request.only("x-cindral-connection").value_or("");
    if (!clients_.answer(*call.session, client, *message, answer)) {
        call.connection.answer(HttpResponse::refusal(409, "There is no such stream of events"));
        return;
    }
    call.connection.answer(answer.empty() ? HttpResponse::noContent() : HttpResponse::json(std::move(answer)));
}

void HttpSite::streamEvents(const Call& call) {
    if (call.request.method == HttpRequest::Method::head) {
        call.connection.answer(HttpResponse::noContent());
        return;
    }
    if (!clients_.stream(call.connection, call.socket, call.stop, call.session))
        call.connection.answer(HttpResponse::refusal(503, "There are too many streams of events"));
}

void HttpSite::sendDocument(const Call& call) {
    const auto identifier = identifierOf(call.rest);
    if (!identifier) {
        call.connection.answer(HttpResponse::refusal(400, "That is no identifier"));
        return;
    }
    documents_.answer(call.connection, call.request, *identifier, call.request.query == "save");
}

void HttpSite::sendThumbnail(const Call& call) {
    const auto identifier = identifierOf(call.rest);
    if (!identifier) {
        call.connection.answer(HttpResponse::refusal(400, "That is no identifier"));
        return;
    }
    const std::string size = call.request.parameter("size").value_or("");
    unsigned pixels = kThumbnailPixelsUsual;
    std::from_chars(size.data(), size.data() + size.size(), pixels);
    call.connection.answer(documents_.thumbnail(*identifier, std::clamp(pixels, 1U, kPageThumbnailPixelsMax)),
                           call.request.method == HttpRequest::Method::head);
}

void HttpSite::prepareArchive(const Call& call) {
    const auto message = readMessage(call);
    if (message) call.connection.answer(archives_.prepare(call.session, *message));
}

void HttpSite::sendArchive(const Call& call) {
    if (call.request.method == HttpRequest::Method::head) {
        call.connection.answer(HttpResponse::noContent());
        return;
    }
    archives_.send(call.connection, call.session, call.rest, call.stop);
}

void HttpSite::receiveUpload(const Call& call) {
    call.connection.answer(uploads_.receive(call.connection, call.request));
}

}  // namespace cindral
