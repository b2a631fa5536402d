#include "host/HostError.h"

#include "platform/tessel/TesselErrors.h"

namespace cindral {
namespace {

// As the provider hands its own errors over: by ordinal. The host knows them by the interface, not by the provider's
// headers.
constexpr std::string_view kProviderErrorDomain = "CindralProvider.LocalTesselKitError";

std::string_view providerMessage(std::int64_t code) {
    switch (code) {
        case 0: return "No such item";
        case 1: return "The URL names no item";
        case 2: return "The item was not found";
        case 3: return "The volume can't be identified";
        default: return {};
    }
}

std::string_view tesselMessage(std::int64_t code) {
    switch (static_cast<TesselErrorCode>(code)) {
        case TesselErrorCode::noSuchItem: return "No such item";
        case TesselErrorCode::pageExpired: return "The page or sync anchor has expired";
        case TesselErrorCode::filenameCollision: return "An item with that name already exists";
    }
    return {};
}

std::string_view tsMessage(std::int64_t code) {
    switch (static_cast<TSErrorCode>(code)) {
        case TSErrorCode::invalidParameter: return "A parameter is not valid";
        case TSErrorCode::itemNotFound: return "The item was not found";
    }
    return {};
}

std::string_view interfaceMessage(const KsError& error) {
    if (error.domain() == kProviderErrorDomain) return providerMessage(error.code());
    if (error.domain() == kTesselErrorDomain) return tesselMessage(error.code());
    if (error.domain() == kTSErrorDomain) return tsMessage(error.code());
    return {};
}

}  // namespace

KsError hostFailure(std::string message) {
    return {kCindralHostErrorDomain, kExitFailed, {{"message", std::move(message)}}};
}

KsError usageFailure(std::string message) {
    return {kCindralHostErrorDomain, kExitUsage, {{"message", std::move(message)}}};
}

int exitStatusOf(const KsError& error) {
    return error.is(kCindralHostErrorDomain, kExitUsage) ? kExitUsage : kExitFailed;
}

bool isNoSuchItem(const KsError& error) {
    return error.is(kTesselErrorDomain, static_cast<std::int64_t>(TesselErrorCode::noSuchItem)) ||
           error.is(kTSErrorDomain, static_cast<std::int64_t>(TSErrorCode::itemNotFound)) ||
           error.is(kProviderErrorDomain, 0) || error.is(kKsGeneralErrorDomain, kKsFileNoSuchFileError);
}

std::string messageOf(const KsError& error) {
    const std::string_view text = interfaceMessage(error);
    return text.empty() ? error.reason() : std::string(text);
}

}  // namespace cindral
