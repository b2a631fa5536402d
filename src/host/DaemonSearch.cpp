#include "host/DaemonSearch.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <set>

#include "host/DaemonSocket.h"
#include "host/Descriptor.h"
#include "host/HostError.h"
#include "host/JsonRpcMessage.h"
#include "host/LocalSocket.h"
#include "host/TerminalText.h"
#include "platform/foundation/KsURL.h"

namespace cindral {
namespace {

constexpr std::size_t kHelloBytesMax = 1 << 20;

/// Whether the command ends by itself, and nobody has to wait long for that.
bool endsSoon(HostCommand command) {
    return command != HostCommand::watch && command != HostCommand::rpc;
}

std::string helloLine(const HostOptions& options) {
    return fmt::format(R"({{"jsonrpc":"2.0","id":0,"method":"hello","params":{{"endsSoon":{}}}}})"
                       "\n",
                       endsSoon(options.command));
}

/// The first line that comes; none where the connection ends before.
std::optional<std::string> readLine(int socket) {
    std::string line;
    std::vector<char> buffer(4096);
    while (line.size() < kHelloBytesMax) {
        const auto got = descriptor::read(socket, buffer);
        if (!got.ok() || *got == 0) return std::nullopt;
        line.append(buffer.data(), *got);
        if (line.ends_with('\n')) return line;
    }
    return line;
}

std::string pathOf(const Json& url) {
    const auto parsed = url.is_string() ? KsURL::parse(url.get<std::string>()) : std::nullopt;
    return parsed && parsed->isFileURL() ? parsed->path() : "";
}

std::optional<FoundDaemon> daemonOf(const Json& hello) {
    if (!hello.is_object()) return std::nullopt;
    FoundDaemon daemon;
    daemon.process = hello.value("process", std::uint64_t{0});
    daemon.storage = pathOf(hello.value("storage", Json()));
    daemon.storageOption = pathOf(hello.value("storageOption", Json()));
    daemon.recorderOption = hello.value("recorderOption", "");
    daemon.flatpak = hello.value("flatpak", true);
    daemon.desktopTags = hello.value("desktopTags", false);
    for (const Json& folder : hello.value("applicationFolders", Json::array()))
        daemon.applications.push_back(pathOf(folder));
    return daemon.storage.empty() ? std::nullopt : std::optional(std::move(daemon));
}

KsError failure(const HostOptions& options, std::string_view what) {
    return hostFailure(fmt::format("the daemon of the state folder {}: {}", terminalText(options.state), what));
}

/// What the daemon at the other end says; none where there is none any more.
Result<std::optional<FoundDaemon>> greet(UniqueFd socket, const HostOptions& options) {
    const auto peer = TRY(local_socket::peerOf(socket.get()));
    if (peer.user != ::geteuid()) return failure(options, fmt::format("process {} is another user's", peer.process));
    if (!descriptor::writeAll(socket.get(), helloLine(options)).ok()) return std::optional<FoundDaemon>();
    const auto line = readLine(socket.get());
    if (!line) return std::optional<FoundDaemon>();
    const Json answer = Json::parse(*line, nullptr, /*allow_exceptions=*/false);
    if (!answer.is_object()) return failure(options, "its answer can't be read");
    if (const auto error = answer.find("error"); error != answer.end()) {
        return failure(options, error->is_object() ? terminalText(error->value("message", "")) : "it refuses");
    }
    const Json hello = answer.value("result", Json());
    if (hello.is_object() && hello.value("isEnding", false)) return std::optional<FoundDaemon>();
    auto daemon = daemonOf(hello);
    if (!daemon) return failure(options, "its answer can't be read");
    daemon->socket = std::move(socket);
    return daemon;
}

std::string realOf(const std::string& path) {
    std::error_code error;
    const std::string real = std::filesystem::weakly_canonical(path, error).string();
    return error ? path : real;
}

std::set<std::string> realOf(const std::vector<std::string>& paths) {
    std::set<std::string> real;
    for (const std::string& path : paths) real.insert(realOf(path));
    return real;
}

std::string listOf(const std::vector<std::string>& paths) {
    std::string list;
    for (const std::string& path : paths) list += (list.empty() ? "" : ", ") + terminalText(path);
    return list.empty() ? "none" : list;
}

KsError disagreement(const FoundDaemon& daemon, std::string_view what) {
    return hostFailure(fmt::format("the daemon that runs (process {}) {}", daemon.process, what));
}

}  // namespace

Result<DaemonSearch> findDaemon(const HostOptions& options) {
    DaemonSearch search;
    if (options.state.empty()) return search;
    while (true) {
        auto connected = local_socket::connectTo(DaemonSocket::linkIn(options.state));
        if (connected.ok()) {
            search.daemon = TRY(greet(*std::move(connected), options));
            if (search.daemon) {
                search.handover.reset();
                return search;
            }
        } else if (search.handover) {
            return search;
        }
        // Nobody answers, as far as can be said without holding anybody up.
        if (search.handover) continue;
        auto handover = StateHandover::begin(options.state, StateHandover::Part::client);
        if (!handover.ok()) return search;
        search.handover = *std::move(handover);
    }
}

Result<HostOptions> agreeWithDaemon(HostOptions options, const FoundDaemon& daemon) {
    if (!options.said.storage) {
        options.storage = daemon.storageOption;
    } else if (realOf(options.storage) != daemon.storage) {
        return disagreement(daemon, fmt::format("has the storage {}, not {}", terminalText(daemon.storage),
                                                terminalText(options.storage)));
    }
    if (options.said.applications && realOf(options.applications) != realOf(daemon.applications)) {
        return disagreement(daemon, fmt::format("has the application folders {}, not {}", listOf(daemon.applications),
                                                listOf(options.applications)));
    }
    if (options.said.flatpak && daemon.flatpak) return disagreement(daemon, "reads Flatpak's applications");
    if (options.said.desktopTags && !daemon.desktopTags)
        return disagreement(daemon, "does not share the desktop's tags");
    if (options.said.recorder && recorderChoiceName(options.recorder) != daemon.recorderOption) {
        return disagreement(daemon, fmt::format("has the recorder {}, not {}", terminalText(daemon.recorderOption),
                                                recorderChoiceName(options.recorder)));
    }
    options.applications = daemon.applications;
    options.flatpak = daemon.flatpak;
    options.desktopTags = daemon.desktopTags;
    return options;
}

}  // namespace cindral
