#pragma once

#include <memory>

#include "platform/roster/Roster.h"
#include "provider/LocalItem.h"

namespace cindral {

/// The record of an app library: the Documents folder of an installed application, under the application's name.
///
/// Thread safety: read-only once made.
class LocalAppLibraryItem : public LocalItem {
public:
    /// The item of the application's record, or null after a log line.
    static std::shared_ptr<const LocalAppLibraryItem> initWithBundleProxy(const RoBundleProxy& proxy);

    /// An app library is made from an application's record and from nothing else: both stop the process.
    [[noreturn]] static std::shared_ptr<const LocalItem> init();
    [[noreturn]] static std::shared_ptr<const LocalItem> initWithURL(KsURL url, Customs customs);

    using LocalItem::LocalItem;
    bool isAppLibrary() const override { return true; }
};

}  // namespace cindral
