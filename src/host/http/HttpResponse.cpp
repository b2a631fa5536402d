#include "host/http/HttpResponse.h"

#include <fmt/format.h>

#include "host/JsonText.h"

namespace cindral {
namespace {

// Nothing but what the program itself serves, no script in the page's text, no text that becomes elements. Pictures of
// the page's own making are data: and blob: URLs.
constexpr std::string_view kPagePolicy =
    "default-src 'none'; script-src 'self'; style-src 'self'; img-src 'self' data: blob:; media-src 'self'; "
    "connect-src 'self'; frame-src 'self'; base-uri 'none'; form-action 'none'; frame-ancestors 'none'; "
    "require-trusted-types-for 'script'; trusted-types 'none'";

std::string_view reasonOf(int status) {
    switch (status) {
        case 200: return "OK";
        case 204: return "No Content";
        case 206: return "Partial Content";
        case 304: return "Not Modified";
        case 400: return "Bad Request";
        case 401: return "Unauthorized";
        case 403: return "Forbidden";
        case 404: return "Not Found";
        case 405: return "Method Not Allowed";
        case 408: return "Request Timeout";
        case 409: return "Conflict";
        case 411: return "Length Required";
        case 413: return "Content Too Large";
        case 415: return "Unsupported Media Type";
        case 416: return "Range Not Satisfiable";
        case 421: return "Misdirected Request";
        case 431: return "Request Header Fields Too Large";
        case 503: return "Service Unavailable";
        default: return "Internal Server Error";
    }
}

}  // namespace

HttpResponse HttpResponse::refusal(int status, std::string_view message) {
    HttpResponse response;
    response.status = status;
    response.body = R"({"message":)";
    appendJsonString(response.body, message);
    response.body += "}\n";
    return response;
}

HttpResponse HttpResponse::json(std::string body) {
    HttpResponse response;
    response.body = std::move(body);
    return response;
}

HttpResponse HttpResponse::noContent() {
    HttpResponse response;
    response.status = 204;
    response.contentType.clear();
    return response;
}

std::string HttpResponse::head(std::optional<std::uint64_t> length, bool keepsConnection) const {
    std::string out = fmt::format("HTTP/1.1 {} {}\r\n", status, reasonOf(status));
    const auto field = [&](std::string_view name, std::string_view value) {
        out += fmt::format("{}: {}\r\n", name, value);
    };
    if (!contentType.empty()) field("Content-Type", contentType);
    if (length && status != 204 && status != 304) field("Content-Length", fmt::to_string(*length));
    field("Connection", keepsConnection ? "keep-alive" : "close");
    field("X-Content-Type-Options", "nosniff");
    field("Referrer-Policy", "no-referrer");
    field("Cross-Origin-Resource-Policy", "same-origin");
    field("Cross-Origin-Opener-Policy", "same-origin");
    field("Cache-Control", "no-store");
    field("Content-Security-Policy", contentPolicy.empty() ? kPagePolicy : std::string_view(contentPolicy));
    for (const auto& [name, value] : fields) field(name, value);
    return out + "\r\n";
}

}  // namespace cindral
