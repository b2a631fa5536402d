#include "cindral/Client.h"

#include <poll.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <deque>
#include <nlohmann/json.hpp>

// Nothing of the host's own sources is used here: who links the library gets one object file, and needs nothing else.

namespace cindral {
namespace {

using Json = nlohmann::json;
using Clock = std::chrono::steady_clock;

constexpr std::size_t kReadBytes = 64 << 10;
constexpr const char* kPosixDomain = "KsPOSIXErrorDomain";

ClientError posixError(const std::string& what, int number) {
    return {what + ": " + std::strerror(number), kPosixDomain, number};
}

ClientError unreadable() {
    return {"the host's answer can't be read", "", 0};
}

/// Strings hold any bytes; what is not UTF-8 becomes a replacement, as nothing that the host knows has such a name.
std::string jsonText(const Json& json) {
    return json.dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::string textOf(const Json& json, const char* key) {
    const auto found = json.find(key);
    return found != json.end() && found->is_string() ? found->get<std::string>() : "";
}

ClientError errorOf(const Json& json) {
    if (!json.is_object()) return unreadable();
    ClientError error{textOf(json, "message"), "", 0};
    if (const auto code = json.find("code"); code != json.end() && code->is_number_integer())
        error.code = code->get<std::int64_t>();
    const auto data = json.find("data");
    if (data == json.end() || !data->is_object()) return error;
    error.domain = textOf(*data, "domain");
    if (const auto code = data->find("code"); code != data->end() && code->is_number_integer())
        error.code = code->get<std::int64_t>();
    return error;
}

Outcome<Item> itemOf(const Json& json) {
    if (!json.is_object()) return unreadable();
    Item item{textOf(json, "identifier"),
              textOf(json, "parentIdentifier"),
              textOf(json, "filename"),
              textOf(json, "typeIdentifier"),
              std::nullopt,
              std::nullopt,
              jsonText(json)};
    if (item.identifier.empty()) return unreadable();
    if (const auto size = json.find("documentSize"); size != json.end() && size->is_number_unsigned())
        item.documentSize = size->get<std::uint64_t>();
    if (json.contains("fileURL")) item.fileURL = textOf(json, "fileURL");
    return item;
}

std::string fileURL(std::string_view path) {
    constexpr std::string_view kPlain = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-._~/";
    constexpr std::string_view kDigits = "0123456789ABCDEF";
    std::string url = "file://";
    for (const char each : path) {
        const auto byte = static_cast<unsigned char>(each);
        if (kPlain.find(each) != std::string_view::npos) {
            url += each;
        } else {
            url += {'%', kDigits[byte >> 4], kDigits[byte & 15]};
        }
    }
    return url;
}

}  // namespace

/// A connected socket, the process behind it where there is one, and what was read from it.
class Client::Channel {
public:
    Channel(int socket, pid_t process) : socket_(socket), process_(process) {}
    ~Channel() {
        ::close(socket_);
        // The end of its input is what it ends by.
        while (process_ > 0 && ::waitpid(process_, nullptr, 0) < 0 && errno == EINTR) continue;
    }
    Channel(const Channel&) = delete;
    Channel& operator=(const Channel&) = delete;

    int socket() const { return socket_; }

    Outcome<Json> request(std::string_view method, const Json& params) {
        const std::uint64_t id = ++lastID_;
        const Json request = {{"jsonrpc", "2.0"}, {"id", id}, {"method", method}, {"params", params}};
        if (const auto sent = send(jsonText(request) + "\n"); !sent.ok()) return sent.error();
        while (true) {
            Outcome<std::optional<Json>> message = next(std::nullopt);
            if (!message.ok()) return message.error();
            if (textOf(**message, "method") == "signal") {
                keepSignal(**message);
                continue;
            }
            const auto answered = (*message)->find("id");
            if (answered == (*message)->end() || *answered != id) continue;
            if (const auto error = (*message)->find("error"); error != (*message)->end()) return errorOf(*error);
            const auto result = (*message)->find("result");
            return result != (*message)->end() ? Outcome<Json>(std::move(*result)) : unreadable();
        }
    }

