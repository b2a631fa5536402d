#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "host/RpcConnection.h"
#include "host/http/HttpArchives.h"
#include "host/http/HttpClients.h"
#include "host/http/HttpConnection.h"
#include "host/http/HttpDocuments.h"
#include "host/http/HttpGuard.h"
#include "host/http/HttpSessions.h"
#include "host/http/HttpUploads.h"

namespace cindral {

/// What there is to be had over HTTP, and for whom.
///
/// | | | |
/// |---|---|---|
/// | GET /, /… | anybody | the page and its parts, which hold nothing of anybody's |
/// | POST /session | a link | the session's cookie, and its token |
/// | GET /session | a session | its token |
/// | POST /logout | a session | ends it |
/// | POST /rpc | a session | one JSON-RPC message and its answer, of the client that X-Cindral-Connection names |
/// | GET /events | a session | what the page's client is told, as server-sent events |
/// | GET /file/IDENTIFIER | a session | a document's bytes; with ?save, to be saved |
/// | GET /thumbnail/IDENTIFIER?size=N | a session | the picture that stands for an item |
/// | POST /archive | a session | takes down of which items there is to be an archive, and names it |
/// | GET /archive/NAME | a session | the archive, once |
/// | POST /upload?parent=IDENTIFIER&name=NAME | a session | a document, its bytes being the body |
///
/// Items go by their identifiers: no route takes a path, and methods that do are not to be had here.
///
/// Thread safety: all operations, from any thread.
class HttpSite {
public:
    /// The first two are borrowed for life. `didTrade` is called when a link was used, on any thread.
    HttpSite(const RpcService& service, HttpSessions& sessions, std::uint16_t port, std::uint64_t uploadBytesMax,
             std::function<void()> didTrade);

    /// Answers the request. `stop`, when it can be read, ends a stream of events.
    void serve(HttpConnection& connection, const HttpRequest& request, int socket, int stop);

    /// The address of the page.
    std::string origin() const { return guard_.origin(); }

private:
    /// A request of a session.
    struct Call {
        HttpConnection& connection;
        const HttpRequest& request;
        const std::shared_ptr<const HttpSession>& session;
        std::string_view rest;  ///< of the path, after the route's beginning
        int socket;
        int stop;
    };
    struct Route;
    static const Route kRoutes[];

    static bool serveAsset(HttpConnection& connection, const HttpRequest& request);
    void openSession(HttpConnection& connection, const HttpRequest& request);
    void serveSession(const Call& call, const Route& route);

    static std::optional<std::string> readMessage(const Call& call);
    void sayToken(const Call& call);
    void logOut(const Call& call);
    void answerRpc(const Call& call);
    void streamEvents(const Call& call);
    void sendDocument(const Call& call);
    void sendThumbnail(const Call& call);
    void prepareArchive(const Call& call);
    void sendArchive(const Call& call);
    void receiveUpload(const Call& call);

    const RpcService& service_;
    HttpSessions& sessions_;
    const HttpGuard guard_;
    HttpClients clients_;
    const HttpDocuments documents_;
    HttpArchives archives_;
    const HttpUploads uploads_;
    const std::function<void()> didTrade_;
};

}  // namespace cindral
