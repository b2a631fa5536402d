#include "host/Program.h"

#include <fmt/format.h>
#include <sys/resource.h>
#include <unistd.h>

#include <optional>
#include <vector>

#include "host/AppsCommands.h"
#include "host/CancelOnStop.h"
#include "host/Commands.h"
#include "host/Daemon.h"
#include "host/DaemonBridge.h"
#include "host/DaemonSearch.h"
#include "host/DaemonSocket.h"
#include "host/Descriptor.h"
#include "host/HostError.h"
#include "host/HostOptions.h"
#include "host/HostProcess.h"
#include "host/JsonText.h"
#include "host/ProviderClient.h"
#include "host/RemoteClient.h"
#include "host/RpcConnection.h"
#include "host/ServiceManager.h"
#include "host/SocketListener.h"
#include "host/StateHandover.h"
#include "host/StopSignals.h"
#include "host/TerminalText.h"
#include "host/TextOutput.h"
#include "host/http/HttpDoor.h"
#include "platform/foundation/Log.h"

namespace cindral {
namespace {

/// The one line on standard error. Where that can't be written either, the exit status has to do.
int failWith(const KsError& error) {
    [[maybe_unused]] const auto written =
        descriptor::writeAll(STDERR_FILENO, fmt::format("cindral: {}\n", messageOf(error)));
    return exitStatusOf(error);
}

int say(const HostReply& reply) {
    const int fd = reply.exitStatus == kExitDone ? STDOUT_FILENO : STDERR_FILENO;
    [[maybe_unused]] const auto written = descriptor::writeAll(fd, reply.text);
    return reply.exitStatus;
}

int outputFailure(const KsError& error) {
    return failWith(hostFailure(fmt::format("can't write to standard output: {}", error.reason())));
}

int runRpc(const HostProcess& host) {
    const auto served = serveRpc(STDIN_FILENO, STDOUT_FILENO, serviceOf(host));
    if (!served.ok()) return failWith(hostFailure(fmt::format("the connection broke: {}", served.error().reason())));
    return kExitDone;
}

bool isAppsCommand(HostCommand command) {
    return command == HostCommand::apps || command == HostCommand::appsEnable || command == HostCommand::appsDisable;
}

/// Those that the service manager listens on for us, else one of our own.
Result<std::vector<DaemonSocket>> makeSockets(const std::string& state, const HostEnvironment& environment,
                                              ServiceManager& manager) {
    std::vector<DaemonSocket> sockets;
    for (UniqueFd& each : manager.takeLocalSockets())
        sockets.push_back(TRY(DaemonSocket::adopt(std::move(each), state)));
    if (sockets.empty()) sockets.push_back(TRY(DaemonSocket::listenFor(state, environment)));
    return sockets;
}

/// A client takes a descriptor, and so does every event source; the usual limit is a relic of old system calls.
void raiseDescriptorLimit() {
    rlimit limit{};
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
    limit.rlim_cur = limit.rlim_max;
    ::setrlimit(RLIMIT_NOFILE, &limit);
}

/// Links go to standard output, and nowhere else; who has closed it needs none.
void printLink(const std::string& link, bool json) {
    [[maybe_unused]] const auto written =
        descriptor::writeAll(STDOUT_FILENO, json ? fmt::format("{{\"url\":{}}}\n", jsonString(link))
                                                 : fmt::format("Your documents, for one browser: {}\n", link));
}

/// Where nobody has asked for it yet, browsers are let in from when somebody does.
Result<std::unique_ptr<HttpDoor>> makeDoor(const HostOptions& options) {
    auto door = HttpDoor::make({options.httpPort, options.uploadBytesMax,
                                [json = options.json](const std::string& link) { printLink(link, json); }});
    if (door.ok()) return door;
    return hostFailure(fmt::format("can't listen at port {}: {}", *options.httpPort, door.error().reason()));
}

int runServe(HostOptions options, const HostEnvironment& environment, TesselExtensionFactory makeProvider) {
    auto stopSignals = StopSignals::catchThem();
    if (!stopSignals.ok()) return failWith(stopSignals.error());
    raiseDescriptorLimit();
    ServiceManager manager;
    std::optional<StateHandover> handover;
    std::vector<DaemonSocket> sockets;
    const auto takeOver = [&](const std::string& state) -> Result<void> {
        handover = TRY(StateHandover::begin(state, StateHandover::Part::daemon));
        return {};
    };
    const auto listen = [&](const std::string& state) -> Result<void> {
        auto made = makeSockets(state, environment, manager);
        if (!made.ok()) {
            const auto path = made.error().userInfo().find("path");
            const std::string where =
                path != made.error().userInfo().end() ? path->second : DaemonSocket::linkIn(state);
            return hostFailure(fmt::format("can't listen at {}: {}", terminalText(where), made.error().reason()));
        }
        sockets = *std::move(made);
        // Who connects from now on is answered, sooner or later.
        handover.reset();
        return {};
    };
    auto host = HostProcess::start(std::move(options), environment, makeProvider, {takeOver, listen});
    if (!host.ok()) return failWith(host.error());

    logInfo("serving {} at {}", (*host)->paths().real(), DaemonSocket::linkIn((*host)->state()));
    Daemon daemon(**host, manager);
    auto made = makeDoor((*host)->options());
    if (!made.ok()) {
        // Who has connected already looks again when the store is closed.
        (void)takeOver((*host)->state());
        return failWith(made.error());
    }
    HttpDoor& door = **made;
    daemon.add(*std::move(made));
    for (DaemonSocket& each : sockets)
        daemon.add(std::make_unique<SocketListener>(std::move(each), [&door] { return door.makeLink(); }));
    const auto served = daemon.run((*stopSignals)->descriptor(), [&] { (void)takeOver((*host)->state()); });
    // Held until the store is closed: until then, nobody else could use it.
    host->reset();
    handover.reset();
    return served.ok() ? kExitDone : failWith(hostFailure(fmt::format("can't serve: {}", served.error().reason())));
}

TextOutput outputFor(const HostOptions& options) {
    return {STDOUT_FILENO, ::isatty(STDOUT_FILENO) == 1, options.endsWithNul ? '\0' : '\n'};
}

int runCommand(const Commands::Context& context) {
    TextOutput output = outputFor(context.options);
    const auto done = Commands(context, output).run();
    // What was found before something went wrong is shown before the line that says what.
    if (const auto error = output.finish()) return outputFailure(*error);
    return done.ok() ? kExitDone : failWith(done.error());
}

/// Alone: with a host of the command's own, for as long as it takes.
int runAlone(const HostProcess& host, const HostEnvironment& environment, std::vector<std::string> setAside) {
    if (host.options().command == HostCommand::rpc) return runRpc(host);
    ProviderClient client(host.provider());
    const auto statusText = [&] {
        host.waitForHistory();
        return host.statusText();
    };
    std::unique_ptr<StopSignals> stopSignals;
    const auto stopDescriptor = [&]() -> Result<int> {
        stopSignals = TRY(StopSignals::catchThem());
        return stopSignals->descriptor();
    };
    return runCommand({client, host.paths(), host.options(), environment, statusText, host.signals(), stopDescriptor,
                       host.search(), [&] { return host.doctorText(); }, std::move(setAside)});
}

/// By the daemon.
int runRemotely(const HostOptions& options, const HostEnvironment& environment, FoundDaemon daemon) {
    if (options.command == HostCommand::rpc) {
        const auto bridged = bridgeToDaemon(STDIN_FILENO, STDOUT_FILENO, std::move(daemon.socket));
        return bridged.ok() ? kExitDone : failWith(bridged.error());
    }
    // What crosses the socket are the paths that clients know.
    const PresentedPaths paths(options.storage, daemon.storage, daemon.storage);
    SignalDispatcher signals;
    RemoteClient client(std::move(daemon.socket), signals);
    std::unique_ptr<CancelOnStop> cancelling;
    if (options.command == HostCommand::edit) {
        auto started = CancelOnStop::start(client.connection());
        if (!started.ok()) return failWith(hostFailure(started.error().reason()));
        cancelling = *std::move(started);
    }
    std::unique_ptr<StopSignals> stopSignals;
    const auto stopDescriptor = [&]() -> Result<int> {
        stopSignals = TRY(StopSignals::catchThem());
        return stopSignals->descriptor();
    };
    return runCommand({client,
                       paths,
                       options,
                       environment,
                       [&] { return client.statusText(); },
                       signals,
                       stopDescriptor,
                       client.search(),
                       [&] { return client.doctorText(); },
                       {}});
}

/// They look at the applications themselves, with a daemon's eyes where there is one.
int runApps(const HostOptions& options, const HostEnvironment& environment) {
    TextOutput output = outputFor(options);
    const auto done = runAppsCommand(options, environment, output);
    if (const auto error = output.finish()) return outputFailure(*error);
    return done.ok() ? kExitDone : failWith(done.error());
}

int runLink(const HostOptions& options, FoundDaemon daemon) {
    SignalDispatcher signals;
    const auto link = RemoteClient(std::move(daemon.socket), signals).makeLink();
    if (!link.ok())
        return failWith(hostFailure(fmt::format("the daemon lets no browser in: {}", messageOf(link.error()))));
    printLink(*link, options.json);
    return kExitDone;
}

/// What the options say, by the daemon where there is one.
int runByDaemonOrAlone(HostOptions options, const HostEnvironment& environment, TesselExtensionFactory makeProvider,
                       ProviderRepair repairProvider) {
    while (true) {
        auto found = findDaemon(options);
        if (!found.ok()) return failWith(found.error());
        if (found->daemon) {
            auto agreed = agreeWithDaemon(std::move(options), *found->daemon);
            if (!agreed.ok()) return failWith(agreed.error());
            if (isAppsCommand(agreed->command)) return runApps(*agreed, environment);
            if (agreed->command == HostCommand::link) return runLink(*agreed, *std::move(found->daemon));
            return runRemotely(*agreed, environment, *std::move(found->daemon));
        }
        if (isAppsCommand(options.command)) return runApps(options, environment);
        if (options.command == HostCommand::link)
            return failWith(hostFailure("no daemon runs that could let a browser in; \"cindral serve --http\" is one"));
        // Without a state folder nobody could be kept from becoming its daemon meanwhile.
        const bool isSure = found->handover.has_value();
        HostProcess::Steps steps;
        std::vector<std::string> setAside;
        if (options.command == HostCommand::doctor) {
            steps.stateIsThere = [&](const std::string& state) -> Result<void> {
                auto done = HostProcess::setAsideWhatStops(state, repairProvider);
                if (!done.ok())
                    return hostFailure(fmt::format("can't set aside what is damaged: {}", messageOf(done.error())));
                setAside = *std::move(done);
                return {};
            };
        }
        steps.stateIsOurs = [&](const std::string&) -> Result<void> {
            found->handover.reset();
            return {};
        };
        const auto host = HostProcess::start(options, environment, makeProvider, steps);
        if (host.ok()) return runAlone(**host, environment, std::move(setAside));
        if (isSure || !host.error().userInfo().contains("holder")) return failWith(host.error());
    }
}

}  // namespace

int runProgram(std::span<const std::string> words, const HostEnvironment& environment,
               TesselExtensionFactory makeProvider, ProviderRepair repairProvider) {
    auto parsed = parseHostOptions(words, environment);
    if (const auto* reply = std::get_if<HostReply>(&parsed)) return say(*reply);
    auto& options = std::get<HostOptions>(parsed);

    const bool isRpc = options.command == HostCommand::rpc;
    const bool isServe = options.command == HostCommand::serve;
    // A person who looks at a listing has no use for the news of the machinery, unless they ask for it.
    if (!isRpc && !isServe && !environment.hasLogLevel) log::setLevel(LogLevel::error);

    if (isServe) return runServe(std::move(options), environment, makeProvider);
    return runByDaemonOrAlone(std::move(options), environment, makeProvider, repairProvider);
}

}  // namespace cindral