    Outcome<std::optional<std::string>> signal(std::optional<Clock::time_point> end) {
        while (signals_.empty()) {
            Outcome<std::optional<Json>> message = next(end);
            if (!message.ok()) return message.error();
            if (!*message) return std::optional<std::string>();
            if (textOf(**message, "method") == "signal") keepSignal(**message);
        }
        std::optional<std::string> container = std::move(signals_.front());
        signals_.pop_front();
        return container;
    }

private:
    void keepSignal(const Json& message) {
        const auto params = message.find("params");
        if (params == message.end() || !params->is_object()) return;
        std::string container = textOf(*params, "container");
        // Told once, however often it comes before somebody asks.
        if (std::ranges::find(signals_, container) == signals_.end()) signals_.push_back(std::move(container));
    }

    Outcome<std::monostate> send(std::string_view bytes) {
        while (!bytes.empty()) {
            const ssize_t sent = ::send(socket_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
            if (sent < 0 && errno == EINTR) continue;
            if (sent < 0) return posixError("can't ask the host", errno);
            bytes.remove_prefix(static_cast<std::size_t>(sent));
        }
        return std::monostate();
    }

    /// The next message; none when the time is over.
    Outcome<std::optional<Json>> next(std::optional<Clock::time_point> end) {
        while (true) {
            if (const std::size_t newline = buffer_.find('\n', looked_); newline != std::string::npos) {
                Json message = Json::parse(buffer_.begin(), buffer_.begin() + static_cast<std::ptrdiff_t>(newline),
                                           nullptr, /*allow_exceptions=*/false);
                buffer_.erase(0, newline + 1);
                looked_ = 0;
                if (!message.is_object()) return unreadable();
                return std::optional(std::move(message));
            }
            looked_ = buffer_.size();
            const Outcome<bool> more = read(end);
            if (!more.ok()) return more.error();
            if (!*more) return std::optional<Json>();
        }
    }

    /// Whether there was something to read before the time was over.
    Outcome<bool> read(std::optional<Clock::time_point> end) {
        if (end) {
            const auto left = std::chrono::ceil<std::chrono::milliseconds>(*end - Clock::now()).count();
            pollfd entry{socket_, POLLIN, 0};
            const int ready = ::poll(&entry, 1, static_cast<int>(std::clamp<std::int64_t>(left, 0, 1 << 30)));
            if (ready < 0 && errno != EINTR) return posixError("can't wait for the host", errno);
            // A wait that was cut short has another turn, which the time bounds too.
            if (ready <= 0 && Clock::now() >= *end) return false;
            if (ready <= 0) return true;
        }
        const std::size_t before = buffer_.size();
        buffer_.resize(before + kReadBytes);
        const ssize_t got = ::recv(socket_, buffer_.data() + before, kReadBytes, 0);
        const int error = errno;
        buffer_.resize(before + static_cast<std::size_t>(std::max<ssize_t>(got, 0)));
        if (got == 0) return ClientError{"the connection to the host has ended", kPosixDomain, ECONNRESET};
        if (got < 0 && error != EINTR) return posixError("can't read the host's answer", error);
        return true;
    }

    const int socket_;
    const pid_t process_;
    std::uint64_t lastID_ = 0;
    std::string buffer_;
    std::size_t looked_ = 0;  ///< bytes of the buffer without a newline
    std::deque<std::string> signals_;
};

Client::Client(std::unique_ptr<Channel> channel) : channel_(std::move(channel)) {}
Client::~Client() = default;
Client::Client(Client&& other) noexcept = default;
Client& Client::operator=(Client&& other) noexcept = default;

Outcome<Client> Client::start(const Options& options) {
    int ends[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) != 0)
        return posixError("can't make a socket", errno);
    std::vector<std::string> words = {options.program, "rpc"};
    if (!options.storage.empty()) words.push_back("--storage=" + options.storage);
    if (!options.state.empty()) words.push_back("--state=" + options.state);
    std::vector<char*> arguments;
    arguments.reserve(words.size() + 1);
    for (std::string& word : words) arguments.push_back(word.data());
    arguments.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    ::posix_spawn_file_actions_init(&actions);
    ::posix_spawn_file_actions_adddup2(&actions, ends[1], STDIN_FILENO);
    ::posix_spawn_file_actions_adddup2(&actions, ends[1], STDOUT_FILENO);
    pid_t process = 0;
    const int failure = ::posix_spawnp(&process, options.program.c_str(), &actions, nullptr, arguments.data(), environ);
    ::posix_spawn_file_actions_destroy(&actions);
    ::close(ends[1]);
    if (failure == 0) return Client(std::make_unique<Channel>(ends[0], process));
    ::close(ends[0]);
    return posixError("can't run " + options.program, failure);
}

Outcome<Client> Client::connect(const std::string& socketPath) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (socketPath.size() >= sizeof address.sun_path) return posixError("can't connect to " + socketPath, ENAMETOOLONG);
    std::copy(socketPath.begin(), socketPath.end(), address.sun_path);
    const int socket = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (socket < 0) return posixError("can't make a socket", errno);
    auto channel = std::make_unique<Channel>(socket, 0);
    if (::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return posixError("can't connect to " + socketPath, errno);
    return Client(std::move(channel));
}

Outcome<std::string> Client::identifierAt(std::string_view path) {
    const auto answer = channel_->request("identifierForItemAtURL", {{"url", fileURL(path)}});
    if (!answer.ok()) return answer.error();
    std::string identifier = textOf(*answer, "identifier");
    if (identifier.empty()) return posixError(std::string(path), ENOENT);
    return identifier;
}

Outcome<Item> Client::item(std::string_view identifier) {
    const auto answer = channel_->request("itemForIdentifier", {{"identifier", identifier}});
    return answer.ok() ? itemOf(*answer) : answer.error();
}

Outcome<ItemPage> Client::items(std::string_view container, const std::optional<std::string>& page) {
    Json params = {{"container", container}};
    if (page) params["page"] = *page;
    const auto answer = channel_->request("enumerateItems", params);
    if (!answer.ok()) return answer.error();
    const auto items = answer->find("items");
    if (items == answer->end() || !items->is_array()) return unreadable();
    ItemPage result;
    for (const Json& each : *items) {
        Outcome<Item> item = itemOf(each);
        if (!item.ok()) return item.error();
        result.items.push_back(*std::move(item));
    }
    if (const auto next = answer->find("nextPage"); next != answer->end() && next->is_string())
        result.nextPage = next->get<std::string>();
    return result;
}

Outcome<std::string> Client::anchor(std::string_view container) {
    const auto answer = channel_->request("currentSyncAnchor", {{"container", container}});
    if (!answer.ok()) return answer.error();
    std::string anchor = textOf(*answer, "anchor");
    if (anchor.empty()) return ClientError{"the container has no anchor", "", 0};
    return anchor;
}

Outcome<Changes> Client::changes(std::string_view container, std::string_view anchor) {
    const auto answer = channel_->request("enumerateChanges", {{"container", container}, {"anchor", anchor}});
    if (!answer.ok()) return answer.error();
    const auto updated = answer->find("updated");
    const auto log = answer->find("log");
    if (updated == answer->end() || !updated->is_array() || log == answer->end() || !log->is_array())
        return unreadable();
    Changes changes{{}, textOf(*answer, "anchor"), answer->value("moreComing", false)};
    std::size_t updates = 0;
    // "log" has updates ("u") and deletions by identifier; the items of its updates are in "updated".
    for (const Json& each : *log) {
        if (!each.is_array() || each.size() != 2 || !each[0].is_string() || !each[1].is_string()) return unreadable();
        Changes::Entry& entry = changes.entries.emplace_back(Changes::Entry{each[1].get<std::string>(), std::nullopt});
        if (each[0] != "u") continue;
        if (updates == updated->size()) return unreadable();
        Outcome<Item> item = itemOf((*updated)[updates++]);
        if (!item.ok()) return item.error();
        entry.item = *std::move(item);
    }
    return changes;
}

Outcome<std::monostate> Client::monitor(std::string_view container) {
    const auto answer = channel_->request("startMonitoring", {{"container", container}});
    return answer.ok() ? Outcome<std::monostate>(std::monostate()) : answer.error();
}

Outcome<std::optional<std::string>> Client::waitForSignal(std::optional<std::chrono::milliseconds> time) {
    return channel_->signal(time ? std::optional(Clock::now() + *time) : std::nullopt);
}

int Client::descriptor() const {
    return channel_->socket();
}

Outcome<std::string> Client::call(std::string_view method, std::string_view params) {
    const Json given = Json::parse(params, nullptr, /*allow_exceptions=*/false);
    if (given.is_discarded()) return ClientError{"the parameters are no JSON", "", 0};
    const auto answer = channel_->request(method, given);
    return answer.ok() ? Outcome<std::string>(jsonText(*answer)) : answer.error();
}

}  // namespace cindral
