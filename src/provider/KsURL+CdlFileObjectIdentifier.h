#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/KsError.h"
#include "platform/foundation/KsURL.h"
#include "platform/tessel/TesselTypes.h"

namespace cindral {

/// The three kinds of identifier that are made from a number or an application.
///
/// "did=" and a document ID, "fid=" and a file ID, each unsigned, in decimal, without padding; "#" and a bundle
/// identifier.
struct CdlFileObjectIdentifier {
    static TesselItemIdentifier fromFileID(std::uint64_t fileID);
    static TesselItemIdentifier fromDocumentID(std::uint64_t documentID);
    /// None, after a line on the framework's log, when no application's data container (or the Documents folder in it)
    /// is there.
    static std::optional<TesselItemIdentifier> fromAppLibraryDataContainerURL(const KsURL& url);
};

/// The identifier of the object that a URL names.
///
/// The storage's root has the root container's; an app library's root its application's; a regular file or a package a
/// document's, given now if it has none; everything else its file number. None, after a log line, for what is not
/// published or not there. What is within a root is decided by the plain text of the paths: also a sibling whose name
/// begins with a root's is inside.
///
/// Thread safety: as the URL, whose cache it fills.
std::optional<TesselItemIdentifier> itemIdentifier(KsURL& url);

/// Where the object of an identifier is now; none, after a log line, when there is none, also for app libraries'
/// identifiers.
std::optional<KsURL> fileURLWithItemIdentifier(const TesselItemIdentifier& identifier);
/// The file ID of the object of an identifier; none, after a log line, when there is none. Not for identifiers that are
/// made from no number.
std::optional<std::uint64_t> fileIDWithItemIdentifier(const TesselItemIdentifier& identifier);
/// Where the object with that file number is on the storage's device.
std::optional<KsURL> fileURLWithFileIdentifier(std::uint64_t fileID);
std::optional<KsURL> fileURLWithFileIdentifierOnDevice(std::uint64_t fileID, std::uint32_t device);

/// The device that holds the URL's object; 0 on failure, with the POSIX error in the slot when there is one.
std::uint32_t deviceIDWithError(const KsURL& url, std::optional<KsError>* error);
std::uint32_t deviceID(const KsURL& url);

/// Reads "/.docid/[DEVICE/]changed/DOCUMENT/src=FILE,dst=FILE", with any number of leading "/".
///
/// The numbers are signed 64-bit decimal, written as each is read: a false result may leave earlier ones written.
bool parseDocIDChangePath(const char* path, std::int64_t* documentID, std::int64_t* sourceFileID,
                          std::int64_t* destinationFileID);

}  // namespace cindral
