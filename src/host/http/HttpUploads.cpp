#include "host/http/HttpUploads.h"

#include <fcntl.h>

#include <cerrno>
#include <functional>
#include <string_view>
#include <utility>
#include <vector>

#include "host/Awaited.h"
#include "host/HostMethods.h"
#include "host/ImportStaging.h"
#include "platform/foundation/SysEdits.h"

namespace cindral {
namespace {

constexpr std::size_t kUploadBufferBytes = 256 << 10;
// What comes by way of a browser is for its owner alone, until they say otherwise.
constexpr mode_t kUploadMode = 0600;

/// Keeps the answer as text.
class WrittenReply final : public JsonRpcReply {
public:
    void result(const std::function<void(std::string&)>& append) override {
        text_ = R"({"result":)";
        append(text_);
        text_ += '}';
    }
    void error(JsonRpcCode code, std::string_view message, std::string_view data) override {
        text_ = encodeJsonRpcFault({code, std::string(message), "null"});
        if (!data.empty()) text_.insert(text_.size() - 2, R"(,"data":)" + std::string(data));
    }
    const std::string& id() const override { return id_; }
    void notify(std::string_view /*line*/) override {}
    void setCancellation(std::function<void()> /*cancellation*/) override {}

    std::string take() { return std::move(text_); }

private:
    const std::string id_;
    std::string text_;
};

/// What the browser is to be told when its body is no good.
std::optional<HttpResponse> refusalOf(const KsError& error) {
    if (error.isPosix(EMSGSIZE)) return HttpResponse::refusal(413, "The document is too big");
    if (error.isPosix(EPROTO)) return HttpResponse::refusal(400, "That is no document");
    if (error.isPosix(ETIMEDOUT) || error.isPosix(ECONNRESET) || error.isPosix(ECANCELED))
        return HttpResponse::refusal(408, "The document did not come to its end");
    return std::nullopt;
}

}  // namespace

HttpResponse HttpUploads::receive(HttpConnection& connection, const HttpRequest& request) const {
    const auto parent = request.parameter("parent");
    const auto name = request.parameter("name");
    if (!parent || !name) return HttpResponse::refusal(400, "An upload has a parent and a name");
    if (!request.isChunked && !request.contentLength) return HttpResponse::refusal(411, "An upload has a length");
    if (request.contentLength > bytesMax_) return HttpResponse::refusal(413, "The document is too big");
    const ItemResult item = put(connection, *parent, *name);
    if (!item.ok()) {
        if (auto refusal = refusalOf(item.error())) return *std::move(refusal);
    }
    WrittenReply reply;
    answerItem(reply, item, paths_);
    return HttpResponse::json(reply.take());
}

HttpUploads::ItemResult HttpUploads::put(HttpConnection& connection, const std::string& parent,
                                         const std::string& name) const {
    const ImportStaging staging = TRY(ImportStaging::make(provider_, paths_));
    {
        const UniqueFd file = TRY(sys::openat(staging.folder->fd(), StagingFolder::kItemName,
                                              O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, kUploadMode));
        TRY(copyBody(connection, file.get()));
    }
    const auto identifier = provider_.persistentIdentifierForItemAtURL(
        KsURL::fileURL(staging.folder->path() + "/" + StagingFolder::kItemName));
    if (!identifier) return KsError::posix(ENOENT);
    Awaited<ItemResult> moved;
    provider_.reparentItemWithIdentifier(*identifier, parent, name, moved.completion());
    return moved.wait();
}

Result<void> HttpUploads::copyBody(HttpConnection& connection, int file) const {
    std::vector<char> buffer(kUploadBufferBytes);
    std::uint64_t written = 0;
    while (true) {
        const std::size_t got = TRY(connection.readBody(buffer));
        if (got == 0) return {};
        if (written + got > bytesMax_) return KsError::posix(EMSGSIZE);
        TRY(sys::pwrite(file, bytesOf({buffer.data(), got}), written));
        written += got;
    }
}

}  // namespace cindral
