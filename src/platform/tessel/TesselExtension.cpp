#include "platform/tessel/TesselExtension.h"

#include <cerrno>

namespace cindral {

namespace {

const KsError& notOffered() {
    static const KsError& error = *new KsError(KsError::posix(ENOTSUP));
    return error;
}

}  // namespace

std::shared_ptr<TesselProgress> TesselExtension::importDocumentAtURL(const KsURL& /*url*/,
                                                                     const TesselItemIdentifier& /*parent*/,
                                                                     ItemCompletion completion) {
    completion(notOffered());
    return nullptr;
}

void TesselExtension::createDirectoryWithName(const std::string& /*name*/, const TesselItemIdentifier& /*parent*/,
                                              ItemCompletion completion) {
    completion(notOffered());
}

void TesselExtension::renameItemWithIdentifier(const TesselItemIdentifier& /*identifier*/, const std::string& /*name*/,
                                               ItemCompletion completion) {
    completion(notOffered());
}

std::shared_ptr<TesselProgress> TesselExtension::reparentItemWithIdentifier(
    const TesselItemIdentifier& /*identifier*/, const TesselItemIdentifier& /*parent*/,
    const std::optional<std::string>& /*newName*/, ItemCompletion completion) {
    completion(notOffered());
    return nullptr;
}

std::shared_ptr<TesselProgress> TesselExtension::deleteItemWithIdentifier(const TesselItemIdentifier& /*identifier*/,
                                                                          Completion completion) {
    completion(notOffered());
    return nullptr;
}

void TesselExtension::trashItemWithIdentifier(const TesselItemIdentifier& /*identifier*/, ItemCompletion completion) {
    completion(notOffered());
}

std::shared_ptr<TesselProgress> TesselExtension::untrashItemWithIdentifier(
    const TesselItemIdentifier& /*identifier*/, const std::optional<TesselItemIdentifier>& /*parent*/,
    ItemCompletion completion) {
    completion(notOffered());
    return nullptr;
}

void TesselExtension::removeTrashedItemsOlderThanDate(const KsDate& /*date*/, Completion completion) {
    completion(notOffered());
}

void TesselExtension::setLastUsedDate(const std::optional<KsDate>& /*date*/, const TesselItemIdentifier& /*identifier*/,
                                      ItemCompletion completion) {
    completion(notOffered());
}

void TesselExtension::setTagData(const std::optional<Bytes>& /*tagData*/, const TesselItemIdentifier& /*identifier*/,
                                 ItemCompletion completion) {
    completion(notOffered());
}

void TesselExtension::setFavoriteRank(std::optional<std::int64_t> /*rank*/, const TesselItemIdentifier& /*identifier*/,
                                      ItemCompletion completion) {
    completion(notOffered());
}

}  // namespace cindral
