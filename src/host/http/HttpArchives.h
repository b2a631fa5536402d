#pragma once

#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "host/http/HttpConnection.h"
#include "host/http/HttpDocuments.h"
#include "host/http/HttpSessions.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// Folders, and several items at once, to be saved: a ZIP archive that is written while it is sent, without anything on
/// the disk.
///
/// A browser saves what an address leads to, and an address holds only so much: so what is to be in the archive is sent
/// first, and answered with a name under which it can then be had, once.
///
/// What can't be read, and what is neither folder nor document, is left out; a text in the archive says so. Each
/// document is the one that the provider knows by its identifier, opened as HttpDocuments opens it: no link leads
/// anywhere.
///
/// Thread safety: all operations, from any thread.
class HttpArchives {
public:
    /// Archives that were asked for and not yet fetched; beyond that the oldest goes.
    static constexpr std::size_t kWaitingMax = 16;

    /// Both borrowed for life.
    HttpArchives(const std::shared_ptr<TesselExtension>& provider, const HttpDocuments& documents)
        : provider_(provider), documents_(documents) {}

    /// Answers a message of the form {"identifiers": [...]} with {"archive": NAME}.
    HttpResponse prepare(const std::shared_ptr<const HttpSession>& session, std::string_view message);
    /// Sends the archive of that name. It ends before its end, which the browser notices, when `stop` can be read.
    void send(HttpConnection& connection, const std::shared_ptr<const HttpSession>& session, std::string_view name,
              int stop);

private:
    using Items = std::vector<std::shared_ptr<const TesselItem>>;
    struct Waiting {
        std::string name;
        std::shared_ptr<const HttpSession> session;
        Items items;
    };
    std::optional<Items> take(const HttpSession& session, std::string_view name);

    const std::shared_ptr<TesselExtension>& provider_;
    const HttpDocuments& documents_;
    Mutex mutex_;
    std::deque<Waiting> waiting_ GUARDED_BY(mutex_);
};

}  // namespace cindral
