#include "provider/LocalTesselKitError.h"

namespace cindral {

namespace {

std::string messageFor(LocalTesselKitError error) {
    switch (error) {
        case LocalTesselKitError::invalidItemIdentifier: return "There is no item with that identifier";
        case LocalTesselKitError::invalidItemURL: return "There is no item at that place";
        case LocalTesselKitError::itemNotFound: return "The item wasn't found";
        case LocalTesselKitError::unableToGetDeviceUUID: return "The volume of the documents can't be told";
    }
    return {};
}

}  // namespace

KsError errorFor(LocalTesselKitError error) {
    return {kLocalTesselKitErrorDomain, static_cast<std::int64_t>(error), {{"message", messageFor(error)}}};
}

}  // namespace cindral
