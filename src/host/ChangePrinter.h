#pragma once

#include <string>
#include <unordered_map>

#include "host/PresentedPaths.h"
#include "host/ProviderAccess.h"
#include "host/TextOutput.h"

namespace cindral {

/// Prints changes, a line each: for people "updated  NAME" and "deleted  NAME", NAME being the path below the storage
/// where it is known, or JSON.
///
/// What is deleted is told by its identifiers; the names are those that the printer has printed before.
///
/// Thread safety: for one thread at a time.
class ChangePrinter {
public:
    enum class Form { text, json };
    /// All borrowed for life.
    ChangePrinter(const PresentedPaths& paths, Form form, TextOutput& output);

    void print(const ChangesBatch& batch);
    void printAnchor(const TesselSyncAnchor& anchor);
    /// What changed can't be told.
    void printLost();

private:
    /// What deletions may say of an item that was printed.
    struct Known {
        std::string name;
        bool isFile = false;  ///< that the identifier of its number is never its own
    };
    void printUpdate(const TesselItem& item);
    void printDeletion(const TesselItemIdentifier& identifier);
    void printText(std::string_view what, std::string_view name);
    std::string nameOf(const TesselItem& item) const;

    const PresentedPaths& paths_;
    const Form form_;
    TextOutput& output_;
    std::unordered_map<TesselItemIdentifier, Known> known_;
};

}  // namespace cindral
