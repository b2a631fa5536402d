#include "host/Program.h"

#include <fmt/format.h>
#include <sys/resource.h>
#include <unistd.h>

#include <optional>
#include <vector>

#include "host/AppsCommands.h"
#include "host/Commands.h"
#include "host/Daemon.h"
#include "host/DaemonSocket.h"
#include "host/Descriptor.h"
#include "host/HostError.h"
#include "host/HostOptions.h"
#include "host/HostProcess.h"
#include "host/RpcConnection.h"
#include "host/ServiceManager.h"
#include "host/SocketListener.h"
#include "host/StateHandover.h"
#include "host/StopSignals.h"
#include "host/TerminalText.h"
#include "host/TextOutput.h"
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
    const auto served = serveRpc(STDIN_FILENO, STDOUT_FILENO,
                                 {host.provider(), host.paths(), host.signals(), [&] { return host.statusText(); }});
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
    for (DaemonSocket& each : sockets) daemon.add(std::make_unique<SocketListener>(std::move(each)));
    const auto served = daemon.run((*stopSignals)->descriptor(), [&] { (void)takeOver((*host)->state()); });
    // Held until the store is closed: until then, nobody else could use it.
    host->reset();
    handover.reset();
    return served.ok() ? kExitDone : failWith(hostFailure(fmt::format("can't serve: {}", served.error().reason())));
}

/// Without a host of its own: there may be one that runs.
int runApps(const HostOptions& options, const HostEnvironment& environment) {
    TextOutput output(STDOUT_FILENO, ::isatty(STDOUT_FILENO) == 1);
    const auto done = runAppsCommand(options, environment, output);
    if (const auto error = output.finish()) return outputFailure(*error);
    return done.ok() ? kExitDone : failWith(done.error());
}

int runCommand(const HostProcess& host, const HostEnvironment& environment) {
    TextOutput output(STDOUT_FILENO, ::isatty(STDOUT_FILENO) == 1);
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
    Commands commands({client, host.paths(), host.options(), environment, statusText, host.signals(), stopDescriptor},
                      output);
    const auto done = commands.run();
    // What was found before something went wrong is shown before the line that says what.
    if (const auto error = output.finish()) return outputFailure(*error);
    return done.ok() ? kExitDone : failWith(done.error());
}

}  // namespace

int runProgram(std::span<const std::string> words, const HostEnvironment& environment,
               TesselExtensionFactory makeProvider) {
    auto parsed = parseHostOptions(words, environment);
    if (const auto* reply = std::get_if<HostReply>(&parsed)) return say(*reply);
    auto& options = std::get<HostOptions>(parsed);

    const bool isRpc = options.command == HostCommand::rpc;
    const bool isServe = options.command == HostCommand::serve;
    // A person who looks at a listing has no use for the news of the machinery, unless they ask for it.
    if (!isRpc && !isServe && !environment.hasLogLevel) log::setLevel(LogLevel::error);

    if (isAppsCommand(options.command)) return runApps(options, environment);
    if (isServe) return runServe(std::move(options), environment, makeProvider);
    const auto host = HostProcess::start(std::move(options), environment, makeProvider);
    if (!host.ok()) return failWith(host.error());
    return isRpc ? runRpc(**host) : runCommand(**host, environment);
}

}  // namespace cindral
