#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace cindral {

/// Why a request was not done.
struct ClientError {
    std::string message;    ///< a line for people
    std::string domain;     ///< "KsPOSIXErrorDomain", "TesselErrorDomain", …; empty where the host said none
    std::int64_t code = 0;  ///< of the domain; where there is none, of JSON-RPC
};

/// A value, or the error that kept it from being made. Taking the value of an error aborts or throws.
template <typename T>
class [[nodiscard]] Outcome {
public:
    Outcome(T value) : state_(std::in_place_index<0>, std::move(value)) {}  // NOLINT(google-explicit-constructor)
    Outcome(ClientError error)
        : state_(std::in_place_index<1>, std::move(error)) {}  // NOLINT(google-explicit-constructor)

    bool ok() const { return state_.index() == 0; }
    explicit operator bool() const { return ok(); }
    T& operator*() & { return std::get<0>(state_); }
    const T& operator*() const& { return std::get<0>(state_); }
    T&& operator*() && { return std::get<0>(std::move(state_)); }
    T* operator->() { return &std::get<0>(state_); }
    const T* operator->() const { return &std::get<0>(state_); }
    const ClientError& error() const { return std::get<1>(state_); }

private:
    std::variant<T, ClientError> state_;
};

/// The containers that no path names.
inline constexpr const char* kRootContainer = "TesselRootContainerItemIdentifier";
inline constexpr const char* kWorkingSetContainer = "TesselWorkingSetContainerItemIdentifier";

/// A file or folder, as it was when it was told of.
struct Item {
    std::string identifier;  ///< stays what it is when the item is renamed, moved or saved
    std::string parentIdentifier;
    std::string filename;
    std::string typeIdentifier;  ///< a MIME type, or a declared type's reverse-DNS name
    std::optional<std::uint64_t> documentSize;
    std::optional<std::string> fileURL;
    std::string json;  ///< all that is known of it, as one JSON object
};

struct ItemPage {
    std::vector<Item> items;
    std::optional<std::string> nextPage;  ///< none: the listing is over
};

/// What changed since an anchor: in their order, and the anchor that follows.
struct Changes {
    struct Entry {
        std::string identifier;
        std::optional<Item> item;  ///< none: it is gone
    };
    std::vector<Entry> entries;
    std::string anchor;
    bool moreComing = false;
};

/// A client of Cindral: asks for items, and is told when they change.
///
/// A listing is not a snapshot: take an anchor first, list, and ask for the changes since the anchor.
///
/// Pages and anchors are text to be kept and given back as it is.
///
/// Thread safety: for one thread at a time. Each request waits for its answer.
class Client {
public:
    struct Options {
        std::string storage;              ///< empty: as the daemon has it, or the documents folder
        std::string state;                ///< empty: the person's own
        std::string program = "cindral";  ///< found by PATH unless it has a slash
    };
    /// By way of `cindral rpc`, which asks the daemon of the state folder, or works alone where there is none. It lives
    /// as long as the client, and writes its complaints to standard error.
    static Outcome<Client> start(const Options& options);
    /// By a daemon's socket: `socket` in the state folder.
    static Outcome<Client> connect(const std::string& socketPath);
    ~Client();
    Client(Client&& other) noexcept;
    Client& operator=(Client&& other) noexcept;

    /// The path is absolute; its bytes are any.
    Outcome<std::string> identifierAt(std::string_view path);
    Outcome<Item> item(std::string_view identifier);
    /// The first page, or the one that an earlier one says is next.
    Outcome<ItemPage> items(std::string_view container, const std::optional<std::string>& page = std::nullopt);

    Outcome<std::string> anchor(std::string_view container);
    /// TesselErrorDomain -1002: the anchor has expired; take a new one, and list again.
    Outcome<Changes> changes(std::string_view container, std::string_view anchor);

    /// From now on waitForSignal() tells when something in the container changes.
    Outcome<std::monostate> monitor(std::string_view container);
    /// The container that changed, once for however many changes came since it was last told; none when the time is
    /// over. Without a time it waits for ever.
    Outcome<std::optional<std::string>> waitForSignal(std::optional<std::chrono::milliseconds> time = std::nullopt);
    /// Becomes readable when there may be a signal to take, for an event loop: then ask waitForSignal() with no time
    /// until it answers none.
    int descriptor() const;

    /// Any other method. Parameters and result are JSON text.
    Outcome<std::string> call(std::string_view method, std::string_view params);

private:
    class Channel;
    explicit Client(std::unique_ptr<Channel> channel);

    std::unique_ptr<Channel> channel_;
};

}  // namespace cindral
