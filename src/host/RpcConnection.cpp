#include "host/RpcConnection.h"

#include <vector>

#include "host/Descriptor.h"
#include "host/HostProcess.h"
#include "host/LineOutput.h"
#include "host/LineSplitter.h"
#include "host/ServedClient.h"

namespace cindral {
namespace {

// A page of a listing fits in the pipe, so that the next one is begun while the client reads.
constexpr std::size_t kPipeBytes = 1 << 20;

class Receiver final : public LineSplitter::Receiver {
public:
    Receiver(JsonRpcServer& server, LineSink& answers) : server_(server), answers_(answers) {}
    void didReadLine(std::string_view line) override {
        answers_.waitForRoom();
        server_.receiveLine(line);
    }
    void didSkipLongLine() override {
        answers_.waitForRoom();
        server_.receiveLongLine();
    }

private:
    JsonRpcServer& server_;
    LineSink& answers_;
};

/// Reads until the end of input, or until nobody reads the answers.
Result<void> readAll(int input, int output, const UniqueFd& interrupt, LineSplitter& lines) {
    std::vector<char> buffer(descriptor::kReadBytes);
    while (TRY(descriptor::waitForInput(input, output, interrupt.get())) == descriptor::Readiness::input) {
        const std::size_t got = TRY(descriptor::read(input, buffer));
        if (got == 0) {
            lines.finish();
            break;
        }
        lines.feed({buffer.data(), got});
    }
    return {};
}

}  // namespace

RpcService serviceOf(const HostProcess& host) {
    return {host.provider(),
            host.paths(),
            host.signals(),
            [&host] { return host.statusText(); },
            host.search(),
            [&host](bool) { return host.helloText(); },
            [&host] { return host.doctorText(); },
            nullptr};
}

Result<void> serveRpc(int input, int output, const RpcService& service) {
    const UniqueFd interrupt = TRY(descriptor::makeInterrupt());
    descriptor::enlargePipe(output, kPipeBytes);
    LineOutput answers(output, interrupt);
    return serveRpc(input, output, interrupt, answers, service);
}

Result<void> serveRpc(int input, int output, const UniqueFd& interrupt, LineSink& answers, const RpcService& service) {
    ServedClient client(service, [&](std::string_view line) { answers.write(line); });
    JsonRpcServer& server = client.server();
    Receiver receiver(server, answers);
    LineSplitter lines(receiver, kJsonRpcLineBytesMax);

    auto done = readAll(input, output, interrupt, lines);
    server.waitUntilIdle();
    if (const auto error = answers.error()) return *error;
    return done;
}

}  // namespace cindral
