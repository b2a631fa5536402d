#include "host/Program.h"

#include <fmt/format.h>
#include <unistd.h>

#include "host/AppsCommands.h"
#include "host/Commands.h"
#include "host/Descriptor.h"
#include "host/HostError.h"
#include "host/HostOptions.h"
#include "host/HostProcess.h"
#include "host/RpcConnection.h"
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
    const auto served =
        serveRpc(STDIN_FILENO, STDOUT_FILENO,
                 {host.provider(), host.paths(), host.signals(), [&] { return host.statusText(); }, host.search()});
    if (!served.ok()) return failWith(hostFailure(fmt::format("the connection broke: {}", served.error().reason())));
    return kExitDone;
}

bool isAppsCommand(HostCommand command) {
    return command == HostCommand::apps || command == HostCommand::appsEnable || command == HostCommand::appsDisable;
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
    Commands commands(
        {client, host.paths(), host.options(), environment, statusText, host.signals(), stopDescriptor, host.search()},
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
    // A person who looks at a listing has no use for the news of the machinery, unless they ask for it.
    if (!isRpc && !environment.hasLogLevel) log::setLevel(LogLevel::error);

    if (isAppsCommand(options.command)) return runApps(options, environment);
    const auto host = HostProcess::start(std::move(options), environment, makeProvider);
    if (!host.ok()) return failWith(host.error());
    return isRpc ? runRpc(**host) : runCommand(**host, environment);
}

}  // namespace cindral
