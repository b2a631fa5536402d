#pragma once

#include <functional>
#include <string>
#include <string_view>

#include "host/HostOptions.h"
#include "host/ItemText.h"
#include "host/PresentedPaths.h"
#include "host/ProviderClient.h"
#include "host/TextOutput.h"

namespace cindral {

/// The commands that people type: each asks the provider, and prints.
///
/// Errors are the host's own, with a line for people.
///
/// Thread safety: for one thread at a time.
class Commands {
public:
    struct Context {
        ProviderClient& client;
        const PresentedPaths& paths;
        const HostOptions& options;
        const HostEnvironment& environment;
        std::function<std::string()> statusText;  ///< as JSON
    };

    /// All borrowed for life.
    Commands(Context context, TextOutput& output);

    /// Does what the options say; `rpc` is not among it.
    Result<void> run();

    /// How an item is named on the command line: an identifier has a well-known name or begins like one; all else is a
    /// path.
    static bool isIdentifier(std::string_view item);

private:
    Result<void> list();
    Result<void> tree();
    Result<void> info();
    Result<void> url();
    Result<void> id();
    Result<void> anchor();
    Result<void> status();

    /// The item that was named; the root container where none was.
    Result<TesselItemIdentifier> identifier() const;
    Result<TesselItemIdentifier> identifierAt(const std::string& path) const;
    Result<std::shared_ptr<const TesselItem>> item() const;
    /// The named item's text, or the storage's path.
    std::string subject() const;
    KsError failure(const KsError& error) const;

    void printItem(const TesselItem& item);
    void printValue(std::string_view key, const std::string& value);

    const Context context_;
    TextOutput& output_;
    const ItemText text_;
};

}  // namespace cindral
